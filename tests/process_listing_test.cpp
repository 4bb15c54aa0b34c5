#include <gtest/gtest.h>

#include <malloc.h>

#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstring>
#include <optional>
#include <spawn.h>
#include <string>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "cpu/process_listing.h"
#include "fake_proc.h"
#include "recording_platform.h"
#include "telvmemdebug.h"

extern char **environ;

namespace {

using Traces = std::vector<std::string>;

const std::string enter = "TARNCPUF: ->update_process_list";
const std::string leave = "TARNCPUF: <-update_process_list";
const std::string skip = "TARNCPUF: <-update_process_list (skip)";
const std::string two_cpus_found[] = {
    "TARNCPUF: query_number_of_cpus: found number 0, new total: 1",
    "TARNCPUF: query_number_of_cpus: found number 1, new total: 2"};

// Seven percentage cells of 0.00: the older end of a row with three samples.
const std::string zeros = "|     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
                          "|     +0.00| |     +0.00| ";

class ProcessListing : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        reset_process_listing_state();
        std::memset(&process_list, 0, sizeof process_list);
        process_list_ptr = &process_list;
        process_entry_ptr = nullptr;
        tree.emplace(1000, 100);
        tree->set_cpus(2);
    }
    void TearDown() override {
        delete_process_list(&process_list);
        tree.reset();
    }

    // Updates the list, `ticks` clock ticks after the previous call.
    void update_after(clock_t ticks) {
        tree->advance(ticks);
        update_process_list(&process_list);
    }

    static process_entry *entry_of(int pid) {
        for (process_entry *e = process_list.head.next; e != nullptr; e = e->next) {
            if (e->pid == pid) {
                return e;
            }
        }
        return nullptr;
    }

    static std::vector<int> chain_pids() {
        std::vector<int> pids;
        for (const process_entry *e = process_list.head.next; e != nullptr; e = e->next) {
            pids.push_back(e->pid);
        }
        return pids;
    }

    // Every link of the chain points back at the entry before it.
    static void expect_consistent_links() {
        const process_entry *before = &process_list.head;
        EXPECT_EQ(before->previous, nullptr);
        int count = 1;
        for (const process_entry *e = before->next; e != nullptr; e = e->next) {
            EXPECT_EQ(e->previous, before) << "pid " << e->pid;
            EXPECT_GT(e->pid, before->pid);
            before = e;
            ++count;
        }
        EXPECT_EQ(count, process_list.number_of_entries);
    }

    // The ring slot of the newest complete sample.
    static int newest() { return (process_list.current_sample + 9) % 10; }

    static std::string print_to_text() {
        char *text = nullptr;
        print_process_list(&process_list, &text);
        std::string copy = text != nullptr ? text : "";
        rec_free(text);
        return copy;
    }
    static void rec_free(char *text) { telvmemdebug_free(text, "test", 0); }

    std::optional<fake::fake_proc> tree;
};

TEST_F(ProcessListing, FirstUpdateSetsUpTheListAndTakesItsSample) {
    tree->set_process(7, "init", 10, 4, 20, 0);
    update_process_list(&process_list);

    EXPECT_EQ(rec::traces(), (Traces{enter, two_cpus_found[0], two_cpus_found[1], leave}));
    EXPECT_EQ(process_list.number_of_cpus, 2);
    EXPECT_EQ(process_list.sample_ticks[0], 1000);
    EXPECT_EQ(process_list.sample_ticks[9], 940); // 0.6 s back, so the first call samples
    EXPECT_EQ(process_list.current_sample, 1);
    EXPECT_EQ(process_list.number_of_entries, 2);
    EXPECT_EQ(process_list.head.pid, 0);
    EXPECT_STREQ(process_list.head.file_name, "/proc/1/stat");
    EXPECT_EQ(process_list.head.previous, nullptr);

    process_entry *init = entry_of(7);
    ASSERT_NE(init, nullptr);
    EXPECT_STREQ(init->file_name, "/proc/7/stat");
    EXPECT_STREQ(init->process_name, "(init)");
    EXPECT_EQ(init->priority, 20);
    EXPECT_EQ(init->nice, 0);
    EXPECT_EQ(init->seen, 1);
    EXPECT_EQ(init->user_jiffies[0], 10u);
    EXPECT_EQ(init->kernel_jiffies[0], 4u);
    EXPECT_EQ(init->user_percent[0], 0.0f); // a new pid has no history yet
    EXPECT_EQ(init->kernel_percent[0], 0.0f);
}

TEST_F(ProcessListing, BackDatedFirstTickIsTruncated) {
    reset_process_listing_state();
    fake::fake_proc odd_rate(1000, 33);
    odd_rate.set_cpus(1);
    update_process_list(&process_list);
    EXPECT_EQ(process_list.sample_ticks[9], 980); // 1000 - 19.8, truncated
    EXPECT_EQ(process_list.current_sample, 1);
}

TEST_F(ProcessListing, BackDatingTruncatesTowardsZero) {
    reset_process_listing_state();
    fake::fake_proc odd_rate(10, 33);
    odd_rate.set_cpus(1);
    update_process_list(&process_list);
    EXPECT_EQ(process_list.sample_ticks[9], -9); // 10 - 19.8 = -9.8, not -10
    EXPECT_EQ(process_list.current_sample, 1);
}

TEST_F(ProcessListing, FirstUpdateZeroesTheHeadAndLeavesTheOtherSamples) {
    process_list.head.pid = 77;
    process_list.head.seen = 1;
    process_list.head.user_percent[3] = 5.0f;
    std::strcpy(process_list.head.process_name, "(stale)");
    process_list.current_sample = 6;
    process_list.number_of_entries = 40;
    for (int i = 0; i < 10; ++i) {
        process_list.sample_ticks[i] = 100 + i;
    }
    update_process_list(&process_list);

    process_entry zeroed_head{};
    std::strcpy(zeroed_head.file_name, "/proc/1/stat");
    EXPECT_EQ(std::memcmp(&process_list.head, &zeroed_head, sizeof zeroed_head), 0);
    EXPECT_EQ(process_list.number_of_entries, 1);
    EXPECT_EQ(process_list.current_sample, 1);
    EXPECT_EQ(process_list.sample_ticks[0], 1000);
    EXPECT_EQ(process_list.sample_ticks[9], 940);
    for (int i = 1; i < 9; ++i) {
        EXPECT_EQ(process_list.sample_ticks[i], 100 + i) << i;
    }
}

TEST_F(ProcessListing, HalfASecondIsMeasuredInFractionsOfATick) {
    reset_process_listing_state();
    fake::fake_proc odd_rate(1000, 33); // half a second is 16.5 ticks
    odd_rate.set_cpus(1);
    update_process_list(&process_list);
    rec::clear_traces();

    odd_rate.advance(16);
    update_process_list(&process_list);
    EXPECT_EQ(rec::traces(), (Traces{enter, skip}));
    EXPECT_EQ(process_list.current_sample, 1);

    odd_rate.advance(1);
    update_process_list(&process_list);
    EXPECT_EQ(rec::traces().back(), leave);
    EXPECT_EQ(process_list.current_sample, 2);
    EXPECT_EQ(process_list.sample_ticks[1], 1017);
}

TEST_F(ProcessListing, ASampleIndexOutsideTheRingCountsModuloTheRing) {
    update_process_list(&process_list);
    process_list.current_sample = INT32_MAX; // slot 7
    process_list.sample_ticks[6] = 1000;
    update_after(100);
    EXPECT_EQ(process_list.sample_ticks[7], 1100);
    EXPECT_EQ(process_list.current_sample, 8);

    process_list.current_sample = INT32_MAX - 2; // slot 5: the newest column is slot 4
    process_list.sample_ticks[4] = 4444;
    process_list.sample_ticks[5] = 5555;
    EXPECT_TRUE(print_to_text().starts_with("checks: |      +4444|")) << print_to_text();
}

TEST_F(ProcessListing, NoTimeElapsedGivesZeroShares) {
    reset_process_listing_state();
    fake::fake_proc no_rate(1000, -1); // the tick rate could not be read
    no_rate.set_cpus(1);
    no_rate.set_process(100, "busy", 10, 7);
    update_process_list(&process_list);
    EXPECT_EQ(process_list.sample_ticks[9], 1000); // 1000 + 0.6, truncated
    no_rate.set_process(100, "busy", 60, 9);
    rec::clear_traces();
    update_process_list(&process_list); // the same tick: diff 0, yet -0.5 is not above it

    EXPECT_EQ(rec::traces(), (Traces{enter,
                                     "TARNCPUF: query_number_of_cpus: found number 0, "
                                     "new total: 1",
                                     leave}));
    EXPECT_EQ(process_list.current_sample, 2);
    EXPECT_EQ(entry_of(100)->user_jiffies[1], 60u);
    EXPECT_EQ(entry_of(100)->user_percent[1], 0.0f);
    EXPECT_EQ(entry_of(100)->kernel_percent[1], 0.0f);
}

TEST_F(ProcessListing, UpdateWithinHalfASecondIsSkippedAndChangesNothing) {
    tree->set_process(7, "init", 10, 4);
    update_process_list(&process_list);
    tree->set_process(7, "init", 30, 8);
    process_list_header before;
    std::memcpy(&before, &process_list, sizeof before);
    process_entry entry_before = *entry_of(7);
    rec::clear_traces();

    update_after(40); // 0.4 s at 100 ticks a second

    EXPECT_EQ(rec::traces(), (Traces{enter, skip}));
    EXPECT_EQ(std::memcmp(&before, &process_list, sizeof before), 0);
    EXPECT_EQ(std::memcmp(&entry_before, entry_of(7), sizeof entry_before), 0);
}

TEST_F(ProcessListing, UpdateExactlyHalfASecondLaterIsTaken) {
    tree->set_process(7, "init", 10, 4);
    update_process_list(&process_list);
    update_after(49);
    EXPECT_EQ(rec::traces().back(), skip);
    EXPECT_EQ(process_list.current_sample, 1);

    tree->set_ticks(1050);
    rec::clear_traces();
    update_process_list(&process_list);
    EXPECT_EQ(rec::traces(), (Traces{enter, two_cpus_found[0], two_cpus_found[1], leave}));
    EXPECT_EQ(process_list.current_sample, 2);
    EXPECT_EQ(process_list.sample_ticks[1], 1050);
}

TEST_F(ProcessListing, FiftyTicksOverAHundredOnTwoProcessorsIsTwentyFivePercent) {
    tree->set_process(100, "busy", 10, 7);
    update_process_list(&process_list);
    tree->set_process(100, "busy", 60, 7);
    update_after(100);

    process_entry *busy = entry_of(100);
    ASSERT_NE(busy, nullptr);
    EXPECT_EQ(busy->user_jiffies[1], 60u);
    EXPECT_EQ(busy->user_percent[1], 25.0f);
    EXPECT_EQ(busy->kernel_jiffies[1], 7u);
    EXPECT_EQ(busy->kernel_percent[1], 0.0f);
}

TEST_F(ProcessListing, KernelTimeIsAccountedLikeUserTime) {
    tree->set_cpus(4);
    tree->set_process(100, "busy", 10, 20);
    update_process_list(&process_list);
    tree->set_process(100, "busy", 10, 100);
    update_after(200);

    // 100 ticks a second x 80 ticks / (4 processors x 200 ticks)
    EXPECT_EQ(entry_of(100)->kernel_percent[1], 10.0f);
    EXPECT_EQ(entry_of(100)->user_percent[1], 0.0f);
}

TEST_F(ProcessListing, PercentageUsesTheTickRateNotAHundred) {
    reset_process_listing_state();
    fake::fake_proc fast(1000, 250);
    fast.set_cpus(1);
    fast.set_process(100, "busy", 10, 7);
    update_process_list(&process_list);
    fast.set_process(100, "busy", 60, 7);
    fast.advance(500);
    update_process_list(&process_list);
    // 250 x 50 / (1 x 500): one quarter of the ticks would have been 10.0 with a factor of 100
    EXPECT_EQ(entry_of(100)->user_percent[1], 25.0f);
}

TEST_F(ProcessListing, ZeroPreviousCounterGivesZero) {
    tree->set_process(100, "fresh", 0, 0);
    update_process_list(&process_list);
    tree->set_process(100, "fresh", 50, 30);
    update_after(100);
    EXPECT_EQ(entry_of(100)->user_percent[1], 0.0f);
    EXPECT_EQ(entry_of(100)->kernel_percent[1], 0.0f);
    EXPECT_EQ(entry_of(100)->user_jiffies[1], 50u);

    tree->set_process(100, "fresh", 100, 30);
    update_after(100);
    EXPECT_EQ(entry_of(100)->user_percent[2], 25.0f);
}

TEST_F(ProcessListing, NewPidAfterTheFirstUpdateStartsAtZero) {
    tree->set_process(7, "init", 10, 4);
    update_process_list(&process_list);
    tree->set_process(8, "late", 500, 500);
    update_after(100);
    EXPECT_EQ(entry_of(8)->user_percent[1], 0.0f);
    EXPECT_EQ(entry_of(8)->kernel_percent[1], 0.0f);
    EXPECT_EQ(entry_of(8)->user_jiffies[1], 500u);
}

TEST_F(ProcessListing, CounterThatWentBackwardsIsTracedAndStoredAsZero) {
    tree->set_process(100, "reused", 500, 40);
    update_process_list(&process_list);
    tree->set_process(100, "reused", 400, 30);
    rec::clear_traces();
    update_after(100);

    EXPECT_EQ(rec::traces(),
              (Traces{enter, two_cpus_found[0], two_cpus_found[1],
                      "TARNCPUF: update_process_list: user percentage invalid: 21474786.000000, "
                      "pid: 100, current jiffies: 400, previous jiffies: 500, hertz: 100, diff: "
                      "100, cpus: 2",
                      "TARNCPUF: update_process_list: kernel percentage invalid: 21474832.000000, "
                      "pid: 100, current jiffies: 30, previous jiffies: 40, hertz: 100, diff: "
                      "100, cpus: 2",
                      leave}));
    EXPECT_EQ(entry_of(100)->user_percent[1], 0.0f);
    EXPECT_EQ(entry_of(100)->kernel_percent[1], 0.0f);
    EXPECT_EQ(entry_of(100)->user_jiffies[1], 400u);
    EXPECT_EQ(entry_of(100)->kernel_jiffies[1], 30u);
}

TEST_F(ProcessListing, ShareAboveAHundredIsRejectedAndExactlyAHundredKept) {
    tree->set_cpus(1);
    tree->set_process(100, "over", 10, 10);
    tree->set_process(101, "full", 10, 10);
    update_process_list(&process_list);
    tree->set_process(100, "over", 111, 10);
    tree->set_process(101, "full", 110, 10);
    rec::clear_traces();
    update_after(100);

    EXPECT_EQ(rec::traces_starting("TARNCPUF: update_process_list:"),
              (Traces{"TARNCPUF: update_process_list: user percentage invalid: 101.000000, pid: "
                      "100, current jiffies: 111, previous jiffies: 10, hertz: 100, diff: 100, "
                      "cpus: 1"}));
    EXPECT_EQ(entry_of(100)->user_percent[1], 0.0f);
    EXPECT_EQ(entry_of(101)->user_percent[1], 100.0f);
}

TEST_F(ProcessListing, ClockTicksWrapAroundInThirtyTwoBits) {
    tree->set_ticks(static_cast<clock_t>(0xFFFFFFC0LL)); // -64 in 32 bits
    tree->set_process(100, "wrap", 0xFFFFFFF0u, 100);
    update_process_list(&process_list);
    EXPECT_EQ(process_list.sample_ticks[0], -64);
    tree->set_process(100, "wrap", 0x22u, 120); // the counter wrapped too: 50 ticks later
    update_after(100);

    EXPECT_EQ(process_list.sample_ticks[1], 36);
    EXPECT_EQ(entry_of(100)->user_percent[1], 25.0f);
    EXPECT_EQ(entry_of(100)->kernel_percent[1], 10.0f);
    EXPECT_TRUE(rec::traces_starting("TARNCPUF: update_process_list:").empty());
}

TEST_F(ProcessListing, ClockThatWentBackwardsSkips) {
    update_process_list(&process_list);
    tree->set_ticks(900);
    rec::clear_traces();
    update_process_list(&process_list);
    EXPECT_EQ(rec::traces(), (Traces{enter, skip}));
}

TEST_F(ProcessListing, ProcessorLinesAreCountedAndTraced) {
    tree->set_cpuinfo("processor\t: 0\nmodel name\t: x\n\nprocessor : 5\nprocessor:7\n"
                      "processors\t: 3\nmodel processor\t: 4\nprocessor\t: none\n");
    EXPECT_EQ(query_number_of_cpus(), 3);
    EXPECT_EQ(rec::traces(),
              (Traces{"TARNCPUF: query_number_of_cpus: found number 0, new total: 1",
                      "TARNCPUF: query_number_of_cpus: found number 5, new total: 2",
                      "TARNCPUF: query_number_of_cpus: found number 7, new total: 3"}));
}

TEST_F(ProcessListing, CpuinfoWithoutProcessorLinesMeansOneProcessor) {
    tree->set_cpuinfo("model name\t: x\nflags\t\t: fpu vme\n\n");
    EXPECT_EQ(query_number_of_cpus(), 1);
    EXPECT_TRUE(rec::traces().empty());

    update_process_list(&process_list);
    EXPECT_EQ(process_list.number_of_cpus, 1);
}

TEST_F(ProcessListing, UnreadableCpuinfoMeansOneProcessor) {
    tree->remove_cpuinfo();
    EXPECT_EQ(query_number_of_cpus(), 1);
    EXPECT_EQ(rec::traces(), (Traces{"TARNCPUF: query_number_of_cpus: error opening file "
                                     "/proc/cpuinfo, errno: 2, No such file or directory"}));
}

TEST_F(ProcessListing, PidThatDisappearsIsPrintedOnceMoreThenGone) {
    tree->set_process(7, "init", 10, 4);
    tree->set_process(200, "leaving", 100, 50);
    update_process_list(&process_list);
    tree->set_process(200, "leaving", 120, 60);
    update_after(100);
    EXPECT_EQ(entry_of(200)->user_percent[1], 10.0f);

    tree->remove_process(200);
    rec::clear_traces();
    update_after(100);
    EXPECT_EQ(rec::traces(), (Traces{enter, two_cpus_found[0], two_cpus_found[1], leave}));
    process_entry *leaving = entry_of(200);
    ASSERT_NE(leaving, nullptr);
    EXPECT_EQ(leaving->seen, 0);
    EXPECT_EQ(process_list.number_of_entries, 3);
    // The newest column is the slot this update did not write for the vanished pid.
    EXPECT_EQ(print_to_text(),
              "checks: |      +1200||      +1100||      +1000||       +940||         +0|"
              "|         +0||         +0||         +0||         +0||         +0|\n"
              "pid: 7, name: (init), priority: 20, nice: 0\n"
              "user:   |     +0.00| |     +0.00| |     +0.00| " +
                  zeros +
                  "\n"
                  "kernel: |     +0.00| |     +0.00| |     +0.00| " +
                  zeros +
                  "\n"
                  "pid: 200, name: (leaving), priority: 20, nice: 0\n"
                  "user:   |     +0.00| |    +10.00| |     +0.00| " +
                  zeros +
                  "\n"
                  "kernel: |     +0.00| |     +5.00| |     +0.00| " +
                  zeros +
                  "\n"
                  "Overall system\n"
                  "user: |     +0.00| |    +10.00| |     +0.00| " +
                  zeros +
                  "\n"
                  "kernel:|     +0.00| |     +5.00| |     +0.00| " +
                  zeros + "\n");

    update_after(100);
    EXPECT_EQ(entry_of(200), nullptr);
    EXPECT_EQ(chain_pids(), (std::vector<int>{7}));
    EXPECT_EQ(process_list.number_of_entries, 2);
    expect_consistent_links();
    EXPECT_EQ(rec::live_allocations().size(), 1u);
}

TEST_F(ProcessListing, StatFileThatCannotBeOpenedIsTracedAndItsSlotKept) {
    for (uint32_t i = 0; i < 10; ++i) {
        tree->set_process(300, "flaky", 100 + 10 * i, 50 + i, 20, 0);
        update_after(100);
    }
    EXPECT_EQ(process_list.current_sample, 0);
    process_entry *flaky = entry_of(300);
    ASSERT_NE(flaky, nullptr);
    EXPECT_EQ(flaky->user_jiffies[0], 100u);
    EXPECT_EQ(flaky->user_percent[9], 5.0f);

    tree->remove_stat(300);
    rec::clear_traces();
    update_after(100);

    EXPECT_EQ(rec::traces(),
              (Traces{enter, two_cpus_found[0], two_cpus_found[1],
                      "TARNCPUF: update_process_list: error opening file /proc/300/stat, errno: "
                      "2, No such file or directory",
                      leave}));
    EXPECT_EQ(flaky->seen, 1); // the pid is still there, so the entry stays
    EXPECT_EQ(flaky->user_jiffies[0], 100u);
    EXPECT_EQ(flaky->kernel_jiffies[0], 50u);
    EXPECT_EQ(flaky->user_percent[0], 0.0f);
    EXPECT_EQ(process_list.current_sample, 1);
    EXPECT_EQ(process_list.sample_ticks[0], 2100);
}

TEST_F(ProcessListing, RootTooLongFailsLikeAnOpen) {
    std::string long_root(5000, 'r');
    proc_root = long_root.c_str();
    tree->set_process(7, "init", 10, 4);
    update_process_list(&process_list);
    EXPECT_EQ(rec::traces(), (Traces{enter,
                                     "TARNCPUF: query_number_of_cpus: error opening file "
                                     "/proc/cpuinfo, errno: 36, File name too long",
                                     leave}));
    EXPECT_EQ(process_list.number_of_cpus, 1);
    EXPECT_TRUE(chain_pids().empty());
    EXPECT_EQ(process_list.current_sample, 1);
    proc_root = tree->root().c_str();
}

TEST_F(ProcessListing, DirectoryEntriesThatAreNotPidsAreSkipped) {
    tree->add_other_directory("self");
    tree->add_other_directory("sys");
    tree->add_other_directory("0");
    tree->set_process(12, "twelve", 1, 1);
    update_process_list(&process_list);
    EXPECT_EQ(chain_pids(), (std::vector<int>{12}));
    EXPECT_EQ(rec::traces(), (Traces{enter, two_cpus_found[0], two_cpus_found[1], leave}));
}

TEST_F(ProcessListing, ManyPidsInAnyDirectoryOrderEndUpSorted) {
    const int pids[] = {4000, 3, 977, 12, 31000, 500, 501, 2, 65, 1200};
    for (int pid : pids) {
        tree->set_process(pid, "p" + std::to_string(pid), 1, 1);
    }
    update_process_list(&process_list);
    EXPECT_EQ(chain_pids(), (std::vector<int>{2, 3, 12, 65, 500, 501, 977, 1200, 4000, 31000}));
    expect_consistent_links();
    EXPECT_EQ(process_list.number_of_entries, 11);
}

TEST_F(ProcessListing, SearchInsertsOutOfOrderPidsInPlaceFromAnyStart) {
    process_list.number_of_entries = 1;
    process_entry *head = &process_list.head;
    process_entry *fifty = search_pid_in_process_list(50, &process_list, head);
    process_entry *ten = search_pid_in_process_list(10, &process_list, fifty);
    process_entry *thirty = search_pid_in_process_list(30, &process_list, ten);
    process_entry *twenty = search_pid_in_process_list(20, &process_list, fifty);
    process_entry *forty = search_pid_in_process_list(40, &process_list, head);
    process_entry *five = search_pid_in_process_list(5, &process_list, fifty);
    process_entry *sixty = search_pid_in_process_list(60, &process_list, five);
    EXPECT_EQ(chain_pids(), (std::vector<int>{5, 10, 20, 30, 40, 50, 60}));
    expect_consistent_links();
    EXPECT_EQ(process_list.number_of_entries, 8);
    EXPECT_STREQ(twenty->file_name, "/proc/20/stat");
    EXPECT_EQ(sixty->next, nullptr);

    for (process_entry *start : {head, five, ten, twenty, thirty, forty, fifty, sixty}) {
        EXPECT_EQ(search_pid_in_process_list(5, &process_list, start), five);
        EXPECT_EQ(search_pid_in_process_list(30, &process_list, start), thirty);
        EXPECT_EQ(search_pid_in_process_list(60, &process_list, start), sixty);
    }
    EXPECT_EQ(search_pid_in_process_list(0, &process_list, sixty), head);
    EXPECT_EQ(process_list.number_of_entries, 8);
    EXPECT_EQ(rec::live_allocations().size(), 7u);
    for (const std::string &where : rec::live_allocations()) {
        EXPECT_TRUE(where.starts_with("process_listing.cpp:")) << where;
    }
}

TEST_F(ProcessListing, PrepareDropsEntriesNotSeenAndClearsTheOthers) {
    process_list.number_of_entries = 1;
    for (int pid : {1, 2, 3, 4}) {
        search_pid_in_process_list(pid, &process_list, &process_list.head)->seen = pid % 2;
    }
    prepare_process_list(&process_list);
    EXPECT_EQ(chain_pids(), (std::vector<int>{1, 3}));
    EXPECT_EQ(entry_of(1)->seen, 0);
    EXPECT_EQ(entry_of(3)->seen, 0);
    EXPECT_EQ(process_list.number_of_cpus, 2);
    expect_consistent_links();
    EXPECT_EQ(rec::live_allocations().size(), 2u);

    prepare_process_list(&process_list);
    EXPECT_TRUE(chain_pids().empty());
    EXPECT_EQ(process_list.number_of_entries, 1);
    EXPECT_TRUE(rec::live_allocations().empty());
}

TEST_F(ProcessListing, EntryThatCannotBeAllocatedIsLeftForTheNextScan) {
    tree->set_process(7, "init", 10, 4);
    tree->set_process(8, "other", 10, 4);
    rec::fail(rec::Call::calloc, 0, 0, 0, 1);
    update_process_list(&process_list);
    EXPECT_EQ(chain_pids().size(), 1u);
    expect_consistent_links();

    update_after(100);
    EXPECT_EQ(chain_pids(), (std::vector<int>{7, 8}));
}

TEST_F(ProcessListing, NameWithABlankShiftsTheFields) {
    tree->set_process(100, "tmux: server", 10, 4, 20, 5);
    update_process_list(&process_list);
    process_entry *tmux = entry_of(100);
    ASSERT_NE(tmux, nullptr);
    // Only the name converts: "(tmux:", then "server)" is no number.
    EXPECT_STREQ(tmux->process_name, "(tmux:");
    EXPECT_EQ(tmux->user_jiffies[0], 0u);
    EXPECT_EQ(tmux->kernel_jiffies[0], 0u);
    EXPECT_EQ(tmux->priority, 0);
    EXPECT_EQ(tmux->nice, 0);
}

TEST_F(ProcessListing, ParserTakesTheFiveFieldsOfAStatLine) {
    char name[PROCESS_NAME_LENGTH] = {};
    uint32_t utime = 1;
    uint32_t stime = 1;
    int32_t priority = 1;
    int32_t nice = 1;
    std::string text = fake::stat_line(4321, "kworker/0:1H", 4000000000u, 17, 0, -20);
    EXPECT_EQ(parse_process_stat_line(text.c_str(), name, &utime, &stime, &priority, &nice), 5);
    EXPECT_STREQ(name, "(kworker/0:1H)");
    EXPECT_EQ(utime, 4000000000u);
    EXPECT_EQ(stime, 17u);
    EXPECT_EQ(priority, 0);
    EXPECT_EQ(nice, -20);
}

TEST_F(ProcessListing, ParserKeepsWhatItCannotConvertAndShiftsWithTheFields) {
    char name[PROCESS_NAME_LENGTH] = "(old)";
    uint32_t utime = 11;
    uint32_t stime = 12;
    int32_t priority = 13;
    int32_t nice = 14;
    // A name with a blank: only the name converts, as "(a"; the state is taken from the "b", and
    // the ")" after it is no number, so the rest keeps its values.
    const char *text = "9 (a b) S 1 9 9 0 -1 4194560 1523 0 12 0 5 6 7 8 20 0 1 0 4242 "
                       "12582912 812 1 94016 94812 140722 0 0 0 0 4096 17642 0 0 0 17 1 0";
    EXPECT_EQ(parse_process_stat_line(text, name, &utime, &stime, &priority, &nice), 1);
    EXPECT_STREQ(name, "(a");
    EXPECT_EQ(utime, 11u);
    EXPECT_EQ(nice, 14);

    // Without its state letter the fields after the name shift by one.
    const char *shifted = "9 (b) 1 9 9 0 -1 4194560 1523 0 12 0 5 6 7 8 20 0 1 0 4242 "
                          "12582912 812 1 94016 94812 140722 0 0 0 0 4096 17642 0 0 0 17 1 0";
    EXPECT_EQ(parse_process_stat_line(shifted, name, &utime, &stime, &priority, &nice), 5);
    EXPECT_STREQ(name, "(b)");
    EXPECT_EQ(utime, 6u);
    EXPECT_EQ(stime, 7u);
    EXPECT_EQ(priority, 0);
    EXPECT_EQ(nice, 1);
}

TEST_F(ProcessListing, ParserStaysWithinTheNameOnHostileLines) {
    struct guarded {
        char name[PROCESS_NAME_LENGTH];
        char guard[64];
    } area;
    std::memset(&area, 'G', sizeof area);
    uint32_t utime = 0;
    uint32_t stime = 0;
    int32_t priority = 0;
    int32_t nice = 0;
    std::string long_name = "1 (" + std::string(5000, 'x') + ") S 1 2 3 4 5 6 7 8 9 10 11 12";
    EXPECT_EQ(
        parse_process_stat_line(long_name.c_str(), area.name, &utime, &stime, &priority, &nice), 1);
    EXPECT_EQ(std::strlen(area.name), 98u);
    EXPECT_EQ(area.name[99], 'G');
    EXPECT_EQ(std::string(area.guard, sizeof area.guard), std::string(64, 'G'));

    std::memset(&area, 'G', sizeof area);
    for (const char *garbage : {"", " \n\t ", "x", "-", "12", "12 ", "((((", "1 2 3 4 5 6 7",
                                "1 (a) S x y z", "\xff\xfe\x80 \x01\x02", "99999999999999999999"}) {
        EXPECT_LE(parse_process_stat_line(garbage, area.name, &utime, &stime, &priority, &nice), 1)
            << garbage;
        EXPECT_EQ(std::string(area.guard, sizeof area.guard), std::string(64, 'G'));
    }
}

// What parse_process_stat_line leaves of one line, each output starting from a value of its own
// so that a field the parse does not convert is seen to keep it.
struct parsed_stat {
    char name[PROCESS_NAME_LENGTH] = "(old)";
    uint32_t utime = 11;
    uint32_t stime = 12;
    int32_t priority = 13;
    int32_t nice = 14;
    int converted;

    explicit parsed_stat(const std::string &text)
        : converted(parse_process_stat_line(text.c_str(), name, &utime, &stime, &priority, &nice)) {
    }
};

// The fields after nice, as the kernel writes them for a live process.
const std::string after_nice = " 1 0 4242 12582912 812 18446744073709551615 94016 94812 140722 0 0 "
                               "0 0 4096 17642 0 0 0 17 1 0 0 0 0 0 94901 94956 95008 140722 "
                               "140723 140723 140724 0\n";

TEST_F(ProcessListing, ParserReadsTheKernelsLines) {
    parsed_stat init("1 (systemd) S 0 1 1 0 -1 4194560 54390 1750853 0 211 127 747 2152 1104 20 0 "
                     "1 0 24 45641728 3642 18446744073709551615 1 1 0 0 0 0 671173123 4096 1260 0 "
                     "0 0 17 0 0 0 0 0 0 0 0 0 0 0 0 0 0\n");
    EXPECT_EQ(init.converted, 5);
    EXPECT_STREQ(init.name, "(systemd)");
    EXPECT_EQ(init.utime, 127u);
    EXPECT_EQ(init.stime, 747u);
    EXPECT_EQ(init.priority, 20);
    EXPECT_EQ(init.nice, 0);

    parsed_stat kernel_thread("2 (kthreadd) S 0 0 0 0 -1 2129984 0 0 0 0 0 12 0 0 20 0 1 0 5 0 0 "
                              "18446744073709551615 0 0 0 0 0 0 0 2147483647 0 1 0 0 0 1 0 0 0 0 "
                              "0 0 0 0 0 0 0 0 0\n");
    EXPECT_EQ(kernel_thread.converted, 5);
    EXPECT_STREQ(kernel_thread.name, "(kthreadd)");
    EXPECT_EQ(kernel_thread.utime, 0u);
    EXPECT_EQ(kernel_thread.stime, 12u);
    EXPECT_EQ(kernel_thread.priority, 20);
    EXPECT_EQ(kernel_thread.nice, 0);

    // A real-time thread: the kernel writes its priority negative.
    parsed_stat real_time("15 (migration/0) S 2 0 0 0 -1 69238848 0 0 0 0 0 301 0 0 -100 0 1 0 5 "
                          "0 0 18446744073709551615 0 0 0 0 0 0 0 2147483647 0 1 0 0 17 0 99 1 0 "
                          "0 0 0 0 0 0 0 0 0 0\n");
    EXPECT_EQ(real_time.converted, 5);
    EXPECT_STREQ(real_time.name, "(migration/0)");
    EXPECT_EQ(real_time.utime, 0u);
    EXPECT_EQ(real_time.stime, 301u);
    EXPECT_EQ(real_time.priority, -100);
    EXPECT_EQ(real_time.nice, 0);

    // Parentheses inside the name, and the lowest scheduling weight.
    parsed_stat nested("1234 ((sd-pam)) S 1233 1233 1233 0 -1 1077936448 50 0 0 0 3 1 0 0 39 19 1 "
                       "0 1500 108388352 1074 18446744073709551615 1 1 0 0 0 0 0 4096 0 0 0 0 17 1 "
                       "0 0 0 0 0 0 0 0 0 0 0 0 0\n");
    EXPECT_EQ(nested.converted, 5);
    EXPECT_STREQ(nested.name, "((sd-pam))");
    EXPECT_EQ(nested.utime, 3u);
    EXPECT_EQ(nested.stime, 1u);
    EXPECT_EQ(nested.priority, 39);
    EXPECT_EQ(nested.nice, 19);

    parsed_stat idle_worker("4321 (kworker/0:1H-kblockd) I 2 0 0 0 -1 69238880 0 0 0 0 0 88 0 0 0 "
                            "-20 1 0 187 0 0 18446744073709551615 0 0 0 0 0 0 0 2147483647 0 1 0 "
                            "0 17 0 0 0 0 0 0 0 0 0 0 0 0 0 0\n");
    EXPECT_EQ(idle_worker.converted, 5);
    EXPECT_STREQ(idle_worker.name, "(kworker/0:1H-kblockd)");
    EXPECT_EQ(idle_worker.utime, 0u);
    EXPECT_EQ(idle_worker.stime, 88u);
    EXPECT_EQ(idle_worker.priority, 0);
    EXPECT_EQ(idle_worker.nice, -20);

    parsed_stat zombie("999 (zombie) Z 1 999 999 0 -1 4227084 0 0 0 0 7 2 0 0 20 0 1 0 7777 0 0 "
                       "18446744073709551615 0 0 0 0 0 0 0 0 0 0 0 0 17 1 0 0 0 0 0 0 0 0 0 0 0 0 "
                       "0\n");
    EXPECT_EQ(zombie.converted, 5);
    EXPECT_STREQ(zombie.name, "(zombie)");
    EXPECT_EQ(zombie.utime, 7u);
    EXPECT_EQ(zombie.stime, 2u);
    EXPECT_EQ(zombie.priority, 20);
    EXPECT_EQ(zombie.nice, 0);
}

TEST_F(ProcessListing, ParserTakesAnyWhiteSpaceBetweenFields) {
    parsed_stat spaced("\v\f79\t(x)\nS\r1 79 79 0 -1 4194560 1523 0 12 0 57\n31\t0 0 20\f-3");
    EXPECT_EQ(spaced.converted, 5);
    EXPECT_STREQ(spaced.name, "(x)");
    EXPECT_EQ(spaced.utime, 57u);
    EXPECT_EQ(spaced.stime, 31u);
    EXPECT_EQ(spaced.priority, 20);
    EXPECT_EQ(spaced.nice, -3);
}

TEST_F(ProcessListing, ParserTakesTheNameOnlyUpToItsFirstBlank) {
    // The first character after the blank is taken as the state, and what follows it up to the
    // ")" is no number: only the name converts, the rest keeps its values.
    for (const char *name : {"tmux: server", "Web Content", "a\nb", "a "}) {
        parsed_stat shifted("4711 (" + std::string(name) +
                            ") S 1 4711 4711 0 -1 4194560 1523 0 12 0 57 31 0 0 20 0" + after_nice);
        EXPECT_EQ(shifted.converted, 1) << name;
        EXPECT_EQ(shifted.utime, 11u) << name;
        EXPECT_EQ(shifted.stime, 12u) << name;
        EXPECT_EQ(shifted.priority, 13) << name;
        EXPECT_EQ(shifted.nice, 14) << name;
    }
    EXPECT_STREQ(parsed_stat("4711 (tmux: server) S 1" + after_nice).name, "(tmux:");
    EXPECT_STREQ(parsed_stat("4711 (Web Content) S 1" + after_nice).name, "(Web");
    EXPECT_STREQ(parsed_stat("4711 (a\nb) S 1" + after_nice).name, "(a");
    EXPECT_STREQ(parsed_stat("4711 (a ) S 1" + after_nice).name, "(a");
}

TEST_F(ProcessListing, ParserCutsALongNameAndReadsOnFromThere) {
    // 98 characters of the name are taken; the 99th counts as the state, and the 100th starts a
    // field that is no number.
    parsed_stat long_name("1 (" + std::string(200, 'x') +
                          ") S 0 1 1 0 -1 4194560 1 2 3 4 57 31 0 0 20 0" + after_nice);
    EXPECT_EQ(long_name.converted, 1);
    EXPECT_EQ(std::string(long_name.name), "(" + std::string(97, 'x'));
    EXPECT_EQ(long_name.utime, 11u);
    EXPECT_EQ(long_name.stime, 12u);
    EXPECT_EQ(long_name.priority, 13);
    EXPECT_EQ(long_name.nice, 14);

    // The state is taken from within the name, then the numbers 7 and 8 from it; its ")" is no
    // number.
    parsed_stat digits_inside("1 (" + std::string(97, 'n') +
                              "R 7 8) S 0 1 1 0 -1 4194560 1 2 3 4 57 31 0 0 20 0" + after_nice);
    EXPECT_EQ(digits_inside.converted, 1);
    EXPECT_EQ(std::string(digits_inside.name), "(" + std::string(97, 'n'));
    EXPECT_EQ(digits_inside.utime, 11u);
}

TEST_F(ProcessListing, ParserReadsNumbersBeyondTheirRangeAsTheConversionsDo) {
    // Above 2^32 the counters keep their low 32 bits; priority and nice are converted as longs
    // and keep their low 32 bits too.
    parsed_stat above_32_bits("77 (big) R 1 77 77 0 -1 4194560 1 2 3 4 4294967296 4294967301 0 0 "
                              "4294967316 2147483648" +
                              after_nice);
    EXPECT_EQ(above_32_bits.converted, 5);
    EXPECT_EQ(above_32_bits.utime, 0u);
    EXPECT_EQ(above_32_bits.stime, 5u);
    EXPECT_EQ(above_32_bits.priority, 20);
    EXPECT_EQ(above_32_bits.nice, INT32_MIN);

    // Beyond 64 bits a counter reads as all ones; just below, as its low 32 bits. Priority and
    // nice beyond the range of a long are held at its largest value, whose low 32 bits are -1.
    parsed_stat above_64_bits("77 (big) R 1 77 77 0 -1 4194560 1 2 3 4 18446744073709551616 "
                              "18446744069414584327 0 0 9223372036854775807 9223372036854775808" +
                              after_nice);
    EXPECT_EQ(above_64_bits.converted, 5);
    EXPECT_EQ(above_64_bits.utime, UINT32_MAX);
    EXPECT_EQ(above_64_bits.stime, 7u);
    EXPECT_EQ(above_64_bits.priority, -1);
    EXPECT_EQ(above_64_bits.nice, -1);

    // A skipped field of any length is still a number; below the range of a long the values are
    // held at its smallest, whose low 32 bits are 0.
    parsed_stat far_below("77 (big) R 1 77 77 0 -1 4194560 99999999999999999999999 2 3 4 5 6 "
                          "99999999999999999999999 -99999999999999999999999 -9223372036854775808 "
                          "-9223372036854775809" +
                          after_nice);
    EXPECT_EQ(far_below.converted, 5);
    EXPECT_EQ(far_below.utime, 5u);
    EXPECT_EQ(far_below.stime, 6u);
    EXPECT_EQ(far_below.priority, 0);
    EXPECT_EQ(far_below.nice, 0);
}

TEST_F(ProcessListing, ParserNegatesANegativeCounterInUnsignedArithmetic) {
    parsed_stat negative("78 (neg) S 1 78 78 0 -1 4194560 1 2 3 4 -1 -5 0 0 -2147483649 "
                         "-4294967296" +
                         after_nice);
    EXPECT_EQ(negative.converted, 5);
    EXPECT_EQ(negative.utime, 4294967295u);
    EXPECT_EQ(negative.stime, 4294967291u);
    EXPECT_EQ(negative.priority, 2147483647);
    EXPECT_EQ(negative.nice, 0);

    // Minus the largest 64-bit value is 1; one more and the counter overflows to all ones.
    parsed_stat extreme("78 (neg) S 1 78 78 0 -1 4194560 1 2 3 4 -18446744073709551615 "
                        "-18446744073709551616 0 0 +20 -0" +
                        after_nice);
    EXPECT_EQ(extreme.converted, 5);
    EXPECT_EQ(extreme.utime, 1u);
    EXPECT_EQ(extreme.stime, UINT32_MAX);
    EXPECT_EQ(extreme.priority, 20);
    EXPECT_EQ(extreme.nice, 0);
}

TEST_F(ProcessListing, ParserStopsAtTheFirstFieldThatIsNoNumber) {
    // A sign alone is no number.
    parsed_stat sign_only("79 (x) S 1 79 79 0 -1 4194560 1523 0 12 0 - 31 0 0 20 0");
    EXPECT_EQ(sign_only.converted, 1);
    EXPECT_EQ(sign_only.utime, 11u);

    // Numbers are decimal: "0x57" is a 0, and "x57" no number.
    parsed_stat hexadecimal("79 (x) S 1 79 79 0 -1 4194560 1523 0 12 0 0x57 31 0 0 20 0");
    EXPECT_EQ(hexadecimal.converted, 2);
    EXPECT_EQ(hexadecimal.utime, 0u);
    EXPECT_EQ(hexadecimal.stime, 12u);
    EXPECT_EQ(hexadecimal.priority, 13);
    EXPECT_EQ(hexadecimal.nice, 14);
}

TEST_F(ProcessListing, ParserKeepsWhatATruncatedLineDoesNotReach) {
    parsed_stat after_stime("79 (cut) S 1 79 79 0 -1 4194560 1523 0 12 0 57 3");
    EXPECT_EQ(after_stime.converted, 3);
    EXPECT_STREQ(after_stime.name, "(cut)");
    EXPECT_EQ(after_stime.utime, 57u);
    EXPECT_EQ(after_stime.stime, 3u);
    EXPECT_EQ(after_stime.priority, 13);
    EXPECT_EQ(after_stime.nice, 14);

    parsed_stat after_priority("79 (cut) S 1 79 79 0 -1 4194560 1523 0 12 0 57 31 0 0 20");
    EXPECT_EQ(after_priority.converted, 4);
    EXPECT_EQ(after_priority.priority, 20);
    EXPECT_EQ(after_priority.nice, 14);

    // Nothing after nice is taken, so a line cut right after it is whole.
    parsed_stat after_nice_only("79 (cut) S 1 79 79 0 -1 4194560 1523 0 12 0 57 31 0 0 20 -5");
    EXPECT_EQ(after_nice_only.converted, 5);
    EXPECT_EQ(after_nice_only.nice, -5);

    parsed_stat within_name("79 (syst");
    EXPECT_EQ(within_name.converted, 1);
    EXPECT_STREQ(within_name.name, "(syst");

    parsed_stat after_name("79 (cut) ");
    EXPECT_EQ(after_name.converted, 1);
    EXPECT_STREQ(after_name.name, "(cut)");
    EXPECT_EQ(after_name.utime, 11u);

    parsed_stat pid_only("79 ");
    EXPECT_EQ(pid_only.converted, 0);
    EXPECT_STREQ(pid_only.name, "(old)");
    EXPECT_EQ(pid_only.utime, 11u);
    EXPECT_EQ(pid_only.stime, 12u);
    EXPECT_EQ(pid_only.priority, 13);
    EXPECT_EQ(pid_only.nice, 14);
}

TEST_F(ProcessListing, ParserConvertsNothingFromAnEmptyOrBlankLine) {
    for (const char *text : {"", " \t\n\v\f\r"}) {
        parsed_stat empty(text);
        EXPECT_EQ(empty.converted, 0);
        EXPECT_STREQ(empty.name, "(old)");
        EXPECT_EQ(empty.utime, 11u);
        EXPECT_EQ(empty.stime, 12u);
        EXPECT_EQ(empty.priority, 13);
        EXPECT_EQ(empty.nice, 14);
    }
}

TEST_F(ProcessListing, HostileStatFilesAreSampledWithoutHarm) {
    tree->set_stat_text(100, std::string(10000, 'z'));
    tree->set_stat_text(101, "");
    tree->set_stat_text(102, std::string("1 (") + std::string(300, 'n') + ") S 0\n");
    tree->set_stat_text(103, std::string("\0\0\0 7 (x) R", 12));
    update_process_list(&process_list);
    EXPECT_EQ(chain_pids(), (std::vector<int>{100, 101, 102, 103}));
    EXPECT_EQ(std::strlen(entry_of(100)->process_name), 0u); // no pid first: nothing converts
    EXPECT_EQ(std::string(entry_of(102)->process_name), "(" + std::string(97, 'n'));
    EXPECT_EQ(entry_of(101)->user_jiffies[0], 0u);

    // Once a counter has been read, a line that gives none is a counter gone back to zero.
    tree->set_process(100, "fine", 10, 10);
    update_after(100);
    tree->set_stat_text(100, "garbage");
    rec::clear_traces();
    update_after(100);
    EXPECT_EQ(rec::traces_starting("TARNCPUF: update_process_list:"),
              (Traces{"TARNCPUF: update_process_list: user percentage invalid: 21474832.000000, "
                      "pid: 100, current jiffies: 0, previous jiffies: 10, hertz: 100, diff: 100, "
                      "cpus: 2",
                      "TARNCPUF: update_process_list: kernel percentage invalid: 21474832.000000, "
                      "pid: 100, current jiffies: 0, previous jiffies: 10, hertz: 100, diff: 100, "
                      "cpus: 2"}));
    EXPECT_EQ(entry_of(100)->user_percent[2], 0.0f);
    EXPECT_STREQ(entry_of(100)->process_name, "(fine)");
}

TEST_F(ProcessListing, DeleteFreesEveryEntry) {
    for (int pid : {3, 1, 2}) {
        tree->set_process(pid, "p", 1, 1);
    }
    update_process_list(&process_list);
    EXPECT_EQ(rec::live_allocations().size(), 3u);
    delete_process_list(&process_list);
    EXPECT_TRUE(rec::live_allocations().empty());
    EXPECT_EQ(process_list.head.next, nullptr);
    EXPECT_EQ(process_list.number_of_entries, 1);
    EXPECT_STREQ(process_list.head.file_name, "/proc/1/stat");
}

// Two processes over three samples: the first takes no share, then two with shares.
class PrintedHistory : public ProcessListing {
  protected:
    void SetUp() override {
        ProcessListing::SetUp();
        tree->set_process(7, "init", 10, 4, 20, 0);
        tree->set_process(42, "worker", 100, 50, 30, 10);
        update_process_list(&process_list);
        tree->set_process(7, "init", 30, 8, 20, 0);
        tree->set_process(42, "worker", 220, 70, 30, 10);
        update_after(100);
        tree->set_process(7, "init", 31, 8, 20, 0);
        tree->set_process(42, "worker", 300, 75, 30, 10);
        update_after(50);
        rec::clear_traces();
    }
};

TEST_F(PrintedHistory, TableTextIsExact) {
    char *text = nullptr;
    int result = print_process_list(&process_list, &text);
    ASSERT_NE(text, nullptr);
    std::string expected =
        "checks: |      +1150||      +1100||      +1000||       +940||         +0||         +0|"
        "|         +0||         +0||         +0||         +0|\n"
        "pid: 7, name: (init), priority: 20, nice: 0\n"
        "user:   |     +1.00| |    +10.00| |     +0.00| " +
        zeros +
        "\n"
        "kernel: |     +0.00| |     +2.00| |     +0.00| " +
        zeros +
        "\n"
        "pid: 42, name: (worker), priority: 30, nice: 10\n"
        "user:   |    +80.00| |    +60.00| |     +0.00| " +
        zeros +
        "\n"
        "kernel: |     +5.00| |    +10.00| |     +0.00| " +
        zeros +
        "\n"
        "Overall system\n"
        "user: |    +81.00| |    +70.00| |     +0.00| " +
        zeros +
        "\n"
        "kernel:|     +5.00| |    +12.00| |     +0.00| " +
        zeros + "\n";
    EXPECT_EQ(std::string(text), expected);
    EXPECT_EQ(rec::traces(),
              (Traces{"TARNCPUF: ->print_process_list", "TARNCPUF: <-print_process_list"}));
    EXPECT_EQ(result, static_cast<int>(std::strlen("TARNCPUF: <-print_process_list")));
    ASSERT_EQ(rec::live_allocations().size(), 3u);
    // number_of_entries (3, the head included) x 493 bytes, as the allocator rounds it
    EXPECT_GE(malloc_usable_size(text), 3u * 493u);
    EXPECT_LT(malloc_usable_size(text), 3u * 493u + 32u);
    telvmemdebug_free(text, "test", 0);
}

TEST_F(PrintedHistory, WithoutOutEveryRowGoesToTheTrace) {
    int allocations_before = rec::calls(rec::Call::calloc);
    print_process_list(&process_list, nullptr);
    EXPECT_EQ(rec::calls(rec::Call::calloc), allocations_before);
    EXPECT_EQ(rec::live_allocations().size(), 2u);
    EXPECT_EQ(
        rec::traces(),
        (Traces{"TARNCPUF: ->print_process_list",
                "TARNCPUF: checks: |      +1150||      +1100||      +1000||       +940|"
                "|         +0||         +0||         +0||         +0||         +0||         +0| ",
                "TARNCPUF: pid: 7, name: (init), priority: 20, nice: 0",
                "TARNCPUF: user:   |     +1.00| |    +10.00| |     +0.00| " + zeros,
                "TARNCPUF: kernel: |     +0.00| |     +2.00| |     +0.00| " + zeros,
                "TARNCPUF: pid: 42, name: (worker), priority: 30, nice: 10",
                "TARNCPUF: user:   |    +80.00| |    +60.00| |     +0.00| " + zeros,
                "TARNCPUF: kernel: |     +5.00| |    +10.00| |     +0.00| " + zeros,
                "TARNCPUF: Overall system:",
                "TARNCPUF: user: |    +81.00| |    +70.00| |     +0.00| " + zeros,
                "TARNCPUF: kernel:|     +5.00| |    +12.00| |     +0.00| " + zeros,
                "TARNCPUF: <-print_process_list"}));
}

TEST_F(PrintedHistory, TextAreaThatCannotBeAllocatedLeavesTheRowsInTheTrace) {
    rec::fail(rec::Call::calloc, 0);
    char *text = reinterpret_cast<char *>(&process_list);
    print_process_list(&process_list, &text);
    EXPECT_EQ(text, nullptr);
    EXPECT_EQ(rec::traces().size(), 12u);
    EXPECT_EQ(rec::traces()[8], "TARNCPUF: Overall system:");
}

// Twelve samples on three processors, so that the ring has wrapped and the newest sample sits in
// slot 1: the columns run from slot 1 down through slot 0 to slot 2.
class WrappedHistory : public ProcessListing {
  protected:
    void SetUp() override {
        ProcessListing::SetUp();
        tree->set_ticks(5000);
        tree->set_cpus(3);
        for (uint32_t k = 0; k < 12; ++k) {
            // user share k %, kernel share one third %
            tree->set_process(5, "ring", 10 + 3 * k * (k + 1) / 2, 5 + k, 20, 0);
            // user share 95 %, no kernel time
            tree->set_process(9, "hog", 1000 + 285 * k, 50, 0, -20);
            update_after(k == 0 ? 0 : 100);
        }
        rec::clear_traces();
    }
};

TEST_F(WrappedHistory, TableTextIsExact) {
    ASSERT_EQ(process_list.current_sample, 2);
    char *text = nullptr;
    print_process_list(&process_list, &text);
    ASSERT_NE(text, nullptr);
    EXPECT_EQ(std::string(text),
              "checks: |      +6100||      +6000||      +5900||      +5800||      +5700|"
              "|      +5600||      +5500||      +5400||      +5300||      +5200|\n"
              "pid: 5, name: (ring), priority: 20, nice: 0\n"
              "user:   |    +11.00| |    +10.00| |     +9.00| |     +8.00| |     +7.00| "
              "|     +6.00| |     +5.00| |     +4.00| |     +3.00| |     +2.00| \n"
              "kernel: |     +0.33| |     +0.33| |     +0.33| |     +0.33| |     +0.33| "
              "|     +0.33| |     +0.33| |     +0.33| |     +0.33| |     +0.33| \n"
              "pid: 9, name: (hog), priority: 0, nice: -20\n"
              "user:   |    +95.00| |    +95.00| |    +95.00| |    +95.00| |    +95.00| "
              "|    +95.00| |    +95.00| |    +95.00| |    +95.00| |    +95.00| \n"
              "kernel: |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
              "|     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
              "Overall system\n"
              "user: |   +100.00| |   +100.00| |   +100.00| |   +100.00| |   +100.00| "
              "|   +100.00| |   +100.00| |    +99.00| |    +98.00| |    +97.00| \n"
              "kernel:|     +0.33| |     +0.33| |     +0.33| |     +0.33| |     +0.33| "
              "|     +0.33| |     +0.33| |     +0.33| |     +0.33| |     +0.33| \n");
    telvmemdebug_free(text, "test", 0);
}

TEST_F(WrappedHistory, TracedRowsAreExact) {
    print_process_list(&process_list, nullptr);
    EXPECT_EQ(rec::traces(),
              (Traces{"TARNCPUF: ->print_process_list",
                      "TARNCPUF: checks: |      +6100||      +6000||      +5900||      +5800|"
                      "|      +5700||      +5600||      +5500||      +5400||      +5300|"
                      "|      +5200| ",
                      "TARNCPUF: pid: 5, name: (ring), priority: 20, nice: 0",
                      "TARNCPUF: user:   |    +11.00| |    +10.00| |     +9.00| |     +8.00| "
                      "|     +7.00| |     +6.00| |     +5.00| |     +4.00| |     +3.00| "
                      "|     +2.00| ",
                      "TARNCPUF: kernel: |     +0.33| |     +0.33| |     +0.33| |     +0.33| "
                      "|     +0.33| |     +0.33| |     +0.33| |     +0.33| |     +0.33| "
                      "|     +0.33| ",
                      "TARNCPUF: pid: 9, name: (hog), priority: 0, nice: -20",
                      "TARNCPUF: user:   |    +95.00| |    +95.00| |    +95.00| |    +95.00| "
                      "|    +95.00| |    +95.00| |    +95.00| |    +95.00| |    +95.00| "
                      "|    +95.00| ",
                      "TARNCPUF: kernel: |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
                      "|     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
                      "|     +0.00| ",
                      "TARNCPUF: Overall system:",
                      "TARNCPUF: user: |   +100.00| |   +100.00| |   +100.00| |   +100.00| "
                      "|   +100.00| |   +100.00| |   +100.00| |    +99.00| |    +98.00| "
                      "|    +97.00| ",
                      "TARNCPUF: kernel:|     +0.33| |     +0.33| |     +0.33| |     +0.33| "
                      "|     +0.33| |     +0.33| |     +0.33| |     +0.33| |     +0.33| "
                      "|     +0.33| ",
                      "TARNCPUF: <-print_process_list"}));
    EXPECT_EQ(rec::live_allocations().size(), 2u);
}

TEST_F(ProcessListing, OverallSumsAreCappedAtAHundred) {
    tree->set_process(7, "sixty", 100, 100);
    tree->set_process(8, "fifty-five", 100, 100);
    update_process_list(&process_list);
    tree->set_process(7, "sixty", 220, 100);      // 100 x 120 / (2 x 100) = 60.0
    tree->set_process(8, "fifty-five", 210, 100); // 100 x 110 / (2 x 100) = 55.0
    update_after(100);
    EXPECT_EQ(entry_of(7)->user_percent[1], 60.0f);
    EXPECT_EQ(entry_of(8)->user_percent[1], 55.0f);

    std::string table = print_to_text();
    EXPECT_TRUE(table.ends_with("Overall system\nuser: |   +100.00| |     +0.00| |     +0.00| " +
                                zeros + "\nkernel:|     +0.00| |     +0.00| |     +0.00| " + zeros +
                                "\n"))
        << table;
}

TEST_F(ProcessListing, EmptyListPrintsTheTickRowAndTheOverallRows) {
    update_process_list(&process_list);
    std::string table = print_to_text();
    EXPECT_EQ(table, "checks: |      +1000||       +940||         +0||         +0||         +0|"
                     "|         +0||         +0||         +0||         +0||         +0|\n"
                     "Overall system\n"
                     "user: |     +0.00| |     +0.00| |     +0.00| " +
                         zeros +
                         "\n"
                         "kernel:|     +0.00| |     +0.00| |     +0.00| " +
                         zeros + "\n");
}

TEST_F(ProcessListing, ExtremeValuesStayWithinTheirCells) {
    tree->set_process(2147483647, std::string(98, 'w'), 1, 1, -2147483647 - 1, -2147483647 - 1);
    update_process_list(&process_list);
    process_entry *extreme = entry_of(2147483647);
    ASSERT_NE(extreme, nullptr);
    EXPECT_STREQ(extreme->file_name, "/proc/2147483647/stat");
    extreme->user_percent[0] = 1.0e30f;
    extreme->kernel_percent[0] = -1.0e30f;
    extreme->priority = INT32_MIN;
    extreme->nice = INT32_MIN;
    process_list.sample_ticks[0] = 0x80000000LL; // -2147483648 in 32 bits
    std::string table = print_to_text();
    EXPECT_NE(table.find("checks: |-2147483648||       +940|"), std::string::npos) << table;
    EXPECT_NE(table.find("name: (" + std::string(97, 'w') +
                         ", priority: -2147483648, nice: "
                         "-2147483648\n"),
              std::string::npos)
        << table;
    EXPECT_LT(table.size(), 2u * PROCESS_TABLE_BYTES_PER_ENTRY);
}

// The real /proc and clock: a child that spins shows up with a plausible share.
TEST(ProcessListingOnThisMachine, SpinningChildTakesAPlausibleShare) {
    rec::reset();
    reset_process_listing_state();
    std::memset(&process_list, 0, sizeof process_list);
    pid_t child = 0;
    // In a session of its own, and so a scheduling group of its own, at the group's highest
    // priority where the rights allow: a host busy with other work does not hold it back.
    const char *argv[] = {"/bin/sh", "-c",
                          "echo -19 2>/dev/null >/proc/self/autogroup; while :; do :; done",
                          nullptr};
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSID);
    ASSERT_EQ(
        posix_spawn(&child, "/bin/sh", nullptr, &attributes, const_cast<char **>(argv), environ),
        0);
    posix_spawnattr_destroy(&attributes);
    // A counter still at 0 in the first sample gives no share in the second, so the child first
    // runs long enough to have used some ticks.
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    update_process_list(&process_list);
    std::this_thread::sleep_for(std::chrono::milliseconds(1200));
    update_process_list(&process_list);

    const process_entry *spinning = nullptr;
    for (const process_entry *e = process_list.head.next; e != nullptr; e = e->next) {
        if (e->pid == child) {
            spinning = e;
        }
    }
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    ASSERT_NE(spinning, nullptr);
    EXPECT_EQ(process_list.current_sample, 2);
    EXPECT_GE(process_list.number_of_cpus, 1);
    float share = spinning->user_percent[1] + spinning->kernel_percent[1];
    EXPECT_GT(share, 10.0f / static_cast<float>(process_list.number_of_cpus));
    EXPECT_LE(share, 100.0f);
    EXPECT_TRUE(rec::traces_starting("TARNCPUF: update_process_list: user").empty());
    delete_process_list(&process_list);
}

} // namespace

namespace {

TEST_F(ProcessListing, ZeroCellsAreThoseTheFormattingWrites) {
    tree->set_process(7, "init", 10, 4);
    update_process_list(&process_list);
    process_entry *init = entry_of(7);
    ASSERT_NE(init, nullptr);
    const float values[PROCESS_SAMPLES] = {0.0f, -0.0f, 0.004f, -0.004f, 1.0f,
                                           0.0f, 0.0f,  0.0f,   0.0f,    0.0f};
    std::string expected = "user:   ";
    for (int k = 0; k < PROCESS_SAMPLES; ++k) {
        int slot = (process_list.current_sample + PROCESS_SAMPLES - 1 - k) % PROCESS_SAMPLES;
        init->user_percent[slot] = values[k];
        char cell[32];
        std::snprintf(cell, sizeof cell, "|%+#10.2f| ", static_cast<double>(values[k]));
        expected += cell;
    }
    expected += '\n';
    const std::string table = print_to_text();
    EXPECT_NE(table.find(expected), std::string::npos) << table;
    EXPECT_NE(expected.find("|     -0.00| "), std::string::npos);
}

} // namespace

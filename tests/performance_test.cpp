// The performance check over a fake /proc and a stepped clock (the accounting's seams), a control
// block of the test's own, and a fake runAsRoot first on PATH that records each trace dump. The
// check on the real /proc is in performance_platform_test.
//
// Every sample lies 1,000 ticks (ten seconds at 100 ticks a second) after the one before on one
// processor, so a process whose utime grew by N ticks used N tenths of a percent: 900 is 90.0 %.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "core/control_block.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "cpu/performance.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "fake_proc.h"
#include "private_ipc.h"
#include "recording_platform.h"
#include "telvmemdebug.h"
#include "text_lines.h"

namespace {

using fake::fake_commands;
using text::joined;
using text::lines;

constexpr clock_t SAMPLE_TICKS = 1000;
constexpr int BUSY = 100;
constexpr int OTHER = 200;
constexpr int32_t EARLIER_FINDING = 0xE117; // what a check before this one found in the pass

const std::string ENTRY = "TARNOTHF: --> tarn_check_performance";
const std::string EXIT = "TARNOTHF: <-- tarn_check_performance, src = 0, crc = 0 (hex)";
const lines REFRESH = {"TARNMNDF:     about to call update_process_list()",
                       "TARNCPUF: ->update_process_list",
                       "TARNCPUF: query_number_of_cpus: found number 0, new total: 1",
                       "TARNCPUF: <-update_process_list",
                       "TARNMNDF:     back from call update_process_list()",
                       "TARNMONF:     about to call print_process_list()",
                       "TARNCPUF: ->print_process_list",
                       "TARNCPUF: <-print_process_list",
                       "TARNMONF:     back from call print_process_list()"};
const std::string ARMED = "TARNMNDF: TARN_CB_PTR->numLoopsBeforeCPUChecking = 0 (dec)";
const std::string JUDGING = "TARNMNDF: Actually check the CPU usage";
const lines GATHERING = {"TARNGTDF: --> tarn_gather_trace_data", "TARNMNDF: stba data: [dumped]",
                         "TARNGTDF: 'showTraceBuf all' call worked. Make sure file exists.",
                         "TARNGTDF: <-- tarn_gather_trace_data, src = 0, crc = 0 (hex)"};
const std::string OLD_PS_OPENING = "\n\r***** About to output old PS data *****: \n\r";
const std::string OLD_PS_CLOSING = "***** end of old PS data ***** \n\r";
const std::string OVERFLOW_LINE = "No room to output more lines... \n\r";

std::string countdown_trace(int value) {
    return "TARNMNDF: TARN_CB_PTR->numLoopsBeforeCPUChecking = " + std::to_string(value) + " (dec)";
}

std::string appliance_trace(const std::string &average) {
    return "TARNMNDF:     total QV cpu usage was = " + average + " (float)";
}

lines process_report(const std::string &average, int pid, const std::string &name) {
    return {"TARNMNDF: A process is using too much CPU time",
            "TARNMNDF:     total average cpu usage was = " + average + " (float)",
            "TARNMNDF:     pid            = " + std::to_string(pid) + " (dec)",
            "TARNMNDF:     priority       = 20 (dec)",
            "TARNMNDF:     nice           = 0 (dec)",
            "TARNMNDF:     process_name   = [(" + name + ")]    ",
            "TARNMNDF:     file_name      = [/proc/" + std::to_string(pid) + "/stat]    "};
}

lines appliance_report(const std::string &average) {
    return {"TARNMNDF: The QV is using too much CPU time",
            "TARNMNDF:     total average QV cpu usage was = " + average + " (float)"};
}

lines sleep_report(int slept, int allowed, int percent) {
    return {"TARNMNDF: The QV is running too slowly",
            "TARNMNDF:     The actual sleep time was " + std::to_string(slept) +
                " seconds instead of the expected " + std::to_string(allowed) + " seconds",
            "TARNMNDF:     TARN_CB_PTR->sleep_time_percent = " + std::to_string(percent) +
                " percent"};
}

std::string formatted(float figure) {
    char text[64];
    std::snprintf(text, sizeof text, "%f", static_cast<double>(figure));
    return text;
}

std::string error_text(const std::string &name) {
    return "\n\rError Information: \n\rProcess is using too much CPU Time:\n\r(" + name + ")\n\r";
}

// What one sample gives a process: user and kernel time in tenths of a percent.
struct usage {
    uint32_t user;
    uint32_t kernel = 0;
};

class Performance : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        rec::reset();
        reset_settings();
        block = private_ipc::fresh_control_block();
        ASSERT_NE(block, nullptr);
        reset_process_listing_state();
        std::memset(&process_list, 0, sizeof process_list);
        process_list_ptr = &process_list;
        process_entry_ptr = nullptr;
        tree.emplace(SAMPLE_TICKS, 100);
        tree->set_cpus(1);
        cpu_percent_threshold = 900;
        cpu_time_threshold = 3;
        cpu_percent_threshold_qv = 100000; // the appliance's tests set their own
        telvzmnd_sleep_time = 0;
        log_path = fakes.dir() + "/runAsRoot.log";
        fakes.add("runAsRoot", "#!/bin/sh\necho \"$*\" >> '" + log_path +
                                   "'\necho dumped\necho trace > '" + rec::data_dir() +
                                   "/'\"$3\"\n");
        clear_ps_data_block();
        start_pass();
    }

    void TearDown() override {
        if (!key_is_ours) {
            return;
        }
        delete_process_list(&process_list);
        tree.reset();
        private_ipc::remove_control_block();
    }

    // What the loop does before the checks of a pass.
    void start_pass() {
        start_pass_data();
        std::memset(line, 0, LINE_SIZE);
        takeLogCrc = 0;
        takeLogValue = 0;
    }

    uint32_t check() {
        crc = 0;
        return tarn_check_performance(&takeLogCrc, &takeLogValue, &block->tookLog, &crc);
    }

    // Lets each process of `used` use what it says in the sample being taken.
    void use(const std::map<int, usage> &used) {
        for (const auto &[pid, use] : used) {
            totals[pid].user += use.user;
            totals[pid].kernel += use.kernel;
            tree->set_process(pid, pid == BUSY ? "busy" : "other" + std::to_string(pid),
                              totals[pid].user, totals[pid].kernel);
        }
    }

    // Moves the clock one sample on, lets each process of `used` use what it says, and starts a
    // pass with the countdown at `countdown` (left as it is without one); the test sets what else
    // the pass needs and runs the check.
    void next_pass(const std::map<int, usage> &used, std::optional<int32_t> countdown) {
        use(used);
        tree->advance(SAMPLE_TICKS);
        if (countdown) {
            block->numLoopsBeforeCPUChecking = *countdown;
        }
        start_pass();
        rec::clear_traces();
    }

    // The pass of one sample: armed when `armed`, otherwise with a countdown that stays above 0.
    void sample(const std::map<int, usage> &used, bool armed = false) {
        next_pass(used, armed ? 0 : 50);
        EXPECT_EQ(check(), 0u);
    }

    // The processes' first sample: entries made, no history yet (every percentage 0).
    void first_sample(std::initializer_list<int> pids) {
        std::map<int, usage> used;
        for (int pid : pids) {
            used[pid] = {1, 1}; // a counter of 0 would leave the next percentage at 0
        }
        sample(used);
    }

    // The samples of one process, oldest first, each the same for the user and the kernel time
    // given; the last is the armed one.
    void history(const std::vector<std::map<int, usage>> &samples) {
        for (size_t i = 0; i < samples.size(); ++i) {
            sample(samples[i], i + 1 == samples.size());
        }
    }

    std::string table_now() {
        char *text = nullptr;
        print_process_list(&process_list, &text);
        std::string copy = text != nullptr ? text : "";
        telvmemdebug_free(text, "test", 0);
        return copy;
    }

    int gatherings() {
        std::ifstream in(log_path);
        int count = 0;
        for (std::string run; std::getline(in, run);) {
            EXPECT_EQ(run, "telvzstba all telvzstba.trm");
            ++count;
        }
        return count;
    }

    void expect_finding(int32_t code, int32_t value) {
        EXPECT_EQ(takeLogCrc, code) << std::hex << takeLogCrc;
        EXPECT_EQ(takeLogValue, value);
    }

    bool key_is_ours = false;
    tarn_control_block *block = nullptr;
    std::optional<fake::fake_proc> tree;
    std::map<int, usage> totals;
    fake_commands fakes;
    std::string log_path;
    int32_t takeLogCrc = 0;
    int32_t takeLogValue = 0;
    uint32_t crc = 0;
};

// ---- The countdown ----

TEST_F(Performance, ElevenPassesCountDownAndTheEleventhDropsTheEarlierFindingAndJudges) {
    first_sample({BUSY});
    block->numLoopsBeforeCPUChecking = 11;
    for (int pass = 1; pass <= 10; ++pass) {
        next_pass({{BUSY, {950}}}, std::nullopt);
        takeLogCrc = EARLIER_FINDING;
        takeLogValue = 5;
        check();
        EXPECT_EQ(block->numLoopsBeforeCPUChecking, 11 - pass);
        EXPECT_EQ(rec::traces(), joined({{ENTRY}, REFRESH, {countdown_trace(11 - pass), EXIT}}))
            << "pass " << pass;
        expect_finding(EARLIER_FINDING, 5);
    }
    EXPECT_EQ(gatherings(), 0);

    // The eleventh: the countdown reaches 0, what the earlier checks found goes, the CPU is judged.
    next_pass({{BUSY, {950}}}, std::nullopt);
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 5;
    check();
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 0);
    expect_finding(RC_PROCESS_CPU, 31); // 95.0 / 3, truncated
    EXPECT_EQ(rec::traces(), joined({{ENTRY},
                                     REFRESH,
                                     {ARMED, JUDGING},
                                     process_report("95.000000", BUSY, "busy"),
                                     GATHERING,
                                     {appliance_trace("95.000000"), EXIT}}));
    EXPECT_EQ(gatherings(), 1);
}

TEST_F(Performance, CountdownReachingZeroWithoutAFindingLeavesAClearPass) {
    first_sample({BUSY});
    next_pass({}, 1);
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 77;
    check();
    expect_finding(0, 0);
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 0);
}

TEST_F(Performance, ArmedCheckingLeavesAnEarlierFindingAloneAndJudgesNothing) {
    first_sample({BUSY});
    next_pass({}, 0);
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 77;
    check();
    expect_finding(EARLIER_FINDING, 77);
    EXPECT_EQ(rec::traces(), joined({{ENTRY}, REFRESH, {ARMED, EXIT}}));
}

TEST_F(Performance, NegativeCountdownStaysAndJudgesNothing) {
    first_sample({BUSY});
    next_pass({}, -3);
    check();
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, -3);
    EXPECT_EQ(rec::traces(), joined({{ENTRY}, REFRESH, {countdown_trace(-3), EXIT}}));
}

// ---- The history in the pass's data ----

TEST_F(Performance, TableGoesInAfterALineEndWhateverRoomIsLeft) {
    first_sample({BUSY, OTHER});
    next_pass({}, 50);
    outbufferleft = 0;
    pdboverflow = 1;
    check();
    const std::string table = table_now();
    ASSERT_NE(table.find("name: (busy)"), std::string::npos);
    EXPECT_EQ(std::string(primaryDataBlock), "\n\r" + table);
    EXPECT_EQ(outbufferleft, 0);
    // The line it has always written beside the table, and never appended.
    EXPECT_STREQ(line, "About to the CPU usage data \n\r");
}

TEST_F(Performance, TableThatCannotBeAllocatedIsTracedInsteadAndNothingGoesIn) {
    first_sample({BUSY});
    next_pass({}, 50);
    rec::fail(rec::Call::calloc, 0);
    check();
    EXPECT_STREQ(primaryDataBlock, "");
    EXPECT_STREQ(line, "");
    EXPECT_NE(rec::find_trace("TARNCPUF: Overall system:"), -1);
}

TEST_F(Performance, TableIsFreedAfterItWentIn) {
    first_sample({BUSY});
    const size_t entries = rec::live_allocations().size();
    sample({});
    EXPECT_EQ(rec::live_allocations().size(), entries);
}

// ---- One process against its limit ----

TEST_F(Performance, ProcessAtTheLimitInEachJudgedSampleIsReportedWithTheOldestSampleAsValue) {
    first_sample({BUSY});
    history({{{BUSY, {900}}}, {{BUSY, {920}}}, {{BUSY, {950}}}});

    // 90.0 x 10 = 900 is not below 900. The value is the oldest judged sample, 90.0, over three.
    expect_finding(RC_PROCESS_CPU, 30);
    EXPECT_EQ(rec::traces(), joined({{ENTRY},
                                     REFRESH,
                                     {ARMED, JUDGING},
                                     process_report("92.333336", BUSY, "busy"),
                                     GATHERING,
                                     {appliance_trace("92.333336"), EXIT}}));
    EXPECT_EQ(std::string(topDataBlock), error_text("busy"));
    EXPECT_TRUE(text::all_zero(topDataBlock + error_text("busy").size(),
                               TOP_DATA_BLOCK_SIZE - error_text("busy").size()));
    EXPECT_EQ(gatherings(), 1);
    EXPECT_EQ(process_entry_ptr, nullptr); // the walk went past busy, the last entry
    EXPECT_EQ(std::string(primaryDataBlock), "\n\r" + table_now());
}

TEST_F(Performance, UserAndKernelTimeAreJudgedTogether) {
    first_sample({BUSY});
    history({{{BUSY, {450, 450}}}, {{BUSY, {500, 400}}}, {{BUSY, {10, 890}}}});
    expect_finding(RC_PROCESS_CPU, 30);
}

class PerformanceTenthBelow : public Performance, public ::testing::WithParamInterface<int> {};

TEST_P(PerformanceTenthBelow, OneSampleATenthBelowTheLimitIsNoFinding) {
    first_sample({BUSY});
    std::vector<std::map<int, usage>> samples(3, {{BUSY, {950}}});
    samples[static_cast<size_t>(GetParam())] = {{BUSY, {899}}}; // 89.9 %
    history(samples);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces_starting("TARNMNDF: A process").size(), 0u);
    EXPECT_EQ(gatherings(), 0);
    EXPECT_EQ(rec::traces().size(), REFRESH.size() + 5);
    EXPECT_STREQ(topDataBlock, "");
}

INSTANTIATE_TEST_SUITE_P(EachOfTheThree, PerformanceTenthBelow, ::testing::Values(0, 1, 2));

TEST_F(Performance, SampleOlderThanTheJudgedOnesIsNotJudged) {
    first_sample({BUSY});
    history({{{BUSY, {100}}}, {{BUSY, {950}}}, {{BUSY, {950}}}, {{BUSY, {950}}}});
    expect_finding(RC_PROCESS_CPU, 31);
}

// Ten samples of 90.0 to 99.0 %, oldest first: only ten exist, so a count above ten judges the
// same ten, while the averages and the value are still divided by the count.
struct sample_count_case {
    int32_t count;
    int32_t value;
    const char *average;
};

class PerformanceSampleCount : public Performance,
                               public ::testing::WithParamInterface<sample_count_case> {};

TEST_P(PerformanceSampleCount, NewestSamplesUpToTenAreJudgedAndTheCountDividesTheFigures) {
    const sample_count_case &c = GetParam();
    cpu_time_threshold = c.count;
    first_sample({BUSY});
    std::vector<std::map<int, usage>> samples;
    for (uint32_t percent = 90; percent <= 99; ++percent) {
        samples.push_back({{BUSY, {percent * 10}}});
    }
    history(samples);
    expect_finding(RC_PROCESS_CPU, c.value);
    EXPECT_EQ(rec::traces(), joined({{ENTRY},
                                     REFRESH,
                                     {ARMED, JUDGING},
                                     process_report(c.average, BUSY, "busy"),
                                     GATHERING,
                                     {appliance_trace(c.average), EXIT}}));
}

INSTANTIATE_TEST_SUITE_P(
    Counts, PerformanceSampleCount,
    ::testing::Values(sample_count_case{1, 99, "99.000000"}, // 99.0 / 1
                      sample_count_case{3, 32, "98.000000"}, // 97.0 / 3 = 32.3; (99+98+97) / 3
                      sample_count_case{10, 9, "94.500000"}, // 90.0 / 10; 945 / 10
                      sample_count_case{12, 7, "78.750000"}  // 90.0 / 12 = 7.5; 945 / 12
                      ),
    [](const ::testing::TestParamInfo<sample_count_case> &info) {
        return "Count" + std::to_string(info.param.count);
    });

TEST_F(Performance, TenthSampleBackBelowTheLimitSparesAProcessJudgedOverTenOrMore) {
    first_sample({BUSY});
    std::vector<std::map<int, usage>> samples(10, {{BUSY, {990}}});
    samples[0] = {{BUSY, {899}}};
    for (int32_t count : {10, 12}) {
        cpu_time_threshold = count;
        history(samples);
        expect_finding(0, 0);
    }
    cpu_time_threshold = 9;
    history(samples);
    expect_finding(RC_PROCESS_CPU, 11); // 99.0 / 9
}

TEST_F(Performance, WalkStopsAtTheFirstProcessOverTheLimit) {
    first_sample({BUSY, OTHER});
    history({{{BUSY, {950}}, {OTHER, {980}}},
             {{BUSY, {950}}, {OTHER, {980}}},
             {{BUSY, {950}}, {OTHER, {980}}}});
    expect_finding(RC_PROCESS_CPU, 31);
    EXPECT_EQ(rec::traces_starting("TARNMNDF: A process").size(), 1u);
    EXPECT_EQ(rec::traces_starting("TARNMNDF:     pid ")[0],
              "TARNMNDF:     pid            = 100 (dec)");
    EXPECT_EQ(gatherings(), 1);
    EXPECT_EQ(std::string(topDataBlock), error_text("busy"));
    // The appliance's figure has busy's samples only: the walk never reached the other one.
    EXPECT_NE(rec::find_trace(appliance_trace("95.000000")), -1);
    EXPECT_EQ(process_entry_ptr->pid, OTHER);
}

TEST_F(Performance, ProcessesBelowTheLimitAllCountForTheAppliance) {
    first_sample({BUSY, OTHER});
    history({{{BUSY, {300}}, {OTHER, {200}}},
             {{BUSY, {300}}, {OTHER, {200}}},
             {{BUSY, {300}}, {OTHER, {200}}}});
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(),
              joined({{ENTRY}, REFRESH, {ARMED, JUDGING, appliance_trace("50.000000"), EXIT}}));
    EXPECT_EQ(process_entry_ptr, nullptr);
}

TEST_F(Performance, HeadEntryIsJudgedFirstAndIsOverALimitOfZero) {
    cpu_percent_threshold = 0;
    first_sample({BUSY});
    history({{{BUSY, {500}}}, {{BUSY, {500}}}, {{BUSY, {500}}}});
    // The head holds pid 0, no name and the file name every head has.
    expect_finding(RC_PROCESS_CPU, 0);
    EXPECT_EQ(rec::traces_starting("TARNMNDF:     pid ")[0],
              "TARNMNDF:     pid            = 0 (dec)");
    EXPECT_NE(rec::find_trace("TARNMNDF:     process_name   = []    "), -1);
    EXPECT_NE(rec::find_trace("TARNMNDF:     file_name      = [/proc/1/stat]    "), -1);
    EXPECT_EQ(std::string(topDataBlock),
              "\n\rError Information: \n\rProcess is using too much CPU Time:\n\r\n\r");
    EXPECT_EQ(process_entry_ptr->pid, BUSY);
}

TEST_F(Performance, CountBelowOneJudgesNoSampleAndSoFindsTheHead) {
    cpu_time_threshold = -1;
    first_sample({BUSY});
    history({{{BUSY, {10}}}});
    expect_finding(RC_PROCESS_CPU, 0);
    EXPECT_NE(rec::find_trace("TARNMNDF:     total average cpu usage was = -0.000000 (float)"), -1);
    EXPECT_NE(rec::find_trace("TARNMNDF:     pid            = 0 (dec)"), -1);
}

TEST_F(Performance, ProcessFoundWhileTookLogIsSetIsOnlyMarked) {
    first_sample({BUSY, OTHER});
    block->tookLog = 1;
    history({{{BUSY, {950}}, {OTHER, {950}}},
             {{BUSY, {950}}, {OTHER, {950}}},
             {{BUSY, {950}}, {OTHER, {950}}}});
    expect_finding(TAKE_LOG_SUPPRESSED, 0);
    EXPECT_EQ(rec::traces(),
              joined({{ENTRY}, REFRESH, {ARMED, JUDGING, appliance_trace("95.000000"), EXIT}}));
    EXPECT_EQ(gatherings(), 0);
    EXPECT_STREQ(topDataBlock, "");
    EXPECT_EQ(block->tookLog, 1u);
    EXPECT_EQ(process_entry_ptr->pid, OTHER); // the walk stopped all the same
}

TEST_F(Performance, SkippedUpdateJudgesTheSamplesThereAre) {
    first_sample({BUSY});
    history({{{BUSY, {950}}}, {{BUSY, {950}}}, {{BUSY, {950}}}});
    start_pass();
    rec::clear_traces();
    tree->advance(40); // 0.4 s: no sample is taken
    check();
    expect_finding(RC_PROCESS_CPU, 31);
    EXPECT_EQ(rec::find_trace("TARNCPUF: <-update_process_list (skip)"), 3);
}

// ---- The appliance ----

TEST_F(Performance, ApplianceExactlyAtItsLimitIsNoFinding) {
    cpu_time_threshold = 1;
    cpu_percent_threshold = 1001;
    cpu_percent_threshold_qv = 900;
    first_sample({BUSY, OTHER});
    history({{{BUSY, {450}}, {OTHER, {450}}}});
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(),
              joined({{ENTRY}, REFRESH, {ARMED, JUDGING, appliance_trace("90.000000"), EXIT}}));
}

TEST_F(Performance, ApplianceATenthOverItsLimitIsReported) {
    cpu_time_threshold = 1;
    cpu_percent_threshold = 1001;
    cpu_percent_threshold_qv = 900;
    first_sample({BUSY, OTHER});
    history({{{BUSY, {450}}, {OTHER, {451}}}});
    expect_finding(RC_APPLIANCE_CPU, 90);
    // Summed in float in walk order: the head, 45.0, then 45.1 as the accounting computes it.
    float overall = 0.0f;
    overall += 45000.0f / 1000.0f;
    overall += 45100.0f / 1000.0f;
    const std::string average = formatted(overall);
    EXPECT_EQ(average.substr(0, 5), "90.09");
    EXPECT_EQ(rec::traces(), joined({{ENTRY},
                                     REFRESH,
                                     {ARMED, JUDGING, appliance_trace(average)},
                                     appliance_report(average),
                                     GATHERING,
                                     {EXIT}}));
    EXPECT_STREQ(topDataBlock, ""); // this finding has no error text
    EXPECT_EQ(gatherings(), 1);
}

TEST_F(Performance, ApplianceFindingReplacesAProcessFindingAndGathersAgain) {
    cpu_percent_threshold_qv = 900;
    first_sample({BUSY});
    history({{{BUSY, {950}}}, {{BUSY, {950}}}, {{BUSY, {950}}}});
    expect_finding(RC_APPLIANCE_CPU, 95);
    EXPECT_EQ(rec::traces(), joined({{ENTRY},
                                     REFRESH,
                                     {ARMED, JUDGING},
                                     process_report("95.000000", BUSY, "busy"),
                                     GATHERING,
                                     {appliance_trace("95.000000")},
                                     appliance_report("95.000000"),
                                     GATHERING,
                                     {EXIT}}));
    EXPECT_EQ(std::string(topDataBlock), error_text("busy")); // the process's text stays
    EXPECT_EQ(gatherings(), 2);
}

TEST_F(Performance, ApplianceFoundWhileTookLogIsSetIsOnlyMarked) {
    cpu_time_threshold = 1;
    cpu_percent_threshold = 1001;
    cpu_percent_threshold_qv = 100;
    block->tookLog = 1;
    first_sample({BUSY});
    history({{{BUSY, {500}}}});
    expect_finding(TAKE_LOG_SUPPRESSED, 0);
    EXPECT_EQ(rec::traces(),
              joined({{ENTRY}, REFRESH, {ARMED, JUDGING, appliance_trace("50.000000"), EXIT}}));
    EXPECT_EQ(gatherings(), 0);
}

// ---- The monitor's own sleep ----

class PerformanceSleep : public Performance {
  protected:
    void SetUp() override {
        Performance::SetUp();
        if (IsSkipped() || HasFatalFailure()) {
            return;
        }
        first_sample({BUSY});
        copy_to_ps_data_block("  PID   RSS COMMAND\n\r    1  9000 init\n\r  100  1200 busy");
        block->maxSleepTime = 66;
        telvzmnd_sleep_time = 70;
    }

    // What the loop leaves after a sleep that took too long.
    void flag_overrun(int32_t percent) {
        block->sleepTimeExceeded = 1;
        block->sleep_time_percent = percent;
    }

    // An armed pass after the loop flagged an overlong sleep with this percentage.
    void overrun(int32_t percent) {
        flag_overrun(percent);
        history({{{BUSY, {100}}}});
    }

    std::string old_ps_data() const {
        return OLD_PS_OPENING + std::string(newPSDataBlock) + "\n\r" + OLD_PS_CLOSING;
    }
};

TEST_F(PerformanceSleep, OverrunWithItsPercentageIsReportedWithTheOldListing) {
    overrun(700);
    expect_finding(RC_SLEEP_OVERRUN, 700);
    EXPECT_EQ(block->sleepTimeExceeded, 0u);
    EXPECT_EQ(rec::traces(), joined({{ENTRY},
                                     REFRESH,
                                     {ARMED, JUDGING, appliance_trace("3.333333")},
                                     sleep_report(70, 66, 700),
                                     GATHERING,
                                     {EXIT}}));
    EXPECT_EQ(std::string(primaryDataBlock), "\n\r" + table_now() + old_ps_data());
    EXPECT_EQ(outbufferleft,
              OUTBUFFER_BUDGET - static_cast<int32_t>(std::strlen(newPSDataBlock)) - 3);
    EXPECT_EQ(gatherings(), 1);
    EXPECT_STREQ(topDataBlock, "");
}

class PerformanceSleepPercent : public PerformanceSleep,
                                public ::testing::WithParamInterface<int32_t> {};

TEST_P(PerformanceSleepPercent, OverrunWithoutAPositivePercentageHasItsOwnCodeAndNoValue) {
    overrun(GetParam());
    expect_finding(RC_SLEEP_OVERRUN_NOT_POSITIVE, 0);
    EXPECT_EQ(rec::traces(), joined({{ENTRY},
                                     REFRESH,
                                     {ARMED, JUDGING, appliance_trace("3.333333")},
                                     sleep_report(70, 66, GetParam()),
                                     GATHERING,
                                     {EXIT}}));
    EXPECT_EQ(std::string(primaryDataBlock), "\n\r" + table_now() + old_ps_data());
    EXPECT_EQ(block->sleepTimeExceeded, 0u);
}

INSTANTIATE_TEST_SUITE_P(ZeroAndMinusOne, PerformanceSleepPercent, ::testing::Values(0, -1),
                         [](const ::testing::TestParamInfo<int32_t> &info) {
                             return info.param == 0 ? std::string("Zero") : std::string("MinusOne");
                         });

TEST_F(PerformanceSleep, OldListingTooLongForTheRoomLeftGivesTheOverflowLineOnce) {
    next_pass({{BUSY, {100}}}, 0);
    flag_overrun(700);
    outbufferleft = static_cast<int32_t>(std::strlen(newPSDataBlock)) + 5;
    check();
    expect_finding(RC_SLEEP_OVERRUN, 700);
    EXPECT_EQ(std::string(primaryDataBlock),
              "\n\r" + table_now() + OLD_PS_OPENING + OVERFLOW_LINE + OLD_PS_CLOSING);
    EXPECT_EQ(outbufferleft, 4);
    EXPECT_EQ(pdboverflow, 1);
}

TEST_F(PerformanceSleep, OldListingWithOneByteMoreRoomGoesIn) {
    const auto length = static_cast<int32_t>(std::strlen(newPSDataBlock));
    next_pass({{BUSY, {100}}}, 0);
    flag_overrun(700);
    outbufferleft = length + 6;
    check();
    EXPECT_EQ(std::string(primaryDataBlock), "\n\r" + table_now() + old_ps_data());
    EXPECT_EQ(outbufferleft, 3);
    EXPECT_EQ(pdboverflow, 0);
}

TEST_F(PerformanceSleep, OldListingAfterThePassOverflowedAddsOnlyItsFrame) {
    next_pass({{BUSY, {100}}}, 0);
    flag_overrun(700);
    outbufferleft = 4;
    pdboverflow = 1;
    check();
    EXPECT_EQ(std::string(primaryDataBlock),
              "\n\r" + table_now() + OLD_PS_OPENING + OLD_PS_CLOSING);
    EXPECT_EQ(outbufferleft, 4);
}

TEST_F(PerformanceSleep, EmptyOldListingIsAnEmptyLine) {
    clear_ps_data_block();
    overrun(700);
    EXPECT_EQ(std::string(primaryDataBlock),
              "\n\r" + table_now() + OLD_PS_OPENING + "\n\r" + OLD_PS_CLOSING);
}

TEST_F(PerformanceSleep, OverrunReplacesAProcessFinding) {
    sample({{BUSY, {950}}});
    sample({{BUSY, {950}}});
    // Flagged in the last sleep: an unarmed pass before it would have cleared the flag.
    next_pass({{BUSY, {950}}}, 0);
    flag_overrun(250);
    check();
    expect_finding(RC_SLEEP_OVERRUN, 250);
    EXPECT_EQ(gatherings(), 2);
    EXPECT_EQ(std::string(topDataBlock), error_text("busy"));
}

TEST_F(PerformanceSleep, OverrunFoundWhileTookLogIsSetIsOnlyMarkedAndForgotten) {
    block->tookLog = 1;
    overrun(700);
    expect_finding(TAKE_LOG_SUPPRESSED, 0);
    EXPECT_EQ(block->sleepTimeExceeded, 0u);
    EXPECT_EQ(rec::traces(),
              joined({{ENTRY}, REFRESH, {ARMED, JUDGING, appliance_trace("3.333333"), EXIT}}));
    EXPECT_EQ(std::string(primaryDataBlock), "\n\r" + table_now());
    EXPECT_EQ(gatherings(), 0);
}

TEST_F(PerformanceSleep, FlagOtherThanOneIsNoOverrunButIsCleared) {
    block->sleepTimeExceeded = 2;
    block->sleep_time_percent = 700;
    history({{{BUSY, {100}}}});
    expect_finding(0, 0);
    EXPECT_EQ(block->sleepTimeExceeded, 0u);
}

TEST_F(PerformanceSleep, OverrunFlaggedWhileTheCountdownRunsIsForgotten) {
    next_pass({}, 5);
    flag_overrun(700);
    check();
    expect_finding(0, 0);
    EXPECT_EQ(block->sleepTimeExceeded, 0u);
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 4);
    EXPECT_EQ(rec::traces(), joined({{ENTRY}, REFRESH, {countdown_trace(4), EXIT}}));
    EXPECT_EQ(gatherings(), 0);
}

TEST_F(PerformanceSleep, OverrunFlaggedWhenAnEarlierCheckFoundSomethingIsForgotten) {
    next_pass({}, 0);
    flag_overrun(700);
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 9;
    check();
    expect_finding(EARLIER_FINDING, 9);
    EXPECT_EQ(block->sleepTimeExceeded, 0u);
}

// ---- Failures around the findings ----

TEST_F(Performance, TraceDumpThatFailsLeavesTheFindingAndItsCrc) {
    fakes.remove("runAsRoot");
    fake_commands only(fake_commands::path_mode::only);
    first_sample({BUSY});
    history({{{BUSY, {950}}}, {{BUSY, {950}}}, {{BUSY, {950}}}});
    expect_finding(RC_PROCESS_CPU, 31);
    EXPECT_NE(crc, 0u); // the size query's, of a dump that is not there
    std::ostringstream exit;
    exit << "TARNOTHF: <-- tarn_check_performance, src = 0, crc = " << std::hex << crc << " (hex)";
    EXPECT_EQ(rec::traces().back(), exit.str());
}

TEST_F(Performance, WithoutAControlBlockTheHistoryIsStillRefreshed) {
    first_sample({BUSY});
    tarn_control_block *attached = TARN_CB_PTR.get();
    TARN_CB_PTR = nullptr;
    next_pass({}, std::nullopt);
    uint32_t took_log = 0;
    crc = 0;
    EXPECT_EQ(tarn_check_performance(&takeLogCrc, &takeLogValue, &took_log, &crc), 0u);
    TARN_CB_PTR = attached;
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), joined({{ENTRY}, REFRESH, {EXIT}}));
    EXPECT_EQ(std::string(primaryDataBlock), "\n\r" + table_now());
}

} // namespace

// The monitoring loop end to end over the recording platform: the control file in the platform's
// data directory, fake commands first on PATH for every check (a quiet host unless a test says
// otherwise), a fake /proc for the CPU accounting, a stepped clock through the loop's time seams,
// and a control block of the test's own.
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <sys/shm.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "capture/external_checks.h"
#include "capture/snapshot_file.h"
#include "core/control_block.h"
#include "core/control_file.h"
#include "core/monitor_loop.h"
#include "core/pass_figures.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "cpu/performance.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "fake_proc.h"
#include "fresh_monitor.h"
#include "logsvc.h"
#include "private_ipc.h"
#include "quiet_control_file.h"
#include "recording_platform.h"
#include "snapshot_stamp.h"
#include "storage/file_system.h"
#include "text_lines.h"

// Every kill of this program, the library's included (it calls the C library's kill through its
// dynamic symbol, which a host may stand in for): recorded, then sent.
std::vector<std::pair<pid_t, int>> kills_sent;

extern "C" int kill(pid_t pid, int signal) noexcept {
    kills_sent.emplace_back(pid, signal);
    return static_cast<int>(syscall(SYS_kill, pid, signal));
}

namespace {

using snapshot_stamp::fixed_clock;
using snapshot_stamp::STAMP;

using fake::fake_commands;
using text::lines;

constexpr uint16_t SLASH_SPACE = 0xE136; // "/" above its space threshold

const std::string PLAIN_OPENING(PLAIN_SNAPSHOT_OPENING);
const std::string PLAIN_CLOSING(PLAIN_SNAPSHOT_CLOSING);
const std::string PROBLEM_OPENING(PROBLEM_SNAPSHOT_OPENING);
const std::string PROBLEM_CLOSING(PROBLEM_SNAPSHOT_CLOSING);

// What the quiet host's commands print.
const std::string PS_QUIET = "    1     1  1000  20000  3000 init            00:00:01\n";
const std::string FREE_QUIET =
    "               total        used        free      shared  buff/cache   available\n"
    "Mem:         1000000      200000      600000        1000      200000      700000\n"
    "Swap:              0           0           0\n";
// 950 KB of 1,000,000 in use: 95.0 %.
const std::string FREE_FULL =
    "               total        used        free      shared  buff/cache   available\n"
    "Mem:         1000000      900000       10000        1000       40000       50000\n"
    "Swap:              0           0           0\n";
const std::string MEMINFO = "MemTotal:        1000000 kB\nMemFree:          600000 kB\n";
const std::string FILE_NR = "1000\t0\t100000\n";
const std::string LSMON = "/proc/1/fd:\ntotal 0\nlrwx------ 1 root root 64 Nov 24 02:00 0 -> "
                          "/dev/null\n\n";

std::string df_space(int slash_percent, int extra_percent = 10) {
    return "Filesystem     Type      Size  Used Avail Use% Mounted on\n"
           "/dev/vda1      ext4       20G   10G   10G " +
           std::to_string(slash_percent) +
           "% /\n"
           "/dev/vdb1      ext4       20G   10G   10G " +
           std::to_string(extra_percent) + "% /extra\n";
}
const std::string DF_INODES = "Filesystem      Inodes  IUsed   IFree IUse% Mounted on\n"
                              "/dev/vda1      1310720 123456 1187264   10% /\n";

std::string ps_line(int pid, int rss) {
    std::string text = std::to_string(pid);
    text = std::string(5 - std::min<size_t>(5, text.size()), ' ') + text;
    std::string tid = text;
    std::string size = std::to_string(rss);
    return text + " " + tid + " " + size + "  20000  3000 victim          00:00:01\n";
}

// A df that prints `space` for "df -h -l -T" and `inodes` for "df --inodes -l".
std::string df_script(const std::string &space, const std::string &inodes = DF_INODES) {
    return "#!/bin/sh\nif [ \"$1\" = -h ]; then printf '%s' '" + space + "'; else printf '%s' '" +
           inodes + "'; fi\n";
}

class MonitorLoop : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        fresh_monitor::reset();
        tree.emplace(1000, 100);
        tree->set_cpus(1);
        tree->set_process(1, "init", 1, 1);
        set_ps(PS_QUIET);
        fakes.add_printing("free", FREE_QUIET);
        fakes.add("cat", "#!/bin/sh\ncase \"$1\" in\n/proc/meminfo) printf '%s' '" + MEMINFO +
                             "' ;;\n/proc/sys/fs/file-nr) printf '%s' '" + FILE_NR +
                             "' ;;\n*) exec /bin/cat \"$@\" ;;\nesac\n");
        set_df(df_space(10));
        set_run_as_root();
        uptime_source = [] { return now; };
        one_second_sleep = [] {
            now += step;
            ++sleeps;
            if (on_sleep) {
                on_sleep(sleeps);
            }
        };
        now = 1000;
        step = 1;
        sleeps = 0;
        on_sleep = nullptr;
    }

    void TearDown() override {
        uptime_source = saved_uptime;
        one_second_sleep = saved_sleep;
        on_sleep = nullptr;
        snapshot_clock = time;
        if (!key_is_ours) {
            return;
        }
        free_compiled_expressions();
        delete_process_list(&process_list);
        tree.reset();
        private_ipc::remove_control_block();
    }

    void set_ps(const std::string &listing) { fakes.add_printing("ps", listing); }
    void set_df(const std::string &space, const std::string &inodes = DF_INODES) {
        fakes.add("df", df_script(space, inodes));
    }
    // lsmon.sh's listing, telvzstba's dump, and nothing from the listing and clean-up runs.
    void set_run_as_root() {
        fakes.add("runAsRoot", "#!/bin/sh\ncase \"$1\" in\nlsmon.sh) printf '%s' '" + LSMON +
                                   "' ;;\ntelvzstba) echo dumped; echo trace > '" +
                                   rec::data_dir() + "/'\"$3\" ;;\nesac\nexit 0\n");
    }

    void write_control(const std::string &text) { rec::write_data_file("telvzopt.trm", text); }

    uint32_t run_monitor(const std::vector<std::string> &arguments) {
        std::vector<std::string> words = {"telvzmnd"};
        words.insert(words.end(), arguments.begin(), arguments.end());
        std::vector<char *> argv;
        for (std::string &word : words) {
            argv.push_back(word.data());
        }
        argv.push_back(nullptr);
        return tarn_mon_main(static_cast<int32_t>(words.size()), argv.data());
    }

    // The monitor for one pass, as a host asks with a third argument.
    uint32_t run_once(const std::string &interval = "60") {
        return run_monitor({interval, "once"});
    }

    // The monitor for `passes` passes: the last sleep asks the loop to end, which the pass after
    // it sees.
    uint32_t run_passes(int passes, const std::string &interval = "5") {
        int sleeps_a_pass = std::stoi(interval);
        on_sleep = [passes, sleeps_a_pass](int count) {
            if (count == (passes - 1) * sleeps_a_pass && TARN_CB_PTR != nullptr) {
                TARN_CB_PTR->terminateRequest = 1;
            }
        };
        return run_monitor({interval});
    }

    static bool control_block_exists() {
        return shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0) != -1;
    }

    static int count_of(const std::string &text, const std::string &part) {
        int count = 0;
        for (size_t at = text.find(part); at != std::string::npos;
             at = text.find(part, at + part.size())) {
            ++count;
        }
        return count;
    }

    std::string snapshots() const { return rec::read_data_file(SNAPSHOT_FILE_NAME); }

    static std::vector<const rec::Event *> events_of(uint16_t reason) {
        std::vector<const rec::Event *> found;
        for (const rec::Event &event : rec::events()) {
            if (event.record.reason_code == reason) {
                found.push_back(&event);
            }
        }
        return found;
    }

    // Indexes of the trace lines equal to `line`.
    static std::vector<int> trace_indexes(const std::string &line) {
        std::vector<int> found;
        for (int at = rec::find_trace(line); at != -1; at = rec::find_trace(line, at + 1)) {
            found.push_back(at);
        }
        return found;
    }

    bool key_is_ours = false;
    std::optional<fake::fake_proc> tree;
    fake_commands fakes;
    long (*saved_uptime)() = uptime_source;
    void (*saved_sleep)() = one_second_sleep;

    static inline long now = 0;
    static inline long step = 1;
    static inline int sleeps = 0;
    static inline std::function<void(int)> on_sleep;
};

// ---- Start ----

struct interval_case {
    const char *argument; // null: none given
    int32_t interval;
};

class MonitorLoopInterval : public MonitorLoop,
                            public ::testing::WithParamInterface<interval_case> {};

TEST_P(MonitorLoopInterval, ArgumentSetsTheIntervalAndShortOnesBecomeSixty) {
    const interval_case &c = GetParam();
    uint32_t src = c.argument != nullptr ? run_monitor({c.argument}) : run_monitor({});
    EXPECT_EQ(src, 0u);
    lines expected = {"TARNMNDF:    argc = " + std::to_string(c.argument != nullptr ? 2 : 1),
                      "TARNMNDF:    argv[0] = >telvzmnd<"};
    if (c.argument != nullptr) {
        const std::string argument = c.argument;
        expected.push_back("TARNMNDF:    argv[1] = >" + argument + "<");
        expected.push_back("TARNMNDF:    input parm: checking_interval = " + argument);
        expected.push_back("TARNMNDF:    checking_interval Point 0010 = " +
                           std::to_string(std::atoi(c.argument)) + " seconds");
    }
    expected.push_back("TARNMNDF:    checking_interval = " + std::to_string(c.interval) +
                       " seconds");
    expected.push_back("TARNMNDF:    runOnce = FALSE");
    // No control file: the monitor ends at once, without a word to anybody.
    expected.push_back("TARNMNDF:    System Return Code: 0");
    EXPECT_EQ(rec::traces(), expected);
    EXPECT_EQ(checking_interval, c.interval);
    EXPECT_EQ(manualStart, c.argument != nullptr ? 1 : 0);
    EXPECT_TRUE(rec::events().empty());
    EXPECT_FALSE(control_block_exists());
}

INSTANTIATE_TEST_SUITE_P(Arguments, MonitorLoopInterval,
                         ::testing::Values(interval_case{"3", 60}, interval_case{"5", 5},
                                           interval_case{"4", 60}, interval_case{"abc", 60},
                                           interval_case{"-7", 60}, interval_case{nullptr, 60}));

TEST_F(MonitorLoop, IntervalFromTheHostMakesTheControlFilesLineChangeNothing) {
    write_control(quiet_control::text({{"CHECKING_INTERVAL", "30"}}));
    run_passes(2, "7");
    EXPECT_EQ(checking_interval, 7);
    EXPECT_EQ(trace_indexes("TARNMNDF: about to sleep for 7 seconds").size(), 1u);
    EXPECT_EQ(trace_indexes("TARNMNDF: inside while loop").size(), 2u);
    EXPECT_EQ(sleeps, 7);
}

TEST_F(MonitorLoop, ControlFileSetsTheIntervalWithoutAnArgument) {
    write_control(quiet_control::text({{"CHECKING_INTERVAL", "6"}}));
    on_sleep = [](int count) {
        if (count == 1) {
            TARN_CB_PTR->terminateRequest = 1;
        }
    };
    run_monitor({});
    EXPECT_EQ(trace_indexes("TARNMNDF: about to sleep for 6 seconds").size(), 1u);
    EXPECT_EQ(sleeps, 6); // the sleep does not look at the request; the pass after it does
}

TEST_F(MonitorLoop, ThreeArgumentsRunOnePassAndEndWithoutSleeping) {
    write_control(quiet_control::text({}));
    EXPECT_EQ(run_once(), 0u);
    EXPECT_EQ(trace_indexes("TARNMNDF: inside while loop").size(), 1u);
    EXPECT_NE(rec::find_trace("TARNMNDF:    runOnce = TRUE"), -1);
    EXPECT_EQ(sleeps, 0);
    EXPECT_EQ(rec::find_trace("TARNMNDF: about to sleep for 60 seconds"), -1);
    EXPECT_EQ(rec::traces().back(), "TARNMNDF:    System Return Code: 0");
    EXPECT_EQ(rec::open_data_files(), 0);
}

// ---- Reading and validating the control file ----

TEST_F(MonitorLoop, ControlFileOfOneByteIsAReadFailure) {
    write_control("A");
    EXPECT_EQ(run_once(), 0u);
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, RC_CONTROL_FILE_READ);
    EXPECT_NE(rec::find_trace("TARNMNDF: Error on filesvc_random_read"), -1);
    EXPECT_EQ(rec::find_trace("TARNMNDF: Everything ok to run"), -1);
    EXPECT_EQ(rec::open_data_files(), 0); // closed in the ending all the same
    EXPECT_FALSE(control_block_exists());
}

TEST_F(MonitorLoop, FailedReadIsReportedWithItsCrc) {
    write_control(quiet_control::text({}));
    rec::fail(rec::Call::random_read, 2, 0x55);
    run_once();
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, RC_CONTROL_FILE_READ);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0x55u);
}

TEST_F(MonitorLoop, FailedCloseIsReportedAndReturned) {
    write_control(quiet_control::text({}));
    rec::fail(rec::Call::close_file, 2, 0x66);
    EXPECT_EQ(run_once(), REPORT_RESULT);
    ASSERT_FALSE(events_of(RC_CONTROL_FILE_CLOSE).empty());
    EXPECT_EQ(events_of(RC_CONTROL_FILE_CLOSE)[0]->record.comp_rc, 0x66u);
    EXPECT_NE(rec::find_trace("TARNMNDF: Error on filesvc_close_file"), -1);
    EXPECT_EQ(rec::traces().back(), "TARNMNDF:    System Return Code: 8");
}

TEST_F(MonitorLoop, FileWithoutActuallyRunEndsSilently) {
    std::string text = quiet_control::text({});
    text.erase(0, std::string("ACTUALLY_RUN\n").size());
    write_control(text);
    EXPECT_EQ(run_once(), 0u);
    EXPECT_TRUE(rec::events().empty());
    EXPECT_FALSE(control_block_exists());
}

struct validation_case {
    const char *keyword;
    const char *value;
    bool runs;
};

class MonitorLoopValidation : public MonitorLoop,
                              public ::testing::WithParamInterface<validation_case> {};

TEST_P(MonitorLoopValidation, RuleDecidesSilentlyWhetherTheMonitorStarts) {
    const validation_case &c = GetParam();
    write_control(quiet_control::text({{c.keyword, c.value}}));
    EXPECT_EQ(run_once(), 0u);
    EXPECT_EQ(rec::find_trace("TARNMNDF: Everything ok to run") != -1, c.runs);
    EXPECT_EQ(control_block_exists(), c.runs);
    if (!c.runs) {
        EXPECT_TRUE(rec::events().empty());
        EXPECT_EQ(rec::find_trace("TARNMNDF: inside while loop"), -1);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Rules, MonitorLoopValidation,
    ::testing::Values(validation_case{"RESUME_JAVA_LOG_ON_PERCENT", "99", false},
                      validation_case{"RESUME_MEMORY_PERCENT_THRESHOLD", "901", false},
                      validation_case{"PP_FILE_DESCRIPTORS_THRESHOLD", "2", true},
                      validation_case{"PP_FILE_DESCRIPTORS_THRESHOLD", "1", false},
                      validation_case{"CPU_TIME_THRESHOLD", "1", true},
                      validation_case{"CPU_TIME_THRESHOLD", "0", false},
                      validation_case{"LOW_FREE_SIZE", "1", true},
                      validation_case{"LOW_FREE_SIZE", "0", false},
                      validation_case{"DASD_PERCENT_VAR_WQN_LOG_INODE_THRESHOLD", "10", false},
                      validation_case{"CPU_SLEEP_TIME_THRESHOLD", "", false}),
    [](const ::testing::TestParamInfo<validation_case> &info) {
        return std::string(info.param.keyword) + "_" +
               (info.param.value[0] != '\0' ? info.param.value : std::string("missing"));
    });

// ---- Passes ----

TEST_F(MonitorLoop, QuietPassFindsNothingAndWritesItsPlainSnapshot) {
    write_control(quiet_control::text({{"SNAPSHOT_INTERVAL", "1"}}));
    EXPECT_EQ(run_once(), 0u);
    EXPECT_TRUE(rec::events().empty());
    for (const rec::Event &event : rec::events()) {
        ADD_FAILURE() << std::hex << event.record.reason_code << std::dec << " "
                      << event.record.comp_rc << " " << event.attachment.substr(0, 300);
    }
    EXPECT_NE(rec::find_trace("TARNMNDD: takeLogCrc = 0 (dec)"), -1);
    ASSERT_NE(TARN_CB_PTR, nullptr);
    EXPECT_EQ(TARN_CB_PTR->tookLog, 0u);
    EXPECT_EQ(TARN_CB_PTR->numLoopsBeforeCPUChecking, 10); // 11 at start, one pass counted
    const std::string file = snapshots();
    ASSERT_EQ(file.rfind(PLAIN_OPENING + "\n\r" + STAMP, 0), 0u) << file.substr(0, 300);
    EXPECT_EQ(file.substr(file.size() - PLAIN_CLOSING.size() - 2), PLAIN_CLOSING + "\n\r");
    // The pass's data, check by check.
    for (const char *section : {"About to output ps data", "About to output free data",
                                "About to output cat /proc/meminfo", "About to output df",
                                "About to output ls data", "name: (init)"}) {
        EXPECT_NE(file.find(section), std::string::npos) << section;
    }
    EXPECT_EQ(count_of(file, PLAIN_OPENING), 1);
    EXPECT_EQ(count_of(file, PROBLEM_OPENING), 0);
    EXPECT_STREQ(oldPSDataBlock, newPSDataBlock);
    // What stays is the CPU history, kept for the life of the monitor.
    delete_process_list(&process_list);
    EXPECT_EQ(rec::live_allocations(), std::vector<std::string>{});
}

TEST_F(MonitorLoop, FindingWritesTheProblemSnapshotRaisesItsEventAndHoldsBackTheNext) {
    write_control(quiet_control::text({}));
    set_df(df_space(95)); // "/" by space: 950 over 900
    run_passes(2);

    ASSERT_EQ(rec::events().size(), 1u);
    const rec::Event &event = rec::events()[0];
    EXPECT_EQ(event.record.reason_code, SLASH_SPACE);
    EXPECT_EQ(event.record.comp_rc, 950u);
    EXPECT_EQ(event.record.option, LOGSVC_REPORT_ERROR + LOGSVC_DATA_ATTACHED);
    ASSERT_TRUE(event.has_attachment);
    // The second pass finds the same and is held back: 0x10000, no snapshot, tookLog kept.
    EXPECT_EQ(
        trace_indexes("TARNMNDD: takeLogCrc = " + std::to_string(SLASH_SPACE) + " (dec)").size(),
        1u);
    EXPECT_EQ(trace_indexes("TARNMNDD: takeLogCrc = 65536 (dec)").size(), 1u);
    EXPECT_EQ(TARN_CB_PTR->tookLog, 1u);

    const std::string file = snapshots();
    EXPECT_EQ(count_of(file, PROBLEM_OPENING), 1);
    ASSERT_EQ(file.rfind(PROBLEM_OPENING + "\n\r" + STAMP, 0), 0u);
    // The snapshot and the attachment carry the same pass's data: the error text (none from the
    // file system check), then the data, whose first byte the event sees as a blank.
    const size_t data_at = PROBLEM_OPENING.size() + 2 + STAMP.size() + 2;
    const size_t closing_at = file.find("\n\r" + PROBLEM_CLOSING);
    ASSERT_NE(closing_at, std::string::npos);
    const std::string data = file.substr(data_at, closing_at - data_at);
    const std::string ending = "end of data \n\r";
    ASSERT_GT(event.attachment.size(), ending.size());
    EXPECT_EQ(event.attachment.substr(event.attachment.size() - ending.size()), ending);
    EXPECT_EQ(event.attachment.substr(1, event.attachment.size() - ending.size() - 1),
              data.substr(1));
    EXPECT_EQ(event.attachment[0], ' ');
    EXPECT_EQ(file.substr(PROBLEM_OPENING.size() + 2 + STAMP.size(), 2), "\n\r");
}

TEST_F(MonitorLoop, CleanPassAfterAFindingReArmsReporting) {
    write_control(quiet_control::text({}));
    set_df(df_space(95));
    on_sleep = [this](int count) {
        if (count == 5) {
            set_df(df_space(10));
        }
        if (count == 10) {
            set_df(df_space(95));
        }
        if (count == 15) {
            TARN_CB_PTR->terminateRequest = 1;
        }
    };
    run_monitor({"5"});
    // Found, clean, found again, found and held back.
    EXPECT_EQ(events_of(SLASH_SPACE).size(), 2u);
    EXPECT_EQ(count_of(snapshots(), PROBLEM_OPENING), 2);
}

// A process that records the signals it is sent, until the one that ends it.
class signal_recorder {
  public:
    signal_recorder() {
        EXPECT_EQ(pipe(pipe_), 0);
        pid_ = fork();
        if (pid_ == 0) {
            close(pipe_[0]);
            write_end = pipe_[1];
            struct sigaction action {};
            action.sa_handler = [](int signal) {
                char number = static_cast<char>(signal);
                (void)!write(write_end, &number, 1);
            };
            sigaction(SIGABRT, &action, nullptr);
            sigaction(SIGSEGV, &action, nullptr);
            char ready = 0;
            (void)!write(write_end, &ready, 1);
            for (;;) {
                pause();
            }
        }
        close(pipe_[1]);
        char ready = 1;
        EXPECT_EQ(read(pipe_[0], &ready, 1), 1);
    }
    ~signal_recorder() {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
        close(pipe_[0]);
    }
    signal_recorder(const signal_recorder &) = delete;
    signal_recorder &operator=(const signal_recorder &) = delete;

    pid_t pid() const { return pid_; }
    // The signals it recorded, and the one that ended it (0 while it lives).
    std::pair<std::string, int> outcome() {
        int status = 0;
        int ended = 0;
        if (waitpid(pid_, &status, 0) == pid_ && WIFSIGNALED(status)) {
            ended = WTERMSIG(status);
        }
        std::string recorded;
        char number = 0;
        while (read(pipe_[0], &number, 1) == 1) {
            recorded += std::to_string(number) + " ";
        }
        return {recorded, ended};
    }

  private:
    static inline int write_end = -1;
    int pipe_[2] = {-1, -1};
    pid_t pid_ = 0;
};

TEST_F(MonitorLoop, ProcessOverItsAbortLimitIsKilledWithAbortSegmentationFaultAndKill) {
    write_control(quiet_control::text({}));
    signal_recorder victim;
    set_ps(PS_QUIET + ps_line(victim.pid(), 2600000));
    kills_sent.clear();
    run_once();
    ASSERT_EQ(events_of(RC_PROCESS_RSS_ABORT).size(), 1u);
    EXPECT_NE(rec::find_trace("TARNMNDF: going to kill process " + std::to_string(victim.pid()) +
                              " (dec)"),
              -1);
    EXPECT_NE(rec::find_trace("TARNMNDF: about to kill process " + std::to_string(victim.pid()) +
                              " (dec)"),
              -1);
    // The signals as the library sent them, through the C library's kill that this program
    // stands in for; then what reached the victim: 6 and 11 may still be pending when 9 ends it,
    // and those that arrived came in order.
    EXPECT_EQ(kills_sent,
              (std::vector<std::pair<pid_t, int>>{
                  {victim.pid(), SIGABRT}, {victim.pid(), SIGSEGV}, {victim.pid(), SIGKILL}}));
    auto [recorded, ended] = victim.outcome();
    EXPECT_EQ(std::string("6 11 ").rfind(recorded, 0), 0u) << recorded;
    EXPECT_EQ(ended, SIGKILL);
}

TEST_F(MonitorLoop, AbortFindingWithoutAPidKillsNothing) {
    write_control(quiet_control::text({}));
    set_ps(PS_QUIET + ps_line(0, 2600000));
    kills_sent.clear();
    run_once();
    EXPECT_TRUE(kills_sent.empty());
    ASSERT_EQ(events_of(RC_PROCESS_RSS_ABORT).size(), 1u);
    EXPECT_EQ(count_of(snapshots(), PROBLEM_OPENING), 1);
    EXPECT_TRUE(rec::traces_starting("TARNMNDF: going to kill").empty());
    EXPECT_TRUE(rec::traces_starting("TARNMNDF: about to kill").empty());
}

TEST_F(MonitorLoop, FullExtraIsInformationOnceAndNeverHoldsBackLaterReports) {
    write_control(quiet_control::text({}));
    set_df(df_space(10, 95));
    run_passes(2);
    const auto extra = events_of(RC_EXTRA_PARTITION_SPACE);
    ASSERT_EQ(extra.size(), 1u); // the second pass stays silent until /extra was below again
    EXPECT_EQ(extra[0]->record.option, LOGSVC_REPORT_INFORMATIONAL + LOGSVC_DATA_ATTACHED);
    EXPECT_NE(rec::find_trace("TARNMNDF:setting the log info as TRUE"), -1);
    EXPECT_NE(rec::find_trace("TARNMNDF:setting the log info as False && extraSRC flag as true"),
              -1);
    EXPECT_EQ(TARN_CB_PTR->tookLog, 0u);
    EXPECT_EQ(TARN_CB_PTR->logAsInfo, 0u);
    EXPECT_EQ(extraFileSystemSRCOn, 1);
}

TEST_F(MonitorLoop, FullExtraIsReportedAgainAfterItWasBelowItsThreshold) {
    write_control(quiet_control::text({}));
    set_df(df_space(10, 95));
    // Full, full (silent), below, full again; then a full "/" in the same pass as a full /extra
    // is reported at once, since the information never set tookLog.
    on_sleep = [this](int count) {
        if (count == 10) {
            set_df(df_space(10, 50));
        }
        if (count == 15) {
            set_df(df_space(10, 95));
        }
        if (count == 20) {
            set_df(df_space(95, 95));
            TARN_CB_PTR->terminateRequest = 1;
        }
    };
    run_monitor({"5"});
    EXPECT_EQ(trace_indexes("TARNMNDF: inside while loop").size(), 5u);
    EXPECT_EQ(events_of(RC_EXTRA_PARTITION_SPACE).size(), 2u);
    ASSERT_EQ(events_of(SLASH_SPACE).size(), 1u);
    EXPECT_EQ(events_of(SLASH_SPACE)[0]->record.option, LOGSVC_REPORT_ERROR + LOGSVC_DATA_ATTACHED);
    EXPECT_EQ(rec::events().back().record.reason_code, SLASH_SPACE);
}

TEST_F(MonitorLoop, PlainSnapshotsComeAtTheirIntervalWithTrendAnalysisBeforeThem) {
    write_control(
        quiet_control::text({{"SNAPSHOT_INTERVAL", "3"}, {"TREND_ANALYSIS_POINTS", "2"}}));
    run_passes(9);
    EXPECT_EQ(count_of(snapshots(), PLAIN_OPENING), 3);
    const std::vector<int> passes = trace_indexes("TARNMNDF: inside while loop");
    const std::vector<int> outputs = trace_indexes("TARNMNDF: Output snapshot data");
    const std::vector<int> trends = trace_indexes("TARNMNDF: Perform trend analysis");
    ASSERT_EQ(passes.size(), 9u);
    ASSERT_EQ(outputs.size(), 3u);
    ASSERT_EQ(trends.size(), 3u);
    for (int i = 0; i < 3; ++i) {
        const int pass = 3 * i + 2; // passes 3, 6 and 9
        EXPECT_GT(outputs[static_cast<size_t>(i)], passes[static_cast<size_t>(pass)]);
        EXPECT_GT(trends[static_cast<size_t>(i)], passes[static_cast<size_t>(pass)]);
        EXPECT_LT(trends[static_cast<size_t>(i)], outputs[static_cast<size_t>(i)]);
        if (pass + 1 < 9) {
            EXPECT_LT(outputs[static_cast<size_t>(i)], passes[static_cast<size_t>(pass + 1)]);
        }
    }
}

TEST_F(MonitorLoop, SnapshotIntervalOfZeroWritesNoPlainSnapshotAndNoTrend) {
    write_control(
        quiet_control::text({{"SNAPSHOT_INTERVAL", "0"}, {"TREND_ANALYSIS_POINTS", "2"}}));
    run_passes(3);
    EXPECT_EQ(count_of(snapshots(), PLAIN_OPENING), 0);
    EXPECT_TRUE(trace_indexes("TARNMNDF: Perform trend analysis").empty());
}

// ---- Each check's findings through the whole pass ----

struct finding_case {
    const char *name;
    std::map<std::string, std::string> settings;
    std::function<void(fake_commands &)> host; // what the host's commands print instead
    uint16_t code;
    uint32_t value;
};

class MonitorLoopFinding : public MonitorLoop,
                           public ::testing::WithParamInterface<finding_case> {};

TEST_P(MonitorLoopFinding, FindingIsReportedWithItsCodeValueAndErrorText) {
    const finding_case &c = GetParam();
    write_control(quiet_control::text(c.settings));
    c.host(fakes);
    run_once();
    ASSERT_EQ(rec::events().size(), 1u) << std::hex << rec::events()[0].record.reason_code;
    const rec::Event &event = rec::events()[0];
    EXPECT_EQ(event.record.reason_code, c.code) << std::hex << event.record.reason_code;
    EXPECT_EQ(event.record.comp_rc, c.value);
    // The attachment opens with the finding's error text, which the loop copied for the event.
    const std::string error_text = topLogDataBlock;
    EXPECT_EQ(event.attachment.substr(0, error_text.size()), error_text);
    // Staging consumed the error text itself: its first byte is NUL, the rest is the copy's.
    EXPECT_EQ(topDataBlock[0], '\0');
    EXPECT_EQ(std::string(topLogDataBlock + 1, TOP_DATA_BLOCK_SIZE - 1),
              std::string(topDataBlock + 1, TOP_DATA_BLOCK_SIZE - 1));
    const std::string file = snapshots();
    EXPECT_EQ(file.rfind(PROBLEM_OPENING + "\n\r" + STAMP + error_text + "\n\r", 0), 0u);
    EXPECT_EQ(TARN_CB_PTR->tookLog, 1u);
}

INSTANTIATE_TEST_SUITE_P(
    Checks, MonitorLoopFinding,
    ::testing::Values(
        finding_case{
            "ProcessRss",
            {},
            [](fake_commands &f) { f.add_printing("ps", PS_QUIET + ps_line(4242, 1500000)); },
            RC_PROCESS_RSS,
            1500000},
        finding_case{"TooManyProcesses",
                     {{"NUM_THREADS_THRESHOLD", "11"}},
                     [](fake_commands &f) {
                         std::string listing;
                         for (int pid = 100; pid < 113; ++pid) {
                             listing += ps_line(pid, 1000);
                         }
                         f.add_printing("ps", listing);
                     },
                     RC_TOO_MANY_PROCESSES,
                     13},
        finding_case{"MemoryInUse",
                     {},
                     [](fake_commands &f) { f.add_printing("free", FREE_FULL); },
                     RC_MEMORY_IN_USE,
                     950},
        finding_case{"SwapTooSmall",
                     {{"MIN_SWAP_SIZE", "100"}},
                     [](fake_commands &) {},
                     RC_SWAP_TOO_SMALL,
                     0},
        finding_case{"KnownPartitionInodes",
                     {},
                     [](fake_commands &f) {
                         f.add("df", df_script(df_space(10),
                                               "Filesystem      Inodes  IUsed   IFree IUse% "
                                               "Mounted on\n/dev/vda1      1310720 123456 "
                                               "1187264   95% /\n"));
                     },
                     0xE146,
                     950},
        finding_case{"OtherPartitionSpace",
                     {},
                     [](fake_commands &f) {
                         f.add("df", df_script(df_space(10) +
                                               "/dev/vdc1      ext4       20G   10G   10G  "
                                               "95% /srv\n"));
                     },
                     RC_OTHER_PARTITION_SPACE,
                     950},
        finding_case{"SystemDescriptors",
                     {},
                     [](fake_commands &f) {
                         f.add("cat", "#!/bin/sh\ncase \"$1\" in\n/proc/sys/fs/file-nr) "
                                      "printf '90000\\t0\\t100000\\n' ;;\n*) printf '%s' '" +
                                          MEMINFO + "' ;;\nesac\n");
                     },
                     RC_SYSTEM_DESCRIPTORS,
                     900},
        finding_case{"ProcessDescriptors",
                     {{"PP_FILE_DESCRIPTORS_THRESHOLD", "2"}},
                     [](fake_commands &) {},
                     RC_PROCESS_DESCRIPTORS,
                     3}),
    [](const ::testing::TestParamInfo<finding_case> &info) { return info.param.name; });

// ---- External routines ----

char *overflowing_text = nullptr;

void returns_nothing(const char *, char **returnedData) {
    *returnedData = nullptr;
}

void returns_too_much(const char *, char **returnedData) {
    *returnedData = overflowing_text;
}

std::string framed(const std::string &name, const std::string &text) {
    return "  \n\rAbout to output data from function " + name + " \n\r" + text +
           "  \n\rDone outputting data from function " + name + " \n\r";
}

TEST_F(MonitorLoop, ExternalRoutinesHaveTheirTextFramedAndOneReturningNothingAddsNothing) {
    rec::register_function("telvzmnd", "tarn_external_check2",
                           reinterpret_cast<void *>(&tarn_external_check2));
    rec::register_function("testmod", "returns_nothing",
                           reinterpret_cast<void *>(&returns_nothing));
    write_control(quiet_control::text({{"SNAPSHOT_INTERVAL", "1"}},
                                      "EXTERNAL_CHECKING_ROUTINE testmod returns_nothing\n"
                                      "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check2\n"));
    run_once();
    const std::string file = snapshots();
    const std::string message = "Message 2 returned data \n\r Second line of Message 2\n\r";
    EXPECT_EQ(count_of(file, framed("tarn_external_check2", message + "\n\r")), 1) << file;
    EXPECT_NE(rec::find_trace("TARNMNDF: about to call returns_nothing"), -1);
    EXPECT_EQ(file.find("function returns_nothing"), std::string::npos);
    EXPECT_NE(rec::find_trace("TARNMNDF: length of caller's data is 53"), -1);
    EXPECT_NE(rec::find_trace("TARNMNDF: num_external_calls = 2"), -1);
    EXPECT_EQ(rec::calls(rec::Call::release_func_addr), 2);
}

TEST_F(MonitorLoop, TextLongerThanTheRoomLeftGivesTheOverflowLineOnceAndLaterRoutinesTheirFrame) {
    std::string too_much(1600000, 'x');
    overflowing_text = too_much.data();
    rec::register_function("testmod", "returns_too_much",
                           reinterpret_cast<void *>(&returns_too_much));
    rec::register_function("telvzmnd", "tarn_external_check3",
                           reinterpret_cast<void *>(&tarn_external_check3));
    write_control(quiet_control::text({{"SNAPSHOT_INTERVAL", "1"}},
                                      "EXTERNAL_CHECKING_ROUTINE testmod returns_too_much\n"
                                      "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check3\n"));
    run_once();
    overflowing_text = nullptr;
    const std::string file = snapshots();
    EXPECT_EQ(count_of(file, framed("returns_too_much", "No room to output more lines... \n\r")),
              1);
    EXPECT_EQ(count_of(file, "No room to output more lines..."), 1);
    // The frame's lines gave room back: the next routine's text fits again.
    EXPECT_EQ(count_of(file, framed("tarn_external_check3",
                                    "Message 3 returned data \n\r Second line of Message 3\n\r"
                                    "\n\r")),
              1);
    EXPECT_EQ(file.find("xxxxxxxx"), std::string::npos);
}

// ---- The sleep and its drift ----

TEST_F(MonitorLoop, SleepThatOverrunsIsCutShortAndReportedByTheNextPass) {
    write_control(quiet_control::text({}));
    step = 1;
    on_sleep = [](int count) {
        if (count == 1) {
            TARN_CB_PTR->numLoopsBeforeCPUChecking = 0;
        }
        if (count == 10) {
            now += 10; // ten seconds slept, twenty passed
            TARN_CB_PTR->terminateRequest = 1;
        }
    };
    run_monitor({"60"});
    EXPECT_EQ(sleeps, 10);
    EXPECT_NE(rec::find_trace("TARNMNDF: max sleep time is 66 (dec)"), -1);
    EXPECT_NE(rec::find_trace("TARNMNDF: anticipated sleep time is 70 (dec)"), -1);
    EXPECT_NE(rec::find_trace("TARNMNDF: TARN_CB_PTR->sleep_time_percent Point 0020 is 700 (dec)"),
              -1);
    EXPECT_EQ(telvzmnd_sleep_time, 70);
    const auto overrun = events_of(RC_SLEEP_OVERRUN);
    ASSERT_EQ(overrun.size(), 1u);
    EXPECT_EQ(overrun[0]->record.comp_rc, 700u);
    EXPECT_NE(rec::find_trace("TARNMNDF:     The actual sleep time was 70 seconds instead of the "
                              "expected 66 seconds"),
              -1);
    EXPECT_EQ(TARN_CB_PTR->sleepTimeExceeded, 0u);
}

TEST_F(MonitorLoop, NoDriftIsFlaggedWhileTheCountdownRuns) {
    write_control(quiet_control::text({}));
    step = 2;
    on_sleep = [](int count) {
        if (count == 60) {
            TARN_CB_PTR->terminateRequest = 1;
        }
    };
    run_monitor({"60"});
    EXPECT_EQ(sleeps, 60);
    EXPECT_TRUE(rec::traces_starting("TARNMNDF: TARN_CB_PTR->sleep_time_percent").empty());
    EXPECT_EQ(TARN_CB_PTR->sleep_time_percent, -1);
    EXPECT_EQ(TARN_CB_PTR->maxSleepTime, 66);
    EXPECT_TRUE(events_of(RC_SLEEP_OVERRUN).empty());
}

} // namespace

namespace {

// ---- The figures of a pass ----

// Every pass's figures, as the observer was handed them.
std::vector<tarn_pass_figures> figures_seen;

void keep_figures(const tarn_pass_figures *figures, void *context) {
    static_cast<std::vector<tarn_pass_figures> *>(context)->push_back(*figures);
}

class MonitorLoopFigures : public MonitorLoop {
  protected:
    void SetUp() override {
        MonitorLoop::SetUp();
        figures_seen.clear();
        tarn_observe_passes(keep_figures, &figures_seen);
    }
    void TearDown() override {
        tarn_observe_passes(nullptr, nullptr);
        MonitorLoop::TearDown();
    }

    // The figures of `mount_point` in a pass; null when the pass has none.
    static const tarn_partition_figures *partition(const tarn_pass_figures &figures,
                                                   const std::string &mount_point) {
        for (uint32_t i = 0; i < figures.partition_count; ++i) {
            if (figures.partitions[i].mount_point == mount_point) {
                return &figures.partitions[i];
            }
        }
        return nullptr;
    }
};

TEST_F(MonitorLoopFigures, EachPassHandsTheObserverWhatItsChecksComputedAndWhatItFound) {
    write_control(quiet_control::text({}));
    set_df(df_space(95)); // "/" by space: 950 over 900, reported, then held back
    // One second of the machine's time a sleep; init uses a fifth of it as user, a tenth as kernel.
    on_sleep = [this](int count) {
        tree->advance(100);
        if (count == 5) {
            tree->set_process(1, "init", 1 + 100, 1 + 50);
            TARN_CB_PTR->terminateRequest = 1;
        }
    };
    step = 2; // each second of the sleep takes two
    run_monitor({"5"});
    ASSERT_EQ(figures_seen.size(), 2u);

    const tarn_pass_figures &first = figures_seen[0];
    EXPECT_EQ(first.pass, 1u);
    EXPECT_EQ(first.reason_code, SLASH_SPACE);
    EXPECT_EQ(first.finding_held_back, 0u);
    EXPECT_EQ(first.memory_known, 1u);
    EXPECT_EQ(first.memory_tenths, 200); // 200,000 KB of 1,000,000 in use
    EXPECT_EQ(first.descriptors_known, 1u);
    EXPECT_EQ(first.descriptors_tenths, 10); // 1,000 handles of 100,000
    EXPECT_EQ(first.cpu_known, 0u);          // no sample before the first
    EXPECT_EQ(first.sleep_known, 0u);        // no sleep before the first
    EXPECT_GT(first.duration_ns, 0u);
    ASSERT_EQ(first.partition_count, 2u);
    EXPECT_STREQ(first.partitions[0].mount_point, "/");
    EXPECT_EQ(first.partitions[0].space_tenths, 950);
    EXPECT_EQ(first.partitions[0].inodes_tenths, 100);
    EXPECT_STREQ(first.partitions[1].mount_point, "/extra");
    EXPECT_EQ(first.partitions[1].space_tenths, 100);
    EXPECT_EQ(first.partitions[1].inodes_tenths, TARN_FIGURE_NONE); // no inode line for it
    EXPECT_EQ(first.partition_lines_dropped, 0u);

    const tarn_pass_figures &second = figures_seen[1];
    EXPECT_EQ(second.pass, 2u);
    EXPECT_EQ(second.reason_code, 0);
    EXPECT_EQ(second.finding_held_back, 1u);
    EXPECT_EQ(second.cpu_known, 1u);
    EXPECT_EQ(second.cpu_user_percent, 20.0f);
    EXPECT_EQ(second.cpu_kernel_percent, 10.0f);
    EXPECT_EQ(second.sleep_known, 1u);
    EXPECT_EQ(second.sleep_seconds, 10); // five seconds asked, ten taken
    EXPECT_EQ(second.sleep_interval, 5);
    EXPECT_EQ(second.partition_count, 2u);
    EXPECT_EQ(rec::events().size(), 1u);
}

TEST_F(MonitorLoopFigures, FiguresThatNoCommandGaveAreLeftUnknown) {
    write_control(quiet_control::text({}));
    fakes.add("free", "#!/bin/sh\nexit 1\n");
    fakes.add("cat", "#!/bin/sh\nexit 1\n");
    // The headings, a line too short to name its partition, and a file system without inodes.
    set_df("Filesystem     Type      Size  Used Avail Use% Mounted on\n"
           "/dev/vda1      ext4       20G\n",
           "Filesystem      Inodes  IUsed   IFree IUse% Mounted on\n"
           "tmpfs               0      0       0     - /run\n");
    EXPECT_EQ(run_once(), 0u);
    ASSERT_EQ(figures_seen.size(), 1u);
    const tarn_pass_figures &only = figures_seen[0];
    EXPECT_EQ(only.memory_known, 0u);
    EXPECT_EQ(only.descriptors_known, 0u);
    EXPECT_EQ(only.partition_count, 0u);
    EXPECT_EQ(only.reason_code, 0);
    EXPECT_EQ(only.finding_held_back, 0u);
}

TEST_F(MonitorLoopFigures, PartitionsBeyondTheTableAreCountedAndLongMountPointsCut) {
    write_control(quiet_control::text({}));
    std::string space = "Filesystem     Type      Size  Used Avail Use% Mounted on\n";
    std::string inodes = "Filesystem      Inodes  IUsed   IFree IUse% Mounted on\n";
    const std::string long_name = "/" + std::string(300, 'm');
    space += "/dev/long ext4 1G 1G 0G 7% " + long_name + "\n";
    for (uint32_t i = 0; i < TARN_PARTITIONS_KEPT + 2; ++i) {
        space += "/dev/p" + std::to_string(i) + " ext4 1G 1G 0G 1% /p" + std::to_string(i) + "\n";
    }
    // The inode run lists them the other way round, and repeats one.
    for (uint32_t i = TARN_PARTITIONS_KEPT + 2; i-- > 0;) {
        inodes += "/dev/p" + std::to_string(i) + " 10 3 7 30% /p" + std::to_string(i) + "\n";
    }
    inodes += "/dev/p5 10 4 6 40% /p5\n";
    set_df(space, inodes);
    EXPECT_EQ(run_once(), 0u);
    ASSERT_EQ(figures_seen.size(), 1u);
    const tarn_pass_figures &only = figures_seen[0];
    ASSERT_EQ(only.partition_count, TARN_PARTITIONS_KEPT);
    // The words of a line are cut at 249 characters before any figure is taken of them.
    EXPECT_EQ(std::string(only.partitions[0].mount_point), long_name.substr(0, 249));
    EXPECT_EQ(only.partitions[0].space_tenths, 70);
    EXPECT_EQ(only.partitions[0].inodes_tenths, TARN_FIGURE_NONE);
    // 63 of the 66 fit after it: three space lines and three inode lines left out.
    EXPECT_EQ(only.partition_lines_dropped, 6u);
    const tarn_partition_figures *p5 = partition(only, "/p5");
    ASSERT_NE(p5, nullptr);
    EXPECT_EQ(p5->space_tenths, 10);
    EXPECT_EQ(p5->inodes_tenths, 400); // the later line of the same partition
    const tarn_partition_figures *p62 = partition(only, "/p62");
    ASSERT_NE(p62, nullptr);
    EXPECT_EQ(p62->inodes_tenths, 300);
    EXPECT_EQ(partition(only, "/p63"), nullptr);
}

TEST_F(MonitorLoopFigures, AnObserverTakenAwayIsNotCalledAndAReplacedOneNoMore) {
    write_control(quiet_control::text({}));
    std::vector<tarn_pass_figures> other;
    tarn_observe_passes(keep_figures, &other);
    EXPECT_EQ(run_once(), 0u);
    EXPECT_EQ(other.size(), 1u);
    EXPECT_TRUE(figures_seen.empty());
    tarn_observe_passes(nullptr, nullptr);
    fresh_monitor::reset();
    write_control(quiet_control::text({}));
    EXPECT_EQ(run_once(), 0u);
    EXPECT_EQ(other.size(), 1u);
    EXPECT_TRUE(figures_seen.empty());
}

// ---- Stopping, and a long run ----

TEST_F(MonitorLoop, TarnmonStopFromAnotherProcessEndsTheLoopAfterTheNextPass) {
    write_control(quiet_control::text({}));
    char data_dir[] = "/tmp/tarn-stop-XXXXXX";
    ASSERT_NE(mkdtemp(data_dir), nullptr);
    const std::string command = "TELV_DATA_DIR=" + std::string(data_dir) + " '" +
                                std::getenv("TARN_BUILD_DIR") + "/tarnmon' stop >/dev/null";
    int status = -1;
    on_sleep = [&command, &status](int count) {
        if (count == 1) {
            status = std::system(command.c_str());
        }
    };
    run_monitor({"5"});
    std::filesystem::remove_all(data_dir);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(sleeps, 5); // the sleep runs on; the pass after it sees the request
    EXPECT_EQ(trace_indexes("TARNMNDF: inside while loop").size(), 2u);
}

// Open descriptors of this process.
int open_descriptors() {
    int count = 0;
    for ([[maybe_unused]] const auto &entry :
         std::filesystem::directory_iterator("/proc/self/fd")) {
        ++count;
    }
    return count;
}

TEST_F(MonitorLoop, ThousandPassesLeaveNoAllocationDescriptorOrChildBehind) {
    write_control(quiet_control::text({{"SNAPSHOT_INTERVAL", "10"}, {"TREND_ANALYSIS_POINTS", "4"}},
                                      "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check1\n"));
    rec::register_function("telvzmnd", "tarn_external_check1",
                           reinterpret_cast<void *>(&tarn_external_check1));
    const int descriptors = open_descriptors();
    EXPECT_EQ(run_passes(1000), 0u);
    EXPECT_EQ(trace_indexes("TARNMNDF: inside while loop").size(), 1000u);
    EXPECT_EQ(count_of(snapshots(), PLAIN_OPENING) > 0, true);
    EXPECT_TRUE(rec::events().empty());
    delete_process_list(&process_list);
    EXPECT_EQ(rec::live_allocations(), std::vector<std::string>{});
    EXPECT_EQ(open_descriptors(), descriptors);
    EXPECT_EQ(rec::open_data_files(), 0);
    errno = 0;
    EXPECT_EQ(waitpid(-1, nullptr, WNOHANG), -1);
    EXPECT_EQ(errno, ECHILD);
}

} // namespace

// tarnmon status, stop, alerts, events, limits and overrides, run as separate processes against a
// real control block in a private IPC namespace; the command line every command shares; tarnmon
// snapshots over files that no monitor wrote.
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <spawn.h>
#include <sstream>
#include <sys/ipc.h>
#include <sys/prctl.h>
#include <sys/sem.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "capture/snapshot_file.h"
#include "core/control_block.h"
#include "data_blocks.h"
#include "private_ipc.h"
#include "run_command.h"

namespace {

std::string tarnmon() {
    return std::string(std::getenv("TARN_BUILD_DIR")) + "/tarnmon";
}

// A program that runs while the test looks at it: its standard input and output are pipes of the
// test, its standard error is kept for when it has ended.
class background {
  public:
    explicit background(const std::vector<std::string> &argv) {
        int in[2], out[2], err[2];
        if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) {
            return;
        }
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, in[0], 0);
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        posix_spawn_file_actions_adddup2(&actions, err[1], 2);
        std::vector<char *> args;
        for (const auto &a : argv) {
            args.push_back(const_cast<char *>(a.c_str()));
        }
        args.push_back(nullptr);
        if (posix_spawn(&pid, args[0], &actions, nullptr, args.data(), environ) != 0) {
            pid = -1;
        }
        posix_spawn_file_actions_destroy(&actions);
        close(in[0]);
        close(out[1]);
        close(err[1]);
        input = in[1];
        output = fdopen(out[0], "r");
        errors = err[0];
    }
    ~background() { finish(); }

    // The next line it printed, without its line feed; empty at the end.
    std::string line() {
        char text[256] = "";
        if (output == nullptr || std::fgets(text, sizeof text, output) == nullptr) {
            return "";
        }
        std::string read = text;
        if (!read.empty() && read.back() == '\n') {
            read.pop_back();
        }
        return read;
    }

    // Closes its standard input and waits for it; its exit status, as run_command gives it.
    int finish() {
        if (input != -1) {
            close(input);
            input = -1;
        }
        if (pid != -1) {
            int status = 0;
            waitpid(pid, &status, 0);
            exit_status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
            pid = -1;
        }
        if (output != nullptr) {
            std::fclose(output);
            output = nullptr;
        }
        if (errors != -1) {
            char buffer[4096];
            ssize_t n;
            while ((n = read(errors, buffer, sizeof buffer)) > 0) {
                err.append(buffer, static_cast<size_t>(n));
            }
            close(errors);
            errors = -1;
        }
        return exit_status;
    }

    pid_t pid = -1;
    std::string err; // once it has ended
  private:
    int input = -1;
    FILE *output = nullptr;
    int errors = -1;
    int exit_status = -1;
};

class Tarnmon : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        char pattern[] = "/tmp/tarnmon-test-XXXXXX";
        data_dir = mkdtemp(pattern);
        setenv("TELV_DATA_DIR", data_dir.c_str(), 1);
        unsetenv("TELV_EVENT_LOG");
        unsetenv("TELV_TRACE_FILE");
    }
    void TearDown() override {
        if (block != nullptr) {
            shmdt(block);
        }
        if (id != -1) {
            shmctl(id, IPC_RMID, nullptr);
        }
        if (lock != -1) {
            semctl(lock, 0, IPC_RMID);
        }
        std::filesystem::remove_all(data_dir);
    }

    // A block as a running monitor leaves it; of another size, a segment of some other program
    // under the monitor's key, which `block` then only holds the address of.
    void create_block(size_t size = TARN_CB_SIZE) {
        id = shmget(static_cast<key_t>(TARN_CB_KEY), size, IPC_CREAT | 0666);
        ASSERT_NE(id, -1);
        block = static_cast<tarn_control_block *>(shmat(id, nullptr, 0));
        ASSERT_NE(block, reinterpret_cast<void *>(-1));
    }

    // The semaphore set that guards the override table, unlocked, as the monitor leaves it.
    void create_lock() {
        lock = semget(static_cast<key_t>(TARN_CB_KEY), 1, IPC_CREAT | 0666);
        ASSERT_NE(lock, -1);
        ASSERT_EQ(semctl(lock, 0, SETVAL, 0), 0);
        block->uBufferLock = lock;
    }

    bool table_is_empty() const {
        const auto *bytes = reinterpret_cast<const unsigned char *>(block->override_table);
        return std::all_of(bytes, bytes + sizeof block->override_table,
                           [](unsigned char b) { return b == 0; });
    }

    std::string event_log() {
        std::ifstream in(data_dir + "/telvzmnd.events");
        std::ostringstream text;
        text << in.rdbuf();
        return text.str();
    }

    std::string data_dir;
    int id = -1;
    int lock = -1;
    tarn_control_block *block = nullptr;
};

TEST_F(Tarnmon, StatusWithoutAMonitorSaysSo) {
    command_result r = run_command({tarnmon(), "status"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err,
              "tarnmon: no monitor has created its control block (key 0x96728017) on this host\n");
}

TEST_F(Tarnmon, StatusPrintsTheNineFieldsByName) {
    create_block();
    block->analysisIndex = 5;
    block->numLoopsBeforeCPUChecking = 11;
    block->tookLog = 1;
    block->maxSleepTime = 66;
    block->sleep_time_percent = -1;
    block->uBufferLock = 3;
    command_result r = run_command({tarnmon(), "status"});
    EXPECT_EQ(r.status, 0) << r.err;
    std::istringstream lines(r.out);
    std::string line;
    std::getline(lines, line);
    EXPECT_EQ(line.rfind("control block 0x96728017: id ", 0), 0u) << line;
    const std::pair<const char *, const char *> expected[] = {
        {"analysisIndex", "5"}, {"sleepTimeExceeded", "0"}, {"numLoopsBeforeCPUChecking", "11"},
        {"tookLog", "1"},       {"maxSleepTime", "66"},     {"sleep_time_percent", "-1"},
        {"uBufferLock", "3"},   {"terminateRequest", "0"},  {"logAsInfo", "0"},
    };
    for (const auto &[name, value] : expected) {
        ASSERT_TRUE(std::getline(lines, line));
        std::istringstream words(line);
        std::string field, number;
        words >> field >> number;
        EXPECT_EQ(field, name);
        EXPECT_EQ(number, value) << name;
    }
    EXPECT_FALSE(std::getline(lines, line));
}

TEST_F(Tarnmon, StatusRefusesASegmentOfAnotherSize) {
    create_block(100);
    command_result r = run_command({tarnmon(), "status"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has 100 "
                     "bytes, not 2940036\n");
}

TEST_F(Tarnmon, StopLeavesALargerSegmentAlone) {
    create_block(4000000);
    command_result status = run_command({tarnmon(), "status"});
    EXPECT_EQ(status.status, 3);
    EXPECT_EQ(status.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has "
                          "4000000 bytes, not 2940036\n");
    command_result stop = run_command({tarnmon(), "stop"});
    EXPECT_EQ(stop.status, 3);
    EXPECT_EQ(stop.out, "");
    EXPECT_EQ(stop.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has "
                        "4000000 bytes, not 2940036; the request was logged only\n");
    // Where terminateRequest would stand in a control block.
    const auto *bytes = reinterpret_cast<const unsigned char *>(block);
    for (size_t i = 2940028; i < 2940032; ++i) {
        EXPECT_EQ(bytes[i], 0) << i;
    }
}

TEST_F(Tarnmon, StatusDoesNotWriteTheBlock) {
    create_block();
    std::memset(block, 0x5A, TARN_CB_SIZE);
    EXPECT_EQ(run_command({tarnmon(), "status"}).status, 0);
    const auto *bytes = reinterpret_cast<const unsigned char *>(block);
    for (size_t i = 0; i < TARN_CB_SIZE; ++i) {
        ASSERT_EQ(bytes[i], 0x5A) << i;
    }
}

TEST_F(Tarnmon, StopSetsTheRequestAndLogsIt) {
    create_block();
    command_result r = run_command({tarnmon(), "stop"});
    EXPECT_EQ(r.status, 0) << r.out << r.err;
    EXPECT_EQ(r.out, "termination requested: the monitor ends after its current pass\n");
    EXPECT_EQ(block->terminateRequest, 1u);
    std::string log = event_log();
    EXPECT_NE(log.find("\"reason\":\"0xE170\""), std::string::npos) << log;
    EXPECT_NE(log.find("\"severity\":\"informational\""), std::string::npos) << log;
}

TEST_F(Tarnmon, StopWithoutAMonitorStillLogsTheRequest) {
    command_result r = run_command({tarnmon(), "stop"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: no monitor has created its control block (key 0x96728017) on this "
                     "host; the request was logged only\n");
    EXPECT_NE(event_log().find("\"reason\":\"0xE170\""), std::string::npos);
}

TEST_F(Tarnmon, UsageAndHelp) {
    command_result none = run_command({tarnmon()});
    EXPECT_EQ(none.status, 2);
    EXPECT_NE(none.err.find("usage: tarnmon COMMAND [ARGS]"), std::string::npos);
    command_result help = run_command({tarnmon(), "--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("check-config [FILE]"), std::string::npos);
    EXPECT_NE(help.out.find("exit status: 0 fine, 1 finding, 2 usage error, 3 not available"),
              std::string::npos);
    command_result unknown = run_command({tarnmon(), "frobnicate"});
    EXPECT_EQ(unknown.status, 2);
    EXPECT_NE(unknown.err.find("tarnmon: unknown command 'frobnicate'"), std::string::npos);
    EXPECT_EQ(run_command({tarnmon(), "status", "extra"}).status, 2);
    EXPECT_EQ(run_command({tarnmon(), "stop", "extra"}).status, 2);
}

TEST_F(Tarnmon, EveryCommandTakesHelpAndRefusesWhatItDoesNotKnow) {
    for (std::string name :
         {"status", "stop", "check-config", "snapshots", "limits", "overrides"}) {
        command_result help = run_command({tarnmon(), name, "--help"});
        EXPECT_EQ(help.status, 0) << name;
        EXPECT_EQ(help.out.rfind("usage: tarnmon " + name, 0), 0u) << help.out;
        EXPECT_NE(help.out.find("\nexit status: 0 fine, 1 finding, 2 usage error, 3 not "
                                "available\n"),
                  std::string::npos)
            << help.out;
        EXPECT_EQ(help.err, "") << name;
        for (const char *wrong : {"--bogus", "-x", "-"}) {
            command_result r = run_command({tarnmon(), name, wrong});
            EXPECT_EQ(r.status, 2) << name << " " << wrong;
            EXPECT_EQ(r.out, "") << name << " " << wrong;
            EXPECT_EQ(r.err.rfind("usage: tarnmon " + name, 0), 0u) << r.err;
        }
    }
    // Neither a request for help nor a refused command line reaches the monitor.
    EXPECT_EQ(event_log(), "");
}

TEST_F(Tarnmon, HelpOfACommandIsItsUsageAndSummary) {
    command_result r = run_command({tarnmon(), "status", "--help"});
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.out, "usage: tarnmon status\n"
                     "show the control block of a running monitor\n\n"
                     "exit status: 0 fine, 1 finding, 2 usage error, 3 not available\n");
}

// tarnmon limits and overrides.

const std::string LIMITS_USAGE = "usage: tarnmon limits [--rss KB] [--dsiz KB] [--vsize KB] "
                                 "[--rss-abort KB] [--dsiz-abort KB] [--vsize-abort KB] -- "
                                 "COMMAND [ARGS]\n";
const std::string OVERRIDES_HEADING = "override table of control block 0x96728017: ";

// The lines of a listing of overrides, after its first: a heading and one row per entry, in
// columns that each row pads to the widest of its cells.
std::string overrides_table(const std::vector<std::vector<std::string>> &rows) {
    std::vector<std::vector<std::string>> all = {{"entry", "pid", "rss", "dsiz", "vsize",
                                                  "rss-abort", "dsiz-abort", "vsize-abort", "seen",
                                                  "command"}};
    all.insert(all.end(), rows.begin(), rows.end());
    std::vector<size_t> widths(all[0].size(), 0);
    for (const auto &row : all) {
        for (size_t i = 0; i < row.size(); ++i) {
            widths[i] = std::max(widths[i], row[i].size());
        }
    }
    std::string text;
    for (const auto &row : all) {
        for (size_t i = 0; i + 1 < row.size(); ++i) {
            text += std::string(widths[i] - row[i].size(), ' ') + row[i] + "  ";
        }
        text += row.back() + "\n";
    }
    return text;
}

std::string own_command_name() {
    std::ifstream in("/proc/self/comm");
    std::string name;
    std::getline(in, name);
    return name;
}

TEST_F(Tarnmon, LimitsStoresTheLimitsUnderThePidOfTheCommandItRuns) {
    create_block();
    create_lock();
    background sh({tarnmon(), "limits", "--rss", "100", "--dsiz", "200", "--vsize-abort", "4194304",
                   "--", "/bin/sh", "-c", "echo $$; read wait; true"});
    std::string printed = sh.line();
    ASSERT_FALSE(printed.empty()) << "the command did not start";
    auto pid = static_cast<uint32_t>(std::stoul(printed));
    EXPECT_EQ(pid, static_cast<uint32_t>(sh.pid)); // tarnmon's own pid, kept by the exec
    const override_entry &entry = block->override_table[0];
    EXPECT_EQ(entry.pid, pid);
    EXPECT_EQ(entry.rss_limit, 100u);
    EXPECT_EQ(entry.dsiz_limit, 200u);
    EXPECT_EQ(entry.vsize_limit, 0u);
    EXPECT_EQ(entry.rss_abort_limit, 0u);
    EXPECT_EQ(entry.dsiz_abort_limit, 0u);
    EXPECT_EQ(entry.vsize_abort_limit, 4194304u);
    EXPECT_EQ(entry.in_use, 1u);
    EXPECT_EQ(entry.seen, 0u);
    EXPECT_EQ(block->override_table[1].in_use, 0u);
    EXPECT_EQ(semctl(lock, 0, GETVAL), 0); // released before the exec

    command_result listed = run_command({tarnmon(), "overrides"});
    EXPECT_EQ(listed.status, 0) << listed.err;
    EXPECT_EQ(listed.err, "");
    std::vector<std::string> row = {"0", printed, "100", "200", "0", "0", "0", "4194304", "0"};
    row.push_back("sh");
    EXPECT_EQ(listed.out, OVERRIDES_HEADING +
                              "1 of 5000 entries in use (limits in KB, 0 = no override)\n" +
                              overrides_table({row}));

    EXPECT_EQ(sh.finish(), 0);
    EXPECT_EQ(sh.err, "");
    row.back() = "(gone)"; // until the monitor sweeps the entry of a pid it no longer lists
    EXPECT_EQ(run_command({tarnmon(), "overrides"}).out,
              OVERRIDES_HEADING + "1 of 5000 entries in use (limits in KB, 0 = no override)\n" +
                  overrides_table({row}));
    // Neither trace nor events went to the monitor's files.
    EXPECT_TRUE(std::filesystem::is_empty(data_dir));
}

TEST_F(Tarnmon, LimitsEndsAsTheCommandEnds) {
    create_block();
    create_lock();
    EXPECT_EQ(
        run_command({tarnmon(), "limits", "--rss", "1", "--", "/bin/sh", "-c", "exit 7"}).status,
        7);
    // Without "--" the command's own options are still its own.
    command_result r =
        run_command({tarnmon(), "limits", "--rss", "0", "/bin/sh", "-c", "echo $0 --rss"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "/bin/sh --rss\n");
    EXPECT_EQ(r.err, "");
    // Limits of 0 make an entry of zeros: the defaults of the control file apply, its per-name
    // rows no longer do.
    EXPECT_EQ(block->override_table[1].in_use, 1u);
    EXPECT_EQ(block->override_table[1].rss_limit, 0u);
}

TEST_F(Tarnmon, LimitsWithoutALimitOptionIsAUsageError) {
    create_block();
    create_lock();
    command_result r = run_command({tarnmon(), "limits", "--", "/bin/sh", "-c", "echo ran"});
    EXPECT_EQ(r.status, 2);
    EXPECT_EQ(r.out, "");
    EXPECT_TRUE(r.err.starts_with("tarnmon: limits needs at least one limit option\n")) << r.err;
    EXPECT_EQ(block->override_table[0].in_use, 0u);
}

TEST_F(Tarnmon, LimitsGivesTheCommandItsEnvironmentAndKeepsItsOwnTraceOutOfTheMonitorsFiles) {
    create_block();
    create_lock();
    std::string trace = data_dir + "/elsewhere.trace";
    setenv("TELV_TRACE_FILE", trace.c_str(), 1);
    command_result r = run_command({tarnmon(), "limits", "--rss", "5", "--", "/bin/sh", "-c",
                                    "echo \"[$TELV_TRACE_FILE][$TELV_EVENT_LOG]\""});
    unsetenv("TELV_TRACE_FILE");
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "[" + trace + "][]\n");
    EXPECT_TRUE(std::filesystem::is_empty(data_dir));
}

TEST_F(Tarnmon, LimitsRefusesAValueThatIsNotKilobytesInRange) {
    create_block();
    create_lock();
    auto refused = [&](const std::string &option, const std::string &value,
                       const std::string &shown) {
        command_result r =
            run_command({tarnmon(), "limits", option, value, "--", "/bin/echo", "ran"});
        EXPECT_EQ(r.status, 2) << option << " " << value;
        EXPECT_EQ(r.out, "");
        EXPECT_EQ(r.err, "tarnmon: " + option + " takes kilobytes in the range 0..4194304, not '" +
                             shown + "'\n" + LIMITS_USAGE);
    };
    for (std::string value :
         {"4194305", "-1", "99999999999999999999", "abc", "", "12k", "1.5", "+5", " 5", "0x10"}) {
        refused("--rss", value, value);
    }
    refused("--rss", "1\x1b[2J", "1\\x1b[2J");
    for (std::string option :
         {"--dsiz", "--vsize", "--rss-abort", "--dsiz-abort", "--vsize-abort"}) {
        refused(option, "4194305", "4194305");
    }
    EXPECT_TRUE(table_is_empty());
}

TEST_F(Tarnmon, LimitsWithoutACommandIsAUsageError) {
    for (std::vector<std::string> words :
         {std::vector<std::string>{"--rss", "100"}, {"--rss", "100", "--"}, {}}) {
        words.insert(words.begin(), {tarnmon(), "limits"});
        command_result r = run_command(words);
        EXPECT_EQ(r.status, 2);
        EXPECT_EQ(r.out, "");
        EXPECT_EQ(r.err, "tarnmon: limits needs a command to run\n" + LIMITS_USAGE);
    }
    command_result no_value = run_command({tarnmon(), "limits", "--rss"});
    EXPECT_EQ(no_value.status, 2);
    EXPECT_EQ(no_value.err, LIMITS_USAGE);
}

TEST_F(Tarnmon, LimitsWithoutAMonitorDoesNotRunTheCommand) {
    command_result r = run_command({tarnmon(), "limits", "--rss", "100", "--", "/bin/echo", "ran"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: no monitor has created its control block (key 0x96728017) on this "
                     "host; the command was not run\n");
    EXPECT_TRUE(std::filesystem::is_empty(data_dir));
}

TEST_F(Tarnmon, LimitsLeavesASegmentOfAnotherSizeAloneAndDoesNotRunTheCommand) {
    create_block(4000000);
    command_result r = run_command({tarnmon(), "limits", "--rss", "100", "--", "/bin/echo", "ran"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has "
                     "4000000 bytes, not 2940036; the command was not run\n");
    const auto *bytes = reinterpret_cast<const unsigned char *>(block);
    EXPECT_TRUE(std::all_of(bytes, bytes + 4000000, [](unsigned char b) { return b == 0; }));
}

TEST_F(Tarnmon, LimitsOfAFullTableAreRefusedAndTheCommandIsNotRun) {
    create_block();
    create_lock();
    for (uint32_t i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        block->override_table[i] = {1000000 + i, 1, 2, 3, 4, 5, 6, 1, 0};
    }
    std::vector<override_entry> before(block->override_table,
                                       block->override_table + OVERRIDE_TABLE_ENTRIES);
    command_result r = run_command({tarnmon(), "limits", "--rss", "100", "--", "/bin/echo", "ran"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: the override table is full: all 5000 entries are in use; the "
                     "command was not run\n");
    EXPECT_EQ(std::memcmp(before.data(), block->override_table, sizeof block->override_table), 0);
    EXPECT_EQ(semctl(lock, 0, GETVAL), 0);
    EXPECT_TRUE(std::filesystem::is_empty(data_dir)); // the report went nowhere too
}

TEST_F(Tarnmon, LimitsThatCannotTakeTheLockAreNotStoredAndTheCommandIsNotRun) {
    create_block();
    create_lock();
    block->uBufferLock = 0x7ffffff0; // no such set
    command_result r = run_command({tarnmon(), "limits", "--rss", "100", "--", "/bin/echo", "ran"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: the limits did not reach the override table (src 0, crc 0): its "
                     "lock could not be taken, or the control block went away; the command was "
                     "not run\n");
    EXPECT_TRUE(table_is_empty());
}

TEST_F(Tarnmon, LimitsOfACommandThatCannotRunAreRemovedAgain) {
    create_block();
    create_lock();
    command_result missing =
        run_command({tarnmon(), "limits", "--rss", "100", "--", "/nonexistent/program", "x"});
    EXPECT_EQ(missing.status, 127);
    EXPECT_EQ(missing.out, "");
    EXPECT_EQ(missing.err, "tarnmon: cannot run /nonexistent/program: No such file or directory; "
                           "its limits were removed again\n");
    EXPECT_TRUE(table_is_empty());

    command_result not_on_path =
        run_command({tarnmon(), "limits", "--rss", "100", "--", "tarnmon-no-such-program"});
    EXPECT_EQ(not_on_path.status, 127);
    EXPECT_TRUE(table_is_empty());

    std::string plain = data_dir + "/plain";
    std::ofstream(plain) << "echo ran\n"; // not executable
    command_result refused = run_command({tarnmon(), "limits", "--dsiz", "7", "--", plain});
    EXPECT_EQ(refused.status, 126);
    EXPECT_EQ(refused.out, "");
    EXPECT_EQ(refused.err, "tarnmon: cannot run " + plain +
                               ": Permission denied; its limits were removed again\n");
    EXPECT_TRUE(table_is_empty());
    EXPECT_EQ(semctl(lock, 0, GETVAL), 0);
}

TEST_F(Tarnmon, OverridesListsTheEntriesInUseInAlignedColumns) {
    create_block();
    create_lock();
    auto own = static_cast<uint32_t>(getpid());
    block->override_table[3] = {own, 100, 0, 0, 4194304, 0, 0, 1, 1};
    block->override_table[4] = {own + 1, 9, 9, 9, 9, 9, 9, 0, 0}; // not in use
    block->override_table[5] = {2, 9, 9, 9, 9, 9, 9, 2, 0};       // nor this: in use is 1
    // Words of any size that another process may have written are shown as they are.
    block->override_table[4999] = {4294967295u, 4294967295u, 1, 2, 3, 4, 5, 1, 0};
    command_result r = run_command({tarnmon(), "overrides"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.err, "");
    EXPECT_EQ(r.out, OVERRIDES_HEADING +
                         "2 of 5000 entries in use (limits in KB, 0 = no override)\n" +
                         overrides_table({{"3", std::to_string(own), "100", "0", "0", "4194304",
                                           "0", "0", "1", own_command_name()},
                                          {"4999", "4294967295", "4294967295", "1", "2", "3", "4",
                                           "5", "0", "(gone)"}}));
}

TEST_F(Tarnmon, OverridesShowsAControlCharacterOfACommandNameEscaped) {
    create_block();
    create_lock();
    block->override_table[0] = {static_cast<uint32_t>(getpid()), 1, 0, 0, 0, 0, 0, 1, 0};
    std::string name = own_command_name();
    ASSERT_EQ(prctl(PR_SET_NAME, "a\nb\tc\x7f"), 0);
    command_result r = run_command({tarnmon(), "overrides"});
    prctl(PR_SET_NAME, name.c_str());
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("  a\\x0ab\\x09c\\x7f\n"), std::string::npos) << r.out;
}

TEST_F(Tarnmon, OverridesOfAnEmptyTable) {
    create_block();
    command_result r = run_command({tarnmon(), "overrides"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out,
              OVERRIDES_HEADING + "0 of 5000 entries in use (limits in KB, 0 = no override)\n");
}

TEST_F(Tarnmon, OverridesNeitherWaitsForTheLockNorWritesTheBlock) {
    create_block();
    create_lock();
    block->override_table[0] = {1, 1, 0, 0, 0, 0, 0, 1, 0};
    ASSERT_EQ(semctl(lock, 0, SETVAL, 1), 0); // held, by a process that hangs
    std::vector<unsigned char> before(TARN_CB_SIZE);
    std::memcpy(before.data(), block, TARN_CB_SIZE);
    command_result r = run_command({tarnmon(), "overrides"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("1 of 5000 entries in use"), std::string::npos);
    EXPECT_EQ(std::memcmp(before.data(), block, TARN_CB_SIZE), 0);
    EXPECT_EQ(semctl(lock, 0, GETVAL), 1);
}

TEST_F(Tarnmon, OverridesWithoutAMonitorSaysSo) {
    command_result r = run_command({tarnmon(), "overrides"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err,
              "tarnmon: no monitor has created its control block (key 0x96728017) on this host\n");
    EXPECT_EQ(run_command({tarnmon(), "overrides", "extra"}).status, 2);
}

// tarnmon alerts and events.

const std::string ALERTS_USAGE = "usage: tarnmon alerts on|off|trigger\n";
const std::string EVENTS_USAGE = "usage: tarnmon events info|error\n";
const std::string ALERTS_ON = "CPU alerts on: CPU use and the monitor's sleep are judged again "
                              "from the 11th pass from now, and the next finding is reported\n";
const std::string ALERTS_OFF = "CPU alerts off for the next 59 passes: CPU use and the monitor's "
                               "sleep are judged again from the 60th pass from now\n";
const std::string ALERTS_TRIGGER = "sleep alert forced: the monitor ends its sleep within a "
                                   "second, and its next pass reports the alert\n";
const std::string EVENTS_INFO = "events of the monitor are informational from now on (until an "
                                "event of a full /extra, which sets them back to errors)\n";
const std::string EVENTS_ERROR = "events of the monitor are errors from now on\n";

// The nine fields at the end of the block, analysisIndex first.
std::array<uint32_t, 9> last_fields(const tarn_control_block *block) {
    std::array<uint32_t, 9> words;
    std::memcpy(words.data(), &block->analysisIndex, sizeof words);
    return words;
}

TEST_F(Tarnmon, AlertsTurnTheCpuAlertSwitchesOfTheBlockThroughTheLibrary) {
    create_block();
    block->numLoopsBeforeCPUChecking = 5;
    block->tookLog = 1;
    block->maxSleepTime = 66;
    block->sleep_time_percent = -1;
    auto said = [](const std::vector<std::string> &words, const std::string &message) {
        command_result r = run_command(words);
        EXPECT_EQ(r.status, 0) << r.err;
        EXPECT_EQ(r.out, message);
        EXPECT_EQ(r.err, "");
    };
    said({tarnmon(), "alerts", "off"}, ALERTS_OFF);
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 60);
    EXPECT_EQ(block->tookLog, 1u);
    said({tarnmon(), "alerts", "on"}, ALERTS_ON);
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 11);
    EXPECT_EQ(block->tookLog, 0u);
    block->tookLog = 1;
    said({tarnmon(), "alerts", "trigger"}, ALERTS_TRIGGER);
    EXPECT_EQ(block->sleep_time_percent, 0);
    EXPECT_EQ(block->maxSleepTime, 0);
    EXPECT_EQ(block->tookLog, 0u);
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 0);
    EXPECT_EQ(block->sleepTimeExceeded, 1u);
    // The library's own traces, in the monitor's trace file; no event.
    std::ifstream in(data_dir + "/telvzmnd.trace");
    std::ostringstream trace;
    trace << in.rdbuf();
    for (const char *name :
         {"tarn_disable_cpu_alerts", "tarn_enable_cpu_alerts", "tarn_trigger_cpu_alert04"}) {
        EXPECT_NE(
            trace.str().find(std::string("TARNOTHF: <-- ") + name + ", src = 0, crc = 0 (hex)"),
            std::string::npos)
            << name;
    }
    EXPECT_EQ(event_log(), "");
}

TEST_F(Tarnmon, EventsSetTheLoggingTypeOfTheBlock) {
    create_block();
    command_result info = run_command({tarnmon(), "events", "info"});
    EXPECT_EQ(info.status, 0) << info.err;
    EXPECT_EQ(info.out, EVENTS_INFO);
    EXPECT_EQ(block->logAsInfo, 1u);
    command_result error = run_command({tarnmon(), "events", "error"});
    EXPECT_EQ(error.status, 0) << error.err;
    EXPECT_EQ(error.out, EVENTS_ERROR);
    EXPECT_EQ(block->logAsInfo, 0u);
    EXPECT_EQ(event_log(), "");
}

TEST_F(Tarnmon, AlertsAndEventsWithoutAMonitorSaySoAndChangeNothing) {
    for (const char *word : {"on", "off", "trigger"}) {
        command_result r = run_command({tarnmon(), "alerts", word});
        EXPECT_EQ(r.status, 3) << word;
        EXPECT_EQ(r.out, "") << word;
        EXPECT_EQ(r.err, "tarnmon: no monitor has created its control block (key 0x96728017) on "
                         "this host; nothing was changed\n");
    }
    for (const char *word : {"info", "error"}) {
        command_result r = run_command({tarnmon(), "events", word});
        EXPECT_EQ(r.status, 3) << word;
        EXPECT_EQ(r.err, "tarnmon: no monitor has created its control block (key 0x96728017) on "
                         "this host; nothing was changed\n");
    }
    EXPECT_EQ(shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0), -1);
    // A segment of another program under the key is left as it is.
    create_block(TARN_CB_SIZE + 4);
    std::memset(block, 0x5A, TARN_CB_SIZE + 4);
    command_result r = run_command({tarnmon(), "alerts", "trigger"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has "
                     "2940040 bytes, not 2940036; nothing was changed\n");
    EXPECT_EQ(run_command({tarnmon(), "events", "info"}).status, 3);
    const auto *bytes = reinterpret_cast<const unsigned char *>(block);
    EXPECT_TRUE(
        std::all_of(bytes, bytes + TARN_CB_SIZE + 4, [](unsigned char b) { return b == 0x5A; }));
    EXPECT_EQ(event_log(), "");
}

TEST_F(Tarnmon, AlertsAndEventsRefuseAnyOtherWordWithTheirUsage) {
    create_block();
    const auto before = last_fields(block);
    auto refused = [](const std::vector<std::string> &words, const std::string &err) {
        command_result r = run_command(words);
        EXPECT_EQ(r.status, 2) << words.back();
        EXPECT_EQ(r.out, "") << words.back();
        EXPECT_EQ(r.err, err) << words.back();
    };
    refused({tarnmon(), "alerts"},
            "tarnmon: alerts needs one word: on, off or trigger\n" + ALERTS_USAGE);
    refused({tarnmon(), "alerts", "ON"},
            "tarnmon: alerts takes on, off or trigger, not 'ON'\n" + ALERTS_USAGE);
    refused({tarnmon(), "alerts", "info"},
            "tarnmon: alerts takes on, off or trigger, not 'info'\n" + ALERTS_USAGE);
    refused({tarnmon(), "alerts", "o\x1bn"},
            "tarnmon: alerts takes on, off or trigger, not 'o\\x1bn'\n" + ALERTS_USAGE);
    refused({tarnmon(), "alerts", "on", "off"}, ALERTS_USAGE);
    refused({tarnmon(), "alerts", "--on"}, ALERTS_USAGE);
    refused({tarnmon(), "events"},
            "tarnmon: events needs one word: info or error\n" + EVENTS_USAGE);
    refused({tarnmon(), "events", "informational"},
            "tarnmon: events takes info or error, not 'informational'\n" + EVENTS_USAGE);
    refused({tarnmon(), "events", "on"},
            "tarnmon: events takes info or error, not 'on'\n" + EVENTS_USAGE);
    refused({tarnmon(), "events", "info", "error"}, EVENTS_USAGE);
    refused({tarnmon(), "events", "-"}, EVENTS_USAGE);
    EXPECT_EQ(last_fields(block), before);
}

TEST_F(Tarnmon, AlertsAndEventsHelpIsTheirUsageAndSummary) {
    // Each command, its usage and summary, and its line in tarnmon's list of commands.
    const std::string helps[][3] = {
        {"alerts",
         ALERTS_USAGE + "switch the running monitor's CPU alerts on or off, or force its sleep "
                        "alert\n",
         "\n  alerts on|off|trigger  switch the running monitor's CPU alerts on or off, or force "
         "its sleep alert\n"},
        {"events",
         EVENTS_USAGE + "raise the running monitor's events as informational or as errors\n",
         "\n  events info|error      raise the running monitor's events as informational or as "
         "errors\n"},
    };
    std::string list = run_command({tarnmon(), "--help"}).out;
    for (const auto &[name, help, listed] : helps) {
        command_result r = run_command({tarnmon(), name, "--help"});
        EXPECT_EQ(r.status, 0) << name;
        EXPECT_EQ(r.out,
                  help + "\nexit status: 0 fine, 1 finding, 2 usage error, 3 not available\n");
        EXPECT_NE(list.find(listed), std::string::npos) << list;
    }
}

// tarnmon snapshots over files written here; no control block is involved.
class TarnmonSnapshots : public ::testing::Test {
  protected:
    void SetUp() override {
        char pattern[] = "/tmp/tarnmon-snapshots-XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir = pattern;
        setenv("TELV_DATA_DIR", dir.c_str(), 1);
    }
    void TearDown() override { std::filesystem::remove_all(dir); }

    command_result snapshots(const std::string &path) {
        return run_command({tarnmon(), "snapshots", "--file", path});
    }

    std::string dir;
};

// The most a snapshot file can hold: the largest size the control file can give it, and one flush
// of the staging buffer beyond it.
constexpr uint64_t BOUND = uint64_t{UINT32_MAX} + FILE_BUFFER_SIZE;

TEST_F(TarnmonSnapshots, ADeviceWithoutEndIsRefused) {
    command_result r = snapshots("/dev/zero");
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: cannot read /dev/zero: not a regular file\n");
}

TEST_F(TarnmonSnapshots, ADirectoryIsRefused) {
    command_result r = snapshots(dir);
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: cannot read " + dir + ": not a regular file\n");
}

TEST_F(TarnmonSnapshots, AFileLargerThanASnapshotFileCanBeIsNotRead) {
    std::string path = dir + "/telvzmnd.trm";
    int fd = open(path.c_str(), O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, static_cast<off_t>(BOUND + 1)), 0); // sparse: no data is written
    close(fd);
    command_result r = run_command({tarnmon(), "snapshots"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: cannot read " + path + ": it holds " + std::to_string(BOUND + 1) +
                         " bytes, more than a snapshot file can hold (" + std::to_string(BOUND) +
                         ")\n");
}

TEST_F(TarnmonSnapshots, AFailedOpenNamesTheFileAndTheError) {
    std::string plain = dir + "/plain";
    std::ofstream(plain) << "x";
    command_result r = snapshots(plain + "/telvzmnd.trm");
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err,
              "tarnmon: cannot open " + plain + "/telvzmnd.trm: " + std::strerror(ENOTDIR) + "\n");
}

TEST_F(TarnmonSnapshots, ARegularFileIsListed) {
    std::string path = dir + "/other.trm";
    std::string block = std::string(PLAIN_SNAPSHOT_OPENING) +
                        "\n\rLocal date and time = 5 March 2021 at 07:04:09 \n\rgathered\n\r" +
                        std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";
    std::ofstream(path, std::ios::binary) << block;
    command_result r = snapshots(path);
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out.rfind(path + ": " + std::to_string(block.size()) + " bytes, 1 block\n", 0), 0u)
        << r.out;
    EXPECT_NE(r.out.find("    1  plain "), std::string::npos) << r.out;
    EXPECT_EQ(r.err, "");
}

} // namespace

// tarnmon status, stop, alerts, events, limits and overrides, run as separate processes against a
// real control block in a private IPC namespace; the command line every command shares; tarnmon
// snapshots over files that no monitor wrote; the --json output of status, overrides and
// snapshots, and the JSON writer and its string escaper.
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
#include <iterator>
#include <optional>
#include <random>
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
#include "json_value.h"
#include "json_writer.h"
#include "platform_test_support.h"
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
    EXPECT_EQ(r.out, "usage: tarnmon status [--json]\n"
                     "show the control block of a running monitor\n"
                     "  --json  print the same as one JSON document\n\n"
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

// tarnmon status, overrides and snapshots --json: one document on one line, read back by a strict
// reader and held against the text of the same state, field by field.

// The document that a command printed; a test failure and a null when it is not one JSON document
// on one line.
json_value json_of(const command_result &r) {
    EXPECT_TRUE(r.out.ends_with('\n') && r.out.find('\n') == r.out.size() - 1) << r.out;
    std::string problem;
    std::optional<json_value> document = parse_json(r.out, &problem);
    EXPECT_TRUE(document.has_value()) << problem << "\n" << r.out;
    return document.value_or(json_value{});
}

// A command run as text and with --json after its name, over the same state: the JSON form must
// succeed quietly.
struct both_forms {
    command_result text;
    command_result json;
    json_value document;
};

both_forms run_both(std::vector<std::string> words) {
    both_forms r;
    r.text = run_command(words);
    EXPECT_EQ(r.text.status, 0) << r.text.err;
    words.insert(words.begin() + 2, "--json");
    r.json = run_command(words);
    EXPECT_EQ(r.json.status, 0) << r.json.err;
    EXPECT_EQ(r.json.err, "");
    r.document = json_of(r.json);
    return r;
}

// A text as tarnmon's text forms show it: a "\n\r" line end as "\n", every other control
// character but tab as "\xhh".
std::string shown(const std::string &text) {
    std::string out;
    for (size_t i = 0; i < text.size(); ++i) {
        auto c = static_cast<unsigned char>(text[i]);
        if (c == '\n') {
            out += '\n';
            i += text.compare(i + 1, 1, "\r") == 0 ? 1 : 0;
        } else if ((c < 0x20 && c != '\t') || c == 0x7f) {
            char escaped[5];
            std::snprintf(escaped, sizeof escaped, "\\x%02x", c);
            out += escaped;
        } else {
            out += static_cast<char>(c);
        }
    }
    return out;
}

std::string hex(int64_t number) {
    char text[32];
    std::snprintf(text, sizeof text, "0x%08llx", static_cast<unsigned long long>(number));
    return text;
}

using names = std::vector<std::string>;

TEST_F(Tarnmon, StatusJsonHoldsWhatTheTextShows) {
    create_block();
    block->analysisIndex = 5;
    block->sleepTimeExceeded = 4294967295u;
    block->numLoopsBeforeCPUChecking = -2147483647 - 1;
    block->sleep_time_percent = -1;
    block->uBufferLock = 3;
    auto [text, json, doc] = run_both({tarnmon(), "status"});
    EXPECT_EQ(doc.keys(), (names{"key", "id", "bytes", "attached_processes", "fields"}));
    std::vector<std::string> lines = platform_test::lines_of(text.out);
    ASSERT_EQ(lines.size(), 10u) << text.out;
    EXPECT_EQ(lines[0], "control block " + hex(doc["key"].integer()) + ": id " + doc["id"].number +
                            ", " + doc["bytes"].number + " bytes, attached by " +
                            doc["attached_processes"].number + " process(es)");
    ASSERT_EQ(doc["fields"].items.size(), 9u);
    for (size_t i = 0; i < 9; ++i) {
        std::istringstream words(lines[i + 1]);
        std::string name, number, meaning;
        words >> name >> number >> std::ws;
        std::getline(words, meaning);
        const json_value &field = doc["fields"][i];
        EXPECT_EQ(field.keys(), (names{"name", "value", "meaning"}));
        EXPECT_EQ(field["name"].text, name);
        EXPECT_EQ(field["value"].type, json_value::kind::number);
        EXPECT_EQ(field["value"].number, number) << name;
        EXPECT_EQ(field["meaning"].text, meaning);
    }
    EXPECT_EQ(doc["fields"][1]["value"].integer(), 4294967295);
    EXPECT_EQ(doc["fields"][2]["value"].integer(), -2147483648);
}

TEST_F(Tarnmon, OverridesJsonHoldsWhatTheTextShows) {
    create_block();
    create_lock();
    auto own = static_cast<uint32_t>(getpid());
    block->override_table[3] = {own, 100, 0, 0, 4194304, 0, 0, 1, 1};
    block->override_table[4] = {own + 1, 9, 9, 9, 9, 9, 9, 0, 0}; // not in use
    block->override_table[4999] = {4294967295u, 4294967295u, 1, 2, 3, 4, 5, 1, 0};
    auto [text, json, doc] = run_both({tarnmon(), "overrides"});
    EXPECT_EQ(doc.keys(), (names{"key", "in_use", "entries", "unit", "overrides"}));
    std::vector<std::string> lines = platform_test::lines_of(text.out);
    ASSERT_EQ(lines.size(), 4u) << text.out;
    EXPECT_EQ(lines[0], "override table of control block " + hex(doc["key"].integer()) + ": " +
                            doc["in_use"].number + " of " + doc["entries"].number +
                            " entries in use (limits in " + doc["unit"].text +
                            ", 0 = no override)");
    std::istringstream heading(lines[1]);
    names columns{std::istream_iterator<std::string>(heading), {}};
    ASSERT_EQ(doc["overrides"].items.size(), 2u);
    for (size_t row = 0; row < 2; ++row) {
        const json_value &entry = doc["overrides"][row];
        EXPECT_EQ(entry.keys(), columns);
        std::istringstream cells(lines[row + 2]);
        for (size_t column = 0; column + 1 < columns.size(); ++column) {
            std::string cell;
            cells >> cell;
            EXPECT_EQ(entry[columns[column]].type, json_value::kind::number);
            EXPECT_EQ(entry[columns[column]].number, cell) << columns[column];
        }
        std::string command;
        std::getline(cells, command);
        EXPECT_EQ("  " + shown(entry["command"].text), command);
    }
    EXPECT_EQ(doc["overrides"][0]["command"].text, own_command_name());
    EXPECT_EQ(doc["overrides"][1]["command"].text, "(gone)");
}

TEST_F(Tarnmon, OverridesJsonOfAnEmptyTable) {
    create_block();
    command_result r = run_command({tarnmon(), "overrides", "--json"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "{\"key\":2524086295,\"in_use\":0,\"entries\":5000,\"unit\":\"KB\","
                     "\"overrides\":[]}\n");
}

TEST_F(Tarnmon, OverridesJsonEscapesAHostileCommandName) {
    create_block();
    create_lock();
    block->override_table[0] = {static_cast<uint32_t>(getpid()), 1, 0, 0, 0, 0, 0, 1, 0};
    std::string name = own_command_name();
    ASSERT_EQ(prctl(PR_SET_NAME, "q\"\\\x01\xff\n\x1b"), 0);
    command_result r = run_command({tarnmon(), "overrides", "--json"});
    prctl(PR_SET_NAME, name.c_str());
    EXPECT_EQ(r.status, 0) << r.err;
    json_value doc = json_of(r);
    EXPECT_NE(r.out.find(R"("command":"q\"\\\u0001\u00ff\u000a\u001b"})"), std::string::npos)
        << r.out;
    // A byte that is not UTF-8 reads back as the character of its number.
    EXPECT_EQ(doc["overrides"][0]["command"].text, "q\"\\\x01\xc3\xbf\n\x1b");
}

TEST_F(Tarnmon, JsonWithoutAMonitorFailsAsTheText) {
    for (std::string name : {"status", "overrides"}) {
        command_result text = run_command({tarnmon(), name});
        command_result json = run_command({tarnmon(), name, "--json"});
        EXPECT_EQ(json.status, 3) << name;
        EXPECT_EQ(json.status, text.status) << name;
        EXPECT_EQ(json.out, "") << name;
        EXPECT_EQ(json.err, text.err) << name;
        EXPECT_EQ(run_command({tarnmon(), name, "--json", "extra"}).status, 2) << name;
    }
    create_block(100);
    command_result text = run_command({tarnmon(), "status"});
    command_result json = run_command({tarnmon(), "status", "--json"});
    EXPECT_EQ(json.status, 3);
    EXPECT_EQ(json.out, "");
    EXPECT_EQ(json.err, text.err);
}

TEST_F(Tarnmon, JsonIsNamedInTheHelpOfTheCommandsThatTakeIt) {
    const std::string line = "\n  --json  print the same as one JSON document\n\n";
    for (std::string name : {"status", "overrides", "snapshots"}) {
        EXPECT_NE(run_command({tarnmon(), name, "--help"}).out.find(line), std::string::npos)
            << name;
    }
    for (std::string name : {"stop", "alerts", "events", "check-config", "limits", "run"}) {
        EXPECT_EQ(run_command({tarnmon(), name, "--help"}).out.find("--json"), std::string::npos)
            << name;
        command_result r = run_command({tarnmon(), name, "--json"});
        EXPECT_EQ(r.status, 2) << name;
        EXPECT_EQ(r.err.rfind("usage: tarnmon " + name, 0), 0u) << r.err;
    }
}

// A file of four blocks: a plain snapshot, a problem snapshot with a hostile line and time stamp,
// text outside any snapshot, and a plain snapshot without a time stamp.
const std::string HOSTILE_STAMP = "6 \"March\" \\ \x01 2021";
const std::string HOSTILE_LINE = "ps \"x\\y\x01\x7f\xff\xc3( \xe2\x82\xac\x1b[2J";
const std::string PLAIN_BLOCK =
    std::string(PLAIN_SNAPSHOT_OPENING) +
    "\n\rLocal date and time = 5 March 2021 at 07:04:09 \n\rgathered\n\r" +
    std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";
const std::string PROBLEM_BLOCK =
    std::string(PROBLEM_SNAPSHOT_OPENING) + "\n\rLocal date and time = " + HOSTILE_STAMP + " \n\r" +
    HOSTILE_LINE + "\n\r" + std::string(PROBLEM_SNAPSHOT_CLOSING) + "\n\r";
const std::string STRAY_TEXT = "left over\n\r";
const std::string UNSTAMPED_BLOCK = std::string(PLAIN_SNAPSHOT_OPENING) + "\n\rno stamp\n\r" +
                                    std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";

TEST_F(TarnmonSnapshots, JsonListHoldsWhatTheTextListShows) {
    std::string path = dir + "/telvzmnd.trm";
    std::ofstream(path, std::ios::binary)
        << PLAIN_BLOCK + PROBLEM_BLOCK + STRAY_TEXT + UNSTAMPED_BLOCK;
    auto [text, json, doc] = run_both({tarnmon(), "snapshots"});
    EXPECT_EQ(doc.keys(), (names{"file", "bytes", "blocks"}));
    EXPECT_EQ(doc["file"].text, path);
    std::vector<std::string> lines = platform_test::lines_of(text.out);
    ASSERT_EQ(lines.size(), 6u) << text.out;
    EXPECT_EQ(lines[0], doc["file"].text + ": " + doc["bytes"].number + " bytes, " +
                            std::to_string(doc["blocks"].items.size()) + " blocks");
    ASSERT_EQ(doc["blocks"].items.size(), 4u);
    // "%5zu  %-34s  %-34s  %10zu": number, kind, time stamp, bytes.
    auto trimmed = [](std::string cell) {
        cell.erase(cell.find_last_not_of(' ') + 1);
        return cell.substr(cell.find_first_not_of(' '));
    };
    for (size_t i = 0; i < 4; ++i) {
        const std::string &row = lines[i + 2];
        const json_value &b = doc["blocks"][i];
        EXPECT_EQ(b.keys(), (names{"number", "kind", "time_stamp", "bytes"}));
        EXPECT_EQ(b["number"].number, trimmed(row.substr(0, 5)));
        EXPECT_EQ(b["kind"].text, trimmed(row.substr(7, 34)));
        std::string stamp =
            b["time_stamp"].type == json_value::kind::null ? "-" : shown(b["time_stamp"].text);
        EXPECT_EQ(stamp, trimmed(row.substr(43, row.size() - 43 - 12)));
        EXPECT_EQ(b["bytes"].number, trimmed(row.substr(row.size() - 10)));
    }
    EXPECT_EQ(doc["blocks"][1]["time_stamp"].text, HOSTILE_STAMP);
    EXPECT_EQ(doc["blocks"][2]["kind"].text, "text outside a snapshot");
    EXPECT_EQ(doc["blocks"][3]["time_stamp"].type, json_value::kind::null);
    EXPECT_NE(json.out.find(R"("time_stamp":"6 \"March\" \\ \u0001 2021")"), std::string::npos);
}

TEST_F(TarnmonSnapshots, JsonOfOneBlockIsItsRowOfTheListWithItsText) {
    std::string path = dir + "/telvzmnd.trm";
    const std::string blocks[] = {PLAIN_BLOCK, PROBLEM_BLOCK, STRAY_TEXT, UNSTAMPED_BLOCK};
    std::ofstream(path, std::ios::binary) << blocks[0] + blocks[1] + blocks[2] + blocks[3];
    json_value list = json_of(run_command({tarnmon(), "snapshots", "--json"}));
    for (std::string which : {"1", "2", "3", "4", "last"}) {
        auto [text, json, doc] = run_both({tarnmon(), "snapshots", which});
        EXPECT_EQ(doc.keys(), (names{"number", "kind", "time_stamp", "bytes", "text"}));
        size_t index = which == "last" ? 1 : std::stoul(which) - 1;
        const json_value &row = list["blocks"][index];
        for (const std::string &name : row.keys()) {
            EXPECT_EQ(doc[name].type, row[name].type) << which << " " << name;
            EXPECT_EQ(doc[name].number, row[name].number) << which << " " << name;
            EXPECT_EQ(doc[name].text, row[name].text) << which << " " << name;
        }
        if (index != 1) {
            EXPECT_EQ(doc["text"].text, blocks[index]) << which;
            EXPECT_EQ(shown(doc["text"].text), text.out) << which;
        }
    }
    // The hostile line, escaped to the byte; what is not UTF-8 reads back as the character of its
    // number.
    command_result last = run_command({tarnmon(), "snapshots", "last", "--json"});
    EXPECT_NE(last.out.find("\\u000a\\u000dps \\\"x\\\\y\\u0001\\u007f\\u00ff\\u00c3( "
                            "\xe2\x82\xac\\u001b[2J\\u000a\\u000d=END FEDC"),
              std::string::npos)
        << last.out;
    EXPECT_NE(
        json_of(last)["text"].text.find("ps \"x\\y\x01\x7f\xc3\xbf\xc3\x83( \xe2\x82\xac\x1b[2J"),
        std::string::npos);
}

TEST_F(TarnmonSnapshots, JsonFailsAsTheText) {
    std::string path = dir + "/telvzmnd.trm";
    auto same = [](std::vector<std::string> words, int status) {
        command_result text = run_command(words);
        words.insert(words.begin() + 2, "--json");
        command_result json = run_command(words);
        EXPECT_EQ(json.status, status) << words.back();
        EXPECT_EQ(json.status, text.status) << words.back();
        EXPECT_EQ(json.out, "") << words.back();
        EXPECT_EQ(json.err, text.err) << words.back();
        EXPECT_NE(json.err, "") << words.back();
    };
    same({tarnmon(), "snapshots"}, 3); // no file
    same({tarnmon(), "snapshots", "--file", dir}, 3);
    std::ofstream(path, std::ios::binary) << PLAIN_BLOCK;
    same({tarnmon(), "snapshots", "2"}, 3);
    same({tarnmon(), "snapshots", "0"}, 3);
    same({tarnmon(), "snapshots", "last"}, 3); // no problem snapshot
    same({tarnmon(), "snapshots", "first"}, 2);
}

// The escaper and the writer on their own.

// The JSON string of `escaped` read back; a test failure when it is not one.
std::string read_back(const std::string &escaped) {
    std::string problem;
    std::optional<json_value> value = parse_json("\"" + escaped + "\"", &problem);
    EXPECT_TRUE(value.has_value()) << problem << ": " << escaped;
    return value ? value->text : "";
}

// Whether `text` is UTF-8 that a JSON string may hold as it is, by the strict reader: no quote,
// backslash or control character (C0, DEL, C1).
bool plain_utf8(const std::string &text) {
    for (size_t i = 0; i + 1 < text.size(); ++i) {
        if (text[i] == '\xc2' && static_cast<unsigned char>(text[i + 1]) <= 0x9f) {
            return false; // U+0080..U+009F, or not UTF-8
        }
    }
    std::string problem;
    return text.find_first_of("\"\\\x7f") == std::string::npos &&
           parse_json("\"" + text + "\"", &problem).has_value();
}

TEST(TarnmonJsonEscaper, EachByteAloneIsKeptOrEscaped) {
    for (int b = 0; b < 256; ++b) {
        std::string in(1, static_cast<char>(b));
        std::string expected = in;
        if (b == '"' || b == '\\') {
            expected = "\\" + in;
        } else if (b < 0x20 || b >= 0x7f) {
            char u[7];
            std::snprintf(u, sizeof u, "\\u%04x", b);
            expected = u;
        }
        std::string escaped = json_escaped(in);
        EXPECT_EQ(escaped, expected) << b;
        // Above 0x7f a lone byte is not UTF-8: it reads back as the character of its number.
        std::string back = b < 0x80 ? in
                                    : std::string{static_cast<char>(0xc0 | (b >> 6)),
                                                  static_cast<char>(0x80 | (b & 0x3f))};
        EXPECT_EQ(read_back(escaped), back) << b;
    }
}

TEST(TarnmonJsonEscaper, SequencesOfUtf8AreKeptAndTheRestEscaped) {
    const std::pair<std::string, std::string> cases[] = {
        {"\xe2\x82\xac", "\xe2\x82\xac"},                     // U+20AC
        {"\xf0\x9f\x98\x80", "\xf0\x9f\x98\x80"},             // U+1F600
        {"\xc2\xa0", "\xc2\xa0"},                             // U+00A0, the first after C1
        {"\xc2\x85", "\\u0085"},                              // C1
        {"\xc2\x9f", "\\u009f"},                              // C1
        {"\xc0\x80", "\\u00c0\\u0080"},                       // overlong
        {"\xe0\x80\xaf", "\\u00e0\\u0080\\u00af"},            // overlong
        {"\xed\xa0\x80", "\\u00ed\\u00a0\\u0080"},            // a surrogate
        {"\xf4\x90\x80\x80", "\\u00f4\\u0090\\u0080\\u0080"}, // beyond U+10FFFF
        {"\xe2\x82", "\\u00e2\\u0082"},                       // cut short
        {"\xe2\x82x", "\\u00e2\\u0082x"},                     // cut short
        {"a\xf0\x9f\x98", "a\\u00f0\\u009f\\u0098"},          // cut short at the end
        {"\xe2\x82\xe2\x82\xac", "\\u00e2\\u0082\xe2\x82\xac"},
        {"\xf8\x88\x80\x80\x80", "\\u00f8\\u0088\\u0080\\u0080\\u0080"},
        {std::string("a\0b", 3), "a\\u0000b"},
    };
    for (const auto &[in, expected] : cases) {
        std::string escaped = json_escaped(in);
        EXPECT_EQ(escaped, expected);
        read_back(escaped);
    }
}

TEST(TarnmonJsonEscaper, AnyBytesGiveAValidStringAndUtf8ReadsBackAsItIs) {
    auto check = [](const std::string &in) {
        std::string escaped = json_escaped(in);
        EXPECT_TRUE(std::none_of(escaped.begin(), escaped.end(), [](char c) {
            return static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
        }));
        std::string back = read_back(escaped);
        if (plain_utf8(in)) {
            EXPECT_EQ(escaped, in);
        }
        return back;
    };
    for (int first = 0; first < 256; ++first) {
        for (int second = 0; second < 256; ++second) {
            check({static_cast<char>(first), static_cast<char>(second)});
        }
    }
    // Random strings, drawn so that the bytes of UTF-8 sequences come together often.
    std::mt19937 random(20261124);
    std::uniform_int_distribution<int> length(0, 12);
    std::uniform_int_distribution<int> pick(0, 3);
    std::uniform_int_distribution<int> byte(0, 255);
    std::uniform_int_distribution<int> continuation(0x80, 0xbf);
    std::uniform_int_distribution<int> lead(0xc2, 0xf4);
    std::uniform_int_distribution<int> ascii(0x20, 0x7e);
    for (int round = 0; round < 200000; ++round) {
        std::string in;
        for (int n = length(random); n > 0; --n) {
            int kind = pick(random);
            in += static_cast<char>(kind == 0   ? byte(random)
                                    : kind == 1 ? continuation(random)
                                    : kind == 2 ? lead(random)
                                                : ascii(random));
        }
        check(in);
        if (::testing::Test::HasFailure()) {
            break;
        }
    }
}

TEST(TarnmonJsonWriter, NestsObjectsAndArraysWithTheirCommas) {
    json_writer json;
    json.begin_object()
        .field("a", INT64_MIN)
        .field("b", UINT64_MAX)
        .key("c")
        .begin_array()
        .begin_object()
        .end_object()
        .begin_array()
        .end_array()
        .value("x")
        .null()
        .value(int32_t{-1})
        .end_array()
        .key("d\n")
        .begin_object()
        .field("e", "f")
        .end_object()
        .end_object();
    EXPECT_EQ(json.text(), R"({"a":-9223372036854775808,"b":18446744073709551615,)"
                           R"("c":[{},[],"x",null,-1],"d\u000a":{"e":"f"}})");
    std::string problem;
    EXPECT_TRUE(parse_json(json.text(), &problem).has_value()) << problem;
}

TEST(TarnmonJsonReader, RefusesWhatIsNotStrictJson) {
    for (std::string wrong :
         {"", "{", "{\"a\":1,}", "[1,]", "01", "1.", "-", "\"\x01\"", "\"\xff\"", "\"\\ud800\"",
          "\"\\x41\"", "{\"a\":1,\"a\":2}", "[] []", "{'a':1}", "nul", "\"\xc0\x80\""}) {
        std::string problem;
        EXPECT_FALSE(parse_json(wrong, &problem).has_value()) << wrong;
    }
    std::string problem;
    std::optional<json_value> ok =
        parse_json(" {\"a\":[true,false,null,-0.5e+3,\"\\ud83d\\ude00\\/\"]} \n", &problem);
    ASSERT_TRUE(ok.has_value()) << problem;
    EXPECT_EQ((*ok)["a"][4].text, "\xf0\x9f\x98\x80/");
    EXPECT_EQ((*ok)["a"][3].number, "-0.5e+3");
}

} // namespace

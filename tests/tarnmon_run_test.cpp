// tarnmon run, as an operator runs it: the built program, which loads the built libtelvzmnd.so,
// over a data directory of the test's own and a control block in a private IPC namespace. The
// real commands of the host serve the checks, except ps (see QUIET_PS).
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <functional>
#include <set>
#include <spawn.h>
#include <sstream>
#include <string>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "core/control_block.h"
#include "example_control_file.h"
#include "fake_commands.h"
#include "private_ipc.h"
#include "prometheus_text.h"
#include "run_command.h"

extern char **environ;

namespace {

using namespace std::chrono_literals;

std::string env(const char *name) {
    const char *value = std::getenv(name);
    return value != nullptr ? value : "";
}

std::string real_path(const std::string &path) {
    std::error_code error;
    std::string resolved = std::filesystem::canonical(path, error).string();
    return error ? path : resolved;
}

std::string tarnmon() {
    return env("TARN_BUILD_DIR") + "/tarnmon";
}

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

void write_file(const std::string &path, const std::string &text) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << text;
}

int count_of(const std::string &text, const std::string &part) {
    int count = 0;
    for (size_t at = text.find(part); at != std::string::npos;
         at = text.find(part, at + part.size())) {
        ++count;
    }
    return count;
}

// The lines of check-config's report that tarnmon run prints too: the file read, and the verdict.
std::string verdict_of(const std::string &report) {
    std::istringstream lines(report);
    std::string verdict;
    for (std::string line; std::getline(lines, line);) {
        if (line.starts_with("Control file: ") || line.starts_with("PROBLEM: ") ||
            line.starts_with("VALID: ")) {
            verdict += line + "\n";
        }
    }
    return verdict;
}

// Waits up to `limit` for `ready`, looking every 20 ms; whether it came.
bool wait_until(const std::function<bool()> &ready, std::chrono::seconds limit) {
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (!ready()) {
        if (std::chrono::steady_clock::now() > deadline) {
            return false;
        }
        std::this_thread::sleep_for(20ms);
    }
    return true;
}

// tarnmon running while the test looks at it; its outputs go to files, read once it has ended.
class running_tarnmon {
  public:
    explicit running_tarnmon(const std::vector<std::string> &arguments) {
        char pattern[] = "/tmp/tarnmon-run-out-XXXXXX";
        outputs_ = mkdtemp(pattern);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
        posix_spawn_file_actions_addopen(&actions, 1, (outputs_ + "/out").c_str(),
                                         O_WRONLY | O_CREAT | O_TRUNC, 0600);
        posix_spawn_file_actions_addopen(&actions, 2, (outputs_ + "/err").c_str(),
                                         O_WRONLY | O_CREAT | O_TRUNC, 0600);
        std::vector<std::string> words = {tarnmon(), "run"};
        words.insert(words.end(), arguments.begin(), arguments.end());
        std::vector<char *> argv;
        for (std::string &word : words) {
            argv.push_back(word.data());
        }
        argv.push_back(nullptr);
        if (posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ) != 0) {
            pid = -1;
        }
        started = pid;
        posix_spawn_file_actions_destroy(&actions);
    }
    ~running_tarnmon() {
        if (pid != -1) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
        std::filesystem::remove_all(outputs_);
    }
    running_tarnmon(const running_tarnmon &) = delete;
    running_tarnmon &operator=(const running_tarnmon &) = delete;

    // Its exit status (128 + the signal that ended it), or -1 when it has not ended within `limit`
    // (it is killed then).
    int wait(std::chrono::seconds limit) {
        int status = 0;
        bool ended = wait_until([&] { return waitpid(pid, &status, WNOHANG) == pid; }, limit);
        if (!ended) {
            kill(pid, SIGKILL);
            waitpid(pid, &status, 0);
        }
        pid = -1;
        if (!ended) {
            return -1;
        }
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }

    std::string out() const { return read_file(outputs_ + "/out"); }
    std::string err() const { return read_file(outputs_ + "/err"); }

    pid_t pid = -1;     // -1 once it has been waited for
    pid_t started = -1; // the pid it had

  private:
    std::string outputs_;
};

// ps is the one command a test cannot take from a shared build host: the example logs a process
// with more than 1 GB resident, and a compiler, fuzzer or benchmark of another job passes that at
// any time. The other commands (free, cat, df, runAsRoot lsmon.sh) are the host's own.
const std::string QUIET_PS = "    1     1  1000  20000  3000 init            00:00:01\n"
                             " 4242  4242  2000  30000  4000 quietd          00:00:02\n";

constexpr auto PASS_LIMIT = 120s; // far more than a pass takes, even under the sanitizers
constexpr int LONG_INTERVAL = 600;

class TarnmonRun : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        private_ipc::remove_control_block_objects();
        char data_pattern[] = "/tmp/tarnmon-run-data-XXXXXX";
        data_dir = real_path(mkdtemp(data_pattern));
        char user_pattern[] = "/tmp/tarnmon-run-user-XXXXXX";
        user_dir = real_path(mkdtemp(user_pattern));
        setenv("TELV_DATA_DIR", data_dir.c_str(), 1);
        for (const char *name : {"TELV_EVENT_LOG", "TELV_TRACE_FILE", "TELV_MODULE_PATH"}) {
            unsetenv(name);
        }
        // The trace's detail lines name every descriptor of every process: on a host running
        // thousands of processes, a pass alone would take the trace past its bound, and a rotation
        // would hide the lines the tests count.
        setenv("TELV_TRACE_DETAIL", "0", 1);
        setenv("TELV_TRACE_MAX_BYTES", "1073741824", 1);
        fakes.add_printing("ps", QUIET_PS);
    }
    void TearDown() override {
        if (!key_is_ours) {
            return;
        }
        if (block != nullptr) {
            shmdt(block);
        }
        private_ipc::remove_control_block_objects();
        std::filesystem::remove_all(data_dir);
        std::filesystem::remove_all(user_dir);
    }

    command_result run(const std::vector<std::string> &arguments) {
        std::vector<std::string> words = {tarnmon(), "run"};
        words.insert(words.end(), arguments.begin(), arguments.end());
        return run_command(words);
    }

    // A control file of the user's, outside the data directory.
    std::string user_file(const std::string &text, const std::string &name = "mine.trm") {
        std::string path = user_dir + "/" + name;
        write_file(path, text);
        return path;
    }

    std::string events() const { return read_file(data_dir + "/telvzmnd.events"); }
    // The whole trace: the file, after the one it was rotated to.
    std::string trace() const {
        return read_file(data_dir + "/telvzmnd.trace.1") + read_file(data_dir + "/telvzmnd.trace");
    }
    std::string snapshot_list() const { return run_command({tarnmon(), "snapshots"}).out; }
    bool data_dir_is_empty() const { return std::filesystem::is_empty(data_dir); }
    std::vector<std::string> data_dir_names() const {
        std::vector<std::string> names;
        for (const auto &entry : std::filesystem::directory_iterator(data_dir)) {
            names.push_back(entry.path().filename().string());
        }
        std::sort(names.begin(), names.end());
        return names;
    }

    static bool control_block_exists() {
        return shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0) != -1;
    }

    // Attaches the monitor's block once it has made it; null when it did not within the limit.
    tarn_control_block *monitor_block() {
        int id = -1;
        if (!wait_until(
                [&] {
                    id = shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0);
                    return id != -1;
                },
                PASS_LIMIT)) {
            return nullptr;
        }
        void *address = shmat(id, nullptr, 0);
        block = address == reinterpret_cast<void *>(-1)
                    ? nullptr
                    : static_cast<tarn_control_block *>(address);
        return block;
    }

    // Waits until the monitor sleeps after its first pass (the loop marks a sleep on time with -1),
    // then arms the judgement of its sleep at once: with the countdown at 0, every second of the
    // sleep is measured against the uptime, and an overrun would be reported by the next pass.
    // Returns once the loop has measured a second with the judgement armed.
    bool sleeping_with_drift_judged(running_tarnmon &monitor) {
        if (monitor.pid == -1 || monitor_block() == nullptr) {
            return false;
        }
        if (!wait_until([&] { return read_field(block->sleep_time_percent) == -1; }, PASS_LIMIT)) {
            return false;
        }
        write_field(block->numLoopsBeforeCPUChecking, 0);
        const std::string slept = "TARNMNDF: slept for 1 second;";
        int before = count_of(trace(), slept);
        // The line comes before the second's measurement: two more, and one measurement is done.
        return wait_until([&] { return count_of(trace(), slept) > before + 1; }, PASS_LIMIT);
    }

    bool key_is_ours = false;
    std::string data_dir;
    std::string user_dir;
    fake::fake_commands fakes;
    tarn_control_block *block = nullptr;
};

const std::string RUN_USAGE =
    "usage: tarnmon run [--interval SECONDS] [--data-dir DIR] [--config FILE] [--once] "
    "[--metrics FILE]\n";

// ---- One pass ----

TEST_F(TarnmonRun, OnceOnAQuietHostWritesAPlainSnapshotAndNoEvent) {
    std::string example = read_file(example::path());
    running_tarnmon monitor({"--once", "--config", example::path()});
    command_result r;
    r.status = monitor.wait(PASS_LIMIT);
    r.out = monitor.out();
    r.err = monitor.err();
    EXPECT_EQ(r.status, 0) << r.out << r.err;
    std::string build = real_path(env("TARN_BUILD_DIR"));
    EXPECT_EQ(r.out, "Control file: " + example::path() + " (" + std::to_string(example.size()) +
                         " bytes read)\n"
                         "VALID: the monitor would run with this control file\n"
                         "monitor: " +
                         build + "/libtelvzmnd.so, one pass\n" + "data directory: " + data_dir +
                         "\n" + "event log: " + data_dir + "/telvzmnd.events\n" +
                         "trace: " + data_dir + "/telvzmnd.trace\n" + "runAsRoot: " + build +
                         "/libexec/runAsRoot (this tarnmon's, put first on PATH)\n");
    EXPECT_EQ(r.err, "");

    // One plain snapshot, whole, with what the commands of this host printed.
    std::string list = snapshot_list();
    EXPECT_NE(list.find(", 1 block\n"), std::string::npos) << list;
    EXPECT_EQ(count_of(list, " plain "), 1) << list;
    command_result shown = run_command({tarnmon(), "snapshots", "1"});
    EXPECT_EQ(shown.status, 0);
    EXPECT_TRUE(shown.out.starts_with("=START=====")) << shown.out;
    EXPECT_NE(shown.out.find(" 4242  4242  2000  30000  4000 quietd"), std::string::npos);
    EXPECT_NE(shown.out.find("About to output df data"), std::string::npos);
    // lsmon.sh, run by the build's runAsRoot, listed the monitor's own descriptors.
    EXPECT_NE(shown.out.find("About to output ls data"), std::string::npos);
    EXPECT_NE(shown.out.find("/proc/" + std::to_string(monitor.started) + "/fd: "),
              std::string::npos)
        << shown.out;

    EXPECT_EQ(events(), "");
    std::string log = trace();
    EXPECT_EQ(count_of(log, "TARNMNDF: inside while loop"), 1);
    EXPECT_NE(log.find("TARNMNDF:    runOnce = TRUE"), std::string::npos);
    // The control file was the user's, through a link that is gone again.
    EXPECT_FALSE(
        std::filesystem::exists(std::filesystem::symlink_status(data_dir + "/telvzopt.trm")));
    EXPECT_EQ(read_file(example::path()), example);
}

TEST_F(TarnmonRun, ControlFileOfTheDataDirectoryIsReadWithoutConfig) {
    write_file(data_dir + "/telvzopt.trm",
               example::with("CHECKING_INTERVAL", "CHECKING_INTERVAL 30"));
    command_result r = run({"--once"});
    EXPECT_EQ(r.status, 0) << r.out << r.err;
    EXPECT_TRUE(
        r.out.starts_with("Control file: telvzopt.trm in the data directory " + data_dir + " ("))
        << r.out;
    // One pass keeps the control file's interval, as the host passes it.
    EXPECT_NE(trace().find("TARNMNDF:    input parm: checking_interval = 30"), std::string::npos);
    EXPECT_EQ(count_of(snapshot_list(), " plain "), 1);
    EXPECT_TRUE(std::filesystem::is_regular_file(data_dir + "/telvzopt.trm"));
}

// ---- Stopping ----

class TarnmonRunStop : public TarnmonRun, public ::testing::WithParamInterface<int> {};

TEST_P(TarnmonRunStop, SignalDuringTheSleepEndsItAfterOnePassWithoutASleepAlert) {
    const int signal = GetParam();
    running_tarnmon monitor(
        {"--interval", std::to_string(LONG_INTERVAL), "--config", example::path()});
    ASSERT_TRUE(sleeping_with_drift_judged(monitor)) << monitor.err();
    auto sent = std::chrono::steady_clock::now();
    ASSERT_EQ(kill(monitor.pid, signal), 0);
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();
    EXPECT_LT(std::chrono::steady_clock::now() - sent, std::chrono::seconds(LONG_INTERVAL));
    std::string name = signal == SIGINT ? "SIGINT" : "SIGTERM";
    EXPECT_EQ(monitor.err(), "tarnmon: " + name + ": the monitor ends after its current pass\n");

    std::string log = trace();
    EXPECT_EQ(count_of(log, "TARNMNDF: inside while loop"), 2) << "the pass before, one after";
    EXPECT_EQ(count_of(log, "TARNMNDF: about to sleep for 600 seconds"), 1);
    std::string raised = events();
    EXPECT_EQ(count_of(raised, "\"reason\":\"0xE170\""), 1) << raised;
    EXPECT_EQ(raised.find("\"reason\":\"0xE152\""), std::string::npos) << raised;
    EXPECT_EQ(raised.find("\"reason\":\"0xE153\""), std::string::npos) << raised;
    // Both passes wrote their snapshot whole.
    std::string list = snapshot_list();
    EXPECT_NE(list.find(", 2 blocks\n"), std::string::npos) << list;
    EXPECT_EQ(count_of(list, " plain "), 2) << list;
    EXPECT_EQ(read_field(block->sleepTimeExceeded), 0u);
}

INSTANTIATE_TEST_SUITE_P(Signals, TarnmonRunStop, ::testing::Values(SIGTERM, SIGINT),
                         [](const ::testing::TestParamInfo<int> &info) {
                             return std::string(info.param == SIGINT ? "Sigint" : "Sigterm");
                         });

// A signal that comes while the monitor is still starting (before its block is set up, or during
// its first pass) ends it too: a request that the set-up cleared is made again at the first sleep.
TEST_F(TarnmonRun, SignalWhileTheMonitorStartsEndsItWithinTwoPasses) {
    running_tarnmon monitor(
        {"--interval", std::to_string(LONG_INTERVAL), "--config", example::path()});
    ASSERT_TRUE(wait_until([&] { return monitor.out().find("runAsRoot: ") != std::string::npos; },
                           PASS_LIMIT));
    ASSERT_EQ(kill(monitor.pid, SIGTERM), 0);
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();
    std::string log = trace();
    int passes = count_of(log, "TARNMNDF: inside while loop");
    EXPECT_GE(passes, 1);
    EXPECT_LE(passes, 2);
    std::string raised = events();
    EXPECT_GE(count_of(raised, "\"reason\":\"0xE170\""), 1) << raised;
    EXPECT_EQ(raised.find("\"reason\":\"0xE152\""), std::string::npos) << raised;
    EXPECT_EQ(raised.find("\"reason\":\"0xE153\""), std::string::npos) << raised;
}

// The sleep alerts that the stopping tests look for (0xE152, 0xE153) do reach the event log in
// their set-up: with an allowance of 1.1 % of the interval, the first measured second is an
// overrun.
TEST_F(TarnmonRun, SleepAlertOfAnArmedJudgementReachesTheEventLog) {
    std::string file =
        user_file(example::with("CPU_SLEEP_TIME_THRESHOLD", "CPU_SLEEP_TIME_THRESHOLD 11"));
    running_tarnmon monitor({"--interval", std::to_string(LONG_INTERVAL), "--config", file});
    ASSERT_TRUE(sleeping_with_drift_judged(monitor)) << monitor.err();
    EXPECT_TRUE(wait_until(
        [&] {
            std::string raised = events();
            return raised.find("\"reason\":\"0xE152\"") != std::string::npos ||
                   raised.find("\"reason\":\"0xE153\"") != std::string::npos;
        },
        PASS_LIMIT))
        << events();
    kill(monitor.pid, SIGTERM);
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();
}

TEST_F(TarnmonRun, TarnmonStopEndsTheSleepToo) {
    running_tarnmon monitor(
        {"--interval", std::to_string(LONG_INTERVAL), "--config", example::path()});
    ASSERT_TRUE(sleeping_with_drift_judged(monitor)) << monitor.err();
    command_result stop = run_command({tarnmon(), "stop"});
    EXPECT_EQ(stop.status, 0) << stop.err;
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();
    EXPECT_EQ(monitor.err(), "");
    EXPECT_EQ(count_of(trace(), "TARNMNDF: inside while loop"), 2);
    std::string raised = events();
    EXPECT_EQ(count_of(raised, "\"reason\":\"0xE170\""), 1) << raised;
    EXPECT_EQ(raised.find("\"reason\":\"0xE152\""), std::string::npos) << raised;
    EXPECT_EQ(raised.find("\"reason\":\"0xE153\""), std::string::npos) << raised;
}

// ---- The switches, from another process ----

class TarnmonRunSwitches : public TarnmonRun {
  protected:
    // Waits until the monitor sleeps between passes: the loop marks the start of every sleep with
    // a measure of -1, which the trigger sets to 0.
    bool sleeping(running_tarnmon &monitor) {
        return monitor.pid != -1 && (block != nullptr || monitor_block() != nullptr) &&
               wait_until([&] { return read_field(block->sleep_time_percent) == -1; }, PASS_LIMIT);
    }

    // tarnmon `command` `word`, which says `message` and succeeds.
    static void turn(const std::string &command, const std::string &word,
                     const std::string &message) {
        command_result r = run_command({tarnmon(), command, word});
        EXPECT_EQ(r.status, 0) << r.err;
        EXPECT_EQ(r.out, message);
        EXPECT_EQ(r.err, "");
    }

    // The lines of the event log that raise `reason` ("0xE153").
    std::vector<std::string> events_of(const std::string &reason) const {
        std::vector<std::string> found;
        std::istringstream lines(events());
        for (std::string line; std::getline(lines, line);) {
            if (line.find("\"reason\":\"" + reason + "\"") != std::string::npos) {
                found.push_back(line);
            }
        }
        return found;
    }
    // tarnmon alerts trigger, and the wait for the sleep alert it brings on: whether the event
    // log came to hold `count` of them.
    bool triggered(size_t count) const {
        turn("alerts", "trigger",
             "sleep alert forced: the monitor ends its sleep within a second, and its next pass "
             "reports the alert\n");
        return wait_until([&] { return events_of("0xE153").size() >= count; }, PASS_LIMIT);
    }
};

// The trigger comes while the monitor sleeps the first of its 600-second sleeps: at most the one
// second under way is slept after it, and the pass that follows reports the sleep alert with the
// measure the trigger left, 0 (the loop allows 660 seconds, so no second measured meanwhile is an
// overrun).
TEST_F(TarnmonRunSwitches, AlertsTriggerEndsTheSleepAndTheNextPassReportsTheSleepAlert) {
    running_tarnmon monitor(
        {"--interval", std::to_string(LONG_INTERVAL), "--config", example::path()});
    ASSERT_TRUE(sleeping(monitor)) << monitor.err();
    ASSERT_TRUE(triggered(1)) << events();
    kill(monitor.pid, SIGTERM);
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();

    std::vector<std::string> alerts = events_of("0xE153");
    ASSERT_EQ(alerts.size(), 1u);
    EXPECT_NE(alerts[0].find("\"severity\":\"error\""), std::string::npos) << alerts[0];
    EXPECT_NE(alerts[0].find("\"compRc\":\"0x0\""), std::string::npos) << alerts[0];
    EXPECT_TRUE(events_of("0xE152").empty()) << events();
    std::string log = trace();
    size_t triggered = log.find("TARNOTHF: <-- tarn_trigger_cpu_alert04, src = 0, crc = 0 (hex)");
    ASSERT_NE(triggered, std::string::npos);
    size_t next_pass = log.find("TARNMNDF: inside while loop", triggered);
    ASSERT_NE(next_pass, std::string::npos);
    EXPECT_LE(
        count_of(log.substr(triggered, next_pass - triggered), "TARNMNDF: slept for 1 second;"), 1);
    EXPECT_NE(log.find("TARNMNDF:     TARN_CB_PTR->sleep_time_percent = 0 percent", next_pass),
              std::string::npos);
    // The pass before the trigger, the one it brought on, and the one after SIGTERM.
    EXPECT_EQ(count_of(log, "TARNMNDF: inside while loop"), 3);
}

// Each switch of the logging type is seen by the next event: the trigger brings one on.
TEST_F(TarnmonRunSwitches, EventsInfoMakesTheNextEventInformationalAndEventsErrorSwitchesBack) {
    running_tarnmon monitor(
        {"--interval", std::to_string(LONG_INTERVAL), "--config", example::path()});
    ASSERT_TRUE(sleeping(monitor)) << monitor.err();
    turn("events", "info",
         "events of the monitor are informational from now on (until an event of a full /extra, "
         "which sets them back to errors)\n");
    EXPECT_EQ(read_field(block->logAsInfo), 1u);
    ASSERT_TRUE(triggered(1)) << events();
    ASSERT_TRUE(sleeping(monitor)) << monitor.err();
    turn("events", "error", "events of the monitor are errors from now on\n");
    EXPECT_EQ(read_field(block->logAsInfo), 0u);
    ASSERT_TRUE(triggered(2)) << events();
    kill(monitor.pid, SIGTERM);
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();

    std::vector<std::string> alerts = events_of("0xE153");
    ASSERT_EQ(alerts.size(), 2u);
    EXPECT_NE(alerts[0].find("\"severity\":\"informational\""), std::string::npos) << alerts[0];
    EXPECT_NE(alerts[1].find("\"severity\":\"error\""), std::string::npos) << alerts[1];
}

// ---- The library and its sleep ----

// The names that the shared library defines for the loader, as nm lists them.
std::set<std::string> names_defined_by(const std::string &library) {
    std::set<std::string> names;
    std::string command = "nm -D --defined-only '" + library + "'";
    FILE *listing = popen(command.c_str(), "r");
    if (listing == nullptr) {
        return names;
    }
    char line[1024];
    while (std::fgets(line, sizeof line, listing) != nullptr) {
        std::istringstream words(line);
        std::string address, kind, name;
        if (words >> address >> kind >> name) {
            names.insert(name.substr(0, name.find('@')));
        }
    }
    pclose(listing);
    return names;
}

// Type information, which a sanitized build emits for its checks: one object for the whole
// program, wherever it binds.
bool type_information(const std::string &name) {
    return name.starts_with("_ZTI") || name.starts_with("_ZTS");
}

// The monitor is the shared library's, and its sleep() binds to the one tarnmon exports, not to
// the C library's. None of the library's own names binds to tarnmon, which carries a private copy
// of the library's objects for check-config: the monitor runs on the library's state alone.
TEST_F(TarnmonRun, LibrarysSleepBindsToTarnmonAndNoneOfItsOwnNamesDoes) {
    std::string build = real_path(env("TARN_BUILD_DIR"));
    std::set<std::string> own = names_defined_by(build + "/libtelvzmnd.so");
    ASSERT_EQ(own.count("tarn_mon_main"), 1u);
    std::string bindings = user_dir + "/ld";
    setenv("LD_DEBUG", "bindings", 1);
    setenv("LD_DEBUG_OUTPUT", bindings.c_str(), 1);
    running_tarnmon monitor({"--once", "--config", example::path()});
    int status = monitor.wait(PASS_LIMIT);
    unsetenv("LD_DEBUG");
    unsetenv("LD_DEBUG_OUTPUT");
    ASSERT_EQ(status, 0) << monitor.err();
    EXPECT_NE(monitor.out().find("monitor: " + build + "/libtelvzmnd.so, one pass\n"),
              std::string::npos)
        << monitor.out();

    std::istringstream lines(read_file(bindings + "." + std::to_string(monitor.started)));
    int sleep_to_tarnmon = 0;
    int own_to_itself = 0;
    for (std::string line; std::getline(lines, line);) {
        size_t from = line.find("binding file ");
        size_t symbol = line.find(": normal symbol `");
        if (from == std::string::npos || symbol == std::string::npos ||
            line.find("/libtelvzmnd.so [0] to ", from) == std::string::npos) {
            continue;
        }
        size_t name_at = symbol + std::strlen(": normal symbol `");
        std::string name = line.substr(name_at, line.find('\'', name_at) - name_at);
        bool to_tarnmon = line.find(" to " + build + "/tarnmon [0]: ") != std::string::npos;
        if (name == "sleep") {
            EXPECT_TRUE(to_tarnmon) << line;
            sleep_to_tarnmon += to_tarnmon ? 1 : 0;
        } else if (own.count(name) != 0 && !type_information(name)) {
            EXPECT_NE(line.find(" to " + build + "/libtelvzmnd.so [0]: "), std::string::npos)
                << line;
            ++own_to_itself;
        }
    }
    EXPECT_GE(sleep_to_tarnmon, 1);
    EXPECT_GT(own_to_itself, 0); // tarn_init, tarn_save_data and others, called through the PLT
}

// ---- A control file the monitor would not run with ----

TEST_F(TarnmonRun, MissingControlFileGivesCheckConfigsMessageAndStatusAndRunsNothing) {
    command_result check = run_command({tarnmon(), "check-config"});
    command_result r = run({"--interval", "5"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.status, check.status);
    EXPECT_EQ(r.out, check.out);
    EXPECT_EQ(r.out, "PROBLEM: the control file telvzopt.trm in the data directory " + data_dir +
                         " does not exist; without it the monitor does not run (and reports "
                         "nothing)\n");
    EXPECT_EQ(r.err, "");
    EXPECT_TRUE(data_dir_is_empty());
    EXPECT_FALSE(control_block_exists());

    std::string missing = user_dir + "/missing.trm";
    command_result check_file = run_command({tarnmon(), "check-config", missing});
    command_result with_file = run({"--once", "--config", missing});
    EXPECT_EQ(with_file.status, 3);
    EXPECT_EQ(with_file.out, check_file.out);
    EXPECT_TRUE(data_dir_is_empty());
    EXPECT_FALSE(control_block_exists());
}

TEST_F(TarnmonRun, InvalidControlFileGivesCheckConfigsVerdictAndStatusAndRunsNothing) {
    std::string file = user_file(
        example::with("RESUME_MEMORY_PERCENT_THRESHOLD", "RESUME_MEMORY_PERCENT_THRESHOLD 950"));
    command_result check = run_command({tarnmon(), "check-config", file});
    EXPECT_EQ(check.status, 1);
    command_result r = run({"--config", file});
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.out, verdict_of(check.out));
    EXPECT_NE(r.out.find("PROBLEM: RESUME_MEMORY_PERCENT_THRESHOLD is 950"), std::string::npos)
        << r.out;
    EXPECT_EQ(r.err, "");
    EXPECT_TRUE(data_dir_is_empty());
    EXPECT_FALSE(control_block_exists());

    // The same from the data directory, and a file that does not ask the monitor to run.
    write_file(data_dir + "/telvzopt.trm", example::with("ACTUALLY_RUN", ""));
    command_result check_own = run_command({tarnmon(), "check-config"});
    command_result own = run({"--once"});
    EXPECT_EQ(own.status, 1);
    EXPECT_EQ(own.out, verdict_of(check_own.out));
    EXPECT_NE(own.out.find("PROBLEM: ACTUALLY_RUN is missing"), std::string::npos) << own.out;
    EXPECT_EQ(data_dir_names(), std::vector<std::string>{"telvzopt.trm"});
    EXPECT_FALSE(control_block_exists());
}

// ---- --config and the data directory's own control file ----

TEST_F(TarnmonRun, ConfigNeverReplacesTheDataDirectorysOwnControlFile) {
    std::string own = example::with("CHECKING_INTERVAL", "CHECKING_INTERVAL 90");
    write_file(data_dir + "/telvzopt.trm", own);
    std::string file = user_file(read_file(example::path()));
    command_result r = run({"--once", "--config", file});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.err, "tarnmon: the data directory " + data_dir +
                         " holds a control file of its own, telvzopt.trm, which the monitor "
                         "would read instead of " +
                         file + ": move it away, or leave out --config to run with it\n");
    EXPECT_EQ(read_file(data_dir + "/telvzopt.trm"), own);
    EXPECT_FALSE(std::filesystem::exists(data_dir + "/telvzmnd.trace"));
    EXPECT_FALSE(control_block_exists());

    // Named with --config, the data directory's own file is read where it is, and stays.
    command_result same = run({"--once", "--config", data_dir + "/telvzopt.trm"});
    EXPECT_EQ(same.status, 0) << same.out << same.err;
    EXPECT_FALSE(std::filesystem::is_symlink(data_dir + "/telvzopt.trm"));
    EXPECT_EQ(read_file(data_dir + "/telvzopt.trm"), own);
    EXPECT_EQ(count_of(snapshot_list(), " plain "), 1);
}

TEST_F(TarnmonRun, DataDirOptionMakesTheDirectoryAndNamesItByItsRealPath) {
    std::string dir = user_dir + "/made/../data";
    std::filesystem::create_directories(user_dir + "/made");
    command_result r = run({"--once", "--data-dir", dir, "--config", example::path()});
    EXPECT_EQ(r.status, 0) << r.out << r.err;
    EXPECT_NE(r.out.find("data directory: " + user_dir + "/data\n"), std::string::npos) << r.out;
    EXPECT_TRUE(std::filesystem::is_regular_file(user_dir + "/data/telvzmnd.trm"));
    EXPECT_TRUE(data_dir_is_empty()); // TELV_DATA_DIR gave way to the option
}

// ---- The appliance programs ----

TEST_F(TarnmonRun, RunAsRootOnThePathIsKept) {
    fakes.add("runAsRoot", "#!/bin/sh\n[ \"$1\" = lsmon.sh ] && printf '/proc/77777/fd:\\ntotal "
                           "0\\n\\n'\nexit 0\n");
    command_result r = run({"--once", "--config", example::path()});
    EXPECT_EQ(r.status, 0) << r.out << r.err;
    EXPECT_NE(r.out.find("runAsRoot: " + fakes.path_of("runAsRoot") + " (from PATH)\n"),
              std::string::npos)
        << r.out;
    command_result shown = run_command({tarnmon(), "snapshots", "1"});
    EXPECT_NE(shown.out.find("/proc/77777/fd:"), std::string::npos) << shown.out;
    EXPECT_EQ(shown.out.find("/proc/1/fd:"), std::string::npos);
}

// ---- The control block ----

TEST_F(TarnmonRun, MonitorHoldingTheBlockIsLeftAlone) {
    int id = shmget(static_cast<key_t>(TARN_CB_KEY), TARN_CB_SIZE, IPC_CREAT | 0666);
    ASSERT_NE(id, -1);
    void *address = shmat(id, nullptr, 0);
    ASSERT_NE(address, reinterpret_cast<void *>(-1));
    block = static_cast<tarn_control_block *>(address);
    block->numLoopsBeforeCPUChecking = 7;
    command_result r = run({"--once", "--config", example::path()});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.err, "tarnmon: the control block (key 0x96728017) is attached by 1 process: a "
                     "monitor runs on this host (see tarnmon status); a second one would take its "
                     "block away\n");
    EXPECT_EQ(shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0), id);
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 7);
    EXPECT_TRUE(data_dir_is_empty());
}

TEST_F(TarnmonRun, SegmentOfAnotherProgramIsLeftAlone) {
    int id = shmget(static_cast<key_t>(TARN_CB_KEY), 100, IPC_CREAT | 0666);
    ASSERT_NE(id, -1);
    command_result r = run({"--once", "--config", example::path()});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has 100 "
                     "bytes, not 2940036; a monitor would remove it\n");
    EXPECT_EQ(shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0), id);
}

// The first segment of a fresh namespace gets id 0, which a monitor that finds it left over takes
// for a failure: neither a block left by an earlier run nor one of id 0 keeps the next run from
// running.
TEST_F(TarnmonRun, EveryRunInTheSameNamespaceRuns) {
    int stale = shmget(static_cast<key_t>(TARN_CB_KEY), TARN_CB_SIZE, IPC_CREAT | 0666);
    ASSERT_NE(stale, -1);
    if (stale != 0) {
        GTEST_SKIP() << "this namespace has made a segment before";
    }
    for (int run_number = 1; run_number <= 2; ++run_number) {
        command_result r = run({"--once", "--config", example::path()});
        EXPECT_EQ(r.status, 0) << r.out << r.err;
        EXPECT_EQ(count_of(snapshot_list(), " plain "), run_number);
        int id = shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0);
        EXPECT_NE(id, -1);
        EXPECT_NE(id, 0);
    }
    EXPECT_EQ(events(), "");
}

// ---- The metrics file ----

// A process over the example's log limit for appserver (1,500,000 KB resident), and under its
// abort limit: reported with 0xE111, killed never.
const std::string PS_WITH_A_LARGE_APPSERVER =
    QUIET_PS + " 4243  4243  2000000  30000  4000 appserver       00:00:02\n";

TEST_F(TarnmonRun, MetricsOfAPassWithAFindingShowItAndTheHostsFigures) {
    fakes.add_printing("ps", PS_WITH_A_LARGE_APPSERVER);
    const std::string metrics = user_dir + "/telvzmnd.prom";
    running_tarnmon monitor({"--once", "--config", example::path(), "--metrics", metrics});
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();
    EXPECT_EQ(monitor.err(), "");
    EXPECT_NE(monitor.out().find("\nmetrics: " + metrics + ", after every pass\n"),
              std::string::npos)
        << monitor.out();
    EXPECT_NE(events().find("\"reason\":\"0xE111\""), std::string::npos) << events();

    auto read = prometheus::parse(read_file(metrics));
    ASSERT_EQ(read.error, "") << read_file(metrics);
    const prometheus::document &doc = read.doc;
    EXPECT_EQ(doc.value("telvzmnd_passes_total"), 1.0);
    EXPECT_EQ(doc.value("telvzmnd_findings_total", {{"reason_code", "0xE111"}}), 1.0);
    EXPECT_EQ(doc.samples_of("telvzmnd_findings_total").size(), 1u);
    EXPECT_EQ(doc.value("telvzmnd_findings_held_back_total"), 0.0);
    // The host's own free, file-nr and df gave their figures; one pass has no CPU sample to
    // compare with, and no sleep before it.
    auto memory = doc.value("telvzmnd_memory_in_use_percent");
    ASSERT_TRUE(memory.has_value());
    EXPECT_GT(*memory, 0.0);
    EXPECT_LE(*memory, 100.0);
    EXPECT_TRUE(doc.value("telvzmnd_file_descriptors_in_use_percent").has_value());
    EXPECT_FALSE(doc.samples_of("telvzmnd_partition_used_percent").empty());
    EXPECT_TRUE(doc.samples_of("telvzmnd_appliance_cpu_percent").empty());
    EXPECT_FALSE(doc.value("telvzmnd_sleep_drift_seconds").has_value());
    EXPECT_GT(*doc.value("telvzmnd_pass_duration_seconds"), 0.0);
    double now = static_cast<double>(std::time(nullptr));
    EXPECT_NEAR(*doc.value("telvzmnd_last_pass_timestamp_seconds"), now, PASS_LIMIT.count());
    // Only the file itself is left where it was written.
    std::vector<std::string> names;
    for (const auto &entry : std::filesystem::directory_iterator(user_dir)) {
        names.push_back(entry.path().filename().string());
    }
    EXPECT_EQ(names, std::vector<std::string>{"telvzmnd.prom"});
}

TEST_F(TarnmonRun, MetricsFileIsReplacedWholeAfterEveryPass) {
    const std::string metrics = user_dir + "/telvzmnd.prom";
    running_tarnmon monitor({"--interval", "5", "--config", example::path(), "--metrics", metrics});
    // Read as a collector reads it, as often as it can, until the third pass has written it.
    int reads = 0;
    std::set<ino_t> files;
    std::string error;
    double passes = 0;
    wait_until(
        [&] {
            struct stat st;
            std::string text = read_file(metrics);
            if (text.empty() || stat(metrics.c_str(), &st) != 0) {
                return false;
            }
            files.insert(st.st_ino);
            ++reads;
            auto read = prometheus::parse(text);
            if (!read.error.empty()) {
                error = read.error + " in:\n" + text;
                return true;
            }
            passes = read.doc.value("telvzmnd_passes_total").value_or(0);
            return passes >= 3;
        },
        PASS_LIMIT);
    kill(monitor.pid, SIGTERM);
    EXPECT_EQ(monitor.wait(PASS_LIMIT), 0) << monitor.err();
    EXPECT_EQ(error, "");
    EXPECT_GE(passes, 3.0);
    EXPECT_GE(files.size(), 2u); // a new file each pass, not the old one rewritten
    auto last = prometheus::parse(read_file(metrics));
    ASSERT_EQ(last.error, "");
    // From the second pass on: the sleep before it, and the CPU of every process.
    EXPECT_TRUE(last.doc.value("telvzmnd_sleep_drift_seconds").has_value());
    EXPECT_EQ(last.doc.samples_of("telvzmnd_appliance_cpu_percent").size(), 2u);
    EXPECT_GT(reads, 0);
}

TEST_F(TarnmonRun, MetricsFileThatCannotBeWrittenIsRefusedBeforeTheMonitorRuns) {
    for (const std::string &place : {user_dir + "/missing/telvzmnd.prom", user_dir}) {
        command_result r = run({"--once", "--config", example::path(), "--metrics", place});
        EXPECT_EQ(r.status, 3) << place;
        EXPECT_EQ(r.out, "") << place;
        EXPECT_EQ(r.err, "tarnmon: cannot write the metrics file " + place + ": " +
                             std::strerror(place == user_dir ? EISDIR : ENOENT) + "\n");
    }
    EXPECT_FALSE(control_block_exists());
    EXPECT_EQ(events(), "");
}

// ---- The command line ----

TEST_F(TarnmonRun, OptionErrorsGiveTheUsageStatus) {
    auto refused = [&](const std::vector<std::string> &words, const std::string &message) {
        command_result r = run(words);
        EXPECT_EQ(r.status, 2) << words.back();
        EXPECT_EQ(r.out, "") << words.back();
        EXPECT_EQ(r.err, message + RUN_USAGE) << words.back();
    };
    refused({"--bogus"}, "");
    refused({"-x"}, "");
    refused({"--once", "extra"}, "");
    refused({"--interval"}, "");
    for (std::string value : {"abc", "-5", "", "2147483648", "99999999999", "1.5", "+5", " 5"}) {
        refused({"--interval", value},
                "tarnmon: --interval takes seconds in the range 0..2147483647, not '" + value +
                    "'\n");
    }
    EXPECT_TRUE(data_dir_is_empty());
    EXPECT_FALSE(control_block_exists());
}

TEST_F(TarnmonRun, HelpIsItsUsageSummaryAndExitStatuses) {
    command_result r = run({"--help"});
    EXPECT_EQ(r.status, 0);
    EXPECT_TRUE(r.out.starts_with(RUN_USAGE + "run the monitor here")) << r.out;
    EXPECT_NE(r.out.find("\nexit status: 0 fine, 1 finding, 2 usage error, 3 not available\n"),
              std::string::npos);
    EXPECT_NE(run_command({tarnmon(), "--help"}).out.find("run [--interval SECONDS]"),
              std::string::npos);
}

} // namespace

// How much memory tarnmon run keeps resident over thousands of passes at the host's own process
// count: the command-line host as it is built, which loads libtelvzmnd.so and runs the monitor on
// a thread of its own, measured in its own process.
//
// tarnmon_resident (not run unless named by --benchmark_filter): tarnmon run --interval 5
// --data-dir DIR --config FILE, from the build, on the real commands, for 10,000 passes (1,000 in
// the short run). The control file is the example's with the thresholds this machine would cross
// out of reach: the resident size of a process and its kill limit (the kill limit goes to 0, so
// that nothing on this shared machine can be told to die), the CPU of the appliance as a whole,
// which here is the whole machine, kept busy by whoever else compiles on it, and a trend that is
// never reported: passes that follow each other within a fraction of a second find every process
// that grows for a second (a compiler) growing at every step, which passes minutes apart would
// not. The analysis still walks every row at every snapshot.
//
// Ten thousand passes five seconds apart would take fourteen hours. tarnmon runs with
// support/fast_time.cpp preloaded, which makes time fly inside its process: every one-second
// sleep of the loop (tarnmon's own sleep(), a wait on a condition variable) ends at once with its
// second gone by on the monotonic clock, the uptime and the clock ticks, so the loop measures
// exactly its interval (no sleep alert) and the CPU accounting takes its sample at every pass,
// while the pass itself runs its checks and commands at their real speed. After the last sleep of
// the pass before the last, the library sends tarnmon SIGTERM, and tarnmon ends the monitor after
// its next pass as it does on a signal. tarnmon and the monitor are not changed for the benchmark.
//
// The counters give VmRSS of tarnmon's process after the first pass, after 1,000 passes, after
// the pass before the last, and with the monitor's thread ended after the last pass, and VmHWM
// then (kB, from its /proc/self/status); RssAnon and RssFile at the end; and the processes in
// /proc when the run ended. The figures are printed to standard error as they come, every 1,000
// passes, and at the end the mappings that hold tarnmon's resident pages, largest first, from its
// /proc/self/smaps. The run fails when tarnmon exits with anything but 0, when the event log got
// an event (a finding or a sleep alert) besides the terminate request that tarnmon's stop logs,
// when the trace dump was taken, when fewer or more sleeps than the passes need were made, or
// when a pass took no CPU sample. Its files stay in the directory printed at the start: the data
// directory (event log, trace, snapshots), tarnmon's output, and what the preloaded library
// recorded.
//
// The project's runAsRoot and lsmon.sh stand first on PATH, and the module path points at the
// built library, whose routine the control file names. Run as root: each tarnmon runs in an IPC
// namespace of its own, so that its control block never touches that of a monitor on this host.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <fstream>
#include <iterator>
#include <map>
#include <sched.h>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "support/idle_processes.h"
#include "support/monitor_setup.h"

extern char **environ;

namespace {

constexpr int INTERVAL = 5;
constexpr long PASSES = 10000;
constexpr long RECORD_EVERY = 1000;
constexpr char NAME[] = "tarnmon_resident";
constexpr int SMAPS_LINES_SHOWN = 16;

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

// The size of a file, -1 when there is none.
long long file_size(const std::string &path) {
    struct stat info {};
    return stat(path.c_str(), &info) == 0 ? static_cast<long long>(info.st_size) : -1;
}

std::string load_average() {
    std::string text = read_file("/proc/loadavg");
    size_t third = 0;
    for (int field = 0; field < 3 && third != std::string::npos; ++field) {
        third = text.find(' ', third + (field > 0 ? 1 : 0));
    }
    return text.substr(0, third);
}

double seconds_since(const timespec &start) {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec - start.tv_sec) +
           static_cast<double>(now.tv_nsec - start.tv_nsec) / 1e9;
}

// The events of the event log, one JSON object a line: how many are the informational event of a
// terminate request, which ends every run, and how many are anything else.
struct event_lines {
    int terminations = 0;
    int others = 0;
};

event_lines read_events(const std::string &path) {
    event_lines events;
    std::istringstream in(read_file(path));
    std::string line;
    while (std::getline(in, line)) {
        bool termination = line.find("\"reason\":\"0xE170\"") != std::string::npos &&
                           line.find("\"severity\":\"informational\"") != std::string::npos;
        ++(termination ? events.terminations : events.others);
    }
    return events;
}

// ---- What the preloaded library recorded ----

// One line of its figures file: "<when> <pass> <VmRSS> <VmHWM> <RssAnon> <RssFile> <RssShmem>".
struct figures_line {
    std::string when;
    long pass = -1;
    long rss_kb = -1;
    long hwm_kb = -1;
    long anon_kb = -1;
    long file_kb = -1;
    long shmem_kb = -1;
};

std::vector<figures_line> read_figures(const std::string &text) {
    std::vector<figures_line> lines;
    std::istringstream in(text);
    figures_line line;
    while (in >> line.when >> line.pass >> line.rss_kb >> line.hwm_kb >> line.anon_kb >>
           line.file_kb >> line.shmem_kb) {
        lines.push_back(line);
    }
    return lines;
}

const figures_line *find_figures(const std::vector<figures_line> &lines, const char *when,
                                 long pass) {
    for (const figures_line &line : lines) {
        if (line.when == when && (pass < 0 || line.pass == pass)) {
            return &line;
        }
    }
    return nullptr;
}

void print_figures(const figures_line &line, double seconds) {
    std::fprintf(stderr,
                 "%-10s %5ld  VmRSS %6ld kB  VmHWM %6ld kB  (anon %ld, file %ld, shmem %ld kB)  "
                 "pids %d  load %s  %.0f s\n",
                 line.when.c_str(), line.pass, line.rss_kb, line.hwm_kb, line.anon_kb, line.file_kb,
                 line.shmem_kb, pids_in_proc(), load_average().c_str(), seconds);
}

// Its counts file: "<name> <value>" lines.
std::map<std::string, long> read_counts(const std::string &text) {
    std::map<std::string, long> counts;
    std::istringstream in(text);
    std::string name;
    long value = 0;
    while (in >> name >> value) {
        counts[name] = value;
    }
    return counts;
}

long count_of(const std::map<std::string, long> &counts, const char *name) {
    auto found = counts.find(name);
    return found != counts.end() ? found->second : -1;
}

// The resident kB of a copy of /proc/<pid>/smaps by mapped file ("[anonymous]" for none), with
// the anonymous kB of each, largest first.
void print_smaps(const std::string &title, const std::string &text) {
    struct held {
        long rss_kb = 0;
        long anon_kb = 0;
        int mappings = 0;
    };
    std::map<std::string, held> by_name;
    std::istringstream in(text);
    std::string line;
    held *current = nullptr;
    while (std::getline(in, line)) {
        size_t colon = line.find(':');
        size_t blank = line.find(' ');
        bool header = blank != std::string::npos && (colon == std::string::npos || colon > blank);
        if (header) {
            // "start-end perms offset dev inode [name]"
            std::istringstream fields(line);
            std::string range, perms, offset, device, inode, name;
            fields >> range >> perms >> offset >> device >> inode;
            std::getline(fields >> std::ws, name);
            current = &by_name[name.empty() ? "[anonymous]" : name];
            ++current->mappings;
            continue;
        }
        long kb = 0;
        if (current != nullptr && std::sscanf(line.c_str(), "Rss: %ld", &kb) == 1) {
            current->rss_kb += kb;
        } else if (current != nullptr && std::sscanf(line.c_str(), "Anonymous: %ld", &kb) == 1) {
            current->anon_kb += kb;
        }
    }
    std::vector<std::pair<std::string, held>> sorted(by_name.begin(), by_name.end());
    std::sort(sorted.begin(), sorted.end(),
              [](const auto &a, const auto &b) { return a.second.rss_kb > b.second.rss_kb; });
    long total = 0;
    for (const auto &entry : sorted) {
        total += entry.second.rss_kb;
    }
    std::fprintf(stderr, "%s: %ld kB resident in %zu mapped names\n", title.c_str(), total,
                 sorted.size());
    std::fprintf(stderr, "  %8s %8s %5s  %s\n", "rss kB", "anon kB", "maps", "mapping");
    int shown = 0;
    for (const auto &[name, figures] : sorted) {
        if (shown++ == SMAPS_LINES_SHOWN || figures.rss_kb == 0) {
            break;
        }
        std::fprintf(stderr, "  %8ld %8ld %5d  %s\n", figures.rss_kb, figures.anon_kb,
                     figures.mappings, name.c_str());
    }
}

// ---- The run ----

// What tarnmon does not take from this process's environment: the preloaded library and its
// settings come from the benchmark, and the monitor's files all go to the run's data directory.
constexpr const char *REPLACED_VARIABLES[] = {
    "LD_PRELOAD=", "TARN_FAST_TIME_", "TELV_DATA_DIR=", "TELV_EVENT_LOG=", "TELV_TRACE_FILE="};

// tarnmon run in a new IPC namespace, with its output in `out` and `err`, and the preloaded
// library's settings added to this process's environment. The child's pid, or -1.
pid_t start_tarnmon(const std::vector<std::string> &words, const std::vector<std::string> &added,
                    const std::string &out, const std::string &err) {
    std::vector<std::string> environment;
    for (char **entry = environ; *entry != nullptr; ++entry) {
        bool replaced = false;
        for (const char *prefix : REPLACED_VARIABLES) {
            replaced = replaced || std::strncmp(*entry, prefix, std::strlen(prefix)) == 0;
        }
        if (!replaced) {
            environment.emplace_back(*entry);
        }
    }
    environment.insert(environment.end(), added.begin(), added.end());
    std::vector<char *> envp;
    for (std::string &entry : environment) {
        envp.push_back(entry.data());
    }
    envp.push_back(nullptr);
    std::vector<std::string> copies = words;
    std::vector<char *> argv;
    for (std::string &word : copies) {
        argv.push_back(word.data());
    }
    argv.push_back(nullptr);
    std::fflush(nullptr);
    pid_t pid = fork();
    if (pid != 0) {
        return pid;
    }
    int input = open("/dev/null", O_RDONLY);
    int output = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    int errors = open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (input < 0 || output < 0 || errors < 0 || dup2(input, 0) < 0 || dup2(output, 1) < 0 ||
        dup2(errors, 2) < 0) {
        _exit(125);
    }
    if (unshare(CLONE_NEWIPC) != 0) {
        static const char why[] = "an IPC namespace of its own is needed (run as root)\n";
        ssize_t ignored = write(2, why, sizeof why - 1);
        static_cast<void>(ignored);
        _exit(125);
    }
    execve(argv[0], argv.data(), envp.data());
    _exit(127);
}

// Waits for tarnmon, printing the figures as the preloaded library records them. Its wait status.
int wait_for_tarnmon(pid_t pid, const std::string &figures_path, const timespec &start) {
    size_t printed = 0;
    int status = 0;
    for (;;) {
        pid_t ended = waitpid(pid, &status, WNOHANG);
        std::vector<figures_line> lines = read_figures(read_file(figures_path));
        for (; printed < lines.size(); ++printed) {
            print_figures(lines[printed], seconds_since(start));
        }
        if (ended == pid || (ended < 0 && errno != EINTR)) {
            return ended == pid ? status : -1;
        }
        sleep(1);
    }
}

void tarnmon_resident(benchmark::State &state) {
    long passes = state.range(0);
    char made[] = "/tmp/tarnmon-resident-XXXXXX";
    if (mkdtemp(made) == nullptr) {
        state.SkipWithError("cannot make a temporary directory");
        return;
    }
    std::string top = made;
    std::string data = top + "/data";
    std::string recorded = top + "/recorded";
    std::string config = top + "/telvzopt.trm";
    if (mkdir(recorded.c_str(), 0755) != 0 || !write_long_run_control_file(config)) {
        state.SkipWithError("cannot write the control file");
        return;
    }
    std::string event_log = data + "/telvzmnd.events";
    std::fprintf(stderr, "%s: %ld passes in %s, %d processes, load %s\n", NAME, passes, top.c_str(),
                 pids_in_proc(), load_average().c_str());

    std::vector<std::string> words = {TARN_TARNMON, "run", "--interval", std::to_string(INTERVAL),
                                      "--data-dir", data,  "--config",   config};
    std::vector<std::string> added = {std::string("LD_PRELOAD=") + TARN_FAST_TIME,
                                      "TARN_FAST_TIME_DIR=" + recorded,
                                      "TARN_FAST_TIME_INTERVAL=" + std::to_string(INTERVAL),
                                      "TARN_FAST_TIME_PASSES=" + std::to_string(passes),
                                      "TARN_FAST_TIME_EVERY=" + std::to_string(RECORD_EVERY)};
    int status = -1;
    for (auto _ : state) {
        timespec start{};
        clock_gettime(CLOCK_MONOTONIC, &start);
        pid_t pid = start_tarnmon(words, added, top + "/tarnmon.out", top + "/tarnmon.err");
        status = pid > 0 ? wait_for_tarnmon(pid, recorded + "/figures", start) : -1;
    }
    int pids_at_end = pids_in_proc();

    std::vector<figures_line> figures = read_figures(read_file(recorded + "/figures"));
    std::map<std::string, long> counts = read_counts(read_file(recorded + "/counts"));
    for (const char *name : {"smaps-last-sleep", "smaps-ended"}) {
        std::string text = read_file(recorded + "/" + name);
        if (!text.empty()) {
            print_smaps(std::string("tarnmon's ") + name, text);
        }
    }
    std::fprintf(stderr, "tarnmon's output:\n%s%s", read_file(top + "/tarnmon.out").c_str(),
                 read_file(top + "/tarnmon.err").c_str());
    std::fprintf(stderr, "counts of the preloaded library:\n");
    for (const auto &[name, value] : counts) {
        std::fprintf(stderr, "  %-22s %ld\n", name.c_str(), value);
    }

    const figures_line *first = find_figures(figures, "pass", 1);
    const figures_line *thousand = find_figures(figures, "pass", RECORD_EVERY);
    const figures_line *last_sleep = find_figures(figures, "last-sleep", -1);
    const figures_line *ended = find_figures(figures, "ended", -1);
    if (thousand == nullptr && passes == RECORD_EVERY) {
        thousand = ended; // the thousandth pass is the last, which sleeps no more
    }
    bool exited_fine = status != -1 && WIFEXITED(status) && WEXITSTATUS(status) == 0;
    // tarnmon's stop logs the terminate request, and nothing else may be logged.
    event_lines events = read_events(event_log);
    bool no_event = events.terminations == 1 && events.others == 0;
    bool no_dump = file_size(data + "/telvzstba.trm") == -1;
    // The loop ends after the pass that follows the sleep that stopped it: that sleep is the last.
    bool ran_all = count_of(counts, "sleeps") == (passes - 1) * INTERVAL &&
                   count_of(counts, "tick_reads_after_stop") >= 1 &&
                   count_of(counts, "short_tick_gaps") == 0 && count_of(counts, "joins") == 1;
    if (!exited_fine || !no_event || !no_dump || !ran_all || first == nullptr ||
        thousand == nullptr || ended == nullptr) {
        std::fprintf(stderr, "tarnmon: wait status %d, %d events besides %d of termination%s\n",
                     status, events.others, events.terminations,
                     no_dump ? "" : ", trace dump taken");
        state.SkipWithError("tarnmon failed, ran short, or found something: see standard error");
        return;
    }
    state.counters["passes"] = static_cast<double>(passes);
    state.counters["rss_1_kb"] = static_cast<double>(first->rss_kb);
    state.counters["rss_1000_kb"] = static_cast<double>(thousand->rss_kb);
    if (last_sleep != nullptr) {
        state.counters["rss_last_sleep_kb"] = static_cast<double>(last_sleep->rss_kb);
    }
    state.counters["rss_end_kb"] = static_cast<double>(ended->rss_kb);
    state.counters["hwm_end_kb"] = static_cast<double>(ended->hwm_kb);
    state.counters["anon_end_kb"] = static_cast<double>(ended->anon_kb);
    state.counters["file_end_kb"] = static_cast<double>(ended->file_kb);
    state.counters["pids"] = static_cast<double>(pids_at_end);
}

} // namespace

int main(int argc, char **argv) {
    setenv("TELV_MODULE_PATH", TARN_MODULE_DIR, 1);
    std::string path = std::string(TARN_LIBEXEC_DIR) + ":" + std::getenv("PATH");
    setenv("PATH", path.c_str(), 1);
    std::printf("processes on this machine before the benchmark: %d, load average %s\n",
                pids_in_proc(), load_average().c_str());
    // The short run is for a quick look at the level the resident memory settles at.
    benchmark::RegisterBenchmark(NAME, tarnmon_resident)
        ->Arg(RECORD_EVERY)
        ->Arg(PASSES)
        ->ArgName("passes")
        ->Iterations(1)
        ->UseRealTime()
        ->Unit(benchmark::kSecond);
    std::vector<char *> arguments = unless_named(argc, argv, NAME);
    int count = static_cast<int>(arguments.size()) - 1;
    benchmark::Initialize(&count, arguments.data());
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}

// A whole pass of the monitor on this host: what it costs the host against the least that its
// commands and its accounting cost, whether that cost depends on the size of the process that
// hosts the monitor, and how much memory a process running the monitor keeps resident.
//
// pass_over_floor: the five checks of a pass with the example control file, at the host's own
// process count and with 5,000 extra idle processes, against their floor: the same commands run
// alone through the same runner with a line handler that does nothing (the ps pipeline through the
// shell; free and cat /proc/meminfo; both df; cat of file-nr and runAsRoot lsmon.sh), and one bare
// open, read and close of every /proc/<pid>/stat, which is the least the CPU accounting can do.
// One of each an iteration, the floor first, so that a drift of the host weighs on both alike;
// the iteration's time is the pass's CPU time, its own and its children's, and `ratio` is the
// pass over the floor.
//
// A pass is the checks called the way the loop's pass calls them: the clears of the pass's data,
// the error texts and the descriptor listing first, then the per-process memory, system memory,
// file system, open files and performance checks in that order, and the copy of the process
// listing for the next pass. The monitor's entry point in run-once mode would be a start, not a
// pass: it reads, parses and validates the control file, compiles its expressions, attaches the
// control block and builds the CPU accounting from nothing every time, and its single pass never
// judges the CPU (that is armed only after the start's countdown of passes). Called directly, the
// pass is the loop's steady state: the CPU accounting holds ten samples, CPU checking is armed,
// the control block and the tables stay. The external routines of the control file are left out:
// they are the host's, not the checks'. The clock-tick source moves at least a second on at every
// call, so that every pass takes its CPU sample, as passes seconds apart do.
//
// A pass must find nothing, or it would start children (the trace dump, a partition's listing)
// and raise events that its floor does not. The example's thresholds are kept, but for four that
// this benchmark or its machine would cross: the processes listed (5,000 idle ones are more than
// the example allows), the resident size of a process and its kill limit (the benchmark's own
// 4 GiB; the kill limit goes to 0, so that nothing on this shared machine can be told to die), and
// the CPU of the appliance as a whole, which here is the whole machine, kept busy by whoever else
// compiles on it. A pass that finds anything, whose CPU walk stops short of the end of the list,
// or after which the event log has grown, ends its benchmark with an error.
//
// large_over_small: the same pass while this process holds 4 GiB of private memory, mapped and
// written (4 KiB pages, the most page-table entries a size can have), and once it has given it
// back: a child started by the runner must not pay for the size of the monitor's host. An
// iteration touches the 4 GiB, makes four passes, unmaps it and makes four more, so that a drift
// of the host weighs on both sizes alike; `ratio` is the large over the small. The touch and the
// unmap are not measured. Both sizes should see the same processes: the counters give the
// fewest and the most that any measured pass found, here and in pass_over_floor, as other users
// of a shared machine may start and end many meanwhile.
//
// monitor_resident (not run unless named by --benchmark_filter, and then alone, in a fresh
// process): the monitor's entry point, as a host runs it, with the control file written into the
// data directory (the example's, with the resident size, kill limit and appliance CPU out of reach
// as above, and a trend that is never reported) and a checking interval of 5, for 10,000 passes
// (1,000 in the short run) on the real commands at the host's process count. The loop's time seams
// step a counter instead of sleeping, and the sleep ends the run after the last pass by setting the
// control block's terminateRequest. VmRSS and VmHWM of /proc/self/status are printed after the
// first pass and every 1,000 passes; the counters give the resident kB before the start, after the
// first pass, after 1,000 passes, and after the last pass with the monitor ended. The process is
// this benchmark's: the command-line host is a separate program, which runs this same entry point.
//
// Everything traces through the default platform into a temporary data directory, detail lines
// included unless TELV_TRACE_DETAIL=0 says otherwise. The project's runAsRoot and lsmon.sh stand
// first on PATH, and the module path points at the built library, whose routine the control file
// names. Run as root: the control block lives in a private IPC namespace.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <fstream>
#include <iterator>
#include <string>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/times.h>
#include <unistd.h>
#include <vector>

#include "command_runner.h"
#include "core/control_block.h"
#include "core/monitor_loop.h"
#include "core/settings.h"
#include "cpu/performance.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "memory/pp_memory.h"
#include "memory/system_memory.h"
#include "storage/file_system.h"
#include "storage/open_files.h"
#include "support/cpu_time.h"
#include "support/idle_processes.h"
#include "support/monitor_setup.h"

namespace {

constexpr int EXTRA_PROCESSES = 5000;
constexpr size_t LARGE_BYTES = size_t{4} << 30;
// Passes of each size between two touches of the 4 GiB, which cost far more than a pass.
constexpr int PASSES_PER_SIZE = 4;
constexpr int32_t LISTED_OUT_OF_REACH = 100000;
constexpr int RESIDENT_INTERVAL = 5;
constexpr int RESIDENT_PASSES = 10000;
constexpr int RESIDENT_REPORT_EVERY = 1000;
constexpr char RESIDENT_NAME[] = "monitor_resident";

idle_processes idle;
clock_t stepped_ticks;
long tick_rate;

// A clock-tick source that moves at least a second on at every call, so that every update takes
// its sample, and never slower than the real clock, so that a long real gap between two samples
// (a touch of 4 GiB, a pass over 5,000 processes) is not taken for a second of the processes' CPU.
clock_t one_second_later() {
    static clock_t ahead_of_real = 0;
    clock_t now = times(nullptr) + ahead_of_real;
    if (now < stepped_ticks + tick_rate) {
        ahead_of_real += stepped_ticks + tick_rate - now;
        now = stepped_ticks + tick_rate;
    }
    stepped_ticks = now;
    return now;
}

// What one measured part of an iteration cost, summed over the iterations.
struct cpu_sum {
    double self = 0;
    double children = 0;

    double total() const { return self + children; }
    double add_since(const cpu_times &before) {
        cpu_times after = cpu_times::now();
        double own = after.self - before.self;
        double theirs = after.children - before.children;
        self += own;
        children += theirs;
        return own + theirs;
    }
};

std::string data_file(const char *name) {
    const char *dir = std::getenv("TELV_DATA_DIR");
    return std::string(dir != nullptr ? dir : ".") + "/" + name;
}

// The size of a file, -1 when there is none.
long long file_size(const std::string &path) {
    struct stat info {};
    return stat(path.c_str(), &info) == 0 ? static_cast<long long>(info.st_size) : -1;
}

std::string event_log_path() {
    const char *path = std::getenv("TELV_EVENT_LOG");
    return path != nullptr ? std::string(path) : data_file("telvzmnd.events");
}

long long events_at_start;

// ---- The floor ----

const char *const FREE_ARGV[] = {"free", nullptr};
const char *const MEMINFO_ARGV[] = {"cat", "/proc/meminfo", nullptr};
const char *const DF_SPACE_ARGV[] = {"df", "-h", "-l", "-T", nullptr};
const char *const DF_INODES_ARGV[] = {"df", "--inodes", "-l", nullptr};
const char *const FILE_NR_ARGV[] = {"cat", "/proc/sys/fs/file-nr", nullptr};
const char *const LISTING_ARGV[] = {"runAsRoot", "lsmon.sh", nullptr};

const command_spec FLOOR_COMMANDS[] = {
    {PS_COMMAND, nullptr, "ps", "ps"},
    {nullptr, FREE_ARGV, "free", "free"},
    {nullptr, MEMINFO_ARGV, "free", "cat /proc/meminfo"},
    {nullptr, DF_SPACE_ARGV, "df", "df"},
    {nullptr, DF_INODES_ARGV, "df1", "df1"},
    {nullptr, FILE_NR_ARGV, "cat", "cat"},
    {nullptr, LISTING_ARGV, "ls", "ls"},
};

void ignore_line(void *, char *, size_t) {}

// The floor of a pass; returns the processes whose stat it read.
int run_floor() {
    for (const command_spec &command : FLOOR_COMMANDS) {
        run_command(command, ignore_line, nullptr);
    }
    return bare_stat_reads();
}

// ---- The pass ----

// CPU checking armed, no sleep overrun flagged and no event raised before, as in the loop's
// passes once the countdown has run out on a quiet host.
void arm_cpu_checking() {
    write_field(TARN_CB_PTR->numLoopsBeforeCPUChecking, 0);
    write_field(TARN_CB_PTR->sleepTimeExceeded, 0);
    write_field(TARN_CB_PTR->tookLog, 0);
}

// One pass as the loop makes it; true when it found nothing and judged every process.
bool run_pass() {
    arm_cpu_checking();
    clear_primary_data_block();
    clear_ls_data_block();
    clear_error_texts();
    outbufferleft = OUTBUFFER_BUDGET;
    pdboverflow = 0;
    int32_t takeLogCrc = 0;
    int32_t takeLogValue = 0;
    int32_t killPid = 0;
    int32_t memoryPercentLogged = 0;
    uint32_t crc = 0;
    uint32_t *tookLog = &TARN_CB_PTR->tookLog;
    tarn_check_pp_memory(&takeLogCrc, &takeLogValue, &killPid, tookLog, &crc);
    tarn_check_system_memory(&takeLogCrc, &takeLogValue, tookLog, &memoryPercentLogged, &crc);
    tarn_check_file_system(&takeLogCrc, &takeLogValue, tookLog, &crc);
    tarn_check_open_files(&takeLogCrc, &takeLogValue, tookLog, &crc);
    tarn_check_performance(&takeLogCrc, &takeLogValue, tookLog, &crc);
    std::memcpy(oldPSDataBlock, newPSDataBlock, std::strlen(newPSDataBlock) + 1);
    bool walked_all = process_entry_ptr == nullptr;
    if (takeLogCrc != 0 || !walked_all) {
        std::fprintf(stderr, "the pass found something: takeLogCrc %#x, value %d, CPU walk %s\n",
                     static_cast<uint32_t>(takeLogCrc), takeLogValue,
                     walked_all ? "complete" : "stopped short");
        return false;
    }
    return file_size(event_log_path()) == events_at_start;
}

void fail(benchmark::State &state) {
    state.SkipWithError("the pass found something, did not judge every process, or raised an "
                        "event: see standard error");
}

int pids_listed() {
    return process_list_ptr->number_of_entries - 1;
}

// The fewest and most processes the measured passes found: other users of the machine may start
// and end processes meanwhile, which the figures of a pass follow.
struct pid_range {
    int least = INT32_MAX;
    int most = 0;

    void add(int pids) {
        least = std::min(least, pids);
        most = std::max(most, pids);
    }
    void report(benchmark::State &state) const {
        state.counters["pids_min"] = least;
        state.counters["pids_max"] = most;
    }
};

// The settings and tables of the example control file, the four thresholds out of reach, and
// the control block, once for the benchmarks that call the checks. Only then: the monitor's
// entry point makes its control block itself, and a block it finds is one to report.
bool attach_monitor() {
    static bool attached = false;
    if (attached) {
        return true;
    }
    uint32_t crc = 0;
    if (!load_example_control_file() || tarn_init(&crc) != 0) {
        std::fprintf(stderr, "cannot set up the monitor: control file or control block\n");
        return false;
    }
    rss_memory_threshold = RSS_OUT_OF_REACH;
    rss_abort_memory_threshold = 0;
    num_threads_threshold = LISTED_OUT_OF_REACH;
    cpu_percent_threshold_qv = APPLIANCE_CPU_OUT_OF_REACH;
    events_at_start = file_size(event_log_path());
    attached = true;
    return true;
}

// The idle processes of this benchmark, and a fresh CPU accounting filled by as many unmeasured
// passes as it keeps samples; they also pay for the kernel's making the /proc entries of new
// processes at their first reading, which only a first pass pays.
bool prepare(const benchmark::State &state) {
    if (!attach_monitor()) {
        return false;
    }
    static int64_t prepared = -1;
    if (prepared != state.range(0)) {
        idle.resize(static_cast<size_t>(state.range(0)));
        prepared = state.range(0);
    }
    tick_rate = sysconf(_SC_CLK_TCK);
    clock_tick_source = one_second_later;
    reset_process_listing_state();
    delete_process_list(&process_list);
    std::memset(&process_list, 0, sizeof process_list);
    process_list_ptr = &process_list;
    bool quiet = true;
    for (int i = 0; i < PROCESS_SAMPLES; ++i) {
        quiet = run_pass() && quiet;
    }
    run_floor();
    return quiet;
}

void pass_over_floor(benchmark::State &state) {
    if (!prepare(state)) {
        fail(state);
        return;
    }
    pid_range pids;
    cpu_sum floor;
    cpu_sum pass;
    for (auto _ : state) {
        cpu_times before = cpu_times::now();
        pids.add(run_floor());
        floor.add_since(before);
        before = cpu_times::now();
        bool quiet = run_pass();
        state.SetIterationTime(pass.add_since(before));
        pids.add(pids_listed());
        if (!quiet) {
            fail(state);
            break;
        }
    }
    auto iterations = static_cast<double>(state.iterations());
    if (iterations == 0) {
        return;
    }
    pids.report(state);
    state.counters["ratio"] = pass.total() / floor.total();
    state.counters["pass_ms"] = pass.total() / iterations * 1e3;
    state.counters["pass_self_ms"] = pass.self / iterations * 1e3;
    state.counters["pass_children_ms"] = pass.children / iterations * 1e3;
    state.counters["floor_ms"] = floor.total() / iterations * 1e3;
    state.counters["floor_self_ms"] = floor.self / iterations * 1e3;
    state.counters["floor_children_ms"] = floor.children / iterations * 1e3;
    state.counters["extra_ms"] = (pass.total() - floor.total()) / iterations * 1e3;
}

// 4 GiB of private memory, every page written; null when it cannot be had. The pages are made
// present in one call before the memset writes them all, which only saves the trap of each first
// write.
void *touch_large() {
    void *memory =
        mmap(nullptr, LARGE_BYTES, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) {
        return nullptr;
    }
    // Small pages whatever the machine's huge-page policy: the largest page tables for the size.
    madvise(memory, LARGE_BYTES, MADV_NOHUGEPAGE);
    madvise(memory, LARGE_BYTES, MADV_POPULATE_WRITE);
    std::memset(memory, 1, LARGE_BYTES);
    benchmark::DoNotOptimize(memory);
    benchmark::ClobberMemory();
    return memory;
}

void large_over_small(benchmark::State &state) {
    if (!prepare(state)) {
        fail(state);
        return;
    }
    pid_range pids;
    cpu_sum small;
    cpu_sum large;
    for (auto _ : state) {
        void *memory = touch_large();
        if (memory == nullptr) {
            state.SkipWithError("cannot map 4 GiB");
            break;
        }
        bool quiet = true;
        cpu_times before = cpu_times::now();
        for (int i = 0; i < PASSES_PER_SIZE; ++i) {
            quiet = run_pass() && quiet;
            pids.add(pids_listed());
        }
        state.SetIterationTime(large.add_since(before));
        munmap(memory, LARGE_BYTES);
        before = cpu_times::now();
        for (int i = 0; i < PASSES_PER_SIZE; ++i) {
            quiet = run_pass() && quiet;
            pids.add(pids_listed());
        }
        small.add_since(before);
        if (!quiet) {
            fail(state);
            break;
        }
    }
    auto passes = static_cast<double>(state.iterations()) * PASSES_PER_SIZE;
    if (passes == 0) {
        return;
    }
    pids.report(state);
    state.counters["ratio"] = large.total() / small.total();
    state.counters["large_ms"] = large.total() / passes * 1e3;
    state.counters["large_self_ms"] = large.self / passes * 1e3;
    state.counters["small_ms"] = small.total() / passes * 1e3;
    state.counters["small_self_ms"] = small.self / passes * 1e3;
}

// ---- The monitor's resident memory ----

struct resident_figures {
    long rss_kb = -1;
    long hwm_kb = -1;
    long anon_kb = -1;
    long file_kb = -1;
    long shmem_kb = -1;
};

resident_figures read_resident() {
    resident_figures figures;
    std::FILE *status = std::fopen("/proc/self/status", "r");
    if (status == nullptr) {
        return figures;
    }
    char text[256];
    while (std::fgets(text, sizeof text, status) != nullptr) {
        long value = 0;
        if (std::sscanf(text, "VmRSS: %ld", &value) == 1) {
            figures.rss_kb = value;
        } else if (std::sscanf(text, "VmHWM: %ld", &value) == 1) {
            figures.hwm_kb = value;
        } else if (std::sscanf(text, "RssAnon: %ld", &value) == 1) {
            figures.anon_kb = value;
        } else if (std::sscanf(text, "RssFile: %ld", &value) == 1) {
            figures.file_kb = value;
        } else if (std::sscanf(text, "RssShmem: %ld", &value) == 1) {
            figures.shmem_kb = value;
        }
    }
    std::fclose(status);
    return figures;
}

// One line of the resident figures, with the processes in /proc and the seconds since the start.
void print_resident(const char *when, long passes, const resident_figures &figures) {
    static timespec start = [] {
        timespec now{};
        clock_gettime(CLOCK_MONOTONIC, &now);
        return now;
    }();
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    double seconds = static_cast<double>(now.tv_sec - start.tv_sec) +
                     static_cast<double>(now.tv_nsec - start.tv_nsec) / 1e9;
    std::fprintf(stderr,
                 "%-20s passes %5ld  VmRSS %6ld kB  VmHWM %6ld kB  (anon %ld, file %ld, shmem "
                 "%ld kB)  pids %d  %.0f s\n",
                 when, passes, figures.rss_kb, figures.hwm_kb, figures.anon_kb, figures.file_kb,
                 figures.shmem_kb, pids_in_proc(), seconds);
}

// The seams' clock: a second on at every sleep, for the loop's uptime and the CPU accounting's
// clock ticks alike.
long fake_uptime = 1000;
long sleeps;
long passes_wanted;
resident_figures after_first_pass;
resident_figures after_first_thousand;

long stepped_uptime() {
    return fake_uptime;
}

clock_t ticks_of_the_seams() {
    return stepped_ticks;
}

// Sleep k belongs to pass (k - 1) / interval + 1, whose checks are done by then. The last sleep
// of the pass before the last asks the loop to end, which it does after its next pass.
void stepped_sleep() {
    ++fake_uptime;
    stepped_ticks += tick_rate;
    ++sleeps;
    if ((sleeps - 1) % RESIDENT_INTERVAL == 0) {
        long pass = (sleeps - 1) / RESIDENT_INTERVAL + 1;
        if (pass == 1 || pass % RESIDENT_REPORT_EVERY == 0 || pass == passes_wanted - 1) {
            resident_figures figures = read_resident();
            print_resident("after pass", pass, figures);
            if (pass == 1) {
                after_first_pass = figures;
            } else if (pass == RESIDENT_REPORT_EVERY) {
                after_first_thousand = figures;
            }
        }
    }
    if (sleeps == (passes_wanted - 1) * RESIDENT_INTERVAL && TARN_CB_PTR != nullptr) {
        write_field(TARN_CB_PTR->terminateRequest, 1);
    }
}

void monitor_resident(benchmark::State &state) {
    idle.resize(0);
    if (TARN_CB_PTR != nullptr) {
        state.SkipWithError("run alone: another benchmark of this process made the control block");
        return;
    }
    events_at_start = file_size(event_log_path());
    if (!write_long_run_control_file(data_file("telvzopt.trm"))) {
        state.SkipWithError("cannot write the control file into the data directory");
        return;
    }
    tick_rate = sysconf(_SC_CLK_TCK);
    passes_wanted = state.range(0);
    resident_figures before_start;
    resident_figures at_end;
    uint32_t src = 0;
    for (auto _ : state) {
        uptime_source = stepped_uptime;
        one_second_sleep = stepped_sleep;
        clock_tick_source = ticks_of_the_seams;
        sleeps = 0;
        before_start = read_resident();
        print_resident("before the start", 0, before_start);
        char name[] = "telvzmnd";
        std::string interval = std::to_string(RESIDENT_INTERVAL);
        char *argv[] = {name, interval.data(), nullptr};
        src = tarn_mon_main(2, argv);
        at_end = read_resident();
        print_resident("after the last pass", passes_wanted, at_end);
    }
    // The loop ends after the pass that follows the sleep that asked it to: that sleep is the
    // last one.
    bool ran_all = sleeps == (passes_wanted - 1) * RESIDENT_INTERVAL;
    if (src != 0 || !ran_all || file_size(event_log_path()) != events_at_start ||
        file_size(data_file("telvzstba.trm")) != -1) {
        std::fprintf(stderr, "monitor: src %u, %ld sleeps, event log %lld bytes (%lld before)\n",
                     src, sleeps, file_size(event_log_path()), events_at_start);
        state.SkipWithError("the monitor failed, ran short, or found something");
        return;
    }
    state.counters["passes"] = static_cast<double>(passes_wanted);
    state.counters["rss_before_kb"] = static_cast<double>(before_start.rss_kb);
    state.counters["rss_1_kb"] = static_cast<double>(after_first_pass.rss_kb);
    if (after_first_thousand.rss_kb >= 0) {
        state.counters["rss_1000_kb"] = static_cast<double>(after_first_thousand.rss_kb);
    }
    state.counters["rss_end_kb"] = static_cast<double>(at_end.rss_kb);
    state.counters["hwm_end_kb"] = static_cast<double>(at_end.hwm_kb);
}

} // namespace

int main(int argc, char **argv) {
    setenv("TELV_MODULE_PATH", TARN_MODULE_DIR, 1);
    if (!enter_private_ipc()) {
        return 1;
    }
    use_temporary_data_dir();
    std::string path = std::string(TARN_LIBEXEC_DIR) + ":" + std::getenv("PATH");
    setenv("PATH", path.c_str(), 1);
    std::printf("processes on this machine before the benchmark: %d\n", pids_in_proc());
    for (int extra : {0, EXTRA_PROCESSES}) {
        benchmark::RegisterBenchmark("pass_over_floor", pass_over_floor)
            ->Arg(extra)
            ->ArgName("extra")
            ->MinTime(2.0)
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    for (int extra : {0, EXTRA_PROCESSES}) {
        benchmark::RegisterBenchmark("large_over_small", large_over_small)
            ->Arg(extra)
            ->ArgName("extra")
            ->MinTime(1.0)
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    // The short run is for a quick look at the level the resident memory settles at.
    benchmark::RegisterBenchmark(RESIDENT_NAME, monitor_resident)
        ->Arg(RESIDENT_REPORT_EVERY)
        ->Arg(RESIDENT_PASSES)
        ->ArgName("passes")
        ->Iterations(1)
        ->UseRealTime()
        ->Unit(benchmark::kSecond);
    std::vector<char *> arguments = unless_named(argc, argv, RESIDENT_NAME);
    int count = static_cast<int>(arguments.size()) - 1;
    benchmark::Initialize(&count, arguments.data());
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    delete_process_list(&process_list);
    idle.resize(0);
    return 0;
}

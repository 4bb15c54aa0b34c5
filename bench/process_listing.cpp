// The cost of one update of the process CPU accounting per process on this machine, at the
// machine's own process count and with 2,000 and 5,000 extra idle processes, against a bare scan
// that only opens, reads and closes each /proc/<pid>/stat once. Both scan the /proc directory.
//
// Every update must lie half a second after the one before or it is skipped; the clock-tick
// source is therefore one that moves a second on at every call, so each iteration samples.
// Tracing goes through the default platform into a trace file in a temporary data directory:
// an update writes its entry and exit lines and one line per processor found, whatever the
// process count; trace_line gives the cost of one such line.
#include <benchmark/benchmark.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <spawn.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "cpu/process_listing.h"
#include "support/idle_processes.h"
#include "tracesvc.h"

extern char **environ;

namespace {

idle_processes idle;
clock_t stepped_ticks;
long tick_rate;

clock_t one_second_later() {
    stepped_ticks += tick_rate;
    return stepped_ticks;
}

void report_per_pid(benchmark::State &state, int pids) {
    state.counters["pids"] = pids;
    state.counters["per_pid"] = benchmark::Counter(
        pids, benchmark::Counter::kIsIterationInvariantRate | benchmark::Counter::kInvert);
}

void update_process_list_per_pid(benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    tick_rate = sysconf(_SC_CLK_TCK);
    clock_tick_source = one_second_later;
    reset_process_listing_state();
    delete_process_list(&process_list);
    std::memset(&process_list, 0, sizeof process_list);
    update_process_list(&process_list); // every pid gets its entry before timing starts
    for (auto _ : state) {
        update_process_list(&process_list);
    }
    report_per_pid(state, process_list.number_of_entries - 1);
    delete_process_list(&process_list);
}

void bare_stat_reads_per_pid(benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    int pids = 0;
    for (auto _ : state) {
        pids = bare_stat_reads();
    }
    report_per_pid(state, pids);
}

// The processor count, read from /proc/cpuinfo at every update whatever the process count.
void cpu_count(benchmark::State &state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(query_number_of_cpus());
    }
}

// One trace line of the kind an update writes, for the share of tracing in an update.
void trace_line(benchmark::State &state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(tracesvc_trace("TARNCPUF: ->update_process_list"));
    }
}

} // namespace

int main(int argc, char **argv) {
    char data_dir[] = "/tmp/tarn-bench-XXXXXX";
    if (std::getenv("TELV_DATA_DIR") == nullptr && mkdtemp(data_dir) != nullptr) {
        setenv("TELV_DATA_DIR", data_dir, 1);
    }
    std::printf("processes on this machine before the benchmark: %d\n", pids_in_proc());
    for (int extra : {0, 2000, 5000}) {
        benchmark::RegisterBenchmark("update_process_list", update_process_list_per_pid)
            ->Arg(extra)
            ->ArgName("extra")
            ->Unit(benchmark::kMicrosecond);
        benchmark::RegisterBenchmark("bare_stat_reads", bare_stat_reads_per_pid)
            ->Arg(extra)
            ->ArgName("extra")
            ->Unit(benchmark::kMicrosecond);
    }
    benchmark::RegisterBenchmark("query_number_of_cpus", cpu_count)->Unit(benchmark::kMicrosecond);
    benchmark::RegisterBenchmark("trace_line", trace_line)->Unit(benchmark::kNanosecond);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    idle.resize(0);
    return 0;
}

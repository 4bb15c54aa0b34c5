// The system memory check on this host against its two commands (free, cat /proc/meminfo) run
// alone through the same runner with a line handler that does nothing. Each iteration's time is
// the CPU time of this process and of its children, so the two compare what the check costs the
// host; the counters split it into the check's own time and its children's.
//
// The check traces to the default platform's trace file, in a data directory of its own; with
// TELV_TRACE_DETAIL=0 its detail lines are dropped, as a host may choose. A third benchmark runs
// the two in turn and gives their ratio, which the drift of a busy host cannot tilt.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "command_runner.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "memory/system_memory.h"
#include "support/cpu_time.h"
#include "support/idle_processes.h"
#include "support/monitor_setup.h"

namespace {

// The lines that went into primaryDataBlock after the two headers.
int64_t copied_lines() {
    int64_t lines = -4;
    for (const char *at = primaryDataBlock; (at = std::strstr(at, "\n\r")) != nullptr; at += 2) {
        ++lines;
    }
    return lines;
}

int64_t run_check() {
    start_pass();
    int32_t take_log_crc = 0;
    int32_t take_log_value = 0;
    int32_t memory_percent_logged = 0;
    uint32_t took_log = 0;
    uint32_t crc = 0;
    tarn_check_system_memory(&take_log_crc, &take_log_value, &took_log, &memory_percent_logged,
                             &crc);
    return copied_lines();
}

int64_t run_commands_alone() {
    static constexpr const char *free_argv[] = {"free", nullptr};
    static constexpr const char *cat_argv[] = {"cat", "/proc/meminfo", nullptr};
    int64_t lines = 0;
    auto count = [&lines](char *, size_t) { ++lines; };
    run_command(command_spec{nullptr, free_argv, "free", "free"}, count);
    run_command(command_spec{nullptr, cat_argv, "free", "cat /proc/meminfo"}, count);
    return lines;
}

void check(benchmark::State &state) {
    measure_cpu(state, run_check);
}

void commands_alone(benchmark::State &state) {
    measure_cpu(state, run_commands_alone);
}

// The two in turn, one of each an iteration, so that a drift of the host weighs on both alike:
// the ratio of their CPU times, and what the check costs beyond the commands.
void check_over_commands_alone(benchmark::State &state) {
    double check_total = 0;
    double alone_total = 0;
    for (auto _ : state) {
        cpu_times before = cpu_times::now();
        run_commands_alone();
        cpu_times between = cpu_times::now();
        run_check();
        cpu_times after = cpu_times::now();
        double alone = (between.self - before.self) + (between.children - before.children);
        double checked = (after.self - between.self) + (after.children - between.children);
        alone_total += alone;
        check_total += checked;
        state.SetIterationTime(checked);
    }
    auto iterations = static_cast<double>(state.iterations());
    state.counters["ratio"] = check_total / alone_total;
    state.counters["extra_us"] = (check_total - alone_total) / iterations * 1e6;
}

} // namespace

int main(int argc, char **argv) {
    use_temporary_data_dir();
    // Thresholds that find nothing, so that every call takes the same path.
    total_memory_in_use_threshold = INT32_MAX;
    total_memory_percent_threshold = 1000;
    resume_memory_percent_threshold = 11;
    min_swap_size = 0;
    low_free_size = 1;
    std::printf("processes on this machine: %d\n", pids_in_proc());
    benchmark::RegisterBenchmark("tarn_check_system_memory", check)
        ->UseManualTime()
        ->Unit(benchmark::kMicrosecond);
    benchmark::RegisterBenchmark("free_and_cat_alone", commands_alone)
        ->UseManualTime()
        ->Unit(benchmark::kMicrosecond);
    benchmark::RegisterBenchmark("check_over_commands_alone", check_over_commands_alone)
        ->UseManualTime()
        ->Unit(benchmark::kMicrosecond);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}

// The system memory check on this host against its two commands (free, cat /proc/meminfo) run
// alone through the same runner with a line handler that does nothing. Each iteration's time is
// the CPU time of this process and of its children, so the two compare what the check costs the
// host; the counters split it into the check's own time and its children's.
//
// The check traces to the default platform's trace file, in a data directory of its own.
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

void check(benchmark::State &state) {
    // Thresholds that find nothing, so that every pass takes the same path.
    total_memory_in_use_threshold = INT32_MAX;
    total_memory_percent_threshold = 1000;
    resume_memory_percent_threshold = 11;
    min_swap_size = 0;
    low_free_size = 1;
    measure_cpu(state, [] {
        start_pass();
        int32_t take_log_crc = 0;
        int32_t take_log_value = 0;
        int32_t memory_percent_logged = 0;
        uint32_t took_log = 0;
        uint32_t crc = 0;
        tarn_check_system_memory(&take_log_crc, &take_log_value, &took_log, &memory_percent_logged,
                                 &crc);
        return copied_lines();
    });
}

void commands_alone(benchmark::State &state) {
    static constexpr const char *free_argv[] = {"free", nullptr};
    static constexpr const char *cat_argv[] = {"cat", "/proc/meminfo", nullptr};
    measure_cpu(state, [] {
        int64_t lines = 0;
        auto count = [&lines](char *, size_t) { ++lines; };
        run_command(command_spec{nullptr, free_argv, "free", "free"}, count);
        run_command(command_spec{nullptr, cat_argv, "free", "cat /proc/meminfo"}, count);
        return lines;
    });
}

} // namespace

int main(int argc, char **argv) {
    use_temporary_data_dir();
    std::printf("processes on this machine: %d\n", pids_in_proc());
    benchmark::RegisterBenchmark("tarn_check_system_memory", check)
        ->UseManualTime()
        ->Unit(benchmark::kMicrosecond);
    benchmark::RegisterBenchmark("free_and_cat_alone", commands_alone)
        ->UseManualTime()
        ->Unit(benchmark::kMicrosecond);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}

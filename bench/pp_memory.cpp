// The per-process memory check on this host, at the host's own process count and with 5,000
// extra idle processes, against its shell command run alone through the same runner with a line
// handler that does nothing. Each iteration's time is the CPU time of this process and of its
// children (bash, ps, sort), so the two compare what the check costs the host; the counters split
// it into the check's own time (per listed line) and its children's.
//
// Then the start of one child (/bin/true, no shell) by the runner, in this small process and again
// once the process holds 4 GiB of touched memory: a spawn must not cost more in a large host.
//
// The check needs a control block: the program first moves into an IPC namespace of its own, so
// that it never touches the block of a monitor on this host.
#include <benchmark/benchmark.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sys/mman.h>
#include <vector>

#include "command_runner.h"
#include "core/control_block.h"
#include "data_blocks.h"
#include "memory/pp_memory.h"
#include "support/cpu_time.h"
#include "support/idle_processes.h"
#include "support/monitor_setup.h"

namespace {

idle_processes idle;

void check(benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    measure_cpu(state, [] {
        start_pass();
        int32_t take_log_crc = 0;
        int32_t take_log_value = 0;
        int32_t kill_pid = 0;
        uint32_t crc = 0;
        tarn_check_pp_memory(&take_log_crc, &take_log_value, &kill_pid, &TARN_CB_PTR->tookLog,
                             &crc);
        // Every listed line went into the block behind the two lines of its header.
        int64_t lines = -2;
        for (const char *at = primaryDataBlock; (at = std::strstr(at, "\n\r")) != nullptr;
             at += 2) {
            ++lines;
        }
        return lines;
    });
}

void command_alone(benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    measure_cpu(state, [] {
        int64_t lines = 0;
        run_command(command_spec{PS_COMMAND, nullptr, "ps", "ps"},
                    [&lines](char *, size_t) { ++lines; });
        return lines;
    });
}

// Memory this process holds, every page touched, for the spawn of a large host.
void hold_touched_memory(size_t gib) {
    static size_t held = 0;
    if (held == gib) {
        return;
    }
    size_t bytes = gib << 30;
    void *memory = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) {
        std::fprintf(stderr, "cannot hold %zu GiB: %s\n", gib, std::strerror(errno));
        std::exit(1);
    }
    std::memset(memory, 1, bytes);
    held = gib;
}

void spawn_one_child(benchmark::State &state) {
    idle.resize(0);
    hold_touched_memory(static_cast<size_t>(state.range(0)));
    const char *argv[] = {"/bin/true", nullptr};
    for (auto _ : state) {
        run_command(command_spec{nullptr, argv, "true", "true"}, [](char *, size_t) {});
    }
}

} // namespace

int main(int argc, char **argv) {
    if (!set_up_monitor()) {
        return 1;
    }
    std::printf("processes on this machine before the benchmark: %d\n", pids_in_proc());
    for (int extra : {0, 5000}) {
        benchmark::RegisterBenchmark("tarn_check_pp_memory", check)
            ->Arg(extra)
            ->ArgName("extra")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
        benchmark::RegisterBenchmark("ps_command_alone", command_alone)
            ->Arg(extra)
            ->ArgName("extra")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    for (int gib : {0, 4}) {
        benchmark::RegisterBenchmark("spawn_one_child", spawn_one_child)
            ->Arg(gib)
            ->ArgName("held_gib")
            ->Unit(benchmark::kMicrosecond);
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    idle.resize(0);
    return 0;
}

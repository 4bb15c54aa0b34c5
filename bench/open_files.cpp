// The open files check on this host, at the host's own process count and with 5,000 extra idle
// processes holding 10 descriptors each, against its two commands (cat of file-nr, and runAsRoot
// lsmon.sh) run alone through the same runner with line handlers that only count. Each
// iteration's time is the CPU time of this process and of its children, so the two compare what
// the check costs the host. The project's own runAsRoot and lsmon.sh stand first on PATH.
//
// Then the clear of lsDataBlock that each directory of the listing asks for: the whole block, as
// the monitor once cleared it, against the bytes an average block of this host's listing writes,
// as it clears now. The command's counters give the directories and bytes of one pass, so that
// both can be put per pass.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "command_runner.h"
#include "core/control_block.h"
#include "data_blocks.h"
#include "storage/open_files.h"
#include "support/cpu_time.h"
#include "support/idle_processes.h"
#include "support/monitor_setup.h"

namespace {

constexpr int IDLE_DESCRIPTORS = 10;

idle_processes idle;

const char *const FILE_NR_ARGV[] = {"cat", "/proc/sys/fs/file-nr", nullptr};
const char *const LISTING_ARGV[] = {"runAsRoot", "lsmon.sh", nullptr};

// The idle processes for this benchmark, and one listing of all of them unmeasured: the kernel
// makes the /proc entries of a process at their first reading, which only the first pass pays.
void prepare_processes(const benchmark::State &state) {
    static int64_t prepared = -1;
    if (prepared == state.range(0)) {
        return;
    }
    idle.resize(static_cast<size_t>(state.range(0)), IDLE_DESCRIPTORS);
    run_command(command_spec{nullptr, LISTING_ARGV, "ls", "ls"}, [](char *, size_t) {});
    prepared = state.range(0);
}

void check(benchmark::State &state) {
    prepare_processes(state);
    measure_cpu(state, [] {
        start_pass();
        int32_t take_log_crc = 0;
        int32_t take_log_value = 0;
        uint32_t crc = 0;
        tarn_check_open_files(&take_log_crc, &take_log_value, &TARN_CB_PTR->tookLog, &crc);
        // One summary line a directory of the listing went into the block.
        int64_t directories = 0;
        for (const char *at = primaryDataBlock; (at = std::strstr(at, "/proc/")) != nullptr; ++at) {
            ++directories;
        }
        return directories;
    });
}

void commands_alone(benchmark::State &state) {
    prepare_processes(state);
    int64_t directories = 0;
    int64_t bytes = 0;
    measure_cpu(state, [&] {
        int64_t lines = 0;
        directories = 0;
        bytes = 0;
        run_command(command_spec{nullptr, FILE_NR_ARGV, "cat", "cat"},
                    [&lines](char *, size_t) { ++lines; });
        run_command(command_spec{nullptr, LISTING_ARGV, "ls", "ls"},
                    [&](char *text, size_t length) {
                        ++lines;
                        directories += std::strncmp(text, "/proc", 5) == 0 ? 1 : 0;
                        bytes += static_cast<int64_t>(length) + 2; // as kept, with "\n\r"
                    });
        return lines;
    });
    state.counters["directories"] = static_cast<double>(directories);
    state.counters["bytes_per_directory"] =
        directories > 0 ? static_cast<double>(bytes) / static_cast<double>(directories) : 0;
}

// One clear of the first `range(0)` bytes of lsDataBlock, every page of them faulted in before.
void ls_block_clear(benchmark::State &state) {
    auto bytes = static_cast<size_t>(state.range(0));
    std::memset(lsDataBlock, 1, bytes);
    for (auto _ : state) {
        std::memset(lsDataBlock, 0, bytes);
        benchmark::ClobberMemory();
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes));
}

} // namespace

int main(int argc, char **argv) {
    if (!set_up_monitor()) {
        return 1;
    }
    std::string path = std::string(TARN_LIBEXEC_DIR) + ":" + std::getenv("PATH");
    setenv("PATH", path.c_str(), 1);
    std::printf("processes on this machine before the benchmark: %d\n", pids_in_proc());
    for (int extra : {0, 5000}) {
        benchmark::RegisterBenchmark("tarn_check_open_files", check)
            ->Arg(extra)
            ->ArgName("extra")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
        benchmark::RegisterBenchmark("file_nr_and_lsmon_alone", commands_alone)
            ->Arg(extra)
            ->ArgName("extra")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    // The whole block, and the bytes of an average directory of a listing (about 15 lines).
    for (int64_t bytes : {static_cast<int64_t>(LS_DATA_BLOCK_SIZE), int64_t{1024}}) {
        benchmark::RegisterBenchmark("ls_block_clear", ls_block_clear)
            ->Arg(bytes)
            ->ArgName("bytes")
            ->Unit(benchmark::kMicrosecond);
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    idle.resize(0);
    return 0;
}

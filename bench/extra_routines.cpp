// The cost of each routine of libtelvzextra.so on this machine, at the machine's own process count
// and with 5,000 extra idle processes, against the bare reads of the files it needs: the same
// opens, reads, directory scans and statvfs calls, with nothing parsed, ranked or written.
//
// The oom_kill counter does not rise during a run, so the kernel log is never read; the routines
// keep their state between iterations as between passes.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <string>
#include <sys/statvfs.h>
#include <unistd.h>
#include <vector>

#include "descriptors.h"
#include "oom_kills.h"
#include "pressure.h"
#include "support/idle_processes.h"
#include "time_to_full.h"

namespace {

idle_processes idle;
char scratch[131072];

// One open, read to the end and close, as the routines read a /proc file.
void bare_read(const char *path) {
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return;
    }
    while (read(fd, scratch, sizeof scratch) > 0) {
    }
    close(fd);
}

void bare_pressure() {
    for (const char *path : {"/proc/pressure/memory", "/proc/pressure/cpu", "/proc/pressure/io"}) {
        bare_read(path);
    }
}

void bare_vmstat() {
    bare_read("/proc/vmstat");
}

// Every process's limits read and its descriptors counted; the routine reads the names of the
// few it lists besides.
void bare_descriptors() {
    DIR *proc = opendir("/proc");
    while (const dirent *entry = readdir(proc)) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') {
            continue;
        }
        char path[300]; // a d_name is at most 255 bytes
        std::snprintf(path, sizeof path, "/proc/%s/limits", entry->d_name);
        bare_read(path);
        std::snprintf(path, sizeof path, "/proc/%s/fd", entry->d_name);
        if (DIR *fds = opendir(path)) {
            while (readdir(fds) != nullptr) {
            }
            closedir(fds);
        }
    }
    closedir(proc);
}

// The mount points the routine measures, found once before timing.
std::vector<std::string> local_mount_points() {
    static char filesystems[8192];
    static char mounts[131072];
    file_text types = read_proc_file("filesystems", filesystems, sizeof filesystems);
    file_text table = read_proc_file("self/mounts", mounts, sizeof mounts);
    std::vector<std::string> points;
    std::string_view lines = table.text;
    while (!lines.empty()) {
        mount_entry entry;
        char path[MOUNT_POINT_SIZE];
        if (parse_mount_line(take_line(lines), &entry) &&
            classify_file_system(types.text, entry.type) == file_system_kind::local &&
            unescape_mount_path(entry.mount_point, path, sizeof path)) {
            points.emplace_back(path);
        }
    }
    return points;
}

void bare_time_to_full(const std::vector<std::string> &points) {
    bare_read("/proc/filesystems");
    bare_read("/proc/self/mounts");
    struct statvfs figures;
    for (const std::string &point : points) {
        benchmark::DoNotOptimize(statvfs(point.c_str(), &figures));
    }
}

void report_pids(benchmark::State &state) {
    state.counters["pids"] = pids_in_proc();
}

template <void (*ROUTINE)(const char *, char **)>
void routine(benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    const char *control = "EXTRA_DESCRIPTORS_LISTED 10\nEXTRA_TIME_TO_FULL_HORIZON 24\n";
    for (auto _ : state) {
        char *returned = nullptr;
        ROUTINE(control, &returned);
        benchmark::DoNotOptimize(returned);
    }
    report_pids(state);
}

template <void (*READS)()>
void bare(benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    for (auto _ : state) {
        READS();
    }
    report_pids(state);
}

void bare_time_to_full_reads(benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    const std::vector<std::string> points = local_mount_points();
    for (auto _ : state) {
        bare_time_to_full(points);
    }
    report_pids(state);
    state.counters["file_systems"] = static_cast<double>(points.size());
}

void register_pair(const char *name, void (*routine_benchmark)(benchmark::State &),
                   const char *bare_name, void (*bare_benchmark)(benchmark::State &)) {
    for (int extra : {0, 5000}) {
        benchmark::RegisterBenchmark(name, routine_benchmark)
            ->Arg(extra)
            ->ArgName("extra")
            ->Unit(benchmark::kMicrosecond);
        benchmark::RegisterBenchmark(bare_name, bare_benchmark)
            ->Arg(extra)
            ->ArgName("extra")
            ->Unit(benchmark::kMicrosecond);
    }
}

} // namespace

int main(int argc, char **argv) {
    std::printf("processes on this machine before the benchmark: %d\n", pids_in_proc());
    register_pair("telvzextra_pressure", routine<telvzextra_pressure>, "bare_pressure_reads",
                  bare<bare_pressure>);
    register_pair("telvzextra_oom_kills", routine<telvzextra_oom_kills>, "bare_vmstat_read",
                  bare<bare_vmstat>);
    register_pair("telvzextra_descriptors", routine<telvzextra_descriptors>,
                  "bare_descriptor_reads", bare<bare_descriptors>);
    register_pair("telvzextra_time_to_full", routine<telvzextra_time_to_full>,
                  "bare_time_to_full_reads", bare_time_to_full_reads);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    idle.resize(0);
    return 0;
}

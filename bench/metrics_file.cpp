// What the metrics file of tarnmon run adds to every pass, on the monitor's thread: the
// exposition of the pass's figures, and the file written beside itself and renamed into place.
//
// metrics_text: the text of a pass with a finding, every figure known and 20 partitions (a host
//   with a few more mounts than usual).
// metrics_file_written: the whole work of the observer: the text, then replace_file into a
//   temporary directory.
// write_and_rename_alone: the floor under it: the same bytes written to a new file and renamed,
//   with no text made.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <string>
#include <unistd.h>

#include "metrics_file.h"

namespace {

constexpr int PARTITIONS = 20;

tarn_pass_figures busy_pass() {
    tarn_pass_figures f{};
    f.pass = 2;
    f.duration_ns = 1'250'000'000;
    f.reason_code = 0xE111;
    f.memory_known = f.descriptors_known = f.cpu_known = f.sleep_known = 1;
    f.memory_tenths = 413;
    f.descriptors_tenths = 12;
    f.cpu_user_percent = 12.5f;
    f.cpu_kernel_percent = 3.25f;
    f.sleep_seconds = 61;
    f.sleep_interval = 60;
    f.partition_count = PARTITIONS;
    for (int i = 0; i < PARTITIONS; ++i) {
        std::snprintf(f.partitions[i].mount_point, TARN_MOUNT_POINT_SIZE, "/srv/volume%d", i);
        f.partitions[i].space_tenths = 10 * i;
        f.partitions[i].inodes_tenths = 5 * i;
    }
    return f;
}

metrics_totals some_totals() {
    metrics_totals totals;
    totals.passes = 1000;
    totals.findings = {{0xE111, 3}, {0xE136, 1}, {0xE153, 2}};
    return totals;
}

class scratch_directory {
  public:
    scratch_directory() {
        char pattern[] = "/tmp/tarn-bench-metrics-XXXXXX";
        path = mkdtemp(pattern);
    }
    ~scratch_directory() { std::filesystem::remove_all(path); }
    std::string path;
};

void metrics_text_of_a_pass(benchmark::State &state) {
    tarn_pass_figures figures = busy_pass();
    metrics_totals totals = some_totals();
    for (auto _ : state) {
        benchmark::DoNotOptimize(metrics_text(figures, totals, 1764000000.5));
    }
}
BENCHMARK(metrics_text_of_a_pass);

void metrics_file_written(benchmark::State &state) {
    scratch_directory directory;
    std::string path = directory.path + "/telvzmnd.prom";
    tarn_pass_figures figures = busy_pass();
    metrics_totals totals = some_totals();
    for (auto _ : state) {
        if (replace_file(path, metrics_text(figures, totals, 1764000000.5)) != 0) {
            state.SkipWithError("replace_file failed");
            break;
        }
    }
}
BENCHMARK(metrics_file_written);

void write_and_rename_alone(benchmark::State &state) {
    scratch_directory directory;
    std::string path = directory.path + "/telvzmnd.prom";
    std::string text = metrics_text(busy_pass(), some_totals(), 1764000000.5);
    std::string next = directory.path + "/.telvzmnd.prom.next";
    for (auto _ : state) {
        int fd = ::open(next.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
        if (fd < 0 || ::write(fd, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
            state.SkipWithError("write failed");
            break;
        }
        ::close(fd);
        ::rename(next.c_str(), path.c_str());
    }
}
BENCHMARK(write_and_rename_alone);

} // namespace

BENCHMARK_MAIN();

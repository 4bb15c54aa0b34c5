// One flush of the snapshot file: a plain snapshot of 64 KB (opening separator, time stamp, the
// gathered text, closing separator) staged and written, with snapshot files of 2, 5 and 20 MB.
//
// append: the bound lies far above the file, so the flush appends; the file is cut back to its
//   size between iterations, outside the timing.
// wrap: the bound is the file's size, so every flush reads the whole file, drops the oldest
//   snapshot and writes the file again; the file stays at its size by itself.
//
// The counters read_per_flush and written_per_flush are the bytes the process passed to read and
// write calls during the timed flushes (rchar and wchar of /proc/self/io), per flush: they include
// the few trace lines the default platform writes to its trace file.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <unistd.h>

#include "capture/snapshot_file.h"
#include "core/settings.h"
#include "data_blocks.h"

namespace {

constexpr size_t MB = 1000000;
constexpr size_t BODY_SIZE = 64 * 1024;

struct io_counts {
    uint64_t read = 0;
    uint64_t written = 0;
};

io_counts process_io() {
    io_counts counts;
    std::ifstream in("/proc/self/io");
    std::string key;
    uint64_t value = 0;
    while (in >> key >> value) {
        if (key == "rchar:") {
            counts.read = value;
        } else if (key == "wchar:") {
            counts.written = value;
        }
    }
    return counts;
}

// A data directory of the benchmark's own, removed at exit.
class data_directory {
  public:
    data_directory() {
        char pattern[] = "/tmp/tarn-bench-snapshot-XXXXXX";
        if (mkdtemp(pattern) == nullptr) {
            std::perror("mkdtemp");
            std::exit(1);
        }
        path_ = pattern;
        setenv("TELV_DATA_DIR", path_.c_str(), 1);
        setenv("TELV_TRACE_FILE", (path_ + "/trace.txt").c_str(), 1);
    }
    ~data_directory() {
        std::error_code ignored;
        std::filesystem::remove_all(path_, ignored);
    }
    std::string file() const { return path_ + "/" + SNAPSHOT_FILE_NAME; }

  private:
    std::string path_;
};

data_directory &directory() {
    static data_directory d;
    return d;
}

// The gathered text of one snapshot: 64 KB of 80-character lines.
const std::string &body() {
    static const std::string text = [] {
        std::string lines;
        while (lines.size() + 82 <= BODY_SIZE) {
            lines.append(80, 'g').append("\n\r");
        }
        return lines;
    }();
    return text;
}

void save(const char *text, int32_t final) {
    std::snprintf(line, sizeof line, "%s", text);
    tarn_save_data(line, file_buffer, FILE_BUFFER_SIZE, final);
}

// One snapshot as the monitoring loop writes it; the closing separator flushes.
void write_snapshot(std::string &gathered) {
    save(PLAIN_SNAPSHOT_OPENING.data(), 0);
    tarn_add_timestamp();
    tarn_save_data(gathered.data(), file_buffer, FILE_BUFFER_SIZE, 0);
    save(PLAIN_SNAPSHOT_CLOSING.data(), 1);
}

// A snapshot file of `size` bytes made of whole plain snapshots, as the writer leaves it.
void make_file(size_t size) {
    std::filesystem::remove(directory().file());
    max_snapshot_file_size = UINT32_MAX;
    std::string gathered;
    while (std::filesystem::exists(directory().file()) == false ||
           std::filesystem::file_size(directory().file()) + BODY_SIZE + 200 < size) {
        gathered = body();
        write_snapshot(gathered);
    }
    std::filesystem::resize_file(directory().file(), size);
}

void report(benchmark::State &state, io_counts before, size_t file_size) {
    io_counts after = process_io();
    state.counters["file_MB"] = static_cast<double>(file_size) / MB;
    state.counters["read_per_flush"] = benchmark::Counter(
        static_cast<double>(after.read - before.read), benchmark::Counter::kAvgIterations);
    state.counters["written_per_flush"] = benchmark::Counter(
        static_cast<double>(after.written - before.written), benchmark::Counter::kAvgIterations);
}

void append_flush(benchmark::State &state) {
    size_t size = static_cast<size_t>(state.range(0)) * MB;
    make_file(size);
    max_snapshot_file_size = UINT32_MAX;
    std::string gathered;
    io_counts before = process_io();
    for (auto _ : state) {
        state.PauseTiming();
        gathered = body();
        std::filesystem::resize_file(directory().file(), size);
        state.ResumeTiming();
        write_snapshot(gathered);
    }
    report(state, before, size);
}

void wrap_flush(benchmark::State &state) {
    size_t size = static_cast<size_t>(state.range(0)) * MB;
    make_file(size);
    max_snapshot_file_size = static_cast<uint32_t>(size);
    std::string gathered;
    io_counts before = process_io();
    for (auto _ : state) {
        state.PauseTiming();
        gathered = body();
        state.ResumeTiming();
        write_snapshot(gathered);
    }
    report(state, before, size);
}

BENCHMARK(append_flush)->Arg(2)->Arg(5)->Arg(20)->Unit(benchmark::kMicrosecond);
BENCHMARK(wrap_flush)->Arg(2)->Arg(5)->Arg(20)->Unit(benchmark::kMicrosecond);

} // namespace

BENCHMARK_MAIN();

// One trace line through the default platform's trace service, as a check writes one for every
// line of a descriptor listing: "TARNMNDD: ls -Rl /proc/*/fd: [%s]" with a 60-character line of
// the listing.
//
// written_line: the line goes to the trace file in a temporary data directory, which rotates at
//   its default bound of 8 MiB as it would on a host. A detail line waits to be written with the
//   lines after it, so this is the cost of a line in a batch.
// written_flow_line: the same line as a flow line ("TARNMNDF: "), which is written at once.
// dropped_detail_line: TELV_TRACE_DETAIL=0 drops the line; its format alone says it is a detail
//   line.
// dropped_detail_line_by_its_text: the same, for a format whose eye-catcher is itself formatted
//   ("TARN%sD: "), so that only the formatted text can say it.
// write_alone: the floor under written_flow_line: one write(2) of a line as long as its lines to a
//   file opened with O_APPEND in the same directory, renamed to "<name>.1" at 8 MiB as the trace
//   file is.
//
// Each iteration is one line; items_per_second is lines a second.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <string>
#include <string_view>
#include <unistd.h>

#include "tracesvc.h"

namespace {

constexpr std::string_view LISTED_LINE =
    "lrwx------ 1 root root 64 Nov 22 02:31 17 -> socket:[402653]";
static_assert(LISTED_LINE.size() == 60);

// A data directory of the benchmark's own, removed at exit.
class data_directory {
  public:
    data_directory() {
        char pattern[] = "/tmp/tarn-bench-trace-XXXXXX";
        if (mkdtemp(pattern) == nullptr) {
            std::perror("mkdtemp");
            std::exit(1);
        }
        path_ = pattern;
        setenv("TELV_DATA_DIR", path_.c_str(), 1);
        unsetenv("TELV_TRACE_FILE");
        unsetenv("TELV_TRACE_MAX_BYTES");
    }
    ~data_directory() {
        std::error_code ignored;
        std::filesystem::remove_all(path_, ignored);
    }
    const std::string &path() const { return path_; }

  private:
    std::string path_;
};

void written_line(benchmark::State &state) {
    setenv("TELV_TRACE_DETAIL", "1", 1);
    for (auto _ : state) {
        if (tracesvc_trace("TARNMNDD: ls -Rl /proc/*/fd: [%s]", LISTED_LINE.data()) < 0) {
            state.SkipWithError("the trace file could not be written");
            break;
        }
    }
    state.SetItemsProcessed(state.iterations());
}

void written_flow_line(benchmark::State &state) {
    setenv("TELV_TRACE_DETAIL", "1", 1);
    for (auto _ : state) {
        if (tracesvc_trace("TARNMNDF: ls -Rl /proc/*/fd: [%s]", LISTED_LINE.data()) < 0) {
            state.SkipWithError("the trace file could not be written");
            break;
        }
    }
    state.SetItemsProcessed(state.iterations());
}

void dropped_detail_line(benchmark::State &state) {
    setenv("TELV_TRACE_DETAIL", "0", 1);
    for (auto _ : state) {
        benchmark::DoNotOptimize(
            tracesvc_trace("TARNMNDD: ls -Rl /proc/*/fd: [%s]", LISTED_LINE.data()));
    }
    state.SetItemsProcessed(state.iterations());
}

void dropped_detail_line_by_its_text(benchmark::State &state) {
    setenv("TELV_TRACE_DETAIL", "0", 1);
    for (auto _ : state) {
        benchmark::DoNotOptimize(
            tracesvc_trace("TARN%sD: ls -Rl /proc/*/fd: [%s]", "MND", LISTED_LINE.data()));
    }
    state.SetItemsProcessed(state.iterations());
}

void write_alone(benchmark::State &state, const std::string &directory) {
    const std::string path = directory + "/alone";
    // "<time> <pid> <thread> TARNMNDD: ls -Rl /proc/*/fd: [<60 characters>]\n"
    const std::string line = "2026-11-22T02:31:30.123Z 43210 43210 TARNMNDD: ls -Rl /proc/*/fd: [" +
                             std::string(LISTED_LINE) + "]\n";
    int fd = -1;
    size_t size = 8u << 20;
    for (auto _ : state) {
        if (size + line.size() > 8u << 20) {
            if (fd >= 0) {
                ::close(fd);
                std::rename(path.c_str(), (path + ".1").c_str());
            }
            fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
            size = 0;
        }
        if (::write(fd, line.data(), line.size()) != static_cast<ssize_t>(line.size())) {
            state.SkipWithError("the file could not be written");
            break;
        }
        size += line.size();
    }
    ::close(fd);
    state.SetItemsProcessed(state.iterations());
}

} // namespace

int main(int argc, char **argv) {
    data_directory directory;
    benchmark::RegisterBenchmark("written_line", written_line)->Unit(benchmark::kNanosecond);
    benchmark::RegisterBenchmark("written_flow_line", written_flow_line)
        ->Unit(benchmark::kNanosecond);
    benchmark::RegisterBenchmark("dropped_detail_line", dropped_detail_line)
        ->Unit(benchmark::kNanosecond);
    benchmark::RegisterBenchmark("dropped_detail_line_by_its_text", dropped_detail_line_by_its_text)
        ->Unit(benchmark::kNanosecond);
    benchmark::RegisterBenchmark("write_alone", write_alone, directory.path())
        ->Unit(benchmark::kNanosecond);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}

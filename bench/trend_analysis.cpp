// One call of the trend analysis with a full process table and full histories (every row with 24
// samples, the index at the last slot, so that each call slides, records, traces and analyses
// every row), at 750, 1,500 and 3,000 processes: once with the index of the record step and the
// one name match per row, once with the walk from row 0 and a match per sample that they stand
// in for. The log table is the example control file's.
//
// The trace lines are written nowhere: the call makes five lines a process, and the cost of a
// trace file would hide the routine's own. They are formatted, as the trace service would, in
// one run, and only counted in the other, which is the routine's own work alone.
//
// The control block is the program's own: it first moves into an IPC namespace of its own.
#include <benchmark/benchmark.h>

#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <string>

#include "core/control_block.h"
#include "core/settings.h"
#include "memory/trend_analysis.h"
#include "support/monitor_setup.h"

namespace {

int64_t trace_lines;
bool format_traces;

// Names from a host's process list, some of them caught by the example file's rows.
constexpr const char *NAMES[] = {"java",     "kworker/0:1", "sshd", "systemd-journal",
                                 "bash",     "rsyslogd",    "cron", "telvzstba",
                                 "postgres", "nginx"};

void fill_tables(tarn_control_block &block, int rows) {
    std::memset(block.process_table, 0, sizeof block.process_table);
    std::memset(block.trend_table, 0, sizeof block.trend_table);
    for (int i = 0; i < rows; ++i) {
        auto pid = static_cast<uint32_t>(1000 + i * 7);
        process_row &process = block.process_table[i];
        process.in_use = 1;
        process.pid = pid;
        std::snprintf(process.process_name, PROCESS_NAME_FIELD, "%s", NAMES[i % 10]);
        process.always_one = 1;
        process.rss = 5000;
        process.dsiz = 8000;
        process.vsize = 20000;
        // The trend rows in another order than the listing, as after processes came and went.
        trend_row &row = block.trend_table[rows - 1 - i];
        row.in_use = 1;
        row.pid = pid;
        std::memcpy(row.process_name, process.process_name, PROCESS_NAME_FIELD);
        for (trend_sample &sample : row.samples) {
            sample = {1, process.rss, process.dsiz, process.vsize};
        }
    }
    block.analysisIndex = TREND_LAST_SLOT;
}

void one_call(benchmark::State &state) {
    auto rows = static_cast<int>(state.range(0));
    trend_row_lookup = state.range(1) == 0 ? trend_lookup::indexed : trend_lookup::walk;
    format_traces = state.range(2) == 1;
    fill_tables(*TARN_CB_PTR, rows);
    uint32_t crc = 0;
    int64_t lines_before = trace_lines;
    for (auto _ : state) {
        tarn_trend_analysis(&crc);
    }
    state.counters["trace_lines"] =
        static_cast<double>(trace_lines - lines_before) / static_cast<double>(state.iterations());
    state.counters["ns_per_row"] = benchmark::Counter(
        static_cast<double>(rows),
        benchmark::Counter::kIsIterationInvariantRate | benchmark::Counter::kInvert);
    state.SetLabel(std::string(state.range(1) == 0 ? "index" : "walk from row 0") +
                   (format_traces ? ", traces formatted" : ", traces counted"));
}

} // namespace

// The trace service of this program: each line counted, formatted when asked, and dropped.
extern "C" int tracesvc_trace(const char *format, ...) {
    ++trace_lines;
    if (!format_traces) {
        return 0;
    }
    static char text[8192];
    va_list args;
    va_start(args, format);
    int length = std::vsnprintf(text, sizeof text, format, args);
    va_end(args);
    benchmark::DoNotOptimize(text[0]);
    return length;
}

int main(int argc, char **argv) {
    if (!set_up_monitor()) {
        return 1;
    }
    // Full histories; no process rises often enough to be reported.
    trend_analysis_points = TREND_LAST_SLOT + 1;
    trend_analysis_num_increases = 20;
    benchmark::RegisterBenchmark("tarn_trend_analysis", one_call)
        ->ArgsProduct({{750, 1500, 3000}, {0, 1}, {0, 1}})
        ->ArgNames({"rows", "walk", "format"})
        ->Unit(benchmark::kMillisecond);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}

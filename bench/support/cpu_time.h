// What a routine that runs commands costs the host: the CPU time of this process and of the
// children it waited for, taken around each iteration and reported as the iteration's time (use
// with UseManualTime), with counters that split it into the routine's own part and its children's.
#pragma once

#include <benchmark/benchmark.h>
#include <cstdint>
#include <sys/resource.h>

struct cpu_times {
    double self;
    double children;

    static double seconds(const timeval &t) {
        return static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_usec) / 1e6;
    }
    static cpu_times now() {
        rusage self_usage{};
        rusage children_usage{};
        getrusage(RUSAGE_SELF, &self_usage);
        getrusage(RUSAGE_CHILDREN, &children_usage);
        return {seconds(self_usage.ru_utime) + seconds(self_usage.ru_stime),
                seconds(children_usage.ru_utime) + seconds(children_usage.ru_stime)};
    }
};

// Runs `body` once an iteration; `body` returns the number of lines it handled, for the counter
// of the routine's own time per line.
template <typename Body>
void measure_cpu(benchmark::State &state, Body body) {
    double self = 0;
    double children = 0;
    int64_t lines = 0;
    for (auto _ : state) {
        cpu_times before = cpu_times::now();
        lines = body();
        cpu_times after = cpu_times::now();
        self += after.self - before.self;
        children += after.children - before.children;
        state.SetIterationTime((after.self - before.self) + (after.children - before.children));
    }
    auto iterations = static_cast<double>(state.iterations());
    state.counters["lines"] = static_cast<double>(lines);
    state.counters["self_ms"] = self / iterations * 1e3;
    state.counters["children_ms"] = children / iterations * 1e3;
    state.counters["self_ns_per_line"] =
        lines > 0 ? self / iterations / static_cast<double>(lines) * 1e9 : 0;
}

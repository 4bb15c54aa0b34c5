// The performance check on this host's /proc, at the host's own process count and with 5,000 extra
// idle processes, against the update of the process CPU accounting that it starts with, run
// alone. Beyond the update the check renders the table of every process (an entry line and two
// rows of ten cells each), puts it into primaryDataBlock, and walks the chain to judge every
// process. The target is a check that costs at most 1.5 times the update alone.
//
// CPU checking is armed and the thresholds are out of reach (above 100 percent for one process,
// far above it for the appliance), so that the walk judges every process and finds nothing: a
// finding would stop the walk and gather trace data through a child. A call that finds anything,
// or whose walk stops short, ends its benchmark with an error.
//
// Each iteration's time is the CPU time of this process (the check starts no children), so that
// the two compare what they cost the host. The clear of primaryDataBlock that the loop does
// before the checks of a pass stays outside the measured time of both: its size is what the
// last pass wrote, it belongs to the loop, and the update alone, which writes nothing there, would
// not pay it; the check reports it as its own counter. The clock-tick source moves a second on at
// every call, so that every update, alone or in the check, takes its sample; before timing, ten
// updates give every process its entry and fill the ring of samples, as after ten passes.
//
// Tracing goes through the default platform into a trace file in a temporary data directory:
// the update writes its entry and exit lines and one line per processor found, and the check
// eleven lines of its own beyond those, whatever the process count. A third benchmark runs the
// update alone and the check in turn and gives their ratio, which the drift of a busy host cannot
// tilt.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <ctime>
#include <unistd.h>

#include "core/control_block.h"
#include "core/settings.h"
#include "cpu/performance.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "support/cpu_time.h"
#include "support/idle_processes.h"
#include "support/monitor_setup.h"

namespace {

idle_processes idle;
clock_t stepped_ticks;
long tick_rate;

clock_t one_second_later() {
    stepped_ticks += tick_rate;
    return stepped_ticks;
}

double cpu_seconds_since(const cpu_times &before) {
    cpu_times after = cpu_times::now();
    return (after.self - before.self) + (after.children - before.children);
}

// The idle processes of this benchmark and a fresh list through the stepped clock, filled by as
// many updates as the ring has samples; the kernel makes the /proc entries of a process at their
// first reading, which these unmeasured updates pay.
void prepare_list(const benchmark::State &state) {
    idle.resize(static_cast<size_t>(state.range(0)));
    tick_rate = sysconf(_SC_CLK_TCK);
    clock_tick_source = one_second_later;
    reset_process_listing_state();
    delete_process_list(&process_list);
    std::memset(&process_list, 0, sizeof process_list);
    process_list_ptr = &process_list;
    for (int i = 0; i < PROCESS_SAMPLES; ++i) {
        update_process_list(process_list_ptr);
    }
}

// CPU checking armed at every call, as from the pass on which the countdown reaches 0, with no
// sleep overrun flagged and no event raised before.
void arm_cpu_checking() {
    write_field(TARN_CB_PTR->numLoopsBeforeCPUChecking, 0);
    write_field(TARN_CB_PTR->sleepTimeExceeded, 0);
    write_field(TARN_CB_PTR->tookLog, 0);
}

int pids_listed() {
    return process_list_ptr->number_of_entries - 1;
}

void report_pids(benchmark::State &state, double seconds) {
    auto iterations = static_cast<double>(state.iterations());
    state.counters["pids"] = pids_listed();
    state.counters["per_pid_us"] =
        iterations > 0 ? seconds / iterations / pids_listed() * 1e6 : 0.0;
}

// The loop's clear before the pass, unmeasured here; its CPU time is returned for the counter.
double clear_as_the_loop_does() {
    cpu_times before = cpu_times::now();
    start_pass();
    return cpu_seconds_since(before);
}

// One update alone: its CPU time.
double time_update() {
    cpu_times before = cpu_times::now();
    update_process_list(process_list_ptr);
    return cpu_seconds_since(before);
}

// One check: its CPU time, or a negative time when it found something or its walk stopped
// short of the end of the chain.
double time_check() {
    arm_cpu_checking();
    process_entry_ptr = &process_list_ptr->head;
    int32_t take_log_crc = 0;
    int32_t take_log_value = 0;
    uint32_t crc = 0;
    cpu_times before = cpu_times::now();
    tarn_check_performance(&take_log_crc, &take_log_value, &TARN_CB_PTR->tookLog, &crc);
    double seconds = cpu_seconds_since(before);
    bool walked_all = process_entry_ptr == nullptr;
    return take_log_crc == 0 && walked_all && primary_data_length() > 0 ? seconds : -1.0;
}

void fail(benchmark::State &state) {
    state.SkipWithError("the check found something or did not judge every process: the "
                        "thresholds must be out of reach and the walk must reach the end");
}

void update_alone(benchmark::State &state) {
    prepare_list(state);
    double total = 0;
    for (auto _ : state) {
        clear_as_the_loop_does();
        double seconds = time_update();
        total += seconds;
        state.SetIterationTime(seconds);
    }
    report_pids(state, total);
}

void check(benchmark::State &state) {
    prepare_list(state);
    double total = 0;
    double clears = 0;
    size_t table_bytes = 0;
    for (auto _ : state) {
        clears += clear_as_the_loop_does();
        double seconds = time_check();
        if (seconds < 0) {
            fail(state);
            break;
        }
        table_bytes = primary_data_length();
        total += seconds;
        state.SetIterationTime(seconds);
    }
    report_pids(state, total);
    auto iterations = static_cast<double>(state.iterations());
    state.counters["clear_us"] = iterations > 0 ? clears / iterations * 1e6 : 0.0;
    state.counters["block_bytes"] = static_cast<double>(table_bytes);
}

// The two in turn, one of each an iteration, so that a drift of the host weighs on both alike:
// the ratio of their CPU times, and what the check costs beyond the update.
void check_over_update_alone(benchmark::State &state) {
    prepare_list(state);
    double check_total = 0;
    double alone_total = 0;
    for (auto _ : state) {
        clear_as_the_loop_does();
        double alone = time_update();
        clear_as_the_loop_does();
        double checked = time_check();
        if (checked < 0) {
            fail(state);
            break;
        }
        alone_total += alone;
        check_total += checked;
        state.SetIterationTime(checked);
    }
    auto iterations = static_cast<double>(state.iterations());
    state.counters["pids"] = pids_listed();
    state.counters["ratio"] = alone_total > 0 ? check_total / alone_total : 0.0;
    state.counters["extra_us"] =
        iterations > 0 ? (check_total - alone_total) / iterations * 1e6 : 0.0;
}

} // namespace

int main(int argc, char **argv) {
    if (!set_up_monitor()) {
        return 1;
    }
    // Out of reach: one process is judged in tenths of a percent of the machine, and no sample
    // exceeds 100 percent; the appliance's figure cannot come near a thousand percent.
    cpu_percent_threshold = 1001;
    cpu_percent_threshold_qv = 100000;
    cpu_time_threshold = 10;
    std::printf("processes on this machine before the benchmark: %d\n", pids_in_proc());
    for (int extra : {0, 5000}) {
        benchmark::RegisterBenchmark("update_process_list_alone", update_alone)
            ->Arg(extra)
            ->ArgName("extra")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
        benchmark::RegisterBenchmark("tarn_check_performance", check)
            ->Arg(extra)
            ->ArgName("extra")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
        benchmark::RegisterBenchmark("check_over_update_alone", check_over_update_alone)
            ->Arg(extra)
            ->ArgName("extra")
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    delete_process_list(&process_list);
    idle.resize(0);
    return 0;
}

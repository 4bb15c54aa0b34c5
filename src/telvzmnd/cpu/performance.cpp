#include "cpu/performance.h"

#include <cstdio>

#include "allocation.h"
#include "capture/trace_data.h"
#include "core/check_contract.h"
#include "core/control_block.h"
#include "core/settings.h"
#include "core/words.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "tracesvc.h"

int32_t telvzmnd_sleep_time;

namespace {

// Written into line when the table goes in, and never appended: the table has only ever been
// preceded by a line end.
constexpr char TABLE_LINE[] = "About to the CPU usage data \n\r";
constexpr char LINE_END[] = "\n\r";
constexpr char OLD_PS_OPENING[] = "***** About to output old PS data *****: \n\r";
constexpr char OLD_PS_CLOSING[] = "***** end of old PS data ***** \n\r";

// The loop's integers the check writes through, and the control block it reads.
struct performance_pass {
    int32_t *takeLogCrc;
    int32_t *takeLogValue;
    uint32_t *tookLog;
    uint32_t *crc;
    tarn_control_block *block;
};

// A float figure traced as its "%f" text in a "%s" slot, as the figures have always been traced.
void trace_figure(const char *format, float figure) {
    char text[64];
    std::snprintf(text, sizeof text, "%f", static_cast<double>(figure));
    tracesvc_trace(format, text);
}

// The history refreshed, and its table put into the pass's data whatever room is left.
void refresh_history() {
    tracesvc_trace("TARNMNDF:     about to call update_process_list()");
    update_process_list(process_list_ptr);
    tracesvc_trace("TARNMNDF:     back from call update_process_list()");
    char *table = nullptr;
    tracesvc_trace("TARNMONF:     about to call print_process_list()");
    print_process_list(process_list_ptr, &table);
    tracesvc_trace("TARNMONF:     back from call print_process_list()");
    if (table != nullptr) {
        std::snprintf(line, LINE_SIZE, "%s", TABLE_LINE);
        append_unbudgeted(LINE_END);
        append_unbudgeted(table);
        TARN_FREE(table);
    }
}

// Counts the countdown down; the pass that brings it to 0 drops what the earlier checks found, so
// that the first judged pass starts clean. True when this pass judges the CPU.
bool cpu_checking_armed(const performance_pass &pass) {
    int32_t &countdown = pass.block->numLoopsBeforeCPUChecking;
    if (read_field(countdown) > 0) {
        write_field(countdown, read_field(countdown) - 1);
        if (read_field(countdown) == 0) {
            *pass.takeLogCrc = 0;
            *pass.takeLogValue = 0;
        }
    }
    tracesvc_trace("TARNMNDF: TARN_CB_PTR->numLoopsBeforeCPUChecking = %d (dec)",
                   read_field(countdown));
    return *pass.takeLogCrc == 0 && read_field(countdown) == 0;
}

void report_process(const performance_pass &pass, const process_entry &entry, float sum,
                    float oldest) {
    tracesvc_trace("TARNMNDF: A process is using too much CPU time");
    trace_figure("TARNMNDF:     total average cpu usage was = %s (float)",
                 sum / static_cast<float>(cpu_time_threshold));
    tracesvc_trace("TARNMNDF:     pid            = %d (dec)", entry.pid);
    tracesvc_trace("TARNMNDF:     priority       = %d (dec)", entry.priority);
    tracesvc_trace("TARNMNDF:     nice           = %d (dec)", entry.nice);
    tracesvc_trace("TARNMNDF:     process_name   = [%s]    ", entry.process_name);
    tracesvc_trace("TARNMNDF:     file_name      = [%s]    ", entry.file_name);
    write_error_text("\n\rError Information: \n\rProcess is using too much CPU Time:\n\r%s\n\r",
                     entry.process_name);
    *pass.takeLogCrc = RC_PROCESS_CPU;
    // The oldest judged sample over the count, not the average traced above: the value has always
    // been this one.
    *pass.takeLogValue = truncate32(oldest / static_cast<float>(cpu_time_threshold));
    tarn_gather_trace_data(pass.crc);
}

// Judges the newest cpu_time_threshold samples of one process (at most the ten there are) and adds
// each to `overall`. A process is over the limit when no judged sample lies below it, which is also
// the case when no sample is judged at all.
void judge_process(const performance_pass &pass, const process_entry &entry, float &overall) {
    bool below = false;
    float sum = 0.0f;
    float value = 0.0f;
    int slot = (process_list_ptr->current_sample + PROCESS_SAMPLES - 1) % PROCESS_SAMPLES;
    for (int32_t i = 0; i < PROCESS_SAMPLES && i < cpu_time_threshold; ++i) {
        value = entry.user_percent[slot] + entry.kernel_percent[slot];
        sum += value;
        overall += value;
        // The limit is in tenths of a percent; the product is a double, as it has always been.
        if (static_cast<double>(static_cast<float>(cpu_percent_threshold)) >
            static_cast<double>(value) * 10.0) {
            below = true;
        }
        slot = slot == 0 ? PROCESS_SAMPLES - 1 : slot - 1;
    }
    if (!below && finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        report_process(pass, entry, sum, value);
    }
}

// Walks the chain from its head (pid 0, never over a positive limit) and stops at the first
// process over the limit: the processes after it are neither judged nor added to the appliance's
// figure. Returns the sum of every sample judged.
float judge_processes(const performance_pass &pass) {
    float overall = 0.0f;
    process_entry_ptr = &process_list_ptr->head;
    for (int32_t k = 0; k < process_list_ptr->number_of_entries && process_entry_ptr != nullptr &&
                        *pass.takeLogCrc == 0;
         ++k) {
        judge_process(pass, *process_entry_ptr, overall);
        process_entry_ptr = process_entry_ptr->next;
    }
    return overall;
}

void judge_appliance(const performance_pass &pass, float overall) {
    float average = overall / static_cast<float>(cpu_time_threshold);
    trace_figure("TARNMNDF:     total QV cpu usage was = %s (float)", average);
    if (!(10.0 * static_cast<double>(average) >
          static_cast<double>(static_cast<float>(cpu_percent_threshold_qv))) ||
        !finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        return;
    }
    tracesvc_trace("TARNMNDF: The QV is using too much CPU time");
    trace_figure("TARNMNDF:     total average QV cpu usage was = %s (float)", average);
    *pass.takeLogCrc = RC_APPLIANCE_CPU;
    *pass.takeLogValue = truncate32(average);
    tarn_gather_trace_data(pass.crc);
}

// The listing of processes the monitor had when it overran, for whoever reads why it was slow.
void append_old_ps_data() {
    append_unbudgeted(LINE_END);
    append_unbudgeted(OLD_PS_OPENING);
    append_data_line(newPSDataBlock);
    append_unbudgeted(OLD_PS_CLOSING);
}

void judge_sleep(const performance_pass &pass) {
    tarn_control_block &block = *pass.block;
    if (read_field(block.sleepTimeExceeded) != 1) {
        return;
    }
    write_field(block.sleepTimeExceeded, 0);
    if (!finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        return;
    }
    int32_t percent = read_field(block.sleep_time_percent);
    tracesvc_trace("TARNMNDF: The QV is running too slowly");
    tracesvc_trace(
        "TARNMNDF:     The actual sleep time was %d seconds instead of the expected %d seconds",
        telvzmnd_sleep_time, read_field(block.maxSleepTime));
    tracesvc_trace("TARNMNDF:     TARN_CB_PTR->sleep_time_percent = %d percent", percent);
    // The loop stores -1 while it sleeps without drift; a trigger from outside may leave it there.
    *pass.takeLogCrc = percent <= 0 ? RC_SLEEP_OVERRUN_NOT_POSITIVE : RC_SLEEP_OVERRUN;
    *pass.takeLogValue = percent <= 0 ? 0 : percent;
    tarn_gather_trace_data(pass.crc);
    append_old_ps_data();
}

} // namespace

TARN_EXPORT uint32_t tarn_check_performance(int32_t *takeLogCrc, int32_t *takeLogValue,
                                            uint32_t *tookLog, uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> tarn_check_performance");
    refresh_history();
    // The loop runs only with its block attached; a check called without one judges nothing.
    tarn_control_block *block = TARN_CB_PTR.get();
    if (block != nullptr) {
        performance_pass pass{takeLogCrc, takeLogValue, tookLog, crc, block};
        if (cpu_checking_armed(pass)) {
            tracesvc_trace("TARNMNDF: Actually check the CPU usage");
            judge_appliance(pass, judge_processes(pass));
            judge_sleep(pass);
        }
        // A sleep overrun flagged while CPU checking is not armed is forgotten.
        write_field(block->sleepTimeExceeded, 0);
    }
    tracesvc_trace("TARNOTHF: <-- tarn_check_performance, src = %x, crc = %x (hex)", 0, *crc);
    return 0;
}

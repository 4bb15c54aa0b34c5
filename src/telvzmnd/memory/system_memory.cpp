#include "memory/system_memory.h"

#include <cstdint>
#include <cstring>

#include "command_runner.h"
#include "core/check_contract.h"
#include "core/pass_figures.h"
#include "core/settings.h"
#include "core/words.h"
#include "data_blocks.h"
#include "tracesvc.h"

namespace {

constexpr const char *FREE_ARGV[] = {"free", nullptr};
constexpr const char *MEMINFO_ARGV[] = {"cat", "/proc/meminfo", nullptr};
// Both pipes have always been traced under free's name.
constexpr command_spec FREE_COMMAND = {nullptr, FREE_ARGV, "free", "free"};
constexpr command_spec MEMINFO_COMMAND = {nullptr, MEMINFO_ARGV, "free", "cat /proc/meminfo"};

constexpr int MEMORY_LINE = 1;
constexpr int SWAP_LINE = 2;
constexpr int MEMORY_LINE_WORDS = 7; // Mem: total used free shared buffers(/cache) ...
constexpr int SWAP_LINE_WORDS = 4;   // Swap: total used free
constexpr int MEMINFO_WORDS = 3;     // name: value kB
constexpr char LOW_FREE_NAME[] = "LowFree:";

void trace_figures(const free_figures &figures, int32_t in_use) {
    tracesvc_trace("TARNMNDD: memtotal       is %d (dec)", figures.memtotal);
    tracesvc_trace("TARNMNDD: memused        is %d (dec)", figures.memused);
    tracesvc_trace("TARNMNDD: memfree        is %d (dec)", figures.memfree);
    tracesvc_trace("TARNMNDD: swaptotal      is %d (dec)", figures.swaptotal);
    tracesvc_trace("TARNMNDD: swapused       is %d (dec)", figures.swapused);
    tracesvc_trace("TARNMNDD: swapfree       is %d (dec)", figures.swapfree);
    tracesvc_trace("TARNMNDD: total memory in use is %d (dec)", in_use);
}

void judge_swap(const system_memory_pass &pass, int32_t swaptotal) {
    if (swaptotal >= min_swap_size || !finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        return;
    }
    tracesvc_trace("TARNMNDF: total available swap area is too small");
    tracesvc_trace("TARNMNDF: total available swap area is is %d (dec)", swaptotal);
    *pass.takeLogCrc = RC_SWAP_TOO_SMALL;
    *pass.takeLogValue = swaptotal;
}

// The percent finding, then the release of tookLog once usage is under the resume percentage
// again: a shortage is reported once, held back while it lasts, and reported anew after it ended.
void judge_percent(const system_memory_pass &pass, int32_t percent) {
    if (percent >= total_memory_percent_threshold &&
        finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        tracesvc_trace("TARNMNDF: total_memory_percent threshold exceeded");
        tracesvc_trace("TARNMNDF: computed percent is %d (dec, scaled by 10)", percent);
        *pass.takeLogCrc = RC_MEMORY_IN_USE;
        *pass.takeLogValue = percent;
        *pass.memoryPercentLogged = 1;
    }
    if (*pass.memoryPercentLogged == 1 && percent < resume_memory_percent_threshold) {
        write_field(*pass.tookLog, 0);
        *pass.memoryPercentLogged = 0;
    }
}

void check_free(const system_memory_pass &pass) {
    append_section_header("About to output free data \n\r");
    free_figures figures;
    if (run_command(FREE_COMMAND, [&figures](char *text, size_t) {
            free_output_line(figures, text);
        }) == command_outcome::pipe_failed) {
        return;
    }
    int32_t in_use = memory_in_use(figures);
    trace_figures(figures, in_use);
    if (in_use > total_memory_in_use_threshold) {
        // A trace for whoever reads it; no finding.
        tracesvc_trace("TARNMNDF: total_memory_in_use threshold exceeded");
        tracesvc_trace("TARNMNDF: total computed is %d (dec)", in_use);
    }
    judge_swap(pass, figures.swaptotal);
    if (figures.memtotal != 0) {
        int32_t percent = memory_percent(figures, in_use);
        tracesvc_trace("TARNMNDD: computed percent is %d (dec, scaled by 10)", percent);
        note_memory_percent(percent);
        judge_percent(pass, percent);
    }
}

void check_meminfo(const system_memory_pass &pass) {
    append_section_header("About to output cat /proc/meminfo \n\r");
    run_command(MEMINFO_COMMAND, [&pass](char *text, size_t) { meminfo_line(pass, text); });
}

} // namespace

void meminfo_line(const system_memory_pass &pass, const char *text) {
    append_data_line(text);
    split_words(text, MEMINFO_WORDS);
    if (std::strcmp(words[0], LOW_FREE_NAME) != 0) {
        return;
    }
    // Only hosts with a split of low and high memory print LowFree.
    int32_t low_free = read_number(words[1]);
    tracesvc_trace("TARNMNDD: LowFree = %d (dec)", low_free);
    if (low_free >= low_free_size || !finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        return;
    }
    tracesvc_trace("TARNMNDF: LowFree memory value too small");
    tracesvc_trace("TARNMNDF: LowFree is %d (dec)", low_free);
    *pass.takeLogCrc = RC_LOW_FREE;
    *pass.takeLogValue = low_free;
}

void free_output_line(free_figures &figures, const char *text) {
    append_data_line(text);
    if (figures.line_index == MEMORY_LINE) {
        tracesvc_trace("TARNMNDD:  MEM line: [%s]", text);
        split_words(text, MEMORY_LINE_WORDS);
        figures.memtotal = read_number(words[1]);
        figures.memused = read_number(words[2]);
        figures.memfree = read_number(words[3]);
        figures.buffers = read_number(words[5]);
    } else if (figures.line_index == SWAP_LINE) {
        tracesvc_trace("TARNMNDD: swap line: [%s]", text);
        // A swap line of fewer words leaves the memory line's words in the slots it does not fill.
        split_words(text, SWAP_LINE_WORDS);
        figures.swaptotal = read_number(words[1]);
        figures.swapused = read_number(words[2]);
        figures.swapfree = read_number(words[3]);
    }
    // Counted on, whatever the count: the output of a million lines stays a count.
    if (figures.line_index <= SWAP_LINE) {
        ++figures.line_index;
    }
}

int32_t memory_in_use(const free_figures &figures) {
    return wrap32(int64_t{figures.memtotal} + figures.swaptotal -
                  (int64_t{figures.buffers} + figures.memfree + figures.swapfree));
}

int32_t memory_percent(const free_figures &figures, int32_t in_use) {
    int32_t total = wrap32(int64_t{figures.swaptotal} + figures.memtotal);
    if (total == 0) {
        return INT32_MIN;
    }
    return truncate32(1000.0 * in_use / total);
}

TARN_EXPORT uint32_t tarn_check_system_memory(int32_t *takeLogCrc, int32_t *takeLogValue,
                                              uint32_t *tookLog, int32_t *memoryPercentLogged,
                                              uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> tarn_check_system_memory");
    uint32_t src = 0;
    system_memory_pass pass{takeLogCrc, takeLogValue, tookLog, memoryPercentLogged};
    check_free(pass);
    check_meminfo(pass);
    tracesvc_trace("TARNOTHF: <-- tarn_check_system_memory, src = %x, crc = %x (hex)", src, *crc);
    return src;
}

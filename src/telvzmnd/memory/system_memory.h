// The system memory check: memory and swap in use as free reports them, and LowFree as
// /proc/meminfo reports it, judged against the control file's thresholds. It also re-arms the
// reporting of a memory shortage once usage has fallen under the resume percentage.
#pragma once

#include <cstdint>

#include "export.h"

// What the check reads from free's output: its line 1 is taken for the memory line and its line
// 2 for the swap line, whatever they say.
struct free_figures {
    int32_t memtotal = 0;
    int32_t memused = 0;
    int32_t memfree = 0;
    int32_t buffers = 0; // the sixth word of the memory line: "buff/cache" on a current free
    int32_t swaptotal = 0;
    int32_t swapused = 0;
    int32_t swapfree = 0;
    int32_t line_index = 0; // the next line of the output; 0 is the header
};

// The loop's integers the check writes through, as the check contract hands them over.
struct system_memory_pass {
    int32_t *takeLogCrc;
    int32_t *takeLogValue;
    uint32_t *tookLog;
    int32_t *memoryPercentLogged;
};

// Takes one line of free's output (NUL-terminated, line end removed): copies it into
// primaryDataBlock, and at line 1 and 2 traces and reads it.
void free_output_line(free_figures &figures, const char *text);

// Takes one line of /proc/meminfo: copies it into primaryDataBlock, and judges LowFree when the
// line's first word is "LowFree:". A line without words leaves the words of the line before.
void meminfo_line(const system_memory_pass &pass, const char *text);

// Memory and swap in use in KB: memtotal + swaptotal - (buffers + memfree + swapfree), wrapping
// as 32-bit arithmetic does.
int32_t memory_in_use(const free_figures &figures);

// In use against memory and swap together, in tenths of a percent, truncated toward zero. A
// quotient outside the 32-bit range (swap and memory adding up to 0 or wrapping) gives INT32_MIN,
// the value the processor's truncating conversion gives.
int32_t memory_percent(const free_figures &figures, int32_t in_use);

// The check. Out: on a finding *takeLogCrc and *takeLogValue, *memoryPercentLogged; may clear
// *tookLog. *crc is only traced. Returns src, always 0.
TARN_EXPORT uint32_t tarn_check_system_memory(int32_t *takeLogCrc, int32_t *takeLogValue,
                                              uint32_t *tookLog, int32_t *memoryPercentLogged,
                                              uint32_t *crc);

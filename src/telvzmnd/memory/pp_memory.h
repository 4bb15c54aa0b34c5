// The per-process memory check: every process listed by ps with its rss, vsize and dsiz, judged
// against the limits that apply to it (its override entry, else the first matching rows of the
// control file's log and abort tables, else the defaults), recorded in the control block's process
// table, and the override table swept of processes that are gone.
#pragma once

#include <cstddef>
#include <cstdint>
#include <regex.h>

#include "core/control_block.h"
#include "export.h"

// Sorted by rss, largest first, so that the last offender in the listing is the smallest.
inline constexpr const char *PS_COMMAND =
    "ps -e -o pid,tid,rss,vsize,dsiz,comm,time --no-header | sort -k3,3nr";
inline constexpr int PS_WORDS = 7; // pid, tid, rss, vsize, dsiz, comm, time
// A size above this (KB) is taken for a misread column and counted as 0, unless a finding is
// already held back by tookLog.
inline constexpr int32_t PS_SIZE_GUARD = 0x800000;

// What the check carries from one line of the listing to the next.
struct pp_memory_pass {
    int32_t *takeLogCrc;
    int32_t *takeLogValue;
    int32_t *killPid;
    const uint32_t *tookLog;
    tarn_control_block *block;
    int32_t line_count = 0;    // every line read: reported as the number of threads
    int32_t previous_pid = -1; // consecutive lines of one pid share a process-table row
    int32_t process_row = 0;   // the next row of the process table
};

// Builds the pass's index of the override table: pid to its lowest in-use entry. The table is
// locked, and stays so for the whole pass, so the index answers as a walk from entry 0 would.
void index_override_table(const tarn_control_block &block);

// The line handler: judges one line of the listing (NUL-terminated). It does no I/O, so that a test
// can hand it a captured line.
void pp_memory_line(pp_memory_pass &pass, const char *text);

// The check. Out: *killPid (0 on entry), and on a finding *takeLogCrc and *takeLogValue; *crc is
// only traced. Returns src, always 0.
TARN_EXPORT uint32_t tarn_check_pp_memory(int32_t *takeLogCrc, int32_t *takeLogValue,
                                          int32_t *killPid, uint32_t *tookLog, uint32_t *crc);

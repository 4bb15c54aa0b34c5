// The trend analysis: slow memory leaks seen over many plain snapshots. Each call adds one sample
// of every listed process (rss, dsiz, vsize from the process table of the pass) to its history in
// the control block's trend table; once the histories are full, a process whose dsiz and vsize
// never fell and rose often enough is reported at once.
#pragma once

#include <cstdint>

#include "export.h"

// Samples a trend row has room for, and so the largest history.
inline constexpr int32_t TREND_LAST_SLOT = 23;

// How a call finds the trend row of a listed process and how often it matches a name against the
// log table: through an index built once per call and once per row (the monitor's way), or by a
// walk from row 0 for each process and a match for each sample. Both give the same rows, traces
// and bytes; the walk is kept so that tests can hold the index to it and the benchmark can show
// what the index saves.
enum class trend_lookup { indexed, walk };
extern trend_lookup trend_row_lookup;

// One call: slide, record, drop, advance, trace the table, analyse, report each leak with its own
// event (reason 0xE11A, the pid as the value). Out: *crc = 0. Returns src, always 0.
TARN_EXPORT uint32_t tarn_trend_analysis(uint32_t *crc);

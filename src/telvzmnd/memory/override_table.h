// The threshold override table: limits that a process sets for its own pid in the control block,
// which the per-process memory check applies in preference to the control file.
#pragma once

#include <cstdint>

#include "export.h"

inline constexpr int32_t OVERRIDE_LIMIT_MAX =
    4194304; // KB; a larger (or negative) limit is refused

// Stores six limits in KB for the caller's pid (0 = no override of that limit); six zeros over an
// existing entry free it. Returns src: 0 when stored, and 0 too when no control block could be
// attached or the table's lock was not obtained, which store nothing; 2 for a limit out of range;
// else the pointer check's or the problem report's result.
// Out: *crc, the code of the last refused limit (1, 2, 3, 5, 6 or 7), else 0.
TARN_EXPORT uint32_t tarn_override_thresholds(int32_t rss, int32_t dsiz, int32_t vsize,
                                              int32_t rssAbort, int32_t dsizAbort,
                                              int32_t vsizeAbort, uint32_t *crc);

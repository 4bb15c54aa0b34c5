// The appliance's own trace, saved beside the monitor's data when the performance check reports a
// problem: its trace-dump tool telvzstba writes "telvzstba.trm", and the monitor confirms that the
// file is there.
#pragma once

#include <cstdint>

#include "export.h"

inline constexpr const char *TRACE_DATA_NAME = "telvzstba.trm";

// Has telvzstba dump the trace into "telvzstba.trm" through runAsRoot, tracing what it prints,
// then asks the data-file service for that file's size. Out: *crc, 0 on entry, then the size
// query's. Returns the size query's src; 0 when no pipe could be made.
TARN_EXPORT uint32_t tarn_gather_trace_data(uint32_t *crc);

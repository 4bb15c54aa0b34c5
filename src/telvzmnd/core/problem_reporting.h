// Problem reporting: every problem the monitor finds, in the host or in itself, leaves the library
// as one event of the appliance's event log with component "LinMonitor".
#pragma once

#include <cstdint>

#include "export.h"

inline constexpr uint32_t ATTACHMENT_SIZE = 84056;
inline constexpr uint32_t ATTACHMENT_DATA_LIMIT = 39000; // characters of the caller's text kept
inline constexpr uint32_t REPORT_RESULT = 8;             // the result of every raised event

// Raises the event of reason code `uiErrorId` (low 16 bits) with detail `compRc` and, when `data`
// is not null, a text attachment. `sysRc` is the caller's system return code, normally `src | 2`.
// Returns 8 once an event was raised; `sysRc` unchanged for 8 and 12, which raise nothing.
TARN_EXPORT uint32_t tarn_mon_error_handler_p(uint32_t sysRc, uint32_t compRc, const char *data,
                                              uint32_t uiErrorId);
TARN_EXPORT uint32_t tarn_mon_error_handler(uint32_t sysRc, uint32_t compRc, uint32_t uiErrorId);

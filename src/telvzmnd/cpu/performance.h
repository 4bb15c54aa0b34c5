// The performance check: the CPU history of every process put into the pass's data, and, once CPU
// checking is armed, three findings: one process that used too much CPU in every recent sample,
// the appliance as a whole using too much, and the monitor's own sleep lasting too long.
#pragma once

#include <cstdint>

#include "export.h"

// Seconds the last sleep between passes took, as the loop measured it.
extern int32_t telvzmnd_sleep_time;

// The check. Out: on a finding *takeLogCrc and *takeLogValue; *crc through the trace-data
// gathering of each finding. Reads *tookLog. Returns src, always 0.
TARN_EXPORT uint32_t tarn_check_performance(int32_t *takeLogCrc, int32_t *takeLogValue,
                                            uint32_t *tookLog, uint32_t *crc);

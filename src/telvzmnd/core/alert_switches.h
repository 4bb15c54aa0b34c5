// The switches that other parts of the appliance turn while the monitor runs, from any process
// that loads the library and on any thread: whether CPU use and the monitor's own sleep are
// judged, a forced sleep alert, and whether problem events are errors or informational. Each
// attaches the control block and stores a few of its 32-bit fields, without the lock; none waits
// for the monitoring loop, which picks the values up where it next reads them.
#pragma once

#include <cstddef>
#include <cstdint>

#include "core/control_block.h"
#include "export.h"
#include "jcb.h"

// What the switches set numLoopsBeforeCPUChecking to. The performance check counts it down one a
// pass and judges CPU use, and the loop measures its sleep, from the pass that brings it to 0.
inline constexpr int32_t CPU_ALERTS_ON_COUNTDOWN = 11;  // the 11th pass from now, as at start
inline constexpr int32_t CPU_ALERTS_OFF_COUNTDOWN = 60; // held off for 59 passes, not for good
inline constexpr int32_t CPU_ALERTS_NOW_COUNTDOWN = 0;  // armed at once

inline constexpr int32_t JAVA_CALL_FAILED = 22; // java_set_logging_type's result on any failure

// One store of a switch: the 32-bit field at `offset` in the block gets `value` (a signed field
// its two's complement bits).
struct field_store {
    size_t offset;
    uint32_t value;
};

// Makes one store of a switch: a single 32-bit store into shared memory. Tests record the stores
// through it; production leaves it at the store.
extern void (*switch_store)(tarn_control_block &block, const field_store &store);

// The three switches. Each returns src: 0, also when no control block exists (nothing changes
// then), or the pointer check's refusal of `crc`, which leaves the block alone. `crc` is only
// read, for the closing trace, and never written.
//
// CPU judging and sleep-overrun detection again from the 11th pass from now, and reporting re-armed
// at once (tookLog 0): the next finding of any check is reported.
TARN_EXPORT uint32_t tarn_enable_cpu_alerts(uint32_t *crc);
// CPU judging and sleep-overrun detection held off for the next 59 passes; they resume by
// themselves in the 60th.
TARN_EXPORT uint32_t tarn_disable_cpu_alerts(uint32_t *crc);
// The sleep alert forced: the loop leaves its sleep within a second, and its next pass reports the
// sleep alert with sleep_time_percent 0. CPU judging is armed at once and reporting re-armed.
TARN_EXPORT uint32_t tarn_trigger_cpu_alert04(uint32_t *crc);

// Problem events are informational while `value` is non-zero, errors while it is 0; the value is
// kept as given. Returns src, always 0, also when no control block exists (nothing changes then).
// Out: *crc, 0.
TARN_EXPORT uint32_t tarn_set_logging_type(uint32_t value, uint32_t *crc);

// tarn_set_logging_type for a call through the Java bridge, with the call's one boolean argument
// as the value. Returns 0 once the call's void result is set; 22 on a failure, the call then
// holding a native-function error that says why (today only the argument's fetch can fail).
TARN_EXPORT int32_t java_set_logging_type(jcb_context *ctx);

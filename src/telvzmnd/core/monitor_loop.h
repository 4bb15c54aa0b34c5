// The monitor: tarn_mon_main reads and validates the control file, creates the control block and
// runs passes until it is told to stop. A pass calls the five checks and the external routines,
// reports what they found (problem snapshot, event, kill), writes a plain snapshot at its own
// cadence, and sleeps one second at a time, measuring whether the sleep took longer than allowed.
#pragma once

#include <cstdint>

#include "export.h"

inline constexpr int32_t CHECKING_INTERVAL_MINIMUM = 5; // a shorter interval from the host is 60
inline constexpr int32_t SLEEP_PERCENT_NOTHING_SLEPT = 999;

// Where the loop takes the time from. Production leaves them at the system's uptime (sysinfo) and
// sleep(1), reached through the C library so that a host may interpose them; tests step a clock of
// their own, so that many passes take milliseconds and a drift is exactly what they set.
extern long (*uptime_source)();
extern void (*one_second_sleep)();

// The control file's text as the loop read it; external routines get it too.
inline constexpr uint32_t FILE_DATA_SIZE = 100000;
extern char fileData[FILE_DATA_SIZE];

// Runs the monitor until a terminate request, the end of a run-once pass or a failure. argv[1]: the
// checking interval in seconds; a third argument of any value: one pass only. Returns src: the
// result of closing the control file, or of its report when that failed; 0 without a control file.
TARN_EXPORT uint32_t tarn_mon_main(int32_t argc, char **argv);

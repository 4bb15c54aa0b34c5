// Pressure stall information: how much of the wall time tasks waited for memory, CPU and I/O, from
// /proc/pressure/{memory,cpu,io}, with the growth of the stalled time since the previous pass.
#pragma once

#include "extra_support.h"

// One line of a pressure file, as "some avg10=0.12 avg60=0.05 avg300=0.01 total=123456".
struct pressure_figures {
    bool present;
    uint32_t avg10;  // hundredths of a percent of wall time, over 10 s
    uint32_t avg60;  // over 60 s
    uint32_t avg300; // over 300 s
    uint64_t total;  // microseconds stalled since boot
};

// A whole file: "some" (at least one task stalled) and, on most kernels, "full" (all stalled).
struct pressure_file {
    pressure_figures some;
    pressure_figures full;
};

// What the routine keeps of one resource from pass to pass.
struct pressure_memory {
    bool some_known; // some_total is the previous pass's
    bool full_known; // full_total is the previous pass's
    uint64_t some_total;
    uint64_t full_total;
    bool absence_said; // the file was absent and that was said; silent until it comes back
};

// Parses a pressure file's text; false when it holds no well-formed "some" line, a "some" or "full"
// line that is malformed, or either of them twice. Other lines are passed over.
bool parse_pressure(std::string_view text, pressure_file *file);

// Writes the line of one resource from its parsed file and updates `memory`.
void pressure_line(routine_text &text, const char *resource, const pressure_file &file,
                   pressure_memory &memory);

// The routine: one line per resource. A file that cannot be read (an old kernel, or accounting off)
// is said once, on the first pass that finds it so, and not again until it has been read again; a
// file that is read but malformed is said on every pass.
EXTRA_EXPORT void telvzextra_pressure(const char *fileData, char **returnedData);

// Forgets every pass, for tests.
void reset_pressure_state();

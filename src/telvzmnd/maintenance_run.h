// The appliance's maintenance tools that the monitor starts through runAsRoot: what a tool prints
// is only traced, line by line, and a tool that writes a data file has the file's size asked for
// afterwards. Failures of these runs have always been traced in the words of the system memory
// check ("free").
#pragma once

#include <cstdint>

#include "command_runner.h"

// A tool whose output is traced with `output_trace` (one "%s", the line without its line end).
command_outcome run_traced(const char *const *argv, const char *output_trace);

// A tool that writes the data file `file_name`.
struct maintenance_run {
    const char *const *argv;
    const char *output_trace;
    const char *worked_trace;      // once the tool was started (or its start failed)
    const char *file_name;         // whose size is asked for afterwards
    const char *size_failed_trace; // "%d", and the report below, of a failed size query
    uint32_t size_failed_reason;
};

// Runs the tool and asks for its file's size. Out: *crc, 0 on entry, then the size query's.
// Returns the size query's src; 0 when no pipe could be made. The report of a failed size query
// has always been guarded by the outcome of the pipe, which is known good by then: it stays
// dormant, and a missing file shows only in what is returned.
uint32_t run_and_query(const maintenance_run &run, uint32_t *crc);

// What every line the platform writes begins with: the time in UTC and who wrote it.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <ctime>

namespace telv::stamp {

// "2026-11-22T02:31:30.123Z": ISO 8601, UTC, milliseconds.
struct UtcTime {
    char text[64];
};
UtcTime utc_now();

// The caller's pid: asked of the kernel once, and once more in a forked child.
pid_t process_id();

// The kernel's id of the calling thread (the one `ps -L` and /proc/<pid>/task show), for a
// caller whose process id is `pid` (the caller has just read it).
long thread_id(pid_t pid);

// "2026-11-22T02:31:30.123Z 4321 4322 ": the time of a trace line, its pid and its thread.
struct LineStamp {
    char text[128];
    size_t length;
    struct timespec time; // the reading of the clock that the text shows
};
LineStamp line_stamp();

} // namespace telv::stamp

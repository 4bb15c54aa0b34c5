// What every line the platform writes begins with: the time in UTC and who wrote it.
#pragma once

#include <sys/types.h>

#include <cstdint>

namespace telv::stamp {

// "2026-11-22T02:31:30.123Z": ISO 8601, UTC, milliseconds.
struct UtcTime {
    char text[64];
};
UtcTime utc_now();

// The kernel's id of the calling thread (the one `ps -L` and /proc/<pid>/task show), for a
// caller whose process id is `pid` (the caller has just read it).
long thread_id(pid_t pid);

} // namespace telv::stamp

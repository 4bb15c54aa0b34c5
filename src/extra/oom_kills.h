// Kernel out-of-memory kills: the oom_kill counter of /proc/vmstat, its rise since the previous
// pass, and for a rise the victims that the kernel log (/dev/kmsg) names.
#pragma once

#include "extra_support.h"

// What /proc/vmstat says of the counter.
enum class oom_counter { found, absent, malformed };

// The value of the "oom_kill N" line; absent when there is no such line (kernels before 4.13),
// malformed when its value is not a whole number of 64 bits.
oom_counter parse_vmstat_oom_kill(std::string_view text, uint64_t *count);

inline constexpr size_t VICTIM_NAME_SIZE = 64;

// A kill the kernel log names.
struct kernel_kill {
    uint64_t sequence; // the record's sequence number in the kernel log
    uint64_t pid;
    char name[VICTIM_NAME_SIZE]; // printable, cut to 63 bytes
};

// Whether one kernel log record ("6,1234,5678901,-;Out of memory: Killed process 4242 (stress)
// total-vm:...") tells of a killed process, and which.
bool parse_kmsg_kill(std::string_view record, kernel_kill *kill);

inline constexpr size_t KMSG_RECORD_SIZE = 8192; // larger than any record the kernel hands over
inline constexpr int KMSG_READS_MAX = 16384;     // records (or pieces of a file) read in a pass
inline constexpr size_t OOM_VICTIMS_MAX = 16;    // victims named for one rise

// The routine: one line of the counter, and for a rise one line per victim named (at most the
// rise, at most 16), or one line that says why none is named.
EXTRA_EXPORT void telvzextra_oom_kills(const char *fileData, char **returnedData);

// Forgets every pass, for tests.
void reset_oom_kills_state();

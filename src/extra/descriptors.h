// Descriptors against their limit: the processes whose open descriptors (the entries of
// /proc/<pid>/fd) are the largest share of their own soft limit ("Max open files" of
// /proc/<pid>/limits).
#pragma once

#include "extra_support.h"

// The soft limit of open files, as /proc/<pid>/limits gives it.
struct open_files_limit {
    enum kind_type { value, unlimited, malformed } kind;
    uint64_t soft; // when kind is value
};

// The "Max open files" line of a limits file ("Max open files  1024  524288  files").
open_files_limit parse_open_files_limit(std::string_view text);

inline constexpr int64_t LISTED_DEFAULT = 10;
inline constexpr int64_t LISTED_MAX = 100;
inline constexpr std::string_view LISTED_KEYWORD = "EXTRA_DESCRIPTORS_LISTED";
inline constexpr size_t PROCESS_NAME_SIZE = 64;

// A process in the list.
struct descriptor_share {
    uint64_t pid;
    uint64_t open;         // entries of its fd directory
    uint64_t limit;        // its soft limit
    uint64_t basis_points; // open / limit in hundredths of a percent; a limit of 0 counts as 1
    char name[PROCESS_NAME_SIZE]; // its comm, printable
};

// Ranks `process` among the `count` of `listed` (sorted by share, largest first, then by pid),
// keeping at most `capacity`. Returns the new count.
size_t rank_process(descriptor_share *listed, size_t count, size_t capacity,
                    const descriptor_share &process);

// The routine: a line of what was read, then one line per listed process. A process with an
// unlimited soft limit cannot run out and is not ranked; one that vanishes or cannot be read
// (another user's, without privilege) is skipped and counted.
EXTRA_EXPORT void telvzextra_descriptors(const char *fileData, char **returnedData);

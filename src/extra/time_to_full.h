// Time to full: for each local file system, the rate at which its used space grows over the passes
// this module has seen, and where it grows, the time until it is full at that rate.
#pragma once

#include "extra_support.h"

// A line of /proc/self/mounts: "device mount-point type options 0 0", blanks in names as "\040".
struct mount_entry {
    std::string_view device;
    std::string_view mount_point; // escaped, as the kernel writes it
    std::string_view type;
};

// The first three fields of a mounts line; false with fewer.
bool parse_mount_line(std::string_view line, mount_entry *entry);

// The mount point with its octal escapes ("\040") undone, NUL-terminated; false when it does not
// fit in `size`.
bool unescape_mount_path(std::string_view escaped, char *path, size_t size);

// local: a file system on a block device ("ext4", not "nodev" in /proc/filesystems, not a network
// one); every other kind is left out.
enum class file_system_kind { local, pseudo, network, unlisted };

// The kind of `type` by the text of /proc/filesystems ("nodev\tproc\n\text4\n").
file_system_kind classify_file_system(std::string_view filesystems, std::string_view type);

// The least-squares line of used space over time, kept in O(1): the running means, the sum of
// squared deviations of time and their products with the used space's (Welford's updates, which
// stay exact enough over any number of passes).
struct used_trend {
    uint64_t passes;
    double mean_seconds;
    double mean_used;       // bytes
    double squares_seconds; // sum of (t - mean t)^2
    double products;        // sum of (t - mean t)(used - mean used)
};

void add_sample(used_trend &trend, double seconds, double used);
// The slope of the line in bytes a second; false before two passes at different times.
bool growth_rate(const used_trend &trend, double *bytes_per_second);

inline constexpr size_t FILE_SYSTEMS_MAX = 64;  // file systems followed at once
inline constexpr size_t MOUNT_POINT_SIZE = 256; // a longer mount point is not followed
inline constexpr size_t DEVICE_SIZE = 128;      // a longer device name is not followed
inline constexpr int64_t HORIZON_DEFAULT = 24;  // hours
inline constexpr int64_t HORIZON_MAX = 876000;  // a hundred years
inline constexpr std::string_view HORIZON_KEYWORD = "EXTRA_TIME_TO_FULL_HORIZON";

// The routine: one line per local file system of this pass (the first mount of each device), and a
// line for those not followed. A file system that is no longer mounted is forgotten; one mounted
// again starts afresh.
EXTRA_EXPORT void telvzextra_time_to_full(const char *fileData, char **returnedData);

// Forgets every pass, for tests.
void reset_time_to_full_state();

// What a pass measured, for a host that publishes it (tarnmon run --metrics): the figures the
// checks compute on their way to a verdict, noted where they are computed, and handed with the
// pass's outcome to one observer after every pass. Nothing here runs a command or reads a file.
#pragma once

#include <cstdint>

#include "export.h"

inline constexpr uint32_t TARN_PARTITIONS_KEPT = 64;   // local partitions a pass keeps figures of
inline constexpr uint32_t TARN_MOUNT_POINT_SIZE = 256; // a mount point as df printed it, cut to fit
inline constexpr int32_t TARN_FIGURE_NONE = -1;        // a partition df printed no such line for

// One partition's use in tenths of a percent, from df's "Use%" and "IUse%" columns.
struct tarn_partition_figures {
    char mount_point[TARN_MOUNT_POINT_SIZE];
    int32_t space_tenths;  // TARN_FIGURE_NONE when df printed no space line for it
    int32_t inodes_tenths; // TARN_FIGURE_NONE when df printed no inode line with a percentage
};

// A figure is valid only when its `_known` flag is 1: a command that failed or printed nothing
// usable leaves its figure out rather than reporting a zero.
struct tarn_pass_figures {
    uint64_t pass;              // 1 for the run's first pass
    uint64_t duration_ns;       // from the start of the pass until the figures were handed over
    int32_t reason_code;        // the finding the pass reported with an event; 0 when none
    uint32_t finding_held_back; // 1: a check found a condition, but an earlier event holds reports
    uint32_t memory_known;
    int32_t memory_tenths; // memory and swap in use, of both together, as the percentage judged
    uint32_t descriptors_known;
    int32_t descriptors_tenths; // file handles in use, of the system's maximum (file-nr)
    uint32_t cpu_known;         // from the second pass on: the first has no sample to compare with
    float cpu_user_percent;     // every process's share of the machine in the newest sample
    float cpu_kernel_percent;
    uint32_t sleep_known;             // from the second pass on: the sleep before this pass
    int32_t sleep_seconds;            // how long that sleep took (or was to take, once it overran)
    int32_t sleep_interval;           // how long it was asked to take
    uint32_t partition_count;         // entries of `partitions` in use
    uint32_t partition_lines_dropped; // df lines of partitions beyond TARN_PARTITIONS_KEPT
    tarn_partition_figures partitions[TARN_PARTITIONS_KEPT];
};

// Called on the monitor's thread after each pass, before its sleep: what it does lengthens the
// pass. The figures are valid during the call only.
typedef void (*tarn_pass_observer)(const tarn_pass_figures *figures, void *context);

// Sets the one observer of every later pass; a null observer ends the observation. Safe to call
// from any thread, also while the monitor runs: once it returns, the observer it replaced is
// neither running nor called again, so its context may go. An observer must not call it.
TARN_EXPORT void tarn_observe_passes(tarn_pass_observer observer, void *context);

// ---- Noted by the checks where they compute the figure ----
void note_memory_percent(int32_t tenths);
void note_descriptor_share(int32_t tenths);
void note_partition_use(bool space, const char *mount_point, int32_t tenths);
void note_appliance_cpu(float user_percent, float kernel_percent);

// ---- The loop's side ----
// Forgets the figures of the pass before; `pass` numbers the new one.
void start_pass_figures(uint64_t pass);
// The loop's own figures, then the observer called with all of them.
struct pass_outcome {
    uint64_t duration_ns;
    int32_t reason_code;
    bool finding_held_back;
    bool sleep_known;
    int32_t sleep_seconds;
    int32_t sleep_interval;
};
void publish_pass_figures(const pass_outcome &outcome);

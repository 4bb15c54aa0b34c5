// Process CPU accounting: for every process on the machine, the share of the whole machine's CPU
// capacity it used in each of the last ten samples, split into user and kernel time, read from
// /proc and rendered as a text table for the performance check.
#pragma once

#include <cstddef>
#include <cstdint>
#include <ctime>

#include "export.h"

inline constexpr int PROCESS_SAMPLES = 10;             // the ring of samples every entry keeps
inline constexpr size_t PROCESS_NAME_LENGTH = 100;     // the name as read, parentheses included
inline constexpr size_t PROCESS_FILE_NAME_LENGTH = 32; // "/proc/<pid>/stat" for any 32-bit pid
inline constexpr size_t PROCESS_TABLE_BYTES_PER_ENTRY = 493; // text of one entry in the table

// One process, or the head of the chain (pid 0). Entries are kept in ascending pid order.
struct process_entry {
    process_entry *previous; // NULL only at the head
    int32_t seen;            // set when the pid was found in the current scan
    int32_t pid;
    int32_t priority;                         // field 18 of the stat line
    int32_t nice;                             // field 19 of the stat line
    char process_name[PROCESS_NAME_LENGTH];   // field 2 as read, at most 98 characters
    char file_name[PROCESS_FILE_NAME_LENGTH]; // "/proc/<pid>/stat"
    uint32_t user_jiffies[PROCESS_SAMPLES];   // utime at each sample, indexed like sample_ticks
    float user_percent[PROCESS_SAMPLES];      // percent of the whole machine, per sample
    uint32_t kernel_jiffies[PROCESS_SAMPLES]; // stime at each sample
    float kernel_percent[PROCESS_SAMPLES];
    process_entry *next; // NULL at the end of the chain
};

// The list header: a fixed global, never allocated; the performance check walks it.
struct process_list_header {
    int32_t number_of_cpus;                // refreshed at every update
    int32_t number_of_entries;             // entries in the chain, the head included
    int64_t sample_ticks[PROCESS_SAMPLES]; // clock-tick counter at each sample; a ring
    int32_t current_sample; // ring slot the next update fills; the newest is the one before
    process_entry head;     // pid 0, never freed
};

static_assert(offsetof(process_entry, previous) == 0);
static_assert(offsetof(process_entry, seen) == 8);
static_assert(offsetof(process_entry, pid) == 12);
static_assert(offsetof(process_entry, priority) == 16);
static_assert(offsetof(process_entry, nice) == 20);
static_assert(offsetof(process_entry, process_name) == 24);
static_assert(offsetof(process_entry, file_name) == 124);
static_assert(offsetof(process_entry, user_jiffies) == 156);
static_assert(offsetof(process_entry, user_percent) == 196);
static_assert(offsetof(process_entry, kernel_jiffies) == 236);
static_assert(offsetof(process_entry, kernel_percent) == 276);
static_assert(offsetof(process_entry, next) == 320);
static_assert(sizeof(process_entry) == 328);

static_assert(offsetof(process_list_header, number_of_cpus) == 0);
static_assert(offsetof(process_list_header, number_of_entries) == 4);
static_assert(offsetof(process_list_header, sample_ticks) == 8);
static_assert(offsetof(process_list_header, current_sample) == 88);
static_assert(offsetof(process_list_header, head) == 96);
static_assert(sizeof(process_list_header) == 424);

extern process_list_header process_list;      // the one list of the monitor
extern process_list_header *process_list_ptr; // set to &process_list by the monitoring loop
extern process_entry *process_entry_ptr;      // the performance check's cursor through the chain

// Where the outside world is read from. Production leaves them at "/proc", times(NULL) and
// sysconf(_SC_CLK_TCK); tests point them at a fake /proc tree and a stepped clock, so that
// every sample is deterministic. The root replaces the leading "/proc" of every path opened.
extern const char *proc_root;
extern clock_t (*clock_tick_source)();
extern long (*clock_tick_rate_source)();

TARN_EXPORT int32_t query_number_of_cpus();
TARN_EXPORT void prepare_process_list(process_list_header *list);
// The entry of `pid`, found from `start` on or newly made and linked in its place; NULL only when
// the new entry cannot be allocated.
TARN_EXPORT process_entry *search_pid_in_process_list(int32_t pid, process_list_header *list,
                                                      process_entry *start);
TARN_EXPORT void update_process_list(process_list_header *list);
// out: when not NULL, receives a text area of the table allocated for the caller, who frees it.
TARN_EXPORT int print_process_list(process_list_header *list, char **out);
TARN_EXPORT void delete_process_list(process_list_header *list);

// Reads one /proc/<pid>/stat line: the name (field 2), utime (14), stime (15), priority (18) and
// nice (19). Returns how many of them were converted; those not converted keep their value.
// process_name must hold PROCESS_NAME_LENGTH characters. The fields are taken exactly as the C
// library's sscanf takes "%*d %98s %*c %*d ... %u %u %*d %*d %d %d" in the C locale (returning 0
// where it returns EOF), odd lines included; fuzz/process_stat_line.cpp holds it to that.
int parse_process_stat_line(const char *text, char *process_name, uint32_t *utime, uint32_t *stime,
                            int32_t *priority, int32_t *nice);

// Puts the state of update_process_list back to its load-time value (uninitialised).
void reset_process_listing_state();

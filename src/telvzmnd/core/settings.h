// The settings of the control file: one process-wide global per keyword, named like it, and the
// one table that binds each keyword to its global, its handling, its trace text, its unit and its
// validation rule. The parser, the settings trace, the validator and tarnmon's check-config all
// walk that table.
// Percentages are tenths of a percent (1000 = 100 %); memory sizes are KB, as ps and free print
// them.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "export.h"

extern int32_t actuallyRun;                     // 1 when ACTUALLY_RUN is present: the monitor runs
extern int32_t minimum_java_free_space;         // percent (x10) of Java heap that must stay free
extern int32_t checking_interval;               // seconds between passes
extern int32_t snapshot_interval;               // passes between plain snapshots, 0 = none
extern int32_t trend_analysis_points;           // samples kept for the trend analysis, at most 24
extern int32_t trend_analysis_num_increases;    // rises over the samples that make a leak
extern uint32_t max_snapshot_file_size;         // bytes the snapshot file may grow to, 0 = unset
extern int32_t low_free_size;                   // KB of LowFree below which memory is short
extern int32_t min_swap_size;                   // KB of swap the host must have
extern int32_t resume_java_log_on_percent;      // percent (x10) of free Java heap that re-arms
extern int32_t total_memory_in_use_threshold;   // KB of memory in use
extern int32_t total_memory_percent_threshold;  // percent (x10) of memory in use
extern int32_t resume_memory_percent_threshold; // percent (x10) of memory in use that re-arms
extern int32_t vsz_memory_threshold;            // KB of a process's virtual size
extern int32_t rss_memory_threshold;            // KB of a process's resident size
extern int32_t dsiz_memory_threshold;           // KB of a process's data size
extern int32_t vsz_abort_memory_threshold;      // KB; above it the process is killed
extern int32_t rss_abort_memory_threshold;      // KB; above it the process is killed
extern int32_t dsiz_abort_memory_threshold;     // KB; above it the process is killed
extern int32_t cpu_percent_threshold;           // percent (x10) of CPU for one process
extern int32_t cpu_time_threshold;              // newest CPU samples judged, at most 10
extern int32_t cpu_percent_threshold_qv;        // percent (x10) of CPU for the appliance
extern int32_t dasd_percent_threshold;          // percent (x10) of a partition not listed
extern int32_t dasd_percent_slash_threshold;    // percent (x10) of space; likewise below
extern int32_t dasd_percent_slash_inode_threshold; // percent (x10) of inodes; likewise below
extern int32_t dasd_percent_var_threshold;
extern int32_t dasd_percent_var_inode_threshold;
extern int32_t dasd_percent_tmp_threshold;
extern int32_t dasd_percent_tmp_inode_threshold;
extern int32_t dasd_percent_console_threshold;
extern int32_t dasd_percent_console_inode_threshold;
extern int32_t dasd_percent_ffdc_threshold;
extern int32_t dasd_percent_ffdc_inode_threshold;
extern int32_t dasd_percent_console_ffdc_threshold;
extern int32_t dasd_percent_console_ffdc_inode_threshold;
extern int32_t dasd_percent_dev_shm_threshold;
extern int32_t dasd_percent_dev_shm_inode_threshold;
extern int32_t dasd_percent_dump_threshold;
extern int32_t dasd_percent_dump_inode_threshold;
extern int32_t dasd_percent_extra_threshold;
extern int32_t dasd_percent_extra_inode_threshold;
extern int32_t dasd_percent_kzrdump_threshold;
extern int32_t dasd_percent_kzrdump_inode_threshold;
extern int32_t dasd_percent_mnt_upgrade_threshold;
extern int32_t dasd_percent_mnt_upgrade_inode_threshold;
extern int32_t dasd_percent_data_threshold;
extern int32_t dasd_percent_data_inode_threshold;
extern int32_t dasd_percent_var_wqn_log_threshold;
extern int32_t dasd_percent_var_wqn_log_inode_threshold;
extern int32_t num_threads_threshold;              // processes listed
extern int32_t file_descriptors_percent_threshold; // percent (x10) of the system's descriptors
extern int32_t pp_file_descriptors_threshold;      // lines of one process's descriptor listing
extern int32_t cpu_sleep_time_threshold;           // percent (x10) of the checking interval

// Rows of the control file's three tables, counted by the first pass and filled by the second.
extern int32_t num_external_calls;
extern int32_t num_log_thresholds;
extern int32_t num_abort_thresholds;

extern int32_t manualStart; // 1 when the checking interval came from the host, not the file

// What the parser does with the second word of a keyword's line.
enum class setting_handling : uint8_t {
    plain,             // the word's number, read as atoi reads it
    flag,              // no value: the keyword alone sets 1
    checking_interval, // number, below 5 becomes 60; the line is ignored when manualStart is 1
    capped_count,      // number, above TREND_SAMPLES_MAX becomes TREND_SAMPLES_MAX
    snapshot_size,     // number x 1000 bytes, floored (unsigned) at the size of primaryDataBlock
    row_counter,       // a table keyword: the first pass only counts its lines
};

inline constexpr int32_t CHECKING_INTERVAL_MIN = 5;      // seconds; below it the default holds
inline constexpr int32_t CHECKING_INTERVAL_DEFAULT = 60; // seconds
inline constexpr int32_t TREND_SAMPLES_MAX = 24;
inline constexpr uint32_t SNAPSHOT_SIZE_UNIT = 1000; // bytes per unit of MAX_SNAPSHOT_FILE_SIZE

// How a setting that must be valid for the monitor to run compares with its neighbour.
enum class cross_check : uint8_t {
    none,
    not_below, // the value may not be less than the other setting
    not_above, // the value may not be greater than the other setting
};

// A validation rule: low <= value <= high, signed, and the cross check against `other`.
struct setting_rule {
    int32_t low;
    int32_t high;
    cross_check cross;
    const int32_t *other;           // the setting of the cross check
    std::string_view other_keyword; // its keyword, for people
    std::string_view text;          // the rule in words, for people
};

inline constexpr int32_t NO_UPPER_BOUND = INT32_MAX;

inline constexpr setting_rule AT_LEAST_1{1,  NO_UPPER_BOUND,      cross_check::none, nullptr,
                                         {}, "must be at least 1"};
inline constexpr setting_rule AT_LEAST_2{2,  NO_UPPER_BOUND,      cross_check::none, nullptr,
                                         {}, "must be at least 2"};
inline constexpr setting_rule AT_LEAST_11{11, NO_UPPER_BOUND,       cross_check::none, nullptr,
                                          {}, "must be at least 11"};
inline constexpr setting_rule PERCENT_11_TO_1000{11,      1000, cross_check::none,
                                                 nullptr, {},   "must be from 11 to 1000"};
inline constexpr setting_rule RESUME_JAVA_RULE{
    11,
    1000,
    cross_check::not_below,
    &minimum_java_free_space,
    "MINIMUM_JAVA_FREE_SPACE",
    "must be from 11 to 1000 and not below MINIMUM_JAVA_FREE_SPACE"};
inline constexpr setting_rule RESUME_MEMORY_RULE{
    11,
    1000,
    cross_check::not_above,
    &total_memory_percent_threshold,
    "TOTAL_MEMORY_PERCENT_THRESHOLD",
    "must be from 11 to 1000 and not above TOTAL_MEMORY_PERCENT_THRESHOLD"};

// The keywords of the three tables, which the second pass also reads.
inline constexpr std::string_view KEYWORD_EXTERNAL_ROUTINE = "EXTERNAL_CHECKING_ROUTINE";
inline constexpr std::string_view KEYWORD_LOG_THRESHOLDS = "PROCESS_LOG_THRESHOLDS";
inline constexpr std::string_view KEYWORD_ABORT_THRESHOLDS = "PROCESS_ABORT_THRESHOLDS";

// One keyword of the control file.
struct setting {
    std::string_view keyword;
    int32_t *value;           // its global; null only for the one unsigned setting
    uint32_t *unsigned_value; // max_snapshot_file_size, which is compared unsigned
    setting_handling handling;
    const char *trace;        // the settings trace line, with one %d for the value
    std::string_view unit;    // the unit and meaning of the value, for people
    const setting_rule *rule; // null: not validated
    uint8_t check_order;      // place of the rule in the validation sequence, from 1; 0 = none
};

// The keywords in the order of the settings trace, which the first pass also compares them in:
// the order of the keyword list, except that the snapshot file size has always been traced after
// the general partition threshold; the three row counts end it.
inline constexpr setting SETTINGS[] = {
    {"ACTUALLY_RUN", &actuallyRun, nullptr, setting_handling::flag, "TARNMNDF: actuallyRun = %d",
     "1 = the monitor runs (the keyword takes no value)", nullptr, 0},
    {"MINIMUM_JAVA_FREE_SPACE", &minimum_java_free_space, nullptr, setting_handling::plain,
     "TARNMNDF: minimum_java_free_space = %d percent (x10)", "percent (x10) of free Java heap",
     &PERCENT_11_TO_1000, 1},
    {"CHECKING_INTERVAL", &checking_interval, nullptr, setting_handling::checking_interval,
     "TARNMNDF: checking_interval = %d seconds", "seconds between passes (below 5: 60)", nullptr,
     0},
    {"SNAPSHOT_INTERVAL", &snapshot_interval, nullptr, setting_handling::plain,
     "TARNMNDF: snapshot_interval = %d passes", "passes between plain snapshots (0 = none)",
     nullptr, 0},
    {"TREND_ANALYSIS_POINTS", &trend_analysis_points, nullptr, setting_handling::capped_count,
     "TARNMNDF: trend_analysis_points = %d samples", "samples of the trend analysis (at most 24)",
     nullptr, 0},
    {"TREND_ANALYSIS_NUM_INCREASES", &trend_analysis_num_increases, nullptr,
     setting_handling::plain, "TARNMNDF: trend_analysis_num_increases = %d increases",
     "rises in a row that make a trend", nullptr, 0},
    {"LOW_FREE_SIZE", &low_free_size, nullptr, setting_handling::plain,
     "TARNMNDF: low_free_size = %d KB", "KB of LowFree", &AT_LEAST_1, 41},
    {"MIN_SWAP_SIZE", &min_swap_size, nullptr, setting_handling::plain,
     "TARNMNDF: min_swap_size = %d KB", "KB of swap", nullptr, 0},
    {"RESUME_JAVA_LOG_ON_PERCENT", &resume_java_log_on_percent, nullptr, setting_handling::plain,
     "TARNMNDF: resume_java_log_on_percent = %d percent (x10)", "percent (x10) of free Java heap",
     &RESUME_JAVA_RULE, 2},
    {"TOTAL_MEMORY_IN_USE_THRESHOLD", &total_memory_in_use_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: total_memory_in_use_threshold = %d KB",
     "KB of memory in use", &AT_LEAST_11, 3},
    {"TOTAL_MEMORY_PERCENT_THRESHOLD", &total_memory_percent_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: total_memory_percent_threshold = %d percent (x10)",
     "percent (x10) of memory in use", &PERCENT_11_TO_1000, 4},
    {"RESUME_MEMORY_PERCENT_THRESHOLD", &resume_memory_percent_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: resume_memory_percent_threshold = %d percent (x10)",
     "percent (x10) of memory in use", &RESUME_MEMORY_RULE, 5},
    {"VSZ_MEMORY_THRESHOLD", &vsz_memory_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: vsz_memory_threshold = %d KB", "KB of a process's virtual size", &AT_LEAST_11, 6},
    {"RSS_MEMORY_THRESHOLD", &rss_memory_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: rss_memory_threshold = %d KB", "KB of a process's resident size", nullptr, 0},
    {"DSIZ_MEMORY_THRESHOLD", &dsiz_memory_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dsiz_memory_threshold = %d KB", "KB of a process's data size", &AT_LEAST_11, 42},
    {"VSZ_ABORT_MEMORY_THRESHOLD", &vsz_abort_memory_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: vsz_abort_memory_threshold = %d KB", "KB of a process's virtual size (kill)",
     nullptr, 0},
    {"RSS_ABORT_MEMORY_THRESHOLD", &rss_abort_memory_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: rss_abort_memory_threshold = %d KB", "KB of a process's resident size (kill)",
     nullptr, 0},
    {"DSIZ_ABORT_MEMORY_THRESHOLD", &dsiz_abort_memory_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dsiz_abort_memory_threshold = %d KB", "KB of a process's data size (kill)", nullptr,
     0},
    {"CPU_PERCENT_THRESHOLD", &cpu_percent_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: cpu_percent_threshold = %d ", "percent (x10) of CPU for one process", &AT_LEAST_11,
     7},
    {"CPU_TIME_THRESHOLD", &cpu_time_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: cpu_time_threshold = %d samples", "newest CPU samples judged (at most 10 are used)",
     &AT_LEAST_1, 8},
    {"CPU_PERCENT_THRESHOLD_QV", &cpu_percent_threshold_qv, nullptr, setting_handling::plain,
     "TARNMNDF: cpu_percent_threshold_qv = %d ", "percent (x10) of CPU for the whole appliance",
     &AT_LEAST_11, 9},
    {"DASD_PERCENT_THRESHOLD", &dasd_percent_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dasd_percent_threshold = %d percent",
     "percent (x10) of space or inodes of a partition not listed", &AT_LEAST_11, 10},
    {"MAX_SNAPSHOT_FILE_SIZE", nullptr, &max_snapshot_file_size, setting_handling::snapshot_size,
     "TARNMNDF: max_snapshot_file_size = %d bytes",
     "bytes (the file gives thousands of bytes; at least 1545056)", nullptr, 0},
    {"DASD_PERCENT_SLASH_THRESHOLD", &dasd_percent_slash_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_slash_threshold = %d percent",
     "percent (x10) of space of /", &AT_LEAST_11, 11},
    {"DASD_PERCENT_SLASH_INODE_THRESHOLD", &dasd_percent_slash_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_slash_inode_threshold = %d percent",
     "percent (x10) of inodes of /", &AT_LEAST_11, 12},
    {"DASD_PERCENT_VAR_THRESHOLD", &dasd_percent_var_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dasd_percent_var_threshold = %d percent", "percent (x10) of space of /var",
     &AT_LEAST_11, 13},
    {"DASD_PERCENT_VAR_INODE_THRESHOLD", &dasd_percent_var_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_var_inode_threshold = %d percent",
     "percent (x10) of inodes of /var", &AT_LEAST_11, 14},
    {"DASD_PERCENT_TMP_THRESHOLD", &dasd_percent_tmp_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dasd_percent_tmp_threshold = %d percent", "percent (x10) of space of /tmp",
     &AT_LEAST_11, 15},
    {"DASD_PERCENT_TMP_INODE_THRESHOLD", &dasd_percent_tmp_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_tmp_inode_threshold = %d percent",
     "percent (x10) of inodes of /tmp", &AT_LEAST_11, 16},
    {"DASD_PERCENT_CONSOLE_THRESHOLD", &dasd_percent_console_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_console_threshold = %d percent",
     "percent (x10) of space of /console", &AT_LEAST_11, 17},
    {"DASD_PERCENT_CONSOLE_INODE_THRESHOLD", &dasd_percent_console_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_console_inode_threshold = %d percent",
     "percent (x10) of inodes of /console", &AT_LEAST_11, 18},
    {"DASD_PERCENT_FFDC_THRESHOLD", &dasd_percent_ffdc_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dasd_percent_ffdc_threshold = %d percent", "percent (x10) of space of /ffdc",
     &AT_LEAST_11, 19},
    {"DASD_PERCENT_FFDC_INODE_THRESHOLD", &dasd_percent_ffdc_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_ffdc_inode_threshold = %d percent",
     "percent (x10) of inodes of /ffdc", &AT_LEAST_11, 20},
    {"DASD_PERCENT_CONSOLE_FFDC_THRESHOLD", &dasd_percent_console_ffdc_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_console_ffdc_threshold = %d percent",
     "percent (x10) of space of /console/ffdc", &AT_LEAST_11, 21},
    {"DASD_PERCENT_CONSOLE_FFDC_INODE_THRESHOLD", &dasd_percent_console_ffdc_inode_threshold,
     nullptr, setting_handling::plain,
     "TARNMNDF: dasd_percent_console_ffdc_inode_threshold = %d percent",
     "percent (x10) of inodes of /console/ffdc", &AT_LEAST_11, 22},
    {"DASD_PERCENT_DEV_SHM_THRESHOLD", &dasd_percent_dev_shm_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_dev_shm_threshold = %d percent",
     "percent (x10) of space of /dev/shm", &AT_LEAST_11, 23},
    {"DASD_PERCENT_DEV_SHM_INODE_THRESHOLD", &dasd_percent_dev_shm_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_dev_shm_inode_threshold = %d percent",
     "percent (x10) of inodes of /dev/shm", &AT_LEAST_11, 24},
    {"DASD_PERCENT_DUMP_THRESHOLD", &dasd_percent_dump_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dasd_percent_dump_threshold = %d percent", "percent (x10) of space of /dump",
     &AT_LEAST_11, 25},
    {"DASD_PERCENT_DUMP_INODE_THRESHOLD", &dasd_percent_dump_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_dump_inode_threshold = %d percent",
     "percent (x10) of inodes of /dump", &AT_LEAST_11, 26},
    {"DASD_PERCENT_EXTRA_THRESHOLD", &dasd_percent_extra_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_extra_threshold = %d percent",
     "percent (x10) of space of /extra", &AT_LEAST_11, 27},
    {"DASD_PERCENT_EXTRA_INODE_THRESHOLD", &dasd_percent_extra_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_extra_inode_threshold = %d percent",
     "percent (x10) of inodes of /extra", &AT_LEAST_11, 28},
    {"DASD_PERCENT_KZRDUMP_THRESHOLD", &dasd_percent_kzrdump_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_kzrdump_threshold = %d percent",
     "percent (x10) of space of /kzrdump", &AT_LEAST_11, 29},
    {"DASD_PERCENT_KZRDUMP_INODE_THRESHOLD", &dasd_percent_kzrdump_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_kzrdump_inode_threshold = %d percent",
     "percent (x10) of inodes of /kzrdump", &AT_LEAST_11, 30},
    {"DASD_PERCENT_MNT_UPGRADE_THRESHOLD", &dasd_percent_mnt_upgrade_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_mnt_upgrade_threshold = %d percent",
     "percent (x10) of space of /mnt_upgrade", &AT_LEAST_11, 31},
    {"DASD_PERCENT_MNT_UPGRADE_INODE_THRESHOLD", &dasd_percent_mnt_upgrade_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_mnt_upgrade_inode_threshold = %d percent",
     "percent (x10) of inodes of /mnt_upgrade", &AT_LEAST_11, 32},
    {"DASD_PERCENT_DATA_THRESHOLD", &dasd_percent_data_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: dasd_percent_data_threshold = %d percent", "percent (x10) of space of /data",
     &AT_LEAST_11, 33},
    {"DASD_PERCENT_DATA_INODE_THRESHOLD", &dasd_percent_data_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_data_inode_threshold = %d percent",
     "percent (x10) of inodes of /data", &AT_LEAST_11, 34},
    {"DASD_PERCENT_VAR_WQN_LOG_THRESHOLD", &dasd_percent_var_wqn_log_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_var_wqn_log_threshold = %d percent",
     "percent (x10) of space of /var/wqn/log", &AT_LEAST_11, 35},
    // The trace line of this one has always read "indoe"; tools that read the trace expect it.
    {"DASD_PERCENT_VAR_WQN_LOG_INODE_THRESHOLD", &dasd_percent_var_wqn_log_inode_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: dasd_percent_var_wqn_log_indoe_threshold = %d percent",
     "percent (x10) of inodes of /var/wqn/log", &AT_LEAST_11, 36},
    {"NUM_THREADS_THRESHOLD", &num_threads_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: num_threads_threshold = %d processes", "processes listed", &AT_LEAST_11, 37},
    {"FILE_DESCRIPTORS_PERCENT_THRESHOLD", &file_descriptors_percent_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: file_descriptors_percent_threshold = %d percent (x10)",
     "percent (x10) of the system's file descriptors in use", &AT_LEAST_11, 38},
    {"PP_FILE_DESCRIPTORS_THRESHOLD", &pp_file_descriptors_threshold, nullptr,
     setting_handling::plain, "TARNMNDF: pp_file_descriptors_threshold = %d lines",
     "lines of one process's descriptor listing", &AT_LEAST_2, 39},
    {"CPU_SLEEP_TIME_THRESHOLD", &cpu_sleep_time_threshold, nullptr, setting_handling::plain,
     "TARNMNDF: cpu_sleep_time_threshold = %d percent (x10)",
     "percent (x10) of the checking interval that a sleep may overrun", &AT_LEAST_11, 40},
    {KEYWORD_EXTERNAL_ROUTINE, &num_external_calls, nullptr, setting_handling::row_counter,
     "TARNMNDF: num_external_calls = %d", "rows: module, routine", nullptr, 0},
    {KEYWORD_LOG_THRESHOLDS, &num_log_thresholds, nullptr, setting_handling::row_counter,
     "TARNMNDF: num_log_thresholds = %d", "rows: rss dsiz vsize KB, memoryCheckFlag, expression",
     nullptr, 0},
    {KEYWORD_ABORT_THRESHOLDS, &num_abort_thresholds, nullptr, setting_handling::row_counter,
     "TARNMNDF: num_abort_thresholds = %d", "rows: rss dsiz vsize abort KB, expression", nullptr,
     0},
};

inline constexpr size_t SETTING_COUNT = sizeof SETTINGS / sizeof SETTINGS[0];

// The value of a setting as a number, the unsigned one included.
inline int64_t setting_current(const setting &entry) {
    return entry.value != nullptr ? int64_t{*entry.value} : int64_t{*entry.unsigned_value};
}

inline constexpr int32_t TREND_INCREASES_DEFAULT = 25;

// Puts every setting and row count, and manualStart, back to its load-time value 0.
void reset_settings();

// What monitoring sets before it reads the control file: the checking interval, the snapshot
// interval and the two trend settings get their defaults, the row counts 0; every other setting
// keeps what it has.
void settings_start_values(void);

// The whole table, for the checker of control files: *count gets its length.
const setting *settings_table(size_t *count);

// The settings of the control file: one process-wide global per keyword, named like it.
// Percentages are tenths of a percent (1000 = 100 %); memory sizes are KB, as ps and free print
// them.
#pragma once

#include <cstdint>

extern int32_t actuallyRun;
extern int32_t minimum_java_free_space;
extern int32_t checking_interval;
extern int32_t snapshot_interval;
extern int32_t trend_analysis_points;
extern int32_t trend_analysis_num_increases;
extern uint32_t max_snapshot_file_size;
extern int32_t low_free_size;
extern int32_t min_swap_size;
extern int32_t resume_java_log_on_percent;
extern int32_t total_memory_in_use_threshold;
extern int32_t total_memory_percent_threshold;
extern int32_t resume_memory_percent_threshold;
extern int32_t vsz_memory_threshold;
extern int32_t rss_memory_threshold;
extern int32_t dsiz_memory_threshold;
extern int32_t vsz_abort_memory_threshold;
extern int32_t rss_abort_memory_threshold;
extern int32_t dsiz_abort_memory_threshold;
extern int32_t cpu_percent_threshold;
extern int32_t cpu_time_threshold;
extern int32_t cpu_percent_threshold_qv;
extern int32_t dasd_percent_threshold;
extern int32_t dasd_percent_slash_threshold;
extern int32_t dasd_percent_slash_inode_threshold;
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
extern int32_t num_threads_threshold;
extern int32_t file_descriptors_percent_threshold;
extern int32_t pp_file_descriptors_threshold;
extern int32_t cpu_sleep_time_threshold;

extern int32_t manualStart; // 1 when the checking interval came from the host, not the file

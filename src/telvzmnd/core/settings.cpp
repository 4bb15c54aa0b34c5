#include "core/settings.h"

int32_t actuallyRun;
int32_t minimum_java_free_space;
int32_t checking_interval;
int32_t snapshot_interval;
int32_t trend_analysis_points;
int32_t trend_analysis_num_increases;
uint32_t max_snapshot_file_size;
int32_t low_free_size;
int32_t min_swap_size;
int32_t resume_java_log_on_percent;
int32_t total_memory_in_use_threshold;
int32_t total_memory_percent_threshold;
int32_t resume_memory_percent_threshold;
int32_t vsz_memory_threshold;
int32_t rss_memory_threshold;
int32_t dsiz_memory_threshold;
int32_t vsz_abort_memory_threshold;
int32_t rss_abort_memory_threshold;
int32_t dsiz_abort_memory_threshold;
int32_t cpu_percent_threshold;
int32_t cpu_time_threshold;
int32_t cpu_percent_threshold_qv;
int32_t dasd_percent_threshold;
int32_t dasd_percent_slash_threshold;
int32_t dasd_percent_slash_inode_threshold;
int32_t dasd_percent_var_threshold;
int32_t dasd_percent_var_inode_threshold;
int32_t dasd_percent_tmp_threshold;
int32_t dasd_percent_tmp_inode_threshold;
int32_t dasd_percent_console_threshold;
int32_t dasd_percent_console_inode_threshold;
int32_t dasd_percent_ffdc_threshold;
int32_t dasd_percent_ffdc_inode_threshold;
int32_t dasd_percent_console_ffdc_threshold;
int32_t dasd_percent_console_ffdc_inode_threshold;
int32_t dasd_percent_dev_shm_threshold;
int32_t dasd_percent_dev_shm_inode_threshold;
int32_t dasd_percent_dump_threshold;
int32_t dasd_percent_dump_inode_threshold;
int32_t dasd_percent_extra_threshold;
int32_t dasd_percent_extra_inode_threshold;
int32_t dasd_percent_kzrdump_threshold;
int32_t dasd_percent_kzrdump_inode_threshold;
int32_t dasd_percent_mnt_upgrade_threshold;
int32_t dasd_percent_mnt_upgrade_inode_threshold;
int32_t dasd_percent_data_threshold;
int32_t dasd_percent_data_inode_threshold;
int32_t dasd_percent_var_wqn_log_threshold;
int32_t dasd_percent_var_wqn_log_inode_threshold;
int32_t num_threads_threshold;
int32_t file_descriptors_percent_threshold;
int32_t pp_file_descriptors_threshold;
int32_t cpu_sleep_time_threshold;
int32_t num_external_calls;
int32_t num_log_thresholds;
int32_t num_abort_thresholds;
int32_t manualStart;

namespace {

// A trace text is handed to the printf-style trace service with exactly one int.
consteval bool takes_one_int(std::string_view text) {
    int conversions = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') {
            continue;
        }
        if (i + 1 >= text.size() || text[i + 1] != 'd') {
            return false;
        }
        ++conversions;
    }
    return conversions == 1;
}

consteval bool table_is_sound() {
    for (size_t i = 0; i < SETTING_COUNT; ++i) {
        const setting &entry = SETTINGS[i];
        if (!takes_one_int(entry.trace) || entry.keyword.empty()) {
            return false;
        }
        if ((entry.value == nullptr) != (entry.handling == setting_handling::snapshot_size)) {
            return false;
        }
        for (size_t j = i + 1; j < SETTING_COUNT; ++j) {
            if (SETTINGS[j].keyword == entry.keyword) {
                return false;
            }
        }
    }
    return true;
}
static_assert(table_is_sound(),
              "every setting needs one %d trace, its global and a unique keyword");

} // namespace

void reset_settings() {
    for (const setting &entry : SETTINGS) {
        if (entry.value != nullptr) {
            *entry.value = 0;
        } else {
            *entry.unsigned_value = 0;
        }
    }
    manualStart = 0;
}

void settings_start_values(void) {
    checking_interval = CHECKING_INTERVAL_DEFAULT;
    snapshot_interval = 0;
    trend_analysis_points = 0;
    trend_analysis_num_increases = TREND_INCREASES_DEFAULT;
    num_external_calls = 0;
    num_log_thresholds = 0;
    num_abort_thresholds = 0;
}

const setting *settings_table(size_t *count) {
    if (count != nullptr) {
        *count = SETTING_COUNT;
    }
    return SETTINGS;
}

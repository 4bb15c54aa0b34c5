// A control file that a quiet host passes: every setting the validation needs, each partition's
// thresholds at 90 %, and whatever a test changes or adds.
#pragma once

#include <map>
#include <string>

namespace quiet_control {

inline const std::map<std::string, std::string> &settings() {
    static const std::map<std::string, std::string> quiet = {
        {"MINIMUM_JAVA_FREE_SPACE", "100"},
        {"RESUME_JAVA_LOG_ON_PERCENT", "150"},
        {"TOTAL_MEMORY_IN_USE_THRESHOLD", "16000000"},
        {"TOTAL_MEMORY_PERCENT_THRESHOLD", "900"},
        {"RESUME_MEMORY_PERCENT_THRESHOLD", "800"},
        {"VSZ_MEMORY_THRESHOLD", "3000000"},
        {"RSS_MEMORY_THRESHOLD", "1000000"},
        {"DSIZ_MEMORY_THRESHOLD", "2000000"},
        {"RSS_ABORT_MEMORY_THRESHOLD", "2500000"},
        {"CPU_PERCENT_THRESHOLD", "900"},
        {"CPU_TIME_THRESHOLD", "10"},
        {"CPU_PERCENT_THRESHOLD_QV", "950"},
        {"CPU_SLEEP_TIME_THRESHOLD", "1100"},
        {"DASD_PERCENT_THRESHOLD", "900"},
        {"NUM_THREADS_THRESHOLD", "2000"},
        {"FILE_DESCRIPTORS_PERCENT_THRESHOLD", "800"},
        {"PP_FILE_DESCRIPTORS_THRESHOLD", "1000"},
        {"LOW_FREE_SIZE", "1"},
        {"MAX_SNAPSHOT_FILE_SIZE", "50000"},
    };
    return quiet;
}

inline constexpr const char *PARTITIONS[] = {
    "SLASH", "VAR",   "TMP",     "CONSOLE",     "FFDC", "CONSOLE_FFDC", "DEV_SHM",
    "DUMP",  "EXTRA", "KZRDUMP", "MNT_UPGRADE", "DATA", "VAR_WQN_LOG"};

// The text, "ACTUALLY_RUN" first and the settings in keyword order; a change to an empty value
// leaves its keyword out. `extra_lines` follow them.
inline std::string text(const std::map<std::string, std::string> &changes,
                        const std::string &extra_lines = "") {
    std::map<std::string, std::string> all = settings();
    for (const char *partition : PARTITIONS) {
        all["DASD_PERCENT_" + std::string(partition) + "_THRESHOLD"] = "900";
        all["DASD_PERCENT_" + std::string(partition) + "_INODE_THRESHOLD"] = "900";
    }
    for (const auto &[keyword, value] : changes) {
        all[keyword] = value;
    }
    std::string lines = "ACTUALLY_RUN\n";
    for (const auto &[keyword, value] : all) {
        if (!value.empty()) {
            lines += keyword + " " + value + "\n";
        }
    }
    return lines + extra_lines;
}

} // namespace quiet_control

#include <gtest/gtest.h>

#include <string>
#include <string_view>
#include <vector>

#include "core/settings.h"
#include "core/validation.h"
#include "recording_platform.h"

namespace {

// The settings the monitor checks, in the order it checks them.
int32_t *const CHECKED_IN_ORDER[] = {
    &minimum_java_free_space,
    &resume_java_log_on_percent,
    &total_memory_in_use_threshold,
    &total_memory_percent_threshold,
    &resume_memory_percent_threshold,
    &vsz_memory_threshold,
    &cpu_percent_threshold,
    &cpu_time_threshold,
    &cpu_percent_threshold_qv,
    &dasd_percent_threshold,
    &dasd_percent_slash_threshold,
    &dasd_percent_slash_inode_threshold,
    &dasd_percent_var_threshold,
    &dasd_percent_var_inode_threshold,
    &dasd_percent_tmp_threshold,
    &dasd_percent_tmp_inode_threshold,
    &dasd_percent_console_threshold,
    &dasd_percent_console_inode_threshold,
    &dasd_percent_ffdc_threshold,
    &dasd_percent_ffdc_inode_threshold,
    &dasd_percent_console_ffdc_threshold,
    &dasd_percent_console_ffdc_inode_threshold,
    &dasd_percent_dev_shm_threshold,
    &dasd_percent_dev_shm_inode_threshold,
    &dasd_percent_dump_threshold,
    &dasd_percent_dump_inode_threshold,
    &dasd_percent_extra_threshold,
    &dasd_percent_extra_inode_threshold,
    &dasd_percent_kzrdump_threshold,
    &dasd_percent_kzrdump_inode_threshold,
    &dasd_percent_mnt_upgrade_threshold,
    &dasd_percent_mnt_upgrade_inode_threshold,
    &dasd_percent_data_threshold,
    &dasd_percent_data_inode_threshold,
    &dasd_percent_var_wqn_log_threshold,
    &dasd_percent_var_wqn_log_inode_threshold,
    &num_threads_threshold,
    &file_descriptors_percent_threshold,
    &pp_file_descriptors_threshold,
    &cpu_sleep_time_threshold,
    &low_free_size,
    &dsiz_memory_threshold,
};

// Settings with the range 11 to 1000 (cross rules aside).
int32_t *const PERCENT_RANGE[] = {&minimum_java_free_space, &resume_java_log_on_percent,
                                  &total_memory_percent_threshold,
                                  &resume_memory_percent_threshold};

void set_all_valid() {
    for (int32_t *value : CHECKED_IN_ORDER) {
        *value = 500;
    }
}

const setting *entry_of(const int32_t *value) {
    for (const setting &entry : SETTINGS) {
        if (entry.value == value) {
            return &entry;
        }
    }
    return nullptr;
}

class Validation : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        reset_settings();
        set_all_valid();
    }
};

TEST_F(Validation, AllValidPasses) {
    EXPECT_EQ(validate_settings(), nullptr);
    EXPECT_TRUE(rec::traces().empty());
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(Validation, NothingSetFailsOnTheFirstRule) {
    reset_settings();
    const setting *failed = validate_settings();
    ASSERT_NE(failed, nullptr);
    EXPECT_EQ(failed->keyword, "MINIMUM_JAVA_FREE_SPACE");
    EXPECT_EQ(failed->rule->text, "must be from 11 to 1000");
    EXPECT_EQ(failed->unit, "percent (x10) of free Java heap");
    EXPECT_TRUE(rec::traces().empty());
}

TEST_F(Validation, RulesAreCheckedInTheMonitorsOrder) {
    reset_settings();
    for (int32_t *value : CHECKED_IN_ORDER) {
        const setting *failed = validate_settings();
        ASSERT_NE(failed, nullptr);
        EXPECT_EQ(failed->value, value) << failed->keyword;
        *value = 500;
    }
    EXPECT_EQ(validate_settings(), nullptr);
}

TEST_F(Validation, PercentRangeBoundaries) {
    for (int32_t *value : PERCENT_RANGE) {
        // Partners that let each of the four reach both ends of its range.
        minimum_java_free_space = 11;
        resume_java_log_on_percent = 1000;
        total_memory_percent_threshold = 1000;
        resume_memory_percent_threshold = 11;
        const setting *entry = entry_of(value);
        ASSERT_NE(entry, nullptr);
        int32_t kept = *value;
        *value = 10;
        EXPECT_EQ(validate_settings(), entry) << entry->keyword;
        *value = 11;
        EXPECT_EQ(validate_settings(), nullptr) << entry->keyword;
        *value = 1000;
        EXPECT_EQ(validate_settings(), nullptr) << entry->keyword;
        *value = 1001;
        EXPECT_EQ(validate_settings(), entry) << entry->keyword;
        *value = kept;
    }
}

TEST_F(Validation, AtLeast11Boundaries) {
    for (int32_t *value : CHECKED_IN_ORDER) {
        const setting *entry = entry_of(value);
        ASSERT_NE(entry, nullptr);
        if (entry->rule != &AT_LEAST_11) {
            continue;
        }
        *value = 10;
        EXPECT_EQ(validate_settings(), entry) << entry->keyword;
        *value = 11;
        EXPECT_EQ(validate_settings(), nullptr) << entry->keyword;
        *value = INT32_MAX; // no upper bound
        EXPECT_EQ(validate_settings(), nullptr) << entry->keyword;
        *value = 500;
    }
}

TEST_F(Validation, EverySettingWithARuleHasItsPlaceInTheSequence) {
    for (const setting &entry : SETTINGS) {
        EXPECT_EQ(entry.rule == nullptr, entry.check_order == 0) << entry.keyword;
    }
}

TEST_F(Validation, EveryRuleKindIsWhereItBelongs) {
    int at_least_11 = 0;
    for (int32_t *value : CHECKED_IN_ORDER) {
        at_least_11 += entry_of(value)->rule == &AT_LEAST_11 ? 1 : 0;
    }
    EXPECT_EQ(at_least_11, 35); // 9 single settings and the 26 of the known partitions
    EXPECT_EQ(entry_of(&pp_file_descriptors_threshold)->rule, &AT_LEAST_2);
    EXPECT_EQ(entry_of(&cpu_time_threshold)->rule, &AT_LEAST_1);
    EXPECT_EQ(entry_of(&low_free_size)->rule, &AT_LEAST_1);
}

// The settings whose lower bound is not 11: the last failing and the first passing value.
struct low_bound {
    int32_t *value;
    int32_t failing;
    int32_t passing;
    std::string_view keyword;
    std::string_view rule;
};
const low_bound LOW_BOUNDS[] = {
    {&pp_file_descriptors_threshold, 1, 2, "PP_FILE_DESCRIPTORS_THRESHOLD", "must be at least 2"},
    {&cpu_time_threshold, 0, 1, "CPU_TIME_THRESHOLD", "must be at least 1"},
    {&low_free_size, 0, 1, "LOW_FREE_SIZE", "must be at least 1"},
};

TEST_F(Validation, SmallLowerBounds) {
    for (const low_bound &bound : LOW_BOUNDS) {
        *bound.value = bound.failing;
        const setting *failed = validate_settings();
        ASSERT_NE(failed, nullptr) << bound.keyword;
        EXPECT_EQ(failed->keyword, bound.keyword);
        EXPECT_EQ(failed->rule->text, bound.rule);
        *bound.value = bound.passing;
        EXPECT_EQ(validate_settings(), nullptr) << bound.keyword;
    }
}

TEST_F(Validation, ComparisonsAreSigned) {
    low_free_size = -1;
    EXPECT_EQ(validate_settings(), entry_of(&low_free_size));
    low_free_size = 1;
    minimum_java_free_space = INT32_MIN;
    EXPECT_EQ(validate_settings(), entry_of(&minimum_java_free_space));
}

TEST_F(Validation, ResumeJavaBelowMinimumJavaFreeSpaceFails) {
    minimum_java_free_space = 100;
    resume_java_log_on_percent = 99;
    const setting *failed = validate_settings();
    ASSERT_NE(failed, nullptr);
    EXPECT_EQ(failed->keyword, "RESUME_JAVA_LOG_ON_PERCENT");
    EXPECT_EQ(failed->rule->cross, cross_check::not_below);
    EXPECT_EQ(failed->rule->other, &minimum_java_free_space);
    EXPECT_EQ(failed->rule->text, "must be from 11 to 1000 and not below MINIMUM_JAVA_FREE_SPACE");
    resume_java_log_on_percent = 100;
    EXPECT_EQ(validate_settings(), nullptr);
}

TEST_F(Validation, ResumeMemoryAboveTotalMemoryFails) {
    total_memory_percent_threshold = 900;
    resume_memory_percent_threshold = 901;
    const setting *failed = validate_settings();
    ASSERT_NE(failed, nullptr);
    EXPECT_EQ(failed->keyword, "RESUME_MEMORY_PERCENT_THRESHOLD");
    EXPECT_EQ(failed->rule->cross, cross_check::not_above);
    EXPECT_EQ(failed->rule->other, &total_memory_percent_threshold);
    resume_memory_percent_threshold = 900;
    EXPECT_EQ(validate_settings(), nullptr);
}

TEST_F(Validation, EarlierRuleWinsOverALaterOne) {
    // LOW_FREE_SIZE comes before NUM_THREADS_THRESHOLD among the keywords, after it when checked.
    low_free_size = 0;
    num_threads_threshold = 0;
    EXPECT_EQ(validate_settings(), entry_of(&num_threads_threshold));
}

TEST_F(Validation, SettingsWithoutARuleAreNotChecked) {
    actuallyRun = 0;
    rss_memory_threshold = -5;
    vsz_abort_memory_threshold = -5;
    rss_abort_memory_threshold = -5;
    dsiz_abort_memory_threshold = -5;
    min_swap_size = -5;
    max_snapshot_file_size = 0;
    snapshot_interval = -5;
    trend_analysis_points = -5;
    trend_analysis_num_increases = -5;
    checking_interval = -5;
    EXPECT_EQ(validate_settings(), nullptr);
}

TEST_F(Validation, RunRequestedOnlyWhenActuallyRunIsOne) {
    EXPECT_EQ(run_requested(), 0);
    actuallyRun = 1;
    EXPECT_EQ(run_requested(), 1);
    actuallyRun = 2;
    EXPECT_EQ(run_requested(), 0);
}

} // namespace

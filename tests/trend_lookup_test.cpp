// The trend analysis finds a listed process's row through an index and matches each name once,
// where the plain walk searches the table from row 0 for every process and matches the name at
// every sample. Over long random runs (pids that come, go, come back under other names, are listed
// twice, a table that fills up, names the log table sends either way), both must leave the same
// trace lines, events, error text, trend table and index, call for call.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "core/control_block.h"
#include "core/control_file.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "memory/name_matching.h"
#include "memory/trend_analysis.h"
#include "private_ipc.h"
#include "recording_platform.h"

namespace {

// Names that the table below sends every way: a row with memoryCheckFlag 0, one with 1, a row
// that does not compile, and names that match nothing.
constexpr char CONTROL_TEXT[] = "PROCESS_LOG_THRESHOLDS 0 0 0 0 ^batch\n"
                                "PROCESS_LOG_THRESHOLDS 0 0 0 1 worker\n"
                                "PROCESS_LOG_THRESHOLDS 0 0 0 0 \\(unclosed\n"
                                "PROCESS_LOG_THRESHOLDS 0 0 0 0 er$\n";
const char *const NAMES[] = {"batchjob", "worker", "sshd", "server", "java", "batch-worker", ""};

struct outcome {
    std::vector<std::string> traces;
    std::vector<std::string> events;
    std::string top_text;
    std::vector<char> trend_bytes;
    int32_t analysis_index;
    bool operator==(const outcome &) const = default;
};

class TrendLookup : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        rec::reset();
        reset_settings();
        block = private_ipc::fresh_control_block();
        ASSERT_NE(block, nullptr);
        uint32_t crc = 0;
        tarn_parse_control_file(CONTROL_TEXT, &crc);
    }
    void TearDown() override {
        trend_row_lookup = trend_lookup::indexed;
        free_compiled_expressions();
        uint32_t crc = 0;
        release_control_file_tables(&crc);
        if (key_is_ours) {
            private_ipc::remove_control_block();
        }
    }

    // One call in the given way, from the block as it stands.
    outcome call(trend_lookup way) {
        rec::reset();
        std::memset(topDataBlock, 0, TOP_DATA_BLOCK_SIZE);
        trend_row_lookup = way;
        uint32_t crc = 7;
        EXPECT_EQ(tarn_trend_analysis(&crc), 0u);
        EXPECT_EQ(crc, 0u);
        outcome result;
        result.traces = rec::traces();
        for (const rec::Event &event : rec::events()) {
            result.events.push_back(std::to_string(event.record.reason_code) + " " +
                                    std::to_string(event.record.comp_rc) + " " +
                                    std::to_string(event.record.option) + " " + event.attachment);
        }
        result.top_text.assign(topDataBlock, TOP_DATA_BLOCK_SIZE);
        const auto *trend = reinterpret_cast<const char *>(block->trend_table);
        result.trend_bytes.assign(trend, trend + sizeof block->trend_table);
        result.analysis_index = block->analysisIndex;
        return result;
    }

    // A process table of `count` rows drawn from `pids` pids, names from NAMES, sizes that mostly
    // rise.
    void list_processes(std::mt19937 &random, int count, uint32_t pids, int call_number) {
        std::memset(block->process_table, 0, sizeof block->process_table);
        for (int i = 0; i < count; ++i) {
            process_row &row = block->process_table[i];
            row.in_use = 1;
            row.pid = 100 + random() % pids;
            // Mostly a name that stays with its pid, sometimes another program under the pid.
            const char *name = random() % 20 == 0 ? NAMES[random() % 7] : NAMES[row.pid % 7];
            std::strncpy(row.process_name, name, PROCESS_NAME_FIELD);
            row.always_one = 1;
            row.rss = row.pid;
            row.dsiz = 1000 + static_cast<uint32_t>(call_number) * (random() % 3) -
                       (random() % 10 == 0 ? 500u : 0u);
            row.vsize = 5000 + static_cast<uint32_t>(call_number) * (random() % 4);
        }
        // Now and then a hole: rows after an empty one are listed too.
        if (count > 2 && random() % 4 == 0) {
            block->process_table[random() % static_cast<uint32_t>(count)].in_use = 0;
        }
    }

    // Each call from the same block both ways; the walk's block is set aside, the index's kept.
    void run_both_ways(std::mt19937 &random, int calls, int max_rows, uint32_t pids) {
        tarn_control_block &block = *this->block;
        std::vector<char> saved(sizeof(tarn_control_block));
        for (int number = 0; number < calls; ++number) {
            auto rows = static_cast<int>(random() % static_cast<uint32_t>(max_rows + 1));
            list_processes(random, rows, pids, number);
            std::memcpy(saved.data(), &block, saved.size());
            outcome walked = call(trend_lookup::walk);
            std::vector<char> after_walk(saved.size());
            std::memcpy(after_walk.data(), &block, saved.size());
            std::memcpy(&block, saved.data(), saved.size());
            outcome indexed = call(trend_lookup::indexed);
            ASSERT_EQ(indexed.traces, walked.traces) << "call " << number;
            ASSERT_EQ(indexed.events, walked.events) << "call " << number;
            ASSERT_TRUE(indexed.top_text == walked.top_text) << "call " << number;
            ASSERT_TRUE(indexed.trend_bytes == walked.trend_bytes) << "call " << number;
            ASSERT_EQ(indexed.analysis_index, walked.analysis_index) << "call " << number;
            ASSERT_EQ(std::memcmp(after_walk.data(), &block, saved.size()), 0) << "call " << number;
        }
    }

    bool key_is_ours = false;
    tarn_control_block *block = nullptr;
};

TEST_F(TrendLookup, IndexAndWalkAgreeOverARunOfFewProcesses) {
    std::mt19937 random(1);
    trend_analysis_points = 4;
    trend_analysis_num_increases = 2;
    run_both_ways(random, 60, 12, 15);
}

TEST_F(TrendLookup, IndexAndWalkAgreeWithFullHistoriesAndTheFirstRowsTakenByOthers) {
    std::mt19937 random(2);
    trend_analysis_points = 24;
    trend_analysis_num_increases = 3;
    // Rows in use before the first call, so that free rows and rows of a pid are not at the top.
    for (int i = 0; i < 40; i += 2) {
        trend_row &row = block->trend_table[i];
        row.in_use = 1;
        row.pid = 100 + static_cast<uint32_t>(i % 30);
        std::strncpy(row.process_name, NAMES[i % 7], PROCESS_NAME_FIELD);
    }
    run_both_ways(random, 40, 60, 50);
}

TEST_F(TrendLookup, IndexAndWalkAgreeWhenTheTableIsFull) {
    std::mt19937 random(3);
    trend_analysis_points = 3;
    trend_analysis_num_increases = 1;
    // Every row but the last few in use by pids never listed: new processes find little room,
    // and the rows free up as the unlisted pids are dropped.
    for (int i = 0; i < TREND_TABLE_ROWS - 5; ++i) {
        trend_row &row = block->trend_table[i];
        row.in_use = 1;
        row.pid = 1000000 + static_cast<uint32_t>(i);
        row.samples[0].valid = 1;
    }
    run_both_ways(random, 6, PROCESS_TABLE_ROWS, 4000);
}

} // namespace

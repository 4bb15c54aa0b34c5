#include <gtest/gtest.h>

#include <algorithm>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <limits>
#include <ostream>
#include <random>
#include <regex.h>
#include <string>
#include <utility>
#include <vector>

#include "core/control_block.h"
#include "core/control_file.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "logsvc.h"
#include "matcher_log.h"
#include "memory/name_matching.h"
#include "memory/trend_analysis.h"
#include "private_ipc.h"
#include "recording_platform.h"
#include "text_lines.h"

namespace {

using text::all_zero;
using text::joined;
using text::lines;

constexpr uint32_t CRC_GIVEN = 0xDEADBEEF; // what the tests pass in *crc, which the call clears
constexpr uint32_t LEAK_REASON = 0xE11A;

__attribute__((format(printf, 1, 2))) std::string printed(const char *format, ...) {
    va_list args;
    va_start(args, format);
    char text[8192];
    int length = std::vsnprintf(text, sizeof text, format, args);
    va_end(args);
    return std::string(text,
                       length > 0 ? std::min(static_cast<size_t>(length), sizeof text - 1) : 0);
}

std::string repeated(const std::string &piece, int times) {
    std::string text;
    for (int i = 0; i < times; ++i) {
        text += piece;
    }
    return text;
}

// `text` followed by NULs to `size` bytes: how a cleared block looks once the text is written.
std::string padded(std::string text, size_t size) {
    text.resize(size, '\0');
    return text;
}

// A name of the whole 250-character field, which leaves no room for a terminating NUL.
const std::string FULL_LENGTH_NAME = std::string(125, 'n') + std::string(125, 'm');

// ---- The process table the per-process check leaves ----

struct proc {
    uint32_t pid;
    std::string name;
    uint32_t rss;
    uint32_t dsiz;
    uint32_t vsize;
};

// The name into its field: at most 250 bytes, the rest NUL.
void copy_name(char (&field)[PROCESS_NAME_FIELD], const std::string &name) {
    std::memset(field, 0, PROCESS_NAME_FIELD);
    std::memcpy(field, name.data(), std::min(name.size(), static_cast<size_t>(PROCESS_NAME_FIELD)));
}

void put_process(tarn_control_block &block, int row, const proc &p) {
    process_row &entry = block.process_table[row];
    std::memset(&entry, 0, sizeof entry);
    entry.in_use = 1;
    entry.pid = p.pid;
    copy_name(entry.process_name, p.name);
    entry.always_one = 1;
    entry.rss = p.rss;
    entry.dsiz = p.dsiz;
    entry.vsize = p.vsize;
}

// The process table of a pass: `processes` in rows 0 on, every other row free and zero.
void list_processes(tarn_control_block &block, const std::vector<proc> &processes) {
    std::memset(block.process_table, 0, sizeof block.process_table);
    for (size_t i = 0; i < processes.size(); ++i) {
        put_process(block, static_cast<int>(i), processes[i]);
    }
}

// ---- The trend table ----

struct sample {
    uint32_t valid;
    uint32_t rss;
    uint32_t dsiz;
    uint32_t vsize;
    bool operator==(const sample &) const = default;
};

void PrintTo(const sample &s, std::ostream *out) {
    if (s == sample{}) {
        *out << "-";
    } else {
        *out << "{" << s.valid << ", rss " << s.rss << ", dsiz " << s.dsiz << ", vsize " << s.vsize
             << "}";
    }
}

constexpr sample EMPTY{0, 0, 0, 0};

sample of(const proc &p) {
    return {1, p.rss, p.dsiz, p.vsize};
}

// The 24 samples of a row: `first` from slot 0, the rest empty.
std::vector<sample> history(std::vector<sample> first) {
    first.resize(TREND_SAMPLES, EMPTY);
    return first;
}

std::vector<sample> samples_of(const trend_row &row) {
    std::vector<sample> all;
    for (const trend_sample &s : row.samples) {
        all.push_back({s.valid, s.rss, s.dsiz, s.vsize});
    }
    return all;
}

std::string name_field(const trend_row &row) {
    return std::string(row.process_name, PROCESS_NAME_FIELD);
}

bool row_is_zero(const trend_row &row) {
    return all_zero(&row, sizeof row);
}

// A row holding the history of `pid` called `name`: flag 1, the name NUL-padded, fill zero.
void expect_row(const trend_row &row, uint32_t pid, const std::string &name,
                const std::vector<sample> &samples) {
    EXPECT_EQ(row.in_use, 1u);
    EXPECT_EQ(row.pid, pid);
    EXPECT_EQ(name_field(row), padded(name, PROCESS_NAME_FIELD));
    EXPECT_EQ(row.fill[0], 0);
    EXPECT_EQ(row.fill[1], 0);
    EXPECT_EQ(samples_of(row), samples);
}

// ---- The trace lines ----

std::string index_trace(int32_t index) {
    return printed("TARNTRAF: analysis index = %d (dec)", index);
}

std::string points_trace(int32_t index) {
    return printed("TARNTRAF: number of analysis points = %d (dec)", index);
}

std::string slot_values(const std::vector<sample> &samples, uint32_t sample::*value) {
    std::string text;
    for (const sample &s : samples) {
        text += s.valid != 0 ? std::to_string(static_cast<int32_t>(s.*value)) + ", " : "-X, ";
    }
    return text;
}

// What the table trace says of a row, after "TARNTRAF: Table entry [n] = ".
std::string table_text(uint32_t pid, const std::string &name, const std::vector<sample> &samples) {
    return "PID " + std::to_string(static_cast<int32_t>(pid)) + ", pname=[" + name +
           "], vsizes=" + slot_values(samples, &sample::vsize) +
           " dsizes=" + slot_values(samples, &sample::dsiz);
}

std::string table_entry(int index, uint32_t pid, const std::string &name,
                        const std::vector<sample> &samples) {
    return "TARNTRAF: Table entry [" + std::to_string(index) +
           "] = " + table_text(pid, name, samples);
}

const std::string ABOUT_TO_ANALYSE = "TARNTRAF: About to do a full trend analysis";
const std::string POINT_0100 = "TARNTRAD: full trend analysis point 0100";
const std::string POINT_0110 = "TARNTRAD: full trend analysis point 0110";

std::string point_0120(int i) {
    return printed("TARNTRAD: full trend analysis point 0120, i = %d (dec)", i);
}

std::string point_0130(int i) {
    return printed("TARNTRAD: full trend analysis point 0130, i = %d (dec)", i);
}

std::string point_0140(int i) {
    return printed("TARNTRAD: full trend analysis point 0140, i = %d (dec)", i);
}

// The two lines that close the analysis of a row.
lines verdict(int dontLog, int increases) {
    return {printed("TARNTRAF: full trend analysis point 0200, dontLog = %d (dec)", dontLog),
            printed("TARNTRAF: number of increases = %d (dec)", increases)};
}

// The report of a leak: its own four lines, then those of the problem report, which show the
// system return code 2, the pid as the value and the reason code.
lines leak_traces(uint32_t pid, const std::string &name, int32_t points, int32_t increases) {
    return {"TARNTRAF: Possible memory leak detected via longterm analysis!",
            printed("TARNTRAF: PID is %d (dec)", static_cast<int32_t>(pid)),
            "TARNTRAF: process name is [" + name + "]",
            printed("TARNTRAF: process never went down over %d snapshots and increased %d of those "
                    "times.",
                    points, increases),
            "TARNMNDF: --> tarn_mon_error_handler_p",
            printed("TARNMNDF:     sysRc = 2   compRc = %x   uiErrorId = e11a", pid),
            "TARNSLTF: LOGSVC_REPORT_ERROR option set.",
            "TARNMNDF:     sysRc= 8, compRc = 0x0",
            "TARNMNDF: <-- tarn_mon_error_handler_p"};
}

// The error text of a leak, as topDataBlock holds it: the text, then NULs to the end.
std::string leak_text(const std::string &name) {
    return "\n\rError Information: \n\rPossible memory leak detected via longterm analysis!\n\r"
           "process name is: \n\r" +
           name + "\n\r";
}

std::string top_block() {
    return std::string(topDataBlock, TOP_DATA_BLOCK_SIZE);
}

std::string line_block() {
    return std::string(line, LINE_SIZE);
}

void expect_leak_event(const rec::Event &event, uint32_t pid) {
    EXPECT_EQ(event.record.record_type, LOGSVC_RECORD_TYPE_EVENT);
    EXPECT_EQ(event.record.option, LOGSVC_REPORT_ERROR);
    EXPECT_EQ(std::string(event.record.component,
                          strnlen(event.record.component, LOGSVC_COMPONENT_LENGTH)),
              "LinMonitor");
    EXPECT_EQ(event.record.reason_code, LEAK_REASON);
    EXPECT_EQ(event.record.comp_rc, pid);
    EXPECT_FALSE(event.has_attachment);
    EXPECT_EQ(event.record.attachment_length, 0u);
}

std::vector<uint32_t> pids_of(const std::vector<rec::Event> &events) {
    std::vector<uint32_t> pids;
    for (const rec::Event &event : events) {
        EXPECT_EQ(event.record.reason_code, LEAK_REASON);
        pids.push_back(event.record.comp_rc);
    }
    return pids;
}

// Compares two images of a block byte by byte, naming the first difference instead of printing
// kilobytes of NULs.
::testing::AssertionResult same_bytes(const std::string &actual, const std::string &expected) {
    if (actual.size() != expected.size()) {
        return ::testing::AssertionFailure()
               << "size " << actual.size() << ", expected " << expected.size();
    }
    auto [at, ignored] = std::mismatch(actual.begin(), actual.end(), expected.begin());
    if (at == actual.end()) {
        return ::testing::AssertionSuccess();
    }
    auto offset = static_cast<size_t>(at - actual.begin());
    auto shown = [&](const std::string &bytes) {
        std::string text;
        for (size_t i = offset; i < std::min(bytes.size(), offset + 24); ++i) {
            text += bytes[i] == '\0' ? std::string("\\0") : std::string(1, bytes[i]);
        }
        return text;
    };
    return ::testing::AssertionFailure()
           << "first difference at byte " << offset << ": [" << shown(actual) << "...], expected ["
           << shown(expected) << "...]; text before it [" << actual.substr(0, offset).c_str()
           << "]";
}

// Compares long trace lists line by line, naming the first difference instead of printing both.
void expect_same_lines(const lines &actual, const lines &expected) {
    size_t common = std::min(actual.size(), expected.size());
    for (size_t i = 0; i < common; ++i) {
        if (actual[i] != expected[i]) {
            ADD_FAILURE() << "trace " << i << " is\n  [" << actual[i] << "]\nexpected\n  ["
                          << expected[i] << "]";
            return;
        }
    }
    EXPECT_EQ(actual.size(), expected.size());
}

// ---- The fixture ----

// A control block of its own (private IPC namespace), empty settings and tables.
class TrendAnalysis : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        rec::reset();
        release_tables();
        reset_settings();
        block = private_ipc::fresh_control_block();
        ASSERT_NE(block, nullptr);
        ASSERT_EQ(block->analysisIndex, 0);
        ASSERT_TRUE(all_zero(block->trend_table, sizeof block->trend_table));
        std::memset(topDataBlock, 0, TOP_DATA_BLOCK_SIZE);
        matcher_calls.clear();
        rec::clear_traces();
    }

    void TearDown() override {
        process_name_matcher = regexec;
        if (TARN_CB_PTR == nullptr && block != nullptr) {
            TARN_CB_PTR = block;
        }
        // Latest change first, so that each row ends with the flag the parse gave it.
        for (auto change = changed_compiled_flags.rbegin(); change != changed_compiled_flags.rend();
             ++change) {
            logtable[change->first].compiled = change->second;
        }
        release_tables();
        if (!key_is_ours) {
            return; // a monitor's block on this host is none of the test's business
        }
        private_ipc::remove_control_block();
    }

    static void release_tables() {
        free_compiled_expressions();
        uint32_t ignored = 0;
        release_control_file_tables(&ignored);
    }

    // The settings and tables of a control file text.
    void load_control_file(const std::string &text) {
        control_text = text;
        uint32_t parse_crc = 0;
        tarn_parse_control_file(control_text.c_str(), &parse_crc);
        rec::clear_traces();
    }

    // Sets a log row's compiled flag; the fixture puts it back, so that its expression is freed.
    void set_compiled_flag(int row, uint32_t flag) {
        changed_compiled_flags.emplace_back(row, logtable[row].compiled);
        logtable[row].compiled = flag;
    }

    // No histories and slot 0 next, as a new block has it.
    void forget_histories() {
        std::memset(block->trend_table, 0, sizeof block->trend_table);
        block->analysisIndex = 0;
    }

    // One call, the process table as it stands.
    uint32_t run_once() {
        rec::clear_traces();
        events_seen = rec::events().size();
        crc = CRC_GIVEN;
        return tarn_trend_analysis(&crc);
    }

    void call(const std::vector<proc> &processes) {
        list_processes(*block, processes);
        EXPECT_EQ(run_once(), 0u);
        EXPECT_EQ(crc, 0u);
    }

    // The events raised by the last call.
    std::vector<rec::Event> new_events() const {
        const std::vector<rec::Event> &all = rec::events();
        return {all.begin() + static_cast<long>(events_seen), all.end()};
    }

    bool key_is_ours = false;
    tarn_control_block *block = nullptr;
    uint32_t crc = 0;
    size_t events_seen = 0;
    std::string control_text;
    std::vector<std::pair<int, uint32_t>> changed_compiled_flags;
};

// ---- How the histories fill, and when they are judged ----

TEST_F(TrendAnalysis, WithThreePointsTheSecondCallAnalysesTheThirdReportsAndLaterCallsSlide) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 1;
    const proc p1{100, "leaky", 10, 50, 100};
    const proc p2{100, "leaky", 11, 50, 110};
    const proc p3{100, "leaky", 12, 50, 120};
    const proc p4{100, "leaky", 13, 50, 130};
    const proc p5{100, "leaky", 14, 50, 140};

    // Slot 0 filled; the histories are not full yet, so no analysis.
    call({p1});
    EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(1),
                                    table_entry(0, 100, "leaky", history({of(p1)}))}));
    EXPECT_EQ(block->analysisIndex, 1);
    expect_row(block->trend_table[0], 100, "leaky", history({of(p1)}));
    EXPECT_TRUE(row_is_zero(block->trend_table[1]));

    // Slot 1 filled and the index reaches the last point: the analysis runs, but slot 2 is empty,
    // so it stops at i = 2 with the trend not held.
    call({p2});
    EXPECT_EQ(rec::traces(), joined({{index_trace(1), points_trace(2),
                                      table_entry(0, 100, "leaky", history({of(p1), of(p2)})),
                                      ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                                     verdict(0, 1)}));
    EXPECT_EQ(block->analysisIndex, 2);
    expect_row(block->trend_table[0], 100, "leaky", history({of(p1), of(p2)}));
    EXPECT_TRUE(new_events().empty());

    // Slot 2 filled without a slide (it was empty): the first call that can report.
    call({p3});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, 100, "leaky", history({of(p1), of(p2), of(p3)})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(100, "leaky", 3, 2)}));
    EXPECT_EQ(block->analysisIndex, 2);
    expect_row(block->trend_table[0], 100, "leaky", history({of(p1), of(p2), of(p3)}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{100}));

    // From now on each call slides the history one slot left before it fills slot 2.
    call({p4});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, 100, "leaky", history({of(p2), of(p3), of(p4)})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(100, "leaky", 3, 2)}));
    EXPECT_EQ(block->analysisIndex, 2);
    expect_row(block->trend_table[0], 100, "leaky", history({of(p2), of(p3), of(p4)}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{100}));

    call({p5});
    EXPECT_EQ(block->analysisIndex, 2);
    expect_row(block->trend_table[0], 100, "leaky", history({of(p3), of(p4), of(p5)}));
    EXPECT_EQ(rec::traces()[2], table_entry(0, 100, "leaky", history({of(p3), of(p4), of(p5)})));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{100}));
    EXPECT_TRUE(row_is_zero(block->trend_table[1]));
}

TEST_F(TrendAnalysis, FirstTracesClearedCrcAndResultWithNoProcesses) {
    trend_analysis_points = 3;
    call({});
    EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(1)}));
    EXPECT_EQ(block->analysisIndex, 1);
    call({});
    EXPECT_EQ(rec::traces(), (lines{index_trace(1), points_trace(2), ABOUT_TO_ANALYSE}));
    call({});
    EXPECT_EQ(rec::traces(), (lines{index_trace(2), points_trace(2), ABOUT_TO_ANALYSE}));
    EXPECT_EQ(block->analysisIndex, 2);
    EXPECT_TRUE(rec::events().empty());
    EXPECT_TRUE(all_zero(block->trend_table, sizeof block->trend_table));
}

TEST_F(TrendAnalysis, WithNoAnalysisPointsTheIndexStaysAtZeroAndNothingIsAnalysed) {
    trend_analysis_points = 0;
    trend_analysis_num_increases = 0;
    const proc first{3, "zero", 1, 10, 100};
    const proc second{3, "zero", 2, 20, 200};
    call({first});
    EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(0),
                                    table_entry(0, 3, "zero", history({of(first)}))}));
    // Slot 0 is full, so the next call slides (it only clears slot 0) and fills it again.
    call({second});
    EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(0),
                                    table_entry(0, 3, "zero", history({of(second)}))}));
    EXPECT_EQ(block->analysisIndex, 0);
    EXPECT_TRUE(rec::events().empty());
}

// ---- What makes a leak ----

TEST_F(TrendAnalysis, EqualSizesHoldTheTrendWithNoRiseAndReportOnlyWithoutARequiredRise) {
    trend_analysis_points = 3;
    for (int32_t needed : {1, 0, -1}) {
        SCOPED_TRACE(needed);
        trend_analysis_num_increases = needed;
        forget_histories();
        // rss falls and rises: it is recorded but plays no part in the trend.
        call({{8, "steady", 10, 50, 100}});
        call({{8, "steady", 5, 50, 100}});
        call({{8, "steady", 20, 50, 100}});
        lines expected =
            joined({{index_trace(2), points_trace(2),
                     table_entry(0, 8, "steady",
                                 history({{1, 10, 50, 100}, {1, 5, 50, 100}, {1, 20, 50, 100}})),
                     ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                    verdict(1, 0)});
        if (needed <= 0) {
            expected = joined({expected, leak_traces(8, "steady", 3, 0)});
        }
        EXPECT_EQ(rec::traces(), expected);
        EXPECT_EQ(pids_of(new_events()),
                  needed <= 0 ? std::vector<uint32_t>{8} : std::vector<uint32_t>{});
    }
}

TEST_F(TrendAnalysis, FallOfVsizeAtTheLastStepStopsTheReport) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    call({{9, "wobbly", 1, 50, 100}});
    call({{9, "wobbly", 1, 50, 120}});
    std::memset(topDataBlock, 'Q', TOP_DATA_BLOCK_SIZE);
    call({{9, "wobbly", 1, 50, 110}});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, 9, "wobbly",
                                   history({{1, 1, 50, 100}, {1, 1, 50, 120}, {1, 1, 50, 110}})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110, point_0140(2)},
                      verdict(0, 1)}));
    EXPECT_TRUE(rec::events().empty());
    EXPECT_TRUE(
        same_bytes(top_block(), std::string(TOP_DATA_BLOCK_SIZE, 'Q'))); // no report, no error text
}

TEST_F(TrendAnalysis, FallOfDsizStopsTheReportAtTheFirstStepAndIsJudgedBeforeVsize) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    // Row 0: dsiz 50, 40, 60 under a rising vsize. Row 1: dsiz rising while vsize falls: the
    // vsize fall stops it, and the dsiz rise still counts.
    call({{1, "shrinks", 1, 50, 100}, {2, "swaps", 1, 50, 100}});
    call({{1, "shrinks", 1, 40, 110}, {2, "swaps", 1, 60, 90}});
    call({{1, "shrinks", 1, 60, 120}, {2, "swaps", 1, 70, 95}});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, 1, "shrinks",
                                   history({{1, 1, 50, 100}, {1, 1, 40, 110}, {1, 1, 60, 120}})),
                       table_entry(1, 2, "swaps",
                                   history({{1, 1, 50, 100}, {1, 1, 60, 90}, {1, 1, 70, 95}})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110, point_0130(1)},
                      verdict(0, 1),
                      {POINT_0100, POINT_0110, point_0140(1)},
                      verdict(0, 1)}));
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(TrendAnalysis, SizesCompareSigned) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 2;
    // a: dsiz 100 then 0x80000000 (the lowest int32): a fall.
    // b: vsize 100 then 0xFFFFFFFF (-1): a fall, and no rise.
    // c: dsiz -16, 0, 16: two rises, never a fall.
    // d: vsize -5, 10, 20 under the highest dsiz: two rises.
    call({{1, "a", 1, 100, 10},
          {2, "b", 1, 5, 100},
          {3, "c", 1, 0xFFFFFFF0u, 7},
          {4, "d", 1, 0x7FFFFFFF, 0xFFFFFFFBu}});
    call({{1, "a", 1, 0x80000000u, 20},
          {2, "b", 1, 5, 0xFFFFFFFFu},
          {3, "c", 1, 0, 7},
          {4, "d", 1, 0x7FFFFFFF, 10}});
    call({{1, "a", 1, 0x80000001u, 30},
          {2, "b", 1, 5, 200},
          {3, "c", 1, 16, 7},
          {4, "d", 1, 0x7FFFFFFF, 20}});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       "TARNTRAF: Table entry [0] = PID 1, pname=[a], vsizes=10, 20, 30, " +
                           repeated("-X, ", 21) + " dsizes=100, -2147483648, -2147483647, " +
                           repeated("-X, ", 21),
                       "TARNTRAF: Table entry [1] = PID 2, pname=[b], vsizes=100, -1, 200, " +
                           repeated("-X, ", 21) + " dsizes=5, 5, 5, " + repeated("-X, ", 21),
                       "TARNTRAF: Table entry [2] = PID 3, pname=[c], vsizes=7, 7, 7, " +
                           repeated("-X, ", 21) + " dsizes=-16, 0, 16, " + repeated("-X, ", 21),
                       "TARNTRAF: Table entry [3] = PID 4, pname=[d], vsizes=-5, 10, 20, " +
                           repeated("-X, ", 21) + " dsizes=2147483647, 2147483647, 2147483647, " +
                           repeated("-X, ", 21),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110, point_0130(1)},
                      verdict(0, 1),
                      {POINT_0100, POINT_0110, point_0140(1)},
                      verdict(0, 0),
                      {POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(3, "c", 3, 2),
                      {POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(4, "d", 3, 2)}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{3, 4}));
}

TEST_F(TrendAnalysis, LeakNeedsTheFullHistory) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 2;
    call({{77, "grower", 1, 50, 100}});
    EXPECT_TRUE(new_events().empty());
    call({{77, "grower", 1, 50, 110}});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(1), points_trace(2),
                       table_entry(0, 77, "grower", history({{1, 1, 50, 100}, {1, 1, 50, 110}})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(0, 1)}));
    EXPECT_TRUE(new_events().empty());
    call({{77, "grower", 1, 50, 120}});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, 77, "grower",
                                   history({{1, 1, 50, 100}, {1, 1, 50, 110}, {1, 1, 50, 120}})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(77, "grower", 3, 2)}));
    ASSERT_EQ(new_events().size(), 1u);
    EXPECT_EQ(rec::traces().back(), "TARNMNDF: <-- tarn_mon_error_handler_p");
    EXPECT_TRUE(rec::has_trace(
        "TARNTRAF: process never went down over 3 snapshots and increased 2 of those times."));
}

TEST_F(TrendAnalysis, LeakReportHasItsTracesEventAndErrorText) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 2;
    const uint32_t pid = 0x1F2E; // the report's trace shows the value in hex
    call({{pid, "leaky_daemon", 300, 4000, 100000}});
    call({{pid, "leaky_daemon", 301, 4000, 100004}});
    // What an earlier finding of the pass left there is cleared before the text goes in.
    std::memset(topDataBlock, 'Q', TOP_DATA_BLOCK_SIZE);
    call({{pid, "leaky_daemon", 299, 4100, 100004}});
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, pid, "leaky_daemon",
                                   history({{1, 300, 4000, 100000},
                                            {1, 301, 4000, 100004},
                                            {1, 299, 4100, 100004}})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      {"TARNTRAF: Possible memory leak detected via longterm analysis!",
                       "TARNTRAF: PID is 7982 (dec)", "TARNTRAF: process name is [leaky_daemon]",
                       "TARNTRAF: process never went down over 3 snapshots and increased 2 of "
                       "those times.",
                       "TARNMNDF: --> tarn_mon_error_handler_p",
                       "TARNMNDF:     sysRc = 2   compRc = 1f2e   uiErrorId = e11a",
                       "TARNSLTF: LOGSVC_REPORT_ERROR option set.",
                       "TARNMNDF:     sysRc= 8, compRc = 0x0",
                       "TARNMNDF: <-- tarn_mon_error_handler_p"}}));
    std::vector<rec::Event> events = new_events();
    ASSERT_EQ(events.size(), 1u);
    expect_leak_event(events[0], pid);
    EXPECT_TRUE(same_bytes(top_block(),
                           padded("\n\rError Information: \n\rPossible memory leak detected via "
                                  "longterm analysis!\n\rprocess name is: \n\rleaky_daemon\n\r",
                                  TOP_DATA_BLOCK_SIZE)));
}

TEST_F(TrendAnalysis, TwoLeakingRowsGiveTwoEventsEachWithItsOwnText) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 1;
    // A log row that matches neither name: both are analysed, and the matcher sees what
    // topDataBlock holds while each row is judged.
    load_control_file("PROCESS_LOG_THRESHOLDS 0 0 0 1 ^nothing-is-called-this$\n");
    process_name_matcher = recording_matcher;
    for (uint32_t step = 0; step < 3; ++step) {
        call({{11, "first", 1, 10, 100 + step}, {22, "second", 1, 20, 200 + step}});
    }
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, 11, "first",
                                   history({{1, 1, 10, 100}, {1, 1, 10, 101}, {1, 1, 10, 102}})),
                       table_entry(1, 22, "second",
                                   history({{1, 1, 20, 200}, {1, 1, 20, 201}, {1, 1, 20, 202}})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(11, "first", 3, 2),
                      {POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(22, "second", 3, 2)}));
    std::vector<rec::Event> events = new_events();
    ASSERT_EQ(events.size(), 2u);
    expect_leak_event(events[0], 11);
    expect_leak_event(events[1], 22);
    EXPECT_TRUE(same_bytes(top_block(), padded(leak_text("second"), TOP_DATA_BLOCK_SIZE)));
    // Between the two reports topDataBlock held the first row's text, and nothing else.
    int judged_second = 0;
    for (const matcher_call &asked : matcher_calls) {
        if (asked.name == "second" && asked.top != std::string(TOP_DATA_BLOCK_SIZE, '\0')) {
            EXPECT_EQ(asked.top, padded(leak_text("first"), TOP_DATA_BLOCK_SIZE));
            ++judged_second;
        }
    }
    EXPECT_GE(judged_second, 1);
}

TEST_F(TrendAnalysis, TookLogIsNotConsulted) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 1;
    block->tookLog = 1;
    for (uint32_t step = 0; step < 3; ++step) {
        call({{5, "again", 1, 10, 100 + step}});
    }
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{5}));
    // And again on the next call: every call on which the condition holds reports.
    call({{5, "again", 1, 10, 103}});
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{5}));
    EXPECT_EQ(block->tookLog, 1u);
}

// ---- The log table ----

TEST_F(TrendAnalysis, ProcessWhoseLogRowHasNoMemoryCheckIsNeverReported) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    load_control_file("PROCESS_LOG_THRESHOLDS 0 0 0 0 ^quiet$\n");
    for (uint32_t step = 0; step < 6; ++step) {
        call({{20, "quiet", 1, 10, 100 + step}});
        if (step >= 1) {
            EXPECT_EQ(
                std::vector<std::string>(rec::traces().begin() + 3, rec::traces().end()),
                joined({{ABOUT_TO_ANALYSE, POINT_0100, POINT_0110, point_0120(1)}, verdict(0, 1)}))
                << "call " << step + 1;
        }
    }
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(TrendAnalysis, ProcessWhoseLogRowHasMemoryCheckIsAnalysed) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 2;
    // Two groups: the matcher is asked for two matches, with room for them.
    load_control_file("PROCESS_LOG_THRESHOLDS 0 0 0 1 ^\\(lo\\)\\(ud\\)$\n");
    process_name_matcher = recording_matcher;
    for (uint32_t step = 0; step < 3; ++step) {
        call({{10, "loud", 1, 10, 100 + step}});
    }
    EXPECT_EQ(std::vector<std::string>(rec::traces().begin() + 3, rec::traces().end()),
              joined({{ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(10, "loud", 3, 2)}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{10}));
    ASSERT_FALSE(matcher_calls.empty());
    for (const matcher_call &asked : matcher_calls) {
        EXPECT_EQ(asked.expression, &logtable[0].expression);
        EXPECT_EQ(asked.name, "loud");
        EXPECT_EQ(asked.nmatch, 2u);
    }
}

TEST_F(TrendAnalysis, FirstMatchingLogRowDecides) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    load_control_file("PROCESS_LOG_THRESHOLDS 0 0 0 1 ^lo\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 0 ^loud$\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 0 ^qu\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 1 ^quiet$\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 2 ^odd$\n");
    ASSERT_EQ(num_log_thresholds, 5);
    for (uint32_t step = 0; step < 3; ++step) {
        call({{10, "loud", 1, 10, 100 + step},
              {20, "quiet", 1, 10, 100 + step},
              {30, "odd", 1, 10, 100 + step},
              {40, "unlisted", 1, 10, 100 + step}});
    }
    // loud: its first row (^lo) watches it. quiet: its first row (^qu) does not. odd: a flag
    // other than 1 does not watch. unlisted: no row, so it is analysed.
    EXPECT_EQ(std::vector<std::string>(rec::traces().begin() + 6, rec::traces().end()),
              joined({{ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(10, "loud", 3, 2),
                      {POINT_0100, POINT_0110, point_0120(1)},
                      verdict(0, 1),
                      {POINT_0100, POINT_0110, point_0120(1)},
                      verdict(0, 1),
                      {POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(40, "unlisted", 3, 2)}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{10, 40}));
}

TEST_F(TrendAnalysis, LogRowWhoseCompiledFlagIsNotOneIsSkipped) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    load_control_file("PROCESS_LOG_THRESHOLDS 0 0 0 0 ^skip\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 1 ^skipme$\n");
    ASSERT_EQ(num_log_thresholds, 2);
    process_name_matcher = recording_matcher;
    auto three_calls = [&] {
        forget_histories();
        matcher_calls.clear();
        for (uint32_t step = 0; step < 3; ++step) {
            call({{12, "skipme", 1, 10, 100 + step}});
        }
    };

    // Compiled: row 0 matches first and does not watch the process.
    three_calls();
    EXPECT_TRUE(rec::has_trace(point_0120(1)));
    EXPECT_TRUE(new_events().empty());

    for (uint32_t flag : {0u, 2u}) {
        SCOPED_TRACE(flag);
        set_compiled_flag(0, flag);
        three_calls();
        EXPECT_FALSE(rec::has_trace(point_0120(1)));
        EXPECT_EQ(std::vector<std::string>(rec::traces().begin() + 3, rec::traces().end()),
                  joined({{ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                          verdict(1, 2),
                          leak_traces(12, "skipme", 3, 2)}));
        EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{12}));
        ASSERT_FALSE(matcher_calls.empty());
        for (const matcher_call &asked : matcher_calls) {
            EXPECT_EQ(asked.expression, &logtable[1].expression); // row 0 is never asked
        }
    }
}

// ---- The record step ----

TEST_F(TrendAnalysis, PidWithAnotherNameStartsANewHistoryInTheSameRow) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    const proc alpha1{100, "alphabetical", 1, 10, 100};
    const proc beta1{200, "beta", 2, 20, 200};
    const proc gam2{100, "gam", 3, 30, 300};
    const proc beta2{200, "beta", 2, 20, 201};
    call({alpha1, beta1});
    call({gam2, beta2});
    // The whole name field is the new name's: no byte of the longer old name is left.
    expect_row(block->trend_table[0], 100, "gam", history({EMPTY, of(gam2)}));
    expect_row(block->trend_table[1], 200, "beta", history({of(beta1), of(beta2)}));
    EXPECT_TRUE(row_is_zero(block->trend_table[2]));
    EXPECT_EQ(rec::traces(), joined({{index_trace(1), points_trace(2),
                                      table_entry(0, 100, "gam", history({EMPTY, of(gam2)})),
                                      table_entry(1, 200, "beta", history({of(beta1), of(beta2)})),
                                      ABOUT_TO_ANALYSE, POINT_0100, POINT_0100, POINT_0110},
                                     verdict(0, 1)}));

    const proc gam3{100, "gam", 3, 30, 301};
    const proc beta3{200, "beta", 2, 20, 202};
    call({gam3, beta3});
    expect_row(block->trend_table[0], 100, "gam", history({EMPTY, of(gam2), of(gam3)}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{200}));

    // The new history is full one call later than the old one would have been.
    const proc gam4{100, "gam", 3, 30, 302};
    const proc beta4{200, "beta", 2, 20, 203};
    call({gam4, beta4});
    expect_row(block->trend_table[0], 100, "gam", history({of(gam2), of(gam3), of(gam4)}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{100, 200}));
    EXPECT_TRUE(same_bytes(top_block(), padded(leak_text("beta"), TOP_DATA_BLOCK_SIZE)));
}

TEST_F(TrendAnalysis, NamesAreComparedOverTheirWholeField) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    const std::string last_changed = FULL_LENGTH_NAME.substr(0, PROCESS_NAME_FIELD - 1) + "x";
    call({{300, "worker-thread-pool-1", 1, 1, 1}, {301, FULL_LENGTH_NAME, 2, 2, 2}});
    call({{300, "worker-thread-pool-2", 3, 3, 3}, {301, last_changed, 4, 4, 4}});
    expect_row(block->trend_table[0], 300, "worker-thread-pool-2", history({EMPTY, {1, 3, 3, 3}}));
    expect_row(block->trend_table[1], 301, last_changed, history({EMPTY, {1, 4, 4, 4}}));
}

TEST_F(TrendAnalysis, SampleAndFlagAreCopiedFromTheProcessRowAsTheyStand) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    std::memset(block->process_table, 0, sizeof block->process_table);
    put_process(*block, 0, {40, "forty", 1, 2, 3});
    block->process_table[0].in_use = 7;
    block->process_table[0].always_one = 5;
    // A row whose word is 0 gives a sample that is not valid: the new row is dropped at once.
    put_process(*block, 1, {41, "forty-one", 4, 5, 6});
    block->process_table[1].always_one = 0;
    EXPECT_EQ(run_once(), 0u);
    const trend_row &row = block->trend_table[0];
    EXPECT_EQ(row.in_use, 7u);
    EXPECT_EQ(row.pid, 40u);
    EXPECT_EQ(samples_of(row), history({{5, 1, 2, 3}}));
    EXPECT_TRUE(row_is_zero(block->trend_table[1]));
    EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(1),
                                    table_entry(0, 40, "forty", history({{5, 1, 2, 3}}))}));
}

TEST_F(TrendAnalysis, ProcessAbsentFromOneSnapshotLosesItsHistory) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    auto a = [](uint32_t n) { return proc{1, "alpha", n, 10, 100 + n}; };
    auto b = [](uint32_t n) { return proc{2, "beta", n, 20, 200 + n}; };
    call({a(1), b(1)});
    call({b(2)});
    EXPECT_TRUE(row_is_zero(block->trend_table[0])); // all 644 bytes
    expect_row(block->trend_table[1], 2, "beta", history({of(b(1)), of(b(2))}));
    EXPECT_EQ(rec::traces(), joined({{index_trace(1), points_trace(2),
                                      table_entry(1, 2, "beta", history({of(b(1)), of(b(2))})),
                                      ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                                     verdict(0, 1)}));

    // Back again: the lowest free row, from the current slot on.
    call({a(3), b(3)});
    expect_row(block->trend_table[0], 1, "alpha", history({EMPTY, EMPTY, of(a(3))}));
    EXPECT_EQ(rec::traces(),
              joined({{index_trace(2), points_trace(2),
                       table_entry(0, 1, "alpha", history({EMPTY, EMPTY, of(a(3))})),
                       table_entry(1, 2, "beta", history({of(b(1)), of(b(2)), of(b(3))})),
                       ABOUT_TO_ANALYSE, POINT_0100, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(2, "beta", 3, 2)}));
    call({a(4), b(4)});
    expect_row(block->trend_table[0], 1, "alpha", history({EMPTY, of(a(3)), of(a(4))}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{2}));
    call({a(5), b(5)});
    expect_row(block->trend_table[0], 1, "alpha", history({of(a(3)), of(a(4)), of(a(5))}));
    EXPECT_EQ(pids_of(new_events()), (std::vector<uint32_t>{1, 2}));
}

TEST_F(TrendAnalysis, PidListedTwiceInTheProcessTableKeepsOneRow) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    // The same name twice: the later listing's sample stands.
    call({{7, "dup", 1, 10, 100}, {8, "x", 5, 50, 500}, {7, "dup", 2, 20, 200}});
    expect_row(block->trend_table[0], 7, "dup", history({{1, 2, 20, 200}}));
    expect_row(block->trend_table[1], 8, "x", history({{1, 5, 50, 500}}));
    EXPECT_TRUE(row_is_zero(block->trend_table[2]));
    EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(1),
                                    table_entry(0, 7, "dup", history({{1, 2, 20, 200}})),
                                    table_entry(1, 8, "x", history({{1, 5, 50, 500}}))}));

    // Two names: the second listing restarts the row, dropping even this call's first sample.
    call({{7, "dup", 3, 30, 300}, {8, "x", 5, 50, 500}, {7, "other", 4, 40, 400}});
    expect_row(block->trend_table[0], 7, "other", history({EMPTY, {1, 4, 40, 400}}));
    expect_row(block->trend_table[1], 8, "x", history({{1, 5, 50, 500}, {1, 5, 50, 500}}));
    EXPECT_TRUE(row_is_zero(block->trend_table[2]));
}

TEST_F(TrendAnalysis, ProcessesAreRecordedInProcessRowOrderSkippingFreeRows) {
    trend_analysis_points = 3;
    std::memset(block->process_table, 0, sizeof block->process_table);
    put_process(*block, 2, {20, "twenty", 1, 2, 3});
    put_process(*block, 7, {70, "seventy", 4, 5, 6});
    put_process(*block, PROCESS_TABLE_ROWS - 1, {99, "last", 7, 8, 9});
    EXPECT_EQ(run_once(), 0u);
    EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(1),
                                    table_entry(0, 20, "twenty", history({{1, 1, 2, 3}})),
                                    table_entry(1, 70, "seventy", history({{1, 4, 5, 6}})),
                                    table_entry(2, 99, "last", history({{1, 7, 8, 9}}))}));
    EXPECT_TRUE(row_is_zero(block->trend_table[3]));
}

TEST_F(TrendAnalysis, DuplicatedPidInTheTrendTableUsesTheLowestRowInUse) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    for (bool same_name : {true, false}) {
        SCOPED_TRACE(same_name);
        forget_histories();
        // Rows 1 and 3 both hold pid 9, as a foreign writer of the block could leave them.
        trend_row &low = block->trend_table[1];
        low.in_use = 1;
        low.pid = 9;
        copy_name(low.process_name, same_name ? "nine" : "other");
        low.samples[0] = {1, 1, 10, 100};
        trend_row &high = block->trend_table[3];
        high.in_use = 1;
        high.pid = 9;
        copy_name(high.process_name, "nine");
        high.samples[0] = {1, 3, 30, 300};
        block->analysisIndex = 1;

        call({{9, "nine", 2, 20, 200},
              {10, "ten", 1, 1, 1},
              {11, "eleven", 2, 2, 2},
              {12, "twelve", 3, 3, 3}});
        const std::vector<sample> nine = same_name ? history({{1, 1, 10, 100}, {1, 2, 20, 200}})
                                                   : history({EMPTY, {1, 2, 20, 200}});
        // New pids take the free rows from the lowest; row 3 is still in use while they are
        // recorded, and is dropped afterwards because its slot stayed empty.
        expect_row(block->trend_table[0], 10, "ten", history({EMPTY, {1, 1, 1, 1}}));
        expect_row(block->trend_table[1], 9, "nine", nine);
        expect_row(block->trend_table[2], 11, "eleven", history({EMPTY, {1, 2, 2, 2}}));
        EXPECT_TRUE(row_is_zero(block->trend_table[3]));
        expect_row(block->trend_table[4], 12, "twelve", history({EMPTY, {1, 3, 3, 3}}));
        EXPECT_TRUE(row_is_zero(block->trend_table[5]));
        lines expected{index_trace(1),
                       points_trace(2),
                       table_entry(0, 10, "ten", history({EMPTY, {1, 1, 1, 1}})),
                       table_entry(1, 9, "nine", nine),
                       table_entry(2, 11, "eleven", history({EMPTY, {1, 2, 2, 2}})),
                       table_entry(4, 12, "twelve", history({EMPTY, {1, 3, 3, 3}})),
                       ABOUT_TO_ANALYSE,
                       POINT_0100};
        if (same_name) {
            expected = joined({expected, {POINT_0100, POINT_0110}, verdict(0, 1)});
        } else {
            expected = joined({expected, {POINT_0100}});
        }
        expected = joined({expected, {POINT_0100, POINT_0100}});
        EXPECT_EQ(rec::traces(), expected);
    }
}

TEST_F(TrendAnalysis, RowsOfProcessesThatWentAwayAreReusedFromTheLowest) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    auto p = [](uint32_t pid, uint32_t n) { return proc{pid, "p" + std::to_string(pid), n, n, n}; };
    call({p(1, 1), p(2, 1), p(3, 1)});
    // 4 is new while the rows of 1 and 2 are still in use: it takes row 3. Then 1 and 2 drop.
    call({p(3, 2), p(4, 2)});
    EXPECT_TRUE(row_is_zero(block->trend_table[0]));
    EXPECT_TRUE(row_is_zero(block->trend_table[1]));
    expect_row(block->trend_table[2], 3, "p3", history({of(p(3, 1)), of(p(3, 2))}));
    expect_row(block->trend_table[3], 4, "p4", history({EMPTY, of(p(4, 2))}));
    call({p(3, 3), p(4, 3), p(5, 3), p(6, 3), p(7, 3)});
    expect_row(block->trend_table[0], 5, "p5", history({EMPTY, EMPTY, of(p(5, 3))}));
    expect_row(block->trend_table[1], 6, "p6", history({EMPTY, EMPTY, of(p(6, 3))}));
    expect_row(block->trend_table[2], 3, "p3", history({of(p(3, 1)), of(p(3, 2)), of(p(3, 3))}));
    expect_row(block->trend_table[3], 4, "p4", history({EMPTY, of(p(4, 2)), of(p(4, 3))}));
    expect_row(block->trend_table[4], 7, "p7", history({EMPTY, EMPTY, of(p(7, 3))}));
    EXPECT_TRUE(row_is_zero(block->trend_table[5]));
}

TEST_F(TrendAnalysis, WholeProcessTableFillsTheTrendTableAndAFullTableRecordsNoNewcomer) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    std::vector<proc> all;
    for (uint32_t i = 0; i < PROCESS_TABLE_ROWS; ++i) {
        all.push_back({10000 + i, "proc" + std::to_string(i), i, 2 * i, 3 * i});
    }
    call(all);
    ASSERT_EQ(rec::traces().size(), 2u + TREND_TABLE_ROWS);
    for (int i = 0; i < TREND_TABLE_ROWS; ++i) {
        const proc &p = all[static_cast<size_t>(i)];
        const trend_row &row = block->trend_table[i];
        ASSERT_EQ(row.in_use, 1u) << i;
        ASSERT_EQ(row.pid, p.pid) << i;
        ASSERT_EQ(name_field(row), padded(p.name, PROCESS_NAME_FIELD)) << i;
        ASSERT_EQ(samples_of(row), history({of(p)})) << i;
        ASSERT_EQ(rec::traces()[static_cast<size_t>(2 + i)],
                  table_entry(i, p.pid, p.name, history({of(p)})));
    }

    // Every row is in use while the newcomer is recorded: it gets none. The process it replaced
    // in the listing is dropped after the record step.
    std::vector<proc> with_newcomer(all.begin(), all.end() - 1);
    const proc newcomer{99999, "newcomer", 1, 1, 1};
    with_newcomer.push_back(newcomer);
    call(with_newcomer);
    EXPECT_TRUE(row_is_zero(block->trend_table[TREND_TABLE_ROWS - 1]));
    for (int i = 0; i < TREND_TABLE_ROWS; ++i) {
        ASSERT_NE(block->trend_table[i].pid, newcomer.pid) << i;
    }
    for (const std::string &trace : rec::traces()) {
        ASSERT_EQ(trace.find("newcomer"), std::string::npos) << trace;
        ASSERT_EQ(trace.find("99999"), std::string::npos) << trace;
    }
    EXPECT_EQ(rec::traces_starting("TARNTRAF: Table entry").size(),
              static_cast<size_t>(TREND_TABLE_ROWS - 1));
    expect_row(block->trend_table[0], 10000, "proc0", history({of(all[0]), of(all[0])}));

    // Now the row freed last time takes it, from the current slot.
    call(with_newcomer);
    expect_row(block->trend_table[TREND_TABLE_ROWS - 1], newcomer.pid, newcomer.name,
               history({EMPTY, EMPTY, of(newcomer)}));
    EXPECT_TRUE(rec::events().empty());
}

// ---- The table trace ----

TEST_F(TrendAnalysis, TableTraceListsAllTwentyFourSlotsWhateverThePoints) {
    trend_analysis_num_increases = 100;
    const proc shortname{5, "short", 1, 50, 100};
    const proc longname{6, FULL_LENGTH_NAME, 2, 7, 0xFFFFFFFF};
    for (int32_t points : {1, 2, 5, 24}) {
        SCOPED_TRACE(points);
        trend_analysis_points = points;
        forget_histories();
        std::memset(line, 'Z', LINE_SIZE);
        call({shortname, longname});
        const std::string long_text = "PID 6, pname=[" + FULL_LENGTH_NAME + "], vsizes=-1, " +
                                      repeated("-X, ", 23) + " dsizes=7, " + repeated("-X, ", 23);
        EXPECT_EQ(rec::traces_starting("TARNTRAF: Table entry"),
                  (lines{"TARNTRAF: Table entry [0] = PID 5, pname=[short], vsizes=100, " +
                             repeated("-X, ", 23) + " dsizes=50, " + repeated("-X, ", 23),
                         "TARNTRAF: Table entry [1] = " + long_text}));
        // The name field holds all 250 characters and no terminating NUL.
        EXPECT_EQ(name_field(block->trend_table[1]), FULL_LENGTH_NAME);
        // `line` is cleared for each row: it keeps the last row's text and nothing else.
        EXPECT_TRUE(same_bytes(line_block(), padded(long_text, LINE_SIZE)));
    }

    // A later slot and a mix of taken and empty slots.
    trend_analysis_points = 24;
    forget_histories();
    call({shortname});
    call({{5, "short", 1, 51, 101}, longname});
    EXPECT_EQ(rec::traces_starting("TARNTRAF: Table entry"),
              (lines{"TARNTRAF: Table entry [0] = PID 5, pname=[short], vsizes=100, 101, " +
                         repeated("-X, ", 22) + " dsizes=50, 51, " + repeated("-X, ", 22),
                     "TARNTRAF: Table entry [1] = PID 6, pname=[" + FULL_LENGTH_NAME +
                         "], vsizes=-X, -1, " + repeated("-X, ", 22) + " dsizes=-X, 7, " +
                         repeated("-X, ", 22)}));
}

TEST_F(TrendAnalysis, LineIsClearedWholeForEveryRowItHolds) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    // What a writer of `line` earlier in the pass can leave: a long text, then a short one
    // written over its start, so that the rest of the long one lies beyond the short one's NUL.
    std::memset(line, 0, LINE_SIZE);
    std::snprintf(line, LINE_SIZE, "%s", std::string(1000, 'L').c_str());
    std::snprintf(line, LINE_SIZE, "%s", "Code Version 61.001");
    call({{5, "short", 1, 50, 100}});
    EXPECT_TRUE(same_bytes(line_block(),
                           padded("PID 5, pname=[short], vsizes=100, " + repeated("-X, ", 23) +
                                      " dsizes=50, " + repeated("-X, ", 23),
                                  LINE_SIZE)));
}

TEST_F(TrendAnalysis, FullLengthNameIsReportedWithItsTwoHundredFiftyCharacters) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 2;
    load_control_file("PROCESS_LOG_THRESHOLDS 0 0 0 1 ^n\n");
    process_name_matcher = recording_matcher;
    for (uint32_t step = 0; step < 3; ++step) {
        call({{6, FULL_LENGTH_NAME, 1, 10, 100 + step}});
    }
    EXPECT_EQ(std::vector<std::string>(rec::traces().begin() + 3, rec::traces().end()),
              joined({{ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                      verdict(1, 2),
                      leak_traces(6, FULL_LENGTH_NAME, 3, 2)}));
    EXPECT_TRUE(same_bytes(top_block(), padded(leak_text(FULL_LENGTH_NAME), TOP_DATA_BLOCK_SIZE)));
    ASSERT_FALSE(matcher_calls.empty());
    for (const matcher_call &asked : matcher_calls) {
        EXPECT_EQ(asked.name, FULL_LENGTH_NAME);
    }
}

// ---- The index ----

TEST_F(TrendAnalysis, PointsAboveTwentyFourAreLoweredToTwentyFourByTheControlFileReader) {
    load_control_file("TREND_ANALYSIS_POINTS 30\nTREND_ANALYSIS_NUM_INCREASES 5\n");
    ASSERT_EQ(trend_analysis_points, 24);
    ASSERT_EQ(trend_analysis_num_increases, 5);
    auto at = [](uint32_t n) { return proc{31, "long", n, 10, 1000 + n}; };
    for (uint32_t n = 1; n <= 30; ++n) {
        SCOPED_TRACE(n);
        call({at(n)});
        const int32_t before = std::min<int32_t>(static_cast<int32_t>(n) - 1, 23);
        const int32_t after = std::min<int32_t>(static_cast<int32_t>(n), 23);
        EXPECT_EQ(block->analysisIndex, after);
        ASSERT_GE(rec::traces().size(), 3u);
        EXPECT_EQ(rec::traces()[0], index_trace(before));
        EXPECT_EQ(rec::traces()[1], points_trace(after));
        std::vector<sample> expected;
        for (uint32_t k = n > 24 ? n - 23 : 1; k <= n; ++k) {
            expected.push_back(of(at(k)));
        }
        expect_row(block->trend_table[0], 31, "long", history(expected));
        EXPECT_TRUE(row_is_zero(block->trend_table[1]));
        EXPECT_EQ(rec::traces()[2], table_entry(0, 31, "long", history(expected)));
        if (n < 23) {
            EXPECT_EQ(rec::traces().size(), 3u);
        }
        if (n == 23) {
            EXPECT_EQ(std::vector<std::string>(rec::traces().begin() + 3, rec::traces().end()),
                      joined({{ABOUT_TO_ANALYSE, POINT_0100, POINT_0110}, verdict(0, 22)}));
        }
        if (n >= 24) {
            EXPECT_EQ(std::vector<std::string>(rec::traces().begin() + 3, rec::traces().end()),
                      joined({{ABOUT_TO_ANALYSE, POINT_0100, POINT_0110},
                              verdict(1, 23),
                              leak_traces(31, "long", 24, 23)}));
        }
        EXPECT_EQ(pids_of(new_events()),
                  n >= 24 ? std::vector<uint32_t>{31} : std::vector<uint32_t>{});
    }
}

TEST_F(TrendAnalysis, IndexOutsideTheSlotsWrittenByAnotherStartsAgainFromSlotZero) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 100;
    const proc one{1, "one", 1, 10, 100};
    for (int32_t foreign : {-5, -1, 24, 40, std::numeric_limits<int32_t>::min(),
                            std::numeric_limits<int32_t>::max()}) {
        SCOPED_TRACE(foreign);
        forget_histories();
        block->analysisIndex = foreign;
        call({one});
        EXPECT_EQ(rec::traces(), (lines{index_trace(0), points_trace(1),
                                        table_entry(0, 1, "one", history({of(one)}))}));
        EXPECT_EQ(block->analysisIndex, 1);
        expect_row(block->trend_table[0], 1, "one", history({of(one)}));
        // Nothing before or after the row was written.
        EXPECT_TRUE(all_zero(block->override_table, sizeof block->override_table));
        EXPECT_TRUE(all_zero(&block->trend_table[1],
                             sizeof(trend_row) * static_cast<size_t>(TREND_TABLE_ROWS - 1)));
    }
}

TEST_F(TrendAnalysis, WithoutAControlBlockNothingIsWritten) {
    trend_analysis_points = 3;
    trend_analysis_num_increases = 0;
    list_processes(*block, {{1, "one", 1, 10, 100}});
    std::memset(line, 'Z', LINE_SIZE);
    std::memset(topDataBlock, 'Q', TOP_DATA_BLOCK_SIZE);
    TARN_CB_PTR = nullptr;
    uint32_t result = run_once();
    TARN_CB_PTR = block;
    EXPECT_EQ(result, 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_TRUE(rec::traces().empty());
    EXPECT_TRUE(rec::events().empty());
    EXPECT_TRUE(same_bytes(line_block(), std::string(LINE_SIZE, 'Z')));
    EXPECT_TRUE(same_bytes(top_block(), std::string(TOP_DATA_BLOCK_SIZE, 'Q')));
    EXPECT_EQ(block->analysisIndex, 0);
    EXPECT_TRUE(all_zero(block->trend_table, sizeof block->trend_table));
}

// ---- Against the plain walk ----

// The routine as the plain walk does it: the trend table searched from row 0 for every process,
// the log table walked for every sample. What it expects the block, the traces, the reports,
// topDataBlock and `line` to be after each call.
class plain_walk {
  public:
    explicit plain_walk(const tarn_control_block &block)
        : rows(block.trend_table, block.trend_table + TREND_TABLE_ROWS), index(block.analysisIndex),
          top(top_block()), line_bytes(line_block()) {}

    void call(const tarn_control_block &block) {
        traces.clear();
        reported.clear();
        if (index < 0 || index > TREND_LAST_SLOT) {
            index = 0;
        }
        traces.push_back(index_trace(index));
        const int64_t last = static_cast<int64_t>(trend_analysis_points) - 1;
        for (trend_row &row : rows) {
            if (row.in_use != 0 && index >= last && row.samples[index].valid != 0) {
                for (int32_t k = 0; k < index && k < TREND_LAST_SLOT; ++k) {
                    row.samples[k] = row.samples[k + 1];
                }
                row.samples[index] = trend_sample{};
            }
        }
        for (const process_row &process : block.process_table) {
            if (process.in_use == 0) {
                continue;
            }
            int found = -1;
            for (int r = 0; r < TREND_TABLE_ROWS && found == -1; ++r) {
                if (rows[r].in_use != 0 && rows[r].pid == process.pid) {
                    found = r;
                }
            }
            if (found != -1) {
                if (std::memcmp(rows[found].process_name, process.process_name,
                                PROCESS_NAME_FIELD) != 0) {
                    ++renamed;
                    restart(rows[found], process);
                }
            } else {
                for (int r = 0; r < TREND_TABLE_ROWS && found == -1; ++r) {
                    if (rows[r].in_use == 0) {
                        found = r;
                    }
                }
                if (found == -1) {
                    ++unrecorded;
                    continue;
                }
                restart(rows[found], process);
            }
            rows[found].samples[index] = {process.always_one, process.rss, process.dsiz,
                                          process.vsize};
        }
        for (trend_row &row : rows) {
            if (row.in_use != 0 && row.samples[index].valid == 0) {
                std::memset(&row, 0, sizeof row);
            }
        }
        if (index < last) {
            ++index;
        }
        traces.push_back(points_trace(index));
        for (int r = 0; r < TREND_TABLE_ROWS; ++r) {
            const trend_row &row = rows[r];
            if (row.in_use == 0) {
                continue;
            }
            std::vector<sample> samples;
            for (const trend_sample &s : row.samples) {
                samples.push_back({s.valid, s.rss, s.dsiz, s.vsize});
            }
            std::string text = table_text(row.pid, name_of(row), samples);
            line_bytes = padded(text, LINE_SIZE);
            traces.push_back("TARNTRAF: Table entry [" + std::to_string(r) + "] = " + text);
        }
        if (trend_analysis_points > 0 && index >= last) {
            analyse();
        }
    }

    std::vector<trend_row> rows;
    int32_t index;
    std::string top;
    std::string line_bytes;
    lines traces;
    std::vector<uint32_t> reported;
    int unrecorded = 0; // processes a full table had no row for
    int renamed = 0;    // histories restarted for a pid under another name

  private:
    static std::string name_of(const trend_row &row) {
        return std::string(row.process_name, strnlen(row.process_name, PROCESS_NAME_FIELD));
    }

    static void restart(trend_row &row, const process_row &process) {
        std::memset(row.samples, 0, sizeof row.samples);
        row.in_use = process.in_use;
        std::memcpy(row.process_name, process.process_name, PROCESS_NAME_FIELD);
        row.pid = process.pid;
    }

    // The log table walked from row 0 until a compiled row matches.
    static bool analysed(const std::string &name) {
        for (int32_t r = 0; logtable != nullptr && r < num_log_thresholds; ++r) {
            const log_threshold &row = logtable[r];
            if (row.compiled != 1) {
                continue;
            }
            std::vector<regmatch_t> found(row.expression.re_nsub + 1);
            if (regexec(&row.expression, name.c_str(), row.expression.re_nsub, found.data(), 0) ==
                0) {
                return row.memoryCheckFlag == 1;
            }
        }
        return true;
    }

    void analyse() {
        traces.push_back(ABOUT_TO_ANALYSE);
        for (const trend_row &row : rows) {
            if (row.in_use == 0) {
                continue;
            }
            traces.push_back(POINT_0100);
            int32_t increases = 0;
            if (row.samples[0].valid == 0) {
                continue;
            }
            traces.push_back(POINT_0110);
            const std::string name = name_of(row);
            const trend_sample *prev = &row.samples[0];
            int dontLog = 1;
            for (int32_t i = 1; i < trend_analysis_points && i <= TREND_LAST_SLOT && dontLog == 1;
                 ++i) {
                const trend_sample &s = row.samples[i];
                if (s.valid == 0) {
                    dontLog = 0;
                    continue;
                }
                const auto prev_dsiz = static_cast<int32_t>(prev->dsiz);
                const auto prev_vsize = static_cast<int32_t>(prev->vsize);
                const auto dsiz = static_cast<int32_t>(s.dsiz);
                const auto vsize = static_cast<int32_t>(s.vsize);
                if (!analysed(name)) {
                    traces.push_back(point_0120(i));
                    dontLog = 0;
                } else if (prev_dsiz > dsiz) {
                    traces.push_back(point_0130(i));
                    dontLog = 0;
                } else if (prev_vsize > vsize) {
                    traces.push_back(point_0140(i));
                    dontLog = 0;
                }
                if (prev_dsiz < dsiz) {
                    ++increases;
                } else if (prev_vsize < vsize) {
                    ++increases;
                }
                prev = &s;
            }
            lines closing = verdict(dontLog, increases);
            traces.insert(traces.end(), closing.begin(), closing.end());
            if (dontLog == 1 && increases >= trend_analysis_num_increases) {
                lines report = leak_traces(row.pid, name, trend_analysis_points, increases);
                traces.insert(traces.end(), report.begin(), report.end());
                top = padded(leak_text(name), TOP_DATA_BLOCK_SIZE);
                reported.push_back(row.pid);
            }
        }
    }
};

struct walk_case {
    const char *title;
    int32_t points;
    int32_t increases;
    int calls;
    uint32_t pid_pool;   // pids 0 .. pid_pool - 1
    uint32_t listed_pct; // chance that a pid is listed in a pass
    uint32_t fall_pct;   // chance that a size falls from one pass to the next
    bool foreign_rows;   // start from rows a foreign writer left, pids doubled among them
};

void PrintTo(const walk_case &c, std::ostream *out) {
    *out << c.title;
}

class TrendAnalysisPlainWalk : public TrendAnalysis,
                               public ::testing::WithParamInterface<walk_case> {
  protected:
    struct process_state {
        std::string name;
        uint32_t rss;
        uint32_t dsiz;
        uint32_t vsize;
    };

    uint32_t draw(uint32_t below) { return static_cast<uint32_t>(generator() % below); }

    uint32_t grown(uint32_t size) {
        const uint32_t falls = GetParam().fall_pct;
        uint32_t roll = draw(100);
        if (roll < falls) {
            return size - 1 - draw(50); // a fall
        }
        if (falls > 0 && roll < falls + 2) {
            return 0x80000000u + draw(1000); // below every positive size, as an int32
        }
        if (roll < 40) {
            return size; // held
        }
        return size + 1 + draw(20);
    }

    std::string some_name(uint32_t pid) {
        static const std::vector<std::string> names{
            "alpha", "beta", "quiet", "loud", "loudspeaker", "quieter", FULL_LENGTH_NAME};
        if (GetParam().pid_pool > 100) {
            return (draw(2) == 0 ? "p" : "q") + std::to_string(pid);
        }
        return names[draw(static_cast<uint32_t>(names.size()))];
    }

    // The process table of one pass: most pids of the pool, some renamed, some twice, with free
    // rows between them.
    void next_listing() {
        std::memset(block->process_table, 0, sizeof block->process_table);
        std::vector<uint32_t> order(GetParam().pid_pool);
        for (uint32_t i = 0; i < order.size(); ++i) {
            order[i] = i;
        }
        std::shuffle(order.begin(), order.end(), generator);
        const bool gaps = GetParam().pid_pool <= 100;
        int row = 0;
        for (uint32_t pid : order) {
            if (row >= PROCESS_TABLE_ROWS) {
                break;
            }
            if (draw(100) >= GetParam().listed_pct) {
                continue;
            }
            process_state &state = processes[pid];
            if (state.name.empty() || draw(100) < 3) {
                state = {some_name(pid), draw(100), 100 + draw(100), 1000 + draw(100)};
            } else {
                state.rss = draw(1000);
                state.dsiz = grown(state.dsiz);
                state.vsize = grown(state.vsize);
            }
            put_process(*block, row++, {pid, state.name, state.rss, state.dsiz, state.vsize});
            if (row < PROCESS_TABLE_ROWS && draw(100) < 2) {
                // The same pid again, now and then under another name.
                std::string name = draw(2) == 0 ? state.name : some_name(pid);
                put_process(*block, row++, {pid, name, state.rss, state.dsiz + 1, state.vsize});
            }
            if (gaps && draw(100) < 10) {
                ++row;
            }
        }
    }

    // Rows in use before the first call, with some pids twice and some samples taken.
    void foreign_rows() {
        for (int r = 0; r < 40; ++r) {
            if (draw(100) < 30) {
                continue;
            }
            trend_row &row = block->trend_table[r];
            row.in_use = 1;
            row.pid = draw(GetParam().pid_pool / 2);
            copy_name(row.process_name, some_name(row.pid));
            for (trend_sample &s : row.samples) {
                if (draw(100) < 60) {
                    s = {1, draw(100), 100 + draw(10), 1000 + draw(10)};
                }
            }
        }
        block->analysisIndex = static_cast<int32_t>(draw(TREND_SAMPLES));
    }

    std::mt19937 generator{20240611};
    std::vector<process_state> processes;
};

TEST_P(TrendAnalysisPlainWalk, EveryCallLeavesWhatThePlainWalkLeaves) {
    const walk_case &c = GetParam();
    trend_analysis_points = c.points;
    trend_analysis_num_increases = c.increases;
    load_control_file("PROCESS_LOG_THRESHOLDS 0 0 0 0 ^quiet$\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 1 ^lo\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 0 ^loud\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 1 \\(al\\)\\(pha\\)\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 1 ^p1\n"
                      "PROCESS_LOG_THRESHOLDS 0 0 0 0 ^p2\n");
    ASSERT_EQ(num_log_thresholds, 6);
    processes.resize(c.pid_pool);
    if (c.foreign_rows) {
        foreign_rows();
    }
    std::memset(line, 'Z', LINE_SIZE);
    plain_walk walk(*block);
    int reports = 0;
    for (int n = 1; n <= c.calls; ++n) {
        SCOPED_TRACE("call " + std::to_string(n));
        next_listing();
        EXPECT_EQ(run_once(), 0u);
        EXPECT_EQ(crc, 0u);
        walk.call(*block);
        for (int r = 0; r < TREND_TABLE_ROWS; ++r) {
            ASSERT_EQ(std::memcmp(&block->trend_table[r], &walk.rows[static_cast<size_t>(r)],
                                  sizeof(trend_row)),
                      0)
                << "trend row " << r;
        }
        ASSERT_EQ(block->analysisIndex, walk.index);
        expect_same_lines(rec::traces(), walk.traces);
        ASSERT_EQ(pids_of(new_events()), walk.reported);
        ASSERT_TRUE(same_bytes(top_block(), walk.top));
        ASSERT_TRUE(same_bytes(line_block(), walk.line_bytes));
        if (HasFailure()) {
            return;
        }
        reports += static_cast<int>(walk.reported.size());
    }
    // A run that never reached what it is there for would prove little.
    if (c.points > 0) {
        EXPECT_GT(reports, 0);
    }
    EXPECT_GT(walk.renamed, 0);
    if (c.pid_pool > PROCESS_TABLE_ROWS) {
        EXPECT_GT(walk.unrecorded, 0);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Cases, TrendAnalysisPlainWalk,
    ::testing::Values(walk_case{"ThreePoints", 3, 1, 150, 40, 85, 6, false},
                      walk_case{"FourPointsForeignRows", 4, 2, 150, 40, 85, 6, true},
                      walk_case{"OnePoint", 1, 0, 40, 40, 85, 6, false},
                      walk_case{"TwoPointsForeignRows", 2, 1, 60, 40, 90, 6, true},
                      walk_case{"TwentyFourPoints", 24, 3, 80, 30, 99, 0, false},
                      walk_case{"NoPointsForeignRows", 0, 0, 20, 40, 85, 6, true},
                      walk_case{"FullTable", 3, 1, 6, 4500, 70, 6, false}),
    [](const ::testing::TestParamInfo<walk_case> &info) { return std::string(info.param.title); });

} // namespace

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <ostream>
#include <regex.h>
#include <spawn.h>
#include <string>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "command_runner.h"
#include "core/control_block.h"
#include "core/control_file.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "matcher_log.h"
#include "memory/name_matching.h"
#include "memory/pp_memory.h"
#include "private_ipc.h"
#include "recording_platform.h"
#include "starved_child.h"
#include "text_lines.h"

extern char **environ;

namespace {

using fake::fake_commands;
using text::all_zero;
using text::joined;
using text::left_aligned;
using text::lines;
using text::right_aligned;

constexpr char PS_HEADER[] = "  \n\rAbout to output ps data \n\r";
constexpr int32_t PS_HEADER_LENGTH = 30;
constexpr char OVERFLOW_LINE[] = "No room to output more lines... \n\r";
constexpr uint32_t CRC_GIVEN = 0x1234; // what the tests pass in *crc, which the check only traces
constexpr int32_t NO_THREAD_LIMIT = 1000000;

// The values of takeLogCrc the check leaves, as the loop's signed integer holds them.
constexpr int32_t PROCESS_RSS = RC_PROCESS_RSS;
constexpr int32_t PROCESS_RSS_ABORT = RC_PROCESS_RSS_ABORT;
constexpr int32_t TOO_MANY_PROCESSES = RC_TOO_MANY_PROCESSES;
constexpr int32_t SUPPRESSED = TAKE_LOG_SUPPRESSED;
constexpr int32_t EARLIER_FINDING = RC_PROCESS_CPU; // a finding of a check before this one

// ---- The listing ----

// One process as ps lists it; the sizes are words as ps prints them, so "123m" can be one.
struct ps_process {
    int pid;
    std::string rss;
    std::string vsize = "20000";
    std::string dsiz = "3000";
    std::string name = "worker";
    int tid = 0; // 0: the pid
};

// The line that "ps -e -o pid,tid,rss,vsize,dsiz,comm,time --no-header" prints for `p`.
std::string ps_line(const ps_process &p) {
    return right_aligned(std::to_string(p.pid), 5) + " " +
           right_aligned(std::to_string(p.tid != 0 ? p.tid : p.pid), 5) + " " +
           right_aligned(p.rss, 5) + " " + right_aligned(p.vsize, 6) + " " +
           right_aligned(p.dsiz, 5) + " " + left_aligned(p.name, 15) + " 00:00:01";
}

lines ps_lines(const std::vector<ps_process> &processes) {
    lines listing;
    for (const ps_process &p : processes) {
        listing.push_back(ps_line(p));
    }
    return listing;
}

// The number "sort -k3,3n" reads from a line: the digits at the start of its third field.
long rss_key(const std::string &line) {
    size_t at = 0;
    for (int field = 0; field < 2; ++field) {
        at = line.find_first_not_of(' ', at);
        at = line.find(' ', at);
    }
    return std::strtol(line.c_str() + at, nullptr, 10);
}

// The listing as "sort -k3,3nr" gives it: the largest rss first. No test lists two lines with the
// same rss, whose order would be the locale's business.
lines sorted_by_rss(lines listing) {
    std::stable_sort(
        listing.begin(), listing.end(),
        [](const std::string &a, const std::string &b) { return rss_key(a) > rss_key(b); });
    return listing;
}

// The listing in an order ps might print it, which sort must put right: smallest rss first,
// then turned by a third.
lines out_of_order(const lines &listing) {
    lines shuffled = sorted_by_rss(listing);
    std::reverse(shuffled.begin(), shuffled.end());
    std::rotate(shuffled.begin(), shuffled.begin() + static_cast<long>(shuffled.size() / 3),
                shuffled.end());
    return shuffled;
}

std::string text_of(const lines &listing) {
    std::string text;
    for (const std::string &line : listing) {
        text += line + "\n";
    }
    return text;
}

// `count` processes "procN" with pids from `first_pid` and rss falling from `top_rss`, in rss
// order.
lines many_processes(int count, int first_pid, int top_rss) {
    lines listing;
    for (int i = 0; i < count; ++i) {
        listing.push_back(ps_line({.pid = first_pid + i,
                                   .rss = std::to_string(top_rss - i),
                                   .name = "proc" + std::to_string(i)}));
    }
    return listing;
}

// ---- What the check leaves ----

std::string block_text() {
    return std::string(primaryDataBlock, strnlen(primaryDataBlock, PRIMARY_DATA_BLOCK_SIZE));
}

// topDataBlock as text; the bytes after the text must all be NUL.
std::string top_text() {
    size_t length = strnlen(topDataBlock, TOP_DATA_BLOCK_SIZE);
    EXPECT_TRUE(all_zero(topDataBlock + length, TOP_DATA_BLOCK_SIZE - length));
    return std::string(topDataBlock, length);
}

std::string ps_block_text() {
    size_t length = strnlen(newPSDataBlock, PS_DATA_BLOCK_SIZE);
    EXPECT_TRUE(all_zero(newPSDataBlock + length, PS_DATA_BLOCK_SIZE - length));
    return std::string(newPSDataBlock, length);
}

enum class finding { log, abort };

// The error text of a finding in topDataBlock.
std::string top_text_for(finding kind, const std::string &line) {
    return std::string("\n\rError Information: \n\r") +
           (kind == finding::abort ? "RSS Abort Threshold exceeded\n\r"
                                   : "RSS Threshold exceeded\n\r") +
           "Entire line was: \n\r" + line + "\n\r";
}

// The trace lines of a finding; the value traced as rss is the vsize.
lines finding_traces(finding kind, int32_t vsize, const std::string &line) {
    return {kind == finding::abort ? "TARNMNDF: RSS Abort threshold exceeded"
                                   : "TARNMNDF: RSS threshold exceeded",
            "TARNMNDF: rss = " + std::to_string(vsize) + " (dec)",
            "TARNMNDF: Entire line was [" + line + "]"};
}

std::string limits_text(int32_t rss, int32_t dsiz, int32_t vsize) {
    return std::to_string(rss) + ", dsiz = " + std::to_string(dsiz) +
           ", vsize = " + std::to_string(vsize) + " (dec)";
}

lines log_match_traces(const std::string &name, const std::string &expression, int32_t rss,
                       int32_t dsiz, int32_t vsize) {
    return {"TARNMNDD: found log table match for pname [" + name + "]",
            "TARNMNDD: with expression [" + expression + "]",
            "TARNMNDD:   rss = " + limits_text(rss, dsiz, vsize)};
}

lines abort_match_traces(const std::string &name, const std::string &expression, int32_t rss,
                         int32_t dsiz, int32_t vsize) {
    return {"TARNMNDD: found abort table match for pname [" + name + "]",
            "TARNMNDD: with expression [" + expression + "]",
            "TARNMNDD:   Abort's Rss = " + limits_text(rss, dsiz, vsize)};
}

// The trace lines, each call of the override table's lock routine folded into one line
// "<lock(1) == 0>": what that routine traces inside is its own tests' business.
lines summarised_traces() {
    constexpr std::string_view enter = "TARNTLCF: --> tarn_override_table_lock_control(";
    constexpr std::string_view leave = "TARNTLCF: <-- tarn_override_table_lock_control() == ";
    lines folded;
    std::string argument;
    for (const std::string &trace : rec::traces()) {
        if (trace.starts_with(enter)) {
            argument = trace.substr(enter.size(), trace.size() - enter.size() - 1);
        } else if (trace.starts_with(leave)) {
            folded.push_back("<lock(" + argument + ") == " + trace.substr(leave.size()) + ">");
        } else if (!trace.starts_with("TARNTLCF: ")) {
            folded.push_back(trace);
        }
    }
    return folded;
}

const std::string CHECK_ENTRY = "TARNOTHF: --> tarn_check_pp_memory";
const std::string CHECK_EXIT = "TARNOTHF: <-- tarn_check_pp_memory, src = 0, crc = 1234 (hex)";

std::string thread_count_trace(int count) {
    return "TARNMNDF: number of threads = " + std::to_string(count) + " (dec)";
}

// Everything a check that got its lock traces: `per_line` from the lines of the listing, the
// thread count, then `after_count` (the thread finding, the sweep).
lines check_traces(const lines &per_line, int count, const lines &after_count = {}) {
    return joined({{CHECK_ENTRY, "<lock(1) == 0>", "TARNMNDD: got access to override table"},
                   per_line,
                   {thread_count_trace(count)},
                   after_count,
                   {"<lock(0) == 0>", CHECK_EXIT}});
}

lines thread_finding_traces(int count) {
    return {"TARNMNDF: number of threads threshold exceeded", thread_count_trace(count)};
}

std::string went_away(int pid) {
    return "TARNMNDF: process " + std::to_string(pid) + " went away; remove override";
}

// One row of the process table, as the test reads it back.
struct row_values {
    uint32_t pid;
    std::string name;
    uint32_t rss;
    uint32_t dsiz;
    uint32_t vsize;
    bool operator==(const row_values &) const = default;
};

void PrintTo(const row_values &row, std::ostream *out) {
    *out << "{pid " << row.pid << ", \"" << row.name << "\", rss " << row.rss << ", dsiz "
         << row.dsiz << ", vsize " << row.vsize << "}";
}

// The rows in use, from row 0; every one must carry in-use 1 and the word set to 1, and every row
// after them must be all zero.
std::vector<row_values> process_rows(const tarn_control_block &block) {
    std::vector<row_values> rows;
    int i = 0;
    for (; i < PROCESS_TABLE_ROWS && block.process_table[i].in_use != 0; ++i) {
        const process_row &row = block.process_table[i];
        EXPECT_EQ(row.in_use, 1u) << "row " << i;
        EXPECT_EQ(row.always_one, 1u) << "row " << i;
        rows.push_back(
            {row.pid, std::string(row.process_name, strnlen(row.process_name, PROCESS_NAME_FIELD)),
             row.rss, row.dsiz, row.vsize});
    }
    const auto *rest = reinterpret_cast<const char *>(block.process_table + i);
    EXPECT_TRUE(all_zero(rest, sizeof(process_row) * static_cast<size_t>(PROCESS_TABLE_ROWS - i)));
    return rows;
}

// ---- The fixture ----

// A control block of its own (private IPC namespace), empty settings and tables, a fresh pass, a
// directory of fake commands first on PATH.
class PpMemory : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        rec::reset();
        release_tables();
        reset_settings();
        block = private_ipc::fresh_control_block();
        ASSERT_NE(block, nullptr);
        // A thread count finding would replace every finding of a line; its tests set their own.
        num_threads_threshold = NO_THREAD_LIMIT;
        matcher_calls.clear();
        start_pass();
        rec::clear_traces();
    }

    void TearDown() override {
        process_name_matcher = regexec;
        command_shell = "/bin/bash";
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

    // What the loop does before the checks of a pass.
    void start_pass() {
        start_pass_data();
        takeLogCrc = 0;
        takeLogValue = 0;
        killPid = 0;
    }

    // The log and abort tables of a control file text.
    void load_tables(const std::string &text) {
        control_text = text;
        uint32_t parse_crc = 0;
        tarn_parse_control_file(control_text.c_str(), &parse_crc);
        rec::clear_traces();
    }

    void set_override(int index, uint32_t pid, std::array<uint32_t, 6> limits,
                      uint32_t in_use = 1) {
        block->override_table[index] = {pid,       limits[0], limits[1], limits[2], limits[3],
                                        limits[4], limits[5], in_use,    0};
    }

    uint32_t check() {
        crc = CRC_GIVEN;
        return tarn_check_pp_memory(&takeLogCrc, &takeLogValue, &killPid, &block->tookLog, &crc);
    }

    // The check over a fake ps that prints `printed` as it stands (sort puts it in rss order).
    uint32_t check_with_ps(const lines &printed, int exit_status = 0) {
        fakes.add_printing("ps", text_of(printed), exit_status);
        return check();
    }

    // The line handler fed `in_order` as the check would feed it, after the pass's index of the
    // override table.
    void judge_lines(const lines &in_order) {
        pass = pp_memory_pass{&takeLogCrc, &takeLogValue, &killPid, &block->tookLog, block};
        index_override_table(*block);
        for (const std::string &line : in_order) {
            pp_memory_line(pass, line.c_str());
        }
    }

    bool key_is_ours = false;
    tarn_control_block *block = nullptr;
    fake_commands fakes;
    pp_memory_pass pass{};
    int32_t takeLogCrc = 0;
    int32_t takeLogValue = 0;
    int32_t killPid = 0;
    uint32_t crc = 0;
    std::string control_text;
};

// ---- Every edge case, by both routes: the line handler with captured lines in rss order, and the
// whole check with a fake ps that prints them out of order ----

enum class route { line_handler, ps_command };

void PrintTo(route way, std::ostream *out) {
    *out << (way == route::line_handler ? "line handler" : "ps command");
}

class PpMemoryEdge : public PpMemory, public ::testing::WithParamInterface<route> {
  protected:
    bool by_handler() const { return GetParam() == route::line_handler; }

    void run(const lines &listing) {
        listed = sorted_by_rss(listing);
        if (by_handler()) {
            judge_lines(listed);
        } else {
            EXPECT_EQ(check_with_ps(out_of_order(listing)), 0u);
        }
    }

    // The lines gave the traces `per_line`; the check gives its own around them, and
    // `after_count` after its thread count.
    void expect_traces(const lines &per_line, const lines &after_count = {}) {
        if (by_handler()) {
            EXPECT_EQ(rec::traces(), per_line);
        } else {
            EXPECT_EQ(summarised_traces(),
                      check_traces(per_line, static_cast<int>(listed.size()), after_count));
        }
    }

    // primaryDataBlock holds every listed line in rss order, after the check's header.
    void expect_listing_in_primary_block() {
        std::string expected = by_handler() ? "" : PS_HEADER;
        for (const std::string &line : listed) {
            expected += line + "\n\r";
        }
        EXPECT_EQ(block_text(), expected);
    }

    void expect_finding(int32_t code, int32_t value, int32_t pid_to_kill) {
        EXPECT_EQ(takeLogCrc, code);
        EXPECT_EQ(takeLogValue, value);
        EXPECT_EQ(killPid, pid_to_kill);
    }

    lines listed;
};

INSTANTIATE_TEST_SUITE_P(BothRoutes, PpMemoryEdge,
                         ::testing::Values(route::line_handler, route::ps_command),
                         [](const ::testing::TestParamInfo<route> &info) {
                             return info.param == route::line_handler ? "LineHandler" : "PsCommand";
                         });

TEST_P(PpMemoryEdge, ProcessExactlyAtItsRssLimitIsNotReported) {
    rss_memory_threshold = 1000;
    run(ps_lines({{.pid = 100, .rss = "1000"}}));
    expect_finding(0, 0, 0);
    expect_traces({});
    EXPECT_EQ(top_text(), "");
    expect_listing_in_primary_block();
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{100, "worker", 1000, 3000, 20000}}));
}

TEST_P(PpMemoryEdge, ProcessOneKilobyteAboveItsRssLimitIsReported) {
    rss_memory_threshold = 1000;
    const std::string above = ps_line({.pid = 101, .rss = "1001", .vsize = "25000"});
    const std::string at = ps_line({.pid = 100, .rss = "1000"});
    run({at, above});
    expect_finding(PROCESS_RSS, 1001, 0);
    expect_traces(finding_traces(finding::log, 25000, above));
    EXPECT_EQ(top_text(), top_text_for(finding::log, above));
    expect_listing_in_primary_block();
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{101, "worker", 1001, 3000, 25000},
                                                             {100, "worker", 1000, 3000, 20000}}));
}

TEST_P(PpMemoryEdge, AbortLimitOfZeroOrBelowNeverAborts) {
    rss_memory_threshold = 1000;
    const std::string line = ps_line({.pid = 7, .rss = "5000"});
    for (int32_t abort_limit : {0, -1, -5000}) {
        SCOPED_TRACE(abort_limit);
        rss_abort_memory_threshold = abort_limit;
        start_pass();
        rec::clear_traces();
        run({line});
        expect_finding(PROCESS_RSS, 5000, 0);
        expect_traces(finding_traces(finding::log, 20000, line));
        EXPECT_EQ(top_text(), top_text_for(finding::log, line));
    }
}

TEST_P(PpMemoryEdge, RssAtTheAbortLimitIsALogFinding) {
    rss_memory_threshold = 1000;
    rss_abort_memory_threshold = 5000;
    const std::string line = ps_line({.pid = 7, .rss = "5000"});
    run({line});
    expect_finding(PROCESS_RSS, 5000, 0);
    EXPECT_EQ(top_text(), top_text_for(finding::log, line));
}

TEST_P(PpMemoryEdge, RssAboveAPositiveAbortLimitAbortsAndNamesThePid) {
    rss_memory_threshold = 1000;
    rss_abort_memory_threshold = 4999;
    const std::string line = ps_line({.pid = 7, .rss = "5000", .vsize = "80000"});
    run({line});
    expect_finding(PROCESS_RSS_ABORT, 5000, 7);
    expect_traces(finding_traces(finding::abort, 80000, line));
    EXPECT_EQ(top_text(), top_text_for(finding::abort, line));
}

// The tables of the override tests: a java process would get 10 KB and abort at 20 KB from them.
constexpr char JAVA_TABLES[] = "PROCESS_LOG_THRESHOLDS 10 0 0 0 ^java$\n"
                               "PROCESS_ABORT_THRESHOLDS 20 0 0 ^java$\n";

TEST_P(PpMemoryEdge, OverrideEntryOfZerosKeepsTheProcessOutOfBothTablesAndTheDefaultsStand) {
    load_tables(JAVA_TABLES);
    rss_memory_threshold = 1000;
    rss_abort_memory_threshold = 2000;
    set_override(0, 300, {0, 0, 0, 0, 0, 0});
    process_name_matcher = recording_matcher;
    const std::string line = ps_line({.pid = 300, .rss = "1500", .name = "java"});
    run({line});
    expect_finding(PROCESS_RSS, 1500, 0);
    expect_traces(finding_traces(finding::log, 20000, line));
    EXPECT_TRUE(matcher_calls.empty());
    EXPECT_EQ(block->override_table[0].seen, 1u);
    EXPECT_EQ(block->override_table[0].in_use, 1u);
}

TEST_P(PpMemoryEdge, WithoutAnOverrideEntryTheTablesGiveTheLimits) {
    load_tables(JAVA_TABLES);
    rss_memory_threshold = 1000;
    rss_abort_memory_threshold = 2000;
    const std::string line = ps_line({.pid = 300, .rss = "1500", .name = "java"});
    run({line});
    expect_finding(PROCESS_RSS_ABORT, 1500, 300);
    expect_traces(joined({log_match_traces("java", "^java$", 10, 0, 0),
                          abort_match_traces("java", "^java$", 20, 0, 0),
                          finding_traces(finding::abort, 20000, line)}));
    EXPECT_EQ(top_text(), top_text_for(finding::abort, line));
}

TEST_P(PpMemoryEdge, OverrideEntryReplacesOnlyTheLimitsItSets) {
    load_tables(JAVA_TABLES);
    rss_memory_threshold = 1000;
    rss_abort_memory_threshold = 2000;
    // Its rss limit and rss abort limit replace the defaults 1000 and 2000.
    set_override(0, 300, {1200, 0, 0, 1400, 0, 0});
    const std::string line = ps_line({.pid = 300, .rss = "1500", .name = "java"});
    run({line});
    expect_finding(PROCESS_RSS_ABORT, 1500, 300);
    expect_traces(finding_traces(finding::abort, 20000, line));

    // With its abort limit 0 the default abort limit stands.
    set_override(0, 300, {1200, 0, 0, 0, 0, 0});
    start_pass();
    rec::clear_traces();
    run({line});
    expect_finding(PROCESS_RSS, 1500, 0);
}

TEST_P(PpMemoryEdge, SizeEndingInMCountsAsThousandsOfKilobytes) {
    rss_memory_threshold = 122999;
    const std::string line = ps_line({.pid = 9, .rss = "123m", .vsize = "2m", .dsiz = "7m"});
    run({line});
    expect_finding(PROCESS_RSS, 123000, 0);
    expect_traces(finding_traces(finding::log, 2000, line));
    EXPECT_EQ(top_text(), top_text_for(finding::log, line));
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{9, "worker", 123000, 7000, 2000}}));
}

TEST_P(PpMemoryEdge, SizeEndingInMAtTheLimitIsNotReported) {
    rss_memory_threshold = 123000;
    run({ps_line({.pid = 9, .rss = "123m"})});
    expect_finding(0, 0, 0);
    expect_traces({});
}

TEST_P(PpMemoryEdge, WithTookLogSetAHugeRssIsComparedAsItStands) {
    rss_memory_threshold = 1000;
    block->tookLog = 1;
    takeLogValue = 77;
    std::strcpy(topDataBlock, "an earlier finding");
    const std::string line =
        ps_line({.pid = 5, .rss = "9000000", .vsize = "9000001", .dsiz = "8388609"});
    run({line});
    // Found, but held back: only the marker.
    expect_finding(SUPPRESSED, 77, 0);
    expect_traces({});
    EXPECT_EQ(top_text(), "an earlier finding");
    EXPECT_EQ(process_rows(*block),
              (std::vector<row_values>{{5, "worker", 9000000, 8388609, 9000001}}));
}

TEST_P(PpMemoryEdge, WithTookLogClearAHugeSizeBecomesZero) {
    rss_memory_threshold = 1000;
    const std::string huge =
        ps_line({.pid = 5, .rss = "9000000", .vsize = "9000001", .dsiz = "8388609"});
    // 8,388,608 itself is no misread column.
    const std::string largest_kept =
        ps_line({.pid = 6, .rss = "8388608", .vsize = "8388608", .dsiz = "8388608"});
    run({huge, largest_kept});
    expect_finding(PROCESS_RSS, 8388608, 0);
    expect_traces(finding_traces(finding::log, 8388608, largest_kept));
    EXPECT_EQ(process_rows(*block),
              (std::vector<row_values>{{5, "worker", 0, 0, 0},
                                       {6, "worker", 8388608, 8388608, 8388608}}));
}

TEST_P(PpMemoryEdge, OfTwoOffendersTheLowerInTheListingIsReported) {
    rss_memory_threshold = 1000;
    const std::string first = ps_line({.pid = 10, .rss = "3000", .vsize = "30000"});
    const std::string second = ps_line({.pid = 20, .rss = "2000", .vsize = "40000"});
    run({second, first});
    expect_finding(PROCESS_RSS, 2000, 0);
    expect_traces(joined(
        {finding_traces(finding::log, 30000, first), finding_traces(finding::log, 40000, second)}));
    EXPECT_EQ(top_text(), top_text_for(finding::log, second));
}

TEST_P(PpMemoryEdge, LogOffenderAfterAnAbortOffenderLeavesTheFirstPidToKill) {
    rss_memory_threshold = 1000;
    rss_abort_memory_threshold = 5000;
    const std::string first = ps_line({.pid = 10, .rss = "6000", .vsize = "30000"});
    const std::string second = ps_line({.pid = 20, .rss = "2000", .vsize = "40000"});
    run({second, first});
    expect_finding(PROCESS_RSS, 2000, 10);
    expect_traces(joined({finding_traces(finding::abort, 30000, first),
                          finding_traces(finding::log, 40000, second)}));
    EXPECT_EQ(top_text(), top_text_for(finding::log, second));
}

TEST_P(PpMemoryEdge, HundredAndOneLinesUnderAThresholdOfHundredAreNotReported) {
    num_threads_threshold = 100;
    run(many_processes(101, 1000, 5000));
    if (by_handler()) {
        EXPECT_EQ(pass.line_count, 101);
    }
    expect_finding(0, 0, 0);
    expect_traces({});
    EXPECT_EQ(process_rows(*block).size(), 101u);
}

TEST_P(PpMemoryEdge, HundredAndTwoLinesUnderAThresholdOfHundredAreReported) {
    num_threads_threshold = 100;
    run(many_processes(102, 1000, 5000));
    if (by_handler()) {
        // The line handler counts; the check judges the count once the listing is read.
        EXPECT_EQ(pass.line_count, 102);
        expect_finding(0, 0, 0);
    } else {
        expect_finding(TOO_MANY_PROCESSES, 102, 0);
    }
    expect_traces({}, thread_finding_traces(102));
    EXPECT_EQ(top_text(), "");
}

TEST_P(PpMemoryEdge, OverrideEntryOfAPidNotListedIsRemovedInTheSamePass) {
    set_override(4, 500, {0, 0, 0, 0, 0, 0});
    set_override(9, 900, {5, 6, 7, 8, 9, 10});
    run({ps_line({.pid = 500, .rss = "100"})});
    const override_entry &listed_entry = block->override_table[4];
    const override_entry &gone_entry = block->override_table[9];
    EXPECT_EQ(listed_entry.pid, 500u);
    EXPECT_EQ(listed_entry.in_use, 1u);
    EXPECT_EQ(listed_entry.seen, 1u);
    if (by_handler()) {
        // The handler marks what it saw; the sweep after the listing removes the rest.
        EXPECT_EQ(gone_entry.in_use, 1u);
        EXPECT_EQ(gone_entry.seen, 0u);
    } else {
        const override_entry zero{};
        EXPECT_EQ(std::memcmp(&gone_entry, &zero, sizeof zero), 0);
    }
    expect_traces({}, {went_away(900)});
}

// ---- The whole check through the real runner, with a fake ps first on PATH ----

TEST_F(PpMemory, EmptyListingCountsNoThreadsAndLeavesAnEmptyProcessTable) {
    std::memset(block->process_table, 0xAB, sizeof block->process_table);
    takeLogCrc = EARLIER_FINDING; // a finding of an earlier check of the pass stays
    killPid = 99;
    EXPECT_EQ(check_with_ps({}), 0u);
    EXPECT_EQ(summarised_traces(), check_traces({}, 0));
    EXPECT_EQ(takeLogCrc, EARLIER_FINDING);
    EXPECT_EQ(killPid, 0);
    EXPECT_TRUE(process_rows(*block).empty());
    EXPECT_EQ(block_text(), PS_HEADER);
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET + PS_HEADER_LENGTH);
    EXPECT_EQ(pdboverflow, 0);
}

TEST_F(PpMemory, PsThatExitsNonZeroIsReadAllTheSame) {
    rss_memory_threshold = 1000;
    const std::string offender = ps_line({.pid = 12, .rss = "1500"});
    const std::string quiet = ps_line({.pid = 13, .rss = "900"});
    EXPECT_EQ(check_with_ps({quiet, offender}, 3), 0u);
    EXPECT_EQ(summarised_traces(), check_traces(finding_traces(finding::log, 20000, offender), 2));
    EXPECT_EQ(takeLogCrc, PROCESS_RSS);
    EXPECT_EQ(takeLogValue, 1500);
    EXPECT_EQ(block_text(), std::string(PS_HEADER) + offender + "\n\r" + quiet + "\n\r");
}

std::string real_sort() {
    return std::filesystem::exists("/usr/bin/sort") ? "/usr/bin/sort" : "/bin/sort";
}

// LC_ALL=C while it lives, so that bash says its messages untranslated.
class c_locale {
  public:
    c_locale() {
        const char *value = std::getenv("LC_ALL");
        had_ = value != nullptr;
        saved_ = had_ ? value : "";
        setenv("LC_ALL", "C", 1);
    }
    ~c_locale() {
        if (had_) {
            setenv("LC_ALL", saved_.c_str(), 1);
        } else {
            unsetenv("LC_ALL");
        }
    }
    c_locale(const c_locale &) = delete;
    c_locale &operator=(const c_locale &) = delete;

  private:
    std::string saved_;
    bool had_;
};

TEST_F(PpMemory, PsMissingFromPathLeavesBashsOwnErrorAndTheCheckGoesOn) {
    c_locale untranslated;
    fake_commands alone(fake_commands::path_mode::only);
    alone.add_forwarding("sort", real_sort());
    set_override(0, 77, {1, 0, 0, 0, 0, 0});
    fake::captured_stderr errors;
    EXPECT_EQ(check(), 0u);
    EXPECT_NE(errors.text().find("ps: command not found"), std::string::npos);
    EXPECT_EQ(summarised_traces(), check_traces({}, 0, {went_away(77)}));
    EXPECT_EQ(block->override_table[0].in_use, 0u);
    EXPECT_EQ(takeLogCrc, 0);
}

TEST_F(PpMemory, ShellThatCannotBeStartedIsTracedAndTheCheckGoesOnWithNoLines) {
    command_shell = "/nonexistent/bash";
    set_override(0, 77, {1, 0, 0, 0, 0, 0});
    append_unbudgeted("  PID earlier output\n\r");
    fake::unrelated_child other;
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(summarised_traces(),
              joined({{CHECK_ENTRY, "<lock(1) == 0>", "TARNMNDD: got access to override table",
                       "TARNMNDF: rc from ps execvp call is: -1; errno=2.", thread_count_trace(0),
                       went_away(77), "<lock(0) == 0>", CHECK_EXIT}}));
    EXPECT_EQ(block->override_table[0].in_use, 0u);
    // The listing is still copied, as after a ps that printed nothing.
    EXPECT_EQ(ps_block_text(), std::string("  PID earlier output\n\r") + PS_HEADER);
    EXPECT_TRUE(other.still_to_reap());
}

TEST_F(PpMemory, PipeThatCannotBeMadeSkipsTheListingButNotTheSweep) {
    append_unbudgeted("  PID of the last pass\n\r");
    ASSERT_EQ(check_with_ps({}), 0u);
    const std::string last_listing = ps_block_text();
    start_pass();
    set_override(0, 77, {1, 0, 0, 0, 0, 0});
    fakes.add("ps", "#!/bin/sh\ntouch \"$0.ran\"\n");

    std::string report = fake::run_without_descriptors([this] {
        rec::clear_traces();
        std::string text = std::to_string(check()) + "\n";
        for (const std::string &trace : summarised_traces()) {
            text += trace + "\n";
        }
        return text + block_text() + "\n" + ps_block_text();
    });

    EXPECT_EQ(report, "0\n" + CHECK_ENTRY + "\n<lock(1) == 0>\n" +
                          "TARNMNDD: got access to override table\n" +
                          "TARNMNDF: rc from ps pipe call is: -1; errno=24.\n" + went_away(77) +
                          "\n<lock(0) == 0>\n" + CHECK_EXIT + "\n" + PS_HEADER + "\n" +
                          last_listing);
    // The sweep happened in the shared block.
    EXPECT_EQ(block->override_table[0].in_use, 0u);
    EXPECT_FALSE(std::filesystem::exists(fakes.path_of("ps") + ".ran"));
}

TEST_F(PpMemory, LockNotObtainedDoesNothingAndReturnsZero) {
    int gone = semget(IPC_PRIVATE, 1, 0600);
    ASSERT_NE(gone, -1);
    semctl(gone, 0, IPC_RMID);
    const int32_t real_lock = block->uBufferLock;
    block->uBufferLock = gone;
    fakes.add("ps", "#!/bin/sh\ntouch \"$0.ran\"\n");
    set_override(0, 77, {1, 0, 0, 0, 0, 0});
    block->override_table[0].seen = 1;
    block->process_table[0] = process_row{1, 4242, "earlier", {}, 1, 1, 2, 3};
    append_unbudgeted("earlier output");
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 5;
    killPid = 99;

    EXPECT_EQ(check(), 0u);
    block->uBufferLock = real_lock;

    EXPECT_EQ(summarised_traces(), (lines{CHECK_ENTRY, "<lock(1) == -1>", CHECK_EXIT}));
    EXPECT_EQ(killPid, 0);
    EXPECT_EQ(takeLogCrc, EARLIER_FINDING);
    EXPECT_EQ(takeLogValue, 5);
    EXPECT_EQ(block->override_table[0].in_use, 1u);
    EXPECT_EQ(block->override_table[0].seen, 1u);
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{4242, "earlier", 1, 2, 3}}));
    EXPECT_EQ(block_text(), "earlier output");
    EXPECT_FALSE(std::filesystem::exists(fakes.path_of("ps") + ".ran"));
}

TEST_F(PpMemory, ProcessTableStopsAtThreeThousandRowsAndNothingIsWrittenPastIt) {
    block->analysisIndex = 0x11111111;
    block->sleepTimeExceeded = 0x22222222;
    block->numLoopsBeforeCPUChecking = 0x33333333;
    block->maxSleepTime = 0x44444444;
    block->sleep_time_percent = 0x55555555;
    block->terminateRequest = 0x66666666;
    block->logAsInfo = 0x77777777;
    const lines listing = many_processes(3001, 10000, 500000);
    EXPECT_EQ(check_with_ps(out_of_order(listing)), 0u);
    EXPECT_EQ(summarised_traces(), check_traces({}, 3001));

    std::vector<row_values> rows = process_rows(*block);
    ASSERT_EQ(rows.size(), 3000u);
    EXPECT_EQ(rows.front(), (row_values{10000, "proc0", 500000, 3000, 20000}));
    EXPECT_EQ(rows.back(), (row_values{12999, "proc2999", 497001, 3000, 20000}));
    EXPECT_EQ(block->analysisIndex, 0x11111111);
    EXPECT_EQ(block->sleepTimeExceeded, 0x22222222u);
    EXPECT_EQ(block->numLoopsBeforeCPUChecking, 0x33333333);
    EXPECT_EQ(block->tookLog, 0u);
    EXPECT_EQ(block->maxSleepTime, 0x44444444);
    EXPECT_EQ(block->sleep_time_percent, 0x55555555);
    EXPECT_EQ(block->terminateRequest, 0x66666666u);
    EXPECT_EQ(block->logAsInfo, 0x77777777u);
}

TEST_F(PpMemory, NameOfMoreThan249CharactersIsCutInTheRowAndInMatching) {
    load_tables("PROCESS_LOG_THRESHOLDS 100 0 0 0 ^n*$\n");
    const std::string name(260, 'n');
    const std::string line = ps_line({.pid = 31, .rss = "150", .name = name});
    EXPECT_EQ(check_with_ps({line}), 0u);
    const std::string cut(249, 'n');
    EXPECT_EQ(summarised_traces(), check_traces(joined({log_match_traces(cut, "^n*$", 100, 0, 0),
                                                        finding_traces(finding::log, 20000, line)}),
                                                1));
    EXPECT_EQ(top_text(), top_text_for(finding::log, line));
    EXPECT_EQ(block_text(), std::string(PS_HEADER) + line + "\n\r");
    const process_row &row = block->process_table[0];
    EXPECT_EQ(std::string(row.process_name, 249), cut);
    EXPECT_EQ(row.process_name[249], '\0');
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{31, cut, 150, 3000, 20000}}));
}

TEST_F(PpMemory, NameWithABlankKeepsOnlyItsFirstPartAndPushesItsSecondIntoTheTimeColumn) {
    // The sizes stand before the name, so they are read right; the name is its first word.
    load_tables("PROCESS_LOG_THRESHOLDS 1 0 0 0 Content\n"
                "PROCESS_LOG_THRESHOLDS 500 0 0 0 ^Web$\n");
    const std::string line =
        ps_line({.pid = 60, .rss = "900", .vsize = "70000", .dsiz = "4000", .name = "Web Content"});
    EXPECT_EQ(check_with_ps({line}), 0u);
    EXPECT_EQ(summarised_traces(), check_traces(joined({log_match_traces("Web", "^Web$", 500, 0, 0),
                                                        finding_traces(finding::log, 70000, line)}),
                                                1));
    EXPECT_EQ(takeLogCrc, PROCESS_RSS);
    EXPECT_EQ(takeLogValue, 900);
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{60, "Web", 900, 4000, 70000}}));
}

TEST_F(PpMemory, ElevenDigitSizeReadsAsTheLargest32BitNumberThenFallsToTheGuard) {
    rss_memory_threshold = 1000;
    const std::string line = ps_line({.pid = 70, .rss = "1500", .vsize = "12345678901"});
    EXPECT_EQ(check_with_ps({line}), 0u);
    // Beyond the guard, so 0, and traced as such in the place of rss.
    EXPECT_EQ(summarised_traces(), check_traces(finding_traces(finding::log, 0, line), 1));
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{70, "worker", 1500, 3000, 0}}));
}

TEST_F(PpMemory, ElevenDigitSizesStandWhileTookLogIsSet) {
    rss_memory_threshold = 1000;
    block->tookLog = 1;
    const std::string line =
        ps_line({.pid = 71, .rss = "99999999999", .vsize = "12345678901", .dsiz = "-99999999999"});
    EXPECT_EQ(check_with_ps({line}), 0u);
    EXPECT_EQ(summarised_traces(), check_traces({}, 1));
    EXPECT_EQ(takeLogCrc, SUPPRESSED);
    EXPECT_EQ(process_rows(*block),
              (std::vector<row_values>{{71, "worker", 2147483647u, 2147483648u, 2147483647u}}));
}

// What the output-block rule lets into primaryDataBlock of `listing` after the check's header.
std::string primary_text_of(const lines &listing) {
    std::string text = PS_HEADER;
    int64_t left = OUTBUFFER_BUDGET + PS_HEADER_LENGTH;
    for (const std::string &line : listing) {
        auto length = static_cast<int64_t>(line.size());
        if (length + 5 >= left) {
            return text + OVERFLOW_LINE;
        }
        text += line + "\n\r";
        left -= length + 3;
    }
    return text;
}

size_t occurrences(const std::string &text, const std::string &part) {
    size_t count = 0;
    for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) {
        ++count;
    }
    return count;
}

TEST_F(PpMemory, ListingLongerThanThePrimaryBlockOverflowsOnceAndEveryLineIsJudged) {
    load_tables("PROCESS_LOG_THRESHOLDS 5 0 0 0 ^late$\n");
    lines listing = many_processes(30000, 100000, 300000);
    const std::string late = ps_line({.pid = 99, .rss = "10", .name = "late"});
    listing.push_back(late);
    EXPECT_EQ(check_with_ps(out_of_order(listing)), 0u);

    EXPECT_EQ(summarised_traces(), check_traces(joined({log_match_traces("late", "^late$", 5, 0, 0),
                                                        finding_traces(finding::log, 20000, late)}),
                                                30001));
    EXPECT_EQ(takeLogCrc, PROCESS_RSS);
    EXPECT_EQ(takeLogValue, 10);
    EXPECT_EQ(top_text(), top_text_for(finding::log, late));
    const std::string text = block_text();
    EXPECT_EQ(occurrences(text, OVERFLOW_LINE), 1u);
    EXPECT_TRUE(text == primary_text_of(listing)) << "primaryDataBlock differs";
    EXPECT_EQ(outbufferleft, 4);
    EXPECT_EQ(pdboverflow, 1);
    EXPECT_EQ(process_rows(*block).size(), 3000u);
}

TEST_F(PpMemory, PidOnTwoConsecutiveLinesTakesOneRow) {
    const lines listing = ps_lines({{.pid = 40, .rss = "700", .name = "first"},
                                    {.pid = 40, .rss = "690", .name = "second", .tid = 41},
                                    {.pid = 50, .rss = "100"}});
    EXPECT_EQ(check_with_ps(out_of_order(listing)), 0u);
    EXPECT_EQ(summarised_traces(), check_traces({}, 3));
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{40, "first", 700, 3000, 20000},
                                                             {50, "worker", 100, 3000, 20000}}));
}

TEST_F(PpMemory, PidOnTwoLinesApartTakesTwoRows) {
    const lines listing = ps_lines({{.pid = 40, .rss = "700", .name = "first"},
                                    {.pid = 50, .rss = "695"},
                                    {.pid = 40, .rss = "690", .name = "second", .tid = 41}});
    EXPECT_EQ(check_with_ps(out_of_order(listing)), 0u);
    EXPECT_EQ(process_rows(*block), (std::vector<row_values>{{40, "first", 700, 3000, 20000},
                                                             {50, "worker", 695, 3000, 20000},
                                                             {40, "second", 690, 3000, 20000}}));
}

TEST_F(PpMemory, ThreadCountFindingReplacesALineFindingButNotItsText) {
    num_threads_threshold = 100;
    rss_memory_threshold = 1000;
    rss_abort_memory_threshold = 2000;
    lines listing = many_processes(101, 1000, 900);
    const std::string offender = ps_line({.pid = 8, .rss = "3000"});
    listing.push_back(offender);
    EXPECT_EQ(check_with_ps(out_of_order(listing)), 0u);
    EXPECT_EQ(summarised_traces(), check_traces(finding_traces(finding::abort, 20000, offender),
                                                102, thread_finding_traces(102)));
    EXPECT_EQ(takeLogCrc, TOO_MANY_PROCESSES);
    EXPECT_EQ(takeLogValue, 102);
    EXPECT_EQ(killPid, 8);
    EXPECT_EQ(top_text(), top_text_for(finding::abort, offender));
}

TEST_F(PpMemory, ThreadCountFindingWhileTookLogIsSetLeavesOnlyTheMarker) {
    num_threads_threshold = 100;
    block->tookLog = 1;
    takeLogValue = 5;
    EXPECT_EQ(check_with_ps(many_processes(102, 1000, 900)), 0u);
    EXPECT_EQ(summarised_traces(), check_traces({}, 102));
    EXPECT_EQ(takeLogCrc, SUPPRESSED);
    EXPECT_EQ(takeLogValue, 5);
}

// ---- The tables ----

TEST_F(PpMemory, LogTableIsAskedForItsGroupsAndTheAbortTableForOneMore) {
    load_tables("PROCESS_LOG_THRESHOLDS 10 0 0 0 \\(a\\)\\(b\\)\n"
                "PROCESS_ABORT_THRESHOLDS 20 0 0 \\(a\\)\\(b\\)\n"
                "PROCESS_LOG_THRESHOLDS 30 0 0 0 ^x$\n"
                "PROCESS_ABORT_THRESHOLDS 40 0 0 ^x$\n");
    ASSERT_EQ(logtable[0].expression.re_nsub, 2u);
    ASSERT_EQ(aborttable[0].expression.re_nsub, 2u);
    process_name_matcher = recording_matcher;
    const std::string line = ps_line({.pid = 3, .rss = "15", .name = "ab"});
    judge_lines({line, ps_line({.pid = 4, .rss = "14", .name = "x"})});
    EXPECT_EQ(matcher_calls, (std::vector<matcher_call>{
                                 {&logtable[0].expression, "ab", 2},
                                 {&aborttable[0].expression, "ab", 3},
                                 {&logtable[0].expression, "x", 2},
                                 {&logtable[1].expression, "x", 0},
                                 {&aborttable[0].expression, "x", 3},
                                 {&aborttable[1].expression, "x", 1},
                             }));
    EXPECT_EQ(rec::traces(), joined({log_match_traces("ab", "\\(a\\)\\(b\\)", 10, 0, 0),
                                     abort_match_traces("ab", "\\(a\\)\\(b\\)", 20, 0, 0),
                                     finding_traces(finding::log, 20000, line),
                                     log_match_traces("x", "^x$", 30, 0, 0),
                                     abort_match_traces("x", "^x$", 40, 0, 0)}));
    EXPECT_EQ(takeLogCrc, PROCESS_RSS);
    EXPECT_EQ(takeLogValue, 15);
}

TEST_F(PpMemory, ExpressionWithTwoGroupsMatchesWithinTheMatchArray) {
    // Under AddressSanitizer regexec's writes of both groups are checked against the array.
    load_tables("PROCESS_LOG_THRESHOLDS 10 0 0 0 \\(a\\)\\(b\\)\n"
                "PROCESS_ABORT_THRESHOLDS 12 0 0 \\(a\\)\\(b\\)\\(c*\\)\n");
    const std::string line = ps_line({.pid = 3, .rss = "15", .name = "ab"});
    judge_lines({line});
    EXPECT_EQ(takeLogCrc, PROCESS_RSS_ABORT);
    EXPECT_EQ(killPid, 3);
    EXPECT_EQ(rec::traces(), joined({log_match_traces("ab", "\\(a\\)\\(b\\)", 10, 0, 0),
                                     abort_match_traces("ab", "\\(a\\)\\(b\\)\\(c*\\)", 12, 0, 0),
                                     finding_traces(finding::abort, 20000, line)}));
}

TEST_F(PpMemory, LowestMatchingRowWinsAndTheTablesAreSearchedApart) {
    load_tables("PROCESS_LOG_THRESHOLDS 100 0 0 0 ^db$\n"
                "PROCESS_LOG_THRESHOLDS 50 0 0 0 d\n"
                "PROCESS_ABORT_THRESHOLDS 60 0 0 x\n");
    rss_abort_memory_threshold = 2000;
    process_name_matcher = recording_matcher;
    // 80 is above the second row's 50 but not the first's 100; the abort limit stays the default.
    judge_lines({ps_line({.pid = 3, .rss = "80", .name = "db"})});
    EXPECT_EQ(rec::traces(), log_match_traces("db", "^db$", 100, 0, 0));
    EXPECT_EQ(matcher_calls, (std::vector<matcher_call>{{&logtable[0].expression, "db", 0},
                                                        {&aborttable[0].expression, "db", 1}}));
    EXPECT_EQ(takeLogCrc, 0);
}

TEST_F(PpMemory, RowTakesPartOnlyWhenItsCompiledFlagIsExactlyOne) {
    load_tables("PROCESS_LOG_THRESHOLDS 1 0 0 0 ^db$\n"
                "PROCESS_LOG_THRESHOLDS 500 0 0 0 ^d\n"
                "PROCESS_LOG_THRESHOLDS 2 0 0 0 [bad\n");
    logtable[0].compiled = 2;
    ASSERT_EQ(num_log_thresholds, 3);
    ASSERT_EQ(logtable[2].compiled, 0u); // the row left unfilled by the expression that failed
    process_name_matcher = recording_matcher;
    rss_memory_threshold = 1;
    judge_lines({ps_line({.pid = 3, .rss = "400", .name = "db"})});
    EXPECT_EQ(matcher_calls, (std::vector<matcher_call>{{&logtable[1].expression, "db", 0}}));
    EXPECT_EQ(rec::traces(), log_match_traces("db", "^d", 500, 0, 0));
    EXPECT_EQ(takeLogCrc, 0);
    logtable[0].compiled = 1; // so that its expression is given back
}

TEST_F(PpMemory, CountedRowsWithoutATableAreSkipped) {
    num_log_thresholds = 3;
    num_abort_thresholds = 3;
    ASSERT_EQ(logtable, nullptr);
    ASSERT_EQ(aborttable, nullptr);
    rss_memory_threshold = 10;
    const std::string line = ps_line({.pid = 3, .rss = "11"});
    judge_lines({line});
    EXPECT_EQ(rec::traces(), finding_traces(finding::log, 20000, line));
}

// ---- The override index ----

TEST_F(PpMemory, OfTwoEntriesOfOnePidTheLowestServesAndTheOtherIsSwept) {
    rss_memory_threshold = 100000;
    set_override(7, 500, {50000, 0, 0, 0, 0, 0});
    set_override(3, 500, {100, 0, 0, 0, 0, 0});
    // Not in use (in-use flag other than 1): neither found nor swept.
    set_override(0, 500, {1, 0, 0, 0, 0, 0}, 2);
    const std::string line = ps_line({.pid = 500, .rss = "1000"});
    EXPECT_EQ(check_with_ps({line}), 0u);
    EXPECT_EQ(summarised_traces(),
              check_traces(finding_traces(finding::log, 20000, line), 1, {went_away(500)}));
    EXPECT_EQ(takeLogValue, 1000);
    EXPECT_EQ(block->override_table[3].in_use, 1u);
    EXPECT_EQ(block->override_table[3].seen, 1u);
    EXPECT_EQ(block->override_table[7].in_use, 0u);
    EXPECT_EQ(block->override_table[7].pid, 0u);
    EXPECT_EQ(block->override_table[0].in_use, 2u);
    EXPECT_EQ(block->override_table[0].pid, 500u);
}

TEST_F(PpMemory, SeenFlagsOfTheLastPassAreClearedFirst) {
    set_override(1, 600, {0, 0, 0, 0, 0, 0});
    block->override_table[1].seen = 1;
    EXPECT_EQ(check_with_ps({ps_line({.pid = 601, .rss = "10"})}), 0u);
    EXPECT_EQ(summarised_traces(), check_traces({}, 1, {went_away(600)}));
    EXPECT_EQ(block->override_table[1].in_use, 0u);
}

TEST_F(PpMemory, IndexAnswersAsTheWalkForManyEntries) {
    // Every other pid of a full table has an entry, some of them twice; the handler must find the
    // lowest entry of each, as the walk from entry 0 does.
    for (int i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        auto pid = static_cast<uint32_t>(1000 + (i % 2500) * 2);
        set_override(i, pid, {static_cast<uint32_t>(i + 1), 0, 0, 0, 0, 0});
    }
    rss_memory_threshold = 1;
    lines listing;
    for (int pid = 999; pid < 6100; pid += 7) {
        listing.push_back(ps_line({.pid = pid, .rss = "100000000"}));
    }
    block->tookLog = 1; // keep the huge rss, and the traces out
    judge_lines(listing);
    for (int i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        const override_entry &entry = block->override_table[i];
        bool listed = (entry.pid - 999) % 7 == 0 && entry.pid < 6100;
        bool lowest = i < 2500;
        EXPECT_EQ(entry.seen, listed && lowest ? 1u : 0u) << "entry " << i;
    }
}

// ---- The copy of the pass's listing ----

TEST_F(PpMemory, ListingIsCopiedFromTheFirstPidHeadingOn) {
    append_unbudgeted(
        "earlier output\n\r  PID TTY          TIME CMD\n\r    1 ?  00:00:02 init\n\r");
    const lines listing = ps_lines({{.pid = 1, .rss = "500"}, {.pid = 2, .rss = "400"}});
    EXPECT_EQ(check_with_ps(listing), 0u);
    const std::string text = block_text();
    EXPECT_EQ(ps_block_text(), text.substr(text.find("  PID")));
    EXPECT_EQ(ps_block_text(), "  PID TTY          TIME CMD\n\r    1 ?  00:00:02 init\n\r" +
                                   std::string(PS_HEADER) + listing[0] + "\n\r" + listing[1] +
                                   "\n\r");
}

TEST_F(PpMemory, ListingCopyIsEmptyWithoutAPidHeading) {
    append_unbudgeted("  PID of the last pass\n\r");
    ASSERT_EQ(check_with_ps({}), 0u);
    ASSERT_NE(ps_block_text(), "");
    start_pass();
    append_unbudgeted(" PID with one blank only\n\r");
    EXPECT_EQ(check_with_ps({ps_line({.pid = 1, .rss = "500"})}), 0u);
    EXPECT_EQ(ps_block_text(), "");
}

TEST_F(PpMemory, ListingCopyKeepsItsFirst249999Bytes) {
    append_unbudgeted("  PID heading\n\r");
    EXPECT_EQ(check_with_ps(many_processes(5000, 1000, 100000)), 0u);
    const std::string text = block_text();
    ASSERT_GT(text.size(), PS_DATA_BLOCK_SIZE);
    EXPECT_EQ(std::string(newPSDataBlock, PS_DATA_BLOCK_SIZE - 1),
              text.substr(0, PS_DATA_BLOCK_SIZE - 1));
    EXPECT_EQ(newPSDataBlock[PS_DATA_BLOCK_SIZE - 1], '\0');
}

// ---- A process that set its own limits through tarnmon ----

// Starts `argv` with its standard output on a pipe; returns the pid, and the read end in *out.
pid_t start_with_output(const std::vector<std::string> &argv, int *out) {
    int ends[2];
    EXPECT_EQ(pipe2(ends, O_CLOEXEC), 0);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, ends[1], STDOUT_FILENO);
    std::vector<char *> vector;
    for (const std::string &word : argv) {
        vector.push_back(const_cast<char *>(word.c_str()));
    }
    vector.push_back(nullptr);
    pid_t pid = 0;
    EXPECT_EQ(posix_spawn(&pid, vector[0], &actions, nullptr, vector.data(), environ), 0);
    posix_spawn_file_actions_destroy(&actions);
    close(ends[1]);
    *out = ends[0];
    return pid;
}

// The command that tarnmon limits became; ended with the test, whatever its asserts did.
class limited_command {
  public:
    explicit limited_command(const std::vector<std::string> &argv)
        : pid_(start_with_output(argv, &out_)) {}
    ~limited_command() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
        close(out_);
    }
    limited_command(const limited_command &) = delete;
    limited_command &operator=(const limited_command &) = delete;

    pid_t pid() const { return pid_; }
    // The first `length` bytes it printed.
    std::string first_output(size_t length) const {
        std::string text(length, '\0');
        ssize_t got = read(out_, text.data(), length);
        text.resize(got > 0 ? static_cast<size_t>(got) : 0);
        return text;
    }

  private:
    int out_ = -1;
    pid_t pid_;
};

TEST_F(PpMemory, LimitsThatTarnmonSetAreAppliedToTheCommandItRuns) {
    const char *build = std::getenv("TARN_BUILD_DIR");
    ASSERT_NE(build, nullptr);
    limited_command command({std::string(build) + "/tarnmon", "limits", "--rss", "100",
                             "--rss-abort", "500", "--", "/bin/sh", "-c",
                             "echo ready; exec sleep 30"});
    ASSERT_GT(command.pid(), 0);
    ASSERT_EQ(command.first_output(5), "ready");
    auto pid = static_cast<uint32_t>(command.pid());
    const override_entry *entry = nullptr;
    for (const override_entry &candidate : block->override_table) {
        if (candidate.in_use == 1 && candidate.pid == pid) {
            entry = &candidate;
        }
    }
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->rss_limit, 100u);
    EXPECT_EQ(entry->rss_abort_limit, 500u);

    // Without its entry the process would pass: the control file sets no limit.
    std::string line = ps_line({.pid = command.pid(), .rss = "300", .name = "sleep"});
    EXPECT_EQ(check_with_ps({line}), 0u);
    EXPECT_EQ(takeLogCrc, PROCESS_RSS);
    EXPECT_EQ(takeLogValue, 300);
    EXPECT_EQ(killPid, 0);
    EXPECT_EQ(entry->seen, 1u);
    EXPECT_EQ(top_text(), top_text_for(finding::log, line));
}

} // namespace

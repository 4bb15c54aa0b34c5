#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "command_runner.h"
#include "core/control_block.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "memory/system_memory.h"
#include "private_ipc.h"
#include "recording_platform.h"
#include "starved_child.h"
#include "text_lines.h"

namespace {

using fake::fake_commands;
using text::joined;
using text::left_aligned;
using text::lines;
using text::right_aligned;

constexpr char FREE_SECTION[] = "\n\rAbout to output free data \n\r";
constexpr char MEMINFO_SECTION[] = "\n\rAbout to output cat /proc/meminfo \n\r";
// What each section header adds to outbufferleft: the header without the line end before it.
constexpr int32_t FREE_HEADER_LENGTH = 28;
constexpr int32_t MEMINFO_HEADER_LENGTH = 36;
constexpr char OVERFLOW_LINE[] = "No room to output more lines... \n\r";
constexpr uint32_t CRC_GIVEN = 0x1234; // what the tests pass in *crc, which the check only traces

// The values of takeLogCrc the check leaves, as the loop's signed integer holds them.
constexpr int32_t SWAP_TOO_SMALL = RC_SWAP_TOO_SMALL;
constexpr int32_t MEMORY_IN_USE = RC_MEMORY_IN_USE;
constexpr int32_t LOW_FREE = RC_LOW_FREE;
constexpr int32_t SUPPRESSED = TAKE_LOG_SUPPRESSED;
constexpr int32_t EARLIER_FINDING = RC_PROCESS_CPU; // a finding of a check before this one

// ---- What free prints ----

// A row of free: its label, then each number in a column of 12.
std::string free_row(const std::string &label, std::initializer_list<int64_t> numbers) {
    std::string row = left_aligned(label, 8);
    for (int64_t number : numbers) {
        row += right_aligned(std::to_string(number), 12);
    }
    return row;
}

const std::string FREE_HEADER =
    "               total        used        free      shared  buff/cache   available";

// The figures of one run of free, in KB as it prints them. The defaults are a host with 1,000,000
// KB of memory, 850,000 of it in use, and no swap.
struct free_table {
    int64_t total = 1000000;
    int64_t used = 850000;
    int64_t free = 60000;
    int64_t shared = 1000;
    int64_t buff_cache = 90000;
    int64_t available = 100000;
    int64_t swap_total = 0;
    int64_t swap_used = 0;
    int64_t swap_free = 0;
};

std::string mem_line(const free_table &t) {
    return free_row("Mem:", {t.total, t.used, t.free, t.shared, t.buff_cache, t.available});
}

std::string swap_line(const free_table &t) {
    return free_row("Swap:", {t.swap_total, t.swap_used, t.swap_free});
}

lines free_lines(const free_table &t) {
    return {FREE_HEADER, mem_line(t), swap_line(t)};
}

// A host of 1,000,000 KB of memory and no swap with `in_use` KB in use as the check counts it:
// what is neither free nor buffers/cache.
free_table memory_in_use_of(int64_t in_use) {
    free_table t;
    t.buff_cache = 40000;
    t.free = 1000000 - 40000 - in_use;
    t.used = in_use;
    t.available = t.free + t.buff_cache;
    return t;
}

// ---- What /proc/meminfo holds ----

std::string meminfo_row(const std::string &name, int64_t kb) {
    return left_aligned(name + ":", 15) + right_aligned(std::to_string(kb), 9) + " kB";
}

// A meminfo of a host without a split of low and high memory: no LowFree line.
lines plain_meminfo() {
    return {meminfo_row("MemTotal", 1000000), meminfo_row("MemFree", 60000),
            meminfo_row("MemAvailable", 100000), meminfo_row("Buffers", 10000),
            meminfo_row("SwapTotal", 0)};
}

// A meminfo of a host with high memory, whose LowFree is `low_free`.
lines split_meminfo(int64_t low_free) {
    return {meminfo_row("MemTotal", 1000000), meminfo_row("MemFree", 60000),
            meminfo_row("HighTotal", 600000), meminfo_row("HighFree", 20000),
            meminfo_row("LowTotal", 400000),  meminfo_row("LowFree", low_free),
            meminfo_row("SwapTotal", 0)};
}

std::string text_of(const lines &output) {
    std::string text;
    for (const std::string &line : output) {
        text += line + "\n";
    }
    return text;
}

// ---- What the check leaves ----

std::string block_text() {
    return std::string(primaryDataBlock, strnlen(primaryDataBlock, PRIMARY_DATA_BLOCK_SIZE));
}

std::string copied(const lines &output) {
    std::string text;
    for (const std::string &line : output) {
        text += line + "\n\r";
    }
    return text;
}

// primaryDataBlock after a pass whose output fitted: both sections with every line.
std::string block_of(const lines &free_output, const lines &meminfo) {
    return FREE_SECTION + copied(free_output) + MEMINFO_SECTION + copied(meminfo);
}

// What a section's lines take from outbufferleft.
int32_t cost_of(const lines &output) {
    int32_t cost = 0;
    for (const std::string &line : output) {
        cost += static_cast<int32_t>(line.size()) + 3;
    }
    return cost;
}

std::string dec(int64_t value) {
    return std::to_string(value);
}

const std::string CHECK_ENTRY = "TARNOTHF: --> tarn_check_system_memory";
const std::string CHECK_EXIT = "TARNOTHF: <-- tarn_check_system_memory, src = 0, crc = 1234 (hex)";

// Everything the check traces: its entry, `body`, its exit.
lines check_traces(const lines &body) {
    return joined({{CHECK_ENTRY}, body, {CHECK_EXIT}});
}

lines line_traces(const std::string &mem, const std::string &swap) {
    return {"TARNMNDD:  MEM line: [" + mem + "]", "TARNMNDD: swap line: [" + swap + "]"};
}

// The figures as the check has read them, and what it counts as in use.
struct figures {
    int64_t memtotal, memused, memfree, swaptotal, swapused, swapfree, in_use;
};

lines figure_traces(const figures &f) {
    return {"TARNMNDD: memtotal       is " + dec(f.memtotal) + " (dec)",
            "TARNMNDD: memused        is " + dec(f.memused) + " (dec)",
            "TARNMNDD: memfree        is " + dec(f.memfree) + " (dec)",
            "TARNMNDD: swaptotal      is " + dec(f.swaptotal) + " (dec)",
            "TARNMNDD: swapused       is " + dec(f.swapused) + " (dec)",
            "TARNMNDD: swapfree       is " + dec(f.swapfree) + " (dec)",
            "TARNMNDD: total memory in use is " + dec(f.in_use) + " (dec)"};
}

int64_t in_use_of(const free_table &t) {
    return t.total + t.swap_total - (t.buff_cache + t.free + t.swap_free);
}

// The traces of reading a free of the usual three lines, figures within 32 bits.
lines free_traces(const free_table &t) {
    return joined({line_traces(mem_line(t), swap_line(t)),
                   figure_traces({t.total, t.used, t.free, t.swap_total, t.swap_used, t.swap_free,
                                  in_use_of(t)})});
}

const lines NO_FIGURES = figure_traces({0, 0, 0, 0, 0, 0, 0});

std::string percent_trace(int64_t percent) {
    return "TARNMNDD: computed percent is " + dec(percent) + " (dec, scaled by 10)";
}

lines percent_finding_traces(int64_t percent) {
    return {"TARNMNDF: total_memory_percent threshold exceeded",
            "TARNMNDF: computed percent is " + dec(percent) + " (dec, scaled by 10)"};
}

lines swap_finding_traces(int64_t swaptotal) {
    return {"TARNMNDF: total available swap area is too small",
            "TARNMNDF: total available swap area is is " + dec(swaptotal) + " (dec)"};
}

lines in_use_traces(int64_t in_use) {
    return {"TARNMNDF: total_memory_in_use threshold exceeded",
            "TARNMNDF: total computed is " + dec(in_use) + " (dec)"};
}

std::string low_free_trace(int64_t low_free) {
    return "TARNMNDD: LowFree = " + dec(low_free) + " (dec)";
}

lines low_free_finding_traces(int64_t low_free) {
    return {"TARNMNDF: LowFree memory value too small",
            "TARNMNDF: LowFree is " + dec(low_free) + " (dec)"};
}

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream all;
    all << in.rdbuf();
    return all.str();
}

// `text` as one word of a shell script.
std::string shell_word(const std::string &text) {
    std::string word = "'";
    for (char c : text) {
        word += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return word + "'";
}

// The script of a command that prints `text` byte for byte with the shell's own printf. The fake
// cat stands first on PATH, so a fake that ran cat itself would print the meminfo fixture.
std::string printing_script(const std::string &text) {
    return "printf '%s' " + shell_word(text) + "\n";
}

// ---- The fixture ----

// A control block of its own (private IPC namespace), settings under which nothing is found, a
// fresh pass, and a directory of fake commands first on PATH.
class SystemMemory : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        rec::reset();
        reset_settings();
        block = private_ipc::fresh_control_block();
        ASSERT_NE(block, nullptr);
        block->tookLog = 0;
        // Each test raises only the thresholds it is about.
        total_memory_in_use_threshold = INT32_MAX;
        total_memory_percent_threshold = INT32_MAX;
        resume_memory_percent_threshold = 0;
        min_swap_size = 0;
        low_free_size = 0;
        // A short line keeps words of the lines before it: start from empty slots.
        std::memset(words, 0, sizeof words);
        start_pass();
        rec::clear_traces();
    }

    void TearDown() override {
        command_shell = "/bin/bash";
        if (key_is_ours) {
            private_ipc::remove_control_block();
        }
    }

    // What the loop does before the checks of a pass.
    void start_pass() {
        start_pass_data();
        takeLogCrc = 0;
        takeLogValue = 0;
    }

    void fake_free(const std::string &text) {
        fakes.add("free", "#!/bin/sh\n" + printing_script(text));
    }
    void fake_meminfo(const std::string &text) {
        fakes.add("cat", "#!/bin/sh\n" + printing_script(text));
    }

    uint32_t check() {
        crc = CRC_GIVEN;
        return tarn_check_system_memory(&takeLogCrc, &takeLogValue, &block->tookLog,
                                        &memoryPercentLogged, &crc);
    }

    // The check over a fake free and a fake cat that print these lines.
    uint32_t check_with(const lines &free_output, const lines &meminfo = plain_meminfo()) {
        fake_free(text_of(free_output));
        fake_meminfo(text_of(meminfo));
        return check();
    }

    void expect_finding(int32_t code, int32_t value) {
        EXPECT_EQ(takeLogCrc, code);
        EXPECT_EQ(takeLogValue, value);
    }

    bool key_is_ours = false;
    tarn_control_block *block = nullptr;
    fake_commands fakes;
    int32_t takeLogCrc = 0;
    int32_t takeLogValue = 0;
    int32_t memoryPercentLogged = 0;
    uint32_t crc = 0;
};

// ---- The memory-percent finding ----

TEST_F(SystemMemory, PercentAtTheThresholdIsReported) {
    total_memory_percent_threshold = 900;
    const free_table t = memory_in_use_of(900000);
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(MEMORY_IN_USE, 900);
    EXPECT_EQ(memoryPercentLogged, 1);
    EXPECT_EQ(block->tookLog, 0u);
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({free_traces(t), {percent_trace(900)}, percent_finding_traces(900)})));
}

TEST_F(SystemMemory, PercentIsTruncatedNotRounded) {
    // 1000 x 899,990 / 1,000,000 = 899.99
    const free_table t = memory_in_use_of(899990);
    total_memory_percent_threshold = 900;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(899)}})));

    start_pass();
    rec::clear_traces();
    total_memory_percent_threshold = 899;
    EXPECT_EQ(check(), 0u);
    expect_finding(MEMORY_IN_USE, 899);
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({free_traces(t), {percent_trace(899)}, percent_finding_traces(899)})));
}

TEST_F(SystemMemory, PercentCountsSwapWithMemory) {
    // 1000 x (1,000,000 + 500,000 - (90,000 + 60,000 + 300,000)) / 1,500,000 = 700
    free_table t;
    t.swap_total = 500000;
    t.swap_used = 200000;
    t.swap_free = 300000;
    total_memory_percent_threshold = 700;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(MEMORY_IN_USE, 700);
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({free_traces(t), {percent_trace(700)}, percent_finding_traces(700)})));
}

// ---- Releasing tookLog once usage has fallen ----

class SystemMemoryAfterAShortage : public SystemMemory {
  protected:
    void SetUp() override {
        SystemMemory::SetUp();
        if (IsSkipped() || HasFatalFailure()) {
            return;
        }
        total_memory_percent_threshold = 900;
        resume_memory_percent_threshold = 800;
        block->tookLog = 1;
        memoryPercentLogged = 1;
    }
};

TEST_F(SystemMemoryAfterAShortage, UsageAtTheResumePercentKeepsTookLog) {
    const free_table t = memory_in_use_of(800000);
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    EXPECT_EQ(block->tookLog, 1u);
    EXPECT_EQ(memoryPercentLogged, 1);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(800)}})));
}

TEST_F(SystemMemoryAfterAShortage, UsageBelowTheResumePercentReleasesTookLog) {
    // 799.999, which must not round up to the resume percentage.
    const free_table t = memory_in_use_of(799999);
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    EXPECT_EQ(block->tookLog, 0u);
    EXPECT_EQ(memoryPercentLogged, 0);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(799)}})));
}

TEST_F(SystemMemoryAfterAShortage, ShortageThatLastsIsOnlyMarked) {
    takeLogValue = 4321;
    const free_table t = memory_in_use_of(950000);
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(SUPPRESSED, 4321);
    EXPECT_EQ(block->tookLog, 1u);
    EXPECT_EQ(memoryPercentLogged, 1);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(950)}})));
}

TEST_F(SystemMemoryAfterAShortage, TheReleaseFollowsThePercentTestInTheSameCall) {
    // A resume percentage above the threshold: 950 is both a shortage and under it.
    resume_memory_percent_threshold = 1000;
    const free_table t = memory_in_use_of(950000);
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    // Still held back when tested, released afterwards.
    expect_finding(SUPPRESSED, 0);
    EXPECT_EQ(block->tookLog, 0u);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(950)}})));

    // Not held back: reported, and the flag it set is taken back at once.
    start_pass();
    rec::clear_traces();
    EXPECT_EQ(check(), 0u);
    expect_finding(MEMORY_IN_USE, 950);
    EXPECT_EQ(block->tookLog, 0u);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({free_traces(t), {percent_trace(950)}, percent_finding_traces(950)})));
}

TEST_F(SystemMemoryAfterAShortage, LowUsageLeavesTookLogOfAnotherFindingAlone) {
    memoryPercentLogged = 0; // the event held back was not a memory shortage
    const free_table t = memory_in_use_of(100000);
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    EXPECT_EQ(block->tookLog, 1u);
    EXPECT_EQ(memoryPercentLogged, 0);
    expect_finding(0, 0);
}

// ---- The swap and LowFree findings ----

TEST_F(SystemMemory, SwapEqualToTheMinimumIsNotReported) {
    min_swap_size = 2000;
    free_table t;
    t.swap_total = 2000;
    t.swap_free = 2000;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(0, 0);
    // 850,000 in use of 1,002,000: 848.3
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(848)}})));
}

TEST_F(SystemMemory, SwapOneBelowTheMinimumIsReported) {
    min_swap_size = 2000;
    free_table t;
    t.swap_total = 1999;
    t.swap_free = 1999;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(SWAP_TOO_SMALL, 1999);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({free_traces(t), swap_finding_traces(1999), {percent_trace(848)}})));
}

TEST_F(SystemMemory, LowFreeEqualToTheMinimumIsNotReported) {
    low_free_size = 5000;
    const free_table t;
    EXPECT_EQ(check_with(free_lines(t), split_meminfo(5000)), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(),
              check_traces(joined({free_traces(t), {percent_trace(850), low_free_trace(5000)}})));
}

TEST_F(SystemMemory, LowFreeOneBelowTheMinimumIsReported) {
    low_free_size = 5000;
    const free_table t;
    EXPECT_EQ(check_with(free_lines(t), split_meminfo(4999)), 0u);
    expect_finding(LOW_FREE, 4999);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t),
                                                  {percent_trace(850), low_free_trace(4999)},
                                                  low_free_finding_traces(4999)})));
}

TEST_F(SystemMemory, MeminfoWithoutLowFreeHasNoLowFreeTest) {
    low_free_size = INT32_MAX;
    const free_table t;
    EXPECT_EQ(check_with(free_lines(t), plain_meminfo()), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(850)}})));
}

TEST_F(SystemMemory, OnlyTheExactNameLowFreeCounts) {
    low_free_size = INT32_MAX;
    const free_table t;
    const lines meminfo = {"LowFree 5 kB", "lowfree: 5 kB", "LowFree:: 5 kB", " XLowFree: 5 kB"};
    EXPECT_EQ(check_with(free_lines(t), meminfo), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(850)}})));
}

TEST_F(SystemMemory, LowFreeWithoutANumberReadsTheWordOfTheLineBefore) {
    low_free_size = 124;
    const free_table t;
    const lines meminfo = {"LowTotal: 123 kB", "LowFree:"};
    EXPECT_EQ(check_with(free_lines(t), meminfo), 0u);
    expect_finding(LOW_FREE, 123);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t),
                                                  {percent_trace(850), low_free_trace(123)},
                                                  low_free_finding_traces(123)})));
    EXPECT_EQ(block_text(), block_of(free_lines(t), meminfo));
}

TEST_F(SystemMemory, BlankLineAfterLowFreeJudgesLowFreeAgain) {
    // A line without words leaves "LowFree:" and its number in the word slots.
    low_free_size = 5000;
    const free_table t;
    const lines meminfo = {meminfo_row("LowFree", 4000), "", meminfo_row("SwapTotal", 0)};
    EXPECT_EQ(check_with(free_lines(t), meminfo), 0u);
    expect_finding(LOW_FREE, 4000);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t),
                                                  {percent_trace(850), low_free_trace(4000)},
                                                  low_free_finding_traces(4000),
                                                  {low_free_trace(4000)},
                                                  low_free_finding_traces(4000)})));
}

// ---- Several findings in one call ----

// Swap of 100 KB, 900,000 KB in use of 1,000,100: 899.91 percent.
free_table short_of_everything() {
    free_table t = memory_in_use_of(900000);
    t.swap_total = 100;
    t.swap_free = 100;
    return t;
}

TEST_F(SystemMemory, LowFreeWinsOverPercentAndSwap) {
    min_swap_size = 200;
    total_memory_percent_threshold = 800;
    low_free_size = 10;
    const free_table t = short_of_everything();
    EXPECT_EQ(check_with(free_lines(t), split_meminfo(5)), 0u);
    expect_finding(LOW_FREE, 5);
    EXPECT_EQ(memoryPercentLogged, 1);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t),
                                                  swap_finding_traces(100),
                                                  {percent_trace(899)},
                                                  percent_finding_traces(899),
                                                  {low_free_trace(5)},
                                                  low_free_finding_traces(5)})));
}

TEST_F(SystemMemory, PercentWinsOverSwap) {
    min_swap_size = 200;
    total_memory_percent_threshold = 800;
    const free_table t = short_of_everything();
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(MEMORY_IN_USE, 899);
    EXPECT_EQ(memoryPercentLogged, 1);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t),
                                                  swap_finding_traces(100),
                                                  {percent_trace(899)},
                                                  percent_finding_traces(899)})));
}

TEST_F(SystemMemory, MemoryInUseAboveItsThresholdIsATraceAndNoFinding) {
    const free_table t = memory_in_use_of(900000);
    total_memory_in_use_threshold = 899999;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(rec::traces(),
              check_traces(joined({free_traces(t), in_use_traces(900000), {percent_trace(900)}})));

    // At the threshold: not even the trace.
    start_pass();
    rec::clear_traces();
    total_memory_in_use_threshold = 900000;
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(900)}})));
}

TEST_F(SystemMemory, EveryFindingWhileTookLogIsSetIsOnlyMarked) {
    min_swap_size = 200;
    total_memory_percent_threshold = 800;
    low_free_size = 10;
    block->tookLog = 1;
    takeLogValue = 4321;
    const free_table t = short_of_everything();
    EXPECT_EQ(check_with(free_lines(t), split_meminfo(5)), 0u);
    expect_finding(SUPPRESSED, 4321);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(block->tookLog, 1u);
    EXPECT_EQ(rec::traces(),
              check_traces(joined({free_traces(t), {percent_trace(899), low_free_trace(5)}})));
}

TEST_F(SystemMemory, EachFindingAloneWhileTookLogIsSetIsOnlyMarked) {
    block->tookLog = 1;
    const free_table t = short_of_everything();
    struct one_finding {
        const char *name;
        int32_t *threshold;
        int32_t value;
        lines meminfo;
    };
    for (const one_finding &f :
         {one_finding{"swap", &min_swap_size, 200, plain_meminfo()},
          one_finding{"percent", &total_memory_percent_threshold, 800, plain_meminfo()},
          one_finding{"LowFree", &low_free_size, 10, split_meminfo(5)}}) {
        SCOPED_TRACE(f.name);
        min_swap_size = 0;
        total_memory_percent_threshold = INT32_MAX;
        low_free_size = 0;
        *f.threshold = f.value;
        start_pass();
        takeLogValue = 4321;
        EXPECT_EQ(check_with(free_lines(t), f.meminfo), 0u);
        expect_finding(SUPPRESSED, 4321);
        EXPECT_EQ(memoryPercentLogged, 0);
        EXPECT_EQ(block->tookLog, 1u);
    }
}

TEST_F(SystemMemory, FindingOfAnEarlierCheckStaysWhenNothingIsFound) {
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 55;
    EXPECT_EQ(check_with(free_lines(free_table{}), split_meminfo(5000)), 0u);
    expect_finding(EARLIER_FINDING, 55);
}

// ---- The copies in primaryDataBlock ----

TEST_F(SystemMemory, BothOutputsAreCopiedUnderTheirHeaders) {
    const free_table t;
    const lines meminfo = plain_meminfo();
    EXPECT_EQ(check_with(free_lines(t), meminfo), 0u);
    EXPECT_EQ(block_text(), block_of(free_lines(t), meminfo));
    // The headers add their length, each line takes its length + 3: 1,500,000 + 28 - (83 + 83 +
    // 47) + 36 - 5 x 30.
    EXPECT_EQ(outbufferleft, 1499701);
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET + FREE_HEADER_LENGTH - cost_of(free_lines(t)) +
                                 MEMINFO_HEADER_LENGTH - cost_of(meminfo));
    EXPECT_EQ(pdboverflow, 0);
}

TEST_F(SystemMemory, TheCopiesFollowWhatEarlierChecksWrote) {
    append_unbudgeted("earlier\n\r");
    const lines free_output = {"a", "Mem: 1 2 3 4 5 6", "Swap: 7 8 9"};
    const lines meminfo = {"x"};
    EXPECT_EQ(check_with(free_output, meminfo), 0u);
    EXPECT_EQ(block_text(), "earlier\n\r\n\rAbout to output free data \n\ra\n\rMem: 1 2 3 4 5 6\n\r"
                            "Swap: 7 8 9\n\r\n\rAbout to output cat /proc/meminfo \n\rx\n\r");
    // 1,500,000 + 28 - 4 - 19 - 14 + 36 - 4
    EXPECT_EQ(outbufferleft, 1500023);
}

TEST_F(SystemMemory, LineThatDoesNotFitOverflowsOncePerPassAndIsStillRead) {
    // 10 + 28 = 38 is not above 80 + 5: the free header does not fit, and outbufferleft becomes
    // 4. The meminfo header brings it to 40, where a line of 27 fits (32 < 40) and leaves 10,
    // after which nothing fits and no second overflow line is written.
    outbufferleft = 10;
    total_memory_percent_threshold = 850;
    const free_table t;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    EXPECT_EQ(block_text(), std::string(FREE_SECTION) + OVERFLOW_LINE + MEMINFO_SECTION +
                                plain_meminfo()[0] + "\n\r");
    EXPECT_EQ(outbufferleft, 10);
    EXPECT_EQ(pdboverflow, 1);
    // The lines not copied are read all the same.
    expect_finding(MEMORY_IN_USE, 850);
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({free_traces(t), {percent_trace(850)}, percent_finding_traces(850)})));
}

TEST_F(SystemMemory, LineFitsOnlyWhenItsLengthPlusFiveIsBelowWhatIsLeft) {
    const free_table t;
    ASSERT_EQ(FREE_HEADER.size(), 80u);
    ASSERT_EQ(mem_line(t).size(), 80u);
    // 58 + 28 = 86 = 80 + 6: the header goes in and leaves 3; the memory line overflows.
    outbufferleft = 58;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    EXPECT_EQ(block_text(), std::string(FREE_SECTION) + FREE_HEADER + "\n\r" + OVERFLOW_LINE +
                                MEMINFO_SECTION + plain_meminfo()[0] + "\n\r");
    EXPECT_EQ(outbufferleft, 10);

    // 57 + 28 = 85 = 80 + 5: the header itself overflows.
    start_pass();
    outbufferleft = 57;
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(block_text(), std::string(FREE_SECTION) + OVERFLOW_LINE + MEMINFO_SECTION +
                                plain_meminfo()[0] + "\n\r");
    EXPECT_EQ(outbufferleft, 10);
}

TEST_F(SystemMemory, OverflowOfAnEarlierCheckWritesNoSecondOverflowLine) {
    pdboverflow = 1;
    outbufferleft = 4;
    EXPECT_EQ(check_with(free_lines(free_table{})), 0u);
    // 4 + 28 + 36 = 68: only the meminfo lines of 27 fit, one after the other (32 < 68, 32 < 38).
    EXPECT_EQ(block_text(), std::string(FREE_SECTION) + MEMINFO_SECTION + plain_meminfo()[0] +
                                "\n\r" + plain_meminfo()[1] + "\n\r");
    EXPECT_EQ(outbufferleft, 8);
    EXPECT_EQ(pdboverflow, 1);
}

// ---- Unusual output of free ----

TEST_F(SystemMemory, FreePrintingNothingGivesZerosAndASwapFinding) {
    min_swap_size = 1;
    total_memory_percent_threshold = 0; // no percent is computed of no memory
    EXPECT_EQ(check_with({}), 0u);
    expect_finding(SWAP_TOO_SMALL, 0);
    EXPECT_EQ(memoryPercentLogged, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({NO_FIGURES, swap_finding_traces(0)})));
    EXPECT_EQ(block_text(), block_of({}, plain_meminfo()));
}

TEST_F(SystemMemory, FreePrintingOnlyItsHeaderGivesZeros) {
    min_swap_size = 1;
    EXPECT_EQ(check_with({FREE_HEADER}), 0u);
    expect_finding(SWAP_TOO_SMALL, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({NO_FIGURES, swap_finding_traces(0)})));
    EXPECT_EQ(block_text(), block_of({FREE_HEADER}, plain_meminfo()));
}

TEST_F(SystemMemory, WithoutTheSwapLineSwapIsZero) {
    const free_table t;
    EXPECT_EQ(check_with({FREE_HEADER, mem_line(t)}), 0u);
    // 1000 x (1,000,000 - (90,000 + 60,000)) / 1,000,000
    EXPECT_EQ(rec::traces(),
              check_traces(joined({{"TARNMNDD:  MEM line: [" + mem_line(t) + "]"},
                                   figure_traces({1000000, 850000, 60000, 0, 0, 0, 850000}),
                                   {percent_trace(850)}})));
}

TEST_F(SystemMemory, LinesAfterTheSwapLineAreCopiedButNotRead) {
    free_table t;
    t.swap_total = 4000;
    t.swap_used = 1000;
    t.swap_free = 3000;
    const lines free_output =
        joined({free_lines(t),
                {free_row("Total:", {1004000, 851000, 63000}), free_row("Mem:", {1, 2, 3, 4, 5, 6}),
                 free_row("Swap:", {7, 8, 9})}});
    EXPECT_EQ(check_with(free_output), 0u);
    // 1000 x (1,004,000 - (90,000 + 60,000 + 3,000)) / 1,004,000 = 847.6
    EXPECT_EQ(rec::traces(), check_traces(joined({free_traces(t), {percent_trace(847)}})));
    EXPECT_EQ(block_text(), block_of(free_output, plain_meminfo()));
}

TEST_F(SystemMemory, ShortSwapLineKeepsTheMemoryLinesWordsInItsEmptySlots) {
    const free_table t;
    const lines free_output = {FREE_HEADER, mem_line(t), "Swap: 100"};
    EXPECT_EQ(check_with(free_output), 0u);
    // swapused and swapfree are the memory line's used and free: 850,000 and 60,000. In use:
    // 1,000,000 + 100 - (90,000 + 60,000 + 60,000) = 790,100, of 1,000,100: 790.02.
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({line_traces(mem_line(t), "Swap: 100"),
                             figure_traces({1000000, 850000, 60000, 100, 850000, 60000, 790100}),
                             {percent_trace(790)}})));
}

TEST_F(SystemMemory, SecondLineIsReadAsTheMemoryLineWhateverItSays) {
    free_table t;
    t.swap_total = 2000;
    t.swap_used = 100;
    t.swap_free = 1900;
    // No header: the memory line is taken for one, the swap line is read as the memory line, and
    // the total line as the swap line. The swap line has no sixth word: buffers is what the slot
    // held before.
    const std::string total = free_row("Total:", {1002000, 850100, 61900});
    const lines free_output = {mem_line(t), swap_line(t), total};
    std::strcpy(words[5], "7");
    EXPECT_EQ(check_with(free_output), 0u);
    // In use: 2,000 + 1,002,000 - (7 + 1,900 + 61,900) = 940,193, of 1,004,000: 936.45.
    EXPECT_EQ(rec::traces(),
              check_traces(joined({line_traces(swap_line(t), total),
                                   figure_traces({2000, 100, 1900, 1002000, 850100, 61900, 940193}),
                                   {percent_trace(936)}})));
    EXPECT_EQ(block_text(), block_of(free_output, plain_meminfo()));
}

TEST_F(SystemMemory, AnyFirstLineIsTakenForTheHeader) {
    const lines free_output = {"Swap: 1 1 0", "Swap: 500 100 400", "Mem: 9 9 9"};
    std::strcpy(words[5], "");
    EXPECT_EQ(check_with(free_output), 0u);
    // buffers reads the empty sixth slot: 0. In use 500 + 9 - (0 + 400 + 9) = 100, of 509:
    // 196.46.
    EXPECT_EQ(rec::traces(), check_traces(joined({line_traces("Swap: 500 100 400", "Mem: 9 9 9"),
                                                  figure_traces({500, 100, 400, 9, 9, 9, 100}),
                                                  {percent_trace(196)}})));
}

TEST_F(SystemMemory, NumbersBeyond32BitsReadAsTheLargestAndTheSumsWrap) {
    free_table t;
    t.total = 99999999999;
    t.used = 5;
    t.free = 0;
    t.buff_cache = 0;
    t.swap_total = 4294967296;
    t.swap_used = 0;
    t.swap_free = 0;
    total_memory_percent_threshold = 1000;
    total_memory_in_use_threshold = -3;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    // In use and memory + swap are both 2 x 2147483647, which wraps to -2: 1000 x -2 / -2.
    EXPECT_EQ(rec::traces(),
              check_traces(joined({line_traces(mem_line(t), swap_line(t)),
                                   figure_traces({2147483647, 5, 0, 2147483647, 0, 0, -2}),
                                   in_use_traces(-2),
                                   {percent_trace(1000)},
                                   percent_finding_traces(1000)})));
    expect_finding(MEMORY_IN_USE, 1000);
}

TEST_F(SystemMemory, InUseThatWrapsGivesANegativePercent) {
    free_table t;
    t.total = 1000;
    t.used = 0;
    t.free = -5000000000; // reads as -2147483648
    t.buff_cache = 0;
    total_memory_percent_threshold = INT32_MIN;
    EXPECT_EQ(check_with(free_lines(t)), 0u);
    // 1000 + 2147483648 wraps to -2147482648; over 1000 memory, x 1000.
    EXPECT_EQ(rec::traces(),
              check_traces(joined({line_traces(mem_line(t), swap_line(t)),
                                   figure_traces({1000, 0, INT32_MIN, 0, 0, 0, -2147482648}),
                                   {percent_trace(-2147482648)},
                                   percent_finding_traces(-2147482648)})));
    expect_finding(MEMORY_IN_USE, -2147482648);
}

TEST_F(SystemMemory, LastLineWithoutALineEndLosesItsLastCharacter) {
    const free_table t;
    fake_meminfo(text_of(plain_meminfo()));
    fake_free(FREE_HEADER + "\n" + mem_line(t) + "\nSwap: 100 0 100");
    EXPECT_EQ(check(), 0u);
    // "Swap: 100 0 10": 1,000,100 - (90,000 + 60,000 + 10) = 850,090, of 1,000,100: 850.005.
    EXPECT_EQ(rec::traces(),
              check_traces(joined({line_traces(mem_line(t), "Swap: 100 0 10"),
                                   figure_traces({1000000, 850000, 60000, 100, 0, 10, 850090}),
                                   {percent_trace(850)}})));
    EXPECT_EQ(block_text(),
              block_of({FREE_HEADER, mem_line(t), "Swap: 100 0 10"}, plain_meminfo()));
}

// ---- The commands ----

TEST_F(SystemMemory, FreeRunsWithoutArgumentsAndCatIsGivenProcMeminfo) {
    const free_table t;
    const std::string record = fakes.dir() + "/";
    fakes.add("free", "#!/bin/sh\nprintf '%s\\n' \"$#\" \"$@\" > " +
                          shell_word(record + "free.args") + "\n" +
                          printing_script(text_of(free_lines(t))));
    fakes.add("cat", "#!/bin/sh\nprintf '%s\\n' \"$#\" \"$@\" > " +
                         shell_word(record + "cat.args") + "\n" +
                         printing_script(text_of(split_meminfo(5))));
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(read_file(record + "free.args"), "0\n");
    EXPECT_EQ(read_file(record + "cat.args"), "1\n/proc/meminfo\n");
    EXPECT_EQ(block_text(), block_of(free_lines(t), split_meminfo(5)));
}

TEST_F(SystemMemory, CommandsAreRunWithoutAShell) {
    command_shell = "/nonexistent/bash";
    const free_table t;
    EXPECT_EQ(check_with(free_lines(t), split_meminfo(5)), 0u);
    EXPECT_EQ(rec::traces(),
              check_traces(joined({free_traces(t), {percent_trace(850), low_free_trace(5)}})));
}

TEST_F(SystemMemory, FreeMissingFromPathIsTracedAndTheRestRuns) {
    fake_commands alone(fake_commands::path_mode::only);
    alone.add("cat", "#!/bin/sh\n" + printing_script(text_of(split_meminfo(5))));
    min_swap_size = 1;
    low_free_size = 5;
    EXPECT_EQ(check(), 0u);
    expect_finding(SWAP_TOO_SMALL, 0);
    EXPECT_EQ(rec::traces(),
              check_traces(joined({{"TARNMNDF: rc from free execvp call is: -1; errno=2."},
                                   NO_FIGURES,
                                   swap_finding_traces(0),
                                   {low_free_trace(5)}})));
    EXPECT_EQ(block_text(), block_of({}, split_meminfo(5)));
}

TEST_F(SystemMemory, CatMissingFromPathIsTracedAndHasNoLowFreeTest) {
    fake_commands alone(fake_commands::path_mode::only);
    const free_table t;
    alone.add("free", "#!/bin/sh\n" + printing_script(text_of(free_lines(t))));
    low_free_size = INT32_MAX;
    EXPECT_EQ(check(), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(),
              check_traces(joined({free_traces(t),
                                   {percent_trace(850)},
                                   {"TARNMNDF: rc from cat /proc/meminfo execvp call is: -1; "
                                    "errno=2."}})));
    EXPECT_EQ(block_text(), block_of(free_lines(t), {}));
}

TEST_F(SystemMemory, PipesThatCannotBeMadeSkipTheFiguresAndEveryFinding) {
    min_swap_size = 1;
    low_free_size = 10;
    total_memory_percent_threshold = 0;
    fakes.add("free", "#!/bin/sh\ntouch \"$0.ran\"\n");
    fakes.add("cat", "#!/bin/sh\ntouch \"$0.ran\"\n" + printing_script(text_of(split_meminfo(5))));

    std::string report = fake::run_without_descriptors([this] {
        const uint32_t src = check();
        std::string text = std::to_string(src) + "\n" + std::to_string(takeLogCrc) + " " +
                           std::to_string(takeLogValue) + " " + std::to_string(outbufferleft) +
                           "\n";
        for (const std::string &trace : rec::traces()) {
            text += trace + "\n";
        }
        return text + block_text();
    });

    EXPECT_EQ(report,
              "0\n0 0 " +
                  std::to_string(OUTBUFFER_BUDGET + FREE_HEADER_LENGTH + MEMINFO_HEADER_LENGTH) +
                  "\n" + CHECK_ENTRY + "\n" +
                  "TARNMNDF: rc from free pipe call is: -1; errno=24.\n"
                  "TARNMNDF: rc from free pipe call is: -1; errno=24.\n" +
                  CHECK_EXIT + "\n" + FREE_SECTION + MEMINFO_SECTION);
    EXPECT_FALSE(std::filesystem::exists(fakes.path_of("free") + ".ran"));
    EXPECT_FALSE(std::filesystem::exists(fakes.path_of("cat") + ".ran"));
}

TEST_F(SystemMemory, FirstAndLastTracesAndTheCrcPassedIn) {
    fake_free("");
    fake_meminfo("");
    crc = 0xABCDEF;
    EXPECT_EQ(tarn_check_system_memory(&takeLogCrc, &takeLogValue, &block->tookLog,
                                       &memoryPercentLogged, &crc),
              0u);
    EXPECT_EQ(crc, 0xABCDEFu);
    EXPECT_EQ(rec::traces(), joined({{CHECK_ENTRY},
                                     NO_FIGURES,
                                     {"TARNOTHF: <-- tarn_check_system_memory, src = 0, crc = "
                                      "abcdef (hex)"}}));
    expect_finding(0, 0);
}

// ---- The host's own free and /proc/meminfo ----

int64_t meminfo_value(const std::string &name) {
    std::ifstream meminfo("/proc/meminfo");
    std::string key;
    int64_t value = -1;
    std::string unit;
    while (meminfo >> key >> value) {
        std::getline(meminfo, unit);
        if (key == name + ":") {
            return value;
        }
    }
    return -1;
}

TEST_F(SystemMemory, HostsOwnFreeGivesItsMemTotalAndNoFindingUnderGenerousThresholds) {
    min_swap_size = 0;
    total_memory_percent_threshold = 1000;
    resume_memory_percent_threshold = 11;
    low_free_size = 1;
    total_memory_in_use_threshold = INT32_MAX;
    EXPECT_EQ(check(), 0u);

    const std::string prefix = "TARNMNDD: memtotal       is ";
    const lines memtotal = rec::traces_starting(prefix);
    ASSERT_EQ(memtotal.size(), 1u);
    const int64_t expected = meminfo_value("MemTotal");
    ASSERT_GT(expected, 0);
    EXPECT_EQ(memtotal[0], prefix + dec(expected) + " (dec)");
    EXPECT_EQ(takeLogCrc, 0);
    EXPECT_EQ(rec::traces().front(), CHECK_ENTRY);
    EXPECT_EQ(rec::traces().back(), CHECK_EXIT);
    EXPECT_EQ(rec::traces_starting("TARNMNDD:  MEM line: [").size(), 1u);
    EXPECT_EQ(rec::traces_starting("TARNMNDD: swap line: [").size(), 1u);
    const std::string text = block_text();
    EXPECT_EQ(text.rfind(FREE_SECTION, 0), 0u);
    EXPECT_NE(text.find(std::string(MEMINFO_SECTION) + "MemTotal:"), std::string::npos);
}

// ---- The arithmetic ----

free_figures figures_of(int32_t memtotal, int32_t swaptotal, int32_t buffers = 0,
                        int32_t memfree = 0, int32_t swapfree = 0) {
    free_figures f;
    f.memtotal = memtotal;
    f.swaptotal = swaptotal;
    f.buffers = buffers;
    f.memfree = memfree;
    f.swapfree = swapfree;
    return f;
}

TEST(SystemMemoryArithmetic, InUseIsMemoryAndSwapLessFreeAndBuffers) {
    EXPECT_EQ(memory_in_use(figures_of(1000, 500, 100, 200, 50)), 1150);
    EXPECT_EQ(memory_in_use(figures_of(100, 0, 100, 200, 50)), -250);
}

TEST(SystemMemoryArithmetic, InUseWrapsAs32Bits) {
    EXPECT_EQ(memory_in_use(figures_of(INT32_MAX, INT32_MAX)), -2);
    EXPECT_EQ(memory_in_use(figures_of(1000, 0, 0, INT32_MIN)), -2147482648);
    // The subtracted sum wraps too, and comes out the same as in 32 bits.
    EXPECT_EQ(memory_in_use(figures_of(0, 0, INT32_MAX, INT32_MAX, 2)), 0);
}

TEST(SystemMemoryArithmetic, PercentIsTenthsTruncatedTowardZero) {
    EXPECT_EQ(memory_percent(figures_of(1000000, 0), 900000), 900);
    EXPECT_EQ(memory_percent(figures_of(1000000, 0), 899990), 899);
    EXPECT_EQ(memory_percent(figures_of(6000, 4000), -8999), -899);
    EXPECT_EQ(memory_percent(figures_of(6000, 4000), -9), 0);
    EXPECT_EQ(memory_percent(figures_of(1000, 0), 0), 0);
}

TEST(SystemMemoryArithmetic, MemoryAndSwapAddingUpToZeroGiveTheSmallestInteger) {
    EXPECT_EQ(memory_percent(figures_of(500, -500), 100), INT32_MIN);
    EXPECT_EQ(memory_percent(figures_of(500, -500), 0), INT32_MIN);
    // Wrapping to 0.
    EXPECT_EQ(memory_percent(figures_of(INT32_MIN, INT32_MIN), 1), INT32_MIN);
}

TEST(SystemMemoryArithmetic, QuotientBeyond32BitsGivesTheSmallestInteger) {
    EXPECT_EQ(memory_percent(figures_of(1, 0), 2147483), 2147483000);
    EXPECT_EQ(memory_percent(figures_of(1, 0), 2147484), INT32_MIN);
    EXPECT_EQ(memory_percent(figures_of(1, 0), -2147483), -2147483000);
    EXPECT_EQ(memory_percent(figures_of(1, 0), -2147484), INT32_MIN);
    EXPECT_EQ(memory_percent(figures_of(1, 0), INT32_MAX), INT32_MIN);
}

TEST(SystemMemoryArithmetic, TotalThatWrapsIsTheDivisor) {
    // 2147483647 + 2 wraps to -2147483647.
    EXPECT_EQ(memory_percent(figures_of(INT32_MAX, 2), -2147483647), 1000);
}

} // namespace

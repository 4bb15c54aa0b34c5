// The open files check over a fake cat (the file-nr line) and a fake runAsRoot (the descriptor
// listing) first on PATH, its line handlers fed directly, and the lsDataBlock it fills.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <unistd.h>
#include <vector>

#include "command_runner.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "recording_platform.h"
#include "starved_child.h"
#include "storage/open_files.h"
#include "text_lines.h"

namespace {

using fake::fake_commands;
using text::joined;
using text::lines;

constexpr char FILE_NR_SECTION[] = "\n\rAbout to output cat /proc/sys/fs/file-nr data: \n\r";
constexpr char LISTING_SECTION[] = "\n\rAbout to output ls data: \n\r";
// What each section header adds to outbufferleft: the header without the line end before it.
constexpr int32_t FILE_NR_HEADER_LENGTH = 49;
constexpr int32_t LISTING_HEADER_LENGTH = 27;
constexpr int32_t BUDGET_AFTER_HEADERS =
    OUTBUFFER_BUDGET + FILE_NR_HEADER_LENGTH + LISTING_HEADER_LENGTH;
constexpr char OVERFLOW_LINE[] = "No room to output more lines... \n\r";
constexpr uint32_t CRC_GIVEN = 0x1234; // what the tests pass in *crc, which the check only traces

// The values of takeLogCrc the check leaves, as the loop's signed integer holds them.
constexpr int32_t SYSTEM_DESCRIPTORS = RC_SYSTEM_DESCRIPTORS;
constexpr int32_t PROCESS_DESCRIPTORS = RC_PROCESS_DESCRIPTORS;
constexpr int32_t SUPPRESSED = TAKE_LOG_SUPPRESSED;
constexpr int32_t EARLIER_FINDING = RC_OTHER_PARTITION_SPACE; // the file system check's, before

const std::string CHECK_ENTRY = "TARNOTHF: --> tarn_check_open_files";
const std::string CHECK_EXIT = "TARNOTHF: <-- tarn_check_open_files, src = 0, crc = 1234 (hex)";
const std::string ABOUT_TO_CALL = "TARNMNDF:    about to call ls command";
const std::string ABOUT_TO_PROCESS = "TARNMNDD:    about to process ls command results";
const std::string NO_SHARE = "TARNMNDF: maximum open file descriptors is 0, no share computed";

std::string dec(int64_t value) {
    return std::to_string(value);
}

// ---- What file-nr and the listing look like ----

// The file-nr line of a host with 2,400 handles allocated, none of them free, of 100,000: 2.4 %.
const std::string FILE_NR = "2400 0 100000";

std::string header(int pid) {
    return "/proc/" + dec(pid) + "/fd:";
}

std::string fd_line(int fd) {
    return "lrwx------ 1 root root 64 Nov 23 23:19 " + dec(fd) + " -> /dev/null";
}

// A directory as the recursive long listing prints it: its header, the total, one line a
// descriptor and a blank line.
lines directory(int pid, int descriptors) {
    lines block = {header(pid), "total 0"};
    for (int fd = 0; fd < descriptors; ++fd) {
        block.push_back(fd_line(fd));
    }
    block.push_back("");
    return block;
}

std::string text_of(const lines &output) {
    std::string text;
    for (const std::string &line : output) {
        text += line + "\n";
    }
    return text;
}

// The lines as lsDataBlock holds them.
std::string ls_text(const lines &output) {
    std::string text;
    for (const std::string &line : output) {
        text += line + "\n\r";
    }
    return text;
}

// ---- What the check traces ----

lines figure_traces(int64_t allocated, int64_t free, int64_t maximum) {
    return {"TARNMNDD: total allocated file descriptors = " + dec(allocated) + " (dec)",
            "TARNMNDD: total free allocated file descriptors = " + dec(free) + " (dec)",
            "TARNMNDD: maximum open file descriptors = " + dec(maximum) + " (dec)"};
}

lines share_finding_traces(const std::string &percent, const std::string &line) {
    return {"TARNMNDF: too many open files", "TARNMNDF: percent_used = " + percent + " (dec)",
            "TARNMNDF: Entire line was [" + line + "]"};
}

std::string listed(const std::string &line) {
    return "TARNMNDD: ls -Rl /proc/*/fd: [" + line + "]";
}

std::string block_total(int64_t lines) {
    return "TARNMNDD: total per-process file descriptors = " + dec(lines) + " (dec)";
}

lines process_finding_traces(int64_t lines, const std::string &line) {
    return {"TARNMNDF: too many open files in process",
            "TARNMNDF: pp number is " + dec(lines) + " (dec)",
            "TARNMNDF: Entire line was [" + line + "]"};
}

lines last_process_finding_traces(int64_t lines, const std::string &line) {
    return {"TARNMNDF: too many open files in process 2",
            "TARNMNDF: pp number is " + dec(lines) + " (dec)",
            "TARNMNDF: Entire line was [" + line + "]"};
}

lines listed_all(const lines &output) {
    lines traced;
    for (const std::string &line : output) {
        traced.push_back(listed(line));
    }
    return traced;
}

// Everything the check traces when both commands start: its entry, the file-nr part, the start
// of the script, the listing part, its exit.
lines check_traces(const lines &file_nr_part, const lines &listing_part) {
    return joined({{CHECK_ENTRY},
                   file_nr_part,
                   {ABOUT_TO_CALL, ABOUT_TO_PROCESS},
                   listing_part,
                   {CHECK_EXIT}});
}

std::string error_text(const std::string &line) {
    return "\n\rError Information: \n\rtoo many open files in process\n\rEntire line was: \n\r" +
           line + "\n\r";
}

// ---- What the check leaves in the blocks ----

std::string block_text() {
    return std::string(primaryDataBlock, strnlen(primaryDataBlock, PRIMARY_DATA_BLOCK_SIZE));
}

std::string top_text() {
    return std::string(topDataBlock, strnlen(topDataBlock, TOP_DATA_BLOCK_SIZE));
}

// primaryDataBlock after a pass whose file-nr line was `file_nr_line` and whose listing gave
// `listing_part`.
std::string block_of(const std::string &file_nr_line, const std::string &listing_part) {
    return FILE_NR_SECTION + file_nr_line + "\n\r" + LISTING_SECTION + listing_part;
}

// lsDataBlock holds exactly `text`, and every byte after it is 0, as after a clear of the whole
// block.
void expect_ls_block(const std::string &text) {
    ASSERT_LT(text.size(), LS_DATA_BLOCK_SIZE);
    EXPECT_EQ(ls_data_length(), text.size());
    EXPECT_EQ(std::string(lsDataBlock, text.size()), text);
    EXPECT_TRUE(text::all_zero(lsDataBlock + text.size(), LS_DATA_BLOCK_SIZE - text.size()));
}

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream all;
    all << in.rdbuf();
    return all.str();
}

std::string shell_word(const std::string &text) {
    std::string word = "'";
    for (char c : text) {
        word += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return word + "'";
}

// The host's cat, named by its path: the fake cat stands first on PATH (or alone on it).
std::string real_cat() {
    return std::filesystem::exists("/bin/cat") ? "/bin/cat" : "/usr/bin/cat";
}

// ---- The fixture ----

// Thresholds under which nothing is found, a fresh pass, and fake commands first on PATH.
class OpenFiles : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        reset_settings();
        // Each test lowers only the thresholds it is about.
        file_descriptors_percent_threshold = INT32_MAX;
        pp_file_descriptors_threshold = INT32_MAX;
        // A short line keeps words of the lines before it: start from empty slots.
        std::memset(words, 0, sizeof words);
        tookLog = 0;
        start_pass();
    }

    void TearDown() override {
        command_shell = "/bin/bash";
        start_pass();
    }

    // What the loop does before the checks of a pass.
    void start_pass() {
        start_pass_data();
        takeLogCrc = 0;
        takeLogValue = 0;
        rec::clear_traces();
    }

    // A command `name` in `commands` that notes its arguments and prints `text` byte for byte.
    void add_printing(fake_commands &commands, const std::string &name, const std::string &text) {
        const std::string fixture = commands.dir() + "/../fixtures/" + name + ".out";
        std::ofstream(fixture, std::ios::binary) << text;
        commands.add(name, "#!/bin/sh\nprintf '%s\\n' \"$#\" \"$@\" > " +
                               shell_word(commands.path_of(name) + ".args") + "\nexec " +
                               real_cat() + " " + shell_word(fixture) + "\n");
    }

    void fake_file_nr(const std::string &text) { add_printing(fakes, "cat", text); }
    void fake_listing(const lines &listing) { add_printing(fakes, "runAsRoot", text_of(listing)); }

    uint32_t check() {
        crc = CRC_GIVEN;
        return tarn_check_open_files(&takeLogCrc, &takeLogValue, &tookLog, &crc);
    }

    uint32_t check_with(const std::string &file_nr, const lines &listing) {
        fake_file_nr(file_nr.empty() ? "" : file_nr + "\n");
        fake_listing(listing);
        return check();
    }

    void expect_finding(int32_t code, int32_t value) {
        EXPECT_EQ(takeLogCrc, code);
        EXPECT_EQ(takeLogValue, value);
    }

    // The listing handler alone, as the check drives it.
    open_files_listing listing() {
        return open_files_listing{{&takeLogCrc, &takeLogValue, &tookLog}, 0, {}};
    }

    fake_commands fakes;
    int32_t takeLogCrc = 0;
    int32_t takeLogValue = 0;
    uint32_t tookLog = 0;
    uint32_t crc = 0;
};

// ---- The system-wide share ----

TEST_F(OpenFiles, ShareAtTheThresholdIsNoFindingAndAboveItIs) {
    // 1000 x (24,000 - 0) / 1,000,000 = 24
    file_descriptors_percent_threshold = 24;
    EXPECT_EQ(check_with(FILE_NR, {}), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000), {}));

    start_pass();
    file_descriptors_percent_threshold = 23;
    EXPECT_EQ(check(), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 24);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(24000, 0, 1000000),
                                                  share_finding_traces("2.4", FILE_NR)}),
                                          {}));
    // Nothing goes into the error text for this finding.
    EXPECT_EQ(top_text(), "");
    EXPECT_EQ(block_text(), block_of(FILE_NR, ""));
}

TEST_F(OpenFiles, ShareFindingReplacesAnEarlierChecksReasonCode) {
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 55;
    file_descriptors_percent_threshold = 23;
    EXPECT_EQ(check_with(FILE_NR, {}), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 24);
}

TEST_F(OpenFiles, ShareOverTheThresholdWhileTookLogIsSetMarksOverAnEarlierReasonCode) {
    tookLog = 1;
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 55;
    file_descriptors_percent_threshold = 23;
    EXPECT_EQ(check_with(FILE_NR, {}), 0u);
    expect_finding(SUPPRESSED, 55);
    EXPECT_EQ(tookLog, 1u);
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000), {}));
}

TEST_F(OpenFiles, TabsBetweenTheNumbersReadAsBlanks) {
    // The kernel itself separates the three numbers by tabs.
    const std::string tabbed = "2400\t0\t100000";
    file_descriptors_percent_threshold = 23;
    EXPECT_EQ(check_with(tabbed, {}), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 24);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(24000, 0, 1000000),
                                                  share_finding_traces("2.4", tabbed)}),
                                          {}));
    EXPECT_EQ(block_text(), block_of(tabbed, ""));
}

TEST_F(OpenFiles, MaximumOfZeroGivesNoShareAndNoFinding) {
    file_descriptors_percent_threshold = INT32_MIN;
    EXPECT_EQ(check_with("2400 0 0", {}), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(24000, 0, 0), {NO_SHARE}}), {}));
    EXPECT_EQ(block_text(), block_of("2400 0 0", ""));
}

TEST_F(OpenFiles, MaximumOfAHostWithoutALimitStaysTheLargestAndGivesAShareOfZero) {
    // 9223372036854775807 reads as 2147483647 and stays that when taken tenfold: 1000 x 24,000 /
    // 2,147,483,647 is 0.
    const std::string unlimited = "2400 0 9223372036854775807";
    file_descriptors_percent_threshold = 0;
    EXPECT_EQ(check_with(unlimited, {}), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, INT32_MAX), {}));

    start_pass();
    file_descriptors_percent_threshold = -1;
    EXPECT_EQ(check(), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(24000, 0, INT32_MAX),
                                                  share_finding_traces("0.0", unlimited)}),
                                          {}));
}

TEST_F(OpenFiles, NumbersBeyond32BitsReadAsTheLargestAndStayThatTenfold) {
    // 99999999999 reads as 2147483647, ten times that stays 2147483647: 1000 x that / 1,000,000
    // is 2,147,483.
    const std::string huge = "99999999999 0 100000";
    file_descriptors_percent_threshold = 2147482;
    EXPECT_EQ(check_with(huge, {}), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 2147483);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(INT32_MAX, 0, 1000000),
                                                  share_finding_traces("214748.3", huge)}),
                                          {}));
}

TEST_F(OpenFiles, MoreThan214748HandlesInUseStillGiveTheirShare) {
    // 1000 x 3,000,000 is beyond 32 bits: the share is 300 all the same.
    const std::string busy = "300000 0 1000000";
    file_descriptors_percent_threshold = 299;
    EXPECT_EQ(check_with(busy, {}), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 300);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(3000000, 0, 10000000),
                                                  share_finding_traces("30.0", busy)}),
                                          {}));
}

TEST_F(OpenFiles, ShareBeyond32BitsIsClampedToTheLargest) {
    // 214748365 x 10 stays 2147483647; 1000 x that / 10 is far beyond 32 bits.
    const std::string busy = "214748365 0 1";
    file_descriptors_percent_threshold = INT32_MAX - 1;
    EXPECT_EQ(check_with(busy, {}), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, INT32_MAX);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(INT32_MAX, 0, 10),
                                                  share_finding_traces("214748364.7", busy)}),
                                          {}));
}

TEST_F(OpenFiles, NegativeNumbersBeyond32BitsStayTheSmallest) {
    const std::string odd = "-214748365 0 1";
    file_descriptors_percent_threshold = INT32_MIN;
    EXPECT_EQ(check_with(odd, {}), 0u);
    expect_finding(0, 0); // the share, INT32_MIN, is not above the threshold
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(INT32_MIN, 0, 10), {}));
}

TEST_F(OpenFiles, NegativeShareIsTracedWithTruncatedQuotientAndRemainder) {
    // More free than allocated: 1000 x (0 - 250) / 10,000 = -25, traced as -2 and -5.
    const std::string odd = "0 25 1000";
    file_descriptors_percent_threshold = -26;
    EXPECT_EQ(check_with(odd, {}), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, -25);
    EXPECT_EQ(rec::traces(),
              check_traces(
                  joined({figure_traces(0, 250, 10000), share_finding_traces("-2.-5", odd)}), {}));
}

TEST_F(OpenFiles, EmptyFileNrGivesNoFiguresAndNoFinding) {
    file_descriptors_percent_threshold = INT32_MIN;
    EXPECT_EQ(check_with("", {}), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces({}, {}));
    EXPECT_EQ(block_text(), std::string(FILE_NR_SECTION) + LISTING_SECTION);
    EXPECT_EQ(outbufferleft, BUDGET_AFTER_HEADERS);
}

TEST_F(OpenFiles, LineOfOneWordReadsTheOtherNumbersFromTheWordsBefore) {
    // From empty slots: no free handles and a maximum of 0.
    file_descriptors_percent_threshold = INT32_MIN;
    EXPECT_EQ(check_with("2400", {}), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(24000, 0, 0), {NO_SHARE}}), {}));

    // From the words an earlier line left: 1000 x (24,000 - 50) / 1,000,000 = 23.95.
    start_pass();
    std::strcpy(words[1], "5");
    std::strcpy(words[2], "100000");
    file_descriptors_percent_threshold = 22;
    EXPECT_EQ(check(), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 23);
    EXPECT_EQ(rec::traces(), check_traces(joined({figure_traces(24000, 50, 1000000),
                                                  share_finding_traces("2.3", "2400")}),
                                          {}));
}

TEST_F(OpenFiles, EveryLineOfFileNrIsJudgedAndTheLastFindingStands) {
    file_descriptors_percent_threshold = 23;
    fake_file_nr("2400 0 100000\n\n5000 0 100000\n");
    fake_listing({});
    EXPECT_EQ(check(), 0u);
    // The blank line keeps the words of the line before it and is judged as that line again.
    expect_finding(SYSTEM_DESCRIPTORS, 50);
    EXPECT_EQ(
        rec::traces(),
        check_traces(joined({figure_traces(24000, 0, 1000000), share_finding_traces("2.4", FILE_NR),
                             figure_traces(24000, 0, 1000000), share_finding_traces("2.4", ""),
                             figure_traces(50000, 0, 1000000),
                             share_finding_traces("5.0", "5000 0 100000")}),
                     {}));
    EXPECT_EQ(block_text(), std::string(FILE_NR_SECTION) + FILE_NR + "\n\r\n\r5000 0 100000\n\r" +
                                LISTING_SECTION);
    EXPECT_EQ(outbufferleft, BUDGET_AFTER_HEADERS - 16 - 3 - 16);
}

TEST_F(OpenFiles, FileNrLineFollowsTheOutputBlockRule) {
    // With 18 left after the header, the line of 13 finds no room (13 + 5 is not below 18);
    // with 19 it goes in and leaves 3.
    outbufferleft = 13 + 5 - FILE_NR_HEADER_LENGTH;
    EXPECT_EQ(check_with(FILE_NR, {}), 0u);
    EXPECT_EQ(block_text(), std::string(FILE_NR_SECTION) + OVERFLOW_LINE + LISTING_SECTION);
    EXPECT_EQ(outbufferleft, 4 + LISTING_HEADER_LENGTH);
    EXPECT_EQ(pdboverflow, 1);

    start_pass();
    outbufferleft = 13 + 6 - FILE_NR_HEADER_LENGTH;
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(block_text(), block_of(FILE_NR, ""));
    EXPECT_EQ(outbufferleft, 3 + LISTING_HEADER_LENGTH);
    EXPECT_EQ(pdboverflow, 0);
}

// ---- The per-process listing ----

TEST_F(OpenFiles, SmallListingGivesOneOutputLinePerDirectoryEndedByItsSummary) {
    const lines listing = joined({directory(1, 3), directory(22, 0), directory(333, 6)});
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    expect_finding(0, 0);
    // /proc/1/fd closes an empty block of one line. /proc/22/fd closes the block of /proc/1/fd:
    // its five lines after the header and itself, summed up as 6 - 5 = 1. /proc/333/fd closes
    // three lines, too few for a summary, so the two headers run together. The last block, of
    // eight lines, is 3.
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd: 1\n\r/proc/22/fd:/proc/333/fd: 3\n\r"));
    // Each header costs its length + 3, though its line end comes with the summary, if any.
    EXPECT_EQ(outbufferleft, BUDGET_AFTER_HEADERS - 16 - 14 - 5 - 15 - 16 - 5);
    EXPECT_EQ(pdboverflow, 0);
    EXPECT_EQ(rec::traces(),
              check_traces(figure_traces(24000, 0, 1000000),
                           joined({{listed(header(1)), block_total(1)},
                                   listed_all({"total 0", fd_line(0), fd_line(1), fd_line(2), ""}),
                                   {listed(header(22)), block_total(6)},
                                   listed_all({"total 0", ""}),
                                   {listed(header(333)), block_total(3)},
                                   listed_all({"total 0", fd_line(0), fd_line(1), fd_line(2),
                                               fd_line(3), fd_line(4), fd_line(5), ""})})));
    // The last block stays in lsDataBlock until the next clear.
    expect_ls_block(ls_text(directory(333, 6)));
    EXPECT_EQ(top_text(), "");
}

TEST_F(OpenFiles, BlockOfExactlyTheThresholdIsNoFindingAndOneLineMoreIs) {
    // The block of /proc/1/fd: the four lines after its header, and the header that closes it.
    const lines listing = {header(1),  "total 0", fd_line(0), fd_line(1),
                           fd_line(2), header(2), "total 0"};
    pp_file_descriptors_threshold = 5;
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    expect_finding(0, 0);
    const lines quiet_traces = joined({{listed(header(1)), block_total(1)},
                                       listed_all({"total 0", fd_line(0), fd_line(1), fd_line(2)}),
                                       {listed(header(2)), block_total(5)},
                                       {listed("total 0")}});
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000), quiet_traces));
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd: 0\n\r/proc/2/fd:"));

    start_pass();
    pp_file_descriptors_threshold = 4;
    EXPECT_EQ(check(), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 5);
    EXPECT_EQ(rec::traces(),
              check_traces(figure_traces(24000, 0, 1000000),
                           joined({{listed(header(1)), block_total(1)},
                                   listed_all({"total 0", fd_line(0), fd_line(1), fd_line(2)}),
                                   {listed(header(2)), block_total(5)},
                                   process_finding_traces(5, header(2)),
                                   {listed("total 0")}})));
    // The error text quotes the header of the next directory; the listing attached is the
    // reported block's own, put in before its summary.
    EXPECT_EQ(top_text(), error_text(header(2)));
    const std::string attached =
        ls_text({header(1), "total 0", fd_line(0), fd_line(1), fd_line(2)});
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd:" + attached + " 0\n\r/proc/2/fd:"));
    // The listing attached costs nothing of outbufferleft.
    EXPECT_EQ(outbufferleft, BUDGET_AFTER_HEADERS - 16 - 14 - 5 - 14);
    EXPECT_EQ(pdboverflow, 0);
}

TEST_F(OpenFiles, ErrorTextIsWrittenOverWhatWasThereBefore) {
    std::memset(topDataBlock, 'e', TOP_DATA_BLOCK_SIZE - 1);
    pp_file_descriptors_threshold = 1;
    EXPECT_EQ(check_with(FILE_NR, {header(1), "x", header(2)}), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 2);
    const std::string expected = error_text(header(2));
    EXPECT_EQ(top_text(), expected);
    EXPECT_TRUE(
        text::all_zero(topDataBlock + expected.size(), TOP_DATA_BLOCK_SIZE - expected.size()));
}

TEST_F(OpenFiles, ErrorTextKeepsWhatFitsOfAVeryLongHeader) {
    const std::string long_header = "/proc/" + std::string(5000, '9') + "/fd:";
    pp_file_descriptors_threshold = 1;
    EXPECT_EQ(check_with(FILE_NR, {header(1), "x", long_header}), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 2);
    EXPECT_EQ(top_text(), error_text(long_header).substr(0, TOP_DATA_BLOCK_SIZE - 1));
    EXPECT_EQ(topDataBlock[TOP_DATA_BLOCK_SIZE - 1], '\0');
    EXPECT_EQ(rec::traces_starting("TARNMNDF: Entire line was ["),
              lines{"TARNMNDF: Entire line was [" + long_header + "]"});
}

TEST_F(OpenFiles, EarlierReasonCodeLeavesNoPerProcessFindingAndNoMark) {
    const lines listing = joined({directory(1, 5), directory(2, 5)});
    pp_file_descriptors_threshold = 2;
    for (uint32_t took_log : {0u, 1u}) {
        SCOPED_TRACE(took_log);
        start_pass();
        tookLog = took_log;
        takeLogCrc = EARLIER_FINDING;
        takeLogValue = 55;
        EXPECT_EQ(check_with(FILE_NR, listing), 0u);
        expect_finding(EARLIER_FINDING, 55);
        EXPECT_EQ(top_text(), "");
        EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd: 3\n\r/proc/2/fd: 2\n\r"));
        EXPECT_TRUE(rec::traces_starting("TARNMNDF: too many open files").empty());
    }
}

TEST_F(OpenFiles, ShareFindingOfTheSamePassLeavesNoPerProcessFinding) {
    const lines listing = joined({directory(1, 5), directory(2, 5)});
    pp_file_descriptors_threshold = 2;
    file_descriptors_percent_threshold = 23;
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    expect_finding(SYSTEM_DESCRIPTORS, 24);
    EXPECT_EQ(top_text(), "");

    // Held back, the share's mark alone is enough to keep the listing quiet.
    start_pass();
    tookLog = 1;
    EXPECT_EQ(check(), 0u);
    expect_finding(SUPPRESSED, 0);
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd: 3\n\r/proc/2/fd: 2\n\r"));
    EXPECT_TRUE(rec::traces_starting("TARNMNDF: too many open files").empty());
}

TEST_F(OpenFiles, BlockOverTheThresholdWhileTookLogIsSetIsOnlyMarked) {
    tookLog = 1;
    takeLogValue = 4321;
    pp_file_descriptors_threshold = 5;
    EXPECT_EQ(check_with(FILE_NR, joined({directory(1, 5), directory(2, 5)})), 0u);
    expect_finding(SUPPRESSED, 4321);
    EXPECT_EQ(top_text(), "");
    // Nothing attached.
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd: 3\n\r/proc/2/fd: 2\n\r"));
    const lines first = directory(1, 5);
    const lines second = directory(2, 5);
    EXPECT_EQ(rec::traces(),
              check_traces(figure_traces(24000, 0, 1000000),
                           joined({{listed(header(1)), block_total(1)},
                                   listed_all(lines(first.begin() + 1, first.end())),
                                   {listed(header(2)), block_total(8)},
                                   listed_all(lines(second.begin() + 1, second.end()))})));
}

TEST_F(OpenFiles, OfTwoProcessesOverTheThresholdOnlyTheFirstIsReported) {
    // Blocks of 8 (/proc/1/fd), 6 (/proc/2/fd) and 7 lines (/proc/3/fd, at the end).
    const lines listing = joined({directory(1, 5), directory(2, 3), directory(3, 5)});
    pp_file_descriptors_threshold = 5;
    std::strcpy(topDataBlock, "before");
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 8);
    EXPECT_EQ(top_text(), error_text(header(2)));
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd:" + ls_text(directory(1, 5)) +
                                                  " 3\n\r/proc/2/fd: 1\n\r/proc/3/fd: 2\n\r"));
    EXPECT_EQ(rec::traces_starting("TARNMNDF: too many open files"),
              lines{"TARNMNDF: too many open files in process"});
}

TEST_F(OpenFiles, BlocksOfFourLinesOrFewerHaveNoSummary) {
    // Blocks of 5, 4 and 2 lines, and a last one of 5.
    const lines listing = {header(1), "a", "b",       "c", "d", header(2), "e", "f", "g",
                           header(3), "k", header(4), "l", "m", "n",       "o", "p"};
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd: 0\n\r/proc/2/fd:/proc/3/fd:/proc/4/fd:"
                                              " 0\n\r"));
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000),
                                          joined({{listed(header(1)), block_total(1)},
                                                  listed_all({"a", "b", "c", "d"}),
                                                  {listed(header(2)), block_total(5)},
                                                  listed_all({"e", "f", "g"}),
                                                  {listed(header(3)), block_total(4), listed("k")},
                                                  {listed(header(4)), block_total(2)},
                                                  listed_all({"l", "m", "n", "o", "p"})})));
}

TEST_F(OpenFiles, LastDirectoryIsJudgedAtTheEndAndLeavesTheErrorTextAlone) {
    // The first block has two lines; the last one five, with no header to close it.
    const lines listing = {header(1),  "x",        header(2),  "total 0",
                           fd_line(0), fd_line(1), fd_line(2), fd_line(3)};
    pp_file_descriptors_threshold = 4;
    std::strcpy(topDataBlock, "before");
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 5);
    EXPECT_EQ(top_text(), "before");
    EXPECT_EQ(rec::traces(),
              check_traces(
                  figure_traces(24000, 0, 1000000),
                  joined({{listed(header(1)), block_total(1), listed("x"), listed(header(2)),
                           block_total(2)},
                          listed_all({"total 0", fd_line(0), fd_line(1), fd_line(2), fd_line(3)}),
                          last_process_finding_traces(5, fd_line(3))})));
    // The listing attached comes after the last summary.
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd:/proc/2/fd: 0\n\r" +
                                                  ls_text({header(2), "total 0", fd_line(0),
                                                           fd_line(1), fd_line(2), fd_line(3)})));
    EXPECT_EQ(outbufferleft, BUDGET_AFTER_HEADERS - 16 - 14 - 14 - 5);
}

TEST_F(OpenFiles, FirstHeaderClosesAnEmptyBlockOfOneLine) {
    const lines listing = {header(1), "total 0"};
    pp_file_descriptors_threshold = 2;
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000),
                                          {listed(header(1)), block_total(1), listed("total 0")}));
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd:"));

    // Under a threshold of 0 even that block is a finding, with nothing to attach.
    start_pass();
    pp_file_descriptors_threshold = 0;
    EXPECT_EQ(check(), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 1);
    EXPECT_EQ(top_text(), error_text(header(1)));
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000),
                                          joined({{listed(header(1)), block_total(1)},
                                                  process_finding_traces(1, header(1)),
                                                  {listed("total 0")}})));
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd:"));
}

TEST_F(OpenFiles, BlankLineRightAfterAHeaderIsTakenForAHeaderAgain) {
    const lines listing = {header(1), "", "total 0"};
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000),
                                          {listed(header(1)), block_total(1), listed(""),
                                           block_total(1), listed("total 0")}));
    // The blank "header" adds nothing to the output line, but costs its 3.
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc/1/fd:"));
    EXPECT_EQ(outbufferleft, BUDGET_AFTER_HEADERS - 16 - 14 - 3);
    expect_ls_block("\n\rtotal 0\n\r");
}

TEST_F(OpenFiles, OnlyAFirstWordBeginningWithProcIsAHeader) {
    const lines listing = {"/proc", " /proc/1/fd:", "/pro/1/fd:", "x/proc/1/fd:", "/PROC/1/fd:"};
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    // "/proc" and " /proc/1/fd:" are headers; the others are lines of the second block.
    EXPECT_EQ(rec::traces(),
              check_traces(figure_traces(24000, 0, 1000000),
                           {listed("/proc"), block_total(1), listed(" /proc/1/fd:"), block_total(1),
                            listed("/pro/1/fd:"), listed("x/proc/1/fd:"), listed("/PROC/1/fd:")}));
    EXPECT_EQ(block_text(), block_of(FILE_NR, "/proc /proc/1/fd:"));
}

TEST_F(OpenFiles, HeaderThatFindsNoRoomWritesTheOverflowLineOnce) {
    // After the two section headers 26 is left: the first header (11 + 5 < 26) goes in and
    // leaves 12, the second (16 >= 12) writes the overflow line, the third nothing.
    outbufferleft = 26 - FILE_NR_HEADER_LENGTH - LISTING_HEADER_LENGTH;
    EXPECT_EQ(check_with("", {header(1), header(2), header(3)}), 0u);
    EXPECT_EQ(block_text(),
              std::string(FILE_NR_SECTION) + LISTING_SECTION + "/proc/1/fd:" + OVERFLOW_LINE);
    EXPECT_EQ(outbufferleft, 4);
    EXPECT_EQ(pdboverflow, 1);
}

// primaryDataBlock filled with unbudgeted text up to `length`.
void fill_block_to(size_t length) {
    const std::string chunk(100000, 'f');
    while (primary_data_length() + chunk.size() <= length) {
        append_unbudgeted(chunk.c_str());
    }
    append_unbudgeted(chunk.substr(0, length - primary_data_length()).c_str());
}

TEST_F(OpenFiles, ListingIsAttachedOnlyWhenTheWholeOfItFitsTheBlock) {
    const lines listing = joined({directory(1, 2), {header(2)}});
    const std::string attached = ls_text(directory(1, 2));
    // What the block holds when the listing is attached: the two sections and the first header.
    const size_t before = std::string(FILE_NR_SECTION).size() +
                          std::string(LISTING_SECTION).size() + header(1).size();
    pp_file_descriptors_threshold = 3;

    // Room for the listing but not for its terminating NUL: not attached.
    fill_block_to(PRIMARY_DATA_BLOCK_SIZE - before - attached.size());
    EXPECT_EQ(check_with("", listing), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 5);
    EXPECT_EQ(primary_data_length(),
              PRIMARY_DATA_BLOCK_SIZE - attached.size() + std::string(" 0\n\r/proc/2/fd:").size());
    EXPECT_EQ(block_text().substr(PRIMARY_DATA_BLOCK_SIZE - attached.size() - header(1).size()),
              header(1) + " 0\n\r" + header(2));

    // One byte more: attached, and the block is full.
    start_pass();
    fill_block_to(PRIMARY_DATA_BLOCK_SIZE - before - attached.size() - 1);
    EXPECT_EQ(check(), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 5);
    EXPECT_EQ(primary_data_length(), PRIMARY_DATA_BLOCK_SIZE - 1);
    EXPECT_EQ(block_text().substr(PRIMARY_DATA_BLOCK_SIZE - 1 - attached.size() - header(1).size()),
              header(1) + attached);
    EXPECT_EQ(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1], '\0');
}

// ---- lsDataBlock ----

TEST_F(OpenFiles, LongBlockThenShortBlockLeaveTheBytesOfAWholeClear) {
    // A whole clear of the block before each directory, as the check has always done it, leaves
    // zeros after the short block where the long one was.
    const std::string long_line(2000, 'l');
    lines listing = {header(1)};
    for (int i = 0; i < 500; ++i) {
        listing.push_back(long_line);
    }
    listing.push_back(header(2));
    listing.push_back("total 0");
    EXPECT_EQ(check_with("", listing), 0u);
    expect_ls_block(ls_text({header(2), "total 0"}));
}

TEST(LsDataBlock, ClearGivesEveryByteOfAWholeClear) {
    std::vector<char> model(LS_DATA_BLOCK_SIZE, '\0');
    auto append_both = [&model](const std::string &text) {
        const std::string with_end = text + "\n\r";
        size_t at = ls_data_length();
        append_ls_line(text.c_str());
        std::copy(with_end.begin(), with_end.end(), model.begin() + static_cast<long>(at));
    };
    auto clear_both = [&model] {
        clear_ls_data_block();
        std::fill(model.begin(), model.end(), '\0');
    };
    clear_both();
    for (int i = 0; i < 1000; ++i) {
        append_both(std::string(1000 + static_cast<size_t>(i), static_cast<char>('a' + i % 26)));
    }
    EXPECT_EQ(std::memcmp(lsDataBlock, model.data(), LS_DATA_BLOCK_SIZE), 0);
    clear_both();
    append_both("short");
    append_both("");
    EXPECT_EQ(ls_data_length(), 9u);
    EXPECT_EQ(std::memcmp(lsDataBlock, model.data(), LS_DATA_BLOCK_SIZE), 0);
    clear_both();
    EXPECT_EQ(ls_data_length(), 0u);
    EXPECT_TRUE(text::all_zero(lsDataBlock, LS_DATA_BLOCK_SIZE));
}

TEST(LsDataBlock, ClearTouchesOnlyWhatWasWrittenSinceTheLastClear) {
    clear_ls_data_block();
    append_ls_line("abc");
    // A byte past the text and its NUL, put there behind the helpers' back, shows how far the
    // clear goes.
    lsDataBlock[6] = 'x';
    clear_ls_data_block();
    EXPECT_TRUE(text::all_zero(lsDataBlock, 6));
    EXPECT_EQ(lsDataBlock[6], 'x');
    lsDataBlock[6] = '\0';
}

TEST(LsDataBlock, LineGoesInOnlyWholeAndTheRestOfTheBlockIsDropped) {
    clear_ls_data_block();
    // Fill up to 10 bytes before the last one, which stays NUL.
    const std::string filler(998, 'f');
    while (ls_data_length() + 1000 <= LS_DATA_BLOCK_SIZE - 1 - 10) {
        append_ls_line(filler.c_str());
    }
    const std::string big(LS_DATA_BLOCK_SIZE - 1 - 10 - ls_data_length() - 2, 'g');
    append_ls_line(big.c_str());
    ASSERT_EQ(ls_data_length(), LS_DATA_BLOCK_SIZE - 1 - 10);
    const std::string before(lsDataBlock, ls_data_length());

    // 9 + 2 does not fit in 10: dropped, and with it the 1-byte line after it, which would fit.
    append_ls_line("123456789");
    append_ls_line("1");
    EXPECT_EQ(ls_data_length(), LS_DATA_BLOCK_SIZE - 1 - 10);
    EXPECT_EQ(std::string(lsDataBlock, ls_data_length()), before);
    EXPECT_TRUE(text::all_zero(lsDataBlock + ls_data_length(), 11));

    // After a clear lines go in again.
    clear_ls_data_block();
    append_ls_line("1");
    EXPECT_EQ(std::string(lsDataBlock, 4), std::string("1\n\r\0", 4));

    // 8 + 2 fits in 10 exactly.
    clear_ls_data_block();
    while (ls_data_length() + 1000 <= LS_DATA_BLOCK_SIZE - 1 - 10) {
        append_ls_line(filler.c_str());
    }
    append_ls_line(big.c_str());
    append_ls_line("12345678");
    EXPECT_EQ(ls_data_length(), LS_DATA_BLOCK_SIZE - 1);
    EXPECT_EQ(std::string(lsDataBlock + LS_DATA_BLOCK_SIZE - 11, 11),
              std::string("12345678\n\r\0", 11));
    clear_ls_data_block();
    EXPECT_TRUE(text::all_zero(lsDataBlock, LS_DATA_BLOCK_SIZE));
}

TEST_F(OpenFiles, BlockLongerThanLsDataBlockKeepsItsBeginningAndIsStillCounted) {
    // 5,000 lines of 1,000 bytes: after the header (13 bytes with its line end) 3,038 of them
    // (1,002 bytes each) fit in the 3,045,055 bytes before the last NUL; the rest is dropped,
    // the short line at the end included.
    const std::string wide(1000, 'w');
    pp_file_descriptors_threshold = 5000;
    open_files_listing reading = listing();
    listing_line(reading, header(1).c_str());
    for (int i = 0; i < 5000; ++i) {
        listing_line(reading, wide.c_str());
    }
    listing_line(reading, "y");
    EXPECT_EQ(reading.block_lines, 5001);
    std::string kept = header(1) + "\n\r";
    for (int i = 0; i < 3038; ++i) {
        kept += wide + "\n\r";
    }
    ASSERT_EQ(kept.size(), 3044089u);
    expect_ls_block(kept);

    // Judged at the end with every line counted; the listing is too long to attach.
    clear_primary_data_block();
    listing_end(reading);
    expect_finding(PROCESS_DESCRIPTORS, 5001);
    EXPECT_EQ(block_text(), " 4996\n\r");
    EXPECT_EQ(rec::traces_starting("TARNMNDF: "), last_process_finding_traces(5001, "y"));
}

TEST_F(OpenFiles, ListingOfBlocksLongerThanLsDataBlockThroughTheScript) {
    const std::string wide(1000, 'w');
    lines listing = {header(1)};
    for (int i = 0; i < 5000; ++i) {
        listing.push_back(wide);
    }
    listing.push_back(header(2));
    listing.push_back("total 0");
    pp_file_descriptors_threshold = 5000;
    EXPECT_EQ(check_with("", listing), 0u);
    // 5,001 lines: over the threshold, but not attached (3,044,089 bytes do not fit).
    expect_finding(PROCESS_DESCRIPTORS, 5001);
    EXPECT_EQ(top_text(), error_text(header(2)));
    EXPECT_EQ(block_text(),
              std::string(FILE_NR_SECTION) + LISTING_SECTION + "/proc/1/fd: 4996\n\r/proc/2/fd:");
    const lines wide_traces = listed_all(lines(5000, wide));
    EXPECT_EQ(rec::traces(), check_traces({}, joined({{listed(header(1)), block_total(1)},
                                                      wide_traces,
                                                      {listed(header(2)), block_total(5001)},
                                                      process_finding_traces(5001, header(2)),
                                                      {listed("total 0")}})));
    expect_ls_block(ls_text({header(2), "total 0"}));
}

TEST_F(OpenFiles, ListingOf5000Directories) {
    // Directory n (pid n) holds n % 7 descriptors, a block of n % 7 + 3 lines with the next
    // header: the first block over 8 lines is that of pid 6, closed by /proc/7/fd.
    constexpr int DIRECTORIES = 5000;
    lines listing;
    for (int pid = 1; pid <= DIRECTORIES; ++pid) {
        const lines block = directory(pid, pid % 7);
        listing.insert(listing.end(), block.begin(), block.end());
    }
    pp_file_descriptors_threshold = 8;
    EXPECT_EQ(check_with(FILE_NR, listing), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 9);
    EXPECT_EQ(top_text(), error_text(header(7)));

    std::string expected_listing;
    lines expected_traces;
    for (int pid = 1; pid <= DIRECTORIES; ++pid) {
        const int descriptors = pid % 7;
        const lines block = directory(pid, descriptors);
        expected_listing += header(pid);
        expected_traces.push_back(listed(header(pid)));
        expected_traces.push_back(block_total(pid == 1 ? 1 : (pid - 1) % 7 + 3));
        if (pid == 7) {
            const lines found = process_finding_traces(9, header(7));
            expected_traces.insert(expected_traces.end(), found.begin(), found.end());
        }
        for (size_t i = 1; i < block.size(); ++i) {
            expected_traces.push_back(listed(block[i]));
        }
        if (pid == 6) {
            expected_listing += ls_text(block);
        }
        // The block's summary: closed by the next header with descriptors + 3 lines, the last
        // one by the end of the listing with descriptors + 2.
        const int block_lines = descriptors + (pid < DIRECTORIES ? 3 : 2);
        if (block_lines > 4) {
            expected_listing += " " + dec(block_lines - 5) + "\n\r";
        }
    }
    EXPECT_EQ(block_text(), block_of(FILE_NR, expected_listing));
    EXPECT_EQ(rec::traces(), check_traces(figure_traces(24000, 0, 1000000), expected_traces));
    expect_ls_block(ls_text(directory(DIRECTORIES, DIRECTORIES % 7)));
}

// ---- The commands ----

TEST_F(OpenFiles, CatIsGivenFileNrAndRunAsRootTheScript) {
    EXPECT_EQ(check_with(FILE_NR, directory(1, 1)), 0u);
    EXPECT_EQ(read_file(fakes.path_of("cat") + ".args"), "1\n/proc/sys/fs/file-nr\n");
    EXPECT_EQ(read_file(fakes.path_of("runAsRoot") + ".args"), "1\nlsmon.sh\n");
}

TEST_F(OpenFiles, CommandsAreRunWithoutAShell) {
    command_shell = "/nonexistent/bash";
    EXPECT_EQ(check_with(FILE_NR, {header(1)}), 0u);
    EXPECT_EQ(rec::traces(),
              check_traces(figure_traces(24000, 0, 1000000), {listed(header(1)), block_total(1)}));
}

TEST_F(OpenFiles, CatMissingFromPathIsTracedAndTheListingStillRuns) {
    fake_commands alone(fake_commands::path_mode::only);
    add_printing(alone, "runAsRoot", text_of(directory(1, 2)));
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(rec::traces(),
              check_traces({"TARNMNDF: rc from cat execvp call is: -1; errno=2."},
                           joined({{listed(header(1)), block_total(1)},
                                   listed_all({"total 0", fd_line(0), fd_line(1), ""})})));
    EXPECT_EQ(block_text(), std::string(FILE_NR_SECTION) + LISTING_SECTION + "/proc/1/fd:");
}

TEST_F(OpenFiles, RunAsRootMissingFromPathIsTracedBetweenTheTracesOfItsStart) {
    fake_commands alone(fake_commands::path_mode::only);
    add_printing(alone, "cat", FILE_NR + "\n");
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(rec::traces(),
              joined({{CHECK_ENTRY},
                      figure_traces(24000, 0, 1000000),
                      {ABOUT_TO_CALL, "TARNMNDF: rc from ls execvp call is: -1; errno=2.",
                       ABOUT_TO_PROCESS, CHECK_EXIT}}));
    EXPECT_EQ(block_text(), block_of(FILE_NR, ""));
    expect_finding(0, 0);
}

TEST_F(OpenFiles, ScriptThatCannotStartIsJudgedAsAnEmptyListing) {
    // Under a threshold below 0 the empty listing's count of 0 is a finding.
    fake_commands alone(fake_commands::path_mode::only);
    add_printing(alone, "cat", "");
    pp_file_descriptors_threshold = -1;
    EXPECT_EQ(check(), 0u);
    expect_finding(PROCESS_DESCRIPTORS, 0);
    EXPECT_EQ(rec::traces(),
              joined({{CHECK_ENTRY, ABOUT_TO_CALL,
                       "TARNMNDF: rc from ls execvp call is: -1; errno=2.", ABOUT_TO_PROCESS},
                      last_process_finding_traces(0, ""),
                      {CHECK_EXIT}}));
}

TEST_F(OpenFiles, PipesThatCannotBeMadeSkipBothHalves) {
    // Thresholds under which even no output at all would be a finding, had anything been judged.
    pp_file_descriptors_threshold = -1;
    file_descriptors_percent_threshold = INT32_MIN;
    fakes.add("cat", "#!/bin/sh\ntouch \"$0.ran\"\n");
    fakes.add("runAsRoot", "#!/bin/sh\ntouch \"$0.ran\"\n");

    std::string report = fake::run_without_descriptors([this] {
        const uint32_t src = check();
        std::string text = dec(src) + "\n" + dec(takeLogCrc) + " " + dec(takeLogValue) + " " +
                           dec(outbufferleft) + "\n";
        for (const std::string &trace : rec::traces()) {
            text += trace + "\n";
        }
        return text + block_text();
    });

    // Without a pipe the script is never started: neither trace of its start is written.
    EXPECT_EQ(report, "0\n0 0 " + dec(BUDGET_AFTER_HEADERS) + "\n" + CHECK_ENTRY + "\n" +
                          "TARNMNDF: rc from cat pipe call is: -1; errno=24.\n"
                          "TARNMNDF: rc from ls pipe call is: -1; errno=24.\n" +
                          CHECK_EXIT + "\n" + FILE_NR_SECTION + LISTING_SECTION);
    EXPECT_FALSE(std::filesystem::exists(fakes.path_of("cat") + ".ran"));
    EXPECT_FALSE(std::filesystem::exists(fakes.path_of("runAsRoot") + ".ran"));
}

TEST_F(OpenFiles, FirstAndLastTracesAndTheCrcPassedIn) {
    fake_file_nr("");
    fake_listing({});
    crc = 0xABCDEF;
    tookLog = 1;
    EXPECT_EQ(tarn_check_open_files(&takeLogCrc, &takeLogValue, &tookLog, &crc), 0u);
    EXPECT_EQ(crc, 0xABCDEFu);
    EXPECT_EQ(tookLog, 1u);
    EXPECT_EQ(rec::traces(),
              (lines{CHECK_ENTRY, ABOUT_TO_CALL, ABOUT_TO_PROCESS,
                     "TARNOTHF: <-- tarn_check_open_files, src = 0, crc = abcdef (hex)"}));
    expect_finding(0, 0);
}

TEST_F(OpenFiles, HostsOwnFileNrGivesItsMaximum) {
    fake_listing({});
    std::istringstream host(read_file("/proc/sys/fs/file-nr"));
    std::string allocated, free, maximum;
    ASSERT_TRUE(host >> allocated >> free >> maximum);
    // As the check reads it: kept within 32 bits, then ten times that, kept within 32 bits.
    const int64_t read = std::clamp<int64_t>(std::stoll(maximum), INT32_MIN, INT32_MAX);
    const auto expected =
        static_cast<int32_t>(std::clamp<int64_t>(read * 10, INT32_MIN, INT32_MAX));
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(rec::traces_starting("TARNMNDD: maximum open file descriptors = "),
              lines{"TARNMNDD: maximum open file descriptors = " + dec(expected) + " (dec)"});
    EXPECT_EQ(rec::traces_starting("TARNMNDD: total allocated file descriptors = ").size(), 1u);
}

// ---- The host's own file-nr and the project's own runAsRoot and lsmon.sh ----

// PATH with the build's appliance programs first and no fakes: the check as a host runs it.
class RealOpenFiles : public OpenFiles {
  protected:
    void SetUp() override {
        OpenFiles::SetUp();
        const char *path = std::getenv("PATH");
        saved_path = path != nullptr ? path : "";
        setenv("PATH", (std::string(TELV_LIBEXEC_DIR) + ":/usr/bin:/bin").c_str(), 1);
    }
    void TearDown() override {
        setenv("PATH", saved_path.c_str(), 1);
        OpenFiles::TearDown();
    }
    std::string saved_path;
};

TEST_F(RealOpenFiles, GenerousThresholdsFindNothingAndEveryProcessHasItsSummaryLine) {
    file_descriptors_percent_threshold = 1000;
    EXPECT_EQ(check(), 0u);
    expect_finding(0, 0);
    const std::string text = block_text();
    // This test process holds descriptors 0 to 2 at least: its header and a summary number.
    const std::string own = "/proc/" + std::to_string(getpid()) + "/fd: ";
    EXPECT_NE(text.find(own), std::string::npos) << text.substr(0, 2000);
    EXPECT_NE(rec::find_trace(ABOUT_TO_PROCESS), -1);
    EXPECT_EQ(rec::traces_starting("TARNMNDF: rc from").size(), 0u);
}

TEST_F(RealOpenFiles, ALowPerProcessThresholdReportsTheFirstProcessWithItsListing) {
    pp_file_descriptors_threshold = 2;
    EXPECT_EQ(check(), 0u);
    EXPECT_EQ(takeLogCrc, PROCESS_DESCRIPTORS);
    EXPECT_GT(takeLogValue, 2);
    // The first directory of the listing is the reported one: its listing follows the summary
    // lines in the pass's data, and the error text quotes the header of the next directory.
    const std::string text = block_text();
    const size_t attached = text.find("\n\r/proc/");
    ASSERT_NE(attached, std::string::npos);
    EXPECT_NE(text.find("fd:\n\rtotal ", attached), std::string::npos);
    EXPECT_EQ(std::string(topDataBlock)
                  .rfind("\n\rError Information: \n\rtoo many open files in "
                         "process\n\rEntire line was: \n\r/proc/",
                         0),
              0u);
}

// ---- The arithmetic ----

TEST(OpenFilesShare, TenthsOfAPercentTruncatedTowardZero) {
    EXPECT_EQ(share_in_use({24000, 0, 1000000}), 24);
    EXPECT_EQ(share_in_use({24000, 50, 1000000}), 23);
    EXPECT_EQ(share_in_use({0, 250, 10000}), -25);
    EXPECT_EQ(share_in_use({24000, 0, -10}), -2400000);
    EXPECT_EQ(share_in_use({1, 0, INT32_MIN}), 0);
}

TEST(OpenFilesShare, MaximumOfZeroGivesNoShare) {
    EXPECT_FALSE(share_in_use({24000, 0, 0}).has_value());
    EXPECT_FALSE(share_in_use({0, 0, 0}).has_value());
}

TEST(OpenFilesShare, DifferenceAndProductDoNotWrap) {
    // INT32_MAX - INT32_MIN is 2^32 - 1, and 1000 times that is far beyond 32 bits.
    EXPECT_EQ(share_in_use({INT32_MAX, INT32_MIN, INT32_MAX}), 2000);
    EXPECT_EQ(share_in_use({3000000, 0, 10000000}), 300);
}

TEST(OpenFilesShare, QuotientBeyond32BitsIsClamped) {
    EXPECT_EQ(share_in_use({2147483, 0, 1}), 2147483000);
    EXPECT_EQ(share_in_use({2147484, 0, 1}), INT32_MAX);
    EXPECT_EQ(share_in_use({INT32_MAX, INT32_MIN, 1}), INT32_MAX);
    EXPECT_EQ(share_in_use({INT32_MIN, INT32_MAX, 1}), INT32_MIN);
    EXPECT_EQ(share_in_use({INT32_MIN, 0, -1}), INT32_MAX);
    EXPECT_EQ(share_in_use({-2147484, 0, 1}), INT32_MIN);
}

} // namespace

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include "control_file_fixture.h"
#include "core/control_file.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "recording_platform.h"

namespace {

using control_file_test::first_pass;
using control_file_test::second_pass;

std::string pointer_text(const void *pointer) {
    char text[64];
    std::snprintf(text, sizeof text, "%p", pointer);
    return text;
}

std::vector<std::string> traces_from(int first, size_t count) {
    const auto &all = rec::traces();
    std::vector<std::string> some;
    for (size_t i = static_cast<size_t>(first); i < all.size() && some.size() < count; ++i) {
        some.push_back(all[i]);
    }
    return some;
}

void some_routine(const char *, char **) {}
void other_routine(const char *, char **) {}

class ControlFile : public control_file_test::ControlFileTest {};

TEST_F(ControlFile, EntryAndExitTraces) {
    EXPECT_EQ(parse("ACTUALLY_RUN\n"), 0u);
    EXPECT_EQ(crc, 0u);
    ASSERT_FALSE(rec::traces().empty());
    EXPECT_EQ(rec::traces().front(), "TARNOTHF: --> tarn_parse_control_file()");
    EXPECT_EQ(rec::traces().back(),
              "TARNOTHF: <-- tarn_parse_control_file(), src = 0, crc = 0 (hex)");
}

TEST_F(ControlFile, AsteriskAsFirstByteMakesAComment) {
    EXPECT_EQ(parse("*ACTUALLY_RUN\n"), 0u);
    EXPECT_EQ(actuallyRun, 0);
    EXPECT_TRUE(rec::has_trace(first_pass({"*ACTUALLY_RUN"})));
    EXPECT_TRUE(rec::has_trace(second_pass({"*ACTUALLY_RUN"})));
}

TEST_F(ControlFile, AsteriskAfterABlankIsNoComment) {
    EXPECT_EQ(parse(" *ACTUALLY_RUN\n"), 0u);
    EXPECT_EQ(actuallyRun, 0); // "*ACTUALLY_RUN" matches no keyword
    EXPECT_TRUE(rec::has_trace(first_pass({"*ACTUALLY_RUN"})));
}

TEST_F(ControlFile, CommentedTableLineIsNeitherCountedNorFilled) {
    EXPECT_EQ(parse("*PROCESS_LOG_THRESHOLDS 1 2 3 1 java\nACTUALLY_RUN\n"), 0u);
    EXPECT_EQ(num_log_thresholds, 0);
    EXPECT_EQ(logtable, nullptr);
    EXPECT_EQ(actuallyRun, 1);
}

TEST_F(ControlFile, KeywordWithoutValueTakesTheNextLinesFirstWord) {
    EXPECT_EQ(parse("SNAPSHOT_INTERVAL\nCHECKING_INTERVAL 30\n"), 0u);
    EXPECT_EQ(snapshot_interval, 0);
    EXPECT_EQ(checking_interval, 30);
    EXPECT_TRUE(rec::has_trace(first_pass({"SNAPSHOT_INTERVAL", "CHECKING_INTERVAL", "30"})));
    EXPECT_TRUE(rec::has_trace(first_pass({"CHECKING_INTERVAL", "30"})));
}

TEST_F(ControlFile, SplitRunsOnIntoLaterLinesUpToTwelveWords) {
    EXPECT_EQ(parse("A 1\nB 2 3 4 5 6 7\nC 8 9 10 11\n"), 0u);
    EXPECT_EQ(rec::traces()[1],
              "TARNMNDF:    Input data = [A] [1] [B] [2] [3] [4] [5] [6] [7] [C] [8] [9]");
    EXPECT_EQ(rec::traces()[2],
              first_pass({"B", "2", "3", "4", "5", "6", "7", "C", "8", "9", "10", "11"}));
    EXPECT_EQ(rec::traces()[3], first_pass({"C", "8", "9", "10", "11"}));
}

TEST_F(ControlFile, EmptyLineTakesTheNextLinesWords) {
    // The split of an empty line starts at its line feed and reads the next line, so the keyword
    // below counts twice.
    EXPECT_EQ(parse("\nPROCESS_LOG_THRESHOLDS 1 2 3 1 java\n"), 0u);
    EXPECT_EQ(num_log_thresholds, 2);
    EXPECT_STREQ(logtable[0].process_mask, "java");
    EXPECT_STREQ(logtable[1].process_mask, "java");
}

TEST_F(ControlFile, BlankLinesBeforeALineAllTakeItsWords) {
    EXPECT_EQ(parse("\n \r\n\t\nMIN_SWAP_SIZE 5 x\n \nLOW_FREE_SIZE 6\n"), 0u);
    const std::vector<std::string> expected = {
        first_pass({"MIN_SWAP_SIZE", "5", "x", "LOW_FREE_SIZE", "6"}),
        first_pass({"MIN_SWAP_SIZE", "5", "x", "LOW_FREE_SIZE", "6"}),
        first_pass({"MIN_SWAP_SIZE", "5", "x", "LOW_FREE_SIZE", "6"}),
        first_pass({"MIN_SWAP_SIZE", "5", "x", "LOW_FREE_SIZE", "6"}),
        first_pass({"LOW_FREE_SIZE", "6"}),
        first_pass({"LOW_FREE_SIZE", "6"}),
    };
    EXPECT_EQ(rec::traces_starting("TARNMNDF:    Input data"), expected);
    EXPECT_EQ(min_swap_size, 5);
    EXPECT_EQ(low_free_size, 6);
}

// What sscanf with twelve "%s" gives from `from`, each word then cut at 249 characters as the
// monitor cuts it; buffers as long as the whole text, so that no word can overrun them.
std::vector<std::string> words_as_sscanf_splits(const char *from) {
    const size_t room = std::strlen(from) + 1;
    std::vector<std::vector<char>> slot(12, std::vector<char>(room, '\0'));
    std::sscanf(from, "%s %s %s %s %s %s %s %s %s %s %s %s", slot[0].data(), slot[1].data(),
                slot[2].data(), slot[3].data(), slot[4].data(), slot[5].data(), slot[6].data(),
                slot[7].data(), slot[8].data(), slot[9].data(), slot[10].data(), slot[11].data());
    std::vector<std::string> split;
    for (const auto &word : slot) {
        split.emplace_back(word.data(), strnlen(word.data(), 249));
    }
    return split;
}

// The first-pass trace lines of `text`, one for each line ending in a line feed, each split from
// the line's first byte by sscanf itself.
std::vector<std::string> traces_by_sscanf(const std::string &text) {
    std::vector<std::string> lines;
    const char *all = text.c_str();
    for (const char *start = all; const char *end = std::strchr(start, '\n'); start = end + 1) {
        lines.push_back(first_pass(words_as_sscanf_splits(start)));
    }
    return lines;
}

// A text of words, blank runs, blank lines, comments, bytes above 127, words around the 249-byte
// cut and an occasional last line without its line feed.
std::string random_control_text(std::mt19937 &random) {
    static const char blanks[] = {' ', '\t', '\r', '\v', '\f', '\n'};
    static const char letters[] = {'A', 'b', '1', '-', '*', '\xa0', '\x85', '\xff', '_'};
    auto below = [&random](size_t limit) {
        return std::uniform_int_distribution<size_t>(0, limit - 1)(random);
    };
    std::string text;
    const size_t pieces = below(60);
    for (size_t i = 0; i < pieces; ++i) {
        switch (below(6)) {
        case 0: // a run of blank lines
            text.append(1 + below(5), '\n');
            break;
        case 1: // blanks of every kind
            for (size_t n = below(8) + 1; n > 0; --n) {
                text += blanks[below(sizeof blanks)];
            }
            break;
        case 2: { // a word near or beyond the cut
            size_t length = 245 + below(12);
            text.append(length, letters[below(sizeof letters)]);
            break;
        }
        default: // a short word
            for (size_t n = below(6) + 1; n > 0; --n) {
                text += letters[below(sizeof letters)];
            }
            break;
        }
        if (below(3) == 0) {
            text += '\n';
        }
    }
    return text;
}

TEST_F(ControlFile, SplitOfEveryLineIsWhatSscanfGives) {
    for (unsigned seed = 1; seed <= 400; ++seed) {
        std::mt19937 random(seed);
        const std::string text = random_control_text(random);
        rec::reset();
        reset_settings();
        parse(text);
        ASSERT_EQ(rec::traces_starting("TARNMNDF:    Input data"), traces_by_sscanf(text))
            << "seed " << seed;
        control_file_test::release_everything();
    }
}

TEST_F(ControlFile, SplitAfterBlankRunsAndLongWordsIsWhatSscanfGives) {
    const std::string texts[] = {
        "\n\n\nA\n\n\nB\n",
        "A\n\n\n" + std::string(300, 'w') + "\n\n\nB C\n",
        "\t\r\n \v\f\n" + std::string(249, 'x') + " " + std::string(250, 'y') + "\nZ",
        std::string(7, '\n') + "PROCESS_LOG_THRESHOLDS\n\n1\n\n2\n3 4\n\n" + std::string(260, 'p') +
            "\nEND",
        "A B C D E F G H I J K L M\n\n\nN\n",
    };
    for (const std::string &text : texts) {
        rec::reset();
        reset_settings();
        parse(text);
        EXPECT_EQ(rec::traces_starting("TARNMNDF:    Input data"), traces_by_sscanf(text)) << text;
        control_file_test::release_everything();
    }
}

TEST_F(ControlFile, CheckingIntervalBelowFiveBecomesSixty) {
    parse("CHECKING_INTERVAL 4\n");
    EXPECT_EQ(checking_interval, 60);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: checking_interval = 60 seconds"));
}

TEST_F(ControlFile, CheckingIntervalOfFiveStays) {
    parse("CHECKING_INTERVAL 5\n");
    EXPECT_EQ(checking_interval, 5);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: checking_interval = 5 seconds"));
}

TEST_F(ControlFile, CheckingIntervalIgnoredWhenTheHostGaveOne) {
    manualStart = 1;
    checking_interval = 17;
    parse("CHECKING_INTERVAL 30\nCHECKING_INTERVAL 2\n");
    EXPECT_EQ(checking_interval, 17);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: checking_interval = 17 seconds"));
    EXPECT_EQ(manualStart, 1);
}

TEST_F(ControlFile, TrendAnalysisPointsCappedAt24) {
    parse("TREND_ANALYSIS_POINTS 30\n");
    EXPECT_EQ(trend_analysis_points, 24);
    parse("TREND_ANALYSIS_POINTS 24\n");
    EXPECT_EQ(trend_analysis_points, 24);
    parse("TREND_ANALYSIS_POINTS 23\n");
    EXPECT_EQ(trend_analysis_points, 23);
}

TEST_F(ControlFile, SnapshotSizeOf100IsRaisedToTheDataBlock) {
    parse("MAX_SNAPSHOT_FILE_SIZE 100\n");
    EXPECT_EQ(max_snapshot_file_size, 1545056u);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: max_snapshot_file_size = 1545056 bytes"));
}

TEST_F(ControlFile, SnapshotSizeOf2000Is2000000Bytes) {
    parse("MAX_SNAPSHOT_FILE_SIZE 2000\n");
    EXPECT_EQ(max_snapshot_file_size, 2000000u);
}

TEST_F(ControlFile, SnapshotSizeAroundTheFloor) {
    parse("MAX_SNAPSHOT_FILE_SIZE 1545\n");
    EXPECT_EQ(max_snapshot_file_size, 1545056u);
    parse("MAX_SNAPSHOT_FILE_SIZE 1546\n");
    EXPECT_EQ(max_snapshot_file_size, 1546000u);
}

TEST_F(ControlFile, NegativeSnapshotSizeWrapsAndIsComparedUnsigned) {
    parse("MAX_SNAPSHOT_FILE_SIZE -1\n");
    EXPECT_EQ(max_snapshot_file_size, 4294966296u); // 0xFFFFFFFF x 1000, modulo 2^32
}

TEST_F(ControlFile, SnapshotSizeOfZeroIsRaisedToTheDataBlock) {
    parse("MAX_SNAPSHOT_FILE_SIZE 0\n");
    EXPECT_EQ(max_snapshot_file_size, 1545056u);
}

TEST_F(ControlFile, SnapshotSizeWhoseProductWrapsBelowTheFloorIsRaised) {
    parse("MAX_SNAPSHOT_FILE_SIZE 4294968\n"); // x 1000 = 2^32 + 704
    EXPECT_EQ(max_snapshot_file_size, 1545056u);
    parse("MAX_SNAPSHOT_FILE_SIZE 4296513\n"); // x 1000 = 2^32 + 1545704
    EXPECT_EQ(max_snapshot_file_size, 1545704u);
}

TEST_F(ControlFile, NegativeSnapshotSizeStaysAboveTheFloorAndIsTracedSigned) {
    parse("MAX_SNAPSHOT_FILE_SIZE -1545\n");
    EXPECT_EQ(max_snapshot_file_size, 4293422296u); // 2^32 - 1,545,000
    EXPECT_TRUE(rec::has_trace("TARNMNDF: max_snapshot_file_size = -1545000 bytes"));
}

TEST_F(ControlFile, SnapshotSizeBeyondTheRangeIsTheLargestNumberTimes1000) {
    parse("MAX_SNAPSHOT_FILE_SIZE 99999999999\n");
    EXPECT_EQ(max_snapshot_file_size, 4294966296u); // 2147483647 x 1000, modulo 2^32
    parse("MAX_SNAPSHOT_FILE_SIZE -99999999999\n");
    EXPECT_EQ(max_snapshot_file_size, 1545056u); // -2147483648 x 1000 is 0 modulo 2^32
}

TEST_F(ControlFile, SnapshotSizeAbsentStaysZero) {
    parse("ACTUALLY_RUN\n");
    EXPECT_EQ(max_snapshot_file_size, 0u);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: max_snapshot_file_size = 0 bytes"));
}

TEST_F(ControlFile, LastLineWithoutLineFeedIsIgnored) {
    parse("CHECKING_INTERVAL 30\nACTUALLY_RUN");
    EXPECT_EQ(actuallyRun, 0);
    EXPECT_EQ(checking_interval, 30);
    EXPECT_EQ(rec::traces_starting("TARNMNDF:    Input data").size(), 1u);
    // Its words are still the ones a short line before it runs on into.
    EXPECT_TRUE(rec::has_trace(first_pass({"CHECKING_INTERVAL", "30", "ACTUALLY_RUN"})));
}

TEST_F(ControlFile, FileWithoutAnyLineFeedSetsNothing) {
    EXPECT_EQ(parse("ACTUALLY_RUN"), 0u);
    EXPECT_EQ(actuallyRun, 0);
    EXPECT_TRUE(rec::traces_starting("TARNMNDF:    Input data").empty());
}

TEST_F(ControlFile, NumbersAreReadAsAtoiReadsThem) {
    parse("MIN_SWAP_SIZE   +42abc\nLOW_FREE_SIZE -7\nRSS_MEMORY_THRESHOLD abc\n"
          "VSZ_MEMORY_THRESHOLD 0x10\n");
    EXPECT_EQ(min_swap_size, 42);
    EXPECT_EQ(low_free_size, -7);
    EXPECT_EQ(rss_memory_threshold, 0);
    EXPECT_EQ(vsz_memory_threshold, 0);
}

TEST_F(ControlFile, NumbersReadAsAtoiReadsThemInRange) {
    const char *const words_read[] = {
        "0",   "+0",  "-0", "007",        "12abc",       "-",   "+",        "--5",
        "+-5", "-+5", "x1", "2147483647", "-2147483648", "1e3", "\xa0\x35", "99,5"};
    for (const char *word : words_read) {
        reset_settings();
        parse(std::string("MIN_SWAP_SIZE ") + word + "\n");
        EXPECT_EQ(min_swap_size, std::atoi(word)) << word;
        control_file_test::release_everything();
    }
}

TEST_F(ControlFile, NumbersBeyondTheRangeStopAtItsEnds) {
    parse("MIN_SWAP_SIZE 2147483648\nLOW_FREE_SIZE 99999999999999999999999999\n"
          "RSS_MEMORY_THRESHOLD -2147483649\nVSZ_ABORT_MEMORY_THRESHOLD -99999999999999999999\n"
          "CPU_TIME_THRESHOLD 00000000000000000000000000042\n"
          "PROCESS_LOG_THRESHOLDS 4294967296 -4294967296 4294967396 99999999999 a\n"
          "PROCESS_ABORT_THRESHOLDS 2147483648 -2147483649 18446744073709551617 b\n");
    EXPECT_EQ(min_swap_size, INT32_MAX);
    EXPECT_EQ(low_free_size, INT32_MAX);
    EXPECT_EQ(rss_memory_threshold, INT32_MIN);
    EXPECT_EQ(vsz_abort_memory_threshold, INT32_MIN);
    EXPECT_EQ(cpu_time_threshold, 42);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: min_swap_size = 2147483647 KB"));
    EXPECT_TRUE(rec::has_trace("TARNMNDF: rss_memory_threshold = -2147483648 KB"));
    ASSERT_EQ(logtable[0].compiled, 1u);
    EXPECT_EQ(logtable[0].rss_limit, INT32_MAX);
    EXPECT_EQ(logtable[0].dsiz_limit, INT32_MIN);
    EXPECT_EQ(logtable[0].vsize_limit, INT32_MAX);
    EXPECT_EQ(logtable[0].memoryCheckFlag, INT32_MAX);
    ASSERT_EQ(aborttable[0].compiled, 1u);
    EXPECT_EQ(aborttable[0].rss_abort_limit, INT32_MAX);
    EXPECT_EQ(aborttable[0].dsiz_abort_limit, INT32_MIN);
    EXPECT_EQ(aborttable[0].vsize_abort_limit, INT32_MAX);
}

TEST_F(ControlFile, KeywordsAreCaseSensitive) {
    parse("actually_run\nChecking_Interval 30\n");
    EXPECT_EQ(actuallyRun, 0);
    EXPECT_EQ(checking_interval, 0);
}

TEST_F(ControlFile, CarriageReturnsAreBlanks) {
    parse("ACTUALLY_RUN\r\nCPU_TIME_THRESHOLD 7\r\n");
    EXPECT_EQ(actuallyRun, 1);
    EXPECT_EQ(cpu_time_threshold, 7);
}

TEST_F(ControlFile, KeywordTwiceLastWinsAndTableRowsAddUp) {
    parse("CPU_TIME_THRESHOLD 3\nPROCESS_LOG_THRESHOLDS 1 2 3 1 a\nCPU_TIME_THRESHOLD 9\n"
          "PROCESS_LOG_THRESHOLDS 4 5 6 0 b\nPROCESS_ABORT_THRESHOLDS 7 8 9 c\n"
          "PROCESS_LOG_THRESHOLDS 10 11 12 1 d\n");
    EXPECT_EQ(cpu_time_threshold, 9);
    ASSERT_EQ(num_log_thresholds, 3);
    ASSERT_EQ(num_abort_thresholds, 1);
    EXPECT_STREQ(logtable[0].process_mask, "a");
    EXPECT_STREQ(logtable[1].process_mask, "b");
    EXPECT_STREQ(logtable[2].process_mask, "d");
    EXPECT_EQ(logtable[2].rss_limit, 10);
    EXPECT_EQ(logtable[2].dsiz_limit, 11);
    EXPECT_EQ(logtable[2].vsize_limit, 12);
    EXPECT_EQ(logtable[2].memoryCheckFlag, 1);
    EXPECT_EQ(logtable[1].memoryCheckFlag, 0);
    EXPECT_STREQ(aborttable[0].process_mask, "c");
    EXPECT_EQ(aborttable[0].rss_abort_limit, 7);
    EXPECT_EQ(aborttable[0].dsiz_abort_limit, 8);
    EXPECT_EQ(aborttable[0].vsize_abort_limit, 9);
    EXPECT_EQ(aborttable[0].compiled, 1u);
}

// Two log rows of which the first did not compile: the second ("10 20 30 1 ^java$") took its
// place, and row 1 stays empty.
void expect_second_log_row_in_place_of_the_first() {
    ASSERT_EQ(num_log_thresholds, 2);
    EXPECT_STREQ(logtable[0].process_mask, "^java$");
    EXPECT_EQ(logtable[0].compiled, 1u);
    EXPECT_EQ(logtable[0].rss_limit, 10);
    EXPECT_EQ(logtable[0].dsiz_limit, 20);
    EXPECT_EQ(logtable[0].vsize_limit, 30);
    EXPECT_EQ(logtable[0].memoryCheckFlag, 1);
    EXPECT_EQ(logtable[1].compiled, 0u);
    EXPECT_STREQ(logtable[1].process_mask, "");
}

// The one problem kept for the checker: a log row of line 1 that did not compile.
const control_file_problem &the_only_problem() {
    static control_file_tables tables{};
    read_control_file_tables(&tables);
    EXPECT_EQ(tables.problem_count, 1);
    const control_file_problem &problem = tables.problems[0];
    EXPECT_EQ(problem.kind, control_file_problem_kind::uncompiled_expression);
    EXPECT_EQ(problem.line, 1);
    EXPECT_STREQ(problem.keyword, "PROCESS_LOG_THRESHOLDS");
    return problem;
}

TEST_F(ControlFile, InvalidFirstLogExpressionIsOverwrittenByTheNextRow) {
    EXPECT_EQ(parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 [abc\n"
                    "PROCESS_LOG_THRESHOLDS 10 20 30 1 ^java$\n"),
              0u);
    EXPECT_EQ(crc, 0u);
    expect_second_log_row_in_place_of_the_first();
    EXPECT_TRUE(rec::events().empty()); // dropped without a report

    // The dropped row is remembered for the checker.
    const control_file_problem &problem = the_only_problem();
    EXPECT_STREQ(problem.first, "[abc");
    EXPECT_STRNE(problem.second, "");
}

TEST_F(ControlFile, InvalidLastAbortExpressionLeavesTheRowUnfilled) {
    parse("PROCESS_ABORT_THRESHOLDS 1 2 3 ^ok$\nPROCESS_ABORT_THRESHOLDS 4 5 6 a\\{1\n");
    ASSERT_EQ(num_abort_thresholds, 2);
    EXPECT_EQ(aborttable[0].compiled, 1u);
    EXPECT_EQ(aborttable[1].compiled, 0u);
    EXPECT_EQ(aborttable[1].rss_abort_limit, 0); // limits are set only when the row compiled
    EXPECT_STREQ(aborttable[1].process_mask, "a\\{1");
}

// The trace of a row whose repetitions are beyond the budget, for `expression` and `reason`.
std::string budget_trace(const std::string &expression, const std::string &reason) {
    return "TARNMNDF: expression [" + expression + "] not compiled: " + reason;
}

const std::string COUNT_REASON = "a counted repetition asks for more than 255 copies";
const std::string NESTED_REASON =
    "counted repetitions nested in groups multiply to more than 255 copies";
const std::string EXPANSION_REASON = "its repetitions would expand it by more than 512 parts";

TEST_F(ControlFile, LogExpressionBeyondTheBudgetFaresAsOneThatDoesNotCompile) {
    EXPECT_EQ(parse("PROCESS_LOG_THRESHOLDS 1 1 1 1 a\\{1,32767\\}\n"
                    "PROCESS_LOG_THRESHOLDS 10 20 30 1 ^java$\n"),
              0u);
    EXPECT_EQ(crc, 0u);
    expect_second_log_row_in_place_of_the_first();
    EXPECT_TRUE(rec::events().empty());

    // One trace, between the second pass's lines of the rejected row and of the next one.
    const std::string rejected = budget_trace("a\\{1,32767\\}", COUNT_REASON);
    EXPECT_EQ(rec::traces_starting("TARNMNDF: expression ["), std::vector<std::string>{rejected});
    int at = rec::find_trace(rejected);
    ASSERT_GT(at, 0);
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) - 1],
              second_pass({"PROCESS_LOG_THRESHOLDS", "1", "1", "1", "1", "a\\{1,32767\\}",
                           "PROCESS_LOG_THRESHOLDS", "10", "20", "30", "1", "^java$"}));
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 1],
              second_pass({"PROCESS_LOG_THRESHOLDS", "10", "20", "30", "1", "^java$"}));

    // The checker names the line and the budget's reason in place of the compiler's message.
    const control_file_problem &problem = the_only_problem();
    EXPECT_STREQ(problem.first, "a\\{1,32767\\}");
    EXPECT_EQ(problem.second, COUNT_REASON);
}

TEST_F(ControlFile, AbortExpressionBeyondTheBudgetFaresAsOneThatDoesNotCompile) {
    EXPECT_EQ(parse("ACTUALLY_RUN\n"
                    "PROCESS_ABORT_THRESHOLDS 1 2 3 \\(a\\{1,16\\}\\)\\{1,16\\}\n"
                    "PROCESS_ABORT_THRESHOLDS 4 5 6 ^db$\n"
                    "PROCESS_ABORT_THRESHOLDS 7 8 9 \\(ab\\)\\{1,172\\}\n"),
              0u);
    ASSERT_EQ(num_abort_thresholds, 3);
    EXPECT_STREQ(aborttable[0].process_mask, "^db$");
    EXPECT_EQ(aborttable[0].compiled, 1u);
    EXPECT_EQ(aborttable[0].rss_abort_limit, 4);
    EXPECT_EQ(aborttable[0].dsiz_abort_limit, 5);
    EXPECT_EQ(aborttable[0].vsize_abort_limit, 6);
    // The last rejected text stays in its row, as a last row the compiler refused does.
    EXPECT_STREQ(aborttable[1].process_mask, "\\(ab\\)\\{1,172\\}");
    EXPECT_EQ(aborttable[1].compiled, 0u);
    EXPECT_EQ(aborttable[1].rss_abort_limit, 0);
    EXPECT_EQ(aborttable[2].compiled, 0u);
    EXPECT_TRUE(rec::events().empty());
    EXPECT_EQ(rec::traces_starting("TARNMNDF: expression ["),
              (std::vector<std::string>{budget_trace("\\(a\\{1,16\\}\\)\\{1,16\\}", NESTED_REASON),
                                        budget_trace("\\(ab\\)\\{1,172\\}", EXPANSION_REASON)}));

    control_file_tables tables{};
    read_control_file_tables(&tables);
    ASSERT_EQ(tables.problem_count, 2);
    EXPECT_EQ(tables.problems[0].line, 2);
    EXPECT_STREQ(tables.problems[0].keyword, "PROCESS_ABORT_THRESHOLDS");
    EXPECT_EQ(tables.problems[0].second, NESTED_REASON);
    EXPECT_EQ(tables.problems[1].line, 4);
    EXPECT_EQ(tables.problems[1].second, EXPANSION_REASON);
}

TEST_F(ControlFile, CompilerRefusalStaysSilentBesideTheBudget) {
    // An ill-formed count is the compiler's to refuse: no trace, the compiler's own message.
    parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 a\\{1,99999x\\}\n");
    EXPECT_EQ(logtable[0].compiled, 0u);
    EXPECT_TRUE(rec::traces_starting("TARNMNDF: expression [").empty());
    control_file_tables tables{};
    read_control_file_tables(&tables);
    ASSERT_EQ(tables.problem_count, 1);
    EXPECT_NE(tables.problems[0].second, COUNT_REASON);
    EXPECT_STRNE(tables.problems[0].second, "");
}

struct budget_case {
    const char *expression;
    const char *reason; // null: compiled as written
};

// Each expression alone in a log row and in an abort row.
const budget_case BUDGET_CASES[] = {
    {"a\\{255\\}", nullptr},
    {"a\\{1,255\\}", nullptr},
    {"a\\{256\\}", COUNT_REASON.c_str()},
    {"a\\{1,256\\}", COUNT_REASON.c_str()},
    {"a\\{1,\\}", nullptr},
    {"a\\{255,\\}", nullptr},
    {"a\\{256,\\}", COUNT_REASON.c_str()},
    {"a*", nullptr},
    {"\\(a\\{1,15\\}\\)\\{1,17\\}", nullptr},
    {"\\(a\\{1,16\\}\\)\\{1,16\\}", NESTED_REASON.c_str()},
    {"[\\{1,999\\}]", nullptr},
    {"[]\\{1,999\\}]", nullptr},
    {"[^]\\{1,999\\}]", nullptr},
    {"[[:alpha:]\\{1,999\\}]", nullptr},
    {"a\\{1,255\\}b\\{1,255\\}c\\{1,5\\}", nullptr},
    {"a\\{1,255\\}b\\{1,255\\}c\\{1,6\\}", EXPANSION_REASON.c_str()},
    {"a\\{1,99999999999999999999\\}", COUNT_REASON.c_str()},
};

TEST_F(ControlFile, BudgetBoundariesInBothTables) {
    for (const budget_case &one : BUDGET_CASES) {
        SCOPED_TRACE(one.expression);
        control_file_test::release_everything();
        rec::reset();
        reset_settings();
        std::string expression = one.expression;
        parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 " + expression + "\nPROCESS_ABORT_THRESHOLDS 4 5 6 " +
              expression + "\n");
        ASSERT_EQ(num_log_thresholds, 1);
        ASSERT_EQ(num_abort_thresholds, 1);
        uint32_t compiled = one.reason == nullptr ? 1u : 0u;
        EXPECT_EQ(logtable[0].compiled, compiled);
        EXPECT_EQ(aborttable[0].compiled, compiled);
        std::vector<std::string> expected;
        if (one.reason != nullptr) {
            expected.assign(2, budget_trace(expression, one.reason));
        }
        EXPECT_EQ(rec::traces_starting("TARNMNDF: expression ["), expected);
    }
}

TEST_F(ControlFile, ExpressionsWithinTheBudgetAreCompiledAsWritten) {
    parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 ^x[\\{1,999\\}]\\{2\\}$\n"
          "PROCESS_LOG_THRESHOLDS 1 2 3 1 ^a\\{255\\}$\n");
    ASSERT_EQ(logtable[0].compiled, 1u);
    ASSERT_EQ(logtable[1].compiled, 1u);
    // A backslash and "\{" inside brackets are members of the set.
    EXPECT_EQ(regexec(&logtable[0].expression, "x{9", 0, nullptr, 0), 0);
    EXPECT_EQ(regexec(&logtable[0].expression, "x\\,", 0, nullptr, 0), 0);
    EXPECT_EQ(regexec(&logtable[0].expression, "x{", 0, nullptr, 0), REG_NOMATCH);
    EXPECT_EQ(regexec(&logtable[1].expression, std::string(255, 'a').c_str(), 0, nullptr, 0), 0);
    EXPECT_EQ(regexec(&logtable[1].expression, std::string(256, 'a').c_str(), 0, nullptr, 0),
              REG_NOMATCH);
}

// The line that once held the monitor's start for over a minute and took 6.5 GB: parsed in a child
// whose address space is capped a few hundred MB above what it has, and which an alarm ends
// after 10 seconds, it is refused at once.
TEST_F(ControlFile, HugeCountedRepetitionIsRefusedBeforeTheCompilerSeesIt) {
#ifndef TARN_SANITIZED
    long in_use = 0;
    std::ifstream("/proc/self/statm") >> in_use;
    in_use *= sysconf(_SC_PAGESIZE);
    ASSERT_GT(in_use, 0);
#endif
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
#ifndef TARN_SANITIZED
        // The sanitizers' shadow memory needs an address space without a cap.
        auto most = static_cast<rlim_t>(in_use + (384L << 20));
        struct rlimit cap = {most, most};
        if (setrlimit(RLIMIT_AS, &cap) != 0) {
            _exit(10);
        }
#endif
        alarm(10);
        parse("PROCESS_LOG_THRESHOLDS 1 1 1 1 a\\{1,32767\\}\n");
        int wrong = logtable[0].compiled != 0 ? 1 : 0;
        wrong |= rec::has_trace(budget_trace("a\\{1,32767\\}", COUNT_REASON)) ? 0 : 2;
        _exit(wrong);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status)) << "ended by signal " << WTERMSIG(status);
    EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST_F(ControlFile, LogExpressionsKeepSubexpressionsAbortOnesDoNot) {
    parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 b+c\nPROCESS_ABORT_THRESHOLDS 1 2 3 b+c\n");
    ASSERT_EQ(logtable[0].compiled, 1u);
    ASSERT_EQ(aborttable[0].compiled, 1u);
    regmatch_t match[1] = {{-7, -7}};
    // Basic syntax: '+' is an ordinary character.
    EXPECT_EQ(regexec(&logtable[0].expression, "abbc", 1, match, 0), REG_NOMATCH);
    EXPECT_EQ(regexec(&logtable[0].expression, "ab+c", 1, match, 0), 0);
    EXPECT_EQ(match[0].rm_so, 1);
    EXPECT_EQ(match[0].rm_eo, 4);
    match[0] = {-7, -7};
    EXPECT_EQ(regexec(&aborttable[0].expression, "ab+c", 1, match, 0), 0);
    EXPECT_EQ(match[0].rm_so, -7); // REG_NOSUB: no positions reported
    // Case-sensitive.
    EXPECT_EQ(regexec(&aborttable[0].expression, "AB+C", 0, nullptr, 0), REG_NOMATCH);
}

TEST_F(ControlFile, ExpressionsTreatALineFeedAsAnOrdinaryCharacter) {
    // Without REG_NEWLINE, '^' and '$' hold only at the ends of the whole name.
    parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 ^db$\nPROCESS_ABORT_THRESHOLDS 1 2 3 ^db$\n");
    ASSERT_EQ(logtable[0].compiled, 1u);
    ASSERT_EQ(aborttable[0].compiled, 1u);
    for (const regex_t *expression : {&logtable[0].expression, &aborttable[0].expression}) {
        EXPECT_EQ(regexec(expression, "db", 0, nullptr, 0), 0);
        EXPECT_EQ(regexec(expression, "x\ndb", 0, nullptr, 0), REG_NOMATCH);
        EXPECT_EQ(regexec(expression, "db\nx", 0, nullptr, 0), REG_NOMATCH);
    }
}

TEST_F(ControlFile, TableLineWithTooFewWordsTakesTheRestFromTheNextLines) {
    parse("PROCESS_ABORT_THRESHOLDS 100 200\n300 ^x$\nPROCESS_LOG_THRESHOLDS 5\n"
          "CHECKING_INTERVAL 30\n");
    ASSERT_EQ(num_abort_thresholds, 1);
    EXPECT_EQ(aborttable[0].rss_abort_limit, 100);
    EXPECT_EQ(aborttable[0].dsiz_abort_limit, 200);
    EXPECT_EQ(aborttable[0].vsize_abort_limit, 300);
    EXPECT_STREQ(aborttable[0].process_mask, "^x$");
    // The log row takes CHECKING_INTERVAL as its dsiz limit (0), 30 as vsize, and so on.
    ASSERT_EQ(num_log_thresholds, 1);
    EXPECT_EQ(logtable[0].rss_limit, 5);
    EXPECT_EQ(logtable[0].dsiz_limit, 0);
    EXPECT_EQ(logtable[0].vsize_limit, 30);
    EXPECT_EQ(logtable[0].memoryCheckFlag, 0);
    EXPECT_STREQ(logtable[0].process_mask, "");
    EXPECT_EQ(logtable[0].compiled, 1u); // the empty expression compiles
    EXPECT_EQ(checking_interval, 30);
}

TEST_F(ControlFile, TableLineAtTheEndOfTheFileTakesEmptyWords) {
    parse("EXTERNAL_CHECKING_ROUTINE\n");
    ASSERT_EQ(num_external_calls, 1);
    EXPECT_STREQ(calllist1[0].name, "");
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE086);
}

TEST_F(ControlFile, WordOf249CharactersIsKept) {
    std::string word(249, 'w');
    parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 " + word + " next\n");
    EXPECT_TRUE(
        rec::has_trace(first_pass({"PROCESS_LOG_THRESHOLDS", "1", "2", "3", "1", word, "next"})));
    EXPECT_EQ(std::string(words[5]), word);
    EXPECT_EQ(std::string(logtable[0].process_mask), word);
}

TEST_F(ControlFile, WordOf250CharactersIsCutAndItsRestSkipped) {
    std::string word(249, 'w');
    parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 " + word + "X next\n");
    EXPECT_TRUE(
        rec::has_trace(first_pass({"PROCESS_LOG_THRESHOLDS", "1", "2", "3", "1", word, "next"})));
    EXPECT_EQ(std::string(logtable[0].process_mask), word);
    EXPECT_EQ(words[5][249], '\0');
}

TEST_F(ControlFile, VeryLongWordsStayInTheirSlots) {
    std::string huge(5000, 'h');
    parse("SNAPSHOT_INTERVAL " + huge + " " + huge + "\n");
    EXPECT_TRUE(rec::has_trace(
        first_pass({"SNAPSHOT_INTERVAL", huge.substr(0, 249), huge.substr(0, 249)})));
    EXPECT_EQ(snapshot_interval, 0);
}

TEST_F(ControlFile, LongRoutineNameIsCutTo99InTheTable) {
    std::string name(150, 'r');
    rec::register_function("mod", name, reinterpret_cast<void *>(&some_routine));
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE mod " + name + "\n"), 0u);
    EXPECT_EQ(std::string(calllist1[0].name), name.substr(0, 99));
    EXPECT_EQ(calllist1[0].address, reinterpret_cast<void *>(&some_routine));
}

TEST_F(ControlFile, FileOf100000BytesCutAtItsLastByte) {
    // What the monitor reads: 100,000 bytes, the last forced to NUL. The line that the cut
    // leaves without its line feed is not read.
    std::string text = "ACTUALLY_RUN\n";
    while (text.size() < 99990) {
        text += "* filler line of the large file\n";
    }
    size_t lines = 0;
    text.resize(99999, '*');
    for (char c : text) {
        lines += c == '\n' ? 1 : 0;
    }
    text += "CHECKING_INTERVAL 30\n"; // beyond the cut
    text.resize(100000);
    text[99999] = '\0';
    EXPECT_EQ(tarn_parse_control_file(text.c_str(), &crc), 0u);
    EXPECT_EQ(actuallyRun, 1);
    EXPECT_EQ(checking_interval, 0);
    EXPECT_EQ(rec::traces_starting("TARNMNDF:    Input data").size(), lines);
    EXPECT_EQ(rec::traces_starting("TARNMNDF:  second pass Input data").size(), lines);
}

TEST_F(ControlFile, FileOfBlankLinesOnly) {
    std::string text(99999, '\n');
    EXPECT_EQ(parse(text), 0u);
    EXPECT_EQ(rec::traces_starting("TARNMNDF:    Input data").size(), 99999u);
    EXPECT_EQ(rec::traces()[1], first_pass({}));
}

TEST_F(ControlFile, FileOfCommentsOnly) {
    EXPECT_EQ(parse("* settings of the host monitor\n*ACTUALLY_RUN\n*CHECKING_INTERVAL 30\n"
                    "*PROCESS_LOG_THRESHOLDS 1 2 3 1 x\n"),
              0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(actuallyRun, 0);
    EXPECT_EQ(checking_interval, 0);
    EXPECT_EQ(num_external_calls, 0);
    EXPECT_EQ(num_log_thresholds, 0);
    EXPECT_EQ(num_abort_thresholds, 0);
    EXPECT_EQ(rec::calls(rec::Call::malloc), 0);
    EXPECT_TRUE(rec::has_trace("TARNOTHF: external call table is NULL"));
    EXPECT_TRUE(rec::has_trace("TARNOTHF: Log table is NULL"));
    EXPECT_TRUE(rec::has_trace("TARNOTHF: Abort table is NULL"));
    EXPECT_TRUE(rec::dumps().empty());
}

// A file that sets every setting to a value of its own.
const char *const EVERY_SETTING = "ACTUALLY_RUN\n"
                                  "MINIMUM_JAVA_FREE_SPACE 101\n"
                                  "CHECKING_INTERVAL 102\n"
                                  "SNAPSHOT_INTERVAL 103\n"
                                  "TREND_ANALYSIS_POINTS 20\n"
                                  "TREND_ANALYSIS_NUM_INCREASES 105\n"
                                  "MAX_SNAPSHOT_FILE_SIZE 2106\n"
                                  "LOW_FREE_SIZE 107\n"
                                  "MIN_SWAP_SIZE 108\n"
                                  "RESUME_JAVA_LOG_ON_PERCENT 109\n"
                                  "TOTAL_MEMORY_IN_USE_THRESHOLD 110\n"
                                  "TOTAL_MEMORY_PERCENT_THRESHOLD 111\n"
                                  "RESUME_MEMORY_PERCENT_THRESHOLD 112\n"
                                  "VSZ_MEMORY_THRESHOLD 113\n"
                                  "RSS_MEMORY_THRESHOLD 114\n"
                                  "DSIZ_MEMORY_THRESHOLD 115\n"
                                  "VSZ_ABORT_MEMORY_THRESHOLD 116\n"
                                  "RSS_ABORT_MEMORY_THRESHOLD 117\n"
                                  "DSIZ_ABORT_MEMORY_THRESHOLD 118\n"
                                  "CPU_PERCENT_THRESHOLD 119\n"
                                  "CPU_TIME_THRESHOLD 120\n"
                                  "CPU_PERCENT_THRESHOLD_QV 121\n"
                                  "DASD_PERCENT_THRESHOLD 122\n"
                                  "DASD_PERCENT_SLASH_THRESHOLD 123\n"
                                  "DASD_PERCENT_SLASH_INODE_THRESHOLD 124\n"
                                  "DASD_PERCENT_VAR_THRESHOLD 125\n"
                                  "DASD_PERCENT_VAR_INODE_THRESHOLD 126\n"
                                  "DASD_PERCENT_TMP_THRESHOLD 127\n"
                                  "DASD_PERCENT_TMP_INODE_THRESHOLD 128\n"
                                  "DASD_PERCENT_CONSOLE_THRESHOLD 129\n"
                                  "DASD_PERCENT_CONSOLE_INODE_THRESHOLD 130\n"
                                  "DASD_PERCENT_FFDC_THRESHOLD 131\n"
                                  "DASD_PERCENT_FFDC_INODE_THRESHOLD 132\n"
                                  "DASD_PERCENT_CONSOLE_FFDC_THRESHOLD 133\n"
                                  "DASD_PERCENT_CONSOLE_FFDC_INODE_THRESHOLD 134\n"
                                  "DASD_PERCENT_DEV_SHM_THRESHOLD 135\n"
                                  "DASD_PERCENT_DEV_SHM_INODE_THRESHOLD 136\n"
                                  "DASD_PERCENT_DUMP_THRESHOLD 137\n"
                                  "DASD_PERCENT_DUMP_INODE_THRESHOLD 138\n"
                                  "DASD_PERCENT_EXTRA_THRESHOLD 139\n"
                                  "DASD_PERCENT_EXTRA_INODE_THRESHOLD 140\n"
                                  "DASD_PERCENT_KZRDUMP_THRESHOLD 141\n"
                                  "DASD_PERCENT_KZRDUMP_INODE_THRESHOLD 142\n"
                                  "DASD_PERCENT_MNT_UPGRADE_THRESHOLD 143\n"
                                  "DASD_PERCENT_MNT_UPGRADE_INODE_THRESHOLD 144\n"
                                  "DASD_PERCENT_DATA_THRESHOLD 145\n"
                                  "DASD_PERCENT_DATA_INODE_THRESHOLD 146\n"
                                  "DASD_PERCENT_VAR_WQN_LOG_THRESHOLD 147\n"
                                  "DASD_PERCENT_VAR_WQN_LOG_INODE_THRESHOLD 148\n"
                                  "NUM_THREADS_THRESHOLD 149\n"
                                  "FILE_DESCRIPTORS_PERCENT_THRESHOLD 150\n"
                                  "PP_FILE_DESCRIPTORS_THRESHOLD 151\n"
                                  "CPU_SLEEP_TIME_THRESHOLD 152\n";

TEST_F(ControlFile, EverySettingIsSetFromItsLine) {
    parse(EVERY_SETTING);
    EXPECT_EQ(actuallyRun, 1);
    EXPECT_EQ(minimum_java_free_space, 101);
    EXPECT_EQ(checking_interval, 102);
    EXPECT_EQ(snapshot_interval, 103);
    EXPECT_EQ(trend_analysis_points, 20);
    EXPECT_EQ(trend_analysis_num_increases, 105);
    EXPECT_EQ(max_snapshot_file_size, 2106000u);
    EXPECT_EQ(low_free_size, 107);
    EXPECT_EQ(min_swap_size, 108);
    EXPECT_EQ(resume_java_log_on_percent, 109);
    EXPECT_EQ(total_memory_in_use_threshold, 110);
    EXPECT_EQ(total_memory_percent_threshold, 111);
    EXPECT_EQ(resume_memory_percent_threshold, 112);
    EXPECT_EQ(vsz_memory_threshold, 113);
    EXPECT_EQ(rss_memory_threshold, 114);
    EXPECT_EQ(dsiz_memory_threshold, 115);
    EXPECT_EQ(vsz_abort_memory_threshold, 116);
    EXPECT_EQ(rss_abort_memory_threshold, 117);
    EXPECT_EQ(dsiz_abort_memory_threshold, 118);
    EXPECT_EQ(cpu_percent_threshold, 119);
    EXPECT_EQ(cpu_time_threshold, 120);
    EXPECT_EQ(cpu_percent_threshold_qv, 121);
    EXPECT_EQ(dasd_percent_threshold, 122);
    EXPECT_EQ(dasd_percent_slash_threshold, 123);
    EXPECT_EQ(dasd_percent_slash_inode_threshold, 124);
    EXPECT_EQ(dasd_percent_var_threshold, 125);
    EXPECT_EQ(dasd_percent_var_inode_threshold, 126);
    EXPECT_EQ(dasd_percent_tmp_threshold, 127);
    EXPECT_EQ(dasd_percent_tmp_inode_threshold, 128);
    EXPECT_EQ(dasd_percent_console_threshold, 129);
    EXPECT_EQ(dasd_percent_console_inode_threshold, 130);
    EXPECT_EQ(dasd_percent_ffdc_threshold, 131);
    EXPECT_EQ(dasd_percent_ffdc_inode_threshold, 132);
    EXPECT_EQ(dasd_percent_console_ffdc_threshold, 133);
    EXPECT_EQ(dasd_percent_console_ffdc_inode_threshold, 134);
    EXPECT_EQ(dasd_percent_dev_shm_threshold, 135);
    EXPECT_EQ(dasd_percent_dev_shm_inode_threshold, 136);
    EXPECT_EQ(dasd_percent_dump_threshold, 137);
    EXPECT_EQ(dasd_percent_dump_inode_threshold, 138);
    EXPECT_EQ(dasd_percent_extra_threshold, 139);
    EXPECT_EQ(dasd_percent_extra_inode_threshold, 140);
    EXPECT_EQ(dasd_percent_kzrdump_threshold, 141);
    EXPECT_EQ(dasd_percent_kzrdump_inode_threshold, 142);
    EXPECT_EQ(dasd_percent_mnt_upgrade_threshold, 143);
    EXPECT_EQ(dasd_percent_mnt_upgrade_inode_threshold, 144);
    EXPECT_EQ(dasd_percent_data_threshold, 145);
    EXPECT_EQ(dasd_percent_data_inode_threshold, 146);
    EXPECT_EQ(dasd_percent_var_wqn_log_threshold, 147);
    EXPECT_EQ(dasd_percent_var_wqn_log_inode_threshold, 148);
    EXPECT_EQ(num_threads_threshold, 149);
    EXPECT_EQ(file_descriptors_percent_threshold, 150);
    EXPECT_EQ(pp_file_descriptors_threshold, 151);
    EXPECT_EQ(cpu_sleep_time_threshold, 152);
}

TEST_F(ControlFile, SettingsTraceEveryLineInOrder) {
    parse(std::string(EVERY_SETTING) + "PROCESS_LOG_THRESHOLDS 1 2 3 1 a\n"
                                       "PROCESS_ABORT_THRESHOLDS 1 2 3 a\n"
                                       "PROCESS_ABORT_THRESHOLDS 1 2 3 b\n");
    const std::vector<std::string> expected = {
        "TARNMNDF: actuallyRun = 1",
        "TARNMNDF: minimum_java_free_space = 101 percent (x10)",
        "TARNMNDF: checking_interval = 102 seconds",
        "TARNMNDF: snapshot_interval = 103 passes",
        "TARNMNDF: trend_analysis_points = 20 samples",
        "TARNMNDF: trend_analysis_num_increases = 105 increases",
        "TARNMNDF: low_free_size = 107 KB",
        "TARNMNDF: min_swap_size = 108 KB",
        "TARNMNDF: resume_java_log_on_percent = 109 percent (x10)",
        "TARNMNDF: total_memory_in_use_threshold = 110 KB",
        "TARNMNDF: total_memory_percent_threshold = 111 percent (x10)",
        "TARNMNDF: resume_memory_percent_threshold = 112 percent (x10)",
        "TARNMNDF: vsz_memory_threshold = 113 KB",
        "TARNMNDF: rss_memory_threshold = 114 KB",
        "TARNMNDF: dsiz_memory_threshold = 115 KB",
        "TARNMNDF: vsz_abort_memory_threshold = 116 KB",
        "TARNMNDF: rss_abort_memory_threshold = 117 KB",
        "TARNMNDF: dsiz_abort_memory_threshold = 118 KB",
        "TARNMNDF: cpu_percent_threshold = 119 ",
        "TARNMNDF: cpu_time_threshold = 120 samples",
        "TARNMNDF: cpu_percent_threshold_qv = 121 ",
        "TARNMNDF: dasd_percent_threshold = 122 percent",
        "TARNMNDF: max_snapshot_file_size = 2106000 bytes",
        "TARNMNDF: dasd_percent_slash_threshold = 123 percent",
        "TARNMNDF: dasd_percent_slash_inode_threshold = 124 percent",
        "TARNMNDF: dasd_percent_var_threshold = 125 percent",
        "TARNMNDF: dasd_percent_var_inode_threshold = 126 percent",
        "TARNMNDF: dasd_percent_tmp_threshold = 127 percent",
        "TARNMNDF: dasd_percent_tmp_inode_threshold = 128 percent",
        "TARNMNDF: dasd_percent_console_threshold = 129 percent",
        "TARNMNDF: dasd_percent_console_inode_threshold = 130 percent",
        "TARNMNDF: dasd_percent_ffdc_threshold = 131 percent",
        "TARNMNDF: dasd_percent_ffdc_inode_threshold = 132 percent",
        "TARNMNDF: dasd_percent_console_ffdc_threshold = 133 percent",
        "TARNMNDF: dasd_percent_console_ffdc_inode_threshold = 134 percent",
        "TARNMNDF: dasd_percent_dev_shm_threshold = 135 percent",
        "TARNMNDF: dasd_percent_dev_shm_inode_threshold = 136 percent",
        "TARNMNDF: dasd_percent_dump_threshold = 137 percent",
        "TARNMNDF: dasd_percent_dump_inode_threshold = 138 percent",
        "TARNMNDF: dasd_percent_extra_threshold = 139 percent",
        "TARNMNDF: dasd_percent_extra_inode_threshold = 140 percent",
        "TARNMNDF: dasd_percent_kzrdump_threshold = 141 percent",
        "TARNMNDF: dasd_percent_kzrdump_inode_threshold = 142 percent",
        "TARNMNDF: dasd_percent_mnt_upgrade_threshold = 143 percent",
        "TARNMNDF: dasd_percent_mnt_upgrade_inode_threshold = 144 percent",
        "TARNMNDF: dasd_percent_data_threshold = 145 percent",
        "TARNMNDF: dasd_percent_data_inode_threshold = 146 percent",
        "TARNMNDF: dasd_percent_var_wqn_log_threshold = 147 percent",
        "TARNMNDF: dasd_percent_var_wqn_log_indoe_threshold = 148 percent",
        "TARNMNDF: num_threads_threshold = 149 processes",
        "TARNMNDF: file_descriptors_percent_threshold = 150 percent (x10)",
        "TARNMNDF: pp_file_descriptors_threshold = 151 lines",
        "TARNMNDF: cpu_sleep_time_threshold = 152 percent (x10)",
        "TARNMNDF: num_external_calls = 0",
        "TARNMNDF: num_log_thresholds = 1",
        "TARNMNDF: num_abort_thresholds = 2",
        "TARNMNDF: sysRc = 0 (dec)",
    };
    int first = rec::find_trace(expected.front());
    ASSERT_GE(first, 0);
    // The settings follow the last line of the first pass.
    EXPECT_EQ(rec::traces()[static_cast<size_t>(first) - 1],
              first_pass({"PROCESS_ABORT_THRESHOLDS", "1", "2", "3", "b"}));
    EXPECT_EQ(traces_from(first, expected.size()), expected);
}

TEST_F(ControlFile, TracesOfTheTablesAndTheirDumps) {
    rec::register_function("modA", "first", reinterpret_cast<void *>(&some_routine));
    rec::register_function("modB", "second", reinterpret_cast<void *>(&other_routine));
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE modA first\n"
                    "PROCESS_LOG_THRESHOLDS 1500000 10 20 1 appserver\n"
                    "EXTERNAL_CHECKING_ROUTINE modB second\n"
                    "PROCESS_ABORT_THRESHOLDS 3000000 5 6 ^appserver$\n"
                    "PROCESS_LOG_THRESHOLDS 7 8 9 0 ^db\n"),
              0u);
    EXPECT_EQ(crc, 0u);
    ASSERT_NE(calllist1, nullptr);
    EXPECT_EQ(calllist1[0].address, reinterpret_cast<void *>(&some_routine));
    EXPECT_EQ(calllist1[0].handle, reinterpret_cast<void *>(&some_routine));
    EXPECT_EQ(calllist1[1].address, reinterpret_cast<void *>(&other_routine));

    const std::string bar = "TARNOTHF: ==========================================";
    const std::vector<std::string> expected = {
        "TARNMNDF: sysRc = 0 (dec)",
        "TARNMNDF: calllist1 = " + pointer_text(calllist1),
        "TARNMNDF: logtable = " + pointer_text(logtable),
        "TARNMNDF: aborttable = " + pointer_text(aborttable),
        second_pass({"EXTERNAL_CHECKING_ROUTINE", "modA", "first", "PROCESS_LOG_THRESHOLDS",
                     "1500000", "10", "20", "1", "appserver", "EXTERNAL_CHECKING_ROUTINE", "modB",
                     "second"}),
        second_pass({"PROCESS_LOG_THRESHOLDS", "1500000", "10", "20", "1", "appserver",
                     "EXTERNAL_CHECKING_ROUTINE", "modB", "second", "PROCESS_ABORT_THRESHOLDS",
                     "3000000", "5"}),
        second_pass({"EXTERNAL_CHECKING_ROUTINE", "modB", "second", "PROCESS_ABORT_THRESHOLDS",
                     "3000000", "5", "6", "^appserver$", "PROCESS_LOG_THRESHOLDS", "7", "8", "9"}),
        second_pass({"PROCESS_ABORT_THRESHOLDS", "3000000", "5", "6", "^appserver$",
                     "PROCESS_LOG_THRESHOLDS", "7", "8", "9", "0", "^db"}),
        second_pass({"PROCESS_LOG_THRESHOLDS", "7", "8", "9", "0", "^db"}),
        bar,
        "TARNOTHF: External call table entry 0 is: ",
        "TARNOTHF:   function name is [first]",
        "TARNOTHF:   address of function is " + pointer_text(calllist1[0].address),
        "TARNOTHF:   handle is " + pointer_text(calllist1[0].handle),
        "TARNOTHF: External call table entry 1 is: ",
        "TARNOTHF:   function name is [second]",
        "TARNOTHF:   address of function is " + pointer_text(calllist1[1].address),
        "TARNOTHF:   handle is " + pointer_text(calllist1[1].handle),
        bar,
        "TARNOTHF: Log threshold table entry 0 is: ",
        "TARNOTHF:   process name/mask is [appserver]",
        "TARNOTHF:   rss threshold is 1500000",
        "TARNOTHF:   dsiz threshold is 10",
        "TARNOTHF:   vsize threshold is 20",
        "TARNOTHF:   memoryCheckFlag is 1",
        "TARNOTHF: Log threshold table entry 1 is: ",
        "TARNOTHF:   process name/mask is [^db]",
        "TARNOTHF:   rss threshold is 7",
        "TARNOTHF:   dsiz threshold is 8",
        "TARNOTHF:   vsize threshold is 9",
        "TARNOTHF:   memoryCheckFlag is 0",
        bar,
        "TARNOTHF: abort threshold table entry 0 is: ",
        "TARNOTHF:   process name/mask is [^appserver$]",
        "TARNOTHF:   rss abort threshold is 3000000",
        "TARNOTHF:   dsiz abort threshold is 5",
        "TARNOTHF:   vsize abort threshold is 6",
        bar,
        "TARNOTHF: <-- tarn_parse_control_file(), src = 0, crc = 0 (hex)",
    };
    int first = rec::find_trace("TARNMNDF: sysRc = 0 (dec)");
    ASSERT_GE(first, 0);
    EXPECT_EQ(traces_from(first, expected.size() + 1), expected);

    // One dump of 64 bytes of each compiled expression, each closing its row's lines.
    ASSERT_EQ(rec::dumps().size(), 3u);
    const regex_t *dumped[] = {&logtable[0].expression, &logtable[1].expression,
                               &aborttable[0].expression};
    const char *const last_line_of_row[] = {"TARNOTHF:   memoryCheckFlag is 1",
                                            "TARNOTHF:   memoryCheckFlag is 0",
                                            "TARNOTHF:   vsize abort threshold is 6"};
    for (size_t i = 0; i < 3; ++i) {
        EXPECT_EQ(rec::dumps()[i].title, "TARNOTHF: compiled regular expression is: ");
        EXPECT_EQ(rec::dumps()[i].bytes,
                  std::string(reinterpret_cast<const char *>(dumped[i]), 64));
        EXPECT_EQ(rec::dumps()[i].after_traces,
                  static_cast<size_t>(rec::find_trace(last_line_of_row[i])) + 1);
    }
}

TEST_F(ControlFile, RowNeverFilledIsDumpedAsZeros) {
    parse("PROCESS_LOG_THRESHOLDS 1 2 3 1 \\(\nPROCESS_LOG_THRESHOLDS 4 5 6 1 \\(\n");
    ASSERT_EQ(num_log_thresholds, 2);
    EXPECT_EQ(logtable[0].compiled, 0u);
    EXPECT_STREQ(logtable[0].process_mask, "\\("); // the last failed text stays in its row
    EXPECT_EQ(logtable[0].rss_limit, 0);
    ASSERT_EQ(rec::dumps().size(), 2u);
    EXPECT_EQ(rec::dumps()[1].bytes, std::string(64, '\0'));
    EXPECT_TRUE(rec::has_trace("TARNOTHF:   process name/mask is [\\(]"));
    EXPECT_TRUE(rec::has_trace("TARNOTHF:   process name/mask is []"));
}

TEST_F(ControlFile, ExternalTableAllocationFails) {
    rec::fail(rec::Call::malloc, 0, 0, 0, 1);
    rec::register_function("m", "f", reinterpret_cast<void *>(&some_routine));
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE m f\nPROCESS_LOG_THRESHOLDS 1 2 3 1 a\n"
                    "PROCESS_ABORT_THRESHOLDS 1 2 3 b\n"),
              8u);
    EXPECT_EQ(crc, 0xE085u);
    EXPECT_EQ(num_external_calls, 0);
    EXPECT_EQ(calllist1, nullptr);
    int at = rec::find_trace("TARNMNDF: Error on malloc");
    ASSERT_GE(at, 0);
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 1], "TARNMNDF: calllist1 = (nil)");
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 2], "TARNMNDF: num_external_calls = 1");
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE085);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0u);
    EXPECT_EQ(rec::events()[0].record.option, 0x300u);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: sysRc = 8 (dec)"));
    // No second pass, for the tables that were allocated either.
    EXPECT_TRUE(rec::traces_starting("TARNMNDF:  second pass").empty());
    EXPECT_EQ(rec::calls(rec::Call::get_func_addr2), 0);
    ASSERT_NE(logtable, nullptr);
    EXPECT_EQ(logtable[0].compiled, 0u);
    EXPECT_EQ(aborttable[0].compiled, 0u);
    EXPECT_TRUE(rec::has_trace("TARNOTHF: external call table is NULL"));
    EXPECT_EQ(rec::traces().back(),
              "TARNOTHF: <-- tarn_parse_control_file(), src = 8, crc = e085 (hex)");
}

TEST_F(ControlFile, LogTableAllocationFails) {
    rec::fail(rec::Call::malloc, 0, 0, 1, 1);
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE m f\nPROCESS_LOG_THRESHOLDS 1 2 3 1 a\n"
                    "PROCESS_LOG_THRESHOLDS 1 2 3 1 a\nPROCESS_ABORT_THRESHOLDS 1 2 3 b\n"),
              8u);
    EXPECT_EQ(crc, 0xE087u);
    EXPECT_EQ(num_log_thresholds, 0);
    EXPECT_EQ(num_external_calls, 1);
    int at = rec::find_trace("TARNMNDF: Error on malloc");
    ASSERT_GE(at, 0);
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 1], "TARNMNDF: logtable = (nil)");
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 2], "TARNMNDF: num_log_thresholds = 2");
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE087);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0u);
    EXPECT_EQ(rec::calls(rec::Call::get_func_addr2), 0); // no second pass: nothing resolved
    EXPECT_TRUE(rec::has_trace("TARNOTHF: Log table is NULL"));
    // The abort table is still allocated after the failure, and left unfilled.
    EXPECT_EQ(rec::calls(rec::Call::malloc), 3);
    ASSERT_NE(aborttable, nullptr);
    EXPECT_EQ(aborttable[0].compiled, 0u);
    ASSERT_NE(calllist1, nullptr);
    EXPECT_STREQ(calllist1[0].name, "");
}

TEST_F(ControlFile, AbortTableIsAllocatedLast) {
    rec::fail(rec::Call::malloc, 0, 0, 2, 1);
    EXPECT_EQ(parse("PROCESS_ABORT_THRESHOLDS 1 2 3 b\nPROCESS_LOG_THRESHOLDS 1 2 3 1 a\n"
                    "EXTERNAL_CHECKING_ROUTINE m f\n"),
              8u);
    EXPECT_EQ(crc, 0xE088u);
    EXPECT_EQ(aborttable, nullptr);
    EXPECT_NE(calllist1, nullptr);
    EXPECT_NE(logtable, nullptr);
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE088);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0u);
    EXPECT_TRUE(rec::traces_starting("TARNMNDF:  second pass").empty());
}

TEST_F(ControlFile, AbortTableAllocationFails) {
    rec::fail(rec::Call::malloc, 0, 0, 0, 1);
    EXPECT_EQ(parse("PROCESS_ABORT_THRESHOLDS 1 2 3 b\n"), 8u);
    EXPECT_EQ(crc, 0xE088u);
    EXPECT_EQ(num_abort_thresholds, 0);
    int at = rec::find_trace("TARNMNDF: Error on malloc");
    ASSERT_GE(at, 0);
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 1], "TARNMNDF: aborttable = (nil)");
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 2], "TARNMNDF: num_abort_thresholds = 1");
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE088);
    EXPECT_TRUE(rec::has_trace("TARNOTHF: Abort table is NULL"));
}

TEST_F(ControlFile, SecondAllocationFailureGoesOutInTheSystemClass) {
    rec::fail(rec::Call::malloc, 0, 0, 0, -1);
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE m f\nPROCESS_LOG_THRESHOLDS 1 2 3 1 a\n"
                    "PROCESS_ABORT_THRESHOLDS 1 2 3 b\n"),
              8u);
    EXPECT_EQ(crc, 0xE088u); // the last failure's code
    ASSERT_EQ(rec::events().size(), 3u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE085);
    EXPECT_EQ(rec::events()[1].record.reason_code, 0xE0F1);
    EXPECT_EQ(rec::events()[1].record.comp_rc, 0u);
    EXPECT_EQ(rec::events()[1].record.option, 0x300u);
    EXPECT_EQ(rec::events()[2].record.reason_code, 0xE0F1);
    EXPECT_TRUE(rec::has_trace("TARNMNDF:     sysRc = a   compRc = 0   uiErrorId = e087"));
    EXPECT_TRUE(rec::has_trace("TARNMNDF:     sysRc = a   compRc = 0   uiErrorId = e088"));
    EXPECT_EQ(num_external_calls, 0);
    EXPECT_EQ(num_log_thresholds, 0);
    EXPECT_EQ(num_abort_thresholds, 0);
}

TEST_F(ControlFile, RoutineThatCannotBeResolved) {
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE nomodule noroutine\n"), 8u);
    EXPECT_EQ(crc, 2u); // as the module service left it
    ASSERT_EQ(num_external_calls, 1);
    EXPECT_STREQ(calllist1[0].name, "noroutine");
    EXPECT_EQ(calllist1[0].address, nullptr);
    int at = rec::find_trace("TARNMNDF: Error on modsvc_get_func_addr2()");
    ASSERT_GE(at, 0);
    EXPECT_EQ(rec::traces()[static_cast<size_t>(at) + 1], "TARNMNDF: src = 8, crc = 2 (dec)");
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE086);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 2u);
    EXPECT_EQ(rec::events()[0].record.option, 0x300u);
    EXPECT_EQ(rec::traces().back(),
              "TARNOTHF: <-- tarn_parse_control_file(), src = 8, crc = 2 (hex)");

    control_file_tables tables{};
    read_control_file_tables(&tables);
    ASSERT_EQ(tables.problem_count, 1);
    EXPECT_EQ(tables.problems[0].kind, control_file_problem_kind::unresolved_routine);
    EXPECT_STREQ(tables.problems[0].first, "nomodule");
    EXPECT_STREQ(tables.problems[0].second, "noroutine");
    EXPECT_EQ(tables.problems[0].rc, 8u);
    EXPECT_EQ(tables.problems[0].crc, 2u);
}

TEST_F(ControlFile, ModuleServiceFailurePassesItsCrc) {
    rec::register_function("m", "f", reinterpret_cast<void *>(&some_routine));
    rec::fail(rec::Call::get_func_addr2, 12, 77);
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE m f\n"), 8u);
    EXPECT_EQ(crc, 77u);
    EXPECT_TRUE(rec::has_trace("TARNMNDF: src = 12, crc = 77 (dec)"));
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 77u);
    EXPECT_EQ(calllist1[0].address, nullptr);
}

TEST_F(ControlFile, SecondUnresolvedRoutineGoesOutAsE0F1AndTheRestStillResolve) {
    rec::register_function("m", "good", reinterpret_cast<void *>(&some_routine));
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE m bad1\nEXTERNAL_CHECKING_ROUTINE m bad2\n"
                    "EXTERNAL_CHECKING_ROUTINE m good\n"),
              8u);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE086);
    EXPECT_EQ(rec::events()[1].record.reason_code, 0xE0F1);
    EXPECT_EQ(rec::events()[1].record.comp_rc, 2u);
    EXPECT_EQ(rec::events()[1].record.option, 0x300u);
    EXPECT_EQ(calllist1[2].address, reinterpret_cast<void *>(&some_routine));
    EXPECT_EQ(crc, 0u); // the last call of the module service succeeded
}

TEST_F(ControlFile, ReleaseGivesBackRoutinesAndFreesEverything) {
    rec::register_function("m", "f", reinterpret_cast<void *>(&some_routine));
    parse("EXTERNAL_CHECKING_ROUTINE m f\nEXTERNAL_CHECKING_ROUTINE m missing\n"
          "PROCESS_LOG_THRESHOLDS 1 2 3 1 a\nPROCESS_ABORT_THRESHOLDS 1 2 3 b\n");
    EXPECT_EQ(rec::live_allocations().size(), 3u);
    control_file_test::release_everything();
    EXPECT_EQ(rec::calls(rec::Call::release_func_addr), 1); // only the resolved one
    EXPECT_EQ(calllist1, nullptr);
    EXPECT_EQ(logtable, nullptr);
    EXPECT_EQ(aborttable, nullptr);
    EXPECT_TRUE(rec::live_allocations().empty());
}

TEST_F(ControlFile, ReleaseWithoutTablesDoesNothing) {
    uint32_t release_crc = 5;
    release_control_file_tables(&release_crc);
    EXPECT_EQ(release_crc, 5u);
    EXPECT_EQ(rec::calls(rec::Call::release_func_addr), 0);
}

TEST_F(ControlFile, ResetSettingsRestoresLoadTimeValues) {
    parse(EVERY_SETTING);
    manualStart = 1;
    control_file_test::release_everything();
    reset_settings();
    EXPECT_EQ(actuallyRun, 0);
    EXPECT_EQ(max_snapshot_file_size, 0u);
    EXPECT_EQ(cpu_sleep_time_threshold, 0);
    EXPECT_EQ(manualStart, 0);
    EXPECT_EQ(num_log_thresholds, 0);
}

TEST_F(ControlFile, ExportedSettingsTableIsTheParsersTable) {
    size_t count = 0;
    const setting *table = settings_table(&count);
    EXPECT_EQ(table, SETTINGS);
    EXPECT_EQ(count, 56u); // 53 settings and 3 table keywords
}

} // namespace

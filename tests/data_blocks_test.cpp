#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>

#include "data_blocks.h"

namespace {

constexpr char OVERFLOW_LINE[] = "No room to output more lines... \n\r";
constexpr char PS_HEADER[] = "  \n\rAbout to output ps data \n\r"; // 30 bytes
// The most text primaryDataBlock holds: one byte stays for its terminating NUL.
constexpr size_t BLOCK_TEXT_MAX = PRIMARY_DATA_BLOCK_SIZE - 1;

std::string block_text() {
    return std::string(primaryDataBlock, strnlen(primaryDataBlock, PRIMARY_DATA_BLOCK_SIZE));
}

bool block_is_zero() {
    return std::all_of(primaryDataBlock, primaryDataBlock + PRIMARY_DATA_BLOCK_SIZE,
                       [](char c) { return c == '\0'; });
}

// Appends unbudgeted text until primaryDataBlock holds `length` bytes of it.
void fill_block_to(size_t length) {
    const std::string chunk(100000, 'f');
    while (primary_data_length() + chunk.size() <= length) {
        append_unbudgeted(chunk.c_str());
    }
    append_unbudgeted(chunk.substr(0, length - primary_data_length()).c_str());
    ASSERT_EQ(primary_data_length(), length);
}

// Every test starts a pass as the loop does: an empty block, the full budget, no overflow yet.
class DataBlocks : public ::testing::Test {
  protected:
    void SetUp() override { start_pass(); }
    void TearDown() override { start_pass(); }

    static void start_pass() {
        clear_primary_data_block();
        outbufferleft = OUTBUFFER_BUDGET;
        pdboverflow = 0;
    }
};

TEST_F(DataBlocks, DataLineGoesInWithItsLineEndAndCostsItsLengthPlusThree) {
    append_data_line("abc");
    EXPECT_EQ(block_text(), "abc\n\r");
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET - 6);
    EXPECT_EQ(pdboverflow, 0);
    append_data_line("");
    EXPECT_EQ(block_text(), "abc\n\r\n\r");
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET - 9);
}

TEST_F(DataBlocks, LengthPlusFiveEqualToTheBudgetOverflows) {
    outbufferleft = 10;
    append_data_line("12345");
    EXPECT_EQ(block_text(), OVERFLOW_LINE);
    EXPECT_EQ(outbufferleft, 4);
    EXPECT_EQ(pdboverflow, 1);
}

TEST_F(DataBlocks, LengthPlusFiveOneBelowTheBudgetGoesIn) {
    outbufferleft = 11;
    append_data_line("12345");
    EXPECT_EQ(block_text(), "12345\n\r");
    EXPECT_EQ(outbufferleft, 3);
    EXPECT_EQ(pdboverflow, 0);
    // Now even an empty line (0 + 5 >= 3) finds no room.
    append_data_line("");
    EXPECT_EQ(block_text(), std::string("12345\n\r") + OVERFLOW_LINE);
    EXPECT_EQ(outbufferleft, 4);
    EXPECT_EQ(pdboverflow, 1);
}

TEST_F(DataBlocks, OverflowLineIsWrittenOncePerPass) {
    outbufferleft = 5;
    append_data_line("a");
    append_data_line("b");
    append_data_line("a much longer line than the first two");
    EXPECT_EQ(block_text(), OVERFLOW_LINE);
    EXPECT_EQ(outbufferleft, 4);
    EXPECT_EQ(pdboverflow, 1);

    // The next pass may say it again.
    pdboverflow = 0;
    outbufferleft = 5;
    append_data_line("c");
    EXPECT_EQ(block_text(), std::string(OVERFLOW_LINE) + OVERFLOW_LINE);
}

TEST_F(DataBlocks, HeaderLengthIsAddedToTheBudget) {
    outbufferleft = 1000;
    append_header_line(PS_HEADER);
    EXPECT_EQ(block_text(), PS_HEADER);
    EXPECT_EQ(outbufferleft, 1030);
    EXPECT_EQ(pdboverflow, 0);
}

TEST_F(DataBlocks, HeaderAfterAnOverflowGivesRoomToShortLinesAgain) {
    outbufferleft = 5;
    append_data_line("too long");
    ASSERT_EQ(outbufferleft, 4);
    append_header_line(PS_HEADER); // 4 + 30
    EXPECT_EQ(outbufferleft, 34);
    const std::string fits(28, 'x'); // 28 + 5 < 34
    append_data_line(fits.c_str());
    EXPECT_EQ(outbufferleft, 3);
    append_data_line("y");
    EXPECT_EQ(block_text(), std::string(OVERFLOW_LINE) + PS_HEADER + fits + "\n\r");
    EXPECT_EQ(outbufferleft, 3);
}

TEST_F(DataBlocks, UnbudgetedTextLeavesTheBudgetAlone) {
    append_unbudgeted("free text\n\r");
    EXPECT_EQ(block_text(), "free text\n\r");
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET);
    EXPECT_EQ(primary_data_length(), 11u);
}

TEST_F(DataBlocks, TextThatDoesNotFitIsCutAtTheBlocksLastByte) {
    fill_block_to(BLOCK_TEXT_MAX - 3);
    append_unbudgeted("abcdef");
    EXPECT_EQ(primary_data_length(), BLOCK_TEXT_MAX);
    EXPECT_EQ(std::string(primaryDataBlock + BLOCK_TEXT_MAX - 3, 4), std::string("abc\0", 4));
    EXPECT_EQ(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1], '\0');
}

TEST_F(DataBlocks, FullBlockTakesNothingMoreOfAnyKind) {
    fill_block_to(BLOCK_TEXT_MAX);
    const std::string before = block_text();

    append_header_line(PS_HEADER);
    // The budget grows by the header's whole length, whatever of it was kept.
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET + 30);
    append_unbudgeted("more");
    append_data_line("a data line the budget still allows");
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET + 30 - 38);
    outbufferleft = 1;
    append_data_line("no room in the budget either");
    EXPECT_EQ(pdboverflow, 1);
    EXPECT_EQ(outbufferleft, 4);

    EXPECT_EQ(primary_data_length(), BLOCK_TEXT_MAX);
    EXPECT_EQ(block_text(), before);
    EXPECT_EQ(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1], '\0');
}

TEST_F(DataBlocks, DataLinesAndHeadersFillTheBlockToItsEndAndStop) {
    // Headers raise the budget beyond the block, so data lines run into its end.
    const std::string header(100000, 'h');
    const std::string data(1000, 'd');
    for (int i = 0; i < 10; ++i) {
        append_header_line(header.c_str());
    }
    while (primary_data_length() < BLOCK_TEXT_MAX) {
        append_data_line(data.c_str());
    }
    append_data_line(data.c_str());
    EXPECT_EQ(pdboverflow, 0);
    EXPECT_EQ(primary_data_length(), BLOCK_TEXT_MAX);
    EXPECT_EQ(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1], '\0');
    EXPECT_EQ(std::strlen(primaryDataBlock), BLOCK_TEXT_MAX);
}

TEST_F(DataBlocks, ClearEmptiesWhatWasWritten) {
    append_header_line(PS_HEADER);
    append_data_line("a line");
    append_unbudgeted("and more");
    clear_primary_data_block();
    EXPECT_EQ(primary_data_length(), 0u);
    EXPECT_TRUE(block_is_zero());

    // The next append starts at the front again.
    append_unbudgeted("again");
    EXPECT_EQ(block_text(), "again");
}

TEST_F(DataBlocks, ClearOfAFullBlockEmptiesAllOfIt) {
    fill_block_to(BLOCK_TEXT_MAX);
    clear_primary_data_block();
    EXPECT_EQ(primary_data_length(), 0u);
    EXPECT_TRUE(block_is_zero());
}

TEST_F(DataBlocks, ClearAfterALongerTextThenAShorterOneLeavesNoTail) {
    fill_block_to(5000);
    clear_primary_data_block();
    append_unbudgeted("short");
    clear_primary_data_block();
    EXPECT_TRUE(block_is_zero());
}

bool ps_block_is_zero_from(size_t first) {
    return std::all_of(newPSDataBlock + first, newPSDataBlock + PS_DATA_BLOCK_SIZE,
                       [](char c) { return c == '\0'; });
}

class PsDataBlock : public ::testing::Test {
  protected:
    void SetUp() override { clear_ps_data_block(); }
    void TearDown() override { clear_ps_data_block(); }
};

TEST_F(PsDataBlock, ShortTextIsCopiedWhole) {
    copy_to_ps_data_block("  PID listing\n\r");
    EXPECT_STREQ(newPSDataBlock, "  PID listing\n\r");
    EXPECT_TRUE(ps_block_is_zero_from(15));
}

TEST_F(PsDataBlock, TextOf249999BytesIsCopiedWithItsNul) {
    const std::string text(PS_DATA_BLOCK_SIZE - 1, 'p');
    copy_to_ps_data_block(text.c_str());
    EXPECT_EQ(std::string(newPSDataBlock, PS_DATA_BLOCK_SIZE - 1), text);
    EXPECT_EQ(newPSDataBlock[PS_DATA_BLOCK_SIZE - 1], '\0');
}

TEST_F(PsDataBlock, LongerTextKeepsItsFirst249999Bytes) {
    const std::string text = std::string(PS_DATA_BLOCK_SIZE, 'p') + "tail";
    copy_to_ps_data_block(text.c_str());
    EXPECT_EQ(std::string(newPSDataBlock, PS_DATA_BLOCK_SIZE - 1),
              text.substr(0, PS_DATA_BLOCK_SIZE - 1));
    EXPECT_EQ(newPSDataBlock[PS_DATA_BLOCK_SIZE - 1], '\0');
}

TEST_F(PsDataBlock, ShorterCopyAfterALongerOneLeavesNoTail) {
    copy_to_ps_data_block(std::string(100000, 'p').c_str());
    copy_to_ps_data_block("short");
    EXPECT_STREQ(newPSDataBlock, "short");
    EXPECT_TRUE(ps_block_is_zero_from(5));
}

TEST_F(PsDataBlock, ClearEmptiesWhatWasWritten) {
    copy_to_ps_data_block(std::string(PS_DATA_BLOCK_SIZE + 10, 'p').c_str());
    clear_ps_data_block();
    EXPECT_TRUE(ps_block_is_zero_from(0));
}

} // namespace

namespace {

TEST(ErrorText, ReplacesTheWholeBlock) {
    std::memset(topDataBlock, 'x', TOP_DATA_BLOCK_SIZE);
    write_error_text("\n\rError Information: \n\r%s\n\r", "name");
    const std::string expected = "\n\rError Information: \n\rname\n\r";
    EXPECT_EQ(std::string(topDataBlock), expected);
    EXPECT_TRUE(std::all_of(topDataBlock + expected.size(), topDataBlock + TOP_DATA_BLOCK_SIZE,
                            [](char c) { return c == '\0'; }));
}

TEST(ErrorText, LongerTextIsCutAtTheBlocksLastByte) {
    const std::string name(TOP_DATA_BLOCK_SIZE * 2, 'n');
    write_error_text("head %s", name.c_str());
    EXPECT_EQ(topDataBlock[TOP_DATA_BLOCK_SIZE - 1], '\0');
    EXPECT_EQ(std::strlen(topDataBlock), TOP_DATA_BLOCK_SIZE - 1);
    EXPECT_EQ(std::string(topDataBlock, 5), "head ");
}

} // namespace

namespace {

// The two error-text blocks after a clear hold what a whole clear leaves, whatever was written.
TEST(ErrorText, ClearLeavesBothBlocksAsAWholeClearWould) {
    write_error_text("%s", std::string(3000, 'a').c_str());
    copy_error_text_to_log();
    write_error_text("short");
    clear_error_texts();
    EXPECT_TRUE(std::all_of(topDataBlock, topDataBlock + TOP_DATA_BLOCK_SIZE,
                            [](char c) { return c == '\0'; }));
    EXPECT_TRUE(std::all_of(topLogDataBlock, topLogDataBlock + TOP_DATA_BLOCK_SIZE,
                            [](char c) { return c == '\0'; }));
}

TEST(ErrorText, CopyToTheLogIsAWholeCopy) {
    clear_error_texts();
    write_error_text("%s", std::string(3000, 'a').c_str());
    copy_error_text_to_log();
    write_error_text("second");
    copy_error_text_to_log();
    EXPECT_EQ(std::memcmp(topLogDataBlock, topDataBlock, TOP_DATA_BLOCK_SIZE), 0);
}

} // namespace

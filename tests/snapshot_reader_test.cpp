#include <gtest/gtest.h>

#include <random>
#include <string>

#include "capture/snapshot_file.h"
#include "snapshot_reader.h"

namespace {

const std::string STAMP =
    "Local date and time = 5 March 2021 at 07:04:09 \n\rCode Version 61.001\n\r";

std::string plain(const std::string &body) {
    return std::string(PLAIN_SNAPSHOT_OPENING) + "\n\r" + STAMP + body +
           std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";
}
std::string problem(const std::string &body, const std::string &stamp = STAMP) {
    return std::string(PROBLEM_SNAPSHOT_OPENING) + "\n\r" + stamp + body +
           std::string(PROBLEM_SNAPSHOT_CLOSING) + "\n\r";
}

TEST(SnapshotReader, AnEmptyFileHoldsNoBlock) {
    EXPECT_TRUE(read_snapshots("").empty());
    EXPECT_TRUE(read_snapshots("\n\r\n\r").empty());
}

TEST(SnapshotReader, CompleteBlocksInFileOrder) {
    std::string first = plain("gathered\n\r");
    std::string second = problem("rss of x is 5 KB\n\r\n\rps output\n\r");
    std::string file = first + second;
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 2u);
    EXPECT_EQ(blocks[0].kind, snapshot_kind::plain);
    EXPECT_EQ(blocks[0].state, snapshot_state::complete);
    EXPECT_EQ(blocks[0].offset, 0u);
    EXPECT_EQ(blocks[0].text, first);
    EXPECT_EQ(blocks[0].timestamp, "5 March 2021 at 07:04:09");
    EXPECT_EQ(blocks[1].kind, snapshot_kind::problem);
    EXPECT_EQ(blocks[1].state, snapshot_state::complete);
    EXPECT_EQ(blocks[1].offset, first.size());
    EXPECT_EQ(blocks[1].text, second);
    EXPECT_EQ(describe(blocks[0]), "plain");
    EXPECT_EQ(describe(blocks[1]), "problem");
}

TEST(SnapshotReader, TheHeadOfAFileCutMidLineIsAPartialBlock) {
    std::string head =
        "ine of a problem snapshot\n\rmore\n\r" + std::string(PROBLEM_SNAPSHOT_CLOSING) + "\n\r";
    std::string file = head + plain("");
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 2u);
    EXPECT_EQ(blocks[0].state, snapshot_state::cut_by_wrap);
    EXPECT_EQ(blocks[0].kind, snapshot_kind::problem);
    EXPECT_EQ(blocks[0].text, head);
    EXPECT_EQ(blocks[0].timestamp, "");
    EXPECT_EQ(describe(blocks[0]), "problem, partial (cut by wrap)");
    EXPECT_EQ(blocks[1].state, snapshot_state::complete);
}

TEST(SnapshotReader, AHeadWithoutItsClosingLineIsPartialOfUnknownKind) {
    std::string file = "ps output cut\n\r" + plain("x\n\r");
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 2u);
    EXPECT_EQ(blocks[0].kind, snapshot_kind::unknown);
    EXPECT_EQ(blocks[0].text, "ps output cut\n\r");
    EXPECT_EQ(describe(blocks[0]), "partial (cut by wrap)");
}

TEST(SnapshotReader, AFileCutInsideItsOnlyBlockIsOnePartialBlock) {
    auto blocks = read_snapshots("ut mid-line");
    ASSERT_EQ(blocks.size(), 1u);
    EXPECT_EQ(blocks[0].state, snapshot_state::cut_by_wrap);
    EXPECT_EQ(blocks[0].text, "ut mid-line");
}

TEST(SnapshotReader, AnOpeningWithoutClosingIsUnterminated) {
    std::string open = std::string(PLAIN_SNAPSHOT_OPENING) + "\n\r" + STAMP + "half\n\r";
    std::string file = open + problem("body\n\r") + std::string(PROBLEM_SNAPSHOT_OPENING) + "\n\rx";
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 3u);
    EXPECT_EQ(blocks[0].state, snapshot_state::unterminated);
    EXPECT_EQ(blocks[0].kind, snapshot_kind::plain);
    EXPECT_EQ(blocks[0].text, open);
    EXPECT_EQ(blocks[0].timestamp, "5 March 2021 at 07:04:09");
    EXPECT_EQ(describe(blocks[0]), "plain, unterminated");
    EXPECT_EQ(blocks[1].state, snapshot_state::complete);
    EXPECT_EQ(blocks[2].state, snapshot_state::unterminated);
    EXPECT_EQ(blocks[2].kind, snapshot_kind::problem);
    EXPECT_EQ(blocks[2].text, std::string(PROBLEM_SNAPSHOT_OPENING) + "\n\rx");
}

TEST(SnapshotReader, AClosingOfTheOtherKindIsBlockText) {
    std::string file = std::string(PLAIN_SNAPSHOT_OPENING) + "\n\r" +
                       std::string(PROBLEM_SNAPSHOT_CLOSING) + "\n\r" +
                       std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 1u);
    EXPECT_EQ(blocks[0].state, snapshot_state::complete);
    EXPECT_EQ(blocks[0].text, file);
}

TEST(SnapshotReader, TextBetweenBlocksIsStray) {
    std::string file = plain("") + "left over\n\r" + std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r" +
                       "\n\r" + problem("");
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 3u);
    EXPECT_EQ(blocks[1].state, snapshot_state::stray);
    EXPECT_EQ(blocks[1].kind, snapshot_kind::plain);
    EXPECT_EQ(describe(blocks[1]), "plain, text outside a snapshot");
    EXPECT_EQ(blocks[2].kind, snapshot_kind::problem);
    EXPECT_EQ(blocks[2].offset, file.size() - problem("").size());
}

TEST(SnapshotReader, SeparatorsMustBeWholeLines) {
    // A wrap cut at "=START=" inside gathered text leaves a line that is no separator.
    std::string file = "=START= in a process name\n\r" + std::string(PLAIN_SNAPSHOT_OPENING) +
                       "==\n\r" + plain("");
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 2u);
    EXPECT_EQ(blocks[0].state, snapshot_state::cut_by_wrap);
    EXPECT_EQ(blocks[1].offset, file.size() - plain("").size());
}

TEST(SnapshotReader, AFileCutInsideALineEndStartsAtTheNextLine) {
    // The cut fell between "\n" and "\r" just before a problem opening, which holds no marker.
    std::string block = problem("body\n\r");
    std::string file = "\r" + block + plain("");
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 2u);
    EXPECT_EQ(blocks[0].kind, snapshot_kind::problem);
    EXPECT_EQ(blocks[0].state, snapshot_state::complete);
    EXPECT_EQ(blocks[0].offset, 1u);
    EXPECT_EQ(blocks[0].text, block);
    EXPECT_EQ(blocks[0].timestamp, "5 March 2021 at 07:04:09");
    EXPECT_EQ(blocks[1].kind, snapshot_kind::plain);
    EXPECT_EQ(blocks[1].state, snapshot_state::complete);
}

TEST(SnapshotReader, CarriageReturnLineFeedEndsAreReadToo) {
    std::string file = std::string(PLAIN_SNAPSHOT_OPENING) + "\r\n" +
                       "Local date and time = 1 May 2020 at 01:02:03 \r\n" +
                       std::string(PLAIN_SNAPSHOT_CLOSING) + "\r\n";
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 1u);
    EXPECT_EQ(blocks[0].state, snapshot_state::complete);
    EXPECT_EQ(blocks[0].timestamp, "1 May 2020 at 01:02:03");
}

TEST(SnapshotReader, TheFirstTimeStampOfABlockCounts) {
    std::string body = "Local date and time = not this one\n\r";
    std::string file = problem(body, "Local date and time = 31 December 1999 at 23:59:58 \n\r");
    auto blocks = read_snapshots(file);
    ASSERT_EQ(blocks.size(), 1u);
    EXPECT_EQ(blocks[0].timestamp, "31 December 1999 at 23:59:58");
}

TEST(SnapshotReader, BlocksCoverEveryByteButLineEndsBetweenThem) {
    std::mt19937 random(7);
    const std::string pieces[] = {std::string(PLAIN_SNAPSHOT_OPENING),
                                  std::string(PLAIN_SNAPSHOT_CLOSING),
                                  std::string(PROBLEM_SNAPSHOT_OPENING),
                                  std::string(PROBLEM_SNAPSHOT_CLOSING),
                                  "Local date and time = 2 June 2022 at 10:11:12 ",
                                  "body",
                                  "",
                                  "=START="};
    const std::string ends[] = {"\n\r", "\n", "\r", ""};
    for (int round = 0; round < 2000; ++round) {
        std::string file;
        int count = static_cast<int>(random() % 12);
        for (int i = 0; i < count; ++i) {
            file += pieces[random() % std::size(pieces)] + ends[random() % std::size(ends)];
        }
        auto blocks = read_snapshots(file);
        size_t covered = 0;
        for (const auto &b : blocks) {
            ASSERT_GE(b.offset, covered) << file;
            ASSERT_EQ(file.substr(covered, b.offset - covered).find_first_not_of("\n\r"),
                      std::string::npos)
                << file;
            ASSERT_EQ(file.substr(b.offset, b.text.size()), b.text);
            ASSERT_FALSE(b.text.empty());
            covered = b.offset + b.text.size();
        }
        ASSERT_EQ(file.substr(covered).find_first_not_of("\n\r"), std::string::npos) << file;
    }
}

TEST(SnapshotReader, TerminalTextTurnsLineEndsIntoNewlines) {
    EXPECT_EQ(terminal_text("a\n\rb\n\r"), "a\nb\n");
    EXPECT_EQ(terminal_text("a\nb"), "a\nb");
    EXPECT_EQ(terminal_text("\n\r\n\r"), "\n\n");
    EXPECT_EQ(terminal_text("tab\there"), "tab\there");
}

TEST(SnapshotReader, TerminalTextShowsControlBytesAsHex) {
    EXPECT_EQ(terminal_text(std::string("a\rb\x1b[2Jc\x7f", 9)), "a\\x0db\\x1b[2Jc\\x7f");
    EXPECT_EQ(terminal_text(std::string("\0x", 2)), "\\x00x");
    EXPECT_EQ(terminal_text("\r\n"), "\\x0d\n");
    EXPECT_EQ(terminal_text("caf\xc3\xa9"), "caf\xc3\xa9");
}

} // namespace

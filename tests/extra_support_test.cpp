// What the routines of libtelvzextra.so share: the bounded text with its one truncation line, the
// keywords read from the control file's text, bounded reads of /proc files, and number parsing.
#include <gtest/gtest.h>

#include <cstring>

#include "extra_fixture.h"

namespace {

using namespace std::string_literals;

TEST(RoutineText, LinesEndInLineFeedAndReturnAndNeverPassTheBuffer) {
    const size_t truncated_size = routine_text::TRUNCATED_LINE.size();
    std::vector<char> buffer(truncated_size + 14, '#'); // the two lines, the cut line, the NUL
    buffer.push_back('!');                              // beyond the size given: never written
    routine_text text(buffer.data(), buffer.size() - 1);
    EXPECT_TRUE(text.empty());
    EXPECT_STREQ(text.text(), "");
    text.line("a%d", 1);
    text.line("bcdefgh");
    EXPECT_EQ(std::string(text.text()), "a1\n\rbcdefgh\n\r");
    text.line("c");
    EXPECT_TRUE(text.truncated());
    text.line("d");
    EXPECT_EQ(std::string(text.text()),
              "a1\n\rbcdefgh\n\r" + std::string(routine_text::TRUNCATED_LINE));
    EXPECT_EQ(text.length(), 13 + truncated_size);
    EXPECT_EQ(buffer.back(), '!');
}

TEST(RoutineText, ALongLineIsCutAndStillEnds) {
    static char buffer[4096];
    routine_text text(buffer, sizeof buffer);
    text.line("%s", std::string(2000, 'x').c_str());
    EXPECT_EQ(std::string(text.text()), std::string(routine_text::LINE_SIZE - 3, 'x') + "\n\r");
}

TEST(RoutineText, AnEmptyTextIsNotHandedBack) {
    char buffer[128];
    routine_text text(buffer, sizeof buffer);
    char *returned = nullptr;
    hand_back(text, &returned);
    EXPECT_EQ(returned, nullptr);
    text.line("x");
    hand_back(text, &returned);
    EXPECT_EQ(returned, buffer);
}

TEST(KeywordNumber, TheLastValidLineOfTheKeywordWins) {
    EXPECT_EQ(keyword_number(nullptr, "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("", "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("K 3\nK 4\n", "K", 7, 0, 10), 4);
    EXPECT_EQ(keyword_number("K 3\nK 40\n", "K", 7, 0, 10), 3);
    EXPECT_EQ(keyword_number("K 3\r\n", "K", 7, 0, 10), 3);
    EXPECT_EQ(keyword_number("KK 3\n", "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("K3\n", "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("x K 3\n", "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("*K 3\n", "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("K 3x\n", "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("K 99999999999999999999999\n", "K", 7, 0, 10), 7);
    EXPECT_EQ(keyword_number("K\n3\n", "K", 7, 0, 10), 7); // the value must be on its line
    EXPECT_EQ(keyword_number(" \tK  5 words after\n", "K", 7, 0, 10), 5);
}

class ProcFile : public extra_test::ExtraTest {};

TEST_F(ProcFile, AFileIsReadWholeOrCutAndAnAbsentOneGivesItsError) {
    char buffer[8];
    write("short", "abc");
    file_text file = read_proc_file("short", buffer, sizeof buffer);
    EXPECT_TRUE(file.present);
    EXPECT_FALSE(file.cut);
    EXPECT_EQ(file.text, "abc");
    write("exact", "1234567");
    file = read_proc_file("exact", buffer, sizeof buffer);
    EXPECT_EQ(file.text, "1234567");
    EXPECT_FALSE(file.cut);
    write("long", "12345678");
    file = read_proc_file("long", buffer, sizeof buffer);
    EXPECT_EQ(file.text, "1234567");
    EXPECT_TRUE(file.cut);
    EXPECT_EQ(buffer[7], '\0');
    write("nul", "a\0b"s);
    EXPECT_EQ(read_proc_file("nul", buffer, sizeof buffer).text, "a\0b"s);
    file = read_proc_file("absent", buffer, sizeof buffer);
    EXPECT_FALSE(file.present);
    EXPECT_EQ(file.error, ENOENT);
    EXPECT_TRUE(file.text.empty());
    file = read_proc_file(std::string(EXTRA_PATH_SIZE, 'x').c_str(), buffer, sizeof buffer);
    EXPECT_EQ(file.error, ENAMETOOLONG);
    std::filesystem::create_directories(root + "/dir");
    file = read_proc_file("dir", buffer, sizeof buffer);
    EXPECT_FALSE(file.present);
    EXPECT_EQ(file.error, EISDIR);
}

TEST(Parsing, NumbersLinesAndNames) {
    std::string_view text = "18446744073709551615 rest";
    uint64_t value = 0;
    ASSERT_TRUE(take_number(text, &value));
    EXPECT_EQ(value, UINT64_MAX);
    EXPECT_EQ(text, " rest");
    for (std::string_view bad : {"18446744073709551616", "-1", "+1", " 1", ""}) {
        EXPECT_FALSE(take_number(bad, &value)) << bad;
    }
    std::string_view lines = "a\n\nb";
    EXPECT_EQ(take_line(lines), "a");
    EXPECT_EQ(take_line(lines), "");
    EXPECT_EQ(take_line(lines), "b");
    EXPECT_TRUE(lines.empty());
    char name[6];
    printable_copy(name, sizeof name,
                   "a\nb\x80\x7f"
                   "cdef");
    EXPECT_STREQ(name, "a?b??");
}

} // namespace

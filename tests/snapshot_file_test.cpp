#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <limits>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "capture/snapshot_file.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "recording_platform.h"

namespace {

const std::string FILE_NAME = "telvzmnd.trm";

time_t fixed_now;
time_t fixed_clock(time_t *out) {
    if (out != nullptr) {
        *out = fixed_now;
    }
    return fixed_now;
}

// The calendar time of a UTC date (the tests run with TZ=UTC).
time_t utc(int year, int month, int day, int hour, int minute, int second) {
    struct tm t {};
    t.tm_year = year - 1900;
    t.tm_mon = month - 1;
    t.tm_mday = day;
    t.tm_hour = hour;
    t.tm_min = minute;
    t.tm_sec = second;
    return timegm(&t);
}

// A writable copy of `text`, as the monitor hands its lines over.
std::vector<char> writable(const std::string &text) {
    std::vector<char> copy(text.begin(), text.end());
    copy.push_back('\0');
    return copy;
}

// Stages `text` in file_buffer with `final`; returns what is left of the caller's line.
std::string save(const std::string &text, int32_t final = 0) {
    std::vector<char> data = writable(text);
    tarn_save_data(data.data(), file_buffer, FILE_BUFFER_SIZE, final);
    return std::string(data.data());
}

// `length` bytes of text lines ("\n\r" line ends) that hold neither marker nor separator.
std::string filler(size_t length, char fill = 'x') {
    std::string text;
    while (text.size() < length) {
        size_t take = std::min<size_t>(length - text.size(), 40);
        if (take <= 2) {
            text.append(take, fill);
        } else {
            text.append(take - 2, fill).append("\n\r");
        }
    }
    return text;
}

class SnapshotFile : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        setenv("TZ", "UTC", 1);
        tzset();
        std::memset(file_buffer, 0, sizeof file_buffer);
        std::memset(line, 0, sizeof line);
        max_snapshot_file_size = 1545056;
        fixed_now = utc(2021, 3, 5, 7, 4, 9);
        snapshot_clock = fixed_clock;
        open_before_ = rec::open_data_files();
    }
    void TearDown() override {
        snapshot_clock = time;
        max_snapshot_file_size = 0;
        EXPECT_TRUE(rec::live_allocations().empty());
    }

    int open_before_ = 0; // a failed read of a wrap leaves its handle open for good

    static const rec::Event &only_event() {
        EXPECT_EQ(rec::events().size(), 1u);
        return rec::events().at(0);
    }
    static void expect_event(const rec::Event &event, uint16_t reason, uint32_t comp_rc) {
        EXPECT_EQ(event.record.reason_code, reason);
        EXPECT_EQ(event.record.comp_rc, comp_rc);
        EXPECT_EQ(event.record.option, 0x300u);
        EXPECT_FALSE(event.has_attachment);
    }
    static void expect_emptied(const std::string &left) {
        EXPECT_EQ(left, "");
        EXPECT_EQ(file_buffer[0], '\0');
    }
};

// ---- staging ----

TEST_F(SnapshotFile, SeparatorsAreFiftyTwoCharactersAndOnlyThePlainOpeningHoldsTheMarker) {
    EXPECT_EQ(PROBLEM_SNAPSHOT_OPENING, "=START FEDC SNAPSHOT" + std::string(32, '='));
    EXPECT_EQ(PROBLEM_SNAPSHOT_CLOSING, "=END FEDC SNAPSHOT" + std::string(34, '='));
    EXPECT_EQ(PLAIN_SNAPSHOT_OPENING, "=START" + std::string(46, '='));
    EXPECT_EQ(PLAIN_SNAPSHOT_CLOSING, "=END" + std::string(48, '='));
    EXPECT_EQ(WRAP_MARKER, "=START=");
    for (std::string_view separator : {PROBLEM_SNAPSHOT_OPENING, PROBLEM_SNAPSHOT_CLOSING,
                                       PLAIN_SNAPSHOT_OPENING, PLAIN_SNAPSHOT_CLOSING}) {
        EXPECT_EQ(separator.size(), 52u);
        EXPECT_EQ(separator.find(WRAP_MARKER) == 0, separator == PLAIN_SNAPSHOT_OPENING);
        EXPECT_EQ(separator.find(WRAP_MARKER) == std::string_view::npos,
                  separator != PLAIN_SNAPSHOT_OPENING);
    }
}

TEST_F(SnapshotFile, StagesALineWithLineFeedThenCarriageReturn) {
    EXPECT_EQ(save("first"), "");
    EXPECT_EQ(save("second"), "");
    EXPECT_EQ(std::string(file_buffer), "first\n\rsecond\n\r");
    EXPECT_TRUE(rec::traces().empty());
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 0);
    EXPECT_FALSE(rec::data_file_exists(FILE_NAME));
}

TEST_F(SnapshotFile, NullDataWithFinalOneWritesNothingAndKeepsTheStagedText) {
    save("kept");
    tarn_save_data(nullptr, file_buffer, FILE_BUFFER_SIZE, 1);
    EXPECT_EQ(rec::traces(), std::vector<std::string>{"TARNSDAD: data to append was NULL"});
    EXPECT_EQ(std::string(file_buffer), "kept\n\r");
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 0);
    EXPECT_EQ(rec::calls(rec::Call::search_file_open), 0);
    EXPECT_FALSE(rec::data_file_exists(FILE_NAME));
}

TEST_F(SnapshotFile, OnlyFinalOneFlushes) {
    save("a", 0);
    save("b", 2);
    save("c", -1);
    EXPECT_EQ(std::string(file_buffer), "a\n\rb\n\rc\n\r");
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 0);
}

TEST_F(SnapshotFile, AnEmptyLineIsStagedAsALineEnd) {
    save("");
    EXPECT_EQ(std::string(file_buffer), "\n\r");
}

// ---- append path ----

TEST_F(SnapshotFile, FlushOfAMissingFileCreatesIt) {
    save("=START==============================================");
    EXPECT_EQ(save("=END================================================", 1), "");
    std::string expected = "=START==============================================\n\r"
                           "=END================================================\n\r";
    EXPECT_EQ(rec::read_data_file(FILE_NAME), expected);
    EXPECT_EQ(file_buffer[0], '\0');
    EXPECT_EQ(rec::traces(), (std::vector<std::string>{"TARNSDAD: buflen = 108 (dec)",
                                                       "TARNSDAD: byte_count = 108"}));
    EXPECT_TRUE(rec::events().empty());
    EXPECT_EQ(rec::open_data_files(), open_before_);
}

TEST_F(SnapshotFile, FlushAppendsOnlyTheStagedTextToTheFile) {
    std::string old = filler(1000);
    rec::write_data_file(FILE_NAME, old);
    save("one");
    save("two", 1);
    EXPECT_EQ(rec::read_data_file(FILE_NAME), old + "one\n\rtwo\n\r");
    EXPECT_EQ(rec::calls(rec::Call::random_write), 1);
    EXPECT_EQ(rec::calls(rec::Call::random_read), 0);
    EXPECT_EQ(rec::traces(), (std::vector<std::string>{"TARNSDAD: buflen = 10 (dec)",
                                                       "TARNSDAD: byte_count = 10"}));
}

TEST_F(SnapshotFile, AppendWhileOneByteBelowTheBound) {
    // file_size + combined = max - 1: the last sum that appends; the file ends max + 1 long.
    rec::write_data_file(FILE_NAME, filler(1000));
    max_snapshot_file_size = 1000 + 499 + 1;
    save(std::string(497, 'a')); // 499 staged
    save("", 1);
    EXPECT_EQ(rec::read_data_file(FILE_NAME).size(), 1501u);
    EXPECT_EQ(rec::calls(rec::Call::delete_file), 0);
}

TEST_F(SnapshotFile, WrapOnceTheSumReachesTheBound) {
    rec::write_data_file(FILE_NAME, filler(1000));
    max_snapshot_file_size = 1000 + 499;
    save(std::string(497, 'a'));
    save("", 1);
    EXPECT_EQ(rec::calls(rec::Call::delete_file), 1);
    EXPECT_EQ(rec::read_data_file(FILE_NAME).size(), 1501u);
}

// ---- the staging buffer's bound ----

// With 1,000,002 bytes staged, a line of L characters is staged while 1,000,002 + L + 10 is below
// 4,591,112: L = 3,591,099 is the largest that is, 3,591,100 the smallest that is not.
constexpr size_t STAGED_BEFORE = 1000002;
constexpr size_t LARGEST_STAGED = 4591112 - 10 - 1 - STAGED_BEFORE;

TEST_F(SnapshotFile, TheLargestLineThatStillFitsIsStaged) {
    ASSERT_EQ(LARGEST_STAGED, 3591099u);
    save(std::string(1000000, 'a'));
    EXPECT_EQ(save(std::string(LARGEST_STAGED, 'b')), "");
    EXPECT_EQ(strnlen(file_buffer, sizeof file_buffer), STAGED_BEFORE + LARGEST_STAGED + 2);
    EXPECT_EQ(file_buffer[4591103], '\0');
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 0);
    EXPECT_FALSE(rec::data_file_exists(FILE_NAME));
}

TEST_F(SnapshotFile, ALineWithinTenBytesOfTheSizeIsWrittenBehindTheStagedText) {
    max_snapshot_file_size = 10000000;
    std::string staged(1000000, 'a');
    std::string big(LARGEST_STAGED + 1, 'b');
    save(staged);
    EXPECT_EQ(save(big, 0), "");
    EXPECT_EQ(file_buffer[0], '\0');
    EXPECT_TRUE(rec::read_data_file(FILE_NAME) == staged + "\n\r" + big + "\n\r");
    EXPECT_EQ(rec::calls(rec::Call::search_file_open), 1);
    EXPECT_EQ(rec::calls(rec::Call::random_write), 2);
    EXPECT_EQ(rec::traces(), (std::vector<std::string>{"TARNSDAD: buflen = 1000002 (dec)",
                                                       "TARNSDAD: byte_count = 1000002",
                                                       "TARNSDAD: byte_count = 3591102"}));
    EXPECT_TRUE(rec::events().empty());
    EXPECT_EQ(rec::open_data_files(), open_before_);
}

TEST_F(SnapshotFile, ALineThatDoesNotFitAnEmptyBufferIsLostWithE091) {
    // Nothing is staged, so the first write has no bytes to write: that counts as a failed write
    // of the staged text, and the line behind it is skipped.
    max_snapshot_file_size = 10000000;
    std::string big(4591102, 'b');
    EXPECT_EQ(save(big), "");
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "");
    EXPECT_TRUE(rec::data_file_exists(FILE_NAME));
    expect_event(only_event(), 0xE091, 0);
    EXPECT_EQ(rec::traces().at(0), "TARNSDAD: buflen = 0 (dec)");
    EXPECT_EQ(rec::traces().at(1), "TARNSDAD: byte_count = 0");
    EXPECT_EQ(rec::open_data_files(), open_before_);
}

TEST_F(SnapshotFile, AnOversizedLineNeverOverrunsASmallBuffer) {
    // A 16-byte buffer of its own on the heap, so that any byte past it is caught.
    auto small = std::make_unique<char[]>(16);
    small[0] = '\0';
    std::vector<char> first = writable("ab");
    tarn_save_data(first.data(), small.get(), 16, 0);
    std::vector<char> fits = writable(std::string(13, 'c')); // 13 + "\n\r" + NUL = 16
    tarn_save_data(fits.data(), small.get(), 16, 0);
    EXPECT_EQ(fits[0], '\0');
    EXPECT_EQ(small[0], '\0');
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "ab\n\r" + std::string(13, 'c') + "\n\r");
    EXPECT_EQ(rec::calls(rec::Call::random_write), 2);

    std::vector<char> second = writable("de");
    tarn_save_data(second.data(), small.get(), 16, 0);
    std::vector<char> too_long = writable(std::string(14, 'f')); // never fits, even alone
    tarn_save_data(too_long.data(), small.get(), 16, 0);
    EXPECT_EQ(too_long[0], '\0');
    EXPECT_EQ(small[0], '\0');
    EXPECT_EQ(rec::read_data_file(FILE_NAME),
              "ab\n\r" + std::string(13, 'c') + "\n\rde\n\r" + std::string(14, 'f') + "\n\r");
    EXPECT_EQ(rec::calls(rec::Call::random_write), 5);
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(SnapshotFile, AFailedLineEndOfALineTooLongForTheBufferIsE092) {
    auto small = std::make_unique<char[]>(16);
    small[0] = '\0';
    std::vector<char> first = writable("ab");
    tarn_save_data(first.data(), small.get(), 16, 0);
    rec::fail(rec::Call::random_write, 8, 0x1C, 2); // the staged text and the line go out
    std::vector<char> too_long = writable(std::string(14, 'f'));
    tarn_save_data(too_long.data(), small.get(), 16, 0);
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "ab\n\r" + std::string(14, 'f'));
    expect_event(only_event(), 0xE092, 0x1C);
    EXPECT_EQ(too_long[0], '\0');
    EXPECT_EQ(small[0], '\0');
}

TEST_F(SnapshotFile, ABufferSizeOfZeroNeverTouchesTheBuffer) {
    char untouched = 'u';
    std::vector<char> data = writable("zz");
    tarn_save_data(data.data(), &untouched, 0, 0);
    EXPECT_EQ(untouched, 'u');
    EXPECT_EQ(data[0], '\0');
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "");
    expect_event(only_event(), 0xE091, 0);
}

TEST_F(SnapshotFile, ANullBufferOnlyLetsTheLineThrough) {
    std::vector<char> data = writable("alone");
    tarn_save_data(data.data(), nullptr, FILE_BUFFER_SIZE, 0);
    EXPECT_EQ(data[0], '\0');
    // No staged text to write: that write counts as failed, and the line goes with it.
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "");
    expect_event(only_event(), 0xE091, 0);
}

// ---- wrap path ----

// The old file of the wrap example: 1,000 bytes, a plain opening at 0 (before the cut) and one
// at `marker` (or none).
std::string old_file(size_t marker) {
    std::string text = std::string(PLAIN_SNAPSHOT_OPENING) + "\n\r";
    text += filler(marker - text.size(), 'p');
    if (marker < 1000) {
        text += std::string(PLAIN_SNAPSHOT_OPENING) + "\n\r";
    }
    text += filler(1000 - text.size(), 'q');
    return text;
}

// 600 bytes staged when the closing line comes in: 546 + "\n\r" + the 52-character separator.
std::string stage_600_and_flush() {
    save(std::string(546, 's'));
    return save(std::string(PLAIN_SNAPSHOT_CLOSING), 1);
}
const std::string NEW_TEXT =
    std::string(546, 's') + "\n\r" + std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";

TEST_F(SnapshotFile, WrapCutsAtTheFirstMarkerAtOrAfterDelta) {
    std::string old = old_file(150);
    ASSERT_EQ(old.size(), 1000u);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    expect_emptied(stage_600_and_flush());
    std::string file = rec::read_data_file(FILE_NAME);
    EXPECT_EQ(file, old.substr(150) + NEW_TEXT);
    EXPECT_EQ(file.size(), 1452u);
    const auto &t = rec::traces();
    ASSERT_EQ(t.size(), 5u);
    EXPECT_EQ(t[0], "TARNSDAD: buflen = 602 (dec)");
    EXPECT_EQ(t[1], "TARNSDAD: byte_count = 1000");
    EXPECT_EQ(t[2], "TARNSDAD: delta = 64 (hex)");
    EXPECT_TRUE(t[3].starts_with("TARNSDAD: start_ptr = 0x")) << t[3];
    EXPECT_EQ(t[4], "TARNSDAD: byte_count = 1452");
    EXPECT_TRUE(rec::events().empty());
    EXPECT_EQ(rec::open_data_files(), open_before_);
    EXPECT_EQ(rec::calls(rec::Call::delete_file), 1);
}

TEST_F(SnapshotFile, WrapKeepsAMarkerThatStartsExactlyAtDelta) {
    std::string old = old_file(100);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    stage_600_and_flush();
    EXPECT_EQ(rec::read_data_file(FILE_NAME), old.substr(100) + NEW_TEXT);
    EXPECT_EQ(rec::read_data_file(FILE_NAME).size(), 1502u);
}

TEST_F(SnapshotFile, AMarkerThatBeginsBeforeDeltaIsNotFound) {
    // The marker starts at 99, one byte before the cut, and there is none after it.
    std::string old = old_file(99).substr(0, 99) + std::string(PLAIN_SNAPSHOT_OPENING) + "\n\r";
    old += filler(1000 - old.size(), 'r');
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    stage_600_and_flush();
    EXPECT_EQ(rec::read_data_file(FILE_NAME), old.substr(100) + NEW_TEXT);
}

TEST_F(SnapshotFile, WrapWithoutAMarkerCutsAtDeltaMidLine) {
    std::string old = std::string(PROBLEM_SNAPSHOT_OPENING) + "\n\r";
    old += filler(1000 - old.size() - 54, 'e');
    old += std::string(PROBLEM_SNAPSHOT_CLOSING) + "\n\r";
    ASSERT_EQ(old.size(), 1000u);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    save(std::string(PROBLEM_SNAPSHOT_OPENING));
    save(std::string(492, 'f'));
    save(std::string(PROBLEM_SNAPSHOT_CLOSING), 1);
    std::string file = rec::read_data_file(FILE_NAME);
    std::string block = std::string(PROBLEM_SNAPSHOT_OPENING) + "\n\r" + std::string(492, 'f') +
                        "\n\r" + std::string(PROBLEM_SNAPSHOT_CLOSING) + "\n\r";
    EXPECT_EQ(file, old.substr(100) + block);
    EXPECT_EQ(file.size(), 1502u);
    EXPECT_NE(old.substr(98, 2), "\n\r"); // the cut really is mid-line
    EXPECT_TRUE(rec::has_trace("TARNSDAD: delta = 64 (hex)"));
}

TEST_F(SnapshotFile, TheMarkerInsideTheNewTextIsFoundToo) {
    std::string old = filler(1000, 'o');
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    save(std::string(PLAIN_SNAPSHOT_OPENING));
    save(std::string(492, 'n'));
    save(std::string(PLAIN_SNAPSHOT_CLOSING), 1);
    std::string block = std::string(PLAIN_SNAPSHOT_OPENING) + "\n\r" + std::string(492, 'n') +
                        "\n\r" + std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";
    EXPECT_EQ(rec::read_data_file(FILE_NAME), block);
}

TEST_F(SnapshotFile, WrapDueOnAMissingFileLosesTheTextWithE098AndLeavesItOpen) {
    max_snapshot_file_size = 100;
    expect_emptied(save(std::string(200, 'm'), 1));
    expect_event(only_event(), 0xE098, 0);
    EXPECT_EQ(rec::open_data_files(), open_before_ + 1);
    EXPECT_TRUE(rec::data_file_exists(FILE_NAME));
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "");
    EXPECT_EQ(rec::calls(rec::Call::close_file), 0);
    EXPECT_EQ(rec::calls(rec::Call::delete_file), 0);
    EXPECT_EQ(rec::traces().at(1), "TARNSDAD: byte_count = 0");
    EXPECT_TRUE(rec::has_trace("TARNMNDF:     sysRc = 2   compRc = 0   uiErrorId = e098"));
}

TEST_F(SnapshotFile, WrapDueOnAnEmptyFileLosesTheTextWithE098) {
    rec::write_data_file(FILE_NAME, "");
    max_snapshot_file_size = 10;
    save("=START==", 0);
    save("=END==", 1);
    expect_event(only_event(), 0xE098, 0);
    EXPECT_EQ(rec::open_data_files(), open_before_ + 1);
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "");
    EXPECT_EQ(file_buffer[0], '\0');
}

TEST_F(SnapshotFile, ABoundOfZeroWrapsEveryFlushDownToTheLastLineEnd) {
    // No MAX_SNAPSHOT_FILE_SIZE keyword leaves the bound at 0: every flush wraps, and the text
    // kept from `delta` on is the final "\n\r".
    rec::write_data_file(FILE_NAME, filler(300));
    max_snapshot_file_size = 0;
    save("a line");
    save("closing", 1);
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "\n\r");
    EXPECT_TRUE(rec::has_trace("TARNSDAD: delta = 13b (hex)"));
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(SnapshotFile, ANulInTheOldFileEndsItsText) {
    std::string old = filler(500, 'g') + std::string(1, '\0') + filler(499, 'h');
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    stage_600_and_flush();
    EXPECT_EQ(rec::read_data_file(FILE_NAME), old.substr(100, 400) + NEW_TEXT);
}

TEST_F(SnapshotFile, ADeltaBeyondTheTextKeepsNothingAndItsEmptyWriteIsE096) {
    // The old file's text ends at once (a NUL at its head), so with a bound of 0 the cut lies past
    // the 602 bytes of text: the file is made again, and writing its empty text writes 0 bytes.
    rec::write_data_file(FILE_NAME, std::string(1, '\0') + filler(999));
    max_snapshot_file_size = 0;
    expect_emptied(stage_600_and_flush());
    EXPECT_TRUE(rec::data_file_exists(FILE_NAME));
    EXPECT_EQ(rec::read_data_file(FILE_NAME), "");
    EXPECT_TRUE(rec::has_trace("TARNSDAD: delta = 640 (hex)"));
    EXPECT_EQ(rec::calls(rec::Call::random_write), 1);
    EXPECT_TRUE(rec::has_trace("TARNSDAD: byte_count = 0"));
    expect_event(only_event(), 0xE096, 0);
    EXPECT_TRUE(rec::has_trace("TARNMNDF:     sysRc = 2   compRc = 0   uiErrorId = e096"));
    EXPECT_EQ(rec::open_data_files(), open_before_);
}

TEST_F(SnapshotFile, AFileAndTextPastFourGigabytesRollOverAndAreAppended) {
    // A sparse file 256 bytes short of 4 GB: with 602 bytes of text the 32-bit sum rolls over to
    // 344, below the largest bound, so the text is appended and no wrap (which would need a work
    // area, refused here) is tried.
    constexpr uint32_t OLD_SIZE = 0xFFFFFF00;
    std::string path = rec::data_dir() + "/" + FILE_NAME;
    rec::write_data_file(FILE_NAME, "");
    std::filesystem::resize_file(path, OLD_SIZE);
    max_snapshot_file_size = 0xFFFFFFFF;
    rec::fail(rec::Call::malloc, 0);
    expect_emptied(stage_600_and_flush());
    EXPECT_EQ(std::filesystem::file_size(path), uint64_t{OLD_SIZE} + NEW_TEXT.size());
    std::ifstream file(path, std::ios::binary);
    file.seekg(OLD_SIZE);
    std::string tail(NEW_TEXT.size() + 1, '\0');
    file.read(tail.data(), static_cast<std::streamsize>(tail.size()));
    tail.resize(static_cast<size_t>(file.gcount()));
    EXPECT_TRUE(tail == NEW_TEXT);
    EXPECT_EQ(rec::traces(), (std::vector<std::string>{"TARNSDAD: buflen = 602 (dec)",
                                                       "TARNSDAD: byte_count = 602"}));
    EXPECT_EQ(rec::calls(rec::Call::random_read), 0);
    EXPECT_EQ(rec::calls(rec::Call::delete_file), 0);
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(SnapshotFile, TheOversizedLineJoinsTheWrappedText) {
    std::string old = old_file(150);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 3000000;
    std::string staged(2000000, 'a');
    std::string big(4591112 - 10 - 2000002, 'b');
    save(staged);
    save(big);
    std::string kept = rec::read_data_file(FILE_NAME);
    // delta = 1,000 + 4,591,102 - 3,000,000; no marker after it, so the cut is mid-text.
    size_t delta = 1000 + 4591102 - 3000000;
    EXPECT_TRUE(kept == (old + staged + "\n\r" + big + "\n\r").substr(delta));
    EXPECT_EQ(kept.size(), 3000002u);
    EXPECT_EQ(file_buffer[0], '\0');
}

TEST_F(SnapshotFile, AFailedSizeQueryCountsAsAnEmptyFile) {
    std::string old = filler(1000);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    rec::fail(rec::Call::query_file_size, 8, 2);
    stage_600_and_flush();
    EXPECT_EQ(rec::read_data_file(FILE_NAME), old + NEW_TEXT);
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(SnapshotFile, AFailedWorkAreaAllocationDropsTheTextSilently) {
    std::string old = filler(1000);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    rec::fail(rec::Call::malloc, 0);
    expect_emptied(stage_600_and_flush());
    EXPECT_EQ(rec::read_data_file(FILE_NAME), old);
    EXPECT_EQ(rec::calls(rec::Call::search_file_open), 0);
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(SnapshotFile, AFailedDeleteIsTracedAndTheTextWrittenOverTheOldFile) {
    std::string old = filler(1000);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 1500;
    rec::fail(rec::Call::delete_file, 8, 13);
    stage_600_and_flush();
    int at = rec::find_trace("TARNSDAF: filesvc_delete_file() returned:");
    ASSERT_GE(at, 0);
    EXPECT_EQ(rec::traces().at(at + 1), "TARNSDAF: src = 8, crc = d (hex)");
    // The file was not removed: the kept text lands at offset 0 over the old bytes, and the old
    // file's tail stays behind it.
    std::string kept = old.substr(100) + NEW_TEXT;
    EXPECT_EQ(rec::read_data_file(FILE_NAME), kept);
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(SnapshotFile, AFailedDeleteOfAShorterTextLeavesTheOldTail) {
    std::string old = filler(2000);
    rec::write_data_file(FILE_NAME, old);
    max_snapshot_file_size = 500;
    rec::fail(rec::Call::delete_file, 8, 13);
    save("short", 1); // delta = 2,000 + 5 - 500 = 1,505: 502 bytes are kept
    std::string kept = (old + "short\n\r").substr(1505);
    EXPECT_EQ(rec::read_data_file(FILE_NAME), kept + old.substr(kept.size()));
}

TEST_F(SnapshotFile, AFailedReopenLosesTheFileWithoutAReport) {
    rec::write_data_file(FILE_NAME, filler(1000));
    max_snapshot_file_size = 1500;
    rec::fail(rec::Call::search_file_open, 8, 2, 1);
    expect_emptied(stage_600_and_flush());
    EXPECT_FALSE(rec::data_file_exists(FILE_NAME));
    EXPECT_TRUE(rec::events().empty());
    // Neither reported nor traced: only the opens that begin a flush say that they failed.
    const auto &t = rec::traces();
    ASSERT_EQ(t.size(), 4u);
    EXPECT_EQ(t[0], "TARNSDAD: buflen = 602 (dec)");
    EXPECT_EQ(t[1], "TARNSDAD: byte_count = 1000");
    EXPECT_EQ(t[2], "TARNSDAD: delta = 64 (hex)");
    EXPECT_TRUE(t[3].starts_with("TARNSDAD: start_ptr = 0x")) << t[3];
    EXPECT_EQ(rec::calls(rec::Call::search_file_open), 2);
    EXPECT_EQ(rec::calls(rec::Call::random_write), 0);
    EXPECT_EQ(rec::open_data_files(), open_before_);
}

// ---- every failure of the file service ----

enum class leaves { old, old_and_staged, old_and_all, empty, trimmed };

struct failure_case {
    const char *name;
    bool wrap;
    rec::Call call;
    uint32_t rc;
    uint32_t crc;
    int skip;
    uint32_t own_reason; // the code the writer hands over
    uint32_t sys_rc;     // and the system return code with it
    uint16_t event;      // the reason code that goes out
    leaves file;
};

// The system return code is the last open's result OR 2: 2 after a good open, 10 after an open
// that failed with 8, which makes the report a system one (0xE0F1); only an open failing with 2
// keeps its own code.
const failure_case FAILURES[] = {
    {"open append rc 8", false, rec::Call::search_file_open, 8, 0x11, 0, 0xE090, 10, 0xE0F1,
     leaves::old},
    {"open append rc 2", false, rec::Call::search_file_open, 2, 0x11, 0, 0xE090, 2, 0xE090,
     leaves::old},
    {"write staged", false, rec::Call::random_write, 8, 0x1C, 0, 0xE091, 2, 0xE091, leaves::old},
    {"write staged 0 bytes", false, rec::Call::random_write, 0, 0x1D, 0, 0xE091, 2, 0xE091,
     leaves::old},
    {"write line", false, rec::Call::random_write, 8, 0x05, 1, 0xE092, 2, 0xE092,
     leaves::old_and_staged},
    {"close append", false, rec::Call::close_file, 8, 0x09, 0, 0xE093, 2, 0xE093,
     leaves::old_and_all},
    {"close after read", true, rec::Call::close_file, 8, 0x04, 0, 0xE094, 2, 0xE094, leaves::old},
    {"open wrap rc 8", true, rec::Call::search_file_open, 8, 0x0D, 0, 0xE095, 10, 0xE0F1,
     leaves::old},
    {"open wrap rc 2", true, rec::Call::search_file_open, 2, 0x0D, 0, 0xE095, 2, 0xE095,
     leaves::old},
    {"open wrap rc 4", true, rec::Call::search_file_open, 4, 0x0D, 0, 0xE095, 6, 0xE0F1,
     leaves::old},
    {"write trimmed", true, rec::Call::random_write, 8, 0x1C, 0, 0xE096, 2, 0xE096, leaves::empty},
    {"write trimmed 0 bytes", true, rec::Call::random_write, 0, 0x1E, 0, 0xE096, 2, 0xE096,
     leaves::empty},
    {"close after write", true, rec::Call::close_file, 8, 0x05, 1, 0xE097, 2, 0xE097,
     leaves::trimmed},
    {"read", true, rec::Call::random_read, 8, 0x05, 0, 0xE098, 2, 0xE098, leaves::old},
    {"read 0 bytes", true, rec::Call::random_read, 0, 0x06, 0, 0xE098, 2, 0xE098, leaves::old},
};

TEST_F(SnapshotFile, EveryFailureOfTheFileServiceIsReportedOnce) {
    for (const auto &c : FAILURES) {
        SCOPED_TRACE(c.name);
        rec::reset();
        std::memset(file_buffer, 0, 16);
        std::string old = old_file(150);
        rec::write_data_file(FILE_NAME, old);
        int open_before = rec::open_data_files();
        // The append path flushes nearly a full buffer and a line that no longer fits behind
        // it; the wrap path 600 bytes against a bound of 1,500, cut at the marker at 150.
        max_snapshot_file_size = c.wrap ? 1500 : 1545056 * 4;
        std::string staged(c.wrap ? 546 : 4591112 - 11 - 560, 't');
        std::string last = c.wrap ? std::string(PLAIN_SNAPSHOT_CLOSING) : std::string(560, 'u');
        rec::fail(c.call, c.rc, c.crc, c.skip);
        save(staged);
        expect_emptied(save(last, 1));

        std::string text = staged + "\n\r" + last + "\n\r";
        std::string expected;
        switch (c.file) {
        case leaves::old:
            expected = old;
            break;
        case leaves::old_and_staged:
            expected = old + staged + "\n\r";
            break;
        case leaves::old_and_all:
            expected = old + text;
            break;
        case leaves::empty:
            break;
        case leaves::trimmed:
            expected = old.substr(150) + text;
            break;
        }
        std::string file = rec::read_data_file(FILE_NAME);
        EXPECT_EQ(file.size(), expected.size());
        EXPECT_TRUE(file == expected);

        expect_event(only_event(), c.event, c.crc);
        char handed_over[96];
        std::snprintf(handed_over, sizeof handed_over,
                      "TARNMNDF:     sysRc = %x   compRc = %x   uiErrorId = %x", c.sys_rc, c.crc,
                      c.own_reason);
        EXPECT_TRUE(rec::has_trace(handed_over)) << handed_over;
        bool open_failed = c.call == rec::Call::search_file_open;
        EXPECT_EQ(rec::has_trace("TARNSDAF: filesvc_search_file_open failed"), open_failed);
        // Only a failed read leaves the file open.
        int left_open = c.call == rec::Call::random_read ? 1 : 0;
        EXPECT_EQ(rec::open_data_files(), open_before + left_open);
    }
}

TEST_F(SnapshotFile, AFailedWriteAndAFailedCloseOfOneFlushAreBothReportedWithTheirOwnCodes) {
    // The writer's system return code stays the open's result | 2 = 2: the first report does not
    // turn the second into a system one.
    rec::fail(rec::Call::random_write, 8, 28);
    rec::fail(rec::Call::close_file, 8, 9);
    save("line", 1);
    ASSERT_EQ(rec::events().size(), 2u);
    expect_event(rec::events()[0], 0xE091, 28);
    expect_event(rec::events()[1], 0xE093, 9);
}

// ---- time stamp ----

TEST_F(SnapshotFile, TimeStampOfTheFifthOfMarch) {
    int result = tarn_add_timestamp();
    EXPECT_EQ(std::string(file_buffer), "Local date and time = 5 March 2021 at 07:04:09 \n\r"
                                        "Code Version 61.001\n\r");
    EXPECT_EQ(rec::traces(), (std::vector<std::string>{"TARNATSF: --> tarn_add_timestamp",
                                                       "TARNATSF: <-- tarn_add_timestamp"}));
    EXPECT_EQ(result, static_cast<int>(std::strlen("TARNATSF: <-- tarn_add_timestamp")));
    EXPECT_EQ(std::string(line), ""); // staging consumed the line buffer
}

TEST_F(SnapshotFile, TimeStampWithTwoDigitFieldsAndMidnight) {
    fixed_now = utc(1999, 12, 31, 23, 59, 58);
    tarn_add_timestamp();
    fixed_now = utc(2000, 1, 1, 0, 0, 0);
    tarn_add_timestamp();
    EXPECT_EQ(std::string(file_buffer), "Local date and time = 31 December 1999 at 23:59:58 \n\r"
                                        "Code Version 61.001\n\r"
                                        "Local date and time = 1 January 2000 at 00:00:00 \n\r"
                                        "Code Version 61.001\n\r");
}

// Two digits built without printf, to check the time stamp's own padding against.
std::string two_digits(int value) {
    return {static_cast<char>('0' + value / 10), static_cast<char>('0' + value % 10)};
}

TEST_F(SnapshotFile, TimeStampPadsEveryHourMinuteAndSecondToTwoDigits) {
    for (int value = 0; value < 60; ++value) {
        SCOPED_TRACE(value);
        file_buffer[0] = '\0';
        fixed_now = utc(2021, 3, 5, value % 24, value, 59 - value);
        tarn_add_timestamp();
        EXPECT_EQ(std::string(file_buffer), "Local date and time = 5 March 2021 at " +
                                                two_digits(value % 24) + ":" + two_digits(value) +
                                                ":" + two_digits(59 - value) +
                                                " \n\rCode Version 61.001\n\r");
    }
}

TEST_F(SnapshotFile, TimeStampNamesEveryMonth) {
    const char *names[] = {"January", "February", "March",     "April",   "May",      "June",
                           "July",    "August",   "September", "October", "November", "December"};
    for (int month = 1; month <= 12; ++month) {
        file_buffer[0] = '\0';
        fixed_now = utc(2024, month, 10 + month, month, 2 * month, 59 - month);
        tarn_add_timestamp();
        char expected[128];
        std::snprintf(
            expected, sizeof expected,
            "Local date and time = %d %s 2024 at %02d:%02d:%02d \n\rCode Version 61.001\n\r",
            10 + month, names[month - 1], month, 2 * month, 59 - month);
        EXPECT_EQ(std::string(file_buffer), expected);
    }
}

TEST_F(SnapshotFile, TimeStampFollowsTheLocalTimeZone) {
    setenv("TZ", "JST-9", 1);
    tzset();
    fixed_now = utc(2021, 3, 4, 22, 4, 9);
    tarn_add_timestamp();
    EXPECT_EQ(std::string(file_buffer), "Local date and time = 5 March 2021 at 07:04:09 \n\r"
                                        "Code Version 61.001\n\r");
}

TEST_F(SnapshotFile, ATimeTheCalendarCannotHoldIsStampedError) {
    fixed_now = std::numeric_limits<time_t>::max();
    tarn_add_timestamp();
    EXPECT_EQ(std::string(file_buffer), "Local date and time = 0 Error 1900 at 00:00:00 \n\r"
                                        "Code Version 61.001\n\r");
}

TEST_F(SnapshotFile, TimeStampGoesToTheFileWithItsBlock) {
    save(std::string(PLAIN_SNAPSHOT_OPENING));
    tarn_add_timestamp();
    save(std::string(PLAIN_SNAPSHOT_CLOSING), 1);
    EXPECT_EQ(rec::read_data_file(FILE_NAME),
              std::string(PLAIN_SNAPSHOT_OPENING) +
                  "\n\rLocal date and time = 5 March 2021 at 07:04:09 \n\r"
                  "Code Version 61.001\n\r" +
                  std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r");
}

// ---- many snapshots, as the monitoring loop writes them ----

struct block_writer {
    std::mt19937 random;
    std::string stamp =
        "Local date and time = 5 March 2021 at 07:04:09 \n\rCode Version 61.001\n\r";

    std::string body_line(size_t length) {
        std::string text;
        std::uniform_int_distribution<int> character(' ', '~');
        while (text.size() < length) {
            // Now and then a marker inside the gathered text: a wrap may cut there as well.
            if (random() % 50 == 0) {
                text += "=START=";
            } else {
                text += static_cast<char>(character(random));
            }
        }
        return text;
    }

    // Writes one snapshot and returns its text as it must reach the file.
    std::string write(bool problem, size_t lines, size_t longest) {
        std::string opening(problem ? PROBLEM_SNAPSHOT_OPENING : PLAIN_SNAPSHOT_OPENING);
        std::string closing(problem ? PROBLEM_SNAPSHOT_CLOSING : PLAIN_SNAPSHOT_CLOSING);
        std::string expected = opening + "\n\r" + stamp;
        save(opening, 0);
        tarn_add_timestamp();
        // The gathered data comes as one text of many lines, like primaryDataBlock.
        std::string gathered;
        for (size_t i = 0; i < lines; ++i) {
            gathered += body_line(random() % (longest + 1)) + "\n\r";
        }
        if (problem) {
            std::string top = "rss of a process is above its limit\n\r";
            save(top, 0);
            expected += top + "\n\r";
        }
        save(gathered, 0);
        expected += gathered + "\n\r" + closing + "\n\r";
        save(closing, 1);
        return expected;
    }
};

TEST_F(SnapshotFile, ManySnapshotsKeepTheFileWithinItsBoundAndTheNewestBlockWhole) {
    for (unsigned seed = 1; seed <= 24; ++seed) {
        SCOPED_TRACE(seed);
        rec::reset();
        file_buffer[0] = '\0';
        block_writer writer{std::mt19937(seed)};
        size_t longest = 20 + writer.random() % 400;
        // The bound always holds the largest block, so that the first flush appends.
        max_snapshot_file_size =
            static_cast<uint32_t>(40 * (longest + 2) + 400 + writer.random() % (60 * longest));
        for (int block = 0; block < 60; ++block) {
            int deletes_before = rec::calls(rec::Call::delete_file);
            std::string before = rec::read_data_file(FILE_NAME);
            size_t size_before = before.size();
            bool problem = writer.random() % 3 == 0;
            std::string expected = writer.write(problem, writer.random() % 40, longest);
            std::string file = rec::read_data_file(FILE_NAME);
            ASSERT_LE(file.size(), max_snapshot_file_size + 2u) << "block " << block;
            ASSERT_GE(file.size(), expected.size());
            ASSERT_TRUE(file.ends_with(expected)) << "block " << block;
            bool wrapped = rec::calls(rec::Call::delete_file) > deletes_before;
            ASSERT_EQ(wrapped, size_before + expected.size() - 2 >= max_snapshot_file_size);
            // The old file and the block, from the first marker at or after the cut on.
            std::string kept = before + expected;
            if (wrapped) {
                size_t delta = size_before + expected.size() - 2 - max_snapshot_file_size;
                size_t marker = kept.find(WRAP_MARKER, delta);
                kept.erase(0, marker == std::string::npos ? delta : marker);
            }
            ASSERT_TRUE(file == kept) << "block " << block;
            ASSERT_TRUE(rec::events().empty());
            ASSERT_EQ(file_buffer[0], '\0');
        }
        EXPECT_GT(rec::calls(rec::Call::delete_file), 0);
        EXPECT_EQ(rec::open_data_files(), open_before_);
    }
}

} // namespace

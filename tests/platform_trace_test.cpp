// The trace service of the default platform: stamped lines in a size-bounded trace file.
#include <atomic>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <string>
#include <string_view>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "platform_test_support.h"
#include "tracesvc.h"

namespace {

using platform_test::file_size;
using platform_test::read_file;
using platform_test::read_lines;
using platform_test::set_variable;

struct TraceLine {
    std::string time;
    long pid = 0;
    long thread = 0;
    std::string text;
};

// Takes the digits at `at` as a number; false when there are none.
bool number(const std::string &line, size_t *at, long *value) {
    size_t start = *at;
    while (*at < line.size() && std::isdigit(static_cast<unsigned char>(line[*at]))) {
        ++*at;
    }
    if (*at == start || *at - start > 18) {
        return false;
    }
    *value = std::stol(line.substr(start, *at - start));
    return true;
}

// "2026-11-22T02:31:30.123Z 4321 4322 text": the time (every 'd' a digit), pid, thread, text.
bool parse(const std::string &line, TraceLine *out) {
    constexpr std::string_view TIME = "dddd-dd-ddTdd:dd:dd.dddZ ";
    if (line.size() < TIME.size()) {
        return false;
    }
    for (size_t i = 0; i < TIME.size(); ++i) {
        bool digit = std::isdigit(static_cast<unsigned char>(line[i])) != 0;
        if (TIME[i] == 'd' ? !digit : line[i] != TIME[i]) {
            return false;
        }
    }
    size_t at = TIME.size();
    out->time = line.substr(0, TIME.size() - 1);
    if (!number(line, &at, &out->pid) || at >= line.size() || line[at++] != ' ' ||
        !number(line, &at, &out->thread) || at >= line.size() || line[at++] != ' ') {
        return false;
    }
    out->text = line.substr(at);
    return true;
}

// The texts of the trace file, every line checked for its stamp.
std::vector<std::string> texts(const std::string &path) {
    std::vector<std::string> found;
    for (const std::string &line : read_lines(path)) {
        TraceLine parsed;
        EXPECT_TRUE(parse(line, &parsed)) << line;
        found.push_back(parsed.text);
    }
    return found;
}

using PlatformTrace = platform_test::PlatformTest;

TEST_F(PlatformTrace, ALineCarriesTimePidAndThread) {
    EXPECT_EQ(
        tracesvc_trace("TARNMNDF: --> tarn_mon_main, interval = %d (dec)", 60),
        static_cast<int>(std::string("TARNMNDF: --> tarn_mon_main, interval = 60 (dec)").size()));
    std::vector<std::string> lines = read_lines(trace_path());
    ASSERT_EQ(lines.size(), 1u);
    TraceLine line;
    ASSERT_TRUE(parse(lines[0], &line)) << lines[0];
    EXPECT_EQ(line.pid, ::getpid());
    EXPECT_EQ(line.thread, platform_test::own_thread_id());
    EXPECT_EQ(line.text, "TARNMNDF: --> tarn_mon_main, interval = 60 (dec)");
    EXPECT_EQ(read_file(trace_path()).back(), '\n');
}

TEST_F(PlatformTrace, ALineOfAnotherThreadCarriesThatThread) {
    long other = 0;
    std::thread writer([&] {
        other = platform_test::own_thread_id();
        tracesvc_trace("TARNTHRF: from the other thread");
    });
    writer.join();
    std::vector<std::string> lines = read_lines(trace_path());
    ASSERT_EQ(lines.size(), 1u);
    TraceLine line;
    ASSERT_TRUE(parse(lines[0], &line));
    EXPECT_EQ(line.thread, other);
    EXPECT_NE(line.thread, platform_test::own_thread_id());
    EXPECT_EQ(line.pid, ::getpid());
}

TEST_F(PlatformTrace, TheTraceFileVariableNamesTheFile) {
    std::string elsewhere = dir + "/elsewhere.trace";
    set_variable("TELV_TRACE_FILE", elsewhere);
    tracesvc_trace("TARNVARF: here");
    EXPECT_EQ(texts(elsewhere), std::vector<std::string>{"TARNVARF: here"});
    EXPECT_FALSE(platform_test::exists(trace_path()));
}

TEST_F(PlatformTrace, DetailLinesAreKeptUnlessSwitchedOff) {
    tracesvc_trace("TARNSDAD: kept by default");
    set_variable("TELV_TRACE_DETAIL", "1");
    tracesvc_trace("TARNSDAD: kept when switched on");
    set_variable("TELV_TRACE_DETAIL", "0");
    EXPECT_EQ(tracesvc_trace("TARNSDAD: dropped"), 17);
    tracesvc_trace("TARNSDAF: flow stays");
    tracesvc_trace("TARNQT F: flow with a blank stays");
    tracesvc_trace("TARNSDAD no colon stays");
    tracesvc_trace("ABCDEFGD");
    tracesvc_dump_bytes("TARNDMPD: dropped dump", "abc", 3);
    tracesvc_dump_bytes("TARNDMPF: kept dump", "abc", 3);
    std::vector<std::string> expected = {
        "TARNSDAD: kept by default",
        "TARNSDAD: kept when switched on",
        "TARNSDAF: flow stays",
        "TARNQT F: flow with a blank stays",
        "TARNSDAD no colon stays",
        "ABCDEFGD",
        "TARNDMPF: kept dump",
        "00000000  61 62 63" + std::string(1 + 13 * 3 + 1 + 1, ' ') + "|abc|",
    };
    EXPECT_EQ(texts(trace_path()), expected);
}

TEST_F(PlatformTrace, LineEndsInsideTheTextAreEscapedAndTrailingOnesDropped) {
    tracesvc_trace("TARNESCF: first\nsecond\rthird\n\r");
    tracesvc_trace("\n");
    EXPECT_EQ(texts(trace_path()),
              (std::vector<std::string>{"TARNESCF: first\\nsecond\\rthird", ""}));
}

TEST_F(PlatformTrace, ALongLineIsCutToTheLineMaximum) {
    std::string text(20000, 'x');
    EXPECT_EQ(tracesvc_trace("%s", text.c_str()), 20000);
    std::string contents = read_file(trace_path());
    EXPECT_EQ(contents.size(), 8192u);
    EXPECT_EQ(contents.back(), '\n');
    EXPECT_EQ(contents.find('\n'), 8191u);
}

TEST_F(PlatformTrace, TheFileStaysWithinItsBoundAndRotates) {
    set_variable("TELV_TRACE_MAX_BYTES", "1000");
    std::string older = trace_path() + ".1";
    for (int i = 0; i < 100; ++i) {
        tracesvc_trace("TARNROTF: line %03d of the rotation test", i);
        ASSERT_LE(file_size(trace_path()), 1000) << i;
        ASSERT_LE(file_size(older), 1000) << i;
    }
    std::vector<std::string> current = texts(trace_path());
    std::vector<std::string> previous = texts(older);
    ASSERT_FALSE(current.empty());
    ASSERT_FALSE(previous.empty());
    EXPECT_EQ(current.back(), "TARNROTF: line 099 of the rotation test");
    // The renamed file ends with the line just before the first of the new file.
    int last_old = std::stoi(previous.back().substr(15, 3));
    int first_new = std::stoi(current.front().substr(15, 3));
    EXPECT_EQ(first_new, last_old + 1);
    // Each file was filled until the next line would have passed the bound.
    long line_length = static_cast<long>(read_lines(older).front().size()) + 1;
    EXPECT_GT(file_size(older) + line_length, 1000);
}

TEST_F(PlatformTrace, ALineLargerThanTheBoundIsCutToIt) {
    set_variable("TELV_TRACE_MAX_BYTES", "50");
    tracesvc_trace("%s", std::string(100, 'y').c_str());
    EXPECT_EQ(file_size(trace_path()), 50);
    tracesvc_trace("TARNSMLF: second");
    EXPECT_EQ(file_size(trace_path() + ".1"), 50);
    EXPECT_LE(file_size(trace_path()), 50);
}

TEST_F(PlatformTrace, ABoundThatIsNoNumberGivesTheDefault) {
    set_variable("TELV_TRACE_MAX_BYTES", "12abc");
    for (int i = 0; i < 5; ++i) {
        tracesvc_trace("TARNDEFF: line %d", i);
    }
    EXPECT_EQ(texts(trace_path()).size(), 5u);
    EXPECT_FALSE(platform_test::exists(trace_path() + ".1"));
}

TEST_F(PlatformTrace, ALostTraceFileIsBegunAgain) {
    tracesvc_trace("TARNLOSF: before");
    ASSERT_EQ(::unlink(trace_path().c_str()), 0);
    tracesvc_trace("TARNLOSF: after");
    EXPECT_EQ(texts(trace_path()), std::vector<std::string>{"TARNLOSF: after"});
}

TEST_F(PlatformTrace, AnUnwritableTraceFileGivesMinusOne) {
    set_variable("TELV_TRACE_FILE", dir + "/missing/dir/x.trace");
    EXPECT_EQ(tracesvc_trace("TARNBADF: lost"), -1);
    EXPECT_EQ(tracesvc_dump_bytes("TARNBADF: lost", "a", 1), -1);
    set_variable("TELV_TRACE_FILE", "/dev/full");
    EXPECT_EQ(tracesvc_trace("TARNBADF: lost"), -1);
}

TEST_F(PlatformTrace, ADumpIsATitleThenSixteenBytesARow) {
    unsigned char data[20];
    for (int i = 0; i < 20; ++i) {
        data[i] = static_cast<unsigned char>(0x3C + i * 7);
    }
    data[0] = 0x00;
    data[19] = 0xFF;
    EXPECT_EQ(tracesvc_dump_bytes("TARNDMPF: the record", data, sizeof data), 0);
    std::vector<std::string> expected = {
        "TARNDMPF: the record",
        "00000000  00 43 4A 51 58 5F 66 6D  74 7B 82 89 90 97 9E A5  |.CJQX_fmt{......|",
        "00000010  AC B3 BA FF" + std::string(1 + 12 * 3 + 1 + 1, ' ') + "|....|",
    };
    EXPECT_EQ(texts(trace_path()), expected);
}

TEST_F(PlatformTrace, ADumpOfExactlySixteenBytesHasOneRow) {
    EXPECT_EQ(tracesvc_dump_bytes("title", "0123456789abcdef", 16), 0);
    std::vector<std::string> expected = {
        "title",
        "00000000  30 31 32 33 34 35 36 37  38 39 61 62 63 64 65 66  |0123456789abcdef|",
    };
    EXPECT_EQ(texts(trace_path()), expected);
}

TEST_F(PlatformTrace, ADumpOfNothingIsItsTitle) {
    EXPECT_EQ(tracesvc_dump_bytes("TARNDMPF: empty", "unused", 0), 0);
    EXPECT_EQ(tracesvc_dump_bytes(nullptr, nullptr, 0), 0);
    EXPECT_EQ(tracesvc_dump_bytes("TARNDMPF: null data", nullptr, 8), -1);
    EXPECT_EQ(texts(trace_path()),
              (std::vector<std::string>{"TARNDMPF: empty", "", "TARNDMPF: null data"}));
}

TEST_F(PlatformTrace, GetpidIsTheProcessId) {
    EXPECT_EQ(tracesvc_getpid(), static_cast<uint32_t>(::getpid()));
}

TEST_F(PlatformTrace, LinesOfManyThreadsNeverInterleave) {
    constexpr int THREADS = 4;
    constexpr int LINES = 200;
    std::vector<std::thread> writers;
    for (int t = 0; t < THREADS; ++t) {
        writers.emplace_back([t] {
            for (int i = 0; i < LINES; ++i) {
                tracesvc_trace("TARNMTHF: thread %d line %d %s", t, i, "padding padding padding");
            }
        });
    }
    for (auto &writer : writers) {
        writer.join();
    }
    std::vector<int> next(THREADS, 0);
    for (const std::string &text : texts(trace_path())) {
        int t = -1;
        int i = -1;
        ASSERT_EQ(std::sscanf(text.c_str(), "TARNMTHF: thread %d line %d", &t, &i), 2) << text;
        ASSERT_TRUE(t >= 0 && t < THREADS) << text;
        char expected[128];
        std::snprintf(expected, sizeof expected,
                      "TARNMTHF: thread %d line %d padding padding padding", t, next[t]++);
        EXPECT_EQ(text, expected);
    }
    EXPECT_EQ(next, std::vector<int>(THREADS, LINES));
}

TEST_F(PlatformTrace, ProcessesSharingTheFileKeepWholeLinesAndTheBound) {
    set_variable("TELV_TRACE_MAX_BYTES", "4000");
    constexpr int LINES = 300;
    // The trace file is already open when the child is made, as in a host that spawns.
    tracesvc_trace("TARNPRCF: parent line %d", LINES);
    pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        for (int i = 0; i < LINES; ++i) {
            tracesvc_trace("TARNPRCF: child line %d", i);
        }
        ::_exit(0);
    }
    for (int i = 0; i < LINES; ++i) {
        tracesvc_trace("TARNPRCF: parent line %d", i);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    for (const std::string &path : {trace_path(), trace_path() + ".1"}) {
        EXPECT_LE(file_size(path), 4000);
        for (const std::string &text : texts(path)) {
            char who[16] = {};
            int i = -1;
            ASSERT_EQ(std::sscanf(text.c_str(), "TARNPRCF: %15s line %d", who, &i), 2) << text;
            EXPECT_EQ(text, "TARNPRCF: " + std::string(who) + " line " + std::to_string(i));
            EXPECT_TRUE(std::string(who) == "child" || std::string(who) == "parent") << text;
        }
    }
}

} // namespace

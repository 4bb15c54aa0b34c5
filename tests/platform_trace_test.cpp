// The trace service of the default platform: stamped lines in a size-bounded trace file.
#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <filesystem>
#include <functional>
#include <map>
#include <numeric>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <utility>
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

// The texts of trace lines, every line checked for its stamp.
std::vector<std::string> texts_of(const std::string &contents) {
    std::vector<std::string> found;
    for (const std::string &line : platform_test::lines_of(contents)) {
        TraceLine parsed;
        EXPECT_TRUE(parse(line, &parsed)) << line;
        found.push_back(parsed.text);
    }
    return found;
}

std::vector<std::string> texts(const std::string &path) {
    return texts_of(read_file(path));
}

// The type bits of what `path` itself is (a link is not followed); 0 when nothing has that name.
mode_t file_type(const std::string &path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0 ? st.st_mode & S_IFMT : 0;
}

// Processes writing to one trace file: the parent writes line 0 of process 0, so that the file is
// open when the children are made, as in a host that spawns; then each child (processes 1 to
// `processes`) writes `lines` lines from each of its `threads` threads.
struct Writers {
    int processes;
    int threads;
    int lines;
};

// The text of a writer's line, "TARNPRCF: process P thread T line I", padded with dots to a fixed
// width so that lines differ in length only by the digits of their stamps.
constexpr size_t WRITER_TEXT = 80;

std::string writer_text(int process, int thread, int line) {
    char text[WRITER_TEXT + 1];
    int length = std::snprintf(text, sizeof text, "TARNPRCF: process %d thread %d line %d ",
                               process, thread, line);
    std::string padded(text, static_cast<size_t>(std::max(length, 0)));
    padded.resize(WRITER_TEXT, '.');
    return padded;
}

// Runs the writers and waits for them. Each child sends the number of its calls that returned -1
// through a pipe: the sum of them, or -1 when a child did not end normally or sent nothing.
long run_writers(const Writers &writers) {
    EXPECT_GT(tracesvc_trace("%s", writer_text(0, 0, 0).c_str()), 0);
    int report[2];
    if (::pipe(report) != 0) {
        return -1;
    }
    std::vector<pid_t> children;
    for (int process = 1; process <= writers.processes; ++process) {
        pid_t child = ::fork();
        if (child == 0) {
            ::close(report[0]);
            std::atomic<int> failures = 0;
            std::vector<std::thread> threads;
            for (int thread = 0; thread < writers.threads; ++thread) {
                threads.emplace_back([&, thread] {
                    for (int i = 0; i < writers.lines; ++i) {
                        if (tracesvc_trace("%s", writer_text(process, thread, i).c_str()) < 0) {
                            ++failures;
                        }
                    }
                });
            }
            for (auto &thread : threads) {
                thread.join();
            }
            int count = failures;
            ::_exit(::write(report[1], &count, sizeof count) == sizeof count ? 0 : 1);
        }
        if (child > 0) {
            children.push_back(child);
        }
    }
    ::close(report[1]);
    bool all_ended_well = children.size() == static_cast<size_t>(writers.processes);
    for (pid_t child : children) {
        int status = 0;
        all_ended_well &=
            ::waitpid(child, &status, 0) == child && WIFEXITED(status) && WEXITSTATUS(status) == 0;
    }
    long failures = 0;
    int reports = 0;
    for (int count = 0; ::read(report[0], &count, sizeof count) == sizeof count; ++reports) {
        failures += count;
    }
    ::close(report[0]);
    return all_ended_well && reports == writers.processes ? failures : -1;
}

// Of each process and thread, the numbers of its lines in the order found in "<path>.1" then
// "<path>". Every line must be a whole writer's line, and each file within `bound`.
using LineNumbers = std::map<std::pair<int, int>, std::vector<int>>;

LineNumbers writer_lines(const std::string &path, long bound) {
    LineNumbers found;
    for (const std::string &file : {path + ".1", path}) {
        EXPECT_LE(file_size(file), bound) << file;
        for (const std::string &text : texts(file)) {
            int process = -1;
            int thread = -1;
            int i = -1;
            bool whole = std::sscanf(text.c_str(), "TARNPRCF: process %d thread %d line %d",
                                     &process, &thread, &i) == 3 &&
                         text == writer_text(process, thread, i);
            EXPECT_TRUE(whole) << text;
            if (whole) {
                found[{process, thread}].push_back(i);
            }
        }
    }
    return found;
}

// Every line the writers write, once and in order.
LineNumbers all_lines(const Writers &writers) {
    LineNumbers all{{{0, 0}, {0}}};
    for (int process = 1; process <= writers.processes; ++process) {
        for (int thread = 0; thread < writers.threads; ++thread) {
            std::vector<int> &numbers = all[{process, thread}];
            numbers.resize(static_cast<size_t>(writers.lines));
            std::iota(numbers.begin(), numbers.end(), 0);
        }
    }
    return all;
}

// Runs `body` in a forked child; whether it returned true there and the child ended normally.
bool in_child(const std::function<bool()> &body) {
    pid_t child = ::fork();
    if (child == 0) {
        ::_exit(body() ? 0 : 1);
    }
    int status = 0;
    return child > 0 && ::waitpid(child, &status, 0) == child && WIFEXITED(status) &&
           WEXITSTATUS(status) == 0;
}

// The descriptor of this process open on `path`; -1 unless there is exactly one.
int descriptor_open_on(const std::string &path) {
    int found = -1;
    int count = 0;
    for (const auto &entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        std::error_code error;
        if (std::filesystem::read_symlink(entry.path(), error) == path) {
            found = std::stoi(entry.path().filename());
            ++count;
        }
    }
    return count == 1 ? found : -1;
}

// `text` made `width` characters long with trailing dots.
std::string padded(std::string text, size_t width) {
    text.resize(width, '.');
    return text;
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
    // A regular file named directly is rotated, never noted as past its bound.
    for (const std::vector<std::string> *lines : {&previous, &current}) {
        for (const std::string &text : *lines) {
            EXPECT_EQ(text.rfind("TARNROTF: line ", 0), 0u) << text;
        }
    }
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

// A line looks at the path only every thousand lines (or a tenth of a second): until then the
// lines go with the removed file, and the first line that finds it missing begins a new one.
TEST_F(PlatformTrace, ALostTraceFileIsBegunAgain) {
    constexpr int LOOK_EVERY_LINES = 1000;
    tracesvc_trace("TARNLOSF: before");
    ASSERT_EQ(::unlink(trace_path().c_str()), 0);
    int after = 0;
    while (after < LOOK_EVERY_LINES && !platform_test::exists(trace_path())) {
        tracesvc_trace("TARNLOSF: after %d", after++);
    }
    EXPECT_EQ(texts(trace_path()),
              std::vector<std::string>{"TARNLOSF: after " + std::to_string(after - 1)});
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
    EXPECT_EQ(run_writers({2, 1, 300}), 0);
    writer_lines(trace_path(), 4000);
}

TEST_F(PlatformTrace, ProcessesRotatingUnderEachOtherLoseNoLine) {
    // Every line fills a file of its own, so nearly every line finds its file rotated away by
    // another process at least once before it is written.
    set_variable("TELV_TRACE_MAX_BYTES", "200");
    EXPECT_EQ(run_writers({4, 4, 100}), 0);
    writer_lines(trace_path(), 200);
}

TEST_F(PlatformTrace, ProcessesSharingOneRotationKeepEveryLineOnce) {
    const Writers writers{4, 4, 50};
    // A line: the time (24 characters), the pid and the thread (1 to 10 digits each), three
    // blanks, the text, the line feed.
    constexpr long SHORTEST = 24 + 1 + 1 + 3 + static_cast<long>(WRITER_TEXT) + 1;
    constexpr long LONGEST = 24 + 10 + 10 + 3 + static_cast<long>(WRITER_TEXT) + 1;
    const long count = 1 + static_cast<long>(writers.processes) * writers.threads * writers.lines;
    // More than the bound in all, so the file is rotated once; less than twice the bound less a
    // line, so the new file never fills and "<file>.1" is never replaced: no line may be missing.
    const long bound = count * SHORTEST - 1;
    ASSERT_LE(count * LONGEST, 2 * bound - LONGEST + 1);
    set_variable("TELV_TRACE_MAX_BYTES", std::to_string(bound));
    EXPECT_EQ(run_writers(writers), 0);
    EXPECT_GT(file_size(trace_path() + ".1"), 0);
    EXPECT_EQ(writer_lines(trace_path(), bound), all_lines(writers));
}

TEST_F(PlatformTrace, ALinkIsWrittenThroughAndNeverRotated) {
    std::string target = dir + "/target.trace";
    std::string link = dir + "/link.trace";
    ASSERT_EQ(::symlink(target.c_str(), link.c_str()), 0);
    set_variable("TELV_TRACE_FILE", link);
    set_variable("TELV_TRACE_MAX_BYTES", "300");
    std::vector<std::string> expected;
    for (int i = 0; i < 20; ++i) {
        expected.push_back("TARNLNKF: line " + std::to_string(i) + " through the link");
        EXPECT_GT(tracesvc_trace("%s", expected.back().c_str()), 0);
    }
    EXPECT_EQ(file_type(link), S_IFLNK);
    EXPECT_EQ(file_type(link + ".1"), 0u);
    EXPECT_EQ(file_type(target + ".1"), 0u);
    EXPECT_GT(file_size(target), 300);
    std::vector<std::string> found = texts(target);
    std::string note = "TELVTRCF: trace file " + link +
                       " is not a regular file: it is not rotated and grows past its bound of "
                       "300 bytes";
    EXPECT_EQ(std::count(found.begin(), found.end(), note), 1);
    found.erase(std::remove(found.begin(), found.end(), note), found.end());
    EXPECT_EQ(found, expected);
}

TEST_F(PlatformTrace, ADeviceIsWrittenAndNeverRotated) {
    set_variable("TELV_TRACE_FILE", "/dev/null");
    set_variable("TELV_TRACE_MAX_BYTES", "50");
    for (int i = 0; i < 20; ++i) {
        EXPECT_GT(tracesvc_trace("TARNDEVF: line %d to the null device", i), 0);
    }
    EXPECT_EQ(file_type("/dev/null"), S_IFCHR);
    EXPECT_EQ(file_type("/dev/null.1"), 0u);
}

TEST_F(PlatformTrace, AFifoIsWrittenAndNeverRotated) {
    std::string fifo = dir + "/trace.fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    int reader = ::open(fifo.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
    ASSERT_GE(reader, 0);
    set_variable("TELV_TRACE_FILE", fifo);
    set_variable("TELV_TRACE_MAX_BYTES", "100");
    std::vector<std::string> expected;
    for (int i = 0; i < 10; ++i) {
        expected.push_back("TARNFIFF: line " + std::to_string(i));
        EXPECT_GT(tracesvc_trace("%s", expected.back().c_str()), 0);
    }
    // The platform lets go of the FIFO before its reader does, so no later line meets a pipe
    // without a reader.
    set_variable("TELV_TRACE_FILE", trace_path());
    tracesvc_trace("TARNFIFF: back to the trace file");
    std::string contents;
    char chunk[4096];
    for (ssize_t n; (n = ::read(reader, chunk, sizeof chunk)) > 0;) {
        contents.append(chunk, static_cast<size_t>(n));
    }
    ::close(reader);
    EXPECT_EQ(texts_of(contents), expected);
    EXPECT_EQ(file_type(fifo), S_IFIFO);
    EXPECT_EQ(file_type(fifo + ".1"), 0u);
}

TEST_F(PlatformTrace, ARotationThatMovesNothingFailsInsteadOfGoingRound) {
    set_variable("TELV_TRACE_MAX_BYTES", "100");
    ASSERT_GT(tracesvc_trace("TARNHLKF: first"), 0);
    // "<name>.1" is the file itself: renaming one name over the other leaves both in place.
    ASSERT_EQ(::link(trace_path().c_str(), (trace_path() + ".1").c_str()), 0);
    EXPECT_EQ(tracesvc_trace("TARNHLKF: the second line, which takes the file past its bound"), -1);
    EXPECT_EQ(texts(trace_path()), std::vector<std::string>{"TARNHLKF: first"});
}

// A line of ours after another process rotated the file goes to the new file, never to the one
// renamed away. Lines: A is 160 to 172 bytes, B and C 60 to 72 (the stamp holds 29 to 41).
TEST_F(PlatformTrace, AFileRotatedByAnotherProcessIsLeftAtTheNextLine) {
    set_variable("TELV_TRACE_MAX_BYTES", "200");
    const std::string a = padded("TARNROTF: A ", 130);
    const std::string b = padded("TARNROTF: B ", 30);
    const std::string c = padded("TARNROTF: C ", 30);
    ASSERT_GT(tracesvc_trace("%s", a.c_str()), 0);
    ASSERT_TRUE(in_child([&] { return tracesvc_trace("%s", b.c_str()) > 0; }));
    ASSERT_GT(tracesvc_trace("%s", c.c_str()), 0);
    EXPECT_EQ(texts(trace_path() + ".1"), std::vector<std::string>{a});
    EXPECT_EQ(texts(trace_path()), (std::vector<std::string>{b, c}));
}

// The size that decides a rotation counts the lines of every process: 60 to 72 bytes for P1, Q1
// and Q2, 130 to 142 for P2, so P2 would take the file past 300 bytes and begins a new one.
TEST_F(PlatformTrace, TheBoundCountsTheLinesOfOtherProcesses) {
    set_variable("TELV_TRACE_MAX_BYTES", "300");
    const std::string p1 = padded("TARNBNDF: P1 ", 30);
    const std::string q1 = padded("TARNBNDF: Q1 ", 30);
    const std::string q2 = padded("TARNBNDF: Q2 ", 30);
    const std::string p2 = padded("TARNBNDF: P2 ", 100);
    ASSERT_GT(tracesvc_trace("%s", p1.c_str()), 0);
    ASSERT_TRUE(in_child([&] {
        return tracesvc_trace("%s", q1.c_str()) > 0 && tracesvc_trace("%s", q2.c_str()) > 0;
    }));
    ASSERT_GT(tracesvc_trace("%s", p2.c_str()), 0);
    EXPECT_EQ(texts(trace_path() + ".1"), (std::vector<std::string>{p1, q1, q2}));
    EXPECT_EQ(texts(trace_path()), std::vector<std::string>{p2});
}

TEST_F(PlatformTrace, AChangedFileOrDataDirectoryIsUsedFromTheNextLine) {
    const std::string a = dir + "/a.trace";
    const std::string b = dir + "/b.trace";
    const std::string other = dir + "/other";
    set_variable("TELV_TRACE_FILE", a);
    tracesvc_trace("TARNENVF: 1");
    set_variable("TELV_TRACE_FILE", b);
    tracesvc_trace("TARNENVF: 2");
    set_variable("TELV_TRACE_FILE", a);
    tracesvc_trace("TARNENVF: 3");
    ::unsetenv("TELV_TRACE_FILE");
    tracesvc_trace("TARNENVF: 4");
    set_variable("TELV_DATA_DIR", other);
    tracesvc_trace("TARNENVF: 5");
    set_variable("TELV_DATA_DIR", dir);
    set_variable("TELV_TRACE_FILE", "");
    tracesvc_trace("TARNENVF: 6");
    EXPECT_EQ(texts(a), (std::vector<std::string>{"TARNENVF: 1", "TARNENVF: 3"}));
    EXPECT_EQ(texts(b), std::vector<std::string>{"TARNENVF: 2"});
    EXPECT_EQ(texts(trace_path()), (std::vector<std::string>{"TARNENVF: 4", "TARNENVF: 6"}));
    EXPECT_EQ(texts(other + "/telvzmnd.trace"), std::vector<std::string>{"TARNENVF: 5"});
}

TEST_F(PlatformTrace, AChangedBoundIsKeptFromTheNextLine) {
    const std::string first = padded("TARNBNDF: first ", 60);
    const std::string second = padded("TARNBNDF: second ", 60);
    tracesvc_trace("%s", first.c_str());
    set_variable("TELV_TRACE_MAX_BYTES", "150");
    tracesvc_trace("%s", second.c_str());
    EXPECT_EQ(texts(trace_path() + ".1"), std::vector<std::string>{first});
    EXPECT_EQ(texts(trace_path()), std::vector<std::string>{second});
}

// However the environment changes between two lines (a value replaced or changed in place, a
// variable removed and another added in its stead), the second line follows it. A dropped line
// still answers the length of its text.
TEST_F(PlatformTrace, DetailSwitchedBetweenTwoLinesIsFollowedAtTheSecond) {
    static char entry[] = "TELV_TRACE_DETAIL=0";
    std::snprintf(entry, sizeof entry, "TELV_TRACE_DETAIL=0");
    set_variable("TELV_TRACE_DETAIL", "0");
    EXPECT_EQ(tracesvc_trace("TARNSWTD: dropped %d", 1), 19);
    set_variable("TELV_TRACE_DETAIL", "1");
    tracesvc_trace("TARNSWTD: kept %d", 2);
    set_variable("TELV_TRACE_DETAIL", "0");
    EXPECT_EQ(tracesvc_trace("TARN%sD: dropped by its text %d", "SWT", 3), 31);
    ::unsetenv("TELV_TRACE_DETAIL");
    tracesvc_trace("TARNSWTD: kept %d", 4);
    set_variable("TELV_TRACE_DETAIL", "");
    tracesvc_trace("TARNSWTD: kept %d", 5);
    ASSERT_EQ(::putenv(entry), 0);
    tracesvc_trace("TARNSWTD: dropped %d", 6);
    entry[sizeof entry - 2] = '1';
    tracesvc_trace("TARNSWTD: kept %d", 7);
    ::unsetenv("TELV_TRACE_DETAIL");
    set_variable("TELV_TRACE_TEST_FILLER", "x");
    tracesvc_trace("TARNSWTD: kept %d", 8);
    ::unsetenv("TELV_TRACE_TEST_FILLER");
    set_variable("TELV_TRACE_DETAIL", "0");
    tracesvc_trace("TARNSWTD: dropped %d", 9);
    tracesvc_trace("TARNSWTF: flow %d", 10);
    ::unsetenv("TELV_TRACE_DETAIL");
    std::vector<std::string> expected = {"TARNSWTD: kept 2", "TARNSWTD: kept 4",
                                         "TARNSWTD: kept 5", "TARNSWTD: kept 7",
                                         "TARNSWTD: kept 8", "TARNSWTF: flow 10"};
    EXPECT_EQ(texts(trace_path()), expected);
}

// A forked child writes with its own pid and thread, through a description of the file that it
// opened itself: its line leaves the parent's offset where the parent's last line left it.
TEST_F(PlatformTrace, AForkedChildWritesThroughADescriptionOfItsOwn) {
    ASSERT_GT(tracesvc_trace("TARNFRKF: parent"), 0);
    int parents = descriptor_open_on(trace_path());
    ASSERT_GE(parents, 0);
    off_t offset = ::lseek(parents, 0, SEEK_CUR);
    ASSERT_EQ(offset, file_size(trace_path()));
    pid_t child = 0;
    int report[2];
    ASSERT_EQ(::pipe(report), 0);
    ASSERT_TRUE(in_child([&] {
        pid_t own = ::getpid();
        return tracesvc_trace("TARNFRKF: child") > 0 &&
               ::write(report[1], &own, sizeof own) == sizeof own;
    }));
    ASSERT_EQ(::read(report[0], &child, sizeof child), static_cast<ssize_t>(sizeof child));
    ::close(report[0]);
    ::close(report[1]);
    EXPECT_EQ(::lseek(parents, 0, SEEK_CUR), offset);
    EXPECT_GT(file_size(trace_path()), offset);
    ASSERT_GT(tracesvc_trace("TARNFRKF: parent again"), 0);
    std::vector<std::string> lines = read_lines(trace_path());
    ASSERT_EQ(lines.size(), 3u);
    std::vector<TraceLine> parsed(3);
    for (size_t i = 0; i < 3; ++i) {
        ASSERT_TRUE(parse(lines[i], &parsed[i])) << lines[i];
    }
    EXPECT_EQ(parsed[0].pid, ::getpid());
    EXPECT_EQ(parsed[1].text, "TARNFRKF: child");
    EXPECT_EQ(parsed[1].pid, child);
    EXPECT_EQ(parsed[1].thread, child); // the child's only thread
    EXPECT_EQ(parsed[2].pid, ::getpid());
    EXPECT_EQ(parsed[2].thread, platform_test::own_thread_id());
}

// While another thread writes lines, a child forked meanwhile can write its own: it never finds
// the platform's lock taken by a thread that it does not have.
TEST_F(PlatformTrace, AChildForkedWhileAnotherThreadTracesWritesItsLine) {
    constexpr int CHILDREN = 20;
    std::atomic<bool> stop = false;
    std::thread writer([&] {
        for (int i = 0; !stop; ++i) {
            tracesvc_trace("TARNFRKF: thread line %d", i);
        }
    });
    int written = 0;
    for (int i = 0; i < CHILDREN; ++i) {
        written += in_child([i] { return tracesvc_trace("TARNFRKF: child %d", i) > 0; }) ? 1 : 0;
    }
    stop = true;
    writer.join();
    EXPECT_EQ(written, CHILDREN);
    std::vector<std::string> found = texts(trace_path());
    for (int i = 0; i < CHILDREN; ++i) {
        EXPECT_EQ(std::count(found.begin(), found.end(), "TARNFRKF: child " + std::to_string(i)),
                  1);
    }
}

// Many threads rotating one file among them: every line whole, every file within the bound, and
// each thread's lines in the order written.
TEST_F(PlatformTrace, ThreadsRotatingTheFileKeepWholeLinesWithinTheBound) {
    constexpr int THREADS = 8;
    constexpr int LINES = 300;
    set_variable("TELV_TRACE_MAX_BYTES", "3000");
    std::vector<std::thread> writers;
    for (int t = 0; t < THREADS; ++t) {
        writers.emplace_back([t] {
            for (int i = 0; i < LINES; ++i) {
                tracesvc_trace("%s", writer_text(0, t, i).c_str());
            }
        });
    }
    for (auto &writer : writers) {
        writer.join();
    }
    LineNumbers found = writer_lines(trace_path(), 3000);
    EXPECT_FALSE(found.empty());
    for (const auto &[writer, numbers] : found) {
        EXPECT_TRUE(std::is_sorted(numbers.begin(), numbers.end())) << writer.second;
        EXPECT_EQ(std::adjacent_find(numbers.begin(), numbers.end()), numbers.end());
    }
    EXPECT_GT(file_size(trace_path() + ".1"), 3000 - 200);
}

// ---- Detail lines wait to be written together ----

// As the platform promises: at most this many bytes wait, and no longer than this.
constexpr long WAITING_BYTES = 64 << 10;
constexpr int WAIT_AT_MOST_MS = 100;

TEST_F(PlatformTrace, DetailLinesWaitForTheNextLineThatIsNone) {
    EXPECT_EQ(tracesvc_trace("TARNWATD: first %d", 1), 17);
    tracesvc_trace("TARNWATD: second");
    EXPECT_EQ(file_size(trace_path()), -1);
    tracesvc_trace("TARNWATF: flow");
    std::vector<std::string> expected = {"TARNWATD: first 1", "TARNWATD: second", "TARNWATF: flow"};
    EXPECT_EQ(texts(trace_path()), expected);
}

// Lines that would pass the batch go out first, whole: the file then holds the lines before the
// one that did not fit, no more than a batch of them, and no less than a batch less one line.
TEST_F(PlatformTrace, WaitingLinesGoOutBeforeTheLineThatWouldPassTheBatch) {
    std::string text = padded("TARNBATD: ", 1000);
    int traced = 0;
    while (file_size(trace_path()) <= 0 && traced < 1000) {
        tracesvc_trace("%s", text.c_str());
        ++traced;
    }
    long written = file_size(trace_path());
    EXPECT_LE(written, WAITING_BYTES);
    EXPECT_GT(written, WAITING_BYTES - 1100);
    std::vector<std::string> lines = texts(trace_path());
    EXPECT_EQ(lines.size(), static_cast<size_t>(traced - 1));
    EXPECT_EQ(lines.back(), text);
}

TEST_F(PlatformTrace, AWaitingLineGoesOutWhenTheNextComesLate) {
    tracesvc_trace("TARNLATD: early");
    ::usleep((WAIT_AT_MOST_MS + 20) * 1000);
    tracesvc_trace("TARNLATD: late");
    EXPECT_EQ(texts(trace_path()), std::vector<std::string>{"TARNLATD: early"});
}

TEST_F(PlatformTrace, WaitingLinesGoToTheFileTheyWereTracedTo) {
    std::string first = dir + "/first.trace";
    std::string second = dir + "/second.trace";
    set_variable("TELV_TRACE_FILE", first);
    tracesvc_trace("TARNTGTD: to the first");
    set_variable("TELV_TRACE_FILE", second);
    tracesvc_trace("TARNTGTD: to the second");
    EXPECT_EQ(texts(first), std::vector<std::string>{"TARNTGTD: to the first"});
    EXPECT_EQ(file_size(second), -1);
    ::unsetenv("TELV_TRACE_FILE");
    tracesvc_trace("TARNTGTF: to the default");
    EXPECT_EQ(texts(second), std::vector<std::string>{"TARNTGTD: to the second"});
    EXPECT_EQ(texts(trace_path()), std::vector<std::string>{"TARNTGTF: to the default"});
}

// A changed bound is another target too: what waits is no more than the bound it was traced under.
TEST_F(PlatformTrace, ABatchIsNeverLargerThanTheBoundAndRotatesTheFileWhole) {
    set_variable("TELV_TRACE_MAX_BYTES", "1000");
    std::vector<std::string> traced;
    for (int i = 0; i < 40; ++i) {
        traced.push_back(padded("TARNRTBD: line " + std::to_string(i) + " ", 60));
        tracesvc_trace("%s", traced.back().c_str());
    }
    traced.push_back("TARNRTBF: flow");
    tracesvc_trace("%s", traced.back().c_str());
    EXPECT_LE(file_size(trace_path()), 1000);
    EXPECT_LE(file_size(trace_path() + ".1"), 1000);
    EXPECT_GT(file_size(trace_path() + ".1"), 1000 - 2 * 100);
    std::vector<std::string> last = texts(trace_path());
    std::vector<std::string> before = texts(trace_path() + ".1");
    ASSERT_FALSE(before.empty());
    ASSERT_FALSE(last.empty());
    EXPECT_TRUE(std::equal(last.rbegin(), last.rend(), traced.rbegin())); // the newest lines
    EXPECT_EQ(before.back(), traced[traced.size() - last.size() - 1]);    // right before them
}

TEST_F(PlatformTrace, ADetailDumpWaitsAndAnotherIsWrittenWholeAtItsEnd) {
    EXPECT_EQ(tracesvc_dump_bytes("TARNDMPD: detail dump", "abc", 3), 0);
    EXPECT_EQ(file_size(trace_path()), -1);
    EXPECT_EQ(tracesvc_dump_bytes("TARNDMPF: flow dump", "xyz", 3), 0);
    std::string row = std::string(1 + 13 * 3 + 1 + 1, ' ');
    std::vector<std::string> expected = {
        "TARNDMPD: detail dump",
        "00000000  61 62 63" + row + "|abc|",
        "TARNDMPF: flow dump",
        "00000000  78 79 7A" + row + "|xyz|",
    };
    EXPECT_EQ(texts(trace_path()), expected);
}

TEST_F(PlatformTrace, WaitingLinesAreWrittenWhenTheProcessEnds) {
    pid_t child = ::fork();
    if (child == 0) {
        tracesvc_trace("TARNENDD: written at exit");
        std::exit(0); // not _exit: the process ends the way a host's does
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(texts(trace_path()), std::vector<std::string>{"TARNENDD: written at exit"});
}

// The child of a fork leaves what was waiting to its parent: written once, by the parent.
TEST_F(PlatformTrace, AForkedChildLeavesTheWaitingLinesToItsParent) {
    tracesvc_trace("TARNFWTD: waiting at the fork");
    ASSERT_TRUE(in_child([] { return tracesvc_trace("TARNFWTF: child") > 0; }));
    tracesvc_trace("TARNFWTF: parent");
    std::vector<std::string> expected = {"TARNFWTF: child", "TARNFWTD: waiting at the fork",
                                         "TARNFWTF: parent"};
    EXPECT_EQ(texts(trace_path()), expected);
}

} // namespace

// The snapshot file writer over the default platform's real data files, and tarnmon reading them.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <sys/wait.h>
#include <vector>

#include "capture/snapshot_file.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "snapshot_stamp.h"

namespace {

using snapshot_stamp::fixed_clock;
using snapshot_stamp::STAMP;

void save(const std::string &text, int32_t final = 0) {
    std::vector<char> data(text.begin(), text.end());
    data.push_back('\0');
    tarn_save_data(data.data(), file_buffer, FILE_BUFFER_SIZE, final);
}

// Writes one snapshot as the monitoring loop does and returns the text it must leave in the file.
std::string write_snapshot(bool problem, const std::string &body) {
    std::string opening(problem ? PROBLEM_SNAPSHOT_OPENING : PLAIN_SNAPSHOT_OPENING);
    std::string closing(problem ? PROBLEM_SNAPSHOT_CLOSING : PLAIN_SNAPSHOT_CLOSING);
    save(opening);
    tarn_add_timestamp();
    save(body);
    save(closing, 1);
    return opening + "\n\r" + STAMP + body + "\n\r" + closing + "\n\r";
}

struct run_result {
    int status;
    std::string out;
    std::string err;
};

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

class SnapshotPlatform : public ::testing::Test {
  protected:
    void SetUp() override {
        char pattern[] = "/tmp/tarn-snapshot-XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
        setenv("TELV_DATA_DIR", dir_.c_str(), 1);
        setenv("TZ", "UTC", 1);
        tzset();
        std::memset(file_buffer, 0, sizeof file_buffer);
        max_snapshot_file_size = 1545056;
        snapshot_clock = fixed_clock;
    }
    void TearDown() override {
        snapshot_clock = time;
        max_snapshot_file_size = 0;
        std::error_code ignored;
        std::filesystem::remove_all(dir_, ignored);
    }

    std::string file_path() const { return dir_ + "/telvzmnd.trm"; }
    std::string snapshot_file() const { return read_file(file_path()); }

    // Runs the built tarnmon with `args` in this test's data directory.
    run_result tarnmon(const std::string &args) const {
        const char *build = std::getenv("TARN_BUILD_DIR");
        std::string binary = std::string(build != nullptr ? build : ".") + "/tarnmon";
        std::string err_path = dir_ + "/stderr.txt";
        std::string command = binary + " snapshots " + args + " 2>" + err_path;
        run_result result{};
        FILE *pipe = popen(command.c_str(), "r");
        if (pipe == nullptr) {
            ADD_FAILURE() << "cannot run " << command;
            return result;
        }
        char chunk[4096];
        size_t n;
        while ((n = std::fread(chunk, 1, sizeof chunk, pipe)) > 0) {
            result.out.append(chunk, n);
        }
        int status = pclose(pipe);
        result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        result.err = read_file(err_path);
        return result;
    }

    std::string dir_;
};

TEST_F(SnapshotPlatform, SnapshotsReachTheDataDirectory) {
    std::string first = write_snapshot(false, "gathered line 1\n\rgathered line 2\n\r");
    std::string second = write_snapshot(true, "rss of appserver is above its limit\n\r");
    EXPECT_EQ(snapshot_file(), first + second);
    EXPECT_EQ(file_buffer[0], '\0');
}

TEST_F(SnapshotPlatform, WrapKeepsRealFilesWithinTheBound) {
    max_snapshot_file_size = 3000;
    int wraps = 0;
    for (int i = 0; i < 40; ++i) {
        std::string body(100 + 37 * (i % 9), static_cast<char>('a' + i % 26));
        std::string before = snapshot_file();
        std::string block = write_snapshot(i % 3 == 0, body);
        std::string file = snapshot_file();
        ASSERT_LE(file.size(), 3002u) << i;
        ASSERT_TRUE(file.ends_with(block)) << i;
        bool wrapped = file != before + block;
        wraps += wrapped ? 1 : 0;
        if (wrapped && file.find("=START=") != std::string::npos) {
            ASSERT_TRUE(file.starts_with("=START=")) << i;
        }
    }
    EXPECT_GT(wraps, 5);
}

TEST_F(SnapshotPlatform, AFailedOpenOfTheRealServiceReachesTheEventLog) {
    // The data directory is a plain file, so the open fails with the service's result 8 and
    // ENOTDIR (0x14), and the report goes out in the system class.
    std::ofstream(dir_ + "/plain-file") << "x";
    setenv("TELV_DATA_DIR", (dir_ + "/plain-file").c_str(), 1);
    setenv("TELV_EVENT_LOG", (dir_ + "/events.log").c_str(), 1);
    write_snapshot(false, "gathered\n\r");
    unsetenv("TELV_EVENT_LOG");
    std::string events = read_file(dir_ + "/events.log");
    EXPECT_NE(events.find("\"reason\":\"0xE0F1\",\"severity\":\"error\",\"option\":\"0x300\","
                          "\"compRc\":\"0x14\""),
              std::string::npos)
        << events;
    EXPECT_EQ(std::count(events.begin(), events.end(), '\n'), 1) << events;
    EXPECT_EQ(file_buffer[0], '\0');
}

TEST_F(SnapshotPlatform, TarnmonListsWhatTheLibraryWrote) {
    std::string first = write_snapshot(false, "gathered\n\r");
    std::string second = write_snapshot(true, "rss of appserver is above its limit\n\r");
    run_result r = tarnmon("");
    EXPECT_EQ(r.status, 0) << r.err;
    char expected[1024];
    std::snprintf(expected, sizeof expected,
                  "%s: %zu bytes, 2 blocks\n"
                  "%5s  %-34s  %-34s  %10s\n"
                  "%5d  %-34s  %-34s  %10zu\n"
                  "%5d  %-34s  %-34s  %10zu\n",
                  file_path().c_str(), first.size() + second.size(), "#", "kind", "time stamp",
                  "bytes", 1, "plain", "5 March 2021 at 07:04:09", first.size(), 2, "problem",
                  "5 March 2021 at 07:04:09", second.size());
    EXPECT_EQ(r.out, expected);
    EXPECT_EQ(r.err, "");
}

// A snapshot as tarnmon shows it on a terminal: every "\n\r" made "\n".
std::string shown(bool problem, const std::string &body) {
    return std::string(problem ? PROBLEM_SNAPSHOT_OPENING : PLAIN_SNAPSHOT_OPENING) +
           "\nLocal date and time = 5 March 2021 at 07:04:09 \nCode Version 61.001\n" + body +
           "\n\n" + std::string(problem ? PROBLEM_SNAPSHOT_CLOSING : PLAIN_SNAPSHOT_CLOSING) + "\n";
}

TEST_F(SnapshotPlatform, TarnmonShowsABlockByNumberAndTheLastProblem) {
    write_snapshot(true, "older problem\n\r");
    write_snapshot(false, "gathered\n\r");
    write_snapshot(true, "newest problem\n\r");
    write_snapshot(false, "after it\n\r");

    run_result second = tarnmon("2");
    EXPECT_EQ(second.status, 0) << second.err;
    EXPECT_EQ(second.out, shown(false, "gathered"));

    run_result last = tarnmon("last");
    EXPECT_EQ(last.status, 0) << last.err;
    EXPECT_EQ(last.out, shown(true, "newest problem"));
}

TEST_F(SnapshotPlatform, TarnmonShowsTheHeadOfAWrappedFileAsPartial) {
    max_snapshot_file_size = 400;
    write_snapshot(true, std::string(150, 'p'));
    write_snapshot(true, std::string(150, 'q')); // no marker: the wrap cuts mid-line
    std::string file = snapshot_file();
    ASSERT_FALSE(file.starts_with("=START"));
    run_result r = tarnmon("");
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("    1  problem, partial (cut by wrap)"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("    2  problem "), std::string::npos) << r.out;
}

TEST_F(SnapshotPlatform, TarnmonReadsAnotherFileOnRequest) {
    std::string other = dir_ + "/other.trm";
    std::ofstream(other, std::ios::binary) << std::string(PLAIN_SNAPSHOT_OPENING) << "\n\rx\n\r";
    run_result r = tarnmon("--file " + other + " 1");
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, std::string(PLAIN_SNAPSHOT_OPENING) + "\nx\n");
}

TEST_F(SnapshotPlatform, TarnmonSaysWhenThereIsNoFile) {
    run_result r = tarnmon("");
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: no snapshot file at " + file_path() +
                         ": the monitor has not written one (or TELV_DATA_DIR names another "
                         "directory)\n");
}

TEST_F(SnapshotPlatform, TarnmonRefusesWhatItCannotShow) {
    write_snapshot(false, "gathered\n\r");
    run_result missing = tarnmon("2");
    EXPECT_EQ(missing.status, 3);
    EXPECT_EQ(missing.err, "tarnmon: no block 2: the file holds 1 (see tarnmon snapshots)\n");
    run_result no_problem = tarnmon("last");
    EXPECT_EQ(no_problem.status, 3);
    EXPECT_EQ(no_problem.err, "tarnmon: no problem snapshot in the file\n");
    for (const char *wrong : {"first", "0x1", "1 2", "--file", "-v"}) {
        run_result usage = tarnmon(wrong);
        EXPECT_EQ(usage.status, 2) << wrong;
        EXPECT_EQ(usage.err, "usage: tarnmon snapshots [--file PATH] [--json] [N|last]\n") << wrong;
    }
    run_result zero = tarnmon("0");
    EXPECT_EQ(zero.status, 3);
}

} // namespace

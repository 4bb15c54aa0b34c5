// tarnmon status and stop, run as separate processes against a real control block in a private
// IPC namespace; the command line every command shares; tarnmon snapshots over files that no
// monitor wrote.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <unistd.h>

#include "capture/snapshot_file.h"
#include "core/control_block.h"
#include "data_blocks.h"
#include "private_ipc.h"
#include "run_command.h"

namespace {

std::string tarnmon() {
    return std::string(std::getenv("TARN_BUILD_DIR")) + "/tarnmon";
}

class Tarnmon : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        char pattern[] = "/tmp/tarnmon-test-XXXXXX";
        data_dir = mkdtemp(pattern);
        setenv("TELV_DATA_DIR", data_dir.c_str(), 1);
        unsetenv("TELV_EVENT_LOG");
        unsetenv("TELV_TRACE_FILE");
    }
    void TearDown() override {
        if (block != nullptr) {
            shmdt(block);
        }
        if (id != -1) {
            shmctl(id, IPC_RMID, nullptr);
        }
        std::filesystem::remove_all(data_dir);
    }

    // A block as a running monitor leaves it; of another size, a segment of some other program
    // under the monitor's key, which `block` then only holds the address of.
    void create_block(size_t size = TARN_CB_SIZE) {
        id = shmget(static_cast<key_t>(TARN_CB_KEY), size, IPC_CREAT | 0666);
        ASSERT_NE(id, -1);
        block = static_cast<tarn_control_block *>(shmat(id, nullptr, 0));
        ASSERT_NE(block, reinterpret_cast<void *>(-1));
    }

    std::string event_log() {
        std::ifstream in(data_dir + "/telvzmnd.events");
        std::ostringstream text;
        text << in.rdbuf();
        return text.str();
    }

    std::string data_dir;
    int id = -1;
    tarn_control_block *block = nullptr;
};

TEST_F(Tarnmon, StatusWithoutAMonitorSaysSo) {
    command_result r = run_command({tarnmon(), "status"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err,
              "tarnmon: no monitor has created its control block (key 0x96728017) on this host\n");
}

TEST_F(Tarnmon, StatusPrintsTheNineFieldsByName) {
    create_block();
    block->analysisIndex = 5;
    block->numLoopsBeforeCPUChecking = 11;
    block->tookLog = 1;
    block->maxSleepTime = 66;
    block->sleep_time_percent = -1;
    block->uBufferLock = 3;
    command_result r = run_command({tarnmon(), "status"});
    EXPECT_EQ(r.status, 0) << r.err;
    std::istringstream lines(r.out);
    std::string line;
    std::getline(lines, line);
    EXPECT_EQ(line.rfind("control block 0x96728017: id ", 0), 0u) << line;
    const std::pair<const char *, const char *> expected[] = {
        {"analysisIndex", "5"}, {"sleepTimeExceeded", "0"}, {"numLoopsBeforeCPUChecking", "11"},
        {"tookLog", "1"},       {"maxSleepTime", "66"},     {"sleep_time_percent", "-1"},
        {"uBufferLock", "3"},   {"terminateRequest", "0"},  {"logAsInfo", "0"},
    };
    for (const auto &[name, value] : expected) {
        ASSERT_TRUE(std::getline(lines, line));
        std::istringstream words(line);
        std::string field, number;
        words >> field >> number;
        EXPECT_EQ(field, name);
        EXPECT_EQ(number, value) << name;
    }
    EXPECT_FALSE(std::getline(lines, line));
}

TEST_F(Tarnmon, StatusRefusesASegmentOfAnotherSize) {
    create_block(100);
    command_result r = run_command({tarnmon(), "status"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has 100 "
                     "bytes, not 2940036\n");
}

TEST_F(Tarnmon, StopLeavesALargerSegmentAlone) {
    create_block(4000000);
    command_result status = run_command({tarnmon(), "status"});
    EXPECT_EQ(status.status, 3);
    EXPECT_EQ(status.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has "
                          "4000000 bytes, not 2940036\n");
    command_result stop = run_command({tarnmon(), "stop"});
    EXPECT_EQ(stop.status, 3);
    EXPECT_EQ(stop.out, "");
    EXPECT_EQ(stop.err, "tarnmon: the segment of key 0x96728017 is not a control block: it has "
                        "4000000 bytes, not 2940036; the request was logged only\n");
    // Where terminateRequest would stand in a control block.
    const auto *bytes = reinterpret_cast<const unsigned char *>(block);
    for (size_t i = 2940028; i < 2940032; ++i) {
        EXPECT_EQ(bytes[i], 0) << i;
    }
}

TEST_F(Tarnmon, StatusDoesNotWriteTheBlock) {
    create_block();
    std::memset(block, 0x5A, TARN_CB_SIZE);
    EXPECT_EQ(run_command({tarnmon(), "status"}).status, 0);
    const auto *bytes = reinterpret_cast<const unsigned char *>(block);
    for (size_t i = 0; i < TARN_CB_SIZE; ++i) {
        ASSERT_EQ(bytes[i], 0x5A) << i;
    }
}

TEST_F(Tarnmon, StopSetsTheRequestAndLogsIt) {
    create_block();
    command_result r = run_command({tarnmon(), "stop"});
    EXPECT_EQ(r.status, 0) << r.out << r.err;
    EXPECT_EQ(r.out, "termination requested: the monitor ends after its current pass\n");
    EXPECT_EQ(block->terminateRequest, 1u);
    std::string log = event_log();
    EXPECT_NE(log.find("\"reason\":\"0xE170\""), std::string::npos) << log;
    EXPECT_NE(log.find("\"severity\":\"informational\""), std::string::npos) << log;
}

TEST_F(Tarnmon, StopWithoutAMonitorStillLogsTheRequest) {
    command_result r = run_command({tarnmon(), "stop"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: no monitor has created its control block (key 0x96728017) on this "
                     "host; the request was logged only\n");
    EXPECT_NE(event_log().find("\"reason\":\"0xE170\""), std::string::npos);
}

TEST_F(Tarnmon, UsageAndHelp) {
    command_result none = run_command({tarnmon()});
    EXPECT_EQ(none.status, 2);
    EXPECT_NE(none.err.find("usage: tarnmon COMMAND [ARGS]"), std::string::npos);
    command_result help = run_command({tarnmon(), "--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("check-config [FILE]"), std::string::npos);
    EXPECT_NE(help.out.find("exit status: 0 fine, 1 finding, 2 usage error, 3 not available"),
              std::string::npos);
    command_result unknown = run_command({tarnmon(), "frobnicate"});
    EXPECT_EQ(unknown.status, 2);
    EXPECT_NE(unknown.err.find("tarnmon: unknown command 'frobnicate'"), std::string::npos);
    EXPECT_EQ(run_command({tarnmon(), "status", "extra"}).status, 2);
    EXPECT_EQ(run_command({tarnmon(), "stop", "extra"}).status, 2);
}

TEST_F(Tarnmon, EveryCommandTakesHelpAndRefusesWhatItDoesNotKnow) {
    for (std::string name : {"status", "stop", "check-config", "snapshots"}) {
        command_result help = run_command({tarnmon(), name, "--help"});
        EXPECT_EQ(help.status, 0) << name;
        EXPECT_EQ(help.out.rfind("usage: tarnmon " + name, 0), 0u) << help.out;
        EXPECT_NE(help.out.find("\nexit status: 0 fine, 1 finding, 2 usage error, 3 not "
                                "available\n"),
                  std::string::npos)
            << help.out;
        EXPECT_EQ(help.err, "") << name;
        for (const char *wrong : {"--bogus", "-x", "-"}) {
            command_result r = run_command({tarnmon(), name, wrong});
            EXPECT_EQ(r.status, 2) << name << " " << wrong;
            EXPECT_EQ(r.out, "") << name << " " << wrong;
            EXPECT_EQ(r.err.rfind("usage: tarnmon " + name, 0), 0u) << r.err;
        }
    }
    // Neither a request for help nor a refused command line reaches the monitor.
    EXPECT_EQ(event_log(), "");
}

TEST_F(Tarnmon, HelpOfACommandIsItsUsageAndSummary) {
    command_result r = run_command({tarnmon(), "status", "--help"});
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.out, "usage: tarnmon status\n"
                     "show the control block of a running monitor\n\n"
                     "exit status: 0 fine, 1 finding, 2 usage error, 3 not available\n");
}

// tarnmon snapshots over files written here; no control block is involved.
class TarnmonSnapshots : public ::testing::Test {
  protected:
    void SetUp() override {
        char pattern[] = "/tmp/tarnmon-snapshots-XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir = pattern;
        setenv("TELV_DATA_DIR", dir.c_str(), 1);
    }
    void TearDown() override { std::filesystem::remove_all(dir); }

    command_result snapshots(const std::string &path) {
        return run_command({tarnmon(), "snapshots", "--file", path});
    }

    std::string dir;
};

// The most a snapshot file can hold: the largest size the control file can give it, and one flush
// of the staging buffer beyond it.
constexpr uint64_t BOUND = uint64_t{UINT32_MAX} + FILE_BUFFER_SIZE;

TEST_F(TarnmonSnapshots, ADeviceWithoutEndIsRefused) {
    command_result r = snapshots("/dev/zero");
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: cannot read /dev/zero: not a regular file\n");
}

TEST_F(TarnmonSnapshots, ADirectoryIsRefused) {
    command_result r = snapshots(dir);
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: cannot read " + dir + ": not a regular file\n");
}

TEST_F(TarnmonSnapshots, AFileLargerThanASnapshotFileCanBeIsNotRead) {
    std::string path = dir + "/telvzmnd.trm";
    int fd = open(path.c_str(), O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, static_cast<off_t>(BOUND + 1)), 0); // sparse: no data is written
    close(fd);
    command_result r = run_command({tarnmon(), "snapshots"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "tarnmon: cannot read " + path + ": it holds " + std::to_string(BOUND + 1) +
                         " bytes, more than a snapshot file can hold (" + std::to_string(BOUND) +
                         ")\n");
}

TEST_F(TarnmonSnapshots, AFailedOpenNamesTheFileAndTheError) {
    std::string plain = dir + "/plain";
    std::ofstream(plain) << "x";
    command_result r = snapshots(plain + "/telvzmnd.trm");
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err,
              "tarnmon: cannot open " + plain + "/telvzmnd.trm: " + std::strerror(ENOTDIR) + "\n");
}

TEST_F(TarnmonSnapshots, ARegularFileIsListed) {
    std::string path = dir + "/other.trm";
    std::string block = std::string(PLAIN_SNAPSHOT_OPENING) +
                        "\n\rLocal date and time = 5 March 2021 at 07:04:09 \n\rgathered\n\r" +
                        std::string(PLAIN_SNAPSHOT_CLOSING) + "\n\r";
    std::ofstream(path, std::ios::binary) << block;
    command_result r = snapshots(path);
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out.rfind(path + ": " + std::to_string(block.size()) + " bytes, 1 block\n", 0), 0u)
        << r.out;
    EXPECT_NE(r.out.find("    1  plain "), std::string::npos) << r.out;
    EXPECT_EQ(r.err, "");
}

} // namespace

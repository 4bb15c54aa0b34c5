// tarnmon status and stop, run as separate processes against a real control block in a private
// IPC namespace.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <sys/ipc.h>
#include <sys/shm.h>

#include "core/control_block.h"
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

    // A block as a running monitor leaves it.
    void create_block(size_t size = TARN_CB_SIZE) {
        id = shmget(static_cast<key_t>(TARN_CB_KEY), size, IPC_CREAT | 0666);
        ASSERT_NE(id, -1);
        if (size == TARN_CB_SIZE) {
            block = static_cast<tarn_control_block *>(shmat(id, nullptr, 0));
            ASSERT_NE(block, reinterpret_cast<void *>(-1));
        }
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
    EXPECT_EQ(r.out,
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
    EXPECT_EQ(r.out, "tarnmon: the segment of key 0x96728017 has 100 bytes, not the 2940036 of a "
                     "control block\n");
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
    EXPECT_EQ(r.out, "tarnmon: no monitor has created its control block (key 0x96728017) on this "
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

} // namespace

// The snapshot file of two passes of the monitoring loop, byte for byte: a quiet pass with its
// plain snapshot, then a pass that finds a process over its rss limit, with its problem snapshot,
// its event and the plain snapshot of the same pass. Every command the checks run is a fake, /proc
// is a fake tree with a clock the test steps, and the snapshots' clock is fixed, so that every
// byte of the file is known beforehand; the whole file is written out below.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "capture/external_checks.h"
#include "capture/snapshot_file.h"
#include "core/control_block.h"
#include "core/control_file.h"
#include "core/monitor_loop.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "fake_proc.h"
#include "fresh_monitor.h"
#include "logsvc.h"
#include "private_ipc.h"
#include "recording_platform.h"
#include "snapshot_stamp.h"
#include "storage/file_system.h"

namespace {

// Every setting the validation needs, at values the quiet host passes; a plain snapshot after
// every pass; one sample routine.
const char CONTROL_FILE[] = "ACTUALLY_RUN\n"
                            "MINIMUM_JAVA_FREE_SPACE 100\n"
                            "RESUME_JAVA_LOG_ON_PERCENT 150\n"
                            "TOTAL_MEMORY_IN_USE_THRESHOLD 16000000\n"
                            "TOTAL_MEMORY_PERCENT_THRESHOLD 900\n"
                            "RESUME_MEMORY_PERCENT_THRESHOLD 800\n"
                            "VSZ_MEMORY_THRESHOLD 3000000\n"
                            "RSS_MEMORY_THRESHOLD 1000000\n"
                            "DSIZ_MEMORY_THRESHOLD 2000000\n"
                            "RSS_ABORT_MEMORY_THRESHOLD 2500000\n"
                            "CPU_PERCENT_THRESHOLD 900\n"
                            "CPU_TIME_THRESHOLD 10\n"
                            "CPU_PERCENT_THRESHOLD_QV 950\n"
                            "CPU_SLEEP_TIME_THRESHOLD 1100\n"
                            "DASD_PERCENT_THRESHOLD 900\n"
                            "DASD_PERCENT_SLASH_THRESHOLD 900\n"
                            "DASD_PERCENT_SLASH_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_VAR_THRESHOLD 900\n"
                            "DASD_PERCENT_VAR_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_TMP_THRESHOLD 900\n"
                            "DASD_PERCENT_TMP_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_CONSOLE_THRESHOLD 900\n"
                            "DASD_PERCENT_CONSOLE_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_FFDC_THRESHOLD 900\n"
                            "DASD_PERCENT_FFDC_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_CONSOLE_FFDC_THRESHOLD 900\n"
                            "DASD_PERCENT_CONSOLE_FFDC_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_DEV_SHM_THRESHOLD 900\n"
                            "DASD_PERCENT_DEV_SHM_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_DUMP_THRESHOLD 900\n"
                            "DASD_PERCENT_DUMP_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_EXTRA_THRESHOLD 900\n"
                            "DASD_PERCENT_EXTRA_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_KZRDUMP_THRESHOLD 900\n"
                            "DASD_PERCENT_KZRDUMP_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_MNT_UPGRADE_THRESHOLD 900\n"
                            "DASD_PERCENT_MNT_UPGRADE_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_DATA_THRESHOLD 900\n"
                            "DASD_PERCENT_DATA_INODE_THRESHOLD 900\n"
                            "DASD_PERCENT_VAR_WQN_LOG_THRESHOLD 900\n"
                            "DASD_PERCENT_VAR_WQN_LOG_INODE_THRESHOLD 900\n"
                            "NUM_THREADS_THRESHOLD 2000\n"
                            "FILE_DESCRIPTORS_PERCENT_THRESHOLD 800\n"
                            "PP_FILE_DESCRIPTORS_THRESHOLD 1000\n"
                            "LOW_FREE_SIZE 1\n"
                            "MAX_SNAPSHOT_FILE_SIZE 50000\n"
                            "SNAPSHOT_INTERVAL 1\n"
                            "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check1\n";

// What the host's commands print. ps is run behind sort, which puts the largest rss first.
const char PS_QUIET[] = "    1     1  1000  20000  3000 init            00:00:01\n";
const char PS_OFFENDER[] = "  742   742 1500000 2200000 1800000 tarnleak        00:03:12\n";
const char FREE[] =
    "               total        used        free      shared  buff/cache   available\n"
    "Mem:         1000000      200000      600000        1000      200000      700000\n"
    "Swap:              0           0           0\n";
const char MEMINFO[] = "MemTotal:        1000000 kB\n"
                       "MemFree:          600000 kB\n";
const char FILE_NR[] = "1000\t0\t100000\n";
const char DF_SPACE[] = "Filesystem     Type      Size  Used Avail Use% Mounted on\n"
                        "/dev/vda1      ext4       20G    2G   18G  10% /\n"
                        "/dev/vdb1      ext4       20G    2G   18G  10% /extra\n";
const char DF_INODES[] = "Filesystem      Inodes  IUsed   IFree IUse% Mounted on\n"
                         "/dev/vda1      1310720 131072 1179648   10% /\n";
// Two descriptor directories: the first block closes at the second header (six lines), the last
// at the end of the listing (seven lines, no header among them).
const char LSMON[] = "/proc/1/fd:\n"
                     "total 0\n"
                     "lrwx------ 1 root root 64 Mar  5 07:00 0 -> /dev/null\n"
                     "lrwx------ 1 root root 64 Mar  5 07:00 1 -> /dev/null\n"
                     "lrwx------ 1 root root 64 Mar  5 07:00 2 -> /dev/null\n"
                     "\n"
                     "/proc/742/fd:\n"
                     "total 0\n"
                     "lr-x------ 1 root root 64 Mar  5 07:00 0 -> /dev/null\n"
                     "l-wx------ 1 root root 64 Mar  5 07:00 1 -> /tmp/tarnleak.log\n"
                     "l-wx------ 1 root root 64 Mar  5 07:00 2 -> /tmp/tarnleak.log\n"
                     "lrwx------ 1 root root 64 Mar  5 07:00 3 -> socket:[4242]\n"
                     "lrwx------ 1 root root 64 Mar  5 07:00 4 -> /dev/null\n"
                     "\n";

// The error text of the second pass's finding, which heads both its problem snapshot and its
// event's attachment.
const char ERROR_TEXT[] = "\n\r"
                          "Error Information: \n\r"
                          "RSS Threshold exceeded\n\r"
                          "Entire line was: \n\r"
                          "  742   742 1500000 2200000 1800000 tarnleak        00:03:12\n\r";

// The whole snapshot file after the two passes. The CPU table is what the history of the fake
// /proc gives: the first pass takes the first sample of pid 1 (0.6 s after the sample the history
// starts from, no earlier jiffies: 0 %); before the second the clock moves on by 100 ticks, pid 1
// by 50 user and 10 kernel jiffies (50 % and 10 % of the one processor), and pid 742 appears
// (its first sample: 0 %). The newest sample is the first column.
const char EXPECTED_FILE[] =
    // ---- The first pass: nothing found, its plain snapshot.
    "=START==============================================\n\r"
    "Local date and time = 5 March 2021 at 07:04:09 \n\r"
    "Code Version 61.001\n\r"
    "  \n\r"
    "About to output ps data \n\r"
    "    1     1  1000  20000  3000 init            00:00:01\n\r"
    "\n\r"
    "About to output free data \n\r"
    "               total        used        free      shared  buff/cache   available\n\r"
    "Mem:         1000000      200000      600000        1000      200000      700000\n\r"
    "Swap:              0           0           0\n\r"
    "\n\r"
    "About to output cat /proc/meminfo \n\r"
    "MemTotal:        1000000 kB\n\r"
    "MemFree:          600000 kB\n\r"
    "\n\r"
    "About to output df data \n\r"
    "Filesystem     Type      Size  Used Avail Use% Mounted on\n\r"
    "/dev/vda1      ext4       20G    2G   18G  10% /\n\r"
    "/dev/vdb1      ext4       20G    2G   18G  10% /extra\n\r"
    "\n\r"
    "About to output df --inodes data \n\r"
    "Filesystem      Inodes  IUsed   IFree IUse% Mounted on\n\r"
    "/dev/vda1      1310720 131072 1179648   10% /\n\r"
    "\n\r"
    "About to output cat /proc/sys/fs/file-nr data: \n\r"
    "1000\t0\t100000\n\r"
    "\n\r"
    "About to output ls data: \n\r"
    "/proc/1/fd: 1\n\r"
    "/proc/742/fd: 2\n\r"
    "\n\r"
    "checks: |      +1000||       +940||         +0||         +0||         +0||         +0|"
    "|         +0||         +0||         +0||         +0|\n"
    "pid: 1, name: (init), priority: 20, nice: 0\n"
    "user:   |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "kernel: |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "Overall system\n"
    "user: |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "kernel:|     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "  \n\r"
    "About to output data from function tarn_external_check1 \n\r"
    "Message 1 returned data \n\r"
    " Second line of Message 1\n\r"
    "\n\r"
    "  \n\r"
    "Done outputting data from function tarn_external_check1 \n\r"
    "\n\r"
    "=END================================================\n\r"
    // ---- The second pass: the problem snapshot of its finding.
    "=START FEDC SNAPSHOT================================\n\r"
    "Local date and time = 5 March 2021 at 07:04:09 \n\r"
    "Code Version 61.001\n\r"
    "\n\r"
    "Error Information: \n\r"
    "RSS Threshold exceeded\n\r"
    "Entire line was: \n\r"
    "  742   742 1500000 2200000 1800000 tarnleak        00:03:12\n\r"
    "\n\r"
    "  \n\r"
    "About to output ps data \n\r"
    "  742   742 1500000 2200000 1800000 tarnleak        00:03:12\n\r"
    "    1     1  1000  20000  3000 init            00:00:01\n\r"
    "\n\r"
    "About to output free data \n\r"
    "               total        used        free      shared  buff/cache   available\n\r"
    "Mem:         1000000      200000      600000        1000      200000      700000\n\r"
    "Swap:              0           0           0\n\r"
    "\n\r"
    "About to output cat /proc/meminfo \n\r"
    "MemTotal:        1000000 kB\n\r"
    "MemFree:          600000 kB\n\r"
    "\n\r"
    "About to output df data \n\r"
    "Filesystem     Type      Size  Used Avail Use% Mounted on\n\r"
    "/dev/vda1      ext4       20G    2G   18G  10% /\n\r"
    "/dev/vdb1      ext4       20G    2G   18G  10% /extra\n\r"
    "\n\r"
    "About to output df --inodes data \n\r"
    "Filesystem      Inodes  IUsed   IFree IUse% Mounted on\n\r"
    "/dev/vda1      1310720 131072 1179648   10% /\n\r"
    "\n\r"
    "About to output cat /proc/sys/fs/file-nr data: \n\r"
    "1000\t0\t100000\n\r"
    "\n\r"
    "About to output ls data: \n\r"
    "/proc/1/fd: 1\n\r"
    "/proc/742/fd: 2\n\r"
    "\n\r"
    "checks: |      +1100||      +1000||       +940||         +0||         +0||         +0|"
    "|         +0||         +0||         +0||         +0|\n"
    "pid: 1, name: (init), priority: 20, nice: 0\n"
    "user:   |    +50.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "kernel: |    +10.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "pid: 742, name: (tarnleak), priority: 20, nice: 0\n"
    "user:   |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "kernel: |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "Overall system\n"
    "user: |    +50.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "kernel:|    +10.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| |     +0.00| "
    "|     +0.00| |     +0.00| |     +0.00| |     +0.00| \n"
    "  \n\r"
    "About to output data from function tarn_external_check1 \n\r"
    "Message 1 returned data \n\r"
    " Second line of Message 1\n\r"
    "\n\r"
    "  \n\r"
    "Done outputting data from function tarn_external_check1 \n\r"
    "\n\r"
    "=END FEDC SNAPSHOT==================================\n\r"
    // ---- The second pass: its plain snapshot, after the event took the pass's data.
    "=START==============================================\n\r"
    "Local date and time = 5 March 2021 at 07:04:09 \n\r"
    "Code Version 61.001\n\r"
    "\n\r"
    "=END================================================\n\r";

class MonitorLoopSnapshotFile : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        fresh_monitor::reset();
        tree.emplace(1000, 100);
        tree->set_cpus(1);
        tree->set_process(1, "init", 1, 1);
        fakes.add_printing("ps", PS_QUIET);
        fakes.add_printing("free", FREE);
        fakes.add("cat", std::string("#!/bin/sh\ncase \"$1\" in\n/proc/meminfo) printf '%s' '") +
                             MEMINFO + "' ;;\n/proc/sys/fs/file-nr) printf '%s' '" + FILE_NR +
                             "' ;;\n*) exec /bin/cat \"$@\" ;;\nesac\n");
        fakes.add("df", std::string("#!/bin/sh\nif [ \"$1\" = -h ]; then printf '%s' '") +
                            DF_SPACE + "'; else printf '%s' '" + DF_INODES + "'; fi\n");
        fakes.add("runAsRoot", std::string("#!/bin/sh\ncase \"$1\" in\nlsmon.sh) printf '%s' '") +
                                   LSMON + "' ;;\nesac\nexit 0\n");
        rec::register_function("telvzmnd", "tarn_external_check1",
                               reinterpret_cast<void *>(&tarn_external_check1));
        rec::write_data_file("telvzopt.trm", CONTROL_FILE);
        now = 1000;
        sleeps = 0;
        on_sleep = nullptr;
        uptime_source = [] { return now; };
        one_second_sleep = [] {
            ++now;
            ++sleeps;
            if (on_sleep) {
                on_sleep(sleeps);
            }
        };
    }

    void TearDown() override {
        uptime_source = saved_uptime;
        one_second_sleep = saved_sleep;
        on_sleep = nullptr;
        snapshot_clock = time;
        if (!key_is_ours) {
            return;
        }
        free_compiled_expressions();
        delete_process_list(&process_list);
        tree.reset();
        private_ipc::remove_control_block();
    }

    bool key_is_ours = false;
    std::optional<fake::fake_proc> tree;
    fake::fake_commands fakes;
    long (*saved_uptime)() = uptime_source;
    void (*saved_sleep)() = one_second_sleep;

    static inline long now = 0;
    static inline int sleeps = 0;
    static inline std::function<void(int)> on_sleep;
};

TEST_F(MonitorLoopSnapshotFile, QuietPassThenAFindingLeaveExactlyTheirThreeSnapshots) {
    // Two passes of five seconds: in the sleep between them the host changes (a process over its
    // rss limit appears, pid 1 uses processor time, the clock moves on a second), and the last
    // second of it asks the loop to end after the pass that follows.
    on_sleep = [this](int count) {
        if (count == 1) {
            fakes.add_printing("ps", std::string(PS_QUIET) + PS_OFFENDER);
            tree->advance(100);
            tree->set_process(1, "init", 51, 11);
            tree->set_process(742, "tarnleak", 300, 40);
        }
        if (count == 5) {
            TARN_CB_PTR->terminateRequest = 1;
        }
    };
    std::vector<std::string> words = {"telvzmnd", "5"};
    std::vector<char *> argv = {words[0].data(), words[1].data(), nullptr};
    EXPECT_EQ(tarn_mon_main(2, argv.data()), 0u);
    EXPECT_EQ(sleeps, 5);

    const std::string file = rec::read_data_file(SNAPSHOT_FILE_NAME);
    EXPECT_EQ(file, std::string(EXPECTED_FILE));

    // The event of the finding: an error with the process's rss, and as attachment the error text,
    // the pass's data exactly as the problem snapshot holds it, and the closing line.
    ASSERT_EQ(rec::events().size(), 1u);
    const rec::Event &event = rec::events()[0];
    EXPECT_EQ(event.record.record_type, LOGSVC_RECORD_TYPE_EVENT);
    EXPECT_EQ(event.record.option, LOGSVC_REPORT_ERROR + LOGSVC_DATA_ATTACHED);
    EXPECT_EQ(std::string(event.record.component, LOGSVC_COMPONENT_LENGTH),
              std::string("LinMonitor\0\0", LOGSVC_COMPONENT_LENGTH));
    EXPECT_EQ(event.record.reason_code, RC_PROCESS_RSS);
    EXPECT_EQ(event.record.reason_code, 0xE111);
    EXPECT_EQ(event.record.comp_rc, 1500000u);
    ASSERT_TRUE(event.has_attachment);
    const std::string expected = EXPECTED_FILE;
    const std::string snapshot_data_start = std::string(ERROR_TEXT) + "\n\r";
    const size_t data_at = expected.find(snapshot_data_start) + snapshot_data_start.size();
    const size_t data_end = expected.find("\n\r=END FEDC SNAPSHOT");
    const std::string pass_data = expected.substr(data_at, data_end - data_at);
    ASSERT_EQ(pass_data.rfind("  \n\rAbout to output ps data \n\r", 0), 0u);
    const std::string attachment = std::string(ERROR_TEXT) + pass_data + "end of data \n\r";
    EXPECT_EQ(event.attachment, attachment);
    EXPECT_EQ(event.record.attachment_length, attachment.size());

    // What the check said of its finding: the vsize is traced under the word rss.
    EXPECT_TRUE(rec::has_trace("TARNMNDF: RSS threshold exceeded"));
    EXPECT_TRUE(rec::has_trace("TARNMNDF: rss = 2200000 (dec)"));
    EXPECT_TRUE(rec::has_trace("TARNMNDF: Entire line was [  742   742 1500000 2200000 1800000 "
                               "tarnleak        00:03:12]"));
    ASSERT_NE(TARN_CB_PTR, nullptr);
    EXPECT_EQ(TARN_CB_PTR->tookLog, 1u);
}

} // namespace

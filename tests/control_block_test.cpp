#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <sched.h>
#include <set>
#include <string>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "core/control_block.h"
#include "core/sysv_ipc.h"
#include "private_ipc.h"
#include "recording_platform.h"
#include "text_lines.h"

namespace {

using text::all_zero;

// What the faked System V calls do and saw; reset by every test.
struct Script {
    std::vector<int> shmget_results; // consumed one per call; empty = the real call
    std::vector<int> shmget_errors;
    int shmat_calls = 0;
    void *shmat_result = nullptr;
    bool fake_shmat = false;
    int shmctl_result = 0;
    int shmctl_error = 0;
    bool fake_shmctl = false; // of IPC_RMID
    std::vector<int> semget_results;
    std::vector<int> semget_errors;
    int semop_eintr = 0; // calls that fail with EINTR before the real ones
    std::vector<std::vector<sembuf>> semop_lists;
};
Script script;

int fake_shmget(key_t key, size_t size, int flags) {
    if (script.shmget_results.empty()) {
        return sysv_ipc_system.shmget(key, size, flags);
    }
    int result = script.shmget_results.front();
    errno = script.shmget_errors.front();
    script.shmget_results.erase(script.shmget_results.begin());
    script.shmget_errors.erase(script.shmget_errors.begin());
    return result;
}

void *fake_shmat(int id, const void *address, int flags) {
    script.shmat_calls++;
    if (script.fake_shmat) {
        return script.shmat_result;
    }
    return sysv_ipc_system.shmat(id, address, flags);
}

// Fakes the removal only: the size check of an attach still asks the kernel.
int fake_shmctl(int id, int command, struct shmid_ds *buffer) {
    if (script.fake_shmctl && command == IPC_RMID) {
        errno = script.shmctl_error;
        return script.shmctl_result;
    }
    return sysv_ipc_system.shmctl(id, command, buffer);
}

int fake_semget(key_t key, int count, int flags) {
    if (script.semget_results.empty()) {
        return sysv_ipc_system.semget(key, count, flags);
    }
    int result = script.semget_results.front();
    errno = script.semget_errors.front();
    script.semget_results.erase(script.semget_results.begin());
    script.semget_errors.erase(script.semget_errors.begin());
    return result;
}

int fake_semop(int id, struct sembuf *operations, size_t count) {
    script.semop_lists.emplace_back(operations, operations + count);
    if (script.semop_eintr > 0) {
        script.semop_eintr--;
        errno = EINTR;
        return -1;
    }
    return sysv_ipc_system.semop(id, operations, count);
}

size_t segment_size(int id) {
    shmid_ds info;
    EXPECT_EQ(shmctl(id, IPC_STAT, &info), 0);
    return info.shm_segsz;
}

int semaphore_value(int id) {
    return semctl(id, 0, GETVAL);
}

using private_ipc::start_child;
using private_ipc::wait_child;

// ---- A host's step before it starts the monitor ----

// What a child in an IPC namespace of its own finds: 0 when the block's key got id 0, 1 when it got
// another, 2 when the child cannot have a namespace of its own, 3 when no segment could be made.
int block_id_in_a_fresh_namespace(bool kept_off_zero, bool key_taken_first) {
    return wait_child(start_child([=] {
        if (unshare(CLONE_NEWIPC) != 0) {
            return 2;
        }
        int earlier = -1;
        if (key_taken_first) {
            earlier = shmget(static_cast<key_t>(TARN_CB_KEY), 16, IPC_CREAT | 0600);
        }
        if (kept_off_zero) {
            keep_block_off_id_zero();
        }
        int id = shmget(static_cast<key_t>(TARN_CB_KEY), 16, IPC_CREAT | 0600);
        if (key_taken_first && id != earlier) {
            return 4; // the segment under the key was replaced
        }
        return id == -1 ? 3 : id == 0 ? 0 : 1;
    }));
}

TEST(KeepBlockOffIdZero, BlockOfAFreshNamespaceGetsAnIdOtherThanZero) {
    int unkept = block_id_in_a_fresh_namespace(false, false);
    if (unkept == 2) {
        GTEST_SKIP() << "a child cannot have an IPC namespace of its own here";
    }
    EXPECT_EQ(unkept, 0); // what the monitor would take for a failure
    EXPECT_EQ(block_id_in_a_fresh_namespace(true, false), 1);
}

TEST(KeepBlockOffIdZero, SegmentUnderTheKeyIsLeftAsItIs) {
    int found = block_id_in_a_fresh_namespace(true, true);
    if (found == 2) {
        GTEST_SKIP() << "a child cannot have an IPC namespace of its own here";
    }
    EXPECT_EQ(found, 0); // the key's segment, made first, keeps its id 0
}

class ControlBlock : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        private_ipc::use_up_id_zero();
        rec::reset();
        script = Script{};
        sysv_ipc = {fake_shmget, fake_shmat, fake_shmctl, fake_semget, fake_semop};
    }
    void TearDown() override {
        sysv_ipc = sysv_ipc_system;
        private_ipc::remove_control_block();
    }

    uint32_t init() {
        crc = 0;
        return tarn_init(&crc);
    }

    uint32_t crc = 0;
};

TEST_F(ControlBlock, InitCreatesAZeroedBlockAndAnUnlockedSemaphore) {
    EXPECT_EQ(init(), 0u);
    EXPECT_EQ(crc, 0u);
    ASSERT_NE(TARN_CB_PTR, nullptr);
    EXPECT_EQ(shKey, 0x96728017u);
    EXPECT_EQ(segment_size(shmid), 2940036u);
    EXPECT_TRUE(all_zero(TARN_CB_PTR, offsetof(tarn_control_block, uBufferLock)));
    EXPECT_EQ(TARN_CB_PTR->terminateRequest, 0u);
    EXPECT_EQ(TARN_CB_PTR->logAsInfo, 0u);
    EXPECT_EQ(TARN_CB_PTR->uBufferLock, semget(static_cast<key_t>(TARN_CB_KEY), 1, 0));
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 0);
    EXPECT_TRUE(rec::events().empty());

    char id_text[64];
    std::snprintf(id_text, sizeof id_text, "%x", shmid);
    char lock_text[64];
    std::snprintf(lock_text, sizeof lock_text, "%x", TARN_CB_PTR->uBufferLock);
    std::vector<std::string> expected = {
        "TARNINTF: before shared memory access",
        "TARNINTF: shKey = 96728017 (hex)",
        "TARNINTF: just before shmget (create)",
        std::string("TARNINTF: shmid = ") + id_text + " (hex), error_number = 0 (hex)",
        "TARNINTF: error is Success",
        "TARNINTF: got id of shared memory",
    };
    for (size_t i = 0; i < expected.size(); ++i) {
        EXPECT_EQ(rec::traces()[i], expected[i]);
    }
    int at = rec::find_trace("TARNINTD: Got here!");
    EXPECT_EQ(at, 7);
    EXPECT_EQ(rec::traces()[8], "TARNINTF: out of while loop");
    EXPECT_EQ(rec::traces()[9], "TARNINTD: out of while loop 2");
    EXPECT_EQ(rec::traces()[11], std::string("TARNINTD: semget's rc = ") + lock_text + " (hex)");
    EXPECT_EQ(rec::traces()[12], "TARNINTD: semget's errrc = 0 (hex)");
    EXPECT_EQ(rec::traces()[13], "TARNINTD: About to do a semop to unlock the semaphore, Point A");
    EXPECT_EQ(rec::traces()[14], "TARNINTD: after semop, osl_rc = ffffffff (hex)");
    EXPECT_EQ(rec::traces()[15], "TARNINTD: after semop, rc = ffffffff (hex)");
    EXPECT_EQ(rec::traces()[16], "TARNINTD: after semop, rc = ffffffff (hex)");
    EXPECT_EQ(rec::traces()[17], std::string("TARNINTD: uBufferLock = ") + lock_text + " (hex)");
    EXPECT_EQ(rec::traces().size(), 19u);
}

TEST_F(ControlBlock, InitReplacesAStaleBlockOfAnotherSize) {
    int stale = shmget(static_cast<key_t>(TARN_CB_KEY), 100, IPC_CREAT | 0666);
    ASSERT_NE(stale, -1);
    EXPECT_EQ(init(), 0u);
    EXPECT_NE(shmid, stale);
    EXPECT_EQ(segment_size(shmid), 2940036u);
    EXPECT_TRUE(all_zero(TARN_CB_PTR, offsetof(tarn_control_block, uBufferLock)));
    EXPECT_TRUE(rec::has_trace("TARNINTF: About to eliminate old shared memory block"));
    EXPECT_TRUE(rec::has_trace("TARNINTF: before second shmget"));
    EXPECT_EQ(rec::traces_starting("TARNINTF: Point 0200 shmid = ").size(), 1u);
    shmid_ds info;
    EXPECT_EQ(shmctl(stale, IPC_STAT, &info), -1); // removed
}

TEST_F(ControlBlock, InitClearsAStaleBlockFullOfData) {
    int stale = shmget(static_cast<key_t>(TARN_CB_KEY), TARN_CB_SIZE, IPC_CREAT | 0666);
    ASSERT_NE(stale, -1);
    void *old = shmat(stale, nullptr, 0);
    std::memset(old, 0xAB, TARN_CB_SIZE);
    shmdt(old);
    EXPECT_EQ(init(), 0u);
    EXPECT_TRUE(all_zero(TARN_CB_PTR, offsetof(tarn_control_block, uBufferLock)));
    EXPECT_TRUE(all_zero(&TARN_CB_PTR->terminateRequest, 8));
}

TEST_F(ControlBlock, SecondInitReusesTheSemaphoreSetOfTheFirst) {
    ASSERT_EQ(init(), 0u);
    int first_set = TARN_CB_PTR->uBufferLock;
    rec::clear_traces();
    ASSERT_EQ(init(), 0u);
    EXPECT_EQ(TARN_CB_PTR->uBufferLock, first_set);
    EXPECT_EQ(semaphore_value(first_set), 0);
    EXPECT_TRUE(rec::has_trace("TARNINTD: semget's errrc = 11 (hex)")); // EEXIST
    EXPECT_TRUE(rec::has_trace("TARNINTD: before second semget()"));
    char text[64];
    std::snprintf(text, sizeof text, "TARNINTD: second semget's rc = %x (hex)", first_set);
    EXPECT_TRUE(rec::has_trace(text));
    EXPECT_TRUE(rec::has_trace("TARNINTD: About to do a semop to unlock the semaphore"));
    EXPECT_TRUE(rec::has_trace("TARNINTD: after semop, rc = ffffffff (hex)"));
}

TEST_F(ControlBlock, InitUnlocksWithTheUnlockOperationOnly) {
    ASSERT_EQ(init(), 0u);
    ASSERT_EQ(script.semop_lists.size(), 1u);
    ASSERT_EQ(script.semop_lists[0].size(), 1u);
    EXPECT_EQ(script.semop_lists[0][0].sem_num, 0);
    EXPECT_EQ(script.semop_lists[0][0].sem_op, -1);
    EXPECT_EQ(script.semop_lists[0][0].sem_flg, 0x1800);
}

TEST_F(ControlBlock, LockAndUnlockUseTheirOperationLists) {
    ASSERT_EQ(init(), 0u);
    script.semop_lists.clear();
    EXPECT_EQ(tarn_override_table_lock_control(1), 0);
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 1);
    EXPECT_EQ(tarn_override_table_lock_control(0), 0);
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 0);
    ASSERT_EQ(script.semop_lists.size(), 2u);
    ASSERT_EQ(script.semop_lists[0].size(), 2u);
    EXPECT_EQ(script.semop_lists[0][0].sem_num, 0);
    EXPECT_EQ(script.semop_lists[0][0].sem_op, 0);
    EXPECT_EQ(script.semop_lists[0][0].sem_flg, 0);
    EXPECT_EQ(script.semop_lists[0][1].sem_num, 0);
    EXPECT_EQ(script.semop_lists[0][1].sem_op, 1);
    EXPECT_EQ(script.semop_lists[0][1].sem_flg, 0x1000);
    ASSERT_EQ(script.semop_lists[1].size(), 1u);
    EXPECT_EQ(script.semop_lists[1][0].sem_op, -1);
    EXPECT_EQ(script.semop_lists[1][0].sem_flg, 0x1800);
}

TEST_F(ControlBlock, LockTracesEveryStep) {
    ASSERT_EQ(init(), 0u);
    rec::clear_traces();
    ASSERT_EQ(tarn_override_table_lock_control(1), 0);
    char lock[64];
    std::snprintf(lock, sizeof lock, "%x", TARN_CB_PTR->uBufferLock);
    std::string id = lock;
    EXPECT_EQ(rec::traces(),
              (std::vector<std::string>{
                  "TARNTLCF: --> tarn_override_table_lock_control(1)",
                  "TARNTLCF: before TARN_CB_PTR->uBufferLock = " + id + " (hex)",
                  "TARNTLCF: try to lock",
                  "TARNTLCF: after TARN_CB_PTR->uBufferLock (lock case) = " + id + " (hex)",
                  "TARNTLCF: osl_rc = 0 (hex)",
                  "TARNTLCF: error_number = 0 (hex)",
                  "TARNTLCF: after TARN_CB_PTR->uBufferLock = " + id + " (hex)",
                  "TARNTLCF: <-- tarn_override_table_lock_control() == 0",
              }));
}

TEST_F(ControlBlock, UnlockingTwiceReturnsZeroBothTimes) {
    ASSERT_EQ(init(), 0u);
    ASSERT_EQ(tarn_override_table_lock_control(1), 0);
    EXPECT_EQ(tarn_override_table_lock_control(0), 0);
    rec::clear_traces();
    EXPECT_EQ(tarn_override_table_lock_control(0), 0);
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 0);
    // The second unlock saw EAGAIN and counted it as success.
    EXPECT_TRUE(rec::has_trace("TARNTLCF: osl_rc = ffffffff (hex)"));
    EXPECT_TRUE(rec::has_trace("TARNTLCF: error_number = b (hex)"));
    EXPECT_TRUE(rec::has_trace("TARNTLCF: <-- tarn_override_table_lock_control() == 0"));
}

TEST_F(ControlBlock, AnyArgumentButOneUnlocks) {
    ASSERT_EQ(init(), 0u);
    ASSERT_EQ(tarn_override_table_lock_control(1), 0);
    EXPECT_EQ(tarn_override_table_lock_control(7), 0);
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 0);
    EXPECT_TRUE(rec::has_trace("TARNTLCF: try to unlock"));
}

TEST_F(ControlBlock, InterruptedLockIsRetried) {
    ASSERT_EQ(init(), 0u);
    rec::clear_traces();
    script.semop_eintr = 1;
    EXPECT_EQ(tarn_override_table_lock_control(1), 0);
    EXPECT_EQ(rec::traces_starting("TARNTLCF: try to lock").size(), 2u);
    EXPECT_TRUE(rec::has_trace("TARNTLCF: error_number = 4 (hex)"));
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 1);
}

TEST_F(ControlBlock, FailedLockReturnsMinusOne) {
    ASSERT_EQ(init(), 0u);
    int real_set = TARN_CB_PTR->uBufferLock;
    TARN_CB_PTR->uBufferLock = 0x7ffffff0; // no such set
    EXPECT_EQ(tarn_override_table_lock_control(1), -1);
    EXPECT_TRUE(rec::has_trace("TARNTLCF: error_number = 16 (hex)")); // EINVAL
    EXPECT_TRUE(rec::has_trace("TARNTLCF: <-- tarn_override_table_lock_control() == -1"));
    EXPECT_EQ(tarn_override_table_lock_control(0), -1);
    TARN_CB_PTR->uBufferLock = real_set;
}

TEST_F(ControlBlock, AttachBeforeAnyInitLeavesThePointerNull) {
    TARN_CB_PTR = nullptr;
    uint32_t unused = 0x55;
    EXPECT_EQ(tarn_init_tarn_cb_ptr(&unused), 0u);
    EXPECT_EQ(unused, 0x55u);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    EXPECT_EQ(rec::traces_starting("TARNICBF: shmget failed").size(), 10u);
    EXPECT_EQ(rec::traces().front(), "TARNICBF: shKey = 96728017 (hex)");
    size_t n = rec::traces().size();
    EXPECT_EQ(rec::traces()[n - 3], "TARNICBF: just after while loop");
    EXPECT_EQ(rec::traces()[n - 2], "TARNICBF: TARN_CB_PTR = (nil) ");
    EXPECT_EQ(rec::traces()[n - 1], "TARNICBF: osl_rc = 0 (hex) ");

    rec::clear_traces();
    tarn_terminate_monitoring();
    ASSERT_EQ(rec::events().size(), 1u);
    const auto &event = rec::events()[0];
    EXPECT_EQ(event.record.record_type, 18);
    EXPECT_EQ(event.record.option, 0x200u);
    EXPECT_STREQ(event.record.component, "LinMonitor");
    EXPECT_EQ(event.record.reason_code, 0xE170);
    EXPECT_EQ(event.record.comp_rc, 0u);
    EXPECT_FALSE(event.has_attachment);
    EXPECT_EQ(rec::traces().front(), "TARNTERF: --> tarn_terminate_monitoring");
    EXPECT_EQ(rec::traces()[rec::traces().size() - 2],
              "TARNTERF: logsvc_microcode_log() src = 0, crc = 0 (hex)");
    EXPECT_EQ(rec::traces().back(), "TARNTERF: <-- tarn_terminate_monitoring");
}

TEST_F(ControlBlock, TerminateSetsTheRequestAndTracesAFailingEventService) {
    ASSERT_EQ(init(), 0u);
    rec::fail(rec::Call::microcode_log, 3, 0x21);
    tarn_terminate_monitoring();
    EXPECT_EQ(TARN_CB_PTR->terminateRequest, 1u);
    EXPECT_TRUE(rec::has_trace("TARNTERF: logsvc_microcode_log() src = 3, crc = 21 (hex)"));
}

TEST_F(ControlBlock, RepeatedAttachReusesTheMapping) {
    ASSERT_EQ(init(), 0u);
    tarn_control_block *first = TARN_CB_PTR;
    int attaches = script.shmat_calls;
    uint32_t unused = 0;
    tarn_init_tarn_cb_ptr(&unused);
    tarn_init_tarn_cb_ptr(&unused);
    EXPECT_EQ(TARN_CB_PTR, first);
    EXPECT_EQ(script.shmat_calls, attaches);
    EXPECT_EQ(rec::traces_starting("TARNICBF: about to get memory pointer").size(), 2u);
}

TEST_F(ControlBlock, NewSegmentLeavesTheOldMappingInPlace) {
    ASSERT_EQ(init(), 0u);
    int first_id = shmid;
    tarn_control_block *first = TARN_CB_PTR;
    first->maxSleepTime = 77;
    ASSERT_EQ(init(), 0u);
    EXPECT_NE(shmid, first_id);
    EXPECT_NE(TARN_CB_PTR.get(), first);
    EXPECT_EQ(script.shmat_calls, 2);
    // Another thread that read the old address may go on using it.
    EXPECT_EQ(first->maxSleepTime, 77);
    EXPECT_EQ(TARN_CB_PTR->maxSleepTime, 0);
    shmdt(first);
}

TEST_F(ControlBlock, AnotherProcessAttachesAndSeesTheFields) {
    ASSERT_EQ(init(), 0u);
    TARN_CB_PTR->numLoopsBeforeCPUChecking = 11;
    TARN_CB_PTR->maxSleepTime = 66;
    TARN_CB_PTR->process_table[2999].vsize = 1234;
    pid_t child = start_child([] {
        TARN_CB_PTR = nullptr; // as in a process that never attached
        uint32_t unused = 0;
        tarn_init_tarn_cb_ptr(&unused);
        if (TARN_CB_PTR == nullptr || TARN_CB_PTR->numLoopsBeforeCPUChecking != 11 ||
            TARN_CB_PTR->maxSleepTime != 66 || TARN_CB_PTR->process_table[2999].vsize != 1234) {
            return 1;
        }
        TARN_CB_PTR->logAsInfo = 1;
        tarn_terminate_monitoring();
        return 0;
    });
    EXPECT_EQ(wait_child(child), 0);
    EXPECT_EQ(TARN_CB_PTR->logAsInfo, 1u);
    EXPECT_EQ(TARN_CB_PTR->terminateRequest, 1u);
}

TEST_F(ControlBlock, LockHeldByAnotherProcessBlocksUntilReleased) {
    ASSERT_EQ(init(), 0u);
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    pid_t holder = start_child([&] {
        if (tarn_override_table_lock_control(1) != 0) {
            return 1;
        }
        char byte = 'L';
        if (write(ready[1], &byte, 1) != 1) {
            return 2;
        }
        usleep(200 * 1000);
        // Written while the lock is held: whoever gets the lock next must see it.
        TARN_CB_PTR->override_table[0].pid = 4242;
        return tarn_override_table_lock_control(0) == 0 ? 0 : 3;
    });
    char byte = 0;
    ASSERT_EQ(read(ready[0], &byte, 1), 1);
    EXPECT_EQ(tarn_override_table_lock_control(1), 0);
    EXPECT_EQ(TARN_CB_PTR->override_table[0].pid, 4242u);
    EXPECT_EQ(tarn_override_table_lock_control(0), 0);
    EXPECT_EQ(wait_child(holder), 0);
    close(ready[0]);
    close(ready[1]);
}

TEST_F(ControlBlock, LockOfAHolderThatDiesIsReleased) {
    ASSERT_EQ(init(), 0u);
    pid_t holder = start_child([] { return tarn_override_table_lock_control(1) == 0 ? 0 : 1; });
    EXPECT_EQ(wait_child(holder), 0);
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 0);
    EXPECT_EQ(tarn_override_table_lock_control(1), 0);
    EXPECT_EQ(semaphore_value(TARN_CB_PTR->uBufferLock), 1);
    EXPECT_EQ(tarn_override_table_lock_control(0), 0);
}

TEST_F(ControlBlock, StaleBlockIdOfZeroIsReportedAndInitGoesOn) {
    script.shmget_results = {-1, 0};
    script.shmget_errors = {EEXIST, 0};
    script.fake_shmctl = true; // id 0 may be somebody's segment: never remove it for real
    EXPECT_EQ(init(), 8u);
    EXPECT_EQ(crc, 0xE089u);
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE089);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0u);
    EXPECT_TRUE(rec::has_trace("TARNINTF: shmid is 0 in telvzmnd"));
    ASSERT_NE(TARN_CB_PTR, nullptr);
    EXPECT_EQ(segment_size(shmid), 2940036u);
}

TEST_F(ControlBlock, NullAttachAddressIsReportedThenTheSecondReportIsSystemClass) {
    script.fake_shmat = true;
    script.shmat_result = nullptr;
    TARN_CB_PTR = nullptr;
    EXPECT_EQ(init(), 8u);
    EXPECT_EQ(crc, 0xE08Bu);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE08A);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0u);
    EXPECT_EQ(rec::events()[1].record.reason_code, 0xE0F1); // src | 2 is 10 by then
    EXPECT_TRUE(rec::has_trace("TARNINTF: error accessing shared memory"));
    EXPECT_EQ(rec::traces_starting("TARNINTF: just before shmget (create)").size(), 1u);
}

TEST_F(ControlBlock, AttachAddressOfMinusOneCountsAsFailure) {
    script.fake_shmat = true;
    script.shmat_result = reinterpret_cast<void *>(-1);
    TARN_CB_PTR = nullptr;
    EXPECT_EQ(init(), 8u);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    EXPECT_EQ(crc, 0xE08Bu);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE08A);
}

TEST_F(ControlBlock, NoSegmentAfterTenAttemptsIsReported) {
    script.shmget_results = std::vector<int>(10, -1);
    script.shmget_errors = std::vector<int>(10, ENOSPC);
    EXPECT_EQ(init(), 8u);
    EXPECT_EQ(crc, 0xE08Bu);
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE08B);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0u);
    EXPECT_EQ(rec::traces_starting("TARNINTF: just before shmget (create)").size(), 10u);
    EXPECT_TRUE(rec::has_trace("TARNINTF: error is No space left on device"));
}

TEST_F(ControlBlock, SegmentObtainedOnlyOnTheTenthAttemptCountsAsFailure) {
    script.shmget_results = std::vector<int>(9, -1);
    script.shmget_errors = std::vector<int>(9, ENOSPC);
    EXPECT_EQ(init(), 8u);
    EXPECT_EQ(crc, 0xE08Bu);
    EXPECT_EQ(rec::traces_starting("TARNINTF: just before shmget (create)").size(), 10u);
    EXPECT_TRUE(rec::has_trace("TARNINTF: got id of shared memory"));
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE08B);
}

TEST_F(ControlBlock, FailedRemovalOfTheStaleBlockIsReported) {
    script.shmget_results = {-1, 5, -1};
    script.shmget_errors = {EEXIST, 0, EEXIST};
    script.fake_shmctl = true;
    script.shmctl_result = -1;
    script.shmctl_error = EPERM;
    EXPECT_EQ(init(), 8u);
    EXPECT_EQ(crc, 0xE08Bu);
    EXPECT_TRUE(rec::has_trace("TARNINTF: shared memory delete failed with errno of 1"));
    EXPECT_TRUE(rec::has_trace("TARNINTF: error is Operation not permitted"));
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE08B);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0xFFFFFFFFu); // removeRc
    EXPECT_EQ(rec::traces_starting("TARNINTF: just before shmget (create)").size(), 1u);
}

TEST_F(ControlBlock, SemaphoreSetThatCannotBeOpenedIsReported) {
    script.semget_results = {-1, -1};
    script.semget_errors = {EEXIST, EACCES};
    EXPECT_EQ(init(), 8u);
    EXPECT_EQ(crc, 0xE08Cu);
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE08C);
    EXPECT_EQ(rec::events()[0].record.comp_rc, static_cast<uint32_t>(EACCES));
    EXPECT_TRUE(rec::has_trace("TARNINTF: error_number = 13 (dec)"));
    EXPECT_EQ(TARN_CB_PTR->uBufferLock, -1);
}

TEST_F(ControlBlock, SemaphoreFailureOtherThanExistsIsNotReported) {
    script.semget_results = {-1};
    script.semget_errors = {ENOSPC};
    EXPECT_EQ(init(), 0u);
    EXPECT_TRUE(rec::events().empty());
    EXPECT_TRUE(rec::has_trace("TARNINTD: semget's errrc = 1c (hex)"));
    EXPECT_TRUE(rec::has_trace("TARNINTD: About to do a semop to unlock the semaphore, Point A"));
}

TEST_F(ControlBlock, ASegmentOfAnotherSizeUnderTheKeyIsNoBlockAndIsNeverWritten) {
    constexpr size_t FOREIGN_SIZE = 4000000;
    int foreign = shmget(static_cast<key_t>(TARN_CB_KEY), FOREIGN_SIZE, IPC_CREAT | 0666);
    ASSERT_NE(foreign, -1);
    auto *bytes = static_cast<unsigned char *>(shmat(foreign, nullptr, 0));
    ASSERT_NE(bytes, reinterpret_cast<unsigned char *>(-1));
    TARN_CB_PTR = nullptr;
    uint32_t unused = 0;
    EXPECT_EQ(tarn_init_tarn_cb_ptr(&unused), 0u);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    EXPECT_EQ(script.shmat_calls, 0);
    EXPECT_EQ(rec::traces_starting("TARNICBF: shmid = ffffffff (hex)").size(), 10u);
    EXPECT_EQ(rec::traces_starting("TARNICBF: shmget failed").size(), 10u);

    rec::clear_traces();
    tarn_terminate_monitoring();
    EXPECT_TRUE(all_zero(bytes, FOREIGN_SIZE));
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE170);
    shmdt(bytes);
}

TEST_F(ControlBlock, InitReplacesALargerSegmentUnderTheKey) {
    int foreign = shmget(static_cast<key_t>(TARN_CB_KEY), 4000000, IPC_CREAT | 0666);
    ASSERT_NE(foreign, -1);
    EXPECT_EQ(init(), 0u);
    EXPECT_NE(shmid, foreign);
    EXPECT_EQ(segment_size(shmid), 2940036u);
}

// A host thread that reads the block while another attaches in a loop, and another process that
// makes a new block again and again: every address a reader took must stay mapped.
TEST_F(ControlBlock, ReadersSurviveAttachesWhileAnotherProcessRemakesTheBlock) {
    sysv_ipc = sysv_ipc_system; // the fakes keep their script without a lock
    ASSERT_EQ(init(), 0u);
    int go[2];
    ASSERT_EQ(pipe(go), 0);
    pid_t remaker = start_child([&] {
        close(go[1]);
        char byte = 0;
        if (read(go[0], &byte, 1) != 1) {
            return 1;
        }
        for (int i = 0; i < 120; ++i) {
            uint32_t child_crc = 0;
            if (tarn_init(&child_crc) != 0) {
                return 2;
            }
            TARN_CB_PTR->terminateRequest = static_cast<uint32_t>(i);
        }
        return 0;
    });
    close(go[0]);

    std::atomic<bool> done{false};
    std::atomic<long> reads{0};
    std::thread reader([&] {
        while (!done.load()) {
            tarn_control_block *block = TARN_CB_PTR;
            if (block != nullptr) {
                volatile uint32_t seen = read_field(block->terminateRequest);
                (void)seen;
                reads.fetch_add(1);
            }
        }
    });
    std::set<tarn_control_block *> addresses;
    std::thread attacher([&] {
        while (!done.load()) {
            uint32_t unused = 0;
            tarn_init_tarn_cb_ptr(&unused);
            addresses.insert(TARN_CB_PTR.get());
            rec::clear_traces();
        }
    });
    char byte = 'G';
    ASSERT_EQ(write(go[1], &byte, 1), 1);
    int status = wait_child(remaker);
    done.store(true);
    reader.join();
    attacher.join();
    close(go[1]);
    EXPECT_EQ(status, 0);
    EXPECT_GT(reads.load(), 0);
    // The attacher followed the block from segment to segment.
    EXPECT_GT(addresses.size(), 2u);
}

} // namespace

// tarn_override_thresholds over a real control block in a private IPC namespace: what it stores,
// what it refuses, the traces of each path, and callers in other processes at the same time.
#include <gtest/gtest.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
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
#include "memory/override_table.h"
#include "private_ipc.h"
#include "recording_platform.h"

namespace {

using words = std::array<uint32_t, 9>; // one entry as it lies in the block
using strings = std::vector<std::string>;

constexpr uint32_t OWN_PID = 4242;
constexpr uint32_t CRC_CODES[6] = {1, 2, 3, 5, 6, 7}; // rss ... vsizeAbort
constexpr uint32_t FILLER_PID = 100000;               // entry i of a full table is FILLER_PID + i

std::string printed(const char *pattern, auto... values) {
    char text[256];
    std::snprintf(text, sizeof text, pattern, values...);
    return text;
}

strings operator+(strings head, const strings &tail) {
    head.insert(head.end(), tail.begin(), tail.end());
    return head;
}

using private_ipc::start_child;
using private_ipc::wait_child;

class OverrideTable : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        private_ipc::use_up_id_zero();
        rec::reset();
        uint32_t crc = 0;
        ASSERT_EQ(tarn_init(&crc), 0u);
        block = TARN_CB_PTR;
        rec::set_pid(OWN_PID);
        rec::clear_traces();
    }
    void TearDown() override { private_ipc::remove_control_block(); }

    uint32_t call(int32_t rss, int32_t dsiz, int32_t vsize, int32_t rssAbort, int32_t dsizAbort,
                  int32_t vsizeAbort) {
        crc = 0xFFFFFFFF; // every path that checks the pointer writes it
        return tarn_override_thresholds(rss, dsiz, vsize, rssAbort, dsizAbort, vsizeAbort, &crc);
    }
    uint32_t call_zeros() { return call(0, 0, 0, 0, 0, 0); }

    words entry(int index) const {
        words w;
        std::memcpy(w.data(), &block->override_table[index], sizeof w);
        return w;
    }
    bool table_is_empty() const {
        for (int i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
            if (entry(i) != words{}) {
                return false;
            }
        }
        return true;
    }
    void fill_table() {
        for (int i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
            block->override_table[i] = {FILLER_PID + i, 10, 20, 30, 40, 50, 60, 1, 1};
        }
    }

    // The traces of the parts that the entry point calls, over this test's block.
    strings argument_traces(int32_t rss, int32_t dsiz, int32_t vsize, int32_t rssAbort,
                            int32_t dsizAbort, int32_t vsizeAbort) const {
        return {
            "TARNOTHF: --> tarn_override_thresholds",
            printed("TARNOTHF: rssThreshold = %d (dec)", rss),
            printed("TARNOTHF: dsizThreshold = %d (dec)", dsiz),
            printed("TARNOTHF: dsizThreshold = %d (dec)", vsize),
            printed("TARNOTHF: rssAbortThreshold = %d (dec)", rssAbort),
            printed("TARNOTHF: dsizAbortThreshold = %d (dec)", dsizAbort),
            printed("TARNOTHF: vsizeAbortThreshold = %d (dec)", vsizeAbort),
        };
    }
    strings attach_traces() const {
        std::string address = printed("%p", static_cast<void *>(block));
        return {
            "TARNICBF: shKey = 96728017 (hex)",           "TARNICBF: before shmget",
            printed("TARNICBF: shmid = %x (hex)", shmid), "TARNICBF: about to get memory pointer",
            "TARNICBF: TARN_CB_PTR = " + address,         "TARNICBF: done with shmat path",
            "TARNICBF: just before while loop",           "TARNICBF: just after while loop",
            "TARNICBF: TARN_CB_PTR = " + address + " ",   "TARNICBF: osl_rc = 0 (hex) ",
        };
    }
    strings lock_traces(int lock) const {
        std::string id = printed("%x", block->uBufferLock);
        const char *which = lock == 1 ? "lock" : "unlock";
        return {
            printed("TARNTLCF: --> tarn_override_table_lock_control(%d)", lock),
            "TARNTLCF: before TARN_CB_PTR->uBufferLock = " + id + " (hex)",
            printed("TARNTLCF: try to %s", which),
            printed("TARNTLCF: after TARN_CB_PTR->uBufferLock (%s case) = ", which) + id + " (hex)",
            "TARNTLCF: osl_rc = 0 (hex)",
            "TARNTLCF: error_number = 0 (hex)",
            "TARNTLCF: after TARN_CB_PTR->uBufferLock = " + id + " (hex)",
            "TARNTLCF: <-- tarn_override_table_lock_control() == 0",
        };
    }
    static std::string closing(uint32_t src, uint32_t crc) {
        return printed("TARNOTHF: <-- tarn_override_thresholds, src = %x, crc = %x (hex)", src,
                       crc);
    }

    tarn_control_block *block = nullptr;
    uint32_t crc = 0;
};

TEST_F(OverrideTable, AFirstCallAddsTheEntryAndTracesEveryStep) {
    EXPECT_EQ(call(100, 200, 300, 400, 500, 600), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(entry(0), (words{OWN_PID, 100, 200, 300, 400, 500, 600, 1, 0}));
    EXPECT_EQ(entry(1), words{});
    EXPECT_TRUE(rec::events().empty());
    // The vsize limit is traced under the dsiz name: "dsizThreshold" twice.
    strings expected = argument_traces(100, 200, 300, 400, 500, 600) + attach_traces() +
                       strings{"TARNOTHF: our PID is 4242"} + lock_traces(1) +
                       strings{
                           "TARNQT F: entry_index = -1 (dec)",
                           "TARNQT F: no entry found for this name/pid",
                           "TARNQT F: adding entry at index 0 (dec)",
                       } +
                       lock_traces(0) + strings{closing(0, 0)};
    EXPECT_EQ(rec::traces(), expected);
    EXPECT_EQ(semctl(block->uBufferLock, 0, GETVAL), 0); // released
}

TEST_F(OverrideTable, ALaterCallReplacesAllSixLimits) {
    ASSERT_EQ(call(0, 50, 0, 0, 0, 0), 0u);
    block->override_table[0].seen = 1; // the memory check's flag is not the caller's to change
    rec::clear_traces();
    EXPECT_EQ(call(100, 0, 0, 0, 0, 0), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(entry(0), (words{OWN_PID, 100, 0, 0, 0, 0, 0, 1, 1})); // dsiz 50 is gone
    EXPECT_EQ(entry(1), words{});
    strings expected = argument_traces(100, 0, 0, 0, 0, 0) + attach_traces() +
                       strings{"TARNOTHF: our PID is 4242"} + lock_traces(1) +
                       strings{
                           "TARNQT F: Found a pid match with entry 0 (dec)",
                           "TARNQT F: entry_index = 0 (dec)",
                           "TARNQT F: entry found",
                       } +
                       lock_traces(0) + strings{closing(0, 0)};
    EXPECT_EQ(rec::traces(), expected);
}

TEST_F(OverrideTable, SixZerosAddAnEmptyEntryAndSixMoreFreeIt) {
    EXPECT_EQ(call_zeros(), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(entry(0), (words{OWN_PID, 0, 0, 0, 0, 0, 0, 1, 0}));
    EXPECT_TRUE(rec::has_trace("TARNQT F: adding entry at index 0 (dec)"));

    rec::clear_traces();
    EXPECT_EQ(call_zeros(), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_TRUE(table_is_empty());
    EXPECT_EQ(rec::traces_starting("TARNQT F:"),
              (strings{
                  "TARNQT F: Found a pid match with entry 0 (dec)",
                  "TARNQT F: entry_index = 0 (dec)",
                  "TARNQT F: entry found",
              }));
    EXPECT_EQ(rec::traces().back(), closing(0, 0));

    rec::clear_traces();
    EXPECT_EQ(call_zeros(), 0u); // a third call finds no entry: it adds one again
    EXPECT_EQ(entry(0), (words{OWN_PID, 0, 0, 0, 0, 0, 0, 1, 0}));
}

TEST_F(OverrideTable, SixZerosOverAnEntryWithLimitsFreeIt) {
    ASSERT_EQ(call(1, 2, 3, 4, 5, 6), 0u);
    block->override_table[0].seen = 1;
    EXPECT_EQ(call_zeros(), 0u);
    EXPECT_TRUE(table_is_empty()); // the seen flag too: a free entry is all zero
}

TEST_F(OverrideTable, AnUpdateTakesTheFirstMatchInUseAndANewPidTheFirstFreeEntry) {
    block->override_table[0] = {7, 1, 1, 1, 1, 1, 1, 1, 0};
    // Not in use: neither a match, nor passed over by a new pid.
    block->override_table[1] = {OWN_PID, 4, 4, 4, 4, 4, 4, 0, 0};
    block->override_table[2] = {OWN_PID, 1, 1, 1, 1, 1, 1, 1, 0};
    block->override_table[5] = {OWN_PID, 2, 2, 2, 2, 2, 2, 1, 0};
    EXPECT_EQ(call(3, 3, 3, 3, 3, 3), 0u);
    EXPECT_EQ(entry(1), (words{OWN_PID, 4, 4, 4, 4, 4, 4, 0, 0}));
    EXPECT_EQ(entry(2), (words{OWN_PID, 3, 3, 3, 3, 3, 3, 1, 0}));
    EXPECT_EQ(entry(5), (words{OWN_PID, 2, 2, 2, 2, 2, 2, 1, 0}));
    EXPECT_EQ(rec::traces_starting("TARNQT F:"),
              (strings{
                  "TARNQT F: Found a pid match with entry 2 (dec)",
                  "TARNQT F: entry_index = 2 (dec)",
                  "TARNQT F: entry found",
              }));

    rec::set_pid(8);
    rec::clear_traces();
    EXPECT_EQ(call(9, 9, 9, 9, 9, 9), 0u);
    EXPECT_EQ(entry(1), (words{8, 9, 9, 9, 9, 9, 9, 1, 0}));
    EXPECT_TRUE(rec::has_trace("TARNQT F: adding entry at index 1 (dec)"));
}

TEST_F(OverrideTable, ALimitOfExactlyTheMaximumIsAccepted) {
    constexpr int32_t MAX = 4194304;
    EXPECT_EQ(call(MAX, MAX, MAX, MAX, MAX, MAX), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(entry(0),
              (words{OWN_PID, 0x400000, 0x400000, 0x400000, 0x400000, 0x400000, 0x400000, 1, 0}));
}

TEST_F(OverrideTable, OneAboveTheMaximumIsRefusedWithTheArgumentsCode) {
    for (int position = 0; position < 6; ++position) {
        int32_t limits[6] = {0, 0, 0, 0, 0, 0};
        limits[position] = 4194305;
        rec::clear_traces();
        EXPECT_EQ(call(limits[0], limits[1], limits[2], limits[3], limits[4], limits[5]), 2u);
        EXPECT_EQ(crc, CRC_CODES[position]) << position;
        EXPECT_TRUE(table_is_empty());
        // Refused before the block is looked at.
        strings expected =
            argument_traces(limits[0], limits[1], limits[2], limits[3], limits[4], limits[5]) +
            strings{closing(2, CRC_CODES[position])};
        EXPECT_EQ(rec::traces(), expected);
    }
}

TEST_F(OverrideTable, ANegativeLimitIsRefusedWithTheArgumentsCode) {
    for (int position = 0; position < 6; ++position) {
        int32_t limits[6] = {1, 1, 1, 1, 1, 1};
        limits[position] = position % 2 == 0 ? -1 : INT32_MIN;
        EXPECT_EQ(call(limits[0], limits[1], limits[2], limits[3], limits[4], limits[5]), 2u);
        EXPECT_EQ(crc, CRC_CODES[position]) << position;
    }
    EXPECT_TRUE(table_is_empty());
}

TEST_F(OverrideTable, TheLastRefusedArgumentNamesTheCrc) {
    EXPECT_EQ(call(-1, 0, 0, 0, 0, 5000000), 2u);
    EXPECT_EQ(crc, 7u);
    EXPECT_TRUE(rec::has_trace("TARNOTHF: rssThreshold = -1 (dec)"));
    EXPECT_TRUE(rec::has_trace("TARNOTHF: vsizeAbortThreshold = 5000000 (dec)"));
    EXPECT_EQ(rec::traces().back(), closing(2, 7));
    EXPECT_TRUE(table_is_empty());
}

// Every set of refused arguments: the code is that of the last one, and never 4.
TEST_F(OverrideTable, EverySetOfRefusedArgumentsGivesTheCodeOfItsLast) {
    for (int refused = 1; refused < 64; ++refused) {
        int32_t limits[6];
        int last = 0;
        for (int position = 0; position < 6; ++position) {
            bool bad = (refused >> position & 1) != 0;
            limits[position] = bad ? (position % 2 == 0 ? 4194305 : -4194305) : 4194304;
            last = bad ? position : last;
        }
        EXPECT_EQ(call(limits[0], limits[1], limits[2], limits[3], limits[4], limits[5]), 2u);
        EXPECT_EQ(crc, CRC_CODES[last]) << "refused set " << refused;
        EXPECT_NE(crc, 4u);
    }
    EXPECT_TRUE(table_is_empty());
}

TEST_F(OverrideTable, TheCodeStandsInTheFirstByteOfCrcAndTheOthersAreZero) {
    EXPECT_EQ(call(0, 0, 0, 0, 0, 4194305), 2u);
    unsigned char bytes[4];
    std::memcpy(bytes, &crc, sizeof bytes);
    EXPECT_EQ(bytes[0], 7);
    EXPECT_EQ(bytes[1], 0);
    EXPECT_EQ(bytes[2], 0);
    EXPECT_EQ(bytes[3], 0);
}

TEST_F(OverrideTable, ARefusedCrcPointerStoresNothingAndIsNeverWritten) {
    rec::fail(rec::Call::ckptr, 0x1234);
    crc = 0xA5A5A5A5;
    EXPECT_EQ(tarn_override_thresholds(100, 0, 0, 0, 0, 0, &crc), 0x1234u);
    EXPECT_EQ(crc, 0xA5A5A5A5u);
    EXPECT_EQ(rec::calls(rec::Call::ckptr), 1);
    EXPECT_TRUE(table_is_empty());
    EXPECT_TRUE(rec::events().empty());
    EXPECT_EQ(rec::traces(),
              (strings{"TARNOTHF: --> tarn_override_thresholds", closing(0x1234, 0)}));
}

TEST_F(OverrideTable, ANullCrcPointerIsRefusedByThePointerCheck) {
    EXPECT_EQ(tarn_override_thresholds(100, 0, 0, 0, 0, 0, nullptr), 1u);
    EXPECT_TRUE(table_is_empty());
    EXPECT_EQ(rec::traces(), (strings{"TARNOTHF: --> tarn_override_thresholds", closing(1, 0)}));
}

TEST_F(OverrideTable, WithoutAControlBlockNothingIsStored) {
    private_ipc::remove_control_block(); // as in a process that never attached
    block = nullptr;
    EXPECT_EQ(call(100, 0, 0, 0, 0, 0), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    EXPECT_EQ(rec::traces_starting("TARNICBF: shmget failed").size(), 10u);
    EXPECT_FALSE(rec::has_trace("TARNOTHF: our PID is 4242"));
    EXPECT_TRUE(rec::traces_starting("TARNTLCF:").empty());
    EXPECT_TRUE(rec::traces_starting("TARNQT F:").empty());
    EXPECT_EQ(rec::traces().back(), closing(0, 0));
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(OverrideTable, ASegmentOfAnotherProgramUnderTheKeyIsNeverWritten) {
    private_ipc::remove_control_block();
    block = nullptr;
    constexpr size_t FOREIGN_SIZE = 4000000;
    int foreign = shmget(static_cast<key_t>(TARN_CB_KEY), FOREIGN_SIZE, IPC_CREAT | 0666);
    ASSERT_NE(foreign, -1);
    auto *bytes = static_cast<unsigned char *>(shmat(foreign, nullptr, SHM_RDONLY));
    ASSERT_NE(bytes, reinterpret_cast<unsigned char *>(-1));
    EXPECT_EQ(call(100, 200, 300, 400, 500, 600), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    for (size_t i = 0; i < FOREIGN_SIZE; ++i) {
        ASSERT_EQ(bytes[i], 0) << i;
    }
    shmdt(bytes);
}

TEST_F(OverrideTable, ALockThatCannotBeTakenStoresNothingAndIsNoError) {
    int real_set = block->uBufferLock;
    block->uBufferLock = 0x7ffffff0; // no such set
    EXPECT_EQ(call(100, 200, 300, 400, 500, 600), 0u);
    block->uBufferLock = real_set;
    EXPECT_EQ(crc, 0u);
    EXPECT_TRUE(table_is_empty());
    EXPECT_TRUE(rec::events().empty());
    EXPECT_TRUE(rec::has_trace("TARNTLCF: <-- tarn_override_table_lock_control() == -1"));
    EXPECT_FALSE(rec::has_trace("TARNTLCF: try to unlock")); // nothing taken, nothing released
    EXPECT_TRUE(rec::traces_starting("TARNQT F:").empty());
    EXPECT_EQ(rec::traces().back(), closing(0, 0));
}

TEST_F(OverrideTable, AFullTableRefusesANewPidWithItsListingAndAReport) {
    fill_table();
    std::vector<override_entry> before(block->override_table,
                                       block->override_table + OVERRIDE_TABLE_ENTRIES);
    EXPECT_EQ(call(1, 2, 3, 4, 5, 6), 8u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(std::memcmp(before.data(), block->override_table, sizeof block->override_table), 0);

    strings listing = {
        "TARNQT F: entry_index = -1 (dec)",
        "TARNQT F: no entry found for this name/pid",
        "TARNQT F: unable to add entry to override table",
        "TARNQT F: index = 5000 (dec)",
        "TARNQT F: First 20 entries are :",
    };
    for (uint32_t i = 0; i < 20; ++i) {
        listing.push_back(printed("TARNQT F: entry %u: pid = %u", i, FILLER_PID + i));
    }
    // 21 entries under a heading of 20.
    listing.push_back("TARNQT F: last 20 entries are :");
    for (uint32_t i = 4979; i < 5000; ++i) {
        listing.push_back(printed("TARNQT F: entry %u: pid = %u", i, FILLER_PID + i));
    }
    EXPECT_EQ(rec::traces_starting("TARNQT F:"), listing);

    // The report (src | 2 = 2, so a report of the code itself) comes before the lock is released.
    int report = rec::find_trace("TARNMNDF: --> tarn_mon_error_handler_p");
    ASSERT_GE(report, 0);
    EXPECT_EQ(rec::traces()[report - 1], listing.back());
    EXPECT_EQ(rec::traces()[report + 1], "TARNMNDF:     sysRc = 2   compRc = 0   uiErrorId = e0a4");
    strings tail = lock_traces(0) + strings{closing(8, 0)};
    strings last(rec::traces().end() - static_cast<long>(tail.size()), rec::traces().end());
    EXPECT_EQ(last, tail);
    EXPECT_EQ(semctl(block->uBufferLock, 0, GETVAL), 0);

    ASSERT_EQ(rec::events().size(), 1u);
    const logsvc_record &record = rec::events()[0].record;
    EXPECT_EQ(record.reason_code, 0xE0A4);
    EXPECT_EQ(record.comp_rc, 0u);
    EXPECT_EQ(record.option, LOGSVC_REPORT_ERROR);
    EXPECT_STREQ(record.component, "LinMonitor");
    EXPECT_FALSE(rec::events()[0].has_attachment);
}

TEST_F(OverrideTable, AFullTableStillUpdatesAnExistingPid) {
    fill_table();
    rec::set_pid(FILLER_PID + 4321);
    EXPECT_EQ(call(7, 0, 0, 0, 0, 8), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(entry(4321), (words{FILLER_PID + 4321, 7, 0, 0, 0, 0, 8, 1, 1}));
    EXPECT_TRUE(rec::has_trace("TARNQT F: Found a pid match with entry 4321 (dec)"));
    EXPECT_FALSE(rec::has_trace("TARNQT F: unable to add entry to override table"));
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(OverrideTable, SixZerosFreeAnEntryOfAFullTableForTheNextNewPid) {
    fill_table();
    rec::set_pid(FILLER_PID + 1234);
    EXPECT_EQ(call_zeros(), 0u);
    EXPECT_EQ(entry(1234), words{});
    rec::set_pid(OWN_PID);
    rec::clear_traces();
    EXPECT_EQ(call(5, 5, 5, 5, 5, 5), 0u);
    EXPECT_EQ(entry(1234), (words{OWN_PID, 5, 5, 5, 5, 5, 5, 1, 0}));
    EXPECT_TRUE(rec::has_trace("TARNQT F: adding entry at index 1234 (dec)"));
    EXPECT_TRUE(rec::events().empty());
}

// Real processes: the pid is each process's own.
class OverrideTableProcesses : public OverrideTable {
  protected:
    void SetUp() override {
        OverrideTable::SetUp();
        rec::set_pid(0);
    }
};

TEST_F(OverrideTableProcesses, ACallerWaitsWhileAnotherProcessHoldsTheLock) {
    ASSERT_EQ(tarn_override_table_lock_control(1), 0);
    pid_t caller = start_child([] {
        uint32_t crc = 1;
        return tarn_override_thresholds(11, 22, 33, 44, 55, 66, &crc) == 0 && crc == 0 ? 0 : 1;
    });
    ASSERT_GT(caller, 0);
    // The caller is waiting for the semaphore to become 0: the lock is still ours.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (semctl(block->uBufferLock, 0, GETZCNT) < 1 &&
           std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    ASSERT_EQ(semctl(block->uBufferLock, 0, GETZCNT), 1);
    EXPECT_TRUE(table_is_empty());
    // Written under our lock: the caller must search after it and so take the next entry.
    block->override_table[0] = {1, 0, 0, 0, 0, 0, 0, 1, 0};
    ASSERT_EQ(tarn_override_table_lock_control(0), 0);
    EXPECT_EQ(wait_child(caller), 0);
    EXPECT_EQ(entry(1), (words{static_cast<uint32_t>(caller), 11, 22, 33, 44, 55, 66, 1, 0}));
    EXPECT_EQ(semctl(block->uBufferLock, 0, GETVAL), 0);
}

TEST_F(OverrideTableProcesses, TwentyProcessesAtOnceGetOneEntryEach) {
    constexpr int PROCESSES = 20;
    constexpr int CALLS = 50;
    int go[2];
    ASSERT_EQ(pipe(go), 0);
    std::vector<pid_t> children;
    for (int k = 0; k < PROCESSES; ++k) {
        children.push_back(start_child([&go, k] {
            close(go[1]);
            char byte;
            if (read(go[0], &byte, 1) != 0) { // end of file: everyone starts together
                return 2;
            }
            for (int round = 1; round <= CALLS; ++round) {
                uint32_t crc = 1;
                int32_t value = round * 100 + k;
                if (tarn_override_thresholds(value, k, 0, 0, 0, value, &crc) != 0 || crc != 0) {
                    return 1;
                }
            }
            return 0;
        }));
        ASSERT_GT(children.back(), 0);
    }
    close(go[0]);
    close(go[1]);
    for (pid_t child : children) {
        EXPECT_EQ(wait_child(child), 0);
    }
    std::set<uint32_t> pids;
    for (int i = 0; i < PROCESSES; ++i) {
        words w = entry(i);
        EXPECT_EQ(w[7], 1u) << i;
        EXPECT_TRUE(pids.insert(w[0]).second) << "two entries for pid " << w[0];
        int k = 0;
        while (k < PROCESSES && static_cast<uint32_t>(children[k]) != w[0]) {
            ++k;
        }
        ASSERT_LT(k, PROCESSES) << "an entry for pid " << w[0] << ", which is no caller";
        uint32_t last = CALLS * 100 + k;
        EXPECT_EQ(w, (words{w[0], last, static_cast<uint32_t>(k), 0, 0, 0, last, 1, 0}));
    }
    for (int i = PROCESSES; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        ASSERT_EQ(entry(i), words{}) << i;
    }
    EXPECT_EQ(semctl(block->uBufferLock, 0, GETVAL), 0);
}

} // namespace

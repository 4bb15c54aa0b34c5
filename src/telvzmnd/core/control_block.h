// The control block: the monitor's cross-process state in one System V shared memory segment.
// Every process that loads the library, and the tarnmon host, maps it through this one header, so
// each offset below is an interface between processes and is pinned.
#pragma once

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <sys/ipc.h>
#include <sys/shm.h>

#include "export.h"

inline constexpr uint32_t TARN_CB_KEY = 0x96728017u; // the semaphore set uses the same key
inline constexpr uint32_t TARN_CB_SIZE = 2940036;

inline constexpr int OVERRIDE_TABLE_ENTRIES = 5000;
inline constexpr int TREND_TABLE_ROWS = 3000;
inline constexpr int TREND_SAMPLES = 24;
inline constexpr int PROCESS_TABLE_ROWS = 3000;
inline constexpr int PROCESS_NAME_FIELD = 250;

// Per-process limits that a process set for itself; all limits in KB, 0 = no override.
struct override_entry {
    uint32_t pid;
    uint32_t rss_limit;
    uint32_t dsiz_limit;
    uint32_t vsize_limit;
    uint32_t rss_abort_limit;
    uint32_t dsiz_abort_limit;
    uint32_t vsize_abort_limit;
    uint32_t in_use; // 1 = in use, 0 = free (a free entry is all zero)
    uint32_t seen;   // set when the pid was listed in the current pass
};
static_assert(sizeof(override_entry) == 36);

// One sample of a process's memory: a copy of the last four words of its process-table row.
struct trend_sample {
    uint32_t valid; // 1 = the process was listed when this sample was taken
    uint32_t rss;
    uint32_t dsiz;
    uint32_t vsize;
};
static_assert(sizeof(trend_sample) == 16);

struct trend_row {
    uint32_t in_use;
    uint32_t pid;
    char process_name[PROCESS_NAME_FIELD]; // NUL-padded, not necessarily terminated
    uint8_t fill[2];
    trend_sample samples[TREND_SAMPLES];
};
static_assert(offsetof(trend_row, process_name) == 8);
static_assert(offsetof(trend_row, samples) == 260);
static_assert(sizeof(trend_row) == 644);

// A process listed in the last pass.
struct process_row {
    uint32_t in_use;
    uint32_t pid;
    char process_name[PROCESS_NAME_FIELD]; // NUL-padded, not necessarily terminated
    uint8_t fill[2];
    uint32_t always_one; // becomes the valid flag of a trend sample
    uint32_t rss;
    uint32_t dsiz;
    uint32_t vsize;
};
static_assert(offsetof(process_row, always_one) == 260);
static_assert(sizeof(process_row) == 276);

struct tarn_control_block {
    override_entry override_table[OVERRIDE_TABLE_ENTRIES];
    trend_row trend_table[TREND_TABLE_ROWS];
    process_row process_table[PROCESS_TABLE_ROWS];
    int32_t analysisIndex;             // sample slot that the next trend analysis fills
    uint32_t sleepTimeExceeded;        // 1 = the last sleep overran, or an alert was forced
    int32_t numLoopsBeforeCPUChecking; // passes left before CPU and drift checks are armed
    uint32_t tookLog;                  // 1 = an event was raised and no clean pass followed
    int32_t maxSleepTime;              // seconds the last sleep was allowed to take
    int32_t sleep_time_percent;        // measured sleep in percent; -1 while sleeping on time
    int32_t uBufferLock;               // id of the semaphore set guarding the override table
    uint32_t terminateRequest;         // 1 = end the loop after the current pass
    uint32_t logAsInfo;                // non-zero = raise problem events as informational
};
static_assert(offsetof(tarn_control_block, override_table) == 0);
static_assert(offsetof(tarn_control_block, trend_table) == 180000);
static_assert(offsetof(tarn_control_block, process_table) == 2112000);
static_assert(offsetof(tarn_control_block, analysisIndex) == 2940000);
static_assert(offsetof(tarn_control_block, sleepTimeExceeded) == 2940004);
static_assert(offsetof(tarn_control_block, numLoopsBeforeCPUChecking) == 2940008);
static_assert(offsetof(tarn_control_block, tookLog) == 2940012);
static_assert(offsetof(tarn_control_block, maxSleepTime) == 2940016);
static_assert(offsetof(tarn_control_block, sleep_time_percent) == 2940020);
static_assert(offsetof(tarn_control_block, uBufferLock) == 2940024);
static_assert(offsetof(tarn_control_block, terminateRequest) == 2940028);
static_assert(offsetof(tarn_control_block, logAsInfo) == 2940032);
static_assert(sizeof(tarn_control_block) == TARN_CB_SIZE);

// This process's attachment of the block. Any thread of the host may attach while others use the
// block, so the address is published with one atomic store and read with one atomic load, and a
// mapping, once made, is never removed while the process lives: an address that a thread has read
// stays valid. A failed attach publishes null, so code that uses the block twice reads the pointer
// once into a local first.
class control_block_pointer {
  public:
    tarn_control_block *get() const { return address.load(std::memory_order_acquire); }
    operator tarn_control_block *() const { return get(); }
    tarn_control_block *operator->() const { return get(); }
    control_block_pointer &operator=(tarn_control_block *block) {
        address.store(block, std::memory_order_release);
        return *this;
    }

  private:
    std::atomic<tarn_control_block *> address{nullptr};
};

// A 32-bit field of the block that another thread or process writes while this one reads it:
// one atomic access of the aligned word. A write releases and a read acquires, so that whoever
// reads a field sees the fields its writer stored before it (the forced sleep alert stores
// sleepTimeExceeded after the fields the performance check reads with it); on x86 they cost no
// more than plain loads and stores.
inline uint32_t read_field(const uint32_t &field) {
    return __atomic_load_n(&field, __ATOMIC_ACQUIRE);
}
inline void write_field(uint32_t &field, uint32_t value) {
    __atomic_store_n(&field, value, __ATOMIC_RELEASE);
}
inline int32_t read_field(const int32_t &field) {
    return __atomic_load_n(&field, __ATOMIC_ACQUIRE);
}
inline void write_field(int32_t &field, int32_t value) {
    __atomic_store_n(&field, value, __ATOMIC_RELEASE);
}

extern uint32_t shKey;                    // key of the segment and of the semaphore set
extern int32_t shmid;                     // id of the segment; -1 until one is found
extern control_block_pointer TARN_CB_PTR; // null until attached

TARN_EXPORT uint32_t tarn_init(uint32_t *crc);
TARN_EXPORT uint32_t tarn_init_tarn_cb_ptr(uint32_t *crc);
TARN_EXPORT int32_t tarn_override_table_lock_control(int32_t lock);
TARN_EXPORT void tarn_terminate_monitoring(void);

// For a host about to start the monitor. The first segment of a fresh IPC namespace gets id 0,
// and tarn_init takes a block of id 0 for a failure: while no segment stands under the block's
// key, a segment made and removed here takes id 0, so that the block gets another. Inline: a
// host's own step, which the library neither exports nor takes.
inline void keep_block_off_id_zero() {
    if (shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0) == -1 && errno == ENOENT) {
        int first = shmget(IPC_PRIVATE, 1, IPC_CREAT | 0600);
        if (first != -1) {
            shmctl(first, IPC_RMID, nullptr);
        }
    }
}

#include "core/control_block.h"

#include <cerrno>
#include <cstring>
#include <mutex>

#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "core/sysv_ipc.h"
#include "logsvc.h"
#include "tracesvc.h"

const sysv_ipc_calls sysv_ipc_system = {::shmget, ::shmat, ::shmctl, ::semget, ::semop};
sysv_ipc_calls sysv_ipc = sysv_ipc_system;

uint32_t shKey;
int32_t shmid = -1;
control_block_pointer TARN_CB_PTR;

namespace {

constexpr int MAX_ATTEMPTS = 10;
constexpr int SEM_PERMISSIONS = 0666;

// A lock waits until nobody holds the table, then takes it; SEM_UNDO gives it back if the holder
// dies. Unlocking an unlocked table fails at once with EAGAIN instead of waiting.
sembuf lockSem[2] = {{0, 0, 0}, {0, 1, SEM_UNDO}};
sembuf unlockSem[1] = {{0, -1, SEM_UNDO | IPC_NOWAIT}};
static_assert(SEM_UNDO == 0x1000 && (SEM_UNDO | IPC_NOWAIT) == 0x1800);

key_t key_of(uint32_t value) {
    return static_cast<key_t>(value);
}

// Serialises the attaches of the threads of this process: shKey, shmid and the mapping below are
// changed only while it is held.
std::mutex attach_lock;

// The segment whose mapping TARN_CB_PTR holds: a repeated attach of the same segment reuses it
// instead of mapping the 2.9 MB again.
int32_t attached_id = -1;

// shmget, accepting only a segment of exactly the control block's size: a larger segment under
// the key belongs to another program, and nothing may be written into it. Such a segment counts
// as no segment at all (-1, errno EINVAL, as shmget says of a size that does not fit).
int find_segment(size_t size, int flags) {
    int id = sysv_ipc.shmget(key_of(shKey), size, flags);
    if (id == -1) {
        return -1;
    }
    shmid_ds info;
    if (sysv_ipc.shmctl(id, IPC_STAT, &info) != 0 || info.shm_segsz != TARN_CB_SIZE) {
        errno = EINVAL;
        return -1;
    }
    return id;
}

// Attaches segment `id`, reusing this process's mapping of it. The mapping of an older segment
// stays in place, since another thread may still be using it. A failed attach (-1, or a null
// address) leaves TARN_CB_PTR null.
void attach(int32_t id) {
    if (TARN_CB_PTR != nullptr && attached_id == id) {
        return;
    }
    void *address = sysv_ipc.shmat(id, nullptr, 0);
    if (address == reinterpret_cast<void *>(-1) || address == nullptr) {
        attached_id = -1;
        TARN_CB_PTR = nullptr;
        return;
    }
    attached_id = id;
    TARN_CB_PTR = static_cast<tarn_control_block *>(address);
}

// Applies unlockSem to the new set, again while a signal interrupts it. On a new set it fails with
// EAGAIN, which leaves the semaphore at 0: unlocked.
void unlock_new_set(bool trace_each_try) {
    int rc;
    do {
        rc = sysv_ipc.semop(TARN_CB_PTR->uBufferLock, unlockSem, 1);
        if (trace_each_try) {
            tracesvc_trace("TARNINTD: after semop, osl_rc = %x (hex)", rc);
            tracesvc_trace("TARNINTD: after semop, rc = %x (hex)", rc);
        }
    } while (rc == -1 && errno == EINTR);
    tracesvc_trace("TARNINTD: after semop, rc = %x (hex)", rc);
}

} // namespace

TARN_EXPORT uint32_t tarn_init(uint32_t *crc) {
    std::lock_guard guard(attach_lock);
    tracesvc_trace("TARNINTF: before shared memory access");
    shKey = TARN_CB_KEY;
    tracesvc_trace("TARNINTF: shKey = %x (hex)", shKey);
    uint32_t src = 0;
    int removeRc = 0;
    int attempts = 0;

    do {
        tracesvc_trace("TARNINTF: just before shmget (create)");
        errno = 0;
        shmid = sysv_ipc.shmget(key_of(shKey), TARN_CB_SIZE, IPC_CREAT | IPC_EXCL | 0666);
        int error_number = errno;
        tracesvc_trace("TARNINTF: shmid = %x (hex), error_number = %x (hex)", shmid, error_number);
        tracesvc_trace("TARNINTF: error is %s", std::strerror(error_number));

        if (shmid == -1 && error_number == EEXIST) {
            // A block of an earlier run is still there; a size of 10 finds it whatever its size.
            tracesvc_trace("TARNINTF: About to eliminate old shared memory block");
            shmid = sysv_ipc.shmget(key_of(shKey), 10, 0666);
            tracesvc_trace("TARNINTF: shmid = %x (hex)", shmid);
            if (shmid == 0) {
                tracesvc_trace("TARNINTF: shmid is 0 in telvzmnd");
                *crc = RC_STALE_BLOCK_ID_ZERO;
                src = tarn_mon_error_handler(src | 2, removeRc, RC_STALE_BLOCK_ID_ZERO);
            }
            removeRc = sysv_ipc.shmctl(shmid, IPC_RMID, nullptr);
            if (removeRc == -1) {
                int remove_error = errno;
                tracesvc_trace("TARNINTF: shared memory delete failed with errno of %d",
                               remove_error);
                tracesvc_trace("TARNINTF: error is %s", std::strerror(remove_error));
            }
            tracesvc_trace("TARNINTF: before second shmget");
            errno = 0;
            shmid = find_segment(TARN_CB_SIZE, IPC_CREAT | 0666);
            int second_error = errno;
            tracesvc_trace("TARNINTF: Point 0200 shmid = %x (hex), errno = %x (hex)", shmid,
                           second_error);
            tracesvc_trace("TARNINTF: error is %s", std::strerror(second_error));
        }

        if (shmid != -1) {
            tracesvc_trace("TARNINTF: got id of shared memory");
            attach(shmid);
            tracesvc_trace("TARNINTF: TARN_CB_PTR = %p ", static_cast<void *>(TARN_CB_PTR));
            tracesvc_trace("TARNINTD: Got here!");
            if (TARN_CB_PTR == nullptr) {
                tracesvc_trace("TARNINTF: error accessing shared memory");
                *crc = RC_BLOCK_NO_ADDRESS;
                src = tarn_mon_error_handler(src | 2, removeRc, RC_BLOCK_NO_ADDRESS);
            }
        }
        attempts++;
    } while (shmid == -1 && removeRc == 0 && attempts <= 9);

    tracesvc_trace("TARNINTF: out of while loop");
    tracesvc_trace("TARNINTD: out of while loop 2");

    // A block obtained only on the tenth attempt counts as a failure too.
    if (removeRc != 0 || attempts > 9 || TARN_CB_PTR == nullptr) {
        *crc = RC_BLOCK_NOT_CREATED;
        return tarn_mon_error_handler(src | 2, removeRc, RC_BLOCK_NOT_CREATED);
    }

    tracesvc_trace("TARNINTD: TARN_CB_PTR = %p Point 0001", static_cast<void *>(TARN_CB_PTR));
    std::memset(TARN_CB_PTR, 0, TARN_CB_SIZE);

    errno = 0;
    TARN_CB_PTR->uBufferLock =
        sysv_ipc.semget(key_of(shKey), 1, IPC_CREAT | IPC_EXCL | SEM_PERMISSIONS);
    int error_number = errno;
    tracesvc_trace("TARNINTD: semget's rc = %x (hex)", TARN_CB_PTR->uBufferLock);
    tracesvc_trace("TARNINTD: semget's errrc = %x (hex)", error_number);

    if (!(TARN_CB_PTR->uBufferLock == -1 && error_number == EEXIST)) {
        // A new set, or a failure for another reason, which is not reported.
        tracesvc_trace("TARNINTD: About to do a semop to unlock the semaphore, Point A");
        unlock_new_set(true);
    } else {
        // The set of an earlier run is reused, not removed.
        tracesvc_trace("TARNINTD: before second semget()");
        TARN_CB_PTR->uBufferLock = sysv_ipc.semget(key_of(shKey), 1, IPC_CREAT | SEM_PERMISSIONS);
        int second_error = errno;
        tracesvc_trace("TARNINTD: second semget's rc = %x (hex)", TARN_CB_PTR->uBufferLock);
        if (TARN_CB_PTR->uBufferLock != -1) {
            tracesvc_trace("TARNINTD: About to do a semop to unlock the semaphore");
            unlock_new_set(false);
        } else {
            tracesvc_trace("TARNINTF: error_number = %d (dec)", second_error);
            *crc = RC_SEMAPHORE_NOT_OPENED;
            src = tarn_mon_error_handler(src | 2, static_cast<uint32_t>(second_error),
                                         RC_SEMAPHORE_NOT_OPENED);
        }
    }

    tracesvc_trace("TARNINTD: uBufferLock = %x (hex)", TARN_CB_PTR->uBufferLock);
    tracesvc_trace("TARNINTD: TARN_CB_PTR = %p Point 0002", static_cast<void *>(TARN_CB_PTR));
    return src;
}

TARN_EXPORT uint32_t tarn_init_tarn_cb_ptr(uint32_t *) {
    std::lock_guard guard(attach_lock);
    shKey = TARN_CB_KEY;
    tracesvc_trace("TARNICBF: shKey = %x (hex)", shKey);
    // A block removed by a later run's tarn_init gets a new id: look it up again each time.
    shmid = -1;
    for (int attempt = 0; attempt < MAX_ATTEMPTS && shmid == -1; ++attempt) {
        tracesvc_trace("TARNICBF: before shmget");
        shmid = find_segment(TARN_CB_SIZE, 0666);
        tracesvc_trace("TARNICBF: shmid = %x (hex)", shmid);
        if (shmid != -1) {
            tracesvc_trace("TARNICBF: about to get memory pointer");
            attach(shmid);
            tracesvc_trace("TARNICBF: TARN_CB_PTR = %p", static_cast<void *>(TARN_CB_PTR));
            if (TARN_CB_PTR == nullptr) {
                tracesvc_trace("TARNICBF: error accessing shared memory");
            }
            tracesvc_trace("TARNICBF: done with shmat path");
        } else {
            tracesvc_trace("TARNICBF: shmget failed");
        }
        tracesvc_trace("TARNICBF: just before while loop");
    }
    tracesvc_trace("TARNICBF: just after while loop");
    tracesvc_trace("TARNICBF: TARN_CB_PTR = %p ", static_cast<void *>(TARN_CB_PTR));
    tracesvc_trace("TARNICBF: osl_rc = %x (hex) ", 0);
    return 0;
}

TARN_EXPORT int32_t tarn_override_table_lock_control(int32_t lock) {
    tracesvc_trace("TARNTLCF: --> tarn_override_table_lock_control(%d)", lock);
    // Read once: another thread may attach a newer block meanwhile.
    tarn_control_block *block = TARN_CB_PTR;
    int rc;
    int error_number;
    do {
        tracesvc_trace("TARNTLCF: before TARN_CB_PTR->uBufferLock = %x (hex)", block->uBufferLock);
        bool locking = lock == 1;
        tracesvc_trace(locking ? "TARNTLCF: try to lock" : "TARNTLCF: try to unlock");
        rc = sysv_ipc.semop(block->uBufferLock, locking ? lockSem : unlockSem, locking ? 2 : 1);
        error_number = rc == -1 ? errno : 0;
        tracesvc_trace(locking
                           ? "TARNTLCF: after TARN_CB_PTR->uBufferLock (lock case) = %x (hex)"
                           : "TARNTLCF: after TARN_CB_PTR->uBufferLock (unlock case) = %x (hex)",
                       block->uBufferLock);
        tracesvc_trace("TARNTLCF: osl_rc = %x (hex)", rc);
        tracesvc_trace("TARNTLCF: error_number = %x (hex)", error_number);
        // Unlocking a table that nobody holds counts as success.
        if (!locking && error_number == EAGAIN) {
            rc = 0;
            error_number = 0;
        }
        tracesvc_trace("TARNTLCF: after TARN_CB_PTR->uBufferLock = %x (hex)", block->uBufferLock);
    } while (rc != 0 && error_number == EINTR);
    tracesvc_trace("TARNTLCF: <-- tarn_override_table_lock_control() == %d", rc);
    return rc;
}

TARN_EXPORT void tarn_terminate_monitoring(void) {
    tracesvc_trace("TARNTERF: --> tarn_terminate_monitoring");
    uint32_t crc = 0;
    tarn_control_block *block = tarn_init_tarn_cb_ptr(&crc) == 0 ? TARN_CB_PTR.get() : nullptr;
    if (block != nullptr) {
        write_field(block->terminateRequest, 1);
    }
    logsvc_record record;
    std::memset(&record, 0, sizeof record);
    record.record_type = LOGSVC_RECORD_TYPE_EVENT;
    record.option = LOGSVC_REPORT_INFORMATIONAL;
    std::strncpy(record.component, "LinMonitor", LOGSVC_COMPONENT_LENGTH);
    record.reason_code = RC_TERMINATE_REQUESTED;
    uint32_t log_crc = 0;
    uint32_t src = logsvc_microcode_log(&record, &log_crc);
    tracesvc_trace("TARNTERF: logsvc_microcode_log() src = %x, crc = %x (hex)", src, log_crc);
    tracesvc_trace("TARNTERF: <-- tarn_terminate_monitoring");
}

// Control-block tests use the one fixed System V key of the monitor. Each test process moves
// into an IPC namespace of its own where the machine allows it, so that the tests never touch the
// block of a monitor running on the same host.
#pragma once

#include <sys/shm.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include "core/control_block.h"

namespace private_ipc {

// Enters a new IPC namespace once per process; false when the machine does not allow it.
bool enter();

// True when it is safe to use the monitor's key: a private namespace, or no block of that key.
// Otherwise it says why in `why`.
bool key_is_ours(const char **why);

// The first segment of a new IPC namespace gets id 0, which the monitor takes for a failure: uses
// it up, so that the blocks of the tests get ordinary ids.
void use_up_id_zero();

// Removes the segment and the semaphore set under the monitor's key.
void remove_control_block_objects();

// Leaves no control block behind: this process's attachment, then the objects under the key.
// Inline, so that a test program without the library's objects, which never calls it, needs none.
inline void remove_control_block() {
    if (TARN_CB_PTR != nullptr) {
        shmdt(TARN_CB_PTR);
        TARN_CB_PTR = nullptr;
    }
    remove_control_block_objects();
}

// A control block of the test's own, made by the monitor's tarn_init once id 0 is used up; null
// when it could not be made. Inline, as above.
inline tarn_control_block *fresh_control_block() {
    use_up_id_zero();
    uint32_t crc = 0;
    return tarn_init(&crc) == 0 ? TARN_CB_PTR.get() : nullptr;
}

// Runs `child` in a forked process that ends with its result; returns the pid.
template <typename F>
pid_t start_child(F child) {
    pid_t pid = fork();
    if (pid == 0) {
        _exit(child());
    }
    return pid;
}

// The exit status of a child of start_child, or 100 + the signal that ended it.
inline int wait_child(pid_t pid) {
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 100 + WTERMSIG(status);
}

} // namespace private_ipc

#define REQUIRE_PRIVATE_KEY()                                                                      \
    do {                                                                                           \
        const char *why_not = nullptr;                                                             \
        if (!private_ipc::key_is_ours(&why_not)) {                                                 \
            GTEST_SKIP() << why_not;                                                               \
        }                                                                                          \
    } while (0)

#include "private_ipc.h"

#include <sched.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/shm.h>

#include "core/control_block.h"

namespace private_ipc {

bool enter() {
    static const bool entered = unshare(CLONE_NEWIPC) == 0;
    return entered;
}

bool key_is_ours(const char **why) {
    if (enter()) {
        return true;
    }
    if (shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0) != -1) {
        *why = "no private IPC namespace here, and a monitor's control block exists on this host";
        return false;
    }
    return true;
}

void use_up_id_zero() {
    int first = shmget(IPC_PRIVATE, 16, IPC_CREAT | 0600);
    shmctl(first, IPC_RMID, nullptr);
}

void remove_control_block_objects() {
    int id = shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0);
    if (id != -1) {
        shmctl(id, IPC_RMID, nullptr);
    }
    int sem = semget(static_cast<key_t>(TARN_CB_KEY), 1, 0);
    if (sem != -1) {
        semctl(sem, 0, IPC_RMID);
    }
}

} // namespace private_ipc

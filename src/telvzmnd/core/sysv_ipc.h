// The System V calls of the control block, reached through one table so that a test can make a
// single call fail in ways the kernel cannot be made to (an id of 0, a null attach address).
#pragma once

#include <cstddef>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/shm.h>

struct sysv_ipc_calls {
    int (*shmget)(key_t key, size_t size, int flags);
    void *(*shmat)(int id, const void *address, int flags);
    int (*shmctl)(int id, int command, struct shmid_ds *buffer);
    int (*semget)(key_t key, int count, int flags);
    int (*semop)(int id, struct sembuf *operations, size_t count);
};

extern sysv_ipc_calls sysv_ipc;              // the calls in use
extern const sysv_ipc_calls sysv_ipc_system; // the kernel's own, what sysv_ipc starts as

// Control-block tests use the one fixed System V key of the monitor. Each test process moves
// into an IPC namespace of its own where the machine allows it, so that the tests never touch the
// block of a monitor running on the same host.
#pragma once

namespace private_ipc {

// Enters a new IPC namespace once per process; false when the machine does not allow it.
bool enter();

// True when it is safe to use the monitor's key: a private namespace, or no block of that key.
// Otherwise it says why in `why`.
bool key_is_ours(const char **why);

} // namespace private_ipc

#define REQUIRE_PRIVATE_KEY()                                                                      \
    do {                                                                                           \
        const char *why_not = nullptr;                                                             \
        if (!private_ipc::key_is_ours(&why_not)) {                                                 \
            GTEST_SKIP() << why_not;                                                               \
        }                                                                                          \
    } while (0)

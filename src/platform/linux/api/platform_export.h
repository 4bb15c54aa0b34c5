// What leaves libtelvplatform.so: the C services of the platform boundary and nothing else. The
// implementation behind them is hidden in the platform's core.
#pragma once

#include <cerrno>
#include <cstdint>

#define TELV_PLATFORM_EXPORT extern "C" __attribute__((visibility("default")))

namespace telv::api {

// Every service runs through here. errno belongs to the caller, who may still be about to look
// at it after a trace line, so it is left as it was; and nothing thrown inside the platform (memory
// running out while a path or a line is built) may reach a host that cannot catch it: the service
// answers `refused` instead.
template <typename Result, typename Service>
Result serve(Result refused, Service service) noexcept {
    int caller_errno = errno;
    Result result = refused;
    try {
        result = service();
    } catch (...) {
        result = refused;
    }
    errno = caller_errno;
    return result;
}

// A service that gives its reason for a refusal in *crc: ENOMEM when it was stopped by a throw,
// which inside the platform means memory ran out.
template <typename Service>
uint32_t serve(uint32_t failed, uint32_t *crc, Service service) noexcept {
    bool finished = false;
    uint32_t result = serve(failed, [&] {
        uint32_t answer = service();
        finished = true;
        return answer;
    });
    if (!finished && crc != nullptr) {
        *crc = ENOMEM;
    }
    return result;
}

} // namespace telv::api

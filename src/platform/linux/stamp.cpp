#include "stamp.h"

#include <cstdio>
#include <ctime>
#include <sys/syscall.h>
#include <unistd.h>

namespace telv::stamp {

UtcTime utc_now() {
    UtcTime now{};
    struct timespec clock;
    ::clock_gettime(CLOCK_REALTIME, &clock);
    struct tm parts;
    ::gmtime_r(&clock.tv_sec, &parts);
    std::snprintf(now.text, sizeof now.text, "%04d-%02d-%02dT%02d:%02d:%02d.%03ldZ",
                  parts.tm_year + 1900, parts.tm_mon + 1, parts.tm_mday, parts.tm_hour,
                  parts.tm_min, parts.tm_sec, clock.tv_nsec / 1000000);
    return now;
}

long thread_id(pid_t pid) {
    // A thread keeps its id for life; only a forked child, whose pid differs, asks again.
    thread_local pid_t asked_in = 0;
    thread_local long id = 0;
    if (asked_in != pid) {
        id = ::syscall(SYS_gettid);
        asked_in = pid;
    }
    return id;
}

} // namespace telv::stamp

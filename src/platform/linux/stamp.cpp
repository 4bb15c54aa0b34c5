#include "stamp.h"

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstring>
#include <pthread.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace telv::stamp {
namespace {

// The pid as far as known: 0 until asked, and again in a forked child.
std::atomic<pid_t> known_pid{0};

void forget_pid() {
    known_pid.store(0, std::memory_order_relaxed);
}

// The pid is kept only once a forked child is sure to forget it before it runs on. Arranged as the
// library loads: a fork that came while another thread was arranging it would leave the child
// waiting for it for ever.
const bool forgotten_in_children = ::pthread_atfork(nullptr, nullptr, forget_pid) == 0;

// What snprintf left in a buffer of `size` bytes: the length of the text as far as it fits.
size_t kept_length(int printed, size_t size) {
    return printed < 0 ? 0 : std::min(static_cast<size_t>(printed), size - 1);
}

// "2026-11-22T02:31:30." for `second`; its length.
size_t up_to_milliseconds(time_t second, char *out, size_t room) {
    struct tm parts {};
    ::gmtime_r(&second, &parts);
    return kept_length(std::snprintf(out, room, "%04d-%02d-%02dT%02d:%02d:%02d.",
                                     parts.tm_year + 1900, parts.tm_mon + 1, parts.tm_mday,
                                     parts.tm_hour, parts.tm_min, parts.tm_sec),
                       room);
}

// "123Z" for the milliseconds of `nanoseconds`: always four characters.
void milliseconds(long nanoseconds, char *out) {
    long ms = nanoseconds / 1000000;
    out[0] = static_cast<char>('0' + ms / 100 % 10);
    out[1] = static_cast<char>('0' + ms / 10 % 10);
    out[2] = static_cast<char>('0' + ms % 10);
    out[3] = 'Z';
}

} // namespace

UtcTime utc_now() {
    UtcTime now{};
    struct timespec clock;
    ::clock_gettime(CLOCK_REALTIME, &clock);
    size_t length = up_to_milliseconds(clock.tv_sec, now.text, sizeof now.text - 5);
    milliseconds(clock.tv_nsec, now.text + length);
    return now;
}

pid_t process_id() {
    pid_t pid = known_pid.load(std::memory_order_relaxed);
    if (pid == 0) {
        pid = ::getpid();
        if (forgotten_in_children) {
            known_pid.store(pid, std::memory_order_relaxed);
        }
    }
    return pid;
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

LineStamp line_stamp() {
    // What changes seldom is kept formatted by each thread: the time up to the second, and the
    // pid and thread, which change only in a forked child.
    struct Kept {
        bool has_second;
        time_t second;
        char up_to_milliseconds[48];
        size_t up_to_milliseconds_length;
        pid_t pid;
        char ids[48]; // " 4321 4322 "
        size_t ids_length;
    };
    thread_local Kept kept{};
    LineStamp stamp;
    ::clock_gettime(CLOCK_REALTIME, &stamp.time);
    if (!kept.has_second || kept.second != stamp.time.tv_sec) {
        kept.up_to_milliseconds_length = up_to_milliseconds(
            stamp.time.tv_sec, kept.up_to_milliseconds, sizeof kept.up_to_milliseconds);
        kept.second = stamp.time.tv_sec;
        kept.has_second = true;
    }
    pid_t pid = process_id();
    if (kept.pid != pid) {
        kept.ids_length = kept_length(std::snprintf(kept.ids, sizeof kept.ids, " %ld %ld ",
                                                    static_cast<long>(pid), thread_id(pid)),
                                      sizeof kept.ids);
        kept.pid = pid;
    }
    std::memcpy(stamp.text, kept.up_to_milliseconds, kept.up_to_milliseconds_length);
    stamp.length = kept.up_to_milliseconds_length;
    milliseconds(stamp.time.tv_nsec, stamp.text + stamp.length);
    stamp.length += 4;
    std::memcpy(stamp.text + stamp.length, kept.ids, kept.ids_length);
    stamp.length += kept.ids_length;
    return stamp;
}

} // namespace telv::stamp

// Time that flies, for a benchmark that runs tarnmon run for thousands of passes: preloaded into
// the tarnmon process (LD_PRELOAD), this library makes every timed wait on the monotonic clock end
// at once, as if its whole time had passed, so that a pass every 5 seconds takes only as long as
// its checks. Nothing of the product changes: tarnmon's own sleep() still waits on its condition
// variable, the loop still measures each second against the uptime, and the CPU accounting still
// reads the clock ticks of times().
//
// What it replaces, over the C library's own functions (found with dlsym(RTLD_NEXT)):
// - pthread_cond_clockwait on CLOCK_MONOTONIC or CLOCK_BOOTTIME, which libstdc++'s
//   condition_variable::wait_until on steady_clock calls, inline in tarnmon's sleep(): the clocks
//   are moved on to the deadline and the wait ends with ETIMEDOUT without waiting. Each such wait
//   is one second slept: sleep k belongs to pass (k - 1) / interval + 1.
// - clock_gettime on CLOCK_MONOTONIC (its raw and coarse variants too) and CLOCK_BOOTTIME, which
//   steady_clock::now reaches through libstdc++'s PLT: the real clock plus the time flown over.
//   CLOCK_REALTIME stays real, so the trace's and the snapshots' time stamps are the real ones.
// - sysinfo, which the loop's uptime reads: the real uptime when this library was loaded, plus
//   the whole seconds of the waits flown over, and nothing else. With real time in it, a second
//   boundary crossed while the loop traces between two sleeps would count as an overrun, which at
//   an interval of 5 and the example's 110 % (5 seconds allowed) is an alert; here a sleep of 5
//   seconds measures exactly 5.
// - times, the CPU accounting's clock ticks: the real ticks plus the time flown over, so that
//   passes 5 seconds apart are 500 ticks apart and every pass takes its CPU sample.
// - pthread_join, which tarnmon's main thread calls once, when the monitor's thread has ended.
//
// Set by the environment, read once at load:
// - TARN_FAST_TIME_DIR: the directory for what this library records (nothing without it).
// - TARN_FAST_TIME_INTERVAL: the seconds slept between two passes (default 5).
// - TARN_FAST_TIME_PASSES: after the last sleep of the pass before this one, SIGTERM is sent to
//   the process and that sleep waits for real until tarnmon's stop wakes it, so that the monitor
//   makes exactly this many passes and ends as tarnmon ends it on a signal (0: never).
// - TARN_FAST_TIME_EVERY: the passes between two records of the memory (default 1000).
//
// In that directory it writes:
// - figures: a line "<when> <pass> <VmRSS> <VmHWM> <RssAnon> <RssFile> <RssShmem>" (kB, from
//   /proc/self/status) after the first pass, after every EVERY-th pass, at the last sleep
//   ("last-sleep", the pass before the last) and when the monitor's thread has been joined
//   ("ended", after the last pass), each at the first sleep that follows its pass;
// - smaps-last-sleep and smaps-ended: copies of /proc/self/smaps at those two points;
// - counts: "<name> <value>" lines of what this library saw, at the join (or at exit without one).
//
// LD_PRELOAD is taken out of the environment at load, so that the commands the monitor starts run
// as they always do. The library allocates nothing: it formats into the stack and writes with
// write(), so that it adds to the process's memory only its own few pages.
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <fcntl.h>
#include <pthread.h>
#include <sys/sysinfo.h>
#include <sys/times.h>
#include <time.h>
#include <unistd.h>

namespace {

constexpr int64_t NS_PER_SECOND = 1000000000;
// How long the wait after the SIGTERM may last: tarnmon's main thread wakes it within
// milliseconds; a run whose stop never comes ends with extra passes, which the benchmark sees.
constexpr int64_t STOP_WAIT_SECONDS = 60;
constexpr size_t PATH_SIZE = 4096;

using clock_gettime_call = int (*)(clockid_t, timespec *);
using clockwait_call = int (*)(pthread_cond_t *, pthread_mutex_t *, clockid_t, const timespec *);
using sysinfo_call = int (*)(struct sysinfo *);
using times_call = clock_t (*)(struct tms *);
using join_call = int (*)(pthread_t, void **);

// The settings of the environment, read at load.
char out_dir[PATH_SIZE];  // where the records go; empty: none
long interval = 5;        // seconds slept between two passes
long passes_wanted = 0;   // passes before the monitor is stopped; 0: never
long record_every = 1000; // passes between two records of the memory
long tick_rate = 100;     // clock ticks a second
long uptime_at_load = 0;  // seconds, the real uptime when this library was loaded
bool loaded = false;      // the constructor has run

// The time flown over.
std::atomic<int64_t> offset_ns{0};  // the monotonic and boot clocks ahead of the real ones
std::atomic<long> seconds_flown{0}; // whole seconds of the waits ended at once: the uptime's
                                    // only motion
std::atomic<bool> stop_sent{false}; // SIGTERM sent: every later wait is real

// What this library saw, for the counts file.
std::atomic<long> sleeps{0};       // waits ended at once
std::atomic<long> real_waits{0};   // waits that waited for real (the stop's, other clocks)
std::atomic<long> clock_reads{0};  // clock_gettime calls on a clock moved on
std::atomic<long> uptime_reads{0}; // sysinfo calls
std::atomic<long> tick_reads{0};   // times calls
std::atomic<long> tick_reads_after_stop{0};
std::atomic<long> short_tick_gaps{0}; // times calls less than half a second after the one
                                      // before, but for the first two (the accounting's start
                                      // back-dates its first sample)
std::atomic<long> last_ticks{0};
std::atomic<long> joins{0};
std::atomic<bool> counts_written{false};

// The C library's own definitions of what this library replaces, found once.
struct definitions {
    clock_gettime_call clock_gettime;
    clockwait_call clockwait;
    sysinfo_call sysinfo;
    times_call times;
    join_call join;
};

template <typename Call>
Call next_definition(const char *name) {
    return reinterpret_cast<Call>(dlsym(RTLD_NEXT, name));
}

const definitions &real() {
    static const definitions found{
        next_definition<clock_gettime_call>("clock_gettime"),
        next_definition<clockwait_call>("pthread_cond_clockwait"),
        next_definition<sysinfo_call>("sysinfo"),
        next_definition<times_call>("times"),
        next_definition<join_call>("pthread_join"),
    };
    return found;
}

bool is_moved(clockid_t clock) {
    return clock == CLOCK_MONOTONIC || clock == CLOCK_MONOTONIC_RAW ||
           clock == CLOCK_MONOTONIC_COARSE || clock == CLOCK_BOOTTIME;
}

int64_t nanoseconds(const timespec &t) {
    return int64_t{t.tv_sec} * NS_PER_SECOND + t.tv_nsec;
}

timespec as_timespec(int64_t ns) {
    return timespec{static_cast<time_t>(ns / NS_PER_SECOND), static_cast<long>(ns % NS_PER_SECOND)};
}

int64_t real_now(clockid_t clock) {
    timespec now{};
    real().clock_gettime(clock, &now);
    return nanoseconds(now);
}

// ---- Records ----

// The file `name` of the out directory into `path`; false without one.
bool out_path(char *path, const char *name) {
    return out_dir[0] != '\0' &&
           std::snprintf(path, PATH_SIZE, "%s/%s", out_dir, name) < static_cast<int>(PATH_SIZE);
}

void write_all(int fd, const char *text, size_t length) {
    while (length > 0) {
        ssize_t written = write(fd, text, length);
        if (written < 0 && errno == EINTR) {
            continue;
        }
        if (written <= 0) {
            return;
        }
        text += written;
        length -= static_cast<size_t>(written);
    }
}

void append_line(const char *name, const char *line) {
    char path[PATH_SIZE];
    if (!out_path(path, name)) {
        return;
    }
    int fd = open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (fd >= 0) {
        write_all(fd, line, std::strlen(line));
        close(fd);
    }
}

// The kB of the field `key` ("VmRSS:") in the text of /proc/self/status; -1 when it has none.
long status_field(const char *status, const char *key) {
    const char *at = std::strstr(status, key);
    return at != nullptr ? std::strtol(at + std::strlen(key), nullptr, 10) : -1;
}

void record_figures(const char *when, long pass) {
    char status[8192];
    ssize_t length = -1;
    int fd = open("/proc/self/status", O_RDONLY | O_CLOEXEC);
    if (fd >= 0) {
        length = read(fd, status, sizeof status - 1);
        close(fd);
    }
    status[length > 0 ? length : 0] = '\0';
    char line[256];
    std::snprintf(line, sizeof line, "%s %ld %ld %ld %ld %ld %ld\n", when, pass,
                  status_field(status, "VmRSS:"), status_field(status, "VmHWM:"),
                  status_field(status, "RssAnon:"), status_field(status, "RssFile:"),
                  status_field(status, "RssShmem:"));
    append_line("figures", line);
}

void copy_smaps(const char *name) {
    char path[PATH_SIZE];
    if (!out_path(path, name)) {
        return;
    }
    int in = open("/proc/self/smaps", O_RDONLY | O_CLOEXEC);
    int out = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    char block[4096];
    ssize_t length = 0;
    while (in >= 0 && out >= 0 && (length = read(in, block, sizeof block)) > 0) {
        write_all(out, block, static_cast<size_t>(length));
    }
    if (in >= 0) {
        close(in);
    }
    if (out >= 0) {
        close(out);
    }
}

void write_counts() {
    if (counts_written.exchange(true)) {
        return;
    }
    char text[1024];
    std::snprintf(text, sizeof text,
                  "sleeps %ld\nreal_waits %ld\nclock_reads %ld\nuptime_reads %ld\n"
                  "tick_reads %ld\ntick_reads_after_stop %ld\nshort_tick_gaps %ld\njoins %ld\n"
                  "seconds_flown %ld\n",
                  sleeps.load(), real_waits.load(), clock_reads.load(), uptime_reads.load(),
                  tick_reads.load(), tick_reads_after_stop.load(), short_tick_gaps.load(),
                  joins.load(), seconds_flown.load());
    append_line("counts", text);
}

// ---- The sleeps ----

// After sleep `sleep` has been flown over: the records of the pass it follows, and the stop.
// True when the monitor is to be stopped now.
bool after_sleep(long sleep) {
    long pass = (sleep - 1) / interval + 1;
    bool first_of_pass = (sleep - 1) % interval == 0;
    if (first_of_pass && (pass == 1 || pass % record_every == 0)) {
        record_figures("pass", pass);
    }
    if (passes_wanted < 2 || sleep != (passes_wanted - 1) * interval) {
        return false;
    }
    record_figures("last-sleep", pass);
    copy_smaps("smaps-last-sleep");
    return true;
}

// A real wait for a deadline of the moved clock.
int wait_for_real(pthread_cond_t *cond, pthread_mutex_t *mutex, clockid_t clock,
                  const timespec *deadline) {
    ++real_waits;
    if (!is_moved(clock)) {
        return real().clockwait(cond, mutex, clock, deadline);
    }
    timespec real_deadline = as_timespec(nanoseconds(*deadline) - offset_ns.load());
    return real().clockwait(cond, mutex, clock, &real_deadline);
}

__attribute__((constructor)) void fast_time_load() {
    const char *dir = std::getenv("TARN_FAST_TIME_DIR");
    if (dir != nullptr) {
        std::snprintf(out_dir, sizeof out_dir, "%s", dir);
    }
    auto number = [](const char *variable, long fallback) {
        const char *text = std::getenv(variable);
        long value = text != nullptr ? std::strtol(text, nullptr, 10) : fallback;
        return value > 0 ? value : fallback;
    };
    interval = number("TARN_FAST_TIME_INTERVAL", 5);
    passes_wanted = number("TARN_FAST_TIME_PASSES", 0);
    record_every = number("TARN_FAST_TIME_EVERY", 1000);
    tick_rate = sysconf(_SC_CLK_TCK);
    struct sysinfo info {};
    real().sysinfo(&info);
    uptime_at_load = info.uptime;
    unsetenv("LD_PRELOAD");
    loaded = true;
}

__attribute__((destructor)) void fast_time_exit() {
    if (loaded) {
        write_counts();
    }
}

} // namespace

extern "C" int clock_gettime(clockid_t clock, timespec *now) noexcept {
    int result = real().clock_gettime(clock, now);
    if (result == 0 && is_moved(clock)) {
        ++clock_reads;
        *now = as_timespec(nanoseconds(*now) + offset_ns.load());
    }
    return result;
}

extern "C" int pthread_cond_clockwait(pthread_cond_t *cond, pthread_mutex_t *mutex, clockid_t clock,
                                      const timespec *deadline) {
    if (!is_moved(clock) || stop_sent.load()) {
        return wait_for_real(cond, mutex, clock, deadline);
    }
    int64_t ahead = nanoseconds(*deadline) - (real_now(clock) + offset_ns.load());
    if (ahead > 0) {
        offset_ns += ahead;
        seconds_flown += (ahead + NS_PER_SECOND / 2) / NS_PER_SECOND;
    }
    if (!after_sleep(++sleeps)) {
        return ETIMEDOUT;
    }
    // The last sleep of the pass before the last: tarnmon reads the signal on its main thread,
    // asks the monitor to end after its next pass and wakes this wait.
    stop_sent = true;
    kill(getpid(), SIGTERM);
    ++real_waits;
    timespec until = as_timespec(real_now(CLOCK_MONOTONIC) + STOP_WAIT_SECONDS * NS_PER_SECOND);
    return real().clockwait(cond, mutex, CLOCK_MONOTONIC, &until);
}

extern "C" int sysinfo(struct sysinfo *info) noexcept {
    int result = real().sysinfo(info);
    if (result == 0 && loaded) {
        ++uptime_reads;
        info->uptime = uptime_at_load + seconds_flown.load();
    }
    return result;
}

extern "C" clock_t times(struct tms *buffer) noexcept {
    clock_t ticks = real().times(buffer);
    if (ticks == static_cast<clock_t>(-1) || !loaded) {
        return ticks;
    }
    ticks += static_cast<clock_t>(offset_ns.load() / (NS_PER_SECOND / tick_rate));
    long reads = ++tick_reads;
    if (stop_sent.load()) {
        ++tick_reads_after_stop;
    }
    if (reads > 2 && ticks - last_ticks.load() < tick_rate / 2) {
        ++short_tick_gaps;
    }
    last_ticks = ticks;
    return ticks;
}

extern "C" int pthread_join(pthread_t thread, void **result) {
    int joined = real().join(thread, result);
    if (joined == 0 && loaded && ++joins == 1) {
        record_figures("ended", passes_wanted);
        copy_smaps("smaps-ended");
        write_counts();
    }
    return joined;
}

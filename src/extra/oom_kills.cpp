#include "oom_kills.h"

#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

namespace {

constexpr size_t VMSTAT_SIZE = 32768; // /proc/vmstat is some 180 lines of less than 40 bytes
constexpr size_t TEXT_SIZE = 2048;    // the counter, 16 victims and one more line

struct oom_memory {
    bool known; // count is the previous pass's
    uint64_t count;
    uint64_t last_named; // the newest kernel log record already named
    bool absence_said;   // the counter was absent and that was said
};

oom_memory memory;
char returned[TEXT_SIZE];

// The newest kills of the kernel log that were not named before, at most `wanted`, oldest first.
struct victims {
    kernel_kill kills[OOM_VICTIMS_MAX];
    size_t wanted;
    size_t count; // kills kept, at most wanted
    size_t next;  // where the next one goes once the ring is full
    bool bounded; // the log held more than a pass reads
    void keep(const kernel_kill &kill) {
        if (count < wanted) {
            kills[count++] = kill;
        } else {
            kills[next] = kill;
            next = (next + 1) % wanted;
        }
    }
    const kernel_kill &oldest_first(size_t i) const { return kills[(next + i) % count]; }
};

void keep_if_new(victims &found, std::string_view record) {
    kernel_kill kill;
    if (parse_kmsg_kill(record, &kill) && kill.sequence > memory.last_named) {
        found.keep(kill);
    }
}

// Reads the kernel log without waiting. /dev/kmsg hands over one record a read; a file standing in
// for it hands over many, and a record may straddle two reads, so lines are cut here either way.
// Returns the errno of open, or 0.
int read_kernel_log(victims &found) {
    int fd = ::open(extra_kmsg_path, O_RDONLY | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    static char buffer[KMSG_RECORD_SIZE];
    size_t kept = 0;       // the start of a record that the last read cut
    bool skipping = false; // inside a record longer than the buffer: passed over
    int reads = 0;
    for (; reads < KMSG_READS_MAX; ++reads) {
        ssize_t got = ::read(fd, buffer + kept, sizeof buffer - kept);
        if (got < 0 && (errno == EINTR || errno == EPIPE)) {
            continue; // EPIPE: records overwritten before they were read; the next one follows
        }
        if (got <= 0) {
            break;
        }
        std::string_view text(buffer, kept + static_cast<size_t>(got));
        for (size_t end = text.find('\n'); end != std::string_view::npos; end = text.find('\n')) {
            if (!skipping) {
                keep_if_new(found, text.substr(0, end));
            }
            skipping = false;
            text.remove_prefix(end + 1);
        }
        kept = text.size();
        if (kept == sizeof buffer) {
            kept = 0;
            skipping = true;
        }
        std::memmove(buffer, text.data(), kept);
    }
    found.bounded = reads == KMSG_READS_MAX;
    ::close(fd);
    return 0;
}

void name_victims(routine_text &text, uint64_t rise) {
    victims found{};
    found.wanted = rise < OOM_VICTIMS_MAX ? static_cast<size_t>(rise) : OOM_VICTIMS_MAX;
    int error = read_kernel_log(found);
    if (error == EPERM || error == EACCES) {
        text.line("oom kills: the kernel log is not readable without privilege; victims not named");
        return;
    }
    if (error != 0) {
        text.line("oom kills: the kernel log cannot be read (%s); victims not named",
                  std::strerror(error));
        return;
    }
    for (size_t i = 0; i < found.count; ++i) {
        const kernel_kill &kill = found.oldest_first(i);
        text.line("oom kills: victim pid %" PRIu64 " (%s)", kill.pid, kill.name);
        memory.last_named = kill.sequence > memory.last_named ? kill.sequence : memory.last_named;
    }
    if (found.count == 0) {
        text.line("oom kills: the kernel log names no victim of this rise");
    }
    if (found.bounded) {
        text.line("oom kills: the kernel log was read up to %d records; newer victims may be "
                  "missing",
                  KMSG_READS_MAX);
    }
}

} // namespace

oom_counter parse_vmstat_oom_kill(std::string_view text, uint64_t *count) {
    while (!text.empty()) {
        std::string_view line = take_line(text);
        if (!line.starts_with("oom_kill ")) {
            continue;
        }
        line.remove_prefix(9);
        skip_blanks(line);
        bool whole = take_number(line, count);
        skip_blanks(line);
        return whole && line.empty() ? oom_counter::found : oom_counter::malformed;
    }
    return oom_counter::absent;
}

bool parse_kmsg_kill(std::string_view record, kernel_kill *kill) {
    // The prefix "priority,sequence,microseconds,flags[,...];" then the message.
    size_t message = record.find(';');
    if (message == std::string_view::npos) {
        return false;
    }
    std::string_view prefix = record.substr(0, message);
    size_t comma = prefix.find(',');
    if (comma == std::string_view::npos) {
        return false;
    }
    prefix.remove_prefix(comma + 1);
    if (!take_number(prefix, &kill->sequence) || !prefix.starts_with(',')) {
        return false;
    }
    // "Out of memory: Killed process 4242 (stress) ...", "Memory cgroup out of memory: Killed
    // process ...", and before 5.x kernels wrote "Killed process" on a line of its own too.
    constexpr std::string_view KILLED = "Killed process ";
    std::string_view text = record.substr(message + 1);
    size_t at = text.find(KILLED);
    if (at == std::string_view::npos) {
        return false;
    }
    text.remove_prefix(at + KILLED.size());
    if (!take_number(text, &kill->pid) || !text.starts_with(" (")) {
        return false;
    }
    text.remove_prefix(2);
    // A name may hold ") ": the name ends at the last ')' before " total-vm", or at the last one.
    size_t end = text.find(") total-vm");
    end = end == std::string_view::npos ? text.rfind(')') : end;
    if (end == std::string_view::npos) {
        return false;
    }
    printable_copy(kill->name, sizeof kill->name, text.substr(0, end));
    return true;
}

EXTRA_EXPORT void telvzextra_oom_kills(const char *, char **returnedData) {
    routine_text text(returned, sizeof returned);
    static char vmstat[VMSTAT_SIZE];
    file_text file = read_proc_file("vmstat", vmstat, sizeof vmstat);
    uint64_t count = 0;
    oom_counter counter =
        file.present ? parse_vmstat_oom_kill(file.text, &count) : oom_counter::absent;
    if (counter == oom_counter::absent) {
        if (!memory.absence_said) {
            text.line("oom kills: not counted (no oom_kill line in /proc/vmstat)");
        }
        memory.known = false;
        memory.absence_said = true;
    } else if (counter == oom_counter::malformed) {
        text.line("oom kills: the oom_kill line of /proc/vmstat is not a count");
        memory.known = false;
    } else if (!memory.known) {
        text.line("oom kills: %" PRIu64 " since boot (first reading)", count);
    } else if (count < memory.count) {
        text.line("oom kills: %" PRIu64 " since boot (counter went back)", count);
    } else {
        text.line("oom kills: %" PRIu64 " since boot (+%" PRIu64 ")", count, count - memory.count);
        if (count > memory.count) {
            name_victims(text, count - memory.count);
        }
    }
    if (counter == oom_counter::found) {
        memory.known = true;
        memory.count = count;
        memory.absence_said = false;
    }
    hand_back(text, returnedData);
}

void reset_oom_kills_state() {
    memory = {};
}

#include "trace_file.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <set>
#include <string>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include "environment.h"
#include "io.h"
#include "stamp.h"

namespace telv::trace {
namespace {

// The open trace file. One lock keeps the lines of the threads apart; flock on the file keeps the
// processes that share it apart, O_APPEND puts every line at its end.
struct Sink {
    std::mutex lock;
    std::string path;
    int fd = -1;
    pid_t owner = 0; // a forked child opens its own: flock is shared with the opener's description
    // Paths already said in the trace to be past their bound and not rotated: once a process is
    // enough (a forked child inherits what its parent has said).
    std::set<std::string> said_unrotated;
};

// Never destroyed: the leak report written while the process exits still traces.
Sink &sink() {
    static Sink *const s = new Sink;
    return *s;
}

void close_sink(Sink &s) {
    if (s.fd >= 0) {
        ::close(s.fd);
    }
    s.fd = -1;
}

bool same_file(const struct stat &a, const struct stat &b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// Opens `path` for appending in place of the sink's file. The former file stays open until the new
// one is, so that no new file can take over its inode number and the two can be told apart: when
// `must_change` (the former was just renamed away), a path that opens the former file again is
// refused, since then nothing has moved on and another round would find the same again.
bool open_sink(Sink &s, const std::string &path, bool must_change) {
    int fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    struct stat opened;
    struct stat former;
    bool same = fd >= 0 && must_change && s.fd >= 0 && ::fstat(fd, &opened) == 0 &&
                ::fstat(s.fd, &former) == 0 && same_file(opened, former);
    close_sink(s);
    s.path = path;
    s.owner = ::getpid();
    if (fd >= 0 && same) {
        ::close(fd);
        fd = -1;
    }
    s.fd = fd;
    return fd >= 0;
}

// flock for the scope of a round; a signal while waiting is no reason to give up.
class FileLock {
  public:
    explicit FileLock(int fd) : fd_(fd) {
        int result;
        while ((result = ::flock(fd_, LOCK_EX)) != 0 && errno == EINTR) {
        }
        held_ = result == 0;
    }
    ~FileLock() {
        if (held_) {
            ::flock(fd_, LOCK_UN);
        }
    }
    FileLock(const FileLock &) = delete;
    FileLock &operator=(const FileLock &) = delete;
    bool held() const { return held_; }

  private:
    int fd_;
    bool held_;
};

// How the path leads to the open file, looked at under the file's lock.
enum class Reach {
    directly,  // the path is the regular file's own name: the file is rotated when full
    unrotated, // the path leads to the file some other way, through a symbolic link (renaming
               // would move the link, not the trace) or as a device or FIFO: never rotated
    elsewhere, // the path names another file now: this one was renamed away, or removed
};

Reach reach(const std::string &path, const struct stat &open_file) {
    // Only a regular file is ever rotated, so only one can have been renamed away. A device node
    // may open another device than itself (/dev/tty opens the terminal), so it is not compared.
    if (!S_ISREG(open_file.st_mode)) {
        return Reach::unrotated;
    }
    struct stat named;
    if (::lstat(path.c_str(), &named) == 0 && S_ISREG(named.st_mode)) {
        return same_file(named, open_file) ? Reach::directly : Reach::elsewhere;
    }
    return ::stat(path.c_str(), &named) == 0 && same_file(named, open_file) ? Reach::unrotated
                                                                            : Reach::elsewhere;
}

struct Target {
    std::string path;
    bool in_data_directory; // the data directory is made before the file is opened
    uint64_t max_bytes;
    bool detail;
};

// Read anew for every line, so that a change of the environment takes effect at once; the data
// directory is made only when the file is opened, not for every line.
Target current_target() {
    Target target;
    target.path =
        environment::path_of_file(FILE_VARIABLE, DEFAULT_FILE_NAME, &target.in_data_directory);
    target.max_bytes = environment::number(MAX_BYTES_VARIABLE, DEFAULT_MAX_BYTES);
    target.detail = environment::text(DETAIL_VARIABLE, "1") != "0";
    return target;
}

// What became of a line in one round under the file's lock.
enum class Round {
    written,
    written_past_bound, // into a full file that is not rotated
    rotated,            // not yet written: the file was renamed (here or elsewhere) or removed
    failed,
};

Round append_once(const Sink &s, const Target &target, const char *line, size_t length) {
    FileLock locked(s.fd);
    struct stat open_file;
    if (!locked.held() || ::fstat(s.fd, &open_file) != 0) {
        return Round::failed;
    }
    Reach how = reach(s.path, open_file);
    if (how == Reach::elsewhere) {
        return Round::rotated;
    }
    auto size = static_cast<uint64_t>(open_file.st_size);
    bool full = size > 0 && size + length > target.max_bytes;
    if (full && how == Reach::directly) {
        return ::rename(s.path.c_str(), (s.path + ".1").c_str()) == 0 ? Round::rotated
                                                                      : Round::failed;
    }
    if (io::write_all(s.fd, line, length) != 0) {
        return Round::failed;
    }
    return full ? Round::written_past_bound : Round::written;
}

// Appends one composed line, first moving a file that it would take past the bound to
// "<name>.1". Another process rotating the file under us loses no line: the path is opened again
// and the line goes to the new file. Each such round follows a rename, here or elsewhere, so the
// loop moves on; a rename that moves nothing (the path opens the same file again) fails, and so
// does every failing open, lock or write.
Round append(Sink &s, const Target &target, pid_t pid, const char *line, size_t length) {
    Round round = Round::rotated;
    for (bool renamed = false; round == Round::rotated; renamed = true) {
        bool stale = s.fd < 0 || s.path != target.path || s.owner != pid;
        if (stale || renamed) {
            if (target.in_data_directory) {
                environment::data_directory();
            }
            if (!open_sink(s, target.path, renamed)) {
                return Round::failed;
            }
        }
        round = append_once(s, target, line, length);
    }
    return round;
}

// What snprintf left in `buffer` (`size` bytes): the text as far as it fits, nothing on failure.
std::string_view printed(const char *buffer, size_t size, int length) {
    return std::string_view(buffer,
                            length < 0 ? 0 : std::min(static_cast<size_t>(length), size - 1));
}

// Stamps, composes and appends one line; the caller holds the sink's lock.
bool emit(Sink &s, const Target &target, std::string_view text) {
    pid_t pid = ::getpid();
    char stamp[128];
    int stamp_length = std::snprintf(stamp, sizeof stamp, "%s %ld %ld ", stamp::utc_now().text,
                                     static_cast<long>(pid), stamp::thread_id(pid));
    char line[MAX_LINE];
    size_t room = static_cast<size_t>(std::min<uint64_t>(sizeof line, target.max_bytes));
    size_t length = compose(line, room, printed(stamp, sizeof stamp, stamp_length), text);
    Round round = append(s, target, pid, line, length);
    // A reader who finds the file past its bound learns why, once. The note is a line past the
    // bound too, but by then the path has been said.
    if (round == Round::written_past_bound && s.said_unrotated.insert(target.path).second) {
        char note[MAX_LINE];
        int note_length =
            std::snprintf(note, sizeof note,
                          "TELVTRCF: trace file %s is not a regular file: it is not rotated and "
                          "grows past its bound of %llu bytes",
                          target.path.c_str(), static_cast<unsigned long long>(target.max_bytes));
        emit(s, target, printed(note, sizeof note, note_length));
    }
    return round == Round::written || round == Round::written_past_bound;
}

} // namespace

bool is_detail(std::string_view text) {
    return text.size() >= 9 && text[7] == 'D' && text[8] == ':';
}

size_t compose(char *out, size_t room, std::string_view stamp, std::string_view text) {
    while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
        text.remove_suffix(1);
    }
    const size_t limit = room - 1; // the line feed always fits
    size_t used = 0;
    for (char c : stamp) {
        if (used == limit) {
            break;
        }
        out[used++] = c;
    }
    for (char c : text) {
        const char *escape = c == '\n' ? "\\n" : c == '\r' ? "\\r" : nullptr;
        size_t width = escape != nullptr ? 2 : 1;
        if (used + width > limit) {
            break;
        }
        if (escape != nullptr) {
            out[used++] = escape[0];
            out[used++] = escape[1];
        } else {
            out[used++] = c;
        }
    }
    out[used++] = '\n';
    return used;
}

size_t dump_row(char *out, size_t room, uint32_t offset, const unsigned char *bytes, size_t count) {
    static constexpr char HEX[] = "0123456789ABCDEF";
    char row[128];
    size_t used = static_cast<size_t>(std::snprintf(row, sizeof row, "%08X  ", offset));
    count = std::min(count, DUMP_BYTES_PER_ROW);
    for (size_t i = 0; i < DUMP_BYTES_PER_ROW; ++i) {
        if (i == DUMP_BYTES_PER_ROW / 2) {
            row[used++] = ' ';
        }
        row[used++] = i < count ? HEX[bytes[i] >> 4] : ' ';
        row[used++] = i < count ? HEX[bytes[i] & 0xF] : ' ';
        row[used++] = ' ';
    }
    row[used++] = ' ';
    row[used++] = '|';
    for (size_t i = 0; i < count; ++i) {
        row[used++] = bytes[i] >= 0x20 && bytes[i] < 0x7F ? static_cast<char>(bytes[i]) : '.';
    }
    row[used++] = '|';
    used = std::min(used, room);
    std::memcpy(out, row, used);
    return used;
}

int vline(const char *format, va_list args) {
    if (format == nullptr) {
        return -1;
    }
    char text[MAX_LINE];
    int length = std::vsnprintf(text, sizeof text, format, args);
    if (length < 0) {
        return -1;
    }
    std::string_view kept(text, std::min(static_cast<size_t>(length), sizeof text - 1));
    Target target = current_target();
    if (!target.detail && is_detail(kept)) {
        return length;
    }
    Sink &s = sink();
    std::lock_guard guard(s.lock);
    return emit(s, target, kept) ? length : -1;
}

int line(const char *format, ...) {
    va_list args;
    va_start(args, format);
    int length = vline(format, args);
    va_end(args);
    return length;
}

int dump(const char *title, const void *data, uint32_t length) {
    std::string_view heading = title != nullptr ? title : "";
    Target target = current_target();
    if (!target.detail && is_detail(heading)) {
        return 0;
    }
    Sink &s = sink();
    std::lock_guard guard(s.lock);
    bool written = emit(s, target, heading);
    const auto *bytes = static_cast<const unsigned char *>(data);
    // 64 bits: the offset of the row after the last one may pass 32 bits.
    for (uint64_t offset = 0; written && bytes != nullptr && offset < length;
         offset += DUMP_BYTES_PER_ROW) {
        char row[128];
        size_t count = std::min<uint64_t>(DUMP_BYTES_PER_ROW, length - offset);
        size_t row_length =
            dump_row(row, sizeof row, static_cast<uint32_t>(offset), bytes + offset, count);
        written = emit(s, target, std::string_view(row, row_length));
    }
    return written && (bytes != nullptr || length == 0) ? 0 : -1;
}

} // namespace telv::trace

#include "trace_file.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <mutex>
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
    dev_t device = 0;
    ino_t inode = 0;
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

bool open_sink(Sink &s, const std::string &path) {
    close_sink(s);
    s.path = path;
    s.fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    s.owner = ::getpid();
    struct stat st;
    if (s.fd >= 0 && ::fstat(s.fd, &st) == 0) {
        s.device = st.st_dev;
        s.inode = st.st_ino;
        return true;
    }
    close_sink(s);
    return false;
}

// Another process may have renamed the file since it was opened here.
bool still_named(const Sink &s) {
    struct stat st;
    return ::stat(s.path.c_str(), &st) == 0 && st.st_dev == s.device && st.st_ino == s.inode;
}

struct Target {
    std::string path;
    uint64_t max_bytes;
    bool detail;
};

Target current_target() {
    return Target{environment::file_in_data_directory(FILE_VARIABLE, DEFAULT_FILE_NAME),
                  environment::number(MAX_BYTES_VARIABLE, DEFAULT_MAX_BYTES),
                  environment::text(DETAIL_VARIABLE, "1") != "0"};
}

// Appends one composed line, first moving a file that it would take past the bound to
// "<name>.1". A few rounds are allowed because another process may rotate in between.
bool append(Sink &s, const Target &target, const char *line, size_t length) {
    constexpr int ROUNDS = 4;
    bool written = false;
    bool failed = false;
    for (int round = 0; round < ROUNDS && !written && !failed; ++round) {
        bool reopen = s.fd < 0 || s.path != target.path || s.owner != ::getpid();
        if (reopen && !open_sink(s, target.path)) {
            failed = true;
            continue;
        }
        ::flock(s.fd, LOCK_EX);
        struct stat st;
        if (!still_named(s) || ::fstat(s.fd, &st) != 0) {
            ::flock(s.fd, LOCK_UN);
            close_sink(s);
            continue;
        }
        auto size = static_cast<uint64_t>(st.st_size);
        if (size > 0 && size + length > target.max_bytes) {
            failed = ::rename(s.path.c_str(), (s.path + ".1").c_str()) != 0;
            ::flock(s.fd, LOCK_UN);
            close_sink(s);
            continue;
        }
        written = io::write_all(s.fd, line, length) == 0;
        failed = !written;
        ::flock(s.fd, LOCK_UN);
    }
    return written;
}

// Stamps, composes and appends one line; the caller holds the sink's lock.
bool emit(Sink &s, const Target &target, std::string_view text) {
    char stamp[128];
    int stamp_length = std::snprintf(stamp, sizeof stamp, "%s %ld %ld ", stamp::utc_now().text,
                                     static_cast<long>(::getpid()), stamp::thread_id());
    char line[MAX_LINE];
    size_t room = static_cast<size_t>(std::min<uint64_t>(sizeof line, target.max_bytes));
    size_t length =
        compose(line, room,
                std::string_view(stamp, std::clamp<size_t>(static_cast<size_t>(stamp_length), 0,
                                                           sizeof stamp - 1)),
                text);
    return append(s, target, line, length);
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

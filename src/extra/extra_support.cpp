#include "extra_support.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <unistd.h>

namespace {

int64_t monotonic_milliseconds() {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

bool is_blank(char c) {
    return c == ' ' || c == '\t';
}

} // namespace

const char *extra_proc_root = "/proc";
const char *extra_kmsg_path = "/dev/kmsg";
statvfs_source extra_statvfs = ::statvfs;
milliseconds_source extra_clock = monotonic_milliseconds;

void reset_extra_seams() {
    extra_proc_root = "/proc";
    extra_kmsg_path = "/dev/kmsg";
    extra_statvfs = ::statvfs;
    extra_clock = monotonic_milliseconds;
}

bool proc_path(char *path, size_t size, const char *relative) {
    int length = std::snprintf(path, size, "%s/%s", extra_proc_root, relative);
    if (length < 0 || static_cast<size_t>(length) >= size) {
        path[0] = '\0';
        return false;
    }
    return true;
}

file_text read_proc_file(const char *relative, char *buffer, size_t size) {
    file_text file{{}, false, false, 0};
    buffer[0] = '\0';
    char path[EXTRA_PATH_SIZE];
    if (!proc_path(path, sizeof path, relative)) {
        file.error = ENAMETOOLONG;
        return file;
    }
    int fd = ::open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        file.error = errno;
        return file;
    }
    size_t length = 0;
    // /proc files hand their text over in pieces: read until the end or the buffer is full.
    while (length < size - 1) {
        ssize_t got = ::read(fd, buffer + length, size - 1 - length);
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got < 0) {
            file.error = errno;
            break;
        }
        if (got == 0) {
            break;
        }
        length += static_cast<size_t>(got);
    }
    if (file.error == 0 && length == size - 1) {
        char more;
        file.cut = ::read(fd, &more, 1) == 1;
    }
    ::close(fd);
    buffer[length] = '\0';
    file.present = file.error == 0;
    file.text = std::string_view(buffer, file.present ? length : 0);
    return file;
}

routine_text::routine_text(char *buffer, size_t size) : buffer_(buffer), size_(size) {
    buffer_[0] = '\0';
}

void routine_text::line(const char *format, ...) {
    if (truncated_) {
        return;
    }
    char line[LINE_SIZE];
    va_list arguments;
    va_start(arguments, format);
    int written = std::vsnprintf(line, LINE_SIZE - 2, format, arguments);
    va_end(arguments);
    size_t length = written < 0 ? 0 : std::min(static_cast<size_t>(written), LINE_SIZE - 3);
    line[length++] = '\n';
    line[length++] = '\r';
    // Room is always kept for the truncation line after the last line that fits.
    if (length_ + length + TRUNCATED_LINE.size() < size_) {
        std::memcpy(buffer_ + length_, line, length);
        length_ += length;
    } else {
        // Only a buffer too small for the truncation line itself leaves it out.
        if (length_ + TRUNCATED_LINE.size() < size_) {
            std::memcpy(buffer_ + length_, TRUNCATED_LINE.data(), TRUNCATED_LINE.size());
            length_ += TRUNCATED_LINE.size();
        }
        truncated_ = true;
    }
    buffer_[length_] = '\0';
}

void hand_back(const routine_text &text, char **returnedData) {
    if (!text.empty()) {
        *returnedData = const_cast<char *>(text.text());
    }
}

int64_t keyword_number(const char *fileData, std::string_view keyword, int64_t fallback,
                       int64_t low, int64_t high) {
    int64_t value = fallback;
    if (fileData == nullptr) {
        return value;
    }
    std::string_view text = fileData;
    while (!text.empty()) {
        std::string_view line = take_line(text);
        if (line.starts_with('*')) {
            continue;
        }
        skip_blanks(line);
        if (!line.starts_with(keyword)) {
            continue;
        }
        line.remove_prefix(keyword.size());
        if (line.empty() || !is_blank(line.front())) {
            continue;
        }
        skip_blanks(line);
        uint64_t number = 0;
        if (take_number(line, &number) &&
            (line.empty() || is_blank(line.front()) || line.front() == '\r') &&
            number >= static_cast<uint64_t>(low) && number <= static_cast<uint64_t>(high)) {
            value = static_cast<int64_t>(number);
        }
    }
    return value;
}

bool take_number(std::string_view &text, uint64_t *value) {
    if (text.empty() || text.front() < '0' || text.front() > '9') {
        return false;
    }
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), *value);
    if (error != std::errc()) {
        return false;
    }
    text.remove_prefix(static_cast<size_t>(end - text.data()));
    return true;
}

void skip_blanks(std::string_view &text) {
    while (!text.empty() && is_blank(text.front())) {
        text.remove_prefix(1);
    }
}

std::string_view take_line(std::string_view &text) {
    size_t end = text.find('\n');
    std::string_view line = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    return line;
}

void printable_copy(char *to, size_t size, std::string_view from) {
    size_t length = std::min(from.size(), size - 1);
    for (size_t i = 0; i < length; ++i) {
        char c = from[i];
        to[i] = c >= ' ' && c < 0x7f ? c : '?';
    }
    to[length] = '\0';
}

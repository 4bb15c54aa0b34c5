#include "pointer_check.h"

#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <string>
#include <unistd.h>

namespace telv::pointer_check {
namespace {

constexpr const char *MAPS = "/proc/self/maps";

// The whole map in one string; empty when it cannot be read.
std::string read_maps() {
    std::string text;
    int fd = ::open(MAPS, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return text;
    }
    char chunk[16384];
    for (;;) {
        ssize_t n = ::read(fd, chunk, sizeof chunk);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            break;
        }
        text.append(chunk, static_cast<size_t>(n));
    }
    ::close(fd);
    return text;
}

struct Mapping {
    uintptr_t start = 0;
    uintptr_t end = 0;
    bool read_write = false;
};

// "55d0c8a4e000-55d0c8a50000 rw-p 00000000 00:00 0   [heap]": the two addresses and the first
// two permission letters are all that count.
bool parse_mapping(std::string_view line, Mapping *out) {
    const char *first = line.data();
    const char *last = line.data() + line.size();
    auto start = std::from_chars(first, last, out->start, 16);
    if (start.ec != std::errc() || start.ptr == last || *start.ptr != '-') {
        return false;
    }
    auto end = std::from_chars(start.ptr + 1, last, out->end, 16);
    if (end.ec != std::errc() || last - end.ptr < 3 || end.ptr[0] != ' ') {
        return false;
    }
    out->read_write = end.ptr[1] == 'r' && end.ptr[2] == 'w';
    return out->start < out->end;
}

} // namespace

bool readable_and_writable(std::string_view maps, uintptr_t start, uintptr_t end) {
    // `covered` is the first address not yet shown to be accessible; mappings come in address
    // order, so the range passes once a chain of adjacent read-write mappings reaches its end.
    uintptr_t covered = start;
    bool broken = false;
    while (!maps.empty() && covered < end && !broken) {
        size_t line_end = maps.find('\n');
        std::string_view line = maps.substr(0, line_end);
        maps.remove_prefix(line_end == std::string_view::npos ? maps.size() : line_end + 1);
        Mapping mapping;
        if (!parse_mapping(line, &mapping) || mapping.end <= covered) {
            continue;
        }
        broken = mapping.start > covered || !mapping.read_write;
        covered = broken ? covered : mapping.end;
    }
    return !broken && covered >= end;
}

uint32_t check(const void *ptr, uint32_t length) {
    auto start = reinterpret_cast<uintptr_t>(ptr);
    uintptr_t size = length == 0 ? 1 : length;
    if (ptr == nullptr || start > UINTPTR_MAX - size) {
        return REFUSED;
    }
    return readable_and_writable(read_maps(), start, start + size) ? 0 : REFUSED;
}

} // namespace telv::pointer_check

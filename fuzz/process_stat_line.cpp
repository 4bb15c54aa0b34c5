// The parser of /proc/<pid>/stat lines, fed arbitrary bytes: it must convert within the name's
// hundred characters whatever the line holds, and give exactly what the C library's scan of the
// line's format gives: the same count of conversions, the same name bytes, the same counters and
// the same priority and nice, with the fields it does not convert left as they were.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>

#include "cpu/process_listing.h"

namespace {

// The reference: the scan the accounting made of every stat line before it had a parser of its
// own. The trailing fields it skips change none of its results.
int parse_process_stat_line_by_scan(const char *text, char *process_name, uint32_t *utime,
                                    uint32_t *stime, int32_t *priority, int32_t *nice) {
    int converted = std::sscanf(
        text,
        "%*d %98s %*c %*d %*d %*d %*d %*d %*d %*d %*d %*d %*d %u %u %*d %*d %d %d %*d %*d %*d %*d "
        "%*d %*d %*d %*d %*d %*d %*d %*d %*d %*d %*d %*d %*d %*d %*d %*d",
        process_name, utime, stime, priority, nice);
    return converted < 0 ? 0 : converted;
}

// Everything one parse leaves, from the same non-zero start for both parsers, so that a field
// one of them converts and the other leaves alone shows as a difference.
struct parse_result {
    char name[PROCESS_NAME_LENGTH];
    uint32_t utime = 0xdeadbeefu;
    uint32_t stime = 0xfeedfaceu;
    int32_t priority = 0x13572468;
    int32_t nice = -0x2468ace;
    int converted = -7;

    parse_result() { std::memset(name, 'N', sizeof name); }
};

void require(bool holds) {
    if (!holds) {
        __builtin_trap();
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    // The line as read into the accounting's buffer: up to its first NUL.
    std::string text(reinterpret_cast<const char *>(data), size);
    parse_result parsed;
    parse_result scanned;
    parsed.converted = parse_process_stat_line(text.c_str(), parsed.name, &parsed.utime,
                                               &parsed.stime, &parsed.priority, &parsed.nice);
    scanned.converted =
        parse_process_stat_line_by_scan(text.c_str(), scanned.name, &scanned.utime, &scanned.stime,
                                        &scanned.priority, &scanned.nice);

    require(parsed.converted >= 0 && parsed.converted <= 5);
    require(parsed.converted == scanned.converted);
    require(std::memcmp(parsed.name, scanned.name, sizeof parsed.name) == 0);
    if (parsed.converted >= 1) {
        require(std::strlen(parsed.name) <= 98);
    }
    require(parsed.utime == scanned.utime);
    require(parsed.stime == scanned.stime);
    require(parsed.priority == scanned.priority);
    require(parsed.nice == scanned.nice);
    return 0;
}

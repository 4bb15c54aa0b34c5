// The parser of /proc/<pid>/stat lines, fed arbitrary bytes: it must convert within the name's
// hundred characters whatever the line holds.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>

#include "cpu/process_listing.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string text(reinterpret_cast<const char *>(data), size);
    char name[PROCESS_NAME_LENGTH];
    std::memset(name, 0, sizeof name);
    uint32_t utime = 0;
    uint32_t stime = 0;
    int32_t priority = 0;
    int32_t nice = 0;
    int converted = parse_process_stat_line(text.c_str(), name, &utime, &stime, &priority, &nice);
    if (converted < 0 || converted > 5 || std::strlen(name) > 98) {
        __builtin_trap();
    }
    return 0;
}

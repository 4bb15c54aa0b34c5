// The parsers of /proc/vmstat and of the kernel log's records, fed any bytes: the first as the
// whole of /proc/vmstat, the second line by line as records. A victim's name is always terminated,
// printable and within its field, and a count is what the line says.
#include <cstddef>
#include <cstdint>
#include <cstdio>

#include "oom_kills.h"
#include "support/extra_fuzz.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string_view input(reinterpret_cast<const char *>(data), size);
    uint64_t count = 0;
    oom_counter counter = parse_vmstat_oom_kill(input, &count);
    extra_fuzz::require(counter == oom_counter::absent ||
                        input.find("oom_kill ") != std::string_view::npos);
    extra_fuzz::for_each_line(input, [](std::string_view record) {
        kernel_kill kill;
        std::memset(&kill, 0x5a, sizeof kill);
        if (!parse_kmsg_kill(record, &kill)) {
            return;
        }
        size_t length = strnlen(kill.name, sizeof kill.name);
        extra_fuzz::require(length < sizeof kill.name);
        for (size_t i = 0; i < length; ++i) {
            extra_fuzz::require(kill.name[i] >= ' ' && kill.name[i] < 0x7f);
        }
        extra_fuzz::guarded_text<120> returned;
        returned.text.line("oom kills: victim pid %llu (%s)",
                           static_cast<unsigned long long>(kill.pid), kill.name);
        returned.check();
    });
    return 0;
}

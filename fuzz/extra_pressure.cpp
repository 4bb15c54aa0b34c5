// The parser of a /proc/pressure file and the line of a resource, fed any bytes as the file: the
// text of the routine stays whole lines within its buffer, however the file and the totals of the
// previous pass are.
#include <cstddef>
#include <cstdint>

#include "pressure.h"
#include "support/extra_fuzz.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string_view input(reinterpret_cast<const char *>(data), size);
    pressure_file file;
    if (!parse_pressure(input, &file)) {
        return 0;
    }
    extra_fuzz::require(file.some.present);
    for (const pressure_figures *figures : {&file.some, &file.full}) {
        extra_fuzz::require(figures->avg10 <= 10000 && figures->avg60 <= 10000 &&
                            figures->avg300 <= 10000);
    }
    // Two passes: the first reading, then the change from it (or a counter that went back).
    extra_fuzz::guarded_text<600> returned;
    pressure_memory memory{};
    pressure_line(returned.text, "memory", file, memory);
    file.some.total ^= size;
    pressure_line(returned.text, "memory", file, memory);
    returned.check();
    extra_fuzz::require(memory.some_known && memory.some_total == file.some.total);
    return 0;
}

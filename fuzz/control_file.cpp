// The control file parser, fed any text of up to 100,000 bytes as monitoring hands it over: it must
// set the settings and build its tables without reading or writing outside them, and whatever it
// allocated must come back when the tables are released.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>
#include <vector>

#include "core/control_file.h"
#include "core/settings.h"
#include "core/validation.h"

namespace {

void release_everything() {
    free_compiled_expressions();
    uint32_t crc = 0;
    release_control_file_tables(&crc);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size > CONTROL_FILE_MAX) {
        return -1;
    }
    // A counted repetition ("a\{1,32767\}") makes the C library's expression compiler take
    // gigabytes and seconds; that is the compiler's own cost, not the parser's, and would only
    // stop the run as out of memory. The parser's handling of every other byte is fuzzed.
    if (std::string_view(reinterpret_cast<const char *>(data), size).find("\\{") !=
        std::string_view::npos) {
        return -1;
    }
    // Exactly as long as the text and its NUL, so that any read past the end is caught.
    std::vector<char> text(size + 1, '\0');
    std::memcpy(text.data(), data, size);
    if (size == CONTROL_FILE_MAX) {
        text[CONTROL_FILE_MAX - 1] = '\0';
    }
    reset_settings();
    settings_start_values();
    uint32_t crc = 0;
    tarn_parse_control_file(text.data(), &crc);
    if (trend_analysis_points > TREND_SAMPLES_MAX ||
        (max_snapshot_file_size != 0 && max_snapshot_file_size < PRIMARY_DATA_BLOCK_SIZE) ||
        checking_interval < CHECKING_INTERVAL_MIN) {
        __builtin_trap();
    }
    validate_settings();
    release_everything();
    return 0;
}

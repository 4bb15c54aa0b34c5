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
#include "support/compiler_own_cost.h"

namespace {

// Rows of the two expression tables an input may ask for; beyond it the input is left out.
constexpr size_t TABLE_ROWS_MAX = 8;

void release_everything() {
    free_compiled_expressions();
    uint32_t crc = 0;
    release_control_file_tables(&crc);
}

bool is_blank(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

// The rows the parser gives the two expression tables for `text`: one for every line (ended by a
// line feed, not a comment) whose first word is a table keyword, where the first word of a blank
// line is that of the next line with a word, as the word split reads it.
size_t expression_table_rows(std::string_view text) {
    std::vector<size_t> word_from(text.size() + 1, text.size());
    for (size_t i = text.size(); i-- > 0;) {
        word_from[i] = is_blank(text[i]) ? word_from[i + 1] : i;
    }
    size_t rows = 0;
    for (size_t line = 0, end = text.find('\n'); end != std::string_view::npos;
         line = end + 1, end = text.find('\n', line)) {
        if (text[line] == '*') {
            continue;
        }
        std::string_view rest = text.substr(word_from[line]);
        for (std::string_view keyword : {"PROCESS_LOG_THRESHOLDS", "PROCESS_ABORT_THRESHOLDS"}) {
            if (rest.starts_with(keyword) &&
                (rest.size() == keyword.size() || is_blank(rest[keyword.size()]))) {
                ++rows;
            }
        }
    }
    return rows;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size > CONTROL_FILE_MAX) {
        return -1;
    }
    // Exactly as long as the text and its NUL, so that any read past the end is caught.
    std::vector<char> text(size + 1, '\0');
    std::memcpy(text.data(), data, size);
    if (size == CONTROL_FILE_MAX) {
        text[CONTROL_FILE_MAX - 1] = '\0';
    }
    std::string_view parsed(text.data(), std::strlen(text.data()));
    // Counted repetitions are fuzzed: the parser keeps those beyond its budget from the compiler,
    // and this target runs under a memory limit that no row within the budget reaches, with a few
    // rows at a time. Left out: what costs the compiler alike with or without a repetition, and
    // more rows than that (each row keeps its compiled expression, so a file of many rows, or a
    // row after a run of blank lines, which makes one row a line, costs what the rows add up to).
    size_t rows = expression_table_rows(parsed);
    if (rows > TABLE_ROWS_MAX || has_compiler_own_cost(parsed)) {
        return -1;
    }
    reset_settings();
    settings_start_values();
    uint32_t crc = 0;
    tarn_parse_control_file(text.data(), &crc);
    if (static_cast<size_t>(num_log_thresholds) + static_cast<size_t>(num_abort_thresholds) !=
            rows ||
        trend_analysis_points > TREND_SAMPLES_MAX ||
        (max_snapshot_file_size != 0 && max_snapshot_file_size < PRIMARY_DATA_BLOCK_SIZE) ||
        checking_interval < CHECKING_INTERVAL_MIN) {
        __builtin_trap();
    }
    validate_settings();
    release_everything();
    return 0;
}

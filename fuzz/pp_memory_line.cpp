// The line handler of the per-process memory check, fed any bytes as one line of the listing, up
// to its first NUL as the runner hands it over: whatever the line holds, it must judge it, record
// its process-table row and append it without writing outside a fixed buffer. The control block
// lives in plain memory here (no segment, no lock); the tables come from a control file parsed
// once.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "core/control_block.h"
#include "core/control_file.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "memory/pp_memory.h"

namespace {

// Defaults that a line can cross, and rows of both tables that names can reach: groups (more
// matches than one), anchors, a class, a row of zeros and a negative limit.
constexpr char CONTROL_TEXT[] = "RSS_MEMORY_THRESHOLD 1000\n"
                                "RSS_ABORT_MEMORY_THRESHOLD 5000\n"
                                "DSIZ_MEMORY_THRESHOLD 100\n"
                                "VSZ_MEMORY_THRESHOLD 100\n"
                                "PROCESS_LOG_THRESHOLDS 10 0 0 0 \\(a\\)\\(b\\)\n"
                                "PROCESS_LOG_THRESHOLDS 0 5 5 1 ^java$\n"
                                "PROCESS_LOG_THRESHOLDS -1 0 0 0 [0-9][0-9]*\n"
                                "PROCESS_ABORT_THRESHOLDS 20 0 0 \\(a\\)\\(b\\)\\(c*\\)\n"
                                "PROCESS_ABORT_THRESHOLDS 0 0 0 ^k\n";

tarn_control_block *block;

void set_up() {
    reset_settings();
    settings_start_values();
    uint32_t crc = 0;
    tarn_parse_control_file(CONTROL_TEXT, &crc);
    block = static_cast<tarn_control_block *>(std::calloc(1, sizeof(tarn_control_block)));
    // Entries for a few pids: one pid twice, one entry of zeros, one in the last slot.
    block->override_table[0] = {1, 100, 0, 0, 200, 0, 0, 1, 0};
    block->override_table[1] = {2, 0, 0, 0, 0, 0, 0, 1, 0};
    block->override_table[7] = {1, 5, 0, 0, 6, 0, 0, 1, 0};
    block->override_table[OVERRIDE_TABLE_ENTRIES - 1] = {12345, 1, 1, 1, 1, 1, 1, 1, 0};
    index_override_table(*block);
}

bool terminated(const char *field, size_t size) {
    return std::memchr(field, '\0', size) != nullptr;
}

void require(bool holds) {
    if (!holds) {
        __builtin_trap();
    }
}

// Judges `line` as the pass's next line, the process table's next row being `row`.
void judge(const char *line, uint32_t took_log, int32_t row) {
    int32_t take_log_crc = 0;
    int32_t take_log_value = 0;
    int32_t kill_pid = 0;
    block->tookLog = took_log;
    pp_memory_pass pass{&take_log_crc, &take_log_value, &kill_pid, &block->tookLog, block};
    pass.process_row = row;
    pp_memory_line(pass, line);

    require(pass.line_count == 1);
    require(pass.process_row == row || (pass.process_row == row + 1 && row < PROCESS_TABLE_ROWS));
    auto code = static_cast<uint32_t>(take_log_crc);
    require(code == 0 || code == TAKE_LOG_SUPPRESSED || code == RC_PROCESS_RSS ||
            code == RC_PROCESS_RSS_ABORT);
    require(kill_pid == 0 || code == RC_PROCESS_RSS_ABORT);
    require(terminated(topDataBlock, TOP_DATA_BLOCK_SIZE));
    for (int i = 0; i < PS_WORDS; ++i) {
        require(terminated(words[i], WORD_SIZE));
    }
    if (pass.process_row > row) {
        const process_row &written = block->process_table[row];
        require(written.in_use == 1 && written.always_one == 1);
        require(terminated(written.process_name, PROCESS_NAME_FIELD));
    }
    require(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1] == '\0');
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
    set_up();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    // Exactly as long as the line and its NUL, so that any read past the end is caught.
    std::vector<char> text(size + 1, '\0');
    std::memcpy(text.data(), data, size);
    const char *line = text.data();

    // A fresh pass; no words left from an earlier input, so that a run can be repeated.
    std::memset(words, 0, sizeof words);
    clear_primary_data_block();
    outbufferleft = OUTBUFFER_BUDGET;
    pdboverflow = 0;
    std::memset(topDataBlock, 0, TOP_DATA_BLOCK_SIZE);
    judge(line, 0, 0);

    // The same line with tookLog set, the budget spent to exactly its length + 5, into the last
    // row of the table; a short line keeps the words the first call left.
    outbufferleft = static_cast<int32_t>(std::strlen(line) + 5);
    judge(line, 1, PROCESS_TABLE_ROWS - 1);
    require(pdboverflow == 1 && outbufferleft == 4);

    // And once the table is full.
    judge(line, 0, PROCESS_TABLE_ROWS);
    return 0;
}

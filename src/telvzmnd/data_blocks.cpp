#include "data_blocks.h"

#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstring>

char primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE];
int32_t outbufferleft = OUTBUFFER_BUDGET;
int32_t pdboverflow;
char topDataBlock[TOP_DATA_BLOCK_SIZE];
char topLogDataBlock[TOP_DATA_BLOCK_SIZE];
char lsDataBlock[LS_DATA_BLOCK_SIZE];
char newPSDataBlock[PS_DATA_BLOCK_SIZE];
char oldPSDataBlock[PS_DATA_BLOCK_SIZE];
char line[LINE_SIZE];
char words[WORD_COUNT][WORD_SIZE];
char file_buffer[FILE_BUFFER_SIZE];

namespace {

constexpr char OVERFLOW_LINE[] = "No room to output more lines... \n\r";
constexpr char LINE_END[] = "\n\r";

size_t primary_length;     // strlen(primaryDataBlock), kept by every append
size_t primary_high_water; // bytes written since the last clear, terminating NULs included
size_t ps_high_water;      // bytes of newPSDataBlock written since its last clear
size_t ls_length;          // strlen(lsDataBlock), kept by every append
size_t ls_high_water;      // bytes of lsDataBlock written since its last clear
bool ls_full;              // a line was dropped since the last clear: the rest of it goes too
size_t top_high_water;     // bytes of topDataBlock written since its last clear
size_t top_log_high_water; // bytes of topLogDataBlock written since its last clear

void append_bytes(const char *text, size_t length) {
    size_t room = PRIMARY_DATA_BLOCK_SIZE - 1 - primary_length;
    size_t taken = length < room ? length : room;
    std::memcpy(primaryDataBlock + primary_length, text, taken);
    primary_length += taken;
    primaryDataBlock[primary_length] = '\0';
    primary_high_water = std::max(primary_high_water, primary_length + 1);
}

// outbufferleft moved by `change`, wrapping as the 32-bit counter always has.
void move_budget(int64_t change) {
    outbufferleft =
        static_cast<int32_t>(static_cast<uint32_t>(static_cast<int64_t>(outbufferleft) + change));
}

// The room test of the output-block rule: true when a line of `length` may go in; otherwise the
// pass's one overflow line goes in instead.
bool budget_allows(int64_t length) {
    if (length + 5 < outbufferleft) {
        return true;
    }
    if (pdboverflow == 0) {
        pdboverflow = 1;
        append_bytes(OVERFLOW_LINE, sizeof OVERFLOW_LINE - 1);
        outbufferleft = 4;
    }
    return false;
}

} // namespace

void append_data_line(const char *text) {
    auto length = static_cast<int64_t>(std::strlen(text));
    if (!budget_allows(length)) {
        return;
    }
    append_bytes(text, static_cast<size_t>(length));
    append_bytes(LINE_END, sizeof LINE_END - 1);
    move_budget(-(length + 3));
}

void append_data_line_unended(const char *text) {
    auto length = static_cast<int64_t>(std::strlen(text));
    if (!budget_allows(length)) {
        return;
    }
    append_bytes(text, static_cast<size_t>(length));
    move_budget(-(length + 3));
}

void append_header_line(const char *text) {
    size_t length = std::strlen(text);
    append_bytes(text, length);
    move_budget(static_cast<int64_t>(length));
}

void append_section_header(const char *header) {
    append_unbudgeted(LINE_END);
    append_header_line(header);
}

void append_unbudgeted(const char *text) {
    append_bytes(text, std::strlen(text));
}

size_t primary_data_length() {
    return primary_length;
}

void clear_primary_data_block() {
    std::memset(primaryDataBlock, 0, primary_high_water);
    primary_length = 0;
    primary_high_water = 0;
}

void write_error_text(const char *format, ...) {
    std::memset(topDataBlock, 0, TOP_DATA_BLOCK_SIZE);
    va_list arguments;
    va_start(arguments, format);
    int length = std::vsnprintf(topDataBlock, TOP_DATA_BLOCK_SIZE, format, arguments);
    va_end(arguments);
    top_high_water = length < 0 ? TOP_DATA_BLOCK_SIZE
                                : std::min(static_cast<size_t>(length) + 1, TOP_DATA_BLOCK_SIZE);
}

void copy_error_text_to_log() {
    std::memset(topLogDataBlock, 0, top_log_high_water);
    std::memcpy(topLogDataBlock, topDataBlock, top_high_water);
    top_log_high_water = top_high_water;
}

void clear_error_texts() {
    std::memset(topDataBlock, 0, top_high_water);
    std::memset(topLogDataBlock, 0, top_log_high_water);
    top_high_water = 0;
    top_log_high_water = 0;
}

void copy_to_ps_data_block(const char *from) {
    clear_ps_data_block();
    ps_high_water = std::min(std::strlen(from) + 1, PS_DATA_BLOCK_SIZE);
    std::memcpy(newPSDataBlock, from, ps_high_water);
    newPSDataBlock[PS_DATA_BLOCK_SIZE - 1] = '\0';
}

void clear_ps_data_block() {
    std::memset(newPSDataBlock, 0, ps_high_water);
    ps_high_water = 0;
}

void append_ls_line(const char *text) {
    size_t length = std::strlen(text);
    size_t room = LS_DATA_BLOCK_SIZE - 1 - ls_length;
    ls_full = ls_full || length > room || room - length < sizeof LINE_END - 1;
    if (ls_full) {
        return;
    }
    std::memcpy(lsDataBlock + ls_length, text, length);
    std::memcpy(lsDataBlock + ls_length + length, LINE_END, sizeof LINE_END - 1);
    ls_length += length + sizeof LINE_END - 1;
    lsDataBlock[ls_length] = '\0';
    ls_high_water = std::max(ls_high_water, ls_length + 1);
}

size_t ls_data_length() {
    return ls_length;
}

void clear_ls_data_block() {
    std::memset(lsDataBlock, 0, ls_high_water);
    ls_length = 0;
    ls_high_water = 0;
    ls_full = false;
}

void start_pass_data() {
    clear_primary_data_block();
    clear_ls_data_block();
    clear_error_texts();
    outbufferleft = OUTBUFFER_BUDGET;
    pdboverflow = 0;
}

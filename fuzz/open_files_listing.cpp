// The line handlers of the open files check, fed any bytes as the whole output of cat
// /proc/sys/fs/file-nr and then as the whole descriptor listing, cut into lines at each line feed
// as the runner hands them over (up to a NUL, which ends what the check sees of a line). A first
// byte of 0xFF has lsDataBlock filled first, up to as little room as the second byte says, so that
// a listing of the fuzzer's size still meets the block's end. Whatever the bytes, the findings
// must be the check's own and no fixed buffer may be written outside its bounds or lose its
// terminating NUL.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "storage/open_files.h"

namespace {

constexpr int32_t PERCENT_THRESHOLD = 500;
constexpr int32_t LINES_THRESHOLD = 8;
constexpr uint8_t FILL_MARK = 0xFF;

void require(bool holds) {
    if (!holds) {
        __builtin_trap();
    }
}

bool terminated(const char *field, size_t size) {
    return std::memchr(field, '\0', size) != nullptr;
}

// Each line exactly as long as it is and its NUL, so that a read past its end is caught.
template <typename Handler>
void for_each_line(const uint8_t *data, size_t size, Handler handler) {
    size_t start = 0;
    for (size_t i = 0; i <= size; ++i) {
        if (i == size ? i > start : data[i] == '\n') {
            std::vector<char> line(data + start, data + i);
            line.push_back('\0');
            handler(line.data());
            start = i + 1;
        }
    }
}

void start_pass() {
    std::memset(words, 0, sizeof words);
    std::memset(topDataBlock, 0, TOP_DATA_BLOCK_SIZE);
    clear_primary_data_block();
    clear_ls_data_block();
    outbufferleft = OUTBUFFER_BUDGET;
    pdboverflow = 0;
}

// lsDataBlock filled with whole lines until no more than about `room` bytes are left.
void fill_ls_data_block(size_t room) {
    static const std::string filler(998, 'f');
    while (ls_data_length() + filler.size() + 2 + room <= LS_DATA_BLOCK_SIZE - 1) {
        append_ls_line(filler.c_str());
    }
}

bool code_of_the_check(int32_t code, uint32_t took_log) {
    auto value = static_cast<uint32_t>(code);
    if (took_log != 0) {
        return value == 0 || value == TAKE_LOG_SUPPRESSED;
    }
    return value == 0 || value == RC_SYSTEM_DESCRIPTORS || value == RC_PROCESS_DESCRIPTORS;
}

void require_blocks_bounded() {
    require(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1] == '\0');
    require(primary_data_length() < PRIMARY_DATA_BLOCK_SIZE);
    require(primaryDataBlock[primary_data_length()] == '\0');
    require(lsDataBlock[LS_DATA_BLOCK_SIZE - 1] == '\0');
    require(ls_data_length() < LS_DATA_BLOCK_SIZE);
    require(lsDataBlock[ls_data_length()] == '\0');
    require(topDataBlock[TOP_DATA_BLOCK_SIZE - 1] == '\0');
    for (int i = 0; i < 3; ++i) {
        require(terminated(words[i], WORD_SIZE));
    }
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
    // Thresholds that lines can cross either way.
    file_descriptors_percent_threshold = PERCENT_THRESHOLD;
    pp_file_descriptors_threshold = LINES_THRESHOLD;
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    for (uint32_t took_log : {0u, 1u}) {
        start_pass();
        int32_t take_log_crc = 0;
        int32_t take_log_value = 0;
        const open_files_pass pass{&take_log_crc, &take_log_value, &took_log};
        for_each_line(data, size, [&](const char *line) { file_nr_line(pass, line); });
        require(code_of_the_check(take_log_crc, took_log));
        if (take_log_crc == RC_SYSTEM_DESCRIPTORS) {
            require(take_log_value > PERCENT_THRESHOLD);
        }
        require_blocks_bounded();

        // The listing, from a pass without an earlier finding.
        start_pass();
        if (size >= 2 && data[0] == FILL_MARK) {
            fill_ls_data_block(size_t{data[1]} * 64);
        }
        take_log_crc = 0;
        take_log_value = 0;
        open_files_listing listing{pass, 0, {}};
        int32_t lines = 0;
        for_each_line(data, size, [&](const char *line) {
            listing_line(listing, line);
            ++lines;
            require(listing.block_lines >= 0 && listing.block_lines <= lines);
        });
        listing_end(listing);
        require(code_of_the_check(take_log_crc, took_log));
        require(take_log_crc != RC_SYSTEM_DESCRIPTORS);
        if (take_log_crc == RC_PROCESS_DESCRIPTORS) {
            require(take_log_value > LINES_THRESHOLD && take_log_value <= lines);
        } else {
            require(take_log_value == 0);
        }
        require_blocks_bounded();
    }
    return 0;
}

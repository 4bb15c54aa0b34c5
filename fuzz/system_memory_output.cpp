// The line handlers of the system memory check, fed any bytes as the whole output of free and then
// as the whole output of cat /proc/meminfo, cut into lines at each line feed as the runner hands
// them over (up to a NUL, which ends what the check sees of a line). Whatever the output holds,
// the figures must come out as the 32-bit arithmetic gives them, the findings must be the check's
// own, and no fixed buffer may be written outside its bounds.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "memory/system_memory.h"

namespace {

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
    clear_primary_data_block();
    outbufferleft = OUTBUFFER_BUDGET;
    pdboverflow = 0;
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
    // Thresholds that lines can cross either way.
    min_swap_size = 1000;
    total_memory_percent_threshold = 900;
    resume_memory_percent_threshold = 800;
    total_memory_in_use_threshold = 100000;
    low_free_size = 5000;
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    start_pass();
    free_figures figures;
    int lines = 0;
    for_each_line(data, size, [&](const char *line) {
        free_output_line(figures, line);
        ++lines;
    });
    require(figures.line_index == (lines < 3 ? lines : 3));
    int32_t in_use = memory_in_use(figures);
    int64_t sum = int64_t{figures.memtotal} + figures.swaptotal -
                  (int64_t{figures.buffers} + figures.memfree + figures.swapfree);
    require(in_use == static_cast<int32_t>(static_cast<uint32_t>(sum)));
    if (figures.memtotal != 0) {
        memory_percent(figures, in_use);
    }

    for (uint32_t took_log : {0u, 1u}) {
        int32_t take_log_crc = 0;
        int32_t take_log_value = 0;
        int32_t memory_percent_logged = 0;
        system_memory_pass pass{&take_log_crc, &take_log_value, &took_log, &memory_percent_logged};
        for_each_line(data, size, [&](const char *line) { meminfo_line(pass, line); });
        auto code = static_cast<uint32_t>(take_log_crc);
        require(code == 0 || code == (took_log == 0 ? RC_LOW_FREE : TAKE_LOG_SUPPRESSED));
        require(code == RC_LOW_FREE ? take_log_value < low_free_size : take_log_value == 0);
    }
    for (int i = 0; i < 7; ++i) {
        require(terminated(words[i], WORD_SIZE));
    }
    require(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1] == '\0');
    return 0;
}

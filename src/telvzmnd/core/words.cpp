#include "core/words.h"

#include <algorithm>
#include <cstring>

#include "data_blocks.h"

int split_words(const char *text, int count) {
    const char *at = text;
    int found = 0;
    count = std::min(count, static_cast<int>(WORD_COUNT));
    for (; found < count; ++found) {
        while (is_blank(*at)) {
            ++at;
        }
        if (*at == '\0') {
            break;
        }
        size_t length = 0;
        while (at[length] != '\0' && !is_blank(at[length])) {
            ++length;
        }
        size_t kept = std::min(length, WORD_SIZE - 1);
        std::memcpy(words[found], at, kept);
        words[found][kept] = '\0';
        at += length;
    }
    return found;
}

int32_t read_number(const char *word) {
    constexpr int64_t beyond_range = int64_t{INT32_MAX} + 1;
    const char *at = word;
    while (is_blank(*at)) {
        ++at;
    }
    bool negative = *at == '-';
    if (*at == '-' || *at == '+') {
        ++at;
    }
    int64_t magnitude = 0;
    for (; *at >= '0' && *at <= '9'; ++at) {
        magnitude = std::min(magnitude * 10 + (*at - '0'), beyond_range);
    }
    return static_cast<int32_t>(negative ? -magnitude : std::min(magnitude, beyond_range - 1));
}

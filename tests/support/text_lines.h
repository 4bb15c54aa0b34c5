// Small text helpers of the checks' tests: expected trace lines put together from parts, command
// output laid out in columns, and the test of a block's unwritten bytes.
#pragma once

#include <algorithm>
#include <cstddef>
#include <initializer_list>
#include <string>
#include <vector>

namespace text {

using lines = std::vector<std::string>;

inline lines joined(std::initializer_list<lines> parts) {
    lines all;
    for (const lines &part : parts) {
        all.insert(all.end(), part.begin(), part.end());
    }
    return all;
}

inline std::string right_aligned(const std::string &word, size_t width) {
    return word.size() >= width ? word : std::string(width - word.size(), ' ') + word;
}

inline std::string left_aligned(const std::string &word, size_t width) {
    return word.size() >= width ? word : word + std::string(width - word.size(), ' ');
}

inline bool all_zero(const void *from, size_t length) {
    const auto *bytes = static_cast<const char *>(from);
    return std::all_of(bytes, bytes + length, [](char c) { return c == '\0'; });
}

} // namespace text

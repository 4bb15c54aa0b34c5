// What the fuzz targets of libtelvzextra.so's parsers share: a failed check traps, and a routine's
// text is written into a buffer with guard bytes after it, which must stay untouched.
#pragma once

#include <cstddef>
#include <cstring>
#include <string_view>

#include "extra_support.h"

namespace extra_fuzz {

inline void require(bool holds) {
    if (!holds) {
        __builtin_trap();
    }
}

// A routine's text of `SIZE` bytes, and guard bytes past it.
template <size_t SIZE>
struct guarded_text {
    static constexpr size_t GUARD = 64;
    char bytes[SIZE + GUARD];
    routine_text text{bytes, SIZE};

    guarded_text() { std::memset(bytes + SIZE, 0x5a, GUARD); }

    // Whole lines ending "\n\r", within SIZE - 1 bytes and a NUL, the guard untouched, and only
    // printable bytes besides the line ends.
    void check() const {
        size_t length = strnlen(bytes, SIZE);
        require(length < SIZE && length == text.length());
        for (size_t i = 0; i < GUARD; ++i) {
            require(bytes[SIZE + i] == 0x5a);
        }
        std::string_view written(bytes, length);
        require(written.empty() || written.ends_with("\n\r"));
        for (size_t i = 0; i < length; ++i) {
            char c = bytes[i];
            require((c >= ' ' && c < 0x7f) || (c == '\n' && bytes[i + 1] == '\r') ||
                    (c == '\r' && i > 0 && bytes[i - 1] == '\n'));
        }
    }
};

// `text` split at its line feeds, each piece handed to `visit`.
template <typename Visit>
void for_each_line(std::string_view text, Visit visit) {
    while (!text.empty()) {
        visit(take_line(text));
    }
}

} // namespace extra_fuzz

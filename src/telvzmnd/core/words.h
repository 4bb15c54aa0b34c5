// Splitting a line into the shared `words` and reading number words, as the monitor has always
// done it with sscanf's "%s" and atoi, but never writing past a word's slot.
#pragma once

#include <cstdint>

// The white space of "%s", as sscanf knows it in the C locale.
inline bool is_blank(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

// Splits `text` into the first `count` slots of `words`, as sscanf with `count` "%s" would. A word
// is cut at 249 characters and the rest of it skipped, so it never spills into the next slot.
// Slots after the last word found keep what they held: a short line keeps words of the line before
// it, as it always has. Returns the number of words found.
int split_words(const char *text, int count);

// A number word as atoi reads it: leading blanks and a sign, then digits up to the first other
// character; a word without digits is 0. A number beyond the 32-bit range, where atoi gives no
// defined value, reads as the nearest end of the range, so that a huge limit stays a huge limit.
int32_t read_number(const char *word);

// A sum or product of 32-bit values, computed in 64 bits, cut back to 32 bits as two's complement
// wraps it: the monitor's figures have always been 32-bit, and this keeps their overflow defined.
inline int32_t wrap32(int64_t value) {
    return static_cast<int32_t>(static_cast<uint32_t>(value));
}

// A quotient of the monitor's float or double arithmetic taken as a 32-bit integer, truncated
// toward zero. A value outside the 32-bit range, or not a number, gives INT32_MIN: the value the
// processor's truncating conversion gives, and never undefined behaviour.
inline int32_t truncate32(double value) {
    if (!(value > -2147483649.0 && value < 2147483648.0)) {
        return INT32_MIN;
    }
    return static_cast<int32_t>(value);
}

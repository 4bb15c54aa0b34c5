// UTF-8 as tarnmon's machine-readable outputs (JSON, metrics) check it: text from the host (process
// names, mount points, control-file lines) may hold any bytes, and each output must stay valid.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

// The length of the valid UTF-8 sequence at the start of `text`, or 0 when its first byte does not
// begin one: no overlong form, no surrogate, nothing beyond U+10FFFF. Out: *code, its code point.
size_t utf8_sequence(std::string_view text, unsigned *code);

// One character of text from the host: a valid UTF-8 sequence (an ASCII byte included) with its
// code point, or a single byte that begins none, with the byte as its code.
struct text_character {
    std::string_view bytes;
    unsigned code;
    bool valid;
};

// Calls `each(text_character)` for every character of `text`, in order.
template <typename Each>
void for_each_character(std::string_view text, Each each) {
    for (size_t i = 0; i < text.size();) {
        auto byte = static_cast<unsigned char>(text[i]);
        unsigned code = byte;
        size_t length = byte < 0x80 ? 1 : utf8_sequence(text.substr(i), &code);
        bool valid = length != 0;
        length = valid ? length : 1;
        each(text_character{text.substr(i, length), valid ? code : byte, valid});
        i += length;
    }
}

// A byte that is not part of valid UTF-8, appended to `out` as the character of its own number
// (U+0080..U+00FF, as Latin-1 reads it) in UTF-8.
void append_byte_as_character(std::string *out, unsigned char byte);

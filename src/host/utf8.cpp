#include "utf8.h"

size_t utf8_sequence(std::string_view text, unsigned *code) {
    auto byte = [&](size_t i) { return static_cast<unsigned char>(text[i]); };
    if (text.empty()) {
        return 0;
    }
    unsigned lead = byte(0);
    size_t length;
    unsigned low = 0x80, high = 0xbf; // the range of the second byte
    if (lead >= 0xc2 && lead <= 0xdf) {
        length = 2;
    } else if (lead >= 0xe0 && lead <= 0xef) {
        length = 3;
        low = lead == 0xe0 ? 0xa0 : 0x80;  // overlong
        high = lead == 0xed ? 0x9f : 0xbf; // surrogates
    } else if (lead >= 0xf0 && lead <= 0xf4) {
        length = 4;
        low = lead == 0xf0 ? 0x90 : 0x80;  // overlong
        high = lead == 0xf4 ? 0x8f : 0xbf; // beyond U+10FFFF
    } else {
        return 0;
    }
    if (text.size() < length || byte(1) < low || byte(1) > high) {
        return 0;
    }
    unsigned value = lead & (0x7f >> length);
    for (size_t i = 1; i < length; ++i) {
        if ((byte(i) & 0xc0) != 0x80) {
            return 0;
        }
        value = (value << 6) | (byte(i) & 0x3f);
    }
    *code = value;
    return length;
}

void append_byte_as_character(std::string *out, unsigned char byte) {
    *out += static_cast<char>(0xc0 | (byte >> 6));
    *out += static_cast<char>(0x80 | (byte & 0x3f));
}

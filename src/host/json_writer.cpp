// The JSON writer of tarnmon's --json output.
#include "json_writer.h"

#include <cstdio>

namespace {

constexpr char HEX[] = "0123456789abcdef";

void append_u00(std::string *out, unsigned code) {
    *out += "\\u00";
    *out += HEX[(code >> 4) & 0xf];
    *out += HEX[code & 0xf];
}

// The length of the valid UTF-8 sequence at the start of `text`, or 0 when its first byte does not
// begin one: no overlong form, no surrogate, nothing beyond U+10FFFF. Out: *code, its code point.
size_t utf8_sequence(std::string_view text, unsigned *code) {
    auto byte = [&](size_t i) { return static_cast<unsigned char>(text[i]); };
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

} // namespace

std::string json_escaped(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size();) {
        auto byte = static_cast<unsigned char>(text[i]);
        unsigned code = 0;
        size_t length = byte < 0x80 ? 1 : utf8_sequence(text.substr(i), &code);
        if (byte == '"' || byte == '\\') {
            out += '\\';
            out += static_cast<char>(byte);
        } else if (byte < 0x20 || byte == 0x7f) {
            append_u00(&out, byte);
        } else if (byte < 0x80) {
            out += static_cast<char>(byte);
        } else if (length == 0) {
            append_u00(&out, byte); // not UTF-8: the byte as Latin-1
            length = 1;
        } else if (code <= 0x9f) {
            append_u00(&out, code); // a C1 control character
        } else {
            out.append(text.substr(i, length));
        }
        i += length;
    }
    return out;
}

void json_writer::separate() {
    if (after_key) {
        after_key = false;
        return;
    }
    if (!first.empty()) {
        if (!first.back()) {
            out += ',';
        }
        first.back() = false;
    }
}

json_writer &json_writer::open(char bracket) {
    separate();
    out += bracket;
    first.push_back(true);
    return *this;
}

json_writer &json_writer::close(char bracket) {
    out += bracket;
    first.pop_back();
    return *this;
}

json_writer &json_writer::key(std::string_view name) {
    value(name);
    out += ':';
    after_key = true;
    return *this;
}

json_writer &json_writer::value(std::string_view text) {
    return literal('"' + json_escaped(text) + '"');
}

json_writer &json_writer::value(int64_t number) {
    return literal(std::to_string(number));
}

json_writer &json_writer::value(uint64_t number) {
    return literal(std::to_string(number));
}

json_writer &json_writer::null() {
    return literal("null");
}

json_writer &json_writer::literal(std::string_view text) {
    separate();
    out += text;
    return *this;
}

void json_writer::print() const {
    std::fwrite(out.data(), 1, out.size(), stdout);
    std::fputc('\n', stdout);
}

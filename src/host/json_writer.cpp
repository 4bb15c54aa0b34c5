// The JSON writer of tarnmon's --json output.
#include "json_writer.h"

#include <cstdio>

#include "utf8.h"

namespace {

constexpr char HEX[] = "0123456789abcdef";

void append_u00(std::string *out, unsigned code) {
    *out += "\\u00";
    *out += HEX[(code >> 4) & 0xf];
    *out += HEX[code & 0xf];
}

} // namespace

std::string json_escaped(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for_each_character(text, [&out](const text_character &c) {
        if (c.code == '"' || c.code == '\\') {
            out += '\\';
            out += static_cast<char>(c.code);
        } else if (!c.valid) {
            append_u00(&out, c.code); // not UTF-8: the byte as Latin-1
        } else if (c.code < 0x20 || (c.code >= 0x7f && c.code <= 0x9f)) {
            append_u00(&out, c.code); // a C0 or C1 control character, or DEL
        } else {
            out += c.bytes;
        }
    });
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

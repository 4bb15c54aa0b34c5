// The strict JSON reader of the tests.
#include "json_value.h"

#include <algorithm>
#include <charconv>
#include <gtest/gtest.h>

namespace {

class reader {
  public:
    explicit reader(std::string_view text) : in(text) {}

    std::optional<json_value> document(std::string *problem) {
        json_value v;
        bool ok = value(&v, 0);
        skip_space();
        if (ok && at != in.size()) {
            ok = fail("text after the document");
        }
        if (!ok) {
            *problem = why + " at byte " + std::to_string(at);
            return std::nullopt;
        }
        return v;
    }

  private:
    bool fail(const std::string &reason) {
        if (why.empty()) {
            why = reason;
        }
        return false;
    }

    void skip_space() {
        while (at < in.size() &&
               (in[at] == ' ' || in[at] == '\t' || in[at] == '\n' || in[at] == '\r')) {
            ++at;
        }
    }

    bool literal(std::string_view word) {
        if (in.substr(at, word.size()) != word) {
            return fail("not a value");
        }
        at += word.size();
        return true;
    }

    bool value(json_value *v, int depth) {
        if (depth > 64) {
            return fail("nested too deep");
        }
        skip_space();
        if (at == in.size()) {
            return fail("no value");
        }
        char c = in[at];
        if (c == '{') {
            v->type = json_value::kind::object;
            return object(v, depth);
        }
        if (c == '[') {
            v->type = json_value::kind::array;
            return array(v, depth);
        }
        if (c == '"') {
            v->type = json_value::kind::string;
            return string(&v->text);
        }
        if (c == 't' || c == 'f') {
            v->type = json_value::kind::boolean;
            v->boolean = c == 't';
            return literal(c == 't' ? "true" : "false");
        }
        if (c == 'n') {
            return literal("null");
        }
        v->type = json_value::kind::number;
        return number(&v->number);
    }

    // The items of an object or array after its opening bracket, each read by `item`, up to
    // `close`.
    template <typename Item>
    bool items_until(char close, Item item) {
        ++at; // the opening bracket
        skip_space();
        if (at < in.size() && in[at] == close) {
            ++at;
            return true;
        }
        for (;;) {
            if (!item()) {
                return false;
            }
            skip_space();
            if (at < in.size() && in[at] == ',') {
                ++at;
            } else if (at < in.size() && in[at] == close) {
                ++at;
                return true;
            } else {
                return fail(std::string("no ',' or '") + close + "'");
            }
        }
    }

    bool object(json_value *v, int depth) {
        return items_until('}', [&] {
            skip_space();
            std::string name;
            if (at == in.size() || in[at] != '"' || !string(&name)) {
                return fail("no member name");
            }
            if (v->has(name)) {
                return fail("a second member " + name);
            }
            skip_space();
            if (at == in.size() || in[at] != ':') {
                return fail("no ':'");
            }
            ++at;
            json_value member;
            if (!value(&member, depth + 1)) {
                return false;
            }
            v->names.push_back(std::move(name));
            v->values.push_back(std::move(member));
            return true;
        });
    }

    bool array(json_value *v, int depth) {
        return items_until(']', [&] {
            json_value item;
            if (!value(&item, depth + 1)) {
                return false;
            }
            v->items.push_back(std::move(item));
            return true;
        });
    }

    bool digits() {
        size_t start = at;
        while (at < in.size() && in[at] >= '0' && in[at] <= '9') {
            ++at;
        }
        return at > start || fail("no digit");
    }

    bool number(std::string *out) {
        size_t start = at;
        if (at < in.size() && in[at] == '-') {
            ++at;
        }
        if (at < in.size() && in[at] == '0') {
            ++at; // no leading zeros
        } else if (!digits()) {
            return false;
        }
        if (at < in.size() && in[at] == '.') {
            ++at;
            if (!digits()) {
                return false;
            }
        }
        if (at < in.size() && (in[at] == 'e' || in[at] == 'E')) {
            ++at;
            if (at < in.size() && (in[at] == '+' || in[at] == '-')) {
                ++at;
            }
            if (!digits()) {
                return false;
            }
        }
        *out = std::string(in.substr(start, at - start));
        return true;
    }

    bool hex4(unsigned *code) {
        if (in.size() - at < 4) {
            return fail("short \\u escape");
        }
        auto [end, error] = std::from_chars(in.data() + at, in.data() + at + 4, *code, 16);
        if (error != std::errc() || end != in.data() + at + 4) {
            return fail("bad \\u escape");
        }
        at += 4;
        return true;
    }

    static void append_utf8(std::string *out, unsigned code) {
        if (code < 0x80) {
            *out += static_cast<char>(code);
        } else if (code < 0x800) {
            *out += static_cast<char>(0xc0 | (code >> 6));
            *out += static_cast<char>(0x80 | (code & 0x3f));
        } else if (code < 0x10000) {
            *out += static_cast<char>(0xe0 | (code >> 12));
            *out += static_cast<char>(0x80 | ((code >> 6) & 0x3f));
            *out += static_cast<char>(0x80 | (code & 0x3f));
        } else {
            *out += static_cast<char>(0xf0 | (code >> 18));
            *out += static_cast<char>(0x80 | ((code >> 12) & 0x3f));
            *out += static_cast<char>(0x80 | ((code >> 6) & 0x3f));
            *out += static_cast<char>(0x80 | (code & 0x3f));
        }
    }

    bool escape(std::string *out) {
        ++at; // '\\'
        if (at == in.size()) {
            return fail("lone backslash");
        }
        char c = in[at++];
        switch (c) {
        case '"':
            *out += '"';
            return true;
        case '\\':
            *out += '\\';
            return true;
        case '/':
            *out += '/';
            return true;
        case 'b':
            *out += '\b';
            return true;
        case 'f':
            *out += '\f';
            return true;
        case 'n':
            *out += '\n';
            return true;
        case 'r':
            *out += '\r';
            return true;
        case 't':
            *out += '\t';
            return true;
        case 'u':
            break;
        default:
            return fail("bad escape");
        }
        unsigned code = 0;
        if (!hex4(&code)) {
            return false;
        }
        if (code >= 0xdc00 && code <= 0xdfff) {
            return fail("lone low surrogate");
        }
        if (code >= 0xd800 && code <= 0xdbff) {
            unsigned low = 0;
            if (in.substr(at, 2) != "\\u" || (at += 2, !hex4(&low)) || low < 0xdc00 ||
                low > 0xdfff) {
                return fail("lone high surrogate");
            }
            code = 0x10000 + ((code - 0xd800) << 10) + (low - 0xdc00);
        }
        append_utf8(out, code);
        return true;
    }

    // One UTF-8 character as it is written, checked: no overlong form, surrogate or code point
    // beyond U+10FFFF.
    bool raw_character(std::string *out) {
        auto byte = [&](size_t i) { return static_cast<unsigned char>(in[at + i]); };
        unsigned lead = byte(0);
        size_t length = lead < 0x80   ? 1
                        : lead < 0xc2 ? 0
                        : lead < 0xe0 ? 2
                        : lead < 0xf0 ? 3
                        : lead < 0xf5 ? 4
                                      : 0;
        if (length == 0 || in.size() - at < length) {
            return fail("not UTF-8");
        }
        unsigned code = lead & (0xff >> (length + 1));
        for (size_t i = 1; i < length; ++i) {
            if ((byte(i) & 0xc0) != 0x80) {
                return fail("not UTF-8");
            }
            code = (code << 6) | (byte(i) & 0x3f);
        }
        static constexpr unsigned SMALLEST[] = {0, 0, 0x80, 0x800, 0x10000};
        if (length > 1 &&
            (code < SMALLEST[length] || code > 0x10ffff || (code >= 0xd800 && code <= 0xdfff))) {
            return fail("not UTF-8");
        }
        out->append(in.substr(at, length));
        at += length;
        return true;
    }

    bool string(std::string *out) {
        ++at; // '"'
        for (;;) {
            if (at == in.size()) {
                return fail("unterminated string");
            }
            auto c = static_cast<unsigned char>(in[at]);
            if (c == '"') {
                ++at;
                return true;
            }
            if (c < 0x20) {
                return fail("raw control character in a string");
            }
            if (!(c == '\\' ? escape(out) : raw_character(out))) {
                return false;
            }
        }
    }

    std::string_view in;
    size_t at = 0;
    std::string why;
};

const json_value NONE;

} // namespace

const json_value &json_value::operator[](std::string_view name) const {
    for (size_t i = 0; i < names.size(); ++i) {
        if (names[i] == name) {
            return values[i];
        }
    }
    ADD_FAILURE() << "no member " << name;
    return NONE;
}

const json_value &json_value::operator[](size_t index) const {
    if (index < items.size()) {
        return items[index];
    }
    ADD_FAILURE() << "no item " << index;
    return NONE;
}

bool json_value::has(std::string_view name) const {
    return std::find(names.begin(), names.end(), name) != names.end();
}

int64_t json_value::integer() const {
    int64_t n = 0;
    auto [end, error] = std::from_chars(number.data(), number.data() + number.size(), n);
    if (type != kind::number || error != std::errc() || end != number.data() + number.size()) {
        ADD_FAILURE() << "not a whole number: '" << number << "'";
    }
    return n;
}

std::optional<json_value> parse_json(std::string_view text, std::string *problem) {
    return reader(text).document(problem);
}

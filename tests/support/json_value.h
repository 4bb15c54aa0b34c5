// A strict reader of JSON text for the tests of tarnmon's --json output: one document, RFC 8259 to
// the letter (no trailing commas, no leading zeros, no raw control characters, UTF-8 only, no lone
// surrogates, no duplicate keys), with nothing but white space after it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

struct json_value {
    enum class kind { null, boolean, number, string, array, object };
    kind type = kind::null;
    bool boolean = false;
    std::string number; // the number as written
    std::string text;   // a string, decoded to UTF-8
    std::vector<json_value> items;
    // An object's members, in the order written: names[i] names values[i].
    std::vector<std::string> names;
    std::vector<json_value> values;

    // The member of that name; a test failure and a null when there is none.
    const json_value &operator[](std::string_view name) const;
    const json_value &operator[](size_t index) const;
    bool has(std::string_view name) const;
    // The number as a whole number; a test failure when it is not one.
    int64_t integer() const;
    // The names of the members, in order.
    const std::vector<std::string> &keys() const { return names; }
};

// The document in `text`, or nothing with `*problem` set to where and why it is not JSON.
std::optional<json_value> parse_json(std::string_view text, std::string *problem);

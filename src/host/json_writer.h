// One JSON document built in memory, for the --json output of tarnmon's commands: objects, arrays,
// strings and integers, with the commas and escapes put in by the writer. The commands print it
// only once it is whole, so that no half-written document reaches standard output.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

// `text` as the body of a JSON string, without the quotes: quote and backslash escaped, every
// control character (C0, DEL, and U+0080..U+009F) as \u00XX, valid UTF-8 otherwise as it is, and
// each byte that is not part of valid UTF-8 as the character of its own number, \u0080..\u00FF, as
// Latin-1 would read it; so any bytes give a valid string, and one that a terminal cannot be
// driven by.
std::string json_escaped(std::string_view text);

class json_writer {
  public:
    // In an object, each value follows its key().
    json_writer &begin_object() { return open('{'); }
    json_writer &end_object() { return close('}'); }
    json_writer &begin_array() { return open('['); }
    json_writer &end_array() { return close(']'); }
    json_writer &key(std::string_view name);
    json_writer &value(std::string_view text);
    json_writer &value(const char *text) { return value(std::string_view(text)); }
    json_writer &value(int64_t number);
    json_writer &value(uint64_t number);
    json_writer &value(int32_t number) { return value(int64_t{number}); }
    json_writer &value(uint32_t number) { return value(uint64_t{number}); }
    json_writer &null();
    // key(name) and value(v) in one.
    template <typename T>
    json_writer &field(std::string_view name, const T &v) {
        return key(name).value(v);
    }

    // The document so far.
    const std::string &text() const { return out; }
    // Writes the document and a line feed on standard output, as the text form prints its lines.
    void print() const;

  private:
    // Before a value or key: the comma that separates it from the one before, if any.
    void separate();
    json_writer &open(char bracket);
    json_writer &close(char bracket);
    json_writer &literal(std::string_view text); // a value as it is written

    std::string out;
    std::vector<bool> first; // per open object or array: nothing written in it yet
    bool after_key = false;  // the next value is a key's
};

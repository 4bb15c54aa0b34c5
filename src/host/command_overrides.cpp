// tarnmon overrides: the entries of the override table in use, each with the command name of its
// pid, in aligned columns; with --json, the same as one JSON document.
#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "commands.h"
#include "control_block_view.h"
#include "json_writer.h"

namespace {

constexpr const char *PROC_ROOT = "/proc";

using row = std::vector<std::string>;

// An entry in use, as it was read.
struct entry_read {
    int index;
    uint32_t pid;
    std::array<uint32_t, 6> limits; // in the order of LIMIT_OPTIONS
    uint32_t seen;
    std::string command; // as the kernel keeps it, or why there is none in parentheses
};
static_assert(std::tuple_size_v<decltype(entry_read::limits)> == std::size(LIMIT_OPTIONS));

// A command name kept within its cell: every control character, line feed and tab too, shown as
// "\xhh", as tarnmon shows the control characters of a file.
std::string shown_name(std::string_view name) {
    std::string text;
    for (unsigned char c : name) {
        if (c < 0x20 || c == 0x7F) {
            char escaped[5];
            std::snprintf(escaped, sizeof escaped, "\\x%02x", c);
            text += escaped;
        } else {
            text += static_cast<char>(c);
        }
    }
    return text;
}

// The command name that the kernel keeps for `pid`, or why there is none; unescaped.
std::string command_name(uint32_t pid) {
    std::string path = std::string(PROC_ROOT) + "/" + std::to_string(pid) + "/comm";
    FILE *file = std::fopen(path.c_str(), "re");
    if (file == nullptr) {
        return errno == ENOENT ? "(gone)" : "(" + std::string(std::strerror(errno)) + ")";
    }
    char name[64];
    size_t length = std::fread(name, 1, sizeof name, file);
    std::fclose(file);
    std::string_view text(name, length);
    if (text.ends_with('\n')) {
        text.remove_suffix(1);
    }
    return std::string(text);
}

// A limit's name in the heading and in JSON: its option without the "--".
std::string_view limit_name(const value_option &option) {
    return option.name.substr(2);
}

row header() {
    row names = {"entry", "pid"};
    for (const auto &option : LIMIT_OPTIONS) {
        names.emplace_back(limit_name(option));
    }
    names.insert(names.end(), {"seen", "command"});
    return names;
}

// The entries in use, read without the table's lock: a listing must never wait for a holder of
// the lock, let alone one that hangs, and at worst it shows an entry that is being written with
// some of its old values.
std::vector<entry_read> entries_in_use(const tarn_control_block &block) {
    std::vector<entry_read> entries;
    for (int i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        const override_entry &entry = block.override_table[i];
        if (read_field(entry.in_use) != 1) {
            continue;
        }
        uint32_t pid = read_field(entry.pid);
        entries.push_back({i, pid, entry_limits(entry), read_field(entry.seen), command_name(pid)});
    }
    return entries;
}

row cells_of(const entry_read &entry) {
    row cells = {std::to_string(entry.index), std::to_string(entry.pid)};
    for (uint32_t limit : entry.limits) {
        cells.push_back(std::to_string(limit));
    }
    cells.push_back(std::to_string(entry.seen));
    cells.push_back(shown_name(entry.command));
    return cells;
}

// Numbers right-aligned under their headings; the command name, last, as it is.
void print_table(const std::vector<row> &rows) {
    std::vector<size_t> widths(rows.front().size(), 0);
    for (const row &cells : rows) {
        for (size_t column = 0; column < cells.size(); ++column) {
            widths[column] = std::max(widths[column], cells[column].size());
        }
    }
    for (const row &cells : rows) {
        for (size_t column = 0; column + 1 < cells.size(); ++column) {
            std::printf("%*s  ", static_cast<int>(widths[column]), cells[column].c_str());
        }
        std::printf("%s\n", cells.back().c_str());
    }
}

void print_text(const std::vector<entry_read> &entries) {
    std::printf("override table of control block 0x%08x: %zu of %d entries in use (limits in KB, "
                "0 = no override)\n",
                TARN_CB_KEY, entries.size(), OVERRIDE_TABLE_ENTRIES);
    if (!entries.empty()) {
        std::vector<row> rows = {header()};
        for (const entry_read &entry : entries) {
            rows.push_back(cells_of(entry));
        }
        print_table(rows);
    }
}

// {"key":…,"in_use":…,"entries":5000,"unit":"KB","overrides":[{"entry","pid","rss",…,
// "vsize-abort","seen","command"}…]}: the names of the heading, the command name unescaped.
void print_json(const std::vector<entry_read> &entries) {
    json_writer json;
    json.begin_object()
        .field("key", TARN_CB_KEY)
        .field("in_use", entries.size())
        .field("entries", OVERRIDE_TABLE_ENTRIES)
        .field("unit", "KB")
        .key("overrides")
        .begin_array();
    for (const entry_read &entry : entries) {
        json.begin_object().field("entry", entry.index).field("pid", entry.pid);
        for (size_t i = 0; i < entry.limits.size(); ++i) {
            json.field(limit_name(LIMIT_OPTIONS[i]), entry.limits[i]);
        }
        json.field("seen", entry.seen).field("command", entry.command).end_object();
    }
    json.end_array().end_object().print();
}

} // namespace

int command_overrides(const command_line &line) {
    control_block_view view = attach_control_block();
    if (view.block == nullptr) {
        std::fprintf(stderr, "tarnmon: %s\n", view.problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    std::vector<entry_read> entries = entries_in_use(*view.block);
    detach_control_block(view);
    if (line.json != nullptr) {
        print_json(entries);
    } else {
        print_text(entries);
    }
    return EXIT_OK;
}

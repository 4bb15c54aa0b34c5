// tarnmon overrides: the entries of the override table in use, each with the command name of its
// pid, in aligned columns.
#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "commands.h"
#include "control_block_view.h"

namespace {

constexpr const char *PROC_ROOT = "/proc";

using row = std::vector<std::string>;

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

// The command name that the kernel keeps for `pid`, or why there is none.
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
    return shown_name(text);
}

row header() {
    row names = {"entry", "pid"};
    for (const auto &option : LIMIT_OPTIONS) {
        names.emplace_back(option.name.substr(2)); // the option without its "--"
    }
    names.insert(names.end(), {"seen", "command"});
    return names;
}

// The rows of the entries in use, read without the table's lock: a listing must never wait for a
// holder of the lock, let alone one that hangs, and at worst it shows an entry that is being
// written with some of its old values.
std::vector<row> entries_in_use(const tarn_control_block &block) {
    std::vector<row> rows;
    for (int i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        const override_entry &entry = block.override_table[i];
        if (read_field(entry.in_use) != 1) {
            continue;
        }
        uint32_t pid = read_field(entry.pid);
        row cells = {std::to_string(i), std::to_string(pid)};
        for (uint32_t limit : entry_limits(entry)) {
            cells.push_back(std::to_string(limit));
        }
        cells.push_back(std::to_string(read_field(entry.seen)));
        cells.push_back(command_name(pid));
        rows.push_back(std::move(cells));
    }
    return rows;
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

} // namespace

int command_overrides(const command_line &) {
    control_block_view view = attach_control_block();
    if (view.block == nullptr) {
        std::fprintf(stderr, "tarnmon: %s\n", view.problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    std::vector<row> rows = entries_in_use(*view.block);
    detach_control_block(view);
    std::printf("override table of control block 0x%08x: %zu of %d entries in use (limits in KB, "
                "0 = no override)\n",
                TARN_CB_KEY, rows.size(), OVERRIDE_TABLE_ENTRIES);
    if (!rows.empty()) {
        rows.insert(rows.begin(), header());
        print_table(rows);
    }
    return EXIT_OK;
}

// man_pages: writes the manual page telvzopt.trm(5) from its hand-written template, with the
// KEYWORDS section made from the settings table itself, so that the page lists exactly the
// keywords that the parser reads, with the unit, start value and rule that the monitor applies.
//
//   man_pages TEMPLATE EXAMPLE_FILE OUTPUT
//
// TEMPLATE is roff with one line KEYWORDS_MARKER where the keyword list goes; EXAMPLE_FILE is the
// example control file, whose line for a keyword becomes that keyword's example.
#include <cstdio>
#include <fstream>
#include <iostream>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

#include "core/settings.h"

namespace {

constexpr std::string_view KEYWORDS_MARKER = ".\\\" == keywords ==";

// Text for a roff body line: a backslash printed as such, and a line that would begin with a
// control character made plain.
std::string roff_text(std::string_view text) {
    std::string out;
    for (char c : text) {
        if (c == '\\') {
            out += "\\e";
        } else if (c == '-') {
            out += "\\-";
        } else if (c == '"') {
            out += "\\(dq";
        } else {
            out += c;
        }
    }
    if (!out.empty() && (out[0] == '.' || out[0] == '\'')) {
        out.insert(0, "\\&");
    }
    return out;
}

// The lines of the example file that give `keyword` (first word equal to it), comments excluded.
std::vector<std::string> example_lines(const std::vector<std::string> &example,
                                       std::string_view keyword) {
    std::vector<std::string> found;
    for (const std::string &line : example) {
        std::istringstream words(line);
        std::string first;
        if (words >> first && first == keyword) {
            found.push_back(line);
        }
    }
    return found;
}

std::string ordinal(unsigned n) {
    const char *suffix = "th";
    if (n % 100 < 11 || n % 100 > 13) {
        suffix = n % 10 == 1 ? "st" : n % 10 == 2 ? "nd" : n % 10 == 3 ? "rd" : "th";
    }
    return std::to_string(n) + suffix;
}

// What the parser does with the value beyond taking its number.
std::string handling_text(const setting &entry) {
    switch (entry.handling) {
    case setting_handling::plain:
        return "a whole number, read as far as it is one";
    case setting_handling::flag:
        return "no value: the keyword alone sets 1, its absence leaves 0";
    case setting_handling::checking_interval:
        return "a whole number; below " + std::to_string(CHECKING_INTERVAL_MIN) + " it becomes " +
               std::to_string(CHECKING_INTERVAL_DEFAULT) +
               "; ignored when the host gives the interval (tarnmon run \\-\\-interval)";
    case setting_handling::capped_count:
        return "a whole number; above " + std::to_string(TREND_SAMPLES_MAX) + " it becomes " +
               std::to_string(TREND_SAMPLES_MAX);
    case setting_handling::snapshot_size:
        return "a whole number of units of " + std::to_string(SNAPSHOT_SIZE_UNIT) +
               " bytes; a size below the smallest snapshot file is raised to it";
    case setting_handling::row_counter:
        return "a table: each line that begins with the keyword is one row";
    }
    return "";
}

// The value before the file is read: the load-time value, then what monitoring sets at its start.
std::string default_text(const setting &entry) {
    if (entry.handling == setting_handling::row_counter) {
        return "no rows";
    }
    if (entry.handling == setting_handling::flag) {
        return "absent (0): the monitor does not run";
    }
    int64_t value = setting_current(entry);
    std::string text = std::to_string(value);
    const setting_rule *rule = entry.rule;
    if (rule != nullptr && (value < rule->low || value > rule->high)) {
        text += ", which the rule refuses: the file must give it";
    }
    return text;
}

std::string rule_text(const setting &entry) {
    if (entry.rule == nullptr) {
        return "none";
    }
    return std::string(entry.rule->text) + " (checked " + ordinal(entry.check_order) +
           "; the first setting that fails stops the monitor)";
}

void write_keyword(std::ostream &out, const setting &entry,
                   const std::vector<std::string> &example) {
    out << ".TP\n.B " << entry.keyword << "\n";
    out << roff_text(entry.unit) << ".\n";
    out << ".RS\n";
    out << ".PD 0\n";
    out << ".TP 10\nValue:\n" << handling_text(entry) << ".\n";
    out << ".TP\nDefault:\n" << roff_text(default_text(entry)) << ".\n";
    out << ".TP\nRule:\n" << roff_text(rule_text(entry)) << ".\n";
    out << ".TP\nExample:\n";
    std::vector<std::string> lines = example_lines(example, entry.keyword);
    if (lines.empty()) {
        int64_t value = setting_current(entry);
        if (entry.rule != nullptr && value < entry.rule->low) {
            value = entry.rule->low;
        }
        lines.push_back(entry.handling == setting_handling::flag
                            ? std::string(entry.keyword)
                            : std::string(entry.keyword) + " " + std::to_string(value));
    }
    for (size_t i = 0; i < lines.size(); ++i) {
        out << (i > 0 ? ".br\n" : "") << ".B \"" << roff_text(lines[i]) << "\"\n";
    }
    out << ".PD\n.RE\n";
}

bool read_lines(const char *path, std::vector<std::string> *lines) {
    std::ifstream in(path);
    if (!in) {
        return false;
    }
    std::string line;
    while (std::getline(in, line)) {
        lines->push_back(line);
    }
    return !in.bad();
}

} // namespace

int main(int argc, char **argv) {
    if (argc != 4) {
        std::fprintf(stderr, "usage: man_pages TEMPLATE EXAMPLE_FILE OUTPUT\n");
        return 2;
    }
    std::vector<std::string> page;
    std::vector<std::string> example;
    if (!read_lines(argv[1], &page) || !read_lines(argv[2], &example)) {
        std::fprintf(stderr, "man_pages: cannot read %s or %s\n", argv[1], argv[2]);
        return 1;
    }
    reset_settings();
    settings_start_values();

    std::ostringstream out;
    bool placed = false;
    for (const std::string &line : page) {
        if (line != KEYWORDS_MARKER) {
            out << line << "\n";
            continue;
        }
        size_t count = 0;
        const setting *table = settings_table(&count);
        for (size_t i = 0; i < count; ++i) {
            write_keyword(out, table[i], example);
        }
        placed = true;
    }
    if (!placed) {
        std::fprintf(stderr, "man_pages: %s has no line '%.*s'\n", argv[1],
                     static_cast<int>(KEYWORDS_MARKER.size()), KEYWORDS_MARKER.data());
        return 1;
    }
    std::ofstream file(argv[3], std::ios::trunc);
    file << out.str();
    file.close();
    if (!file) {
        std::fprintf(stderr, "man_pages: cannot write %s\n", argv[3]);
        return 1;
    }
    return 0;
}

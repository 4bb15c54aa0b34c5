// tarnmon: the command-line host of the monitor library.
#include <cstdio>
#include <span>
#include <string>
#include <string_view>

#include "commands.h"

namespace {

struct command {
    std::string_view name;
    int (*run)(const command_line &line);
    std::string_view arguments; // what follows the name in its usage
    std::string_view summary;
    size_t max_operands;
    bool takes_file; // --file PATH
};

constexpr command COMMANDS[] = {
    {"status", command_status, "", "show the control block of a running monitor", 0, false},
    {"stop", command_stop, "", "ask the running monitor to end after its pass", 0, false},
    {"check-config", command_check_config, "[FILE]",
     "check a control file as the monitor would read it", 1, false},
    {"snapshots", command_snapshots, "[--file PATH] [N|last]",
     "list the snapshot file, or show snapshot N or the last problem one", 1, true},
};

constexpr const char *EXIT_STATUSES =
    "exit status: 0 fine, 1 finding, 2 usage error, 3 not available\n";

// "check-config [FILE]": the command as its usage shows it.
std::string synopsis(const command &c) {
    std::string text(c.name);
    if (!c.arguments.empty()) {
        text += ' ';
        text += c.arguments;
    }
    return text;
}

void print_usage(FILE *out, const command &c) {
    std::fprintf(out, "usage: tarnmon %s\n", synopsis(c).c_str());
}

void print_help(const command &c) {
    print_usage(stdout, c);
    std::printf("%.*s\n\n%s", static_cast<int>(c.summary.size()), c.summary.data(), EXIT_STATUSES);
}

void print_commands(FILE *out) {
    std::fprintf(out, "usage: tarnmon COMMAND [ARGS]\n\ncommands:\n");
    constexpr int WIDTH = 22;
    for (const auto &c : COMMANDS) {
        // A synopsis too wide for its column has the summary on a line of its own.
        std::string text = synopsis(c);
        if (text.size() > static_cast<size_t>(WIDTH)) {
            std::fprintf(out, "  %s\n%*s", text.c_str(), WIDTH + 2, "");
        } else {
            std::fprintf(out, "  %-*s", WIDTH, text.c_str());
        }
        std::fprintf(out, " %.*s\n", static_cast<int>(c.summary.size()), c.summary.data());
    }
    std::fprintf(out, "\n%s", EXIT_STATUSES);
}

enum class parsed { run, help, wrong };

// Sorts the words after the command's name into `line`. "--" ends the options, so that an operand
// may begin with '-'; before it, every word that begins with '-' must be an option of the command
// ("-" too: no command reads standard input).
parsed parse(const command &c, std::span<char *const> words, command_line *line) {
    bool options = true;
    for (size_t i = 0; i < words.size(); ++i) {
        std::string_view word = words[i];
        if (options && word == "--") {
            options = false;
        } else if (options && (word == "--help" || word == "-h")) {
            return parsed::help;
        } else if (options && c.takes_file && word == "--file" && i + 1 < words.size()) {
            line->file = words[++i];
        } else if (options && word.starts_with('-')) {
            return parsed::wrong;
        } else {
            line->operands.push_back(words[i]);
        }
    }
    return line->operands.size() <= c.max_operands ? parsed::run : parsed::wrong;
}

int run(const command &c, std::span<char *const> words) {
    command_line line;
    parsed result = parse(c, words, &line);
    if (result == parsed::help) {
        print_help(c);
        return EXIT_OK;
    }
    int status = result == parsed::run ? c.run(line) : EXIT_USAGE;
    if (status == EXIT_USAGE) {
        print_usage(stderr, c);
    }
    return status;
}

} // namespace

int main(int argc, char **argv) {
    if (argc < 2) {
        print_commands(stderr);
        return EXIT_USAGE;
    }
    std::string_view name = argv[1];
    if (name == "--help" || name == "-h" || name == "help") {
        print_commands(stdout);
        return EXIT_OK;
    }
    for (const auto &c : COMMANDS) {
        if (c.name == name) {
            return run(c, std::span<char *const>(argv + 2, static_cast<size_t>(argc - 2)));
        }
    }
    std::fprintf(stderr, "tarnmon: unknown command '%s'\n\n", argv[1]);
    print_commands(stderr);
    return EXIT_USAGE;
}

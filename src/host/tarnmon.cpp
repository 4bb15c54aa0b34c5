// tarnmon: the command-line host of the monitor library.
#include <cstdint>
#include <cstdio>
#include <span>
#include <string>
#include <string_view>

#include "commands.h"

namespace {

constexpr value_option FILE_OPTION[] = {{"--file", "PATH", &command_line::file}};
constexpr value_option RUN_OPTIONS[] = {
    {"--interval", "SECONDS", &command_line::interval},
    {"--data-dir", "DIR", &command_line::data_dir},
    {"--config", "FILE", &command_line::config},
    {"--once", "", &command_line::once},
    {"--metrics", "FILE", &command_line::metrics},
};
constexpr std::span<const value_option> NO_OPTIONS;
// Taken by the commands that print what they found as a table or a listing; their --help says
// what it does on a line of its own.
constexpr value_option JSON_OPTION = {"--json", "", &command_line::json};
constexpr const char *JSON_HELP = "  --json  print the same as one JSON document\n";

struct command {
    std::string_view name;
    int (*run)(const command_line &line);
    std::span<const value_option> options;
    bool takes_json;            // JSON_OPTION too
    std::string_view arguments; // what follows the options in its usage
    std::string_view summary;
    size_t max_operands;
    // The first operand and every word after it are a program and its arguments: they are the
    // program's, whatever they begin with.
    bool runs_program;
    std::string_view exit_note; // what its --help adds to the exit statuses
};

constexpr command COMMANDS[] = {
    {"status", command_status, NO_OPTIONS, true, "", "show the control block of a running monitor",
     0, false, ""},
    {"stop", command_stop, NO_OPTIONS, false, "", "ask the running monitor to end after its pass",
     0, false, ""},
    {"alerts", command_alerts, NO_OPTIONS, false, "on|off|trigger",
     "switch the running monitor's CPU alerts on or off, or force its sleep alert", 1, false, ""},
    {"events", command_events, NO_OPTIONS, false, "info|error",
     "raise the running monitor's events as informational or as errors", 1, false, ""},
    {"check-config", command_check_config, NO_OPTIONS, false, "[FILE]",
     "check a control file as the monitor would read it", 1, false, ""},
    {"snapshots", command_snapshots, FILE_OPTION, true, "[N|last]",
     "list the snapshot file, or show snapshot N or the last problem one", 1, false, ""},
    {"limits", command_limits, LIMIT_OPTIONS, false, "-- COMMAND [ARGS]",
     "run COMMAND under memory limits of its own (KB, 0..4194304; 0 = the default)", SIZE_MAX, true,
     "once COMMAND runs, the exit status is its own; 126 COMMAND cannot be run, 127 no such "
     "COMMAND\n"},
    {"overrides", command_overrides, NO_OPTIONS, true, "",
     "list the memory limits that processes set for themselves", 0, false, ""},
    {"run", command_run, RUN_OPTIONS, false, "",
     "run the monitor here until SIGINT, SIGTERM or tarnmon stop (--once: one pass)", 0, false,
     "run: 0 once the monitor has ended (its pass done, or stopped); check-config's status for a\n"
     "control file that check-config refuses; 1 the monitor returned a failure of its own; 3 also\n"
     "no data directory, no library, the control block in use, or no metrics file to write\n"},
};

constexpr const char *EXIT_STATUSES =
    "exit status: 0 fine, 1 finding, 2 usage error, 3 not available\n";

// "snapshots [--file PATH] [--json] [N|last]": the command as its usage shows it.
std::string synopsis(const command &c) {
    std::string text(c.name);
    for (const auto &option : c.options) {
        text += " [";
        text += option.name;
        if (!option.placeholder.empty()) {
            text += ' ';
            text += option.placeholder;
        }
        text += ']';
    }
    if (c.takes_json) {
        text += " [";
        text += JSON_OPTION.name;
        text += ']';
    }
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
    std::printf("%.*s\n%s\n%s%.*s", static_cast<int>(c.summary.size()), c.summary.data(),
                c.takes_json ? JSON_HELP : "", EXIT_STATUSES, static_cast<int>(c.exit_note.size()),
                c.exit_note.data());
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

const value_option *option_named(const command &c, std::string_view word) {
    for (const auto &option : c.options) {
        if (option.name == word) {
            return &option;
        }
    }
    return c.takes_json && word == JSON_OPTION.name ? &JSON_OPTION : nullptr;
}

// Sorts the words after the command's name into `line`. "--" ends the options, so that an operand
// may begin with '-'; so does the program of a command that runs one. Before that, every word that
// begins with '-' must be an option of the command ("-" too: no command reads standard input), and
// an option that takes a value takes the next word, whatever it is.
parsed parse(const command &c, std::span<char *const> words, command_line *line) {
    bool options = true;
    for (size_t i = 0; i < words.size(); ++i) {
        std::string_view word = words[i];
        const value_option *option = options ? option_named(c, word) : nullptr;
        if (options && word == "--") {
            options = false;
        } else if (options && (word == "--help" || word == "-h")) {
            return parsed::help;
        } else if (option != nullptr && option->placeholder.empty()) {
            line->*option->value = words[i];
        } else if (option != nullptr && i + 1 < words.size()) {
            line->*option->value = words[++i];
        } else if (options && word.starts_with('-')) {
            return parsed::wrong;
        } else {
            line->operands.push_back(words[i]);
            options = options && !c.runs_program;
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

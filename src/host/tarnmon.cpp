// tarnmon: the command-line host of the monitor library.
#include <cstdio>
#include <cstring>
#include <string_view>

#include "commands.h"

namespace {

struct command {
    std::string_view name;
    int (*run)(command_args args);
    std::string_view synopsis;
};

constexpr command COMMANDS[] = {
    {"status", command_status,
     "status                 show the control block of a running monitor"},
    {"stop", command_stop, "stop                   ask the running monitor to end after its pass"},
    {"check-config", command_check_config,
     "check-config [FILE]    check a control file as the monitor would read it"},
    {"snapshots", command_snapshots,
     "snapshots [--file PATH] [N|last]\n"
     "                         list the snapshot file, or show snapshot N or the last problem one"},
};

void usage(FILE *out) {
    std::fprintf(out, "usage: tarnmon COMMAND [ARGS]\n\ncommands:\n");
    for (const auto &c : COMMANDS) {
        std::fprintf(out, "  %.*s\n", static_cast<int>(c.synopsis.size()), c.synopsis.data());
    }
    std::fprintf(out, "\nexit status: 0 fine, 1 finding, 2 usage error, 3 not available\n");
}

} // namespace

int main(int argc, char **argv) {
    if (argc < 2) {
        usage(stderr);
        return EXIT_USAGE;
    }
    std::string_view name = argv[1];
    if (name == "--help" || name == "-h" || name == "help") {
        usage(stdout);
        return EXIT_OK;
    }
    for (const auto &c : COMMANDS) {
        if (c.name == name) {
            return c.run(command_args(argv + 2, static_cast<size_t>(argc - 2)));
        }
    }
    std::fprintf(stderr, "tarnmon: unknown command '%s'\n\n", argv[1]);
    usage(stderr);
    return EXIT_USAGE;
}

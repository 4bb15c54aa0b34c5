// The commands of tarnmon, one file each. Every command takes its command line, already sorted by
// tarnmon's one parser, and returns the process exit status.
#pragma once

#include <vector>

// Exit statuses a script can rely on.
inline constexpr int EXIT_OK = 0;
inline constexpr int EXIT_FINDING = 1;     // the command ran, and what it checked is not good
inline constexpr int EXIT_USAGE = 2;       // the command line is wrong
inline constexpr int EXIT_UNAVAILABLE = 3; // what the command needs is not there

// The words after the command's name. "--help", "--" and the options are taken out by tarnmon,
// which refuses words the command does not take; a command that finds its operands wrong returns
// EXIT_USAGE, and tarnmon prints the command's usage.
struct command_line {
    std::vector<const char *> operands;
    const char *file = nullptr; // --file PATH, for the commands that take it
};

int command_status(const command_line &line);
int command_stop(const command_line &line);
int command_check_config(const command_line &line);
int command_snapshots(const command_line &line);

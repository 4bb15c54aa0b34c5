// The commands of tarnmon, one file each. Every command takes the words after its name and returns
// the process exit status.
#pragma once

#include <span>

// Exit statuses a script can rely on.
inline constexpr int EXIT_OK = 0;
inline constexpr int EXIT_FINDING = 1;     // the command ran, and what it checked is not good
inline constexpr int EXIT_USAGE = 2;       // the command line is wrong
inline constexpr int EXIT_UNAVAILABLE = 3; // what the command needs is not there

using command_args = std::span<char *const>;

int command_status(command_args args);
int command_stop(command_args args);
int command_check_config(command_args args);
int command_snapshots(command_args args);

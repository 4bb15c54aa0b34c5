// The commands of tarnmon, one file each. Every command takes its command line, already sorted by
// tarnmon's one parser, and returns the process exit status.
#pragma once

#include <string_view>
#include <vector>

// Exit statuses a script can rely on.
inline constexpr int EXIT_OK = 0;
inline constexpr int EXIT_FINDING = 1;     // the command ran, and what it checked is not good
inline constexpr int EXIT_USAGE = 2;       // the command line is wrong
inline constexpr int EXIT_UNAVAILABLE = 3; // what the command needs is not there
// A command that runs a program and cannot, says so as a shell would.
inline constexpr int EXIT_CANNOT_EXECUTE = 126; // the program is there but cannot be run
inline constexpr int EXIT_NOT_FOUND = 127;      // there is no such program

// The words after the command's name. "--help", "--" and the options are taken out by tarnmon,
// which refuses words the command does not take; a command that finds its operands wrong returns
// EXIT_USAGE, and tarnmon prints the command's usage.
struct command_line {
    std::vector<const char *> operands;
    const char *file = nullptr; // --file PATH, for the commands that take it
    // The limits of `limits`, in KB, as given; null when not given.
    const char *rss = nullptr;
    const char *dsiz = nullptr;
    const char *vsize = nullptr;
    const char *rss_abort = nullptr;
    const char *dsiz_abort = nullptr;
    const char *vsize_abort = nullptr;
};

// An option that takes a value, and the field of command_line that tarnmon's parser puts it in.
struct value_option {
    std::string_view name;        // "--rss"
    std::string_view placeholder; // "KB", as the usage shows the value
    const char *command_line::*value;
};

// The options of `limits`, in the order of the limits of an override entry and of the arguments
// of tarn_override_thresholds.
inline constexpr value_option LIMIT_OPTIONS[] = {
    {"--rss", "KB", &command_line::rss},
    {"--dsiz", "KB", &command_line::dsiz},
    {"--vsize", "KB", &command_line::vsize},
    {"--rss-abort", "KB", &command_line::rss_abort},
    {"--dsiz-abort", "KB", &command_line::dsiz_abort},
    {"--vsize-abort", "KB", &command_line::vsize_abort},
};

int command_status(const command_line &line);
int command_stop(const command_line &line);
int command_check_config(const command_line &line);
int command_snapshots(const command_line &line);
int command_limits(const command_line &line);
int command_overrides(const command_line &line);

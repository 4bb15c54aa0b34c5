// The commands of tarnmon, one file each. Every command takes its command line, already sorted by
// tarnmon's one parser, and returns the process exit status.
#pragma once

#include <cstdint>
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
    // --json, for the commands that take it: their output as one JSON document. Holds the
    // option's own word; null when not given.
    const char *json = nullptr;
    // The options of `run`, as given; null when not given. --once takes no value: it holds the
    // option's own word.
    const char *interval = nullptr;
    const char *data_dir = nullptr;
    const char *config = nullptr;
    const char *once = nullptr;
    const char *metrics = nullptr; // the file of the figures of every pass
    // The limits of `limits`, in KB, as given; null when not given.
    const char *rss = nullptr;
    const char *dsiz = nullptr;
    const char *vsize = nullptr;
    const char *rss_abort = nullptr;
    const char *dsiz_abort = nullptr;
    const char *vsize_abort = nullptr;
};

// An option, and the field of command_line that tarnmon's parser puts its value in. An option
// without a placeholder takes no value: its field gets the option's own word.
struct value_option {
    std::string_view name;        // "--rss"
    std::string_view placeholder; // "KB", as the usage shows the value; empty: no value
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

// How much of what it found check_control_file prints: the whole report of check-config, or only
// the verdict that `run` gives before it starts the monitor.
enum class check_report { full, verdict };

// Reads a control file as the monitor reads it (the file at `path`, or telvzopt.trm through the
// data-file service when `path` is null), parses and validates it with the monitor's own code, and
// prints on standard output the name of the file, then each problem in a line that begins with
// "PROBLEM:", or the line that begins with "VALID:". Nothing of the check reaches the monitor's
// trace or event log. Returns check-config's exit status: EXIT_OK, EXIT_FINDING, or
// EXIT_UNAVAILABLE when there is no file to read. Out: *checking_interval, the seconds between
// passes that the file sets (60 when it sets none, or cannot be read).
int check_control_file(const char *path, check_report report, int32_t *checking_interval);

int command_status(const command_line &line);
int command_stop(const command_line &line);
int command_alerts(const command_line &line);
int command_events(const command_line &line);
int command_check_config(const command_line &line);
int command_snapshots(const command_line &line);
int command_limits(const command_line &line);
int command_overrides(const command_line &line);
int command_run(const command_line &line);

// Runs a program of the build and collects what it printed and how it ended.
#pragma once

#include <string>
#include <vector>

struct command_result {
    int status = -1; // exit status, or 128 + signal
    std::string out;
    std::string err;
};

// Runs `argv` (argv[0] a path) with the test's environment; standard input is /dev/null.
command_result run_command(const std::vector<std::string> &argv);

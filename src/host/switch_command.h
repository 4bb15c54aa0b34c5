// What tarnmon alerts and tarnmon events share: one word of the command line chooses a switch of
// the running monitor, which tarnmon turns through the library's own entry point, from its own
// process, as any process that loads the library turns it.
#pragma once

#include <cstdint>
#include <span>
#include <string_view>

#include "commands.h"

struct switch_word {
    std::string_view word;
    uint32_t (*turn)(uint32_t *crc); // the entry point; returns its src
    const char *done;                // what tarnmon says once the switch is turned
};

// Turns the switch of the one operand of `line`, a word of `words`. Returns the exit status, having
// said what was done on standard output, or on standard error why nothing was: EXIT_USAGE for no
// word or another word, EXIT_UNAVAILABLE without a control block.
int turn_switch(std::string_view command, std::span<const switch_word> words,
                const command_line &line);

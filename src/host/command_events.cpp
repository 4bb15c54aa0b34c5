// tarnmon events info|error: whether the running monitor raises its events as informational or as
// errors.
#include <cstdint>

#include "commands.h"
#include "core/alert_switches.h"
#include "switch_command.h"

namespace {

uint32_t events_informational(uint32_t *crc) {
    return tarn_set_logging_type(1, crc);
}

uint32_t events_errors(uint32_t *crc) {
    return tarn_set_logging_type(0, crc);
}

constexpr switch_word EVENT_WORDS[] = {
    {"info", events_informational,
     "events of the monitor are informational from now on (until an event of a full /extra, which "
     "sets them back to errors)"},
    {"error", events_errors, "events of the monitor are errors from now on"},
};

} // namespace

int command_events(const command_line &line) {
    return turn_switch("events", EVENT_WORDS, line);
}

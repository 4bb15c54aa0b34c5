// tarnmon alerts on|off|trigger: the CPU alert switches of the running monitor.
#include "commands.h"
#include "core/alert_switches.h"
#include "switch_command.h"

namespace {

constexpr switch_word ALERT_WORDS[] = {
    {"on", tarn_enable_cpu_alerts,
     "CPU alerts on: CPU use and the monitor's sleep are judged again from the 11th pass from now, "
     "and the next finding is reported"},
    {"off", tarn_disable_cpu_alerts,
     "CPU alerts off for the next 59 passes: CPU use and the monitor's sleep are judged again from "
     "the 60th pass from now"},
    {"trigger", tarn_trigger_cpu_alert04,
     "sleep alert forced: the monitor ends its sleep within a second, and its next pass reports "
     "the alert"},
};

} // namespace

int command_alerts(const command_line &line) {
    return turn_switch("alerts", ALERT_WORDS, line);
}

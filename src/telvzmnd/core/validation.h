// Validation of the settings before the monitor runs: every threshold the checks compare against
// must lie in its range, or the monitor does not start.
#pragma once

#include "core/settings.h"
#include "export.h"

// 1 when the file asked the monitor to run (ACTUALLY_RUN), else 0; checked before the rules.
int32_t run_requested(void);

// Whether one setting passes its rule (a setting without a rule always does).
bool setting_is_valid(const setting &entry);

// The first setting whose rule fails, in the monitor's order of checking, or null when every rule
// holds. Traces nothing: a failing rule ends the monitor silently.
const setting *validate_settings(void);

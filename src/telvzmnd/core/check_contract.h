// The rule every check keeps with the loop's takeLogCrc when it finds a condition: the finding is
// marked present (TAKE_LOG_SUPPRESSED), and the check goes on to report it, with its own reason
// code, value and error text, only while no event is held back by the control block's tookLog.
#pragma once

#include <cstdint>

#include "core/control_block.h"
#include "core/reason_codes.h"

// Marks a finding present; true when the check is to report it. tookLog is read as it is now:
// another process may clear it at any time.
inline bool finding_to_report(int32_t *takeLogCrc, const uint32_t *tookLog) {
    *takeLogCrc = TAKE_LOG_SUPPRESSED;
    return read_field(*tookLog) == 0;
}

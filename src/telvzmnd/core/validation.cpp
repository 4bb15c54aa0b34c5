#include "core/validation.h"

#include <array>

namespace {

inline constexpr size_t RULE_COUNT = [] {
    size_t count = 0;
    for (const setting &entry : SETTINGS) {
        count += entry.check_order != 0 ? 1 : 0;
    }
    return count;
}();

// The settings with a rule (those with a check_order), as indexes into SETTINGS in the order of
// their check_order: that order is the monitor's order of checking, which differs from the order
// of the keywords. Indexes rather than pointers, so that the compiler can check the sequence.
consteval std::array<size_t, RULE_COUNT> checking_sequence() {
    std::array<size_t, RULE_COUNT> sequence{};
    sequence.fill(SETTING_COUNT);
    for (size_t i = 0; i < SETTING_COUNT; ++i) {
        if (SETTINGS[i].check_order != 0) {
            sequence[SETTINGS[i].check_order - 1] = i;
        }
    }
    return sequence;
}

inline constexpr auto CHECKING_SEQUENCE = checking_sequence();

consteval bool sequence_is_complete() {
    for (size_t index : CHECKING_SEQUENCE) {
        if (index == SETTING_COUNT) {
            return false;
        }
    }
    return true;
}
static_assert(sequence_is_complete(), "check_order must number the rules 1, 2, ... without gaps");

} // namespace

int32_t run_requested(void) {
    return actuallyRun == 1 ? 1 : 0;
}

bool setting_is_valid(const setting &entry) {
    const setting_rule *rule = entry.rule;
    if (rule == nullptr) {
        return true;
    }
    int64_t value = setting_current(entry);
    bool valid = value >= rule->low && value <= rule->high;
    if (rule->cross == cross_check::not_below) {
        valid = valid && value >= *rule->other;
    } else if (rule->cross == cross_check::not_above) {
        valid = valid && value <= *rule->other;
    }
    return valid;
}

const setting *validate_settings(void) {
    const setting *failed = nullptr;
    for (size_t index : CHECKING_SEQUENCE) {
        if (!setting_is_valid(SETTINGS[index])) {
            failed = &SETTINGS[index];
            break;
        }
    }
    return failed;
}

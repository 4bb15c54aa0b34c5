#include "core/expression_budget.h"

#include <algorithm>

namespace {

// The reasons name the budgets by number.
static_assert(REPETITION_COUNT_MAX == 255 && EXPANSION_PARTS_MAX == 512 &&
              EXPRESSION_NESTING_MAX == 128);
constexpr const char *REASON_COUNT = "a counted repetition asks for more than 255 copies";
constexpr const char *REASON_NESTED =
    "counted repetitions nested in groups multiply to more than 255 copies";
constexpr const char *REASON_EXPANSION = "its repetitions would expand it by more than 512 parts";
constexpr const char *REASON_NESTING = "groups nested more than 128 deep";

// Counts are held below this ceiling, far above every budget, so that no product overflows.
constexpr uint64_t COUNT_CEILING = uint64_t{1} << 30;
// A number of a repetition is read up to this value: the compiler refuses anything above 32767.
constexpr uint64_t NUMBER_CEILING = 100000;

uint64_t capped(uint64_t count) {
    return std::min(count, COUNT_CEILING);
}

// One group being read; frame 0 is the whole expression.
struct group_frame {
    uint64_t parts = 0;          // the content so far, every repetition written out
    uint64_t added = 0;          // of which the repetitions added
    uint64_t last = 0;           // parts of the last item, which a repetition copies; 0 = none
    bool last_empty = true;      // the last item can match nothing (true while there is none)
    bool before_empty = true;    // so can every item of this alternative before the last
    uint32_t empty_branches = 0; // finished alternatives that can match nothing
    uint64_t last_chain = 1;     // product of the counted repetitions on and inside the last item
    uint64_t chain_max = 1;      // the largest such product of any item of the group
    bool branch_start = true;    // at the start of the group or after "\|": '^' anchors here
};

void add_parts(group_frame &frame, uint64_t parts, uint64_t added) {
    frame.parts = capped(frame.parts + parts);
    frame.added = capped(frame.added + added);
}

void add_item(group_frame &frame, uint64_t parts, bool can_be_empty, uint64_t chain) {
    add_parts(frame, parts, 0);
    frame.before_empty = frame.before_empty && frame.last_empty;
    frame.last = parts;
    frame.last_empty = can_be_empty;
    frame.last_chain = chain;
    frame.chain_max = std::max(frame.chain_max, chain);
    frame.branch_start = false;
}

// Nothing repeats an anchor: a repetition sign after it is an ordinary character, or refused.
void add_anchor(group_frame &frame, uint64_t parts) {
    add_item(frame, parts, true, 1);
    frame.last = 0;
}

// Ends an alternative of the group, counting it when it can match nothing.
void end_branch(group_frame &frame) {
    if (frame.before_empty && frame.last_empty) {
        ++frame.empty_branches;
    }
    frame.last = 0;
    frame.last_empty = true;
    frame.before_empty = true;
}

// A finished group as an item of its parent: one part and its content, and one place to take or
// skip for every alternative beyond the first that can match nothing.
void close_group(group_frame &group, group_frame &parent) {
    end_branch(group);
    uint64_t ways = group.empty_branches > 1 ? group.empty_branches - 1 : 0;
    uint64_t parts = capped(group.parts + 1 + ways * SKIPPABLE_PARTS);
    add_item(parent, parts, group.empty_branches > 0, group.chain_max);
    parent.added = capped(parent.added + group.added);
}

struct repetition {
    uint64_t copies;   // copies written out; 0 still builds one before dropping it
    uint64_t optional; // of which may be left out (besides one under a '*')
    bool open_end;     // the last copy stands under a '*'
    bool counted;      // what it adds is held to the budget
};

void repeat_last(group_frame &frame, const repetition &how) {
    uint64_t extra = capped(frame.last * (std::max<uint64_t>(how.copies, 1) - 1));
    if (frame.last_empty) {
        extra = capped(extra + (how.optional + (how.open_end ? 1 : 0)) * SKIPPABLE_PARTS);
    }
    add_parts(frame, extra, how.counted ? extra : 0);
    frame.last = capped(frame.last + extra);
    uint64_t required = how.copies - how.optional - (how.open_end ? 1 : 0);
    frame.last_empty = frame.last_empty || required == 0;
    frame.branch_start = false;
}

// The end of the bracket expression that opens at `at`. Inside it a backslash is an ordinary
// character; a ']' first (after an optional '^') is one of the set; "[:", "[=" and "[." open a
// class, an equivalence class or a collating symbol that ends at ":]", "=]" or ".]". Unterminated,
// it runs to the end of the text (and the compiler refuses it).
size_t past_bracket(std::string_view text, size_t at) {
    size_t i = at + 1;
    if (i < text.size() && text[i] == '^') {
        ++i;
    }
    if (i < text.size() && text[i] == ']') {
        ++i;
    }
    while (i < text.size()) {
        char c = text[i];
        if (c == ']') {
            return i + 1;
        }
        if (c == '[' && i + 1 < text.size() &&
            (text[i + 1] == ':' || text[i + 1] == '=' || text[i + 1] == '.')) {
            const char closing[] = {text[i + 1], ']'};
            size_t end = text.find(std::string_view(closing, 2), i + 2);
            if (end == std::string_view::npos) {
                return text.size();
            }
            i = end + 2;
            continue;
        }
        ++i;
    }
    return text.size();
}

// The length of the digit of a counted repetition at `at`, 0 when there is none: the compiler
// takes "\0" for the digit 0 as well (other escaped digits are back-references, which it refuses).
size_t digit_length(std::string_view text, size_t at) {
    std::string_view rest = text.substr(at);
    return !rest.empty() && rest[0] >= '0' && rest[0] <= '9' ? 1 : rest.starts_with("\\0") ? 2 : 0;
}

// A number of a repetition at `at`, read up to the ceiling; `found` says whether there was a digit.
uint64_t read_count(std::string_view text, size_t &at, bool &found) {
    uint64_t value = 0;
    found = false;
    for (size_t length = digit_length(text, at); length != 0; length = digit_length(text, at)) {
        uint64_t digit = static_cast<uint64_t>(text[at + length - 1] - '0');
        value = std::min(value * 10 + digit, NUMBER_CEILING);
        at += length;
        found = true;
    }
    return value;
}

// The length of the comma of a counted repetition at `at`, 0 when there is none: the compiler
// takes an escaped comma for one as well.
size_t comma_length(std::string_view text, size_t at) {
    std::string_view rest = text.substr(at);
    return rest.starts_with(',') ? 1 : rest.starts_with("\\,") ? 2 : 0;
}

struct counted_repetition {
    bool well_formed; // false: the compiler refuses it; it is read as ordinary characters
    uint64_t bound;   // the larger number given
    repetition how;
    size_t end; // just past the closing "\}"
};

// "\{m\}", "\{m,\}" or "\{m,n\}" at `at`; a missing number ("\{,n\}", "\{,\}") is 0. "\{m,n\}"
// writes n copies, the last n - m optional; "\{m,\}" writes m copies and one more under a '*'
// ("\{0,\}" only that one).
counted_repetition read_counted_repetition(std::string_view text, size_t at) {
    size_t i = at + 2;
    bool has_low = false;
    bool has_high = false;
    uint64_t low = read_count(text, i, has_low);
    size_t comma = comma_length(text, i);
    bool has_comma = comma != 0;
    uint64_t high = 0;
    if (has_comma) {
        i += comma;
        high = read_count(text, i, has_high);
    }
    bool closed = i + 1 < text.size() && text[i] == '\\' && text[i + 1] == '}';
    if (!closed || (!has_low && !has_comma)) {
        return {false, 0, {}, at};
    }
    repetition how{low, 0, false, true};
    if (has_comma && has_high) {
        how.copies = std::max(low, high);
        how.optional = how.copies - low;
    } else if (has_comma) {
        how.copies = low + 1;
        how.optional = 0;
        how.open_end = true;
    }
    return {true, std::max(low, high), how, i + 2};
}

// A '$' anchors only at the end of the expression, of a group or of an alternative.
bool dollar_anchors(std::string_view text, size_t at) {
    std::string_view rest = text.substr(at + 1);
    return rest.empty() || rest.starts_with("\\)") || rest.starts_with("\\|");
}

} // namespace

expression_weight weigh_expression(std::string_view text) {
    group_frame frames[EXPRESSION_NESTING_MAX + 1];
    size_t depth = 0;
    size_t at = 0;
    while (at < text.size()) {
        group_frame &top = frames[depth];
        char c = text[at];
        if (c == '[') {
            at = past_bracket(text, at);
            add_item(top, 1, false, 1);
            continue;
        }
        // '*' with nothing before it to repeat is an ordinary character; likewise "\+", "\?".
        if (c == '*' && top.last != 0) {
            repeat_last(top, {1, 0, true, false});
            ++at;
            continue;
        }
        if ((c == '^' && top.branch_start) || (c == '$' && dollar_anchors(text, at))) {
            add_anchor(top, ANCHOR_PARTS);
            ++at;
            continue;
        }
        if (c != '\\' || at + 1 == text.size()) {
            add_item(top, 1, false, 1);
            ++at;
            continue;
        }
        char escaped = text[at + 1];
        at += 2;
        if (escaped == '(') {
            if (depth == EXPRESSION_NESTING_MAX) {
                return {false, REASON_NESTING};
            }
            frames[++depth] = group_frame{};
        } else if (escaped == ')' && depth > 0) {
            --depth;
            close_group(frames[depth + 1], frames[depth]);
        } else if (escaped == '|') {
            end_branch(top);
            top.branch_start = true;
        } else if (escaped == '?' && top.last != 0) {
            repeat_last(top, {1, 1, false, true});
        } else if (escaped == '+' && top.last != 0) {
            repeat_last(top, {2, 0, true, true});
        } else if (escaped == '{' && top.last != 0) {
            counted_repetition counted = read_counted_repetition(text, at - 2);
            if (!counted.well_formed) {
                add_item(top, 1, false, 1);
                continue;
            }
            if (counted.bound > REPETITION_COUNT_MAX) {
                return {false, REASON_COUNT};
            }
            top.last_chain *= std::max<uint64_t>(counted.bound, 1);
            if (top.last_chain > REPETITION_COUNT_MAX) {
                return {false, REASON_NESTED};
            }
            top.chain_max = std::max(top.chain_max, top.last_chain);
            repeat_last(top, counted.how);
            at = counted.end;
        } else if (escaped == 'b' || escaped == 'B') {
            add_anchor(top, SKIPPABLE_PARTS);
        } else if (escaped == '<' || escaped == '>' || escaped == '`' || escaped == '\'') {
            add_anchor(top, ANCHOR_PARTS);
        } else if (escaped >= '1' && escaped <= '9') {
            add_item(top, 1, true, 1); // matches nothing when its group matched nothing
        } else {
            add_item(top, 1, false, 1); // a class such as "\w", or an escaped character
        }
    }
    // Groups left open are refused by the compiler, but only after it has written out what they
    // hold.
    for (; depth > 0; --depth) {
        close_group(frames[depth], frames[depth - 1]);
    }
    if (frames[0].added > EXPANSION_PARTS_MAX) {
        return {false, REASON_EXPANSION};
    }
    return {true, nullptr};
}

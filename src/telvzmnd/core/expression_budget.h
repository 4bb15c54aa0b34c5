// The cost of a process name expression before it is compiled. The C library's compiler writes
// every repetition out copy by copy, links every part to every part it can reach without reading
// a character, copies those links again for every anchor on the way, and follows every way
// through parts that may be skipped: "a\{1,32767\}" takes over a minute and 6.5 GB,
// "\(\<\)\{1,255\}" over a gigabyte, and twenty-two copies of "\(\)\{0,1\}" before a "\(\)*"
// three seconds. A row whose repetitions would expand it beyond a fixed budget is treated as a row
// whose expression does not compile; every other row is compiled exactly as written.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

// The largest count a counted repetition may ask for, alone or multiplied through the groups
// around it: the least every POSIX system accepts (RE_DUP_MAX), so no portable expression needs
// more.
inline constexpr uint32_t REPETITION_COUNT_MAX = 255;
// The most parts that the repetitions of one expression may add when they are written out. A
// character, a bracket expression, a back-reference and a group are one part; an anchor is
// ANCHOR_PARTS; a word boundary ("\b", "\B": two anchors, either of which may hold) and every
// place where a part that can match nothing may be taken or skipped (a copy a repetition may
// leave out, a '*' over such a part) are SKIPPABLE_PARTS, since the compiler follows each way
// through them apart. Within this budget the repetitions of a row of 249 characters cost the
// compiler at most some 10 MB and a fifth of a second. What is written by hand is not bounded:
// word boundaries, alternatives of anchors and anchors under a '*' cost it dearly without any
// repetition.
inline constexpr uint32_t EXPANSION_PARTS_MAX = 512;
inline constexpr uint32_t ANCHOR_PARTS = 16;
inline constexpr uint32_t SKIPPABLE_PARTS = 128;
// Groups open at once that the weighing follows; a row of 249 characters opens at most 124.
inline constexpr size_t EXPRESSION_NESTING_MAX = 128;

struct expression_weight {
    bool within_budget; // true: compile it as written
    const char *reason; // otherwise why not, a short static text; null when within the budget
};

// Weighs a basic-syntax expression as the compiler writes out its repetitions: "\{m\}",
// "\{m,\}", "\{m,n\}" and their short forms "\?" (= "\{0,1\}") and "\+" (= "\{1,\}"). What is
// written by hand is never counted against the budget, only what the repetitions add. Pure: no
// I/O, no allocation.
expression_weight weigh_expression(std::string_view expression);

// A name matcher for the process_name_matcher seam that records every match the library asks for,
// and what topDataBlock held at that moment, before it matches as regexec does.
#pragma once

#include <cstddef>
#include <ostream>
#include <regex.h>
#include <string>
#include <vector>

#include "data_blocks.h"

struct matcher_call {
    const regex_t *expression;
    std::string name;
    size_t nmatch;
    std::string top = {}; // topDataBlock, all its bytes, when the name was matched

    // What was asked; the block's bytes are looked at by the tests that care, one by one.
    bool operator==(const matcher_call &other) const {
        return expression == other.expression && name == other.name && nmatch == other.nmatch;
    }
};

inline void PrintTo(const matcher_call &call, std::ostream *out) {
    *out << "{" << static_cast<const void *>(call.expression) << ", \"" << call.name
         << "\", nmatch " << call.nmatch << "}";
}

inline std::vector<matcher_call> matcher_calls;

// Writes every match slot the caller says it has, so that under AddressSanitizer a match array
// smaller than nmatch fails here.
inline int recording_matcher(const regex_t *expression, const char *name, size_t nmatch,
                             regmatch_t *found, int flags) {
    matcher_calls.push_back(
        {expression, name, nmatch, std::string(topDataBlock, TOP_DATA_BLOCK_SIZE)});
    for (size_t i = 0; i < nmatch; ++i) {
        found[i] = regmatch_t{-2, -2};
    }
    return regexec(expression, name, nmatch, found, flags);
}

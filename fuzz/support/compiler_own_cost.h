// Expressions whose cost is the C library's compiler's own, with or without a repetition: word
// boundaries ("\b" sixty times takes 1.5 GB), alternatives of anchors ("\(^\|$\)" thirty times,
// 300 MB) and anchors in groups under a '*' ("\(^\)*" twenty times, seconds). The repetition budget
// does not claim to bound them, so the targets that hold the compiler to a memory limit leave texts
// holding them out.
#pragma once

#include <string_view>

inline bool has_compiler_own_cost(std::string_view text) {
    for (std::string_view piece :
         {"\\b", "\\B", "\\|", "\\<", "\\>", "\\`", "\\'", "\\(^", "$\\)"}) {
        if (text.find(piece) != std::string_view::npos) {
            return true;
        }
    }
    return false;
}

// The weighing of process name expressions, fed any text: it must read nothing outside the text,
// its verdict and reason must agree, a text without repetitions must be within the budget, and
// every expression it lets through (of a length a row can hold) must compile within the memory
// limit and the time this target runs under.
#include <cstddef>
#include <cstdint>
#include <regex.h>
#include <string>
#include <string_view>

#include "core/control_file.h"
#include "core/expression_budget.h"
#include "support/compiler_own_cost.h"

namespace {

bool has_repetition(std::string_view text) {
    return text.find("\\{") != std::string_view::npos ||
           text.find("\\?") != std::string_view::npos || text.find("\\+") != std::string_view::npos;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string_view text(reinterpret_cast<const char *>(data), size);
    expression_weight weight = weigh_expression(text);
    if (weight.within_budget != (weight.reason == nullptr)) {
        __builtin_trap();
    }
    // Groups cannot nest past what the weighing follows in a text this short.
    if (size <= 2 * EXPRESSION_NESTING_MAX && !has_repetition(text) && !weight.within_budget) {
        __builtin_trap();
    }
    if (!weight.within_budget || size > CONTROL_WORD_MAX ||
        text.find('\0') != std::string_view::npos || has_compiler_own_cost(text)) {
        return 0;
    }
    // The log table's flags, the dearer of the two tables'.
    std::string expression(text);
    regex_t compiled;
    if (regcomp(&compiled, expression.c_str(), 0) == 0) {
        regfree(&compiled);
    }
    return 0;
}

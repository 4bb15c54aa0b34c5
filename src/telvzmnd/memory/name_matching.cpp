#include "memory/name_matching.h"

#include <algorithm>

#include "core/settings.h"

name_matcher process_name_matcher = regexec;

namespace {

// An expression of at most 249 characters has fewer groups than this; regexec is given room for
// as many matches as it is asked for.
constexpr size_t MATCH_CAPACITY = PROCESS_MASK_SIZE / 2 + 2;

bool matches(const regex_t &expression, const char *name, size_t nmatch) {
    regmatch_t found[MATCH_CAPACITY];
    return process_name_matcher(&expression, name, std::min(nmatch, MATCH_CAPACITY), found, 0) == 0;
}

template <typename Row>
const Row *first_match(const Row *table, int32_t rows, const char *name, size_t extra_matches) {
    for (int32_t i = 0; table != nullptr && i < rows; ++i) {
        const Row &row = table[i];
        if (row.compiled == 1 &&
            matches(row.expression, name, row.expression.re_nsub + extra_matches)) {
            return &row;
        }
    }
    return nullptr;
}

} // namespace

const log_threshold *first_log_match(const char *name) {
    return first_match(logtable, num_log_thresholds, name, 0);
}

const abort_threshold *first_abort_match(const char *name) {
    return first_match(aborttable, num_abort_thresholds, name, 1);
}

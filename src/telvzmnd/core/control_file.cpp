#include "core/control_file.h"

#include <algorithm>
#include <cstring>
#include <string_view>

#include "allocation.h"
#include "core/expression_budget.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "core/words.h"
#include "modsvc.h"
#include "tracesvc.h"

external_call *calllist1;
log_threshold *logtable;
abort_threshold *aborttable;

namespace {

// The dump of a compiled expression reads its first 64 bytes; they lie inside the row.
static_assert(offsetof(log_threshold, expression) + EXPRESSION_DUMP_LENGTH <=
              sizeof(log_threshold));
static_assert(offsetof(abort_threshold, expression) + EXPRESSION_DUMP_LENGTH <=
              sizeof(abort_threshold));
static_assert(CONTROL_WORD_MAX < PROCESS_MASK_SIZE, "a mask copied from a word stays terminated");
static_assert(2 * EXPRESSION_NESTING_MAX >= CONTROL_WORD_MAX,
              "the weighing follows every group a mask can open");

control_file_problem problems[CONTROL_FILE_PROBLEMS_KEPT];
int32_t problem_count;

// Splits the text from a line's first byte into the first 12 slots of `words`. The split does not
// stop at the line feed: a line of fewer than 12 words takes the rest from the following lines, so
// a keyword without its value takes the next line's first word. Kept: files in the field rely on
// how such lines have always been read. A word is cut at 249 characters; the rest of it is
// skipped, so it never spills into the next slot.
class word_splitter {
  public:
    void split(const char *text) {
        const char *at = skip_blanks(text);
        // Lines whose split begins at the same first word (blank lines before it) get the same
        // words: they are split once, so that no word is scanned once for every such line.
        if (at == last_first_word) {
            return;
        }
        last_first_word = at;
        std::memset(words, 0, CONTROL_LINE_WORDS * WORD_SIZE);
        for (int n = 0; n < CONTROL_LINE_WORDS; ++n) {
            at = skip_blanks(at);
            if (*at == '\0') {
                break;
            }
            size_t length = 0;
            while (at[length] != '\0' && !is_blank(at[length])) {
                ++length;
            }
            std::memcpy(words[n], at, length < CONTROL_WORD_MAX ? length : CONTROL_WORD_MAX);
            at += length;
        }
    }

  private:
    // Every line of a run of blank lines splits from inside the same run; the run is remembered
    // so that it is scanned once, not once a line.
    const char *skip_blanks(const char *at) {
        if (at >= blank_from && at < blank_to) {
            return blank_to;
        }
        const char *start = at;
        while (is_blank(*at)) {
            ++at;
        }
        if (at != start) {
            blank_from = start;
            blank_to = at;
        }
        return at;
    }

    const char *blank_from = nullptr;
    const char *blank_to = nullptr;
    const char *last_first_word = nullptr;
};

// Copies at most `limit` characters of `from` into the zeroed field `to`.
void copy_into_zeroed(char *to, const char *from, size_t limit) {
    std::memcpy(to, from, strnlen(from, limit));
}

void trace_words(const char *format) {
    tracesvc_trace(format, words[0], words[1], words[2], words[3], words[4], words[5], words[6],
                   words[7], words[8], words[9], words[10], words[11]);
}

// Calls `visit(line, number)` for every line that ends in a line feed, with the line's words split
// into `words`; text after the last line feed is never visited.
template <typename Visit>
void for_each_line(const char *fileData, Visit visit) {
    word_splitter splitter;
    const char *line_start = fileData;
    int32_t number = 1;
    for (const char *end = std::strchr(line_start, '\n'); end != nullptr;
         end = std::strchr(line_start, '\n')) {
        splitter.split(line_start);
        visit(line_start, number);
        line_start = end + 1;
        ++number;
    }
}

// Only a '*' as the very first byte makes a comment; after a blank it is part of the first word.
bool is_comment(const char *line_start) {
    return line_start[0] == '*';
}

void apply_setting(const setting &entry, const char *value) {
    switch (entry.handling) {
    case setting_handling::plain:
        *entry.value = read_number(value);
        break;
    case setting_handling::flag:
        *entry.value = 1;
        break;
    case setting_handling::checking_interval:
        if (manualStart != 1) {
            int32_t seconds = read_number(value);
            *entry.value = seconds < CHECKING_INTERVAL_MIN ? CHECKING_INTERVAL_DEFAULT : seconds;
        }
        break;
    case setting_handling::capped_count: {
        int32_t count = read_number(value);
        *entry.value = count > TREND_SAMPLES_MAX ? TREND_SAMPLES_MAX : count;
        break;
    }
    case setting_handling::snapshot_size: {
        // Computed and compared unsigned: a negative value wraps to a large size, as it always has.
        uint32_t bytes = static_cast<uint32_t>(read_number(value)) * SNAPSHOT_SIZE_UNIT;
        *entry.unsigned_value = bytes < PRIMARY_DATA_BLOCK_SIZE
                                    ? static_cast<uint32_t>(PRIMARY_DATA_BLOCK_SIZE)
                                    : bytes;
        break;
    }
    case setting_handling::row_counter:
        ++*entry.value;
        break;
    }
}

void first_pass_line(const char *line_start) {
    trace_words("TARNMNDF:    Input data = [%s] [%s] [%s] [%s] [%s] [%s] [%s] [%s] [%s] [%s] "
                "[%s] [%s]");
    if (is_comment(line_start)) {
        return;
    }
    for (const setting &entry : SETTINGS) {
        if (entry.keyword == words[0]) {
            apply_setting(entry, words[1]);
        }
    }
}

void trace_settings() {
    for (const setting &entry : SETTINGS) {
        tracesvc_trace(entry.trace, static_cast<int32_t>(setting_current(entry)));
    }
}

// Allocates and clears a table of `count` rows. On failure the count becomes 0, *crc the table's
// reason code, and the failure is reported.
template <typename Row>
void allocate_table(Row *&table, int32_t &count, const char *pointer_trace, const char *count_trace,
                    uint32_t reason, uint32_t &src, uint32_t *crc) {
    if (count <= 0) {
        return;
    }
    size_t size = static_cast<size_t>(count) * sizeof(Row);
    table = static_cast<Row *>(TARN_MALLOC(size));
    if (table != nullptr) {
        std::memset(static_cast<void *>(table), 0, size);
        return;
    }
    tracesvc_trace("TARNMNDF: Error on malloc");
    tracesvc_trace(pointer_trace, static_cast<void *>(table));
    tracesvc_trace(count_trace, count);
    count = 0;
    *crc = reason;
    src = tarn_mon_error_handler(src | 2, 0, *crc);
}

void note_problem(control_file_problem_kind kind, int32_t line, const char *first,
                  const char *second, uint32_t rc, uint32_t crc) {
    if (problem_count < CONTROL_FILE_PROBLEMS_KEPT) {
        control_file_problem &problem = problems[problem_count];
        std::memset(&problem, 0, sizeof problem);
        problem.kind = kind;
        problem.line = line;
        copy_into_zeroed(problem.keyword, words[0], WORD_SIZE - 1);
        copy_into_zeroed(problem.first, first, WORD_SIZE - 1);
        copy_into_zeroed(problem.second, second, WORD_SIZE - 1);
        problem.rc = rc;
        problem.crc = crc;
    }
    ++problem_count;
}

// Compiles the row's expression; the row counts (its index may advance) only when it compiled.
// An expression whose repetitions would cost the compiler more than their budget is not handed to
// it: such a row fares as one the compiler refused, with one trace that says why.
template <typename Row>
bool compile_row(Row &row, const char *mask, int flags, int32_t line) {
    std::memset(static_cast<void *>(&row), 0, sizeof row);
    copy_into_zeroed(row.process_mask, mask, PROCESS_MASK_SIZE);
    expression_weight weight = weigh_expression(row.process_mask);
    if (!weight.within_budget) {
        tracesvc_trace("TARNMNDF: expression [%s] not compiled: %s", row.process_mask,
                       weight.reason);
        note_problem(control_file_problem_kind::uncompiled_expression, line, row.process_mask,
                     weight.reason, 0, 0);
        return false;
    }
    int result = regcomp(&row.expression, row.process_mask, flags);
    if (result != 0) {
        char message[WORD_SIZE];
        regerror(result, &row.expression, message, sizeof message);
        note_problem(control_file_problem_kind::uncompiled_expression, line, row.process_mask,
                     message, 0, 0);
        return false;
    }
    row.compiled = 1;
    return true;
}

struct second_pass_state {
    int32_t external_row = 0;
    int32_t log_row = 0;
    int32_t abort_row = 0;
};

void resolve_routine(external_call &entry, int32_t line, uint32_t &src, uint32_t *crc) {
    copy_into_zeroed(entry.name, words[2], EXTERNAL_NAME_SIZE - 1);
    uint32_t rc = modsvc_get_func_addr2(words[1], words[2], &entry.address, &entry.handle, crc);
    if (rc != 0) {
        // The loop calls every entry whose address is not null, whatever the service left there.
        entry.address = nullptr;
        tracesvc_trace("TARNMNDF: Error on modsvc_get_func_addr2()");
        tracesvc_trace("TARNMNDF: src = %d, crc = %d (dec)", rc, *crc);
        note_problem(control_file_problem_kind::unresolved_routine, line, words[1], words[2], rc,
                     *crc);
        src = tarn_mon_error_handler(src | 2, *crc, RC_EXTERNAL_ROUTINE_UNRESOLVED);
    }
}

void second_pass_line(const char *line_start, int32_t line, second_pass_state &rows, uint32_t &src,
                      uint32_t *crc) {
    trace_words("TARNMNDF:  second pass Input data = [%s] [%s] [%s] [%s] [%s] [%s] [%s] [%s] "
                "[%s] [%s] [%s] [%s]");
    if (is_comment(line_start)) {
        return;
    }
    std::string_view keyword = words[0];
    if (keyword == KEYWORD_EXTERNAL_ROUTINE && rows.external_row < num_external_calls) {
        resolve_routine(calllist1[rows.external_row], line, src, crc);
        ++rows.external_row;
    } else if (keyword == KEYWORD_LOG_THRESHOLDS && rows.log_row < num_log_thresholds) {
        log_threshold &row = logtable[rows.log_row];
        if (compile_row(row, words[5], 0, line)) {
            row.rss_limit = read_number(words[1]);
            row.dsiz_limit = read_number(words[2]);
            row.vsize_limit = read_number(words[3]);
            row.memoryCheckFlag = read_number(words[4]);
            ++rows.log_row;
        }
    } else if (keyword == KEYWORD_ABORT_THRESHOLDS && rows.abort_row < num_abort_thresholds) {
        abort_threshold &row = aborttable[rows.abort_row];
        if (compile_row(row, words[4], REG_NOSUB, line)) {
            row.rss_abort_limit = read_number(words[1]);
            row.dsiz_abort_limit = read_number(words[2]);
            row.vsize_abort_limit = read_number(words[3]);
            ++rows.abort_row;
        }
    }
}

void dump_expression(const regex_t &expression) {
    tracesvc_dump_bytes("TARNOTHF: compiled regular expression is: ", &expression,
                        EXPRESSION_DUMP_LENGTH);
}

void trace_tables() {
    tracesvc_trace("TARNOTHF: ==========================================");
    if (calllist1 != nullptr) {
        for (int32_t i = 0; i < num_external_calls; ++i) {
            const external_call &entry = calllist1[i];
            tracesvc_trace("TARNOTHF: External call table entry %d is: ", i);
            tracesvc_trace("TARNOTHF:   function name is [%s]", entry.name);
            tracesvc_trace("TARNOTHF:   address of function is %p", entry.address);
            tracesvc_trace("TARNOTHF:   handle is %p", entry.handle);
        }
    } else {
        tracesvc_trace("TARNOTHF: external call table is NULL");
    }
    tracesvc_trace("TARNOTHF: ==========================================");
    if (logtable != nullptr) {
        for (int32_t i = 0; i < num_log_thresholds; ++i) {
            const log_threshold &row = logtable[i];
            tracesvc_trace("TARNOTHF: Log threshold table entry %d is: ", i);
            tracesvc_trace("TARNOTHF:   process name/mask is [%s]", row.process_mask);
            tracesvc_trace("TARNOTHF:   rss threshold is %d", row.rss_limit);
            tracesvc_trace("TARNOTHF:   dsiz threshold is %d", row.dsiz_limit);
            tracesvc_trace("TARNOTHF:   vsize threshold is %d", row.vsize_limit);
            tracesvc_trace("TARNOTHF:   memoryCheckFlag is %d", row.memoryCheckFlag);
            dump_expression(row.expression);
        }
    } else {
        tracesvc_trace("TARNOTHF: Log table is NULL");
    }
    tracesvc_trace("TARNOTHF: ==========================================");
    if (aborttable != nullptr) {
        for (int32_t i = 0; i < num_abort_thresholds; ++i) {
            const abort_threshold &row = aborttable[i];
            tracesvc_trace("TARNOTHF: abort threshold table entry %d is: ", i);
            tracesvc_trace("TARNOTHF:   process name/mask is [%s]", row.process_mask);
            tracesvc_trace("TARNOTHF:   rss abort threshold is %d", row.rss_abort_limit);
            tracesvc_trace("TARNOTHF:   dsiz abort threshold is %d", row.dsiz_abort_limit);
            tracesvc_trace("TARNOTHF:   vsize abort threshold is %d", row.vsize_abort_limit);
            dump_expression(row.expression);
        }
    } else {
        tracesvc_trace("TARNOTHF: Abort table is NULL");
    }
    tracesvc_trace("TARNOTHF: ==========================================");
}

} // namespace

TARN_EXPORT uint32_t tarn_parse_control_file(const char *fileData, uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> tarn_parse_control_file()");
    uint32_t src = 0;
    *crc = 0;
    problem_count = 0;

    for_each_line(fileData, [](const char *line_start, int32_t) { first_pass_line(line_start); });
    trace_settings();

    // The tables are sized by the first pass; the three allocations are tried whatever the
    // earlier ones gave, and any failure skips the whole second pass.
    allocate_table(calllist1, num_external_calls, "TARNMNDF: calllist1 = %p",
                   "TARNMNDF: num_external_calls = %d", RC_NO_MEMORY_EXTERNAL_TABLE, src, crc);
    allocate_table(logtable, num_log_thresholds, "TARNMNDF: logtable = %p",
                   "TARNMNDF: num_log_thresholds = %d", RC_NO_MEMORY_LOG_TABLE, src, crc);
    allocate_table(aborttable, num_abort_thresholds, "TARNMNDF: aborttable = %p",
                   "TARNMNDF: num_abort_thresholds = %d", RC_NO_MEMORY_ABORT_TABLE, src, crc);
    tracesvc_trace("TARNMNDF: sysRc = %d (dec)", src);
    tracesvc_trace("TARNMNDF: calllist1 = %p", static_cast<void *>(calllist1));
    tracesvc_trace("TARNMNDF: logtable = %p", static_cast<void *>(logtable));
    tracesvc_trace("TARNMNDF: aborttable = %p", static_cast<void *>(aborttable));

    if (src == 0) {
        second_pass_state rows;
        for_each_line(fileData, [&](const char *line_start, int32_t line) {
            second_pass_line(line_start, line, rows, src, crc);
        });
    }

    trace_tables();
    tracesvc_trace("TARNOTHF: <-- tarn_parse_control_file(), src = %x, crc = %x (hex)", src, *crc);
    return src;
}

void free_compiled_expressions() {
    for (int32_t i = 0; logtable != nullptr && i < num_log_thresholds; ++i) {
        if (logtable[i].compiled == 1) {
            regfree(&logtable[i].expression);
        }
    }
    for (int32_t i = 0; aborttable != nullptr && i < num_abort_thresholds; ++i) {
        if (aborttable[i].compiled == 1) {
            regfree(&aborttable[i].expression);
        }
    }
}

// The compiled expressions inside the rows are not given back with regfree: the monitor has never
// released them, and a table is freed only when monitoring ends.
void release_control_file_tables(uint32_t *crc) {
    if (calllist1 != nullptr) {
        for (int32_t i = 0; i < num_external_calls; ++i) {
            external_call &entry = calllist1[i];
            if (entry.address != nullptr && entry.handle != nullptr) {
                modsvc_release_func_addr(entry.name, entry.handle, crc);
            }
        }
        TARN_FREE(calllist1);
        calllist1 = nullptr;
    }
    if (logtable != nullptr) {
        TARN_FREE(logtable);
        logtable = nullptr;
    }
    if (aborttable != nullptr) {
        TARN_FREE(aborttable);
        aborttable = nullptr;
    }
}

void read_control_file_tables(control_file_tables *tables) {
    tables->calls = calllist1;
    tables->call_count = num_external_calls;
    tables->log_rows = logtable;
    tables->log_count = num_log_thresholds;
    tables->abort_rows = aborttable;
    tables->abort_count = num_abort_thresholds;
    tables->problems = problems;
    tables->problem_count = problem_count;
}

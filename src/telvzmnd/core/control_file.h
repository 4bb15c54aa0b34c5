// The control file "telvzopt.trm": its parser, and the three tables it builds beside the settings
// (external checking routines, per-process log thresholds, per-process abort thresholds).
#pragma once

#include <cstddef>
#include <cstdint>
#include <regex.h>

#include "data_blocks.h"
#include "export.h"

inline constexpr const char *CONTROL_FILE_NAME = "telvzopt.trm";
inline constexpr uint32_t CONTROL_FILE_MAX = 100000; // bytes read; byte 99,999 is forced to NUL
inline constexpr uint32_t CONTROL_FILE_MIN = 2;      // fewer bytes read is a failed read
inline constexpr int CONTROL_LINE_WORDS = 12;        // words split from each line
inline constexpr size_t CONTROL_WORD_MAX = WORD_SIZE - 1; // a longer word is cut
inline constexpr size_t EXTERNAL_NAME_SIZE = 100;
inline constexpr size_t PROCESS_MASK_SIZE = 250;
inline constexpr uint32_t EXPRESSION_DUMP_LENGTH = 64; // bytes of a compiled expression traced

// An external checking routine: it may read the control file's text and may set *returnedData to
// a NUL-terminated text (lines ending "\n\r") that stays valid after it returns.
using external_check_routine = void (*)(const char *fileData, char **returnedData);

// A row of the external routine table.
struct external_call {
    char name[EXTERNAL_NAME_SIZE]; // routine name, at most 99 characters and a NUL
    void *address;                 // the routine (external_check_routine); null when unresolved
    void *handle;                  // the module service's handle, given back on release
};

// A row of the log table: a process whose name matches `expression` is logged above these limits.
struct log_threshold {
    char process_mask[PROCESS_MASK_SIZE]; // the expression text, NUL-padded
    regex_t expression;                   // compiled with flags 0
    int32_t rss_limit;                    // KB
    int32_t dsiz_limit;                   // KB
    int32_t vsize_limit;                  // KB
    int32_t memoryCheckFlag;              // 1 = the trend analysis watches matching processes
    uint32_t compiled;                    // 1 = the row takes part in matching
};

// A row of the abort table: a process whose name matches is killed above these limits.
struct abort_threshold {
    char process_mask[PROCESS_MASK_SIZE];
    regex_t expression;        // compiled with REG_NOSUB
    int32_t rss_abort_limit;   // KB
    int32_t dsiz_abort_limit;  // KB
    int32_t vsize_abort_limit; // KB
    uint32_t compiled;
};

// The tables, sized by the first pass; null while their count is 0 or after release.
extern external_call *calllist1;
extern log_threshold *logtable;
extern abort_threshold *aborttable;

// Parses the NUL-terminated control file text: sets the settings globals, builds and fills the
// tables, resolves the external routines and traces all of it. Returns src, 0 when all went well,
// else the result of the last problem report. Out: *crc.
TARN_EXPORT uint32_t tarn_parse_control_file(const char *fileData, uint32_t *crc);

// Gives back every resolved routine to the module service and frees the three tables, setting
// their pointers to null; the counts stay. Out: *crc, as left by the module service.
void release_control_file_tables(uint32_t *crc);
// Gives back the compiled expressions of the rows, which the monitor keeps to the end of the
// process; for whoever parses many times in one process (tests, the fuzz target), before the
// release of the tables.
void free_compiled_expressions();

// What the monitor passes over without a word, kept so that a checker can name it: a row whose
// expression did not compile (the monitor drops it) and a routine that did not resolve.
enum class control_file_problem_kind : uint8_t { uncompiled_expression, unresolved_routine };

struct control_file_problem {
    control_file_problem_kind kind;
    int32_t line; // 1 = the file's first line
    char keyword[WORD_SIZE];
    char first[WORD_SIZE];  // the expression, or the module
    char second[WORD_SIZE]; // why it does not compile, or the routine
    uint32_t rc;            // the module service's result and crc (unresolved routine)
    uint32_t crc;
};

inline constexpr int CONTROL_FILE_PROBLEMS_KEPT = 16;

// The tables and problems of the last parse in one piece, for the checker of control files.
struct control_file_tables {
    const external_call *calls;
    int32_t call_count;
    const log_threshold *log_rows;
    int32_t log_count;
    const abort_threshold *abort_rows;
    int32_t abort_count;
    const control_file_problem *problems; // the first CONTROL_FILE_PROBLEMS_KEPT of them
    int32_t problem_count;                // all of them
};

void read_control_file_tables(control_file_tables *tables);

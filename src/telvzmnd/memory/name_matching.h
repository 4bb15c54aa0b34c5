// Matching a process name against the rows of the control file's log and abort tables: the first
// compiled row whose expression matches wins. The per-process memory check takes its limits from
// the rows, the trend analysis the memoryCheckFlag of the log table's row.
#pragma once

#include <cstddef>
#include <regex.h>

#include "core/control_file.h"

// Matches a process name against a table row's expression: regexec, reached through this one place
// so that a test can see how many matches each table's walk asks for.
using name_matcher = int (*)(const regex_t *expression, const char *name, size_t nmatch,
                             regmatch_t *found, int flags);
extern name_matcher process_name_matcher;

// The lowest row of the log table whose expression compiled and matches `name` (nmatch: the
// expression's number of groups), or null; null too while the table is not there.
const log_threshold *first_log_match(const char *name);
// The same for the abort table, whose walk has always asked for one match more.
const abort_threshold *first_abort_match(const char *name);

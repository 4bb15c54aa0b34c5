// tarnmon limits [--rss KB] ... -- COMMAND [ARGS]: stores memory limits for tarnmon's own pid, as
// any process that loads the library stores its own, and then becomes COMMAND: execvp keeps the
// pid, so the entry is COMMAND's until the monitor no longer finds the pid listed.
#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <unistd.h>
#include <vector>

#include "commands.h"
#include "control_block_view.h"
#include "core/control_block.h"
#include "core/problem_reporting.h"
#include "memory/override_table.h"
#include "snapshot_reader.h"
#include "tracesvc.h"

extern char **environ;

namespace {

// Where the default platform writes its events and its trace.
constexpr const char *EVENT_LOG_VARIABLE = "TELV_EVENT_LOG";
constexpr const char *TRACE_FILE_VARIABLE = "TELV_TRACE_FILE";

using limit_values = std::array<int32_t, std::size(LIMIT_OPTIONS)>;

// A limit as given: whole decimal kilobytes in 0..4194304; 0 when the option was not given.
bool parse_limit(const value_option &option, const char *text, int32_t *value) {
    *value = 0;
    if (text == nullptr) {
        return true;
    }
    std::string_view word = text;
    int64_t number = -1;
    auto [end, error] = std::from_chars(word.data(), word.data() + word.size(), number);
    if (error == std::errc{} && end == word.data() + word.size() && number >= 0 &&
        number <= OVERRIDE_LIMIT_MAX) {
        *value = static_cast<int32_t>(number);
        return true;
    }
    std::fprintf(stderr, "tarnmon: %.*s takes kilobytes in the range 0..%d, not '%s'\n",
                 static_cast<int>(option.name.size()), option.name.data(), OVERRIDE_LIMIT_MAX,
                 terminal_text(word).c_str());
    return false;
}

uint32_t override_thresholds(const limit_values &limits, uint32_t *crc) {
    return tarn_override_thresholds(limits[0], limits[1], limits[2], limits[3], limits[4],
                                    limits[5], crc);
}

// Whether the limits in force for `pid` are `limits`: those of its first entry in use, or none
// (all 0) when it has no entry. Read without the table's lock: after a store only this process
// changes its entry, and the monitor at most removes it.
bool in_force(const tarn_control_block &block, uint32_t pid, const limit_values &limits) {
    for (const override_entry &entry : block.override_table) {
        if (read_field(entry.in_use) == 1 && read_field(entry.pid) == pid) {
            return std::ranges::equal(
                limits, entry_limits(entry),
                [](int32_t given, uint32_t kept) { return static_cast<uint32_t>(given) == kept; });
        }
    }
    return std::ranges::all_of(limits, [](int32_t given) { return given == 0; });
}

// Stores the limits for `pid` and makes sure that they are in force: the library stores nothing,
// and still returns 0, when there is no control block or the table's lock cannot be taken.
// Returns an exit status, having said on standard error what went wrong.
int store(const limit_values &limits, uint32_t pid) {
    control_block_view view = attach_control_block();
    if (view.block == nullptr) {
        std::fprintf(stderr, "tarnmon: %s; the command was not run\n", view.problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    detach_control_block(view);
    uint32_t crc = 0;
    uint32_t src = override_thresholds(limits, &crc);
    const tarn_control_block *block = TARN_CB_PTR;
    if (src == REPORT_RESULT) {
        std::fprintf(stderr,
                     "tarnmon: the override table is full: all %d entries are in use; the command "
                     "was not run\n",
                     OVERRIDE_TABLE_ENTRIES);
        return EXIT_UNAVAILABLE;
    }
    if (src != 0 || block == nullptr || !in_force(*block, pid, limits)) {
        std::fprintf(stderr,
                     "tarnmon: the limits did not reach the override table (src %x, crc %x): its "
                     "lock could not be taken, or the control block went away; the command was "
                     "not run\n",
                     src, crc);
        return EXIT_UNAVAILABLE;
    }
    return EXIT_OK;
}

// This process's environment as it was given, before tarnmon changed any of it for itself.
std::vector<char *> given_environment() {
    std::vector<char *> variables;
    for (char **variable = environ; *variable != nullptr; ++variable) {
        variables.push_back(*variable);
    }
    variables.push_back(nullptr);
    return variables;
}

} // namespace

int command_limits(const command_line &line) {
    if (line.operands.empty()) {
        std::fprintf(stderr, "tarnmon: limits needs a command to run\n");
        return EXIT_USAGE;
    }
    // An entry takes its process out of the control file's per-name rows, whatever limits it
    // holds: an entry nobody asked for would do that unseen.
    if (std::ranges::all_of(LIMIT_OPTIONS, [&line](const value_option &option) {
            return line.*option.value == nullptr;
        })) {
        std::fprintf(stderr, "tarnmon: limits needs at least one limit option\n");
        return EXIT_USAGE;
    }
    limit_values limits{};
    for (size_t i = 0; i < limits.size(); ++i) {
        if (!parse_limit(LIMIT_OPTIONS[i], line.*LIMIT_OPTIONS[i].value, &limits[i])) {
            return EXIT_USAGE;
        }
    }
    // The monitor's trace file and event log record what the monitor did. Setting limits is an
    // operator's step whose outcome is told here: the forty-odd trace lines of a call would only
    // push the monitor's own lines towards the trace file's bound, and a full table refuses the
    // operator's request rather than being a finding on the host. COMMAND gets the environment as
    // tarnmon was given it.
    std::vector<char *> environment = given_environment();
    setenv(EVENT_LOG_VARIABLE, "/dev/null", 1);
    setenv(TRACE_FILE_VARIABLE, "/dev/null", 1);

    uint32_t pid = tracesvc_getpid();
    if (int status = store(limits, pid); status != EXIT_OK) {
        return status;
    }
    std::vector<char *> arguments;
    for (const char *word : line.operands) {
        arguments.push_back(const_cast<char *>(word));
    }
    arguments.push_back(nullptr);
    execvpe(arguments[0], arguments.data(), environment.data());

    // The entry would stay until the monitor found the pid gone: six zeros free it now.
    int error = errno;
    uint32_t crc = 0;
    override_thresholds(limit_values{}, &crc);
    std::fprintf(stderr, "tarnmon: cannot run %s: %s; its limits were removed again\n",
                 terminal_text(arguments[0]).c_str(), std::strerror(error));
    return error == ENOENT ? EXIT_NOT_FOUND : EXIT_CANNOT_EXECUTE;
}

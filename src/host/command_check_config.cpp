// tarnmon check-config [FILE]: reads a control file as the monitor reads it, parses it with the
// monitor's own parser, and says in words whether the monitor would run with it, and if not, why.
// tarnmon run gives the same verdict, from the same code, before it starts the monitor.
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "commands.h"
#include "core/control_file.h"
#include "core/settings.h"
#include "core/validation.h"
#include "filesvc.h"
#include "snapshot_reader.h"

namespace {

// Where the default platform writes its events and its trace.
constexpr const char *EVENT_LOG_VARIABLE = "TELV_EVENT_LOG";
constexpr const char *TRACE_FILE_VARIABLE = "TELV_TRACE_FILE";

// The default platform's data directory, named in messages only: the file itself is reached
// through the platform's data-file service, as the monitor reaches it.
std::string data_directory_for_people() {
    const char *directory = std::getenv("TELV_DATA_DIR");
    return directory != nullptr && directory[0] != '\0' ? directory : "/var/lib/telvzmnd";
}

struct control_text {
    std::vector<char> bytes = std::vector<char>(CONTROL_FILE_MAX, '\0');
    uint32_t length = 0;
    std::string where; // for messages, shown as terminal_text shows it
    int error = 0;     // errno of a failed open or read
    bool opened = false;
};

// The monitor's way: the data-file service, the whole file in one read of at most 100,000 bytes.
void read_through_data_files(control_text &text) {
    text.where = terminal_text(std::string(CONTROL_FILE_NAME) + " in the data directory " +
                               data_directory_for_people());
    filesvc_handle_t handle = 0;
    uint32_t info = 0;
    uint32_t crc = 0;
    if (filesvc_search_file_open(CONTROL_FILE_NAME, FILESVC_OPEN_EXISTING, FILESVC_ACCESS_READ, 1,
                                 64, &handle, &info, &crc) != 0) {
        text.error = crc != 0 ? static_cast<int>(crc) : EIO;
        return;
    }
    text.opened = true;
    if (filesvc_random_read(handle, text.bytes.data(), CONTROL_FILE_MAX, FILESVC_AT_OFFSET, 0,
                            &text.length, &info, &crc) != 0) {
        text.error = crc != 0 ? static_cast<int>(crc) : EIO;
    }
    filesvc_close_file(handle, &crc);
}

void read_from_path(control_text &text, const char *path) {
    text.where = terminal_text(path);
    FILE *file = std::fopen(path, "rb");
    if (file == nullptr) {
        text.error = errno;
        return;
    }
    text.opened = true;
    text.length = static_cast<uint32_t>(std::fread(text.bytes.data(), 1, CONTROL_FILE_MAX, file));
    if (std::ferror(file) != 0) {
        text.error = errno != 0 ? errno : EIO;
    }
    std::fclose(file);
}

// Why the file cannot be read, or empty when it can; the monitor's own limit of 2 bytes included.
std::string read_problem(const control_text &text) {
    std::string reason = text.error != 0 ? std::string(" (") + std::strerror(text.error) + ")" : "";
    if (!text.opened && text.error == ENOENT) {
        return "does not exist; without it the monitor does not run (and reports nothing)";
    }
    if (!text.opened) {
        return "cannot be opened" + reason +
               "; without it the monitor does not run (and reports nothing)";
    }
    if (text.error != 0) {
        return "cannot be read" + reason + "; the monitor reports 0xE081 and does not run";
    }
    if (text.length < CONTROL_FILE_MIN) {
        return "holds fewer than 2 bytes; the monitor reports 0xE081 and does not run";
    }
    return "";
}

// A name or an expression from the file, up to its NUL, as the terminal may be shown it.
template <size_t N>
std::string shown(const char (&field)[N]) {
    return terminal_text(std::string_view(field, strnlen(field, N)));
}

void print_settings() {
    size_t count = 0;
    const setting *table = settings_table(&count);
    std::printf("Settings:\n");
    for (size_t i = 0; i < count; ++i) {
        const setting &entry = table[i];
        if (entry.handling == setting_handling::row_counter) {
            continue;
        }
        std::printf("  %-42.*s %12" PRId64 "  %.*s\n", static_cast<int>(entry.keyword.size()),
                    entry.keyword.data(), setting_current(entry),
                    static_cast<int>(entry.unit.size()), entry.unit.data());
    }
}

void print_tables(const control_file_tables &tables) {
    std::printf("\nExternal checking routines: %d\n", tables.call_count);
    for (int32_t i = 0; tables.calls != nullptr && i < tables.call_count; ++i) {
        const external_call &call = tables.calls[i];
        std::printf("  %d: %s  %s\n", i, shown(call.name).c_str(),
                    call.address != nullptr ? "resolved" : "NOT resolved");
    }
    std::printf("\nProcess log thresholds: %d\n", tables.log_count);
    for (int32_t i = 0; tables.log_rows != nullptr && i < tables.log_count; ++i) {
        const log_threshold &row = tables.log_rows[i];
        if (row.compiled != 1) {
            std::printf("  %d: (empty: its expression did not compile)\n", i);
            continue;
        }
        std::printf("  %d: processes matching [%s]  rss %d KB  dsiz %d KB  vsize %d KB  "
                    "memoryCheckFlag %d\n",
                    i, shown(row.process_mask).c_str(), row.rss_limit, row.dsiz_limit,
                    row.vsize_limit, row.memoryCheckFlag);
    }
    std::printf("\nProcess abort thresholds: %d\n", tables.abort_count);
    for (int32_t i = 0; tables.abort_rows != nullptr && i < tables.abort_count; ++i) {
        const abort_threshold &row = tables.abort_rows[i];
        if (row.compiled != 1) {
            std::printf("  %d: (empty: its expression did not compile)\n", i);
            continue;
        }
        std::printf("  %d: processes matching [%s]  rss %d KB  dsiz %d KB  vsize %d KB\n", i,
                    shown(row.process_mask).c_str(), row.rss_abort_limit, row.dsiz_abort_limit,
                    row.vsize_abort_limit);
    }
}

// Prints what the monitor reads past in silence, or refuses; returns how many problems there were.
int print_table_problems(const control_file_tables &tables) {
    int kept = tables.problem_count < CONTROL_FILE_PROBLEMS_KEPT ? tables.problem_count
                                                                 : CONTROL_FILE_PROBLEMS_KEPT;
    for (int i = 0; i < kept; ++i) {
        const control_file_problem &problem = tables.problems[i];
        if (problem.kind == control_file_problem_kind::uncompiled_expression) {
            std::printf("PROBLEM: line %d: the process name expression [%s] of %s does not "
                        "compile (%s); the monitor drops this row without a message\n",
                        problem.line, shown(problem.first).c_str(), shown(problem.keyword).c_str(),
                        shown(problem.second).c_str());
        } else {
            std::printf("PROBLEM: line %d: the routine %s of module %s cannot be resolved "
                        "(module service result %u, crc %u); the monitor reports 0xE086 and "
                        "does not run\n",
                        problem.line, shown(problem.second).c_str(), shown(problem.first).c_str(),
                        problem.rc, problem.crc);
        }
    }
    if (tables.problem_count > kept) {
        std::printf("PROBLEM: %d more rows with the same kinds of problem\n",
                    tables.problem_count - kept);
    }
    return tables.problem_count;
}

void print_rule_failure(const setting &entry) {
    const setting_rule &rule = *entry.rule;
    std::printf("PROBLEM: %.*s is %" PRId64 " (%.*s), but it %.*s",
                static_cast<int>(entry.keyword.size()), entry.keyword.data(),
                setting_current(entry), static_cast<int>(entry.unit.size()), entry.unit.data(),
                static_cast<int>(rule.text.size()), rule.text.data());
    if (rule.other != nullptr) {
        std::printf(" (which is %d)", *rule.other);
    }
    std::printf("; the monitor does not run\n");
}

// The two variables of the default platform that the check sends to /dev/null while it runs, and
// puts back as they were afterwards: a monitor started after the check (tarnmon run) writes its
// own trace and events where the platform's settings say.
class quiet_platform {
  public:
    quiet_platform() {
        for (size_t i = 0; i < std::size(VARIABLES); ++i) {
            const char *value = std::getenv(VARIABLES[i]);
            saved_[i] = value != nullptr ? std::optional<std::string>(value) : std::nullopt;
            setenv(VARIABLES[i], "/dev/null", 1);
        }
    }
    ~quiet_platform() {
        for (size_t i = 0; i < std::size(VARIABLES); ++i) {
            if (saved_[i].has_value()) {
                setenv(VARIABLES[i], saved_[i]->c_str(), 1);
            } else {
                unsetenv(VARIABLES[i]);
            }
        }
    }
    quiet_platform(const quiet_platform &) = delete;
    quiet_platform &operator=(const quiet_platform &) = delete;

  private:
    static constexpr const char *VARIABLES[] = {EVENT_LOG_VARIABLE, TRACE_FILE_VARIABLE};
    std::optional<std::string> saved_[std::size(VARIABLES)];
};

} // namespace

int check_control_file(const char *path, check_report report, int32_t *checking_interval_set) {
    *checking_interval_set = CHECKING_INTERVAL_DEFAULT;
    // A check raises no events and writes no trace: what the parser reports while checking (an
    // unresolved routine, a failed allocation) is told here in words, and the appliance's event
    // log and trace keep only what a running monitor did. Set before anything can trace.
    quiet_platform quiet;
    control_text text;
    if (path == nullptr) {
        read_through_data_files(text);
    } else {
        read_from_path(text, path);
    }
    if (std::string problem = read_problem(text); !problem.empty()) {
        std::printf("PROBLEM: the control file %s %s\n", text.where.c_str(), problem.c_str());
        return text.opened ? EXIT_FINDING : EXIT_UNAVAILABLE;
    }
    text.bytes[CONTROL_FILE_MAX - 1] = '\0';
    std::printf("Control file: %s (%u bytes read)\n", text.where.c_str(), text.length);

    // As monitoring starts without a checking interval from its host.
    settings_start_values();
    uint32_t crc = 0;
    uint32_t src = tarn_parse_control_file(text.bytes.data(), &crc);
    *checking_interval_set = checking_interval;
    control_file_tables tables{};
    read_control_file_tables(&tables);
    if (report == check_report::full) {
        std::printf("\n");
        print_settings();
        print_tables(tables);
        std::printf("\n");
    }

    int problems = print_table_problems(tables);
    if (src != 0 && problems == 0) {
        std::printf("PROBLEM: the monitor reported a failure of its own while reading the file "
                    "(crc %x); it does not run\n",
                    crc);
        ++problems;
    }
    if (run_requested() == 0) {
        std::printf("PROBLEM: ACTUALLY_RUN is missing; the monitor runs only when the file holds "
                    "a line starting with it\n");
        ++problems;
    }
    if (const setting *failed = validate_settings()) {
        print_rule_failure(*failed);
        ++problems;
    }
    if (problems == 0) {
        std::printf("VALID: the monitor would run with this control file\n");
    }
    return problems == 0 ? EXIT_OK : EXIT_FINDING;
}

int command_check_config(const command_line &line) {
    int32_t interval = 0;
    return check_control_file(line.operands.empty() ? nullptr : line.operands[0],
                              check_report::full, &interval);
}

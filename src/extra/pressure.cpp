#include "pressure.h"

#include <cinttypes>
#include <cstdio>
#include <cstring>

namespace {

struct resource {
    const char *name; // as in the line
    const char *file; // under the /proc root
};

constexpr resource RESOURCES[] = {
    {"memory", "pressure/memory"},
    {"cpu", "pressure/cpu"},
    {"io", "pressure/io"},
};
constexpr size_t RESOURCE_COUNT = sizeof RESOURCES / sizeof RESOURCES[0];

constexpr uint64_t AVERAGE_MAX = 10000; // 100.00 %: a share of wall time

constexpr size_t FILE_SIZE = 512;  // a pressure file is two lines of about 60 bytes
constexpr size_t TEXT_SIZE = 1024; // three lines of at most 240 bytes, and the truncation line

pressure_memory memories[RESOURCE_COUNT];
char returned[TEXT_SIZE];

// "12.34" as 1234: the kernel writes two decimals; one is taken as tenths.
bool take_average(std::string_view &text, uint32_t *hundredths) {
    uint64_t whole = 0;
    if (!take_number(text, &whole) || whole > AVERAGE_MAX / 100) {
        return false;
    }
    uint64_t fraction = 0;
    if (text.starts_with('.')) {
        text.remove_prefix(1);
        std::string_view digits = text.substr(0, text.find_first_not_of("0123456789"));
        if (digits.empty() || digits.size() > 2 || !take_number(text, &fraction)) {
            return false;
        }
        fraction *= digits.size() == 1 ? 10 : 1;
    }
    uint64_t value = whole * 100 + fraction;
    *hundredths = static_cast<uint32_t>(value);
    return value <= AVERAGE_MAX;
}

bool take_field(std::string_view &text, std::string_view name) {
    skip_blanks(text);
    if (!text.starts_with(name)) {
        return false;
    }
    text.remove_prefix(name.size());
    return true;
}

// "avg10=0.12 avg60=0.05 avg300=0.01 total=123456", in this order, and nothing after.
bool parse_figures(std::string_view text, pressure_figures *figures) {
    bool parsed = take_field(text, "avg10=") && take_average(text, &figures->avg10) &&
                  take_field(text, "avg60=") && take_average(text, &figures->avg60) &&
                  take_field(text, "avg300=") && take_average(text, &figures->avg300) &&
                  take_field(text, "total=") && take_number(text, &figures->total);
    skip_blanks(text);
    figures->present = parsed && text.empty();
    return figures->present;
}

void write_change(char *change, size_t size, bool known, uint64_t previous, uint64_t total) {
    if (!known) {
        std::snprintf(change, size, "first reading");
    } else if (total < previous) {
        std::snprintf(change, size, "counter went back");
    } else {
        std::snprintf(change, size, "+%" PRIu64 " us", total - previous);
    }
}

// "some avg10=0.12 avg60=0.05 avg300=0.01 total=123456 us (+120 us)"
void write_figures(char *part, size_t size, const char *kind, const pressure_figures &figures,
                   bool known, uint64_t previous) {
    char change[48];
    write_change(change, sizeof change, known, previous, figures.total);
    std::snprintf(
        part, size, "%s avg10=%u.%02u avg60=%u.%02u avg300=%u.%02u total=%" PRIu64 " us (%s)", kind,
        figures.avg10 / 100, figures.avg10 % 100, figures.avg60 / 100, figures.avg60 % 100,
        figures.avg300 / 100, figures.avg300 % 100, figures.total, change);
}

} // namespace

bool parse_pressure(std::string_view text, pressure_file *file) {
    *file = {};
    while (!text.empty()) {
        std::string_view line = take_line(text);
        pressure_figures *figures = nullptr;
        if (line.starts_with("some ")) {
            figures = &file->some;
        } else if (line.starts_with("full ")) {
            figures = &file->full;
        } else {
            continue;
        }
        if (figures->present || !parse_figures(line.substr(5), figures)) {
            return false;
        }
    }
    return file->some.present;
}

void pressure_line(routine_text &text, const char *resource, const pressure_file &file,
                   pressure_memory &memory) {
    char some[160];
    write_figures(some, sizeof some, "some", file.some, memory.some_known, memory.some_total);
    char full[160] = "";
    if (file.full.present) {
        full[0] = ';';
        full[1] = ' ';
        write_figures(full + 2, sizeof full - 2, "full", file.full, memory.full_known,
                      memory.full_total);
    }
    text.line("pressure %s: %s%s", resource, some, full);
    memory.some_known = true;
    memory.some_total = file.some.total;
    memory.full_known = file.full.present;
    memory.full_total = file.full.total;
    memory.absence_said = false;
}

EXTRA_EXPORT void telvzextra_pressure(const char *, char **returnedData) {
    routine_text text(returned, sizeof returned);
    char buffers[RESOURCE_COUNT][FILE_SIZE];
    file_text files[RESOURCE_COUNT];
    bool none_present = true;
    bool absence_to_say = false;
    for (size_t i = 0; i < RESOURCE_COUNT; ++i) {
        files[i] = read_proc_file(RESOURCES[i].file, buffers[i], sizeof buffers[i]);
        none_present = none_present && !files[i].present;
        absence_to_say = absence_to_say || (!files[i].present && !memories[i].absence_said);
    }
    // A kernel without pressure accounting, or with it off, has none of the files: one line.
    if (none_present && absence_to_say) {
        text.line("pressure: not available (no /proc/pressure: an old kernel, or pressure "
                  "accounting off)");
    }
    for (size_t i = 0; i < RESOURCE_COUNT; ++i) {
        const resource &each = RESOURCES[i];
        pressure_memory &memory = memories[i];
        const file_text &file = files[i];
        pressure_file figures;
        if (!file.present) {
            if (!memory.absence_said && !none_present) {
                text.line("pressure %s: not available (no /proc/%s: an old kernel, or pressure "
                          "accounting off)",
                          each.name, each.file);
            }
            memory = {};
            memory.absence_said = true;
        } else if (file.cut || !parse_pressure(file.text, &figures)) {
            text.line("pressure %s: /proc/%s does not hold pressure figures", each.name, each.file);
            memory = {};
        } else {
            pressure_line(text, each.name, figures, memory);
        }
    }
    hand_back(text, returnedData);
}

void reset_pressure_state() {
    std::memset(memories, 0, sizeof memories);
}

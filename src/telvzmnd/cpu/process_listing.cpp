#include "cpu/process_listing.h"

#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <sys/times.h>
#include <unistd.h>

#include "allocation.h"
#include "core/pass_figures.h"
#include "tracesvc.h"

process_list_header process_list;
process_list_header *process_list_ptr;
process_entry *process_entry_ptr;

const char *proc_root = "/proc";
clock_t (*clock_tick_source)() = [] { return times(nullptr); };
long (*clock_tick_rate_source)() = [] { return sysconf(_SC_CLK_TCK); };

namespace {

// update_process_list's own state, kept at file scope only so that tests can reset it.
int32_t is_initialized; // 1 once the list header has been set up by the first update
int32_t hertz;          // clock ticks per second

constexpr size_t PATH_SIZE = PATH_MAX;
constexpr size_t STAT_TEXT_SIZE = 4096; // a stat line is about 300 bytes; the rest is never used
constexpr size_t ROW_SIZE = 160;
constexpr int ROW_LABEL_LENGTH = 8; // "checks: ", "user:   ", "kernel: "
constexpr int CELL_STRIDE = 13;
constexpr int ROW_NEWLINE_OFFSET = 130; // from a row's first cell column to its "\n"
constexpr size_t ENTRY_LINE_SIZE = 256;
constexpr char ZERO_CELL[] = "|     +0.00| "; // "|%+#10.2f| " of 0.0

struct file_closer {
    void operator()(FILE *file) const { std::fclose(file); }
};
struct directory_closer {
    void operator()(DIR *directory) const { closedir(directory); }
};
using unique_file = std::unique_ptr<FILE, file_closer>;
using unique_directory = std::unique_ptr<DIR, directory_closer>;

struct unique_descriptor {
    int fd;
    explicit unique_descriptor(int descriptor) : fd(descriptor) {}
    unique_descriptor(const unique_descriptor &) = delete;
    unique_descriptor &operator=(const unique_descriptor &) = delete;
    ~unique_descriptor() {
        if (fd >= 0) {
            close(fd);
        }
    }
};

// Every path the accounting reads is written as "/proc/..."; it is opened below proc_root. A path
// that does not fit fails like an open with ENAMETOOLONG.
bool below_proc_root(char (&path)[PATH_SIZE], const char *proc_path) {
    constexpr size_t prefix_length = sizeof "/proc" - 1;
    const char *rest = std::strncmp(proc_path, "/proc", prefix_length) == 0
                           ? proc_path + prefix_length
                           : proc_path;
    int length = std::snprintf(path, sizeof path, "%s%s", proc_root, rest);
    bool fits = length >= 0 && static_cast<size_t>(length) < sizeof path;
    if (!fits) {
        errno = ENAMETOOLONG;
    }
    return fits;
}

// The whole stat text of one process, NUL-terminated; empty when it cannot be read. The kernel
// hands the line out in one read.
void read_stat_text(int fd, char (&text)[STAT_TEXT_SIZE]) {
    ssize_t length = read(fd, text, sizeof text - 1);
    text[length > 0 ? length : 0] = '\0';
}

// A pid as the directory scan takes it from an entry name: atoi's reading, with a name out of
// 32-bit range counting as not numeric.
int32_t pid_of_name(const char *name) {
    long value = std::strtol(name, nullptr, 10);
    return value < INT32_MIN || value > INT32_MAX ? 0 : static_cast<int32_t>(value);
}

// The ring slot of a sample index; any index counts modulo the ring, the largest ones too.
int ring_slot(int32_t sample) {
    return ((sample % PROCESS_SAMPLES) + PROCESS_SAMPLES) % PROCESS_SAMPLES;
}

// Ring slot `cur` of one kind of CPU time (user or kernel) of an entry: the counter read, and the
// percentage of the whole machine it grew by since slot `prev`, over `diff` clock ticks of wall
// time. The arithmetic wraps in 32 bits, so a counter that went backwards (a reused pid) gives a
// huge share, which is rejected like any other share above 100.
void sample_share(process_entry *entry, bool kernel, uint32_t ticks, int cur, int prev,
                  int32_t diff, int32_t cpus) {
    uint32_t *jiffies = kernel ? entry->kernel_jiffies : entry->user_jiffies;
    float *percent = kernel ? entry->kernel_percent : entry->user_percent;
    uint32_t before = jiffies[prev];
    jiffies[cur] = ticks;
    uint32_t used = static_cast<uint32_t>(hertz) * (ticks - before);
    auto capacity = static_cast<int32_t>(static_cast<uint32_t>(cpus) * static_cast<uint32_t>(diff));
    float share = diff == 0 || before == 0 || capacity == 0
                      ? 0.0f
                      : static_cast<float>(used) / static_cast<float>(capacity);
    if (share > 100.0f) {
        tracesvc_trace(kernel ? "TARNCPUF: update_process_list: kernel percentage invalid: %f, "
                                "pid: %d, current jiffies: %d, previous jiffies: %d, hertz: %d, "
                                "diff: %d, cpus: %d"
                              : "TARNCPUF: update_process_list: user percentage invalid: %f, "
                                "pid: %d, current jiffies: %d, previous jiffies: %d, hertz: %d, "
                                "diff: %d, cpus: %d",
                       static_cast<double>(share), entry->pid, static_cast<int32_t>(ticks),
                       static_cast<int32_t>(before), hertz, diff, cpus);
        share = 0.0f;
    }
    percent[cur] = share;
}

// Reads the stat file of one entry into ring slot `cur`.
void sample_entry(process_list_header *list, process_entry *entry, int cur, int prev,
                  int32_t diff) {
    char path[PATH_SIZE];
    int fd = below_proc_root(path, entry->file_name) ? open(path, O_RDONLY | O_CLOEXEC) : -1;
    if (fd < 0) {
        int error = errno;
        tracesvc_trace("TARNCPUF: update_process_list: error opening file %s, errno: %d, %s",
                       entry->file_name, error, std::strerror(error));
        return;
    }
    char text[STAT_TEXT_SIZE];
    {
        unique_descriptor stat_file(fd);
        read_stat_text(stat_file.fd, text);
    }
    uint32_t utime = 0;
    uint32_t stime = 0;
    parse_process_stat_line(text, entry->process_name, &utime, &stime, &entry->priority,
                            &entry->nice);
    sample_share(entry, false, utime, cur, prev, diff, list->number_of_cpus);
    sample_share(entry, true, stime, cur, prev, diff, list->number_of_cpus);
}

void initialise_list(process_list_header *list) {
    hertz = static_cast<int32_t>(clock_tick_rate_source());
    list->sample_ticks[0] = static_cast<int64_t>(clock_tick_source());
    // Back-dated by more than half a second, so that the first update always takes its sample.
    list->sample_ticks[PROCESS_SAMPLES - 1] =
        static_cast<int64_t>(static_cast<double>(list->sample_ticks[0]) - 0.6 * hertz);
    list->current_sample = 0;
    list->number_of_entries = 1;
    std::memset(&list->head, 0, sizeof list->head);
    std::snprintf(list->head.file_name, sizeof list->head.file_name, "/proc/1/stat");
    is_initialized = 1;
}

// The table text that print_process_list hands out, or nothing: then every row goes to the trace.
struct table_text {
    char *text = nullptr;
    size_t capacity = 0;
    size_t used = 0;

    void append(const char *piece, size_t length) {
        if (used + 1 >= capacity) {
            return;
        }
        size_t room = capacity - 1 - used;
        size_t kept = length < room ? length : room;
        std::memcpy(text + used, piece, kept);
        used += kept;
        text[used] = '\0';
    }
};

// A row: an eight-character label, then one cell a sample from column `first_column` on, newest
// sample first. Percentage cells end in a blank that separates them; tick cells are one
// character wider and each next cell overwrites that blank, so they touch.
struct table_row {
    char text[ROW_SIZE];
    int first_column;

    table_row(const char *label, int column) : first_column(column) {
        std::memset(text, 0, sizeof text);
        std::snprintf(text, sizeof text, "%s", label);
    }
    static int slot_of_column(const process_list_header *list, int k) {
        return ring_slot(ring_slot(list->current_sample) + PROCESS_SAMPLES - 1 - k);
    }
    char *cell(int k) { return text + first_column + CELL_STRIDE * k; }
    size_t room(int k) const {
        return sizeof text - static_cast<size_t>(first_column + CELL_STRIDE * k);
    }

    void percentages(const process_list_header *list, const float (&values)[PROCESS_SAMPLES]) {
        for (int k = 0; k < PROCESS_SAMPLES; ++k) {
            float value = values[slot_of_column(list, k)];
            // Most processes of a host are idle: their cells are copied as the formatting would
            // write them, which costs a fraction of formatting each.
            if (value == 0.0f && !std::signbit(value) && room(k) >= sizeof ZERO_CELL) {
                std::memcpy(cell(k), ZERO_CELL, sizeof ZERO_CELL);
                continue;
            }
            std::snprintf(cell(k), room(k), "|%+#10.2f| ", static_cast<double>(value));
        }
    }
    void ticks(const process_list_header *list) {
        for (int k = 0; k < PROCESS_SAMPLES; ++k) {
            auto value = static_cast<int32_t>(list->sample_ticks[slot_of_column(list, k)]);
            std::snprintf(cell(k), room(k), "|%+11d| ", value);
        }
    }
    // Into the table the row goes up to its newline column (over the tick row's last blank);
    // into the trace it goes whole.
    void emit(table_text &table) {
        if (table.text == nullptr) {
            tracesvc_trace("TARNCPUF: %s", text);
            return;
        }
        size_t end = static_cast<size_t>(first_column + ROW_NEWLINE_OFFSET);
        text[end] = '\n';
        text[end + 1] = '\0';
        table.append(text, end + 1);
    }
};

void emit_entry_line(table_text &table, const process_entry *entry) {
    constexpr int name_length = static_cast<int>(PROCESS_NAME_LENGTH) - 1;
    if (table.text == nullptr) {
        tracesvc_trace("TARNCPUF: pid: %d, name: %.*s, priority: %d, nice: %d", entry->pid,
                       name_length, entry->process_name, entry->priority, entry->nice);
        return;
    }
    char text[ENTRY_LINE_SIZE];
    int length =
        std::snprintf(text, sizeof text, "pid: %d, name: %.*s, priority: %d, nice: %d\n",
                      entry->pid, name_length, entry->process_name, entry->priority, entry->nice);
    size_t kept = length < 0 ? 0 : static_cast<size_t>(length);
    table.append(text, kept < sizeof text ? kept : sizeof text - 1);
}

void emit_percentage_row(table_text &table, const process_list_header *list, const char *label,
                         int first_column, const float (&values)[PROCESS_SAMPLES]) {
    table_row row(label, first_column);
    row.percentages(list, values);
    row.emit(table);
}

// The reading of a stat line. Its fields are taken the way the C library's scanf takes them in the
// C locale, so that an odd line (a name with blanks, a huge or negative counter, a cut-off line)
// gives the same values, and the same count of them, as the accounting has always recorded.
// A conversion that finds nothing makes the rest of the line unread, as a failed scan would.

// White space as isspace sees it in the C locale: every field may be preceded by any run of it.
bool is_white_space(char c) {
    return c == ' ' || (c >= '\t' && c <= '\r');
}

bool is_digit(char c) {
    return c >= '0' && c <= '9';
}

// A decimal field: an optional sign, then its digits; the magnitude saturates once it passes
// 64 bits, where the conversion would report overflow.
struct scanned_number {
    bool negative = false;
    bool beyond_64_bits = false;
    uint64_t magnitude = 0;

    // As an unsigned field is read: strtoul's value, negated in unsigned arithmetic when the
    // field has a minus, all ones when it overflows; then cut to 32 bits.
    uint32_t as_unsigned() const {
        if (beyond_64_bits) {
            return UINT32_MAX;
        }
        return static_cast<uint32_t>(negative ? 0 - magnitude : magnitude);
    }
    // As a signed field is read: strtol's value, held at LONG_MIN or LONG_MAX when it is out of
    // range, then cut to 32 bits (so a field beyond the range reads as 0 or -1).
    int32_t as_signed() const {
        constexpr uint64_t largest = static_cast<uint64_t>(INT64_MAX);
        uint64_t value;
        if (negative) {
            value = beyond_64_bits || magnitude > largest + 1 ? largest + 1 : 0 - magnitude;
        } else {
            value = beyond_64_bits || magnitude > largest ? largest : magnitude;
        }
        return static_cast<int32_t>(static_cast<uint32_t>(value));
    }
};

// A position in the NUL-terminated stat text; no step moves past the NUL.
struct stat_cursor {
    const char *at;

    void skip_white_space() {
        while (is_white_space(*at)) {
            ++at;
        }
    }

    // A decimal field after white space. False when there is no digit: a sign alone is no number.
    bool take_number(scanned_number &number) {
        skip_white_space();
        number = scanned_number{};
        if (*at == '-' || *at == '+') {
            number.negative = *at == '-';
            ++at;
        }
        if (!is_digit(*at)) {
            return false;
        }
        constexpr uint64_t tenth = UINT64_MAX / 10;
        do {
            auto digit = static_cast<uint64_t>(*at - '0');
            if (number.magnitude > tenth ||
                (number.magnitude == tenth && digit > UINT64_MAX % 10)) {
                number.beyond_64_bits = true;
            } else {
                number.magnitude = number.magnitude * 10 + digit;
            }
            ++at;
        } while (is_digit(*at));
        return true;
    }

    // A field whose value is not kept; it only has to be there.
    bool skip_number() {
        scanned_number ignored;
        return take_number(ignored);
    }

    bool skip_numbers(int count) {
        for (int i = 0; i < count; ++i) {
            if (!skip_number()) {
                return false;
            }
        }
        return true;
    }

    // The name field after white space: up to the next white space, at most 98 characters (the
    // name area's last byte has never been written), NUL-terminated; the rest of a longer name is
    // read as the fields after it. False at the end of the text.
    bool take_name(char *name) {
        constexpr size_t most = PROCESS_NAME_LENGTH - 2;
        skip_white_space();
        if (*at == '\0') {
            return false;
        }
        size_t length = 0;
        while (length < most && *at != '\0' && !is_white_space(*at)) {
            name[length++] = *at++;
        }
        name[length] = '\0';
        return true;
    }

    // One character after white space, whatever it is (the state letter). False at the end.
    bool skip_character() {
        skip_white_space();
        if (*at == '\0') {
            return false;
        }
        ++at;
        return true;
    }
};

} // namespace

int parse_process_stat_line(const char *text, char *process_name, uint32_t *utime, uint32_t *stime,
                            int32_t *priority, int32_t *nice) {
    // pid (name) state ppid pgrp session tty tpgid flags minflt cminflt majflt cmajflt utime
    // stime cutime cstime priority nice ... A name with a blank shifts the fields after it; that
    // is accepted, the process is then sampled with what the conversions left. Nothing is taken
    // after nice, so the fields that follow it are not read at all.
    stat_cursor line{text};
    if (!line.skip_number() || !line.take_name(process_name)) {
        return 0;
    }
    if (!line.skip_character() || !line.skip_numbers(10)) {
        return 1;
    }
    scanned_number field;
    if (!line.take_number(field)) {
        return 1;
    }
    *utime = field.as_unsigned();
    if (!line.take_number(field)) {
        return 2;
    }
    *stime = field.as_unsigned();
    if (!line.skip_numbers(2) || !line.take_number(field)) {
        return 3;
    }
    *priority = field.as_signed();
    if (!line.take_number(field)) {
        return 4;
    }
    *nice = field.as_signed();
    return 5;
}

void reset_process_listing_state() {
    is_initialized = 0;
    hertz = 0;
}

TARN_EXPORT int32_t query_number_of_cpus() {
    int32_t total = 0;
    char path[PATH_SIZE];
    unique_file cpuinfo(below_proc_root(path, "/proc/cpuinfo") ? std::fopen(path, "re") : nullptr);
    if (cpuinfo == nullptr) {
        int error = errno;
        tracesvc_trace("TARNCPUF: query_number_of_cpus: error opening file /proc/cpuinfo, errno: "
                       "%d, %s",
                       error, std::strerror(error));
    } else {
        char *text = nullptr;
        size_t size = 0;
        while (getline(&text, &size, cpuinfo.get()) != -1) {
            int number;
            // The format begins with the word itself, so only a line that does can match; the
            // test in front spares the scan of every other line of a long cpuinfo.
            if (std::strncmp(text, "processor", sizeof "processor" - 1) == 0 &&
                std::sscanf(text, "processor       : %d\n", &number) == 1) {
                ++total;
                tracesvc_trace("TARNCPUF: query_number_of_cpus: found number %d, new total: %d",
                               number, total);
            }
        }
        free(text); // getline's buffer belongs to the C library
    }
    return total < 1 ? 1 : total;
}

TARN_EXPORT process_entry *search_pid_in_process_list(int32_t pid, process_list_header *list,
                                                      process_entry *start) {
    // Walk to the entry of the pid, or to the one it belongs after; a scan in rising pid order
    // that starts from the previous pid's entry moves one step at most.
    process_entry *e = start != nullptr ? start : &list->head;
    for (;;) {
        if (pid > e->pid && e->next != nullptr && pid >= e->next->pid) {
            e = e->next;
        } else if (pid < e->pid && e->previous != nullptr) {
            e = e->previous;
        } else {
            break;
        }
    }
    process_entry *found = e;
    if (e->pid != pid) {
        found = static_cast<process_entry *>(TARN_CALLOC(1, sizeof(process_entry)));
    }
    // A new entry that cannot be allocated leaves the pid unsampled this time; the scan goes on.
    if (found != nullptr && found != e) {
        std::snprintf(found->file_name, sizeof found->file_name, "/proc/%d/stat", pid);
        found->pid = pid;
        found->previous = e;
        found->next = e->next;
        if (e->next != nullptr) {
            e->next->previous = found;
        }
        e->next = found;
        list->number_of_entries++;
    }
    return found;
}

TARN_EXPORT void prepare_process_list(process_list_header *list) {
    list->number_of_cpus = query_number_of_cpus();
    process_entry *e = list->head.next;
    while (e != nullptr) {
        process_entry *following = e->next;
        if (e->seen != 0) {
            e->seen = 0;
        } else {
            e->previous->next = following;
            if (following != nullptr) {
                following->previous = e->previous;
            }
            TARN_FREE(e);
            list->number_of_entries--;
        }
        e = following;
    }
}

TARN_EXPORT void update_process_list(process_list_header *list) {
    tracesvc_trace("TARNCPUF: ->update_process_list");
    if (is_initialized == 0) {
        initialise_list(list);
    }
    int cur = ring_slot(list->current_sample);
    int prev = ring_slot(cur + PROCESS_SAMPLES - 1);
    auto now = static_cast<int32_t>(static_cast<uint32_t>(clock_tick_source()));
    auto diff = static_cast<int32_t>(static_cast<uint32_t>(now) -
                                     static_cast<uint32_t>(list->sample_ticks[prev]));
    if (0.5 * hertz > diff) {
        tracesvc_trace("TARNCPUF: <-update_process_list (skip)");
        return;
    }
    list->sample_ticks[cur] = now;
    prepare_process_list(list);
    process_entry *cursor = &list->head;

    char path[PATH_SIZE];
    unique_directory directory(below_proc_root(path, "/proc/") ? opendir(path) : nullptr);
    while (directory != nullptr) {
        const dirent *found = readdir(directory.get());
        if (found == nullptr) {
            break;
        }
        int32_t pid = pid_of_name(found->d_name);
        if (pid == 0) {
            continue;
        }
        process_entry *entry = search_pid_in_process_list(pid, list, cursor);
        if (entry == nullptr) {
            continue;
        }
        cursor = entry;
        cursor->seen = 1;
        sample_entry(list, cursor, cur, prev, diff);
    }
    directory.reset();
    list->current_sample = ring_slot(cur + 1);
    tracesvc_trace("TARNCPUF: <-update_process_list");
}

TARN_EXPORT int print_process_list(process_list_header *list, char **out) {
    tracesvc_trace("TARNCPUF: ->print_process_list");
    table_text table;
    if (out != nullptr) {
        size_t entries =
            list->number_of_entries > 0 ? static_cast<size_t>(list->number_of_entries) : 0;
        table.text = static_cast<char *>(TARN_CALLOC(entries, PROCESS_TABLE_BYTES_PER_ENTRY));
        table.capacity = table.text != nullptr ? entries * PROCESS_TABLE_BYTES_PER_ENTRY : 0;
        *out = table.text;
    }

    table_row checks("checks: ", ROW_LABEL_LENGTH);
    checks.ticks(list);
    checks.emit(table);

    float user_sum[PROCESS_SAMPLES] = {};
    float kernel_sum[PROCESS_SAMPLES] = {};
    for (const process_entry *e = list->head.next; e != nullptr; e = e->next) {
        emit_entry_line(table, e);
        emit_percentage_row(table, list, "user:   ", ROW_LABEL_LENGTH, e->user_percent);
        emit_percentage_row(table, list, "kernel: ", ROW_LABEL_LENGTH, e->kernel_percent);
        for (int i = 0; i < PROCESS_SAMPLES; ++i) {
            user_sum[i] += e->user_percent[i];
            kernel_sum[i] += e->kernel_percent[i];
        }
    }
    for (int i = 0; i < PROCESS_SAMPLES; ++i) {
        user_sum[i] = user_sum[i] > 100.0f ? 100.0f : user_sum[i];
        kernel_sum[i] = kernel_sum[i] > 100.0f ? 100.0f : kernel_sum[i];
    }

    if (table.text == nullptr) {
        tracesvc_trace("TARNCPUF: Overall system:");
    } else {
        table.append("Overall system\n", sizeof "Overall system\n" - 1);
    }
    // The overall rows start their cells inside the label ("user: |", "kernel:|"), unlike the
    // per-process rows above them; readers of the table know them by that.
    emit_percentage_row(table, list, "user:   ", 6, user_sum);
    emit_percentage_row(table, list, "kernel: ", 7, kernel_sum);
    int newest = ring_slot(ring_slot(list->current_sample) + PROCESS_SAMPLES - 1);
    note_appliance_cpu(user_sum[newest], kernel_sum[newest]);
    return tracesvc_trace("TARNCPUF: <-print_process_list");
}

TARN_EXPORT void delete_process_list(process_list_header *list) {
    process_entry *e = list->head.next;
    list->head.next = nullptr;
    list->number_of_entries = 1;
    while (e != nullptr) {
        process_entry *following = e->next;
        TARN_FREE(e);
        e = following;
    }
}

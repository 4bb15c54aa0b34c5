#include "memory/trend_analysis.h"

#include <algorithm>
#include <charconv>
#include <cstdio>
#include <cstring>

#include "core/control_block.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "memory/name_matching.h"
#include "tracesvc.h"

trend_lookup trend_row_lookup = trend_lookup::indexed;

namespace {

constexpr uint32_t LEAK_REPORT_SRC = 2;

bool in_use(const trend_row &row) {
    return row.in_use != 0;
}

bool valid(const trend_sample &sample) {
    return sample.valid != 0;
}

// A row's name as a C string: the field is NUL-padded but a name of 250 characters fills it.
struct row_name {
    char text[PROCESS_NAME_FIELD + 1];
    explicit row_name(const char (&field)[PROCESS_NAME_FIELD]) {
        std::memcpy(text, field, PROCESS_NAME_FIELD);
        text[PROCESS_NAME_FIELD] = '\0';
    }
};

// The trend row of each pid, for the record step: the lowest row in use with that pid, as a walk
// from row 0 finds it. Open addressing over twice the rows; no allocation.
class pid_index {
  public:
    void clear() { std::fill(std::begin(slots), std::end(slots), slot{0, -1}); }
    int32_t find(uint32_t pid) const {
        for (uint32_t at = first_slot(pid);; at = (at + 1) % SLOTS) {
            if (slots[at].row == -1 || slots[at].pid == pid) {
                return slots[at].row;
            }
        }
    }
    // `pid` must not be in the index yet.
    void add(uint32_t pid, int32_t row) {
        uint32_t at = first_slot(pid);
        while (slots[at].row != -1) {
            at = (at + 1) % SLOTS;
        }
        slots[at] = {pid, row};
    }

  private:
    static constexpr uint32_t SLOT_BITS = 13;
    static constexpr uint32_t SLOTS = 1u << SLOT_BITS;
    static_assert(SLOTS >= 2 * TREND_TABLE_ROWS);
    struct slot {
        uint32_t pid;
        int32_t row; // -1 = empty
    };
    // Fibonacci hashing: the top bits of the product spread pids that follow each other.
    static uint32_t first_slot(uint32_t pid) { return (pid * 2654435761u) >> (32 - SLOT_BITS); }
    slot slots[SLOTS];
};

pid_index trend_rows_by_pid;

// Histories are full once the index stands at the last of their points: from then on every call
// slides them one slot left before it fills the last slot.
bool histories_full(int32_t slot) {
    return slot >= static_cast<int32_t>(static_cast<uint32_t>(trend_analysis_points) - 1);
}

void slide(tarn_control_block &block, int32_t slot) {
    if (!histories_full(slot)) {
        return;
    }
    for (trend_row &row : block.trend_table) {
        if (!in_use(row) || !valid(row.samples[slot])) {
            continue;
        }
        for (int32_t k = 0; k < slot && k < TREND_LAST_SLOT; ++k) {
            row.samples[k] = row.samples[k + 1];
        }
        row.samples[slot] = {};
    }
}

// A new history in `row` for the process: no samples, the process's flag, pid and name.
void start_history(trend_row &row, const process_row &process) {
    std::memset(row.samples, 0, sizeof row.samples);
    row.in_use = process.in_use;
    std::memcpy(row.process_name, process.process_name, PROCESS_NAME_FIELD);
    row.pid = process.pid;
}

// The first row in use with `pid`, walked from row 0.
int32_t walk_to_row(const tarn_control_block &block, uint32_t pid) {
    for (int32_t i = 0; i < TREND_TABLE_ROWS; ++i) {
        if (in_use(block.trend_table[i]) && block.trend_table[i].pid == pid) {
            return i;
        }
    }
    return -1;
}

void index_trend_rows(const tarn_control_block &block) {
    trend_rows_by_pid.clear();
    for (int32_t i = 0; i < TREND_TABLE_ROWS; ++i) {
        const trend_row &row = block.trend_table[i];
        if (in_use(row) && trend_rows_by_pid.find(row.pid) == -1) {
            trend_rows_by_pid.add(row.pid, i);
        }
    }
}

void record(tarn_control_block &block, int32_t slot) {
    bool walk = trend_row_lookup == trend_lookup::walk;
    if (!walk) {
        index_trend_rows(block);
    }
    // Rows only fill during this step, so the first free row only moves on.
    int32_t first_free = 0;
    for (const process_row &process : block.process_table) {
        if (process.in_use == 0) {
            continue;
        }
        int32_t index =
            walk ? walk_to_row(block, process.pid) : trend_rows_by_pid.find(process.pid);
        if (index == -1) {
            if (walk) {
                first_free = 0;
            }
            while (first_free < TREND_TABLE_ROWS && in_use(block.trend_table[first_free])) {
                ++first_free;
            }
            if (first_free == TREND_TABLE_ROWS) {
                continue; // a full table records no new process
            }
            index = first_free;
            start_history(block.trend_table[index], process);
            if (!walk) {
                trend_rows_by_pid.add(process.pid, index);
            }
        } else if (std::memcmp(block.trend_table[index].process_name, process.process_name,
                               PROCESS_NAME_FIELD) != 0) {
            // The pid now belongs to another program.
            start_history(block.trend_table[index], process);
        }
        block.trend_table[index].samples[slot] = {process.always_one, process.rss, process.dsiz,
                                                  process.vsize};
    }
}

// A process not listed this time loses its whole history.
void drop(tarn_control_block &block, int32_t slot) {
    for (trend_row &row : block.trend_table) {
        if (in_use(row) && !valid(row.samples[slot])) {
            std::memset(&row, 0, sizeof row);
        }
    }
}

// The longest table line: the pid and a name of 250 characters, then 24 samples of "%d, " twice.
constexpr size_t TABLE_LINE_MAX = sizeof "PID -2147483648, pname=[], vsizes=" - 1 +
                                  PROCESS_NAME_FIELD + sizeof " dsizes=" - 1 +
                                  2 * TREND_SAMPLES * (sizeof "-2147483648, " - 1);
static_assert(TABLE_LINE_MAX < LINE_SIZE);

// A table line under construction; it always has room. Built apart from `line`, whose every
// write could otherwise alias the row being read.
struct table_line {
    char text[TABLE_LINE_MAX + 1];
    size_t length = 0;

    void append(const char *from, size_t count) {
        std::memcpy(text + length, from, count);
        length += count;
    }
    void append_number(int32_t value) {
        length = static_cast<size_t>(
            std::to_chars(text + length, text + TABLE_LINE_MAX, value).ptr - text);
    }
    // "%d, " for `value` of each of the 24 samples, or "-X, " for one not taken. A size seldom
    // changes from one sample to the next: the text of the last one is used again.
    template <typename Value>
    void append_samples(const trend_row &row, Value value) {
        size_t last_at = 0;
        size_t last_length = 0;
        int32_t last_value = 0;
        for (const trend_sample &sample : row.samples) {
            if (!valid(sample)) {
                append("-X, ", 4);
                continue;
            }
            auto number = static_cast<int32_t>(value(sample));
            if (last_length != 0 && number == last_value) {
                std::memmove(text + length, text + last_at, last_length);
                length += last_length;
                continue;
            }
            last_at = length;
            append_number(number);
            append(", ", 2);
            last_length = length - last_at;
            last_value = number;
        }
    }
};

// "PID %d, pname=[%s], vsizes=" and the 24 vsizes, then " dsizes=" and the 24 dsizes.
void compose_table_line(const trend_row &row, table_line &built) {
    built.length = 0;
    built.append("PID ", 4);
    built.append_number(static_cast<int32_t>(row.pid));
    built.append(", pname=[", 9);
    built.append(row.process_name, strnlen(row.process_name, PROCESS_NAME_FIELD));
    built.append("], vsizes=", 10);
    built.append_samples(row, [](const trend_sample &s) { return s.vsize; });
    built.append(" dsizes=", 8);
    built.append_samples(row, [](const trend_sample &s) { return s.dsiz; });
    built.text[built.length] = '\0';
}

// Each line is traced from where it was built. `line`, the scratch line the table has always been
// built in, cleared for each row, is left as that leaves it: the last row's text, then NULs.
void trace_table(const tarn_control_block &block) {
    table_line built;
    bool traced = false;
    for (int32_t i = 0; i < TREND_TABLE_ROWS; ++i) {
        const trend_row &row = block.trend_table[i];
        if (in_use(row)) {
            compose_table_line(row, built);
            tracesvc_trace("TARNTRAF: Table entry [%d] = %s", i, built.text);
            traced = true;
        }
    }
    if (traced) {
        std::memset(line, 0, LINE_SIZE);
        std::memcpy(line, built.text, built.length);
    }
}

// Whether the trend of a process is analysed: the first log-table row its name matches decides by
// its memoryCheckFlag; a name that matches no row is analysed.
bool analysed(const char *name) {
    const log_threshold *row = first_log_match(name);
    return row == nullptr || row->memoryCheckFlag == 1;
}

// The answer for each name met in a call, so that a name is matched once however many processes
// bear it and however long their histories: neither the names nor the log table change within a
// call. Open addressing over more slots than the table has rows; no allocation.
class analysed_names {
  public:
    void clear() { std::fill(std::begin(slots), std::end(slots), slot{}); }
    // `field`: a row's name field, which lives as long as the call.
    bool analysed(const char (&field)[PROCESS_NAME_FIELD]) {
        size_t length = strnlen(field, PROCESS_NAME_FIELD);
        uint32_t hash = 2166136261u;
        for (size_t i = 0; i < length; ++i) {
            hash = (hash ^ static_cast<unsigned char>(field[i])) * 16777619u;
        }
        for (uint32_t at = hash % SLOTS;; at = (at + 1) % SLOTS) {
            slot &here = slots[at];
            if (here.name == nullptr) {
                here = {field, length, hash, ::analysed(row_name(field).text)};
                return here.answer;
            }
            if (here.hash == hash && here.length == length &&
                std::memcmp(here.name, field, length) == 0) {
                return here.answer;
            }
        }
    }

  private:
    static constexpr uint32_t SLOTS = 8192;
    static_assert(SLOTS >= 2 * TREND_TABLE_ROWS);
    struct slot {
        const char *name = nullptr; // the name field of the first row that bore it
        size_t length = 0;
        uint32_t hash = 0;
        bool answer = false;
    };
    slot slots[SLOTS];
};

analysed_names analysed_by_name;

struct trend_verdict {
    int32_t dontLog; // 1 = the trend held over the whole history: the process may be reported
    int32_t increases;
};

// Walks the history from its oldest sample. The name's answer is asked for at the first sample
// that needs it, and only there: it cannot change within a call.
trend_verdict judge_history(const trend_row &row) {
    trend_verdict verdict{1, 0};
    tracesvc_trace("TARNTRAD: full trend analysis point 0110");
    const trend_sample *prev = &row.samples[0];
    int analysed_answer = -1; // not asked yet
    for (int32_t i = 1; i < trend_analysis_points && i <= TREND_LAST_SLOT && verdict.dontLog == 1;
         ++i) {
        const trend_sample &sample = row.samples[i];
        if (!valid(sample)) {
            verdict.dontLog = 0;
            continue;
        }
        if (trend_row_lookup == trend_lookup::walk) {
            analysed_answer = analysed(row_name(row.process_name).text) ? 1 : 0;
        } else if (analysed_answer == -1) {
            analysed_answer = analysed_by_name.analysed(row.process_name) ? 1 : 0;
        }
        auto prev_dsiz = static_cast<int32_t>(prev->dsiz);
        auto prev_vsize = static_cast<int32_t>(prev->vsize);
        auto dsiz = static_cast<int32_t>(sample.dsiz);
        auto vsize = static_cast<int32_t>(sample.vsize);
        if (analysed_answer == 0) {
            tracesvc_trace("TARNTRAD: full trend analysis point 0120, i = %d (dec)", i);
            verdict.dontLog = 0;
        } else if (prev_dsiz > dsiz) {
            tracesvc_trace("TARNTRAD: full trend analysis point 0130, i = %d (dec)", i);
            verdict.dontLog = 0;
        } else if (prev_vsize > vsize) {
            tracesvc_trace("TARNTRAD: full trend analysis point 0140, i = %d (dec)", i);
            verdict.dontLog = 0;
        }
        if (prev_dsiz < dsiz || prev_vsize < vsize) {
            ++verdict.increases;
        }
        prev = &sample;
    }
    tracesvc_trace("TARNTRAF: full trend analysis point 0200, dontLog = %d (dec)", verdict.dontLog);
    tracesvc_trace("TARNTRAF: number of increases = %d (dec)", verdict.increases);
    return verdict;
}

void report_leak(const trend_row &row, const char *name, int32_t increases) {
    auto pid = static_cast<int32_t>(row.pid);
    tracesvc_trace("TARNTRAF: Possible memory leak detected via longterm analysis!");
    tracesvc_trace("TARNTRAF: PID is %d (dec)", pid);
    tracesvc_trace("TARNTRAF: process name is [%s]", name);
    tracesvc_trace(
        "TARNTRAF: process never went down over %d snapshots and increased %d of those times.",
        trend_analysis_points, increases);
    write_error_text("\n\rError Information: \n\rPossible memory leak detected via longterm "
                     "analysis!\n\rprocess name is: \n\r%s\n\r",
                     name);
    tarn_mon_error_handler(LEAK_REPORT_SRC, static_cast<uint32_t>(pid), RC_VSIZE_TREND);
}

void analyse(const tarn_control_block &block) {
    tracesvc_trace("TARNTRAF: About to do a full trend analysis");
    analysed_by_name.clear();
    for (const trend_row &row : block.trend_table) {
        if (!in_use(row)) {
            continue;
        }
        tracesvc_trace("TARNTRAD: full trend analysis point 0100");
        if (!valid(row.samples[0])) {
            continue;
        }
        trend_verdict verdict = judge_history(row);
        if (verdict.dontLog == 1 && verdict.increases >= trend_analysis_num_increases) {
            report_leak(row, row_name(row.process_name).text, verdict.increases);
        }
    }
}

} // namespace

TARN_EXPORT uint32_t tarn_trend_analysis(uint32_t *crc) {
    uint32_t src = 0;
    *crc = 0;
    tarn_control_block *block = TARN_CB_PTR;
    if (block == nullptr) {
        return src; // no block, no histories
    }
    // Only a foreign writer of the block could leave an index outside the 24 slots of a row; the
    // histories then go on from slot 0.
    if (block->analysisIndex < 0 || block->analysisIndex > TREND_LAST_SLOT) {
        block->analysisIndex = 0;
    }
    int32_t slot = block->analysisIndex;
    tracesvc_trace("TARNTRAF: analysis index = %d (dec)", slot);
    slide(*block, slot);
    record(*block, slot);
    drop(*block, slot);
    if (!histories_full(slot) && slot < TREND_LAST_SLOT) {
        block->analysisIndex = ++slot;
    }
    tracesvc_trace("TARNTRAF: number of analysis points = %d (dec)", slot);
    trace_table(*block);
    if (trend_analysis_points > 0 && histories_full(slot)) {
        analyse(*block);
    }
    return src;
}

#include "memory/pp_memory.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <regex.h>

#include "command_runner.h"
#include "core/control_file.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "core/words.h"
#include "data_blocks.h"
#include "memory/name_matching.h"
#include "tracesvc.h"

namespace {

constexpr command_spec PS_LISTING = {PS_COMMAND, nullptr, "ps", "ps"};
constexpr char PS_HEADER_MARK[] = "  PID";

// The six limits in force for one line, in KB.
struct limits {
    int32_t rss, dsiz, vsize;
    int32_t rss_abort, dsiz_abort, vsize_abort;
};

// One in-use override entry by pid; sorted by pid, then entry, with one item per pid.
struct override_index_item {
    uint32_t pid;
    int32_t entry;
};
override_index_item override_index[OVERRIDE_TABLE_ENTRIES];
int32_t override_index_size;

int32_t find_override(uint32_t pid) {
    const override_index_item *begin = override_index;
    const override_index_item *end = begin + override_index_size;
    const override_index_item *at =
        std::lower_bound(begin, end, pid, [](const override_index_item &item, uint32_t wanted) {
            return item.pid < wanted;
        });
    return at != end && at->pid == pid ? at->entry : -1;
}

void replace_where_set(int32_t &limit, uint32_t value) {
    if (value != 0) {
        limit = static_cast<int32_t>(value);
    }
}

// The first matching row of the log table gives the three limits.
void apply_log_table(const char *name, limits &in_force) {
    const log_threshold *row = first_log_match(name);
    if (row == nullptr) {
        return;
    }
    in_force.rss = row->rss_limit;
    in_force.dsiz = row->dsiz_limit;
    in_force.vsize = row->vsize_limit;
    tracesvc_trace("TARNMNDD: found log table match for pname [%s]", name);
    tracesvc_trace("TARNMNDD: with expression [%s]", row->process_mask);
    tracesvc_trace("TARNMNDD:   rss = %d, dsiz = %d, vsize = %d (dec)", in_force.rss, in_force.dsiz,
                   in_force.vsize);
}

// The first matching row of the abort table gives the three abort limits.
void apply_abort_table(const char *name, limits &in_force) {
    const abort_threshold *row = first_abort_match(name);
    if (row == nullptr) {
        return;
    }
    in_force.rss_abort = row->rss_abort_limit;
    in_force.dsiz_abort = row->dsiz_abort_limit;
    in_force.vsize_abort = row->vsize_abort_limit;
    tracesvc_trace("TARNMNDD: found abort table match for pname [%s]", name);
    tracesvc_trace("TARNMNDD: with expression [%s]", row->process_mask);
    tracesvc_trace("TARNMNDD:   Abort's Rss = %d, dsiz = %d, vsize = %d (dec)", in_force.rss_abort,
                   in_force.dsiz_abort, in_force.vsize_abort);
}

limits limits_for(uint32_t pid, const char *name, tarn_control_block &block) {
    limits in_force = {rss_memory_threshold,        dsiz_memory_threshold,
                       vsz_memory_threshold,        rss_abort_memory_threshold,
                       dsiz_abort_memory_threshold, vsz_abort_memory_threshold};
    int32_t index = find_override(pid);
    if (index == -1) {
        apply_log_table(name, in_force);
        apply_abort_table(name, in_force);
        return in_force;
    }
    // An entry, even of six zeros, keeps the process out of both tables.
    override_entry &entry = block.override_table[index];
    entry.seen = 1;
    replace_where_set(in_force.rss, entry.rss_limit);
    replace_where_set(in_force.dsiz, entry.dsiz_limit);
    replace_where_set(in_force.vsize, entry.vsize_limit);
    replace_where_set(in_force.rss_abort, entry.rss_abort_limit);
    replace_where_set(in_force.dsiz_abort, entry.dsiz_abort_limit);
    replace_where_set(in_force.vsize_abort, entry.vsize_abort_limit);
    return in_force;
}

// A size column: "123m" is 123,000 KB (the 'm' is taken off the word), anything else a number of
// KB. A size past the guard is 0 unless a finding is already held back.
int32_t read_size(char *word, uint32_t tookLog) {
    size_t length = std::strlen(word);
    int32_t size;
    if (length > 0 && word[length - 1] == 'm') {
        word[length - 1] = '\0';
        size = static_cast<int32_t>(static_cast<uint32_t>(int64_t{read_number(word)} * 1000));
    } else {
        size = read_number(word);
    }
    return size > PS_SIZE_GUARD && tookLog == 0 ? 0 : size;
}

void record_process(pp_memory_pass &pass, int32_t pid, int32_t rss, int32_t dsiz, int32_t vsize) {
    if (pid == pass.previous_pid) {
        return;
    }
    pass.previous_pid = pid;
    if (pass.process_row >= PROCESS_TABLE_ROWS) {
        return;
    }
    process_row &row = pass.block->process_table[pass.process_row++];
    row.in_use = 1;
    row.pid = static_cast<uint32_t>(pid);
    std::strncpy(row.process_name, words[5], PROCESS_NAME_FIELD);
    row.always_one = 1;
    row.rss = static_cast<uint32_t>(rss);
    row.dsiz = static_cast<uint32_t>(dsiz);
    row.vsize = static_cast<uint32_t>(vsize);
}

// `tookLog` as the line's sizes were guarded with it: another party may change it meanwhile.
void judge_rss(pp_memory_pass &pass, const char *text, int32_t pid, int32_t rss, int32_t vsize,
               const limits &in_force, uint32_t tookLog) {
    if (in_force.rss <= 0 || rss <= in_force.rss) {
        return;
    }
    bool abort = in_force.rss_abort > 0 && rss > in_force.rss_abort;
    *pass.takeLogCrc = TAKE_LOG_SUPPRESSED;
    if (tookLog != 0) {
        return;
    }
    tracesvc_trace(abort ? "TARNMNDF: RSS Abort threshold exceeded"
                         : "TARNMNDF: RSS threshold exceeded");
    // The value traced under the name rss has always been the vsize.
    tracesvc_trace("TARNMNDF: rss = %d (dec)", vsize);
    tracesvc_trace("TARNMNDF: Entire line was [%s]", text);
    write_error_text("\n\rError Information: \n\r%sEntire line was: \n\r%s\n\r",
                     abort ? "RSS Abort Threshold exceeded\n\r" : "RSS Threshold exceeded\n\r",
                     text);
    *pass.takeLogCrc = abort ? RC_PROCESS_RSS_ABORT : RC_PROCESS_RSS;
    *pass.takeLogValue = rss;
    if (abort) {
        *pass.killPid = pid;
    }
}

void judge_thread_count(pp_memory_pass &pass) {
    tracesvc_trace("TARNMNDF: number of threads = %d (dec)", pass.line_count);
    auto allowed = static_cast<int32_t>(static_cast<uint32_t>(num_threads_threshold) + 1);
    if (pass.line_count <= allowed) {
        return;
    }
    *pass.takeLogCrc = TAKE_LOG_SUPPRESSED;
    if (read_field(*pass.tookLog) == 0) {
        tracesvc_trace("TARNMNDF: number of threads threshold exceeded");
        tracesvc_trace("TARNMNDF: number of threads = %d (dec)", pass.line_count);
        *pass.takeLogCrc = RC_TOO_MANY_PROCESSES;
        *pass.takeLogValue = pass.line_count;
    }
}

// newPSDataBlock: the pass's text from the first "  PID" on, or nothing.
void copy_listing() {
    const char *from = std::strstr(primaryDataBlock, PS_HEADER_MARK);
    if (from != nullptr) {
        copy_to_ps_data_block(from);
    } else {
        clear_ps_data_block();
    }
}

void sweep_override_table(tarn_control_block &block) {
    for (override_entry &entry : block.override_table) {
        if (entry.in_use == 1 && entry.seen == 0) {
            tracesvc_trace("TARNMNDF: process %d went away; remove override",
                           static_cast<int32_t>(entry.pid));
            std::memset(&entry, 0, sizeof entry);
        }
    }
}

void check_locked(pp_memory_pass &pass) {
    tarn_control_block &block = *pass.block;
    tracesvc_trace("TARNMNDD: got access to override table");
    for (override_entry &entry : block.override_table) {
        entry.seen = 0;
    }
    std::memset(block.process_table, 0, sizeof block.process_table);
    std::snprintf(line, LINE_SIZE, "%s%s", "  \n\r", "About to output ps data \n\r");
    append_header_line(line);
    index_override_table(block);
    command_outcome outcome =
        run_command(PS_LISTING, [&pass](char *text, size_t) { pp_memory_line(pass, text); });
    if (outcome == command_outcome::ran) {
        judge_thread_count(pass);
        copy_listing();
    }
    sweep_override_table(block);
}

} // namespace

void index_override_table(const tarn_control_block &block) {
    override_index_size = 0;
    for (int32_t i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        if (block.override_table[i].in_use == 1) {
            override_index[override_index_size++] = {block.override_table[i].pid, i};
        }
    }
    override_index_item *end = override_index + override_index_size;
    std::sort(override_index, end, [](const override_index_item &a, const override_index_item &b) {
        return a.pid != b.pid ? a.pid < b.pid : a.entry < b.entry;
    });
    // The lowest entry of each pid is the one a walk from entry 0 stops at.
    end = std::unique(
        override_index, end,
        [](const override_index_item &a, const override_index_item &b) { return a.pid == b.pid; });
    override_index_size = static_cast<int32_t>(end - override_index);
}

void pp_memory_line(pp_memory_pass &pass, const char *text) {
    ++pass.line_count;
    append_data_line(text);
    split_words(text, PS_WORDS);
    int32_t pid = read_number(words[0]);
    // A command name with a blank in it shifts the columns after it: kept, as ps has always been
    // read this way.
    const char *name = words[5];
    limits in_force = limits_for(static_cast<uint32_t>(pid), name, *pass.block);
    uint32_t tookLog = read_field(*pass.tookLog);
    int32_t rss = read_size(words[2], tookLog);
    int32_t vsize = read_size(words[3], tookLog);
    int32_t dsiz = read_size(words[4], tookLog);
    record_process(pass, pid, rss, dsiz, vsize);
    judge_rss(pass, text, pid, rss, vsize, in_force, tookLog);
}

TARN_EXPORT uint32_t tarn_check_pp_memory(int32_t *takeLogCrc, int32_t *takeLogValue,
                                          int32_t *killPid, uint32_t *tookLog, uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> tarn_check_pp_memory");
    uint32_t src = 0;
    *killPid = 0;
    pp_memory_pass pass{takeLogCrc, takeLogValue, killPid, tookLog, TARN_CB_PTR};
    // The lock lives in the control block: without one there is nothing to lock, as when the lock
    // is not obtained.
    if (pass.block != nullptr && tarn_override_table_lock_control(1) == 0) {
        check_locked(pass);
        tarn_override_table_lock_control(0);
    }
    tracesvc_trace("TARNOTHF: <-- tarn_check_pp_memory, src = %x, crc = %x (hex)", src, *crc);
    return src;
}

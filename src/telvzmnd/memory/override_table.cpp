#include "memory/override_table.h"

#include <cstring>

#include "core/control_block.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "memsvc.h"
#include "tracesvc.h"

namespace {

constexpr int32_t TRACED_HEAD_ENTRIES = 20; // "First 20 entries are :"
constexpr int32_t TRACED_TAIL_FIRST = 4979; // "last 20 entries are :" lists 4,979 to 4,999
constexpr uint32_t SRC_LIMIT_OUT_OF_RANGE = 2;

// One argument: its value and the crc that names it when refused. Code 4 was never used.
struct limit_argument {
    int32_t value;
    uint8_t code;
};

// The code goes into the first byte of crc, the other three stay 0, whatever the byte order.
void set_code(uint32_t *crc, uint8_t code) {
    *crc = 0;
    std::memcpy(crc, &code, 1);
}

int32_t find_entry(const tarn_control_block &block, uint32_t pid) {
    for (int32_t i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        const override_entry &entry = block.override_table[i];
        if (entry.in_use == 1 && entry.pid == pid) {
            tracesvc_trace("TARNQT F: Found a pid match with entry %d (dec)", i);
            return i;
        }
    }
    return -1;
}

int32_t find_free_entry(const tarn_control_block &block) {
    for (int32_t i = 0; i < OVERRIDE_TABLE_ENTRIES; ++i) {
        if (block.override_table[i].in_use == 0) {
            return i;
        }
    }
    return -1;
}

void store_limits(override_entry &entry, const limit_argument (&limits)[6]) {
    entry.rss_limit = static_cast<uint32_t>(limits[0].value);
    entry.dsiz_limit = static_cast<uint32_t>(limits[1].value);
    entry.vsize_limit = static_cast<uint32_t>(limits[2].value);
    entry.rss_abort_limit = static_cast<uint32_t>(limits[3].value);
    entry.dsiz_abort_limit = static_cast<uint32_t>(limits[4].value);
    entry.vsize_abort_limit = static_cast<uint32_t>(limits[5].value);
}

void trace_pids(const tarn_control_block &block, int32_t first, int32_t last) {
    for (int32_t i = first; i <= last; ++i) {
        tracesvc_trace("TARNQT F: entry %d: pid = %d", i,
                       static_cast<int32_t>(block.override_table[i].pid));
    }
}

// Adds, replaces or frees the caller's entry; the table is locked. Returns src.
uint32_t update_table(tarn_control_block &block, uint32_t pid, const limit_argument (&limits)[6],
                      uint32_t src, uint32_t *crc) {
    int32_t index = find_entry(block, pid);
    tracesvc_trace("TARNQT F: entry_index = %d (dec)", index);
    if (index != -1) {
        tracesvc_trace("TARNQT F: entry found");
        override_entry &entry = block.override_table[index];
        bool any = false;
        for (const limit_argument &limit : limits) {
            any = any || limit.value != 0;
        }
        if (any) {
            store_limits(entry, limits);
        } else {
            std::memset(&entry, 0, sizeof entry);
        }
        return src;
    }
    tracesvc_trace("TARNQT F: no entry found for this name/pid");
    int32_t free_index = find_free_entry(block);
    if (free_index != -1) {
        tracesvc_trace("TARNQT F: adding entry at index %d (dec)", free_index);
        override_entry &entry = block.override_table[free_index];
        std::memset(&entry, 0, sizeof entry);
        entry.pid = pid;
        store_limits(entry, limits);
        entry.in_use = 1;
        return src;
    }
    tracesvc_trace("TARNQT F: unable to add entry to override table");
    tracesvc_trace("TARNQT F: index = %d (dec)", OVERRIDE_TABLE_ENTRIES);
    tracesvc_trace("TARNQT F: First 20 entries are :");
    trace_pids(block, 0, TRACED_HEAD_ENTRIES - 1);
    // 21 entries under a heading of 20: the listing has always ended at the table's last entry.
    tracesvc_trace("TARNQT F: last 20 entries are :");
    trace_pids(block, TRACED_TAIL_FIRST, OVERRIDE_TABLE_ENTRIES - 1);
    return tarn_mon_error_handler(src | 2, *crc, RC_OVERRIDE_TABLE_FULL);
}

} // namespace

TARN_EXPORT uint32_t tarn_override_thresholds(int32_t rss, int32_t dsiz, int32_t vsize,
                                              int32_t rssAbort, int32_t dsizAbort,
                                              int32_t vsizeAbort, uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> tarn_override_thresholds");
    // A refused crc pointer is never read or written; the closing trace shows 0 for it.
    uint32_t refused_crc = 0;
    uint32_t src = memsvc_ckptr(crc, sizeof *crc);
    if (src != 0) {
        crc = &refused_crc;
    } else {
        const limit_argument limits[6] = {{rss, 1},      {dsiz, 2},      {vsize, 3},
                                          {rssAbort, 5}, {dsizAbort, 6}, {vsizeAbort, 7}};
        tracesvc_trace("TARNOTHF: rssThreshold = %d (dec)", rss);
        tracesvc_trace("TARNOTHF: dsizThreshold = %d (dec)", dsiz);
        // The vsize limit has always been traced under the dsiz name.
        tracesvc_trace("TARNOTHF: dsizThreshold = %d (dec)", vsize);
        tracesvc_trace("TARNOTHF: rssAbortThreshold = %d (dec)", rssAbort);
        tracesvc_trace("TARNOTHF: dsizAbortThreshold = %d (dec)", dsizAbort);
        tracesvc_trace("TARNOTHF: vsizeAbortThreshold = %d (dec)", vsizeAbort);
        *crc = 0;
        for (const limit_argument &limit : limits) {
            if (limit.value > OVERRIDE_LIMIT_MAX || limit.value < 0) {
                src = SRC_LIMIT_OUT_OF_RANGE;
                set_code(crc, limit.code);
            }
        }
        if (src == 0) {
            src = tarn_init_tarn_cb_ptr(crc);
        }
        tarn_control_block *block = TARN_CB_PTR;
        if (src == 0 && block != nullptr) {
            auto pid = tracesvc_getpid();
            tracesvc_trace("TARNOTHF: our PID is %d", static_cast<int32_t>(pid));
            if (tarn_override_table_lock_control(1) == 0) {
                src = update_table(*block, pid, limits, src, crc);
                tarn_override_table_lock_control(0);
            }
        }
    }
    tracesvc_trace("TARNOTHF: <-- tarn_override_thresholds, src = %x, crc = %x (hex)", src, *crc);
    return src;
}

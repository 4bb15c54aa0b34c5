// Every reason code the monitor raises: findings about the host and failures of its own machinery.
#pragma once

#include <cstdint>
#include <string_view>

enum reason_code : uint32_t {
    RC_CONTROL_FILE_READ = 0xE081,
    RC_CONTROL_FILE_CLOSE = 0xE082,
    RC_NO_MEMORY_EXTERNAL_TABLE = 0xE085,
    RC_EXTERNAL_ROUTINE_UNRESOLVED = 0xE086,
    RC_NO_MEMORY_LOG_TABLE = 0xE087,
    RC_NO_MEMORY_ABORT_TABLE = 0xE088,
    RC_STALE_BLOCK_ID_ZERO = 0xE089,
    RC_BLOCK_NO_ADDRESS = 0xE08A,
    RC_BLOCK_NOT_CREATED = 0xE08B,
    RC_SEMAPHORE_NOT_OPENED = 0xE08C,
    RC_SNAPSHOT_OPEN_APPEND = 0xE090,
    RC_SNAPSHOT_WRITE_STAGED = 0xE091,
    RC_SNAPSHOT_WRITE_LINE = 0xE092,
    RC_SNAPSHOT_CLOSE_APPEND = 0xE093,
    RC_SNAPSHOT_CLOSE_AFTER_READ = 0xE094,
    RC_SNAPSHOT_OPEN_WRAP = 0xE095,
    RC_SNAPSHOT_WRITE_TRIMMED = 0xE096,
    RC_SNAPSHOT_CLOSE_AFTER_WRITE = 0xE097,
    RC_SNAPSHOT_READ_WRAP = 0xE098,
    RC_FILE_LISTING_SIZE = 0xE099,
    RC_OVERRIDE_TABLE_FULL = 0xE0A4,
    RC_TRACE_DATA_SIZE = 0xE0A5,
    RC_SYSTEM_CLASS = 0xE0F1,
    RC_PROCESS_RSS = 0xE111,
    RC_MEMORY_IN_USE = 0xE114,
    RC_TOO_MANY_PROCESSES = 0xE116,
    RC_PROCESS_RSS_ABORT = 0xE117,
    RC_RESERVED_KILL_1 = 0xE118,
    RC_RESERVED_KILL_2 = 0xE119,
    RC_VSIZE_TREND = 0xE11A,
    RC_LOW_FREE = 0xE11B,
    RC_SWAP_TOO_SMALL = 0xE11C,
    RC_OTHER_PARTITION_SPACE = 0xE121,
    RC_OTHER_PARTITION_INODES = 0xE122,
    RC_PARTITION_SPACE_FIRST = 0xE131, // /console/ffdc; one code a known partition up to 0xE13D
    RC_EXTRA_PARTITION_SPACE = 0xE139,
    RC_PARTITION_SPACE_LAST = 0xE13D,
    RC_PARTITION_INODES_FIRST = 0xE141,
    RC_PARTITION_INODES_LAST = 0xE14D,
    RC_PROCESS_CPU = 0xE150,
    RC_APPLIANCE_CPU = 0xE151,
    RC_SLEEP_OVERRUN = 0xE152,
    RC_SLEEP_OVERRUN_NOT_POSITIVE = 0xE153,
    RC_SYSTEM_DESCRIPTORS = 0xE160,
    RC_PROCESS_DESCRIPTORS = 0xE161,
    RC_TERMINATE_REQUESTED = 0xE170,
};

// The value of takeLogCrc that means found but not reported; never logged.
inline constexpr uint32_t TAKE_LOG_SUPPRESSED = 0x10000;

struct reason_code_text {
    uint32_t first;
    uint32_t last; // the same as first for a single code
    std::string_view meaning;
};

// What each code means, for people who read the event log.
inline constexpr reason_code_text REASON_CODE_TEXTS[] = {
    {0xE081, 0xE081, "the control file could not be read, or held fewer than 2 bytes"},
    {0xE082, 0xE082, "the control file could not be closed"},
    {0xE085, 0xE085, "no memory for the external routine table"},
    {0xE086, 0xE086, "an external checking routine could not be resolved"},
    {0xE087, 0xE087, "no memory for the log table"},
    {0xE088, 0xE088, "no memory for the abort table"},
    {0xE089, 0xE089, "the id of a stale control block came back as 0"},
    {0xE08A, 0xE08A, "attaching the control block gave no address"},
    {0xE08B, 0xE08B, "the control block could not be created and attached"},
    {0xE08C, 0xE08C, "the existing semaphore set could not be opened"},
    {0xE090, 0xE090, "snapshot file: open failed (append)"},
    {0xE091, 0xE091, "snapshot file: write of staged text failed"},
    {0xE092, 0xE092, "snapshot file: write of the oversized line failed"},
    {0xE093, 0xE093, "snapshot file: close failed (append)"},
    {0xE094, 0xE094, "snapshot file: close after reading failed (wrap)"},
    {0xE095, 0xE095, "snapshot file: open failed (wrap)"},
    {0xE096, 0xE096, "snapshot file: write of the trimmed text failed"},
    {0xE097, 0xE097, "snapshot file: close after writing failed (wrap)"},
    {0xE098, 0xE098, "snapshot file: read failed (wrap)"},
    {0xE099, 0xE099, "file listing: the size query of the listing file failed"},
    {0xE0A4, 0xE0A4, "the threshold override table is full"},
    {0xE0A5, 0xE0A5, "trace data gathering: the size query failed"},
    {0xE0F1, 0xE0F1, "a failure of the monitor reported in the system class"},
    {0xE111, 0xE111, "a process's rss is above its limit"},
    {0xE114, 0xE114, "memory in use is at or above its threshold"},
    {0xE116, 0xE116, "more processes listed than the thread threshold allows"},
    {0xE117, 0xE117, "a process's rss is above its abort limit; it is killed"},
    {0xE118, 0xE119, "reserved: the process is killed as for 0xE117"},
    {0xE11A, 0xE11A,
     "a process's data and virtual size never fell and kept rising: a possible leak"},
    {0xE11B, 0xE11B, "LowFree is below its threshold"},
    {0xE11C, 0xE11C, "total swap is below its threshold"},
    {0xE121, 0xE121, "a partition not in the known list is above its space threshold"},
    {0xE122, 0xE122, "a partition not in the known list is above its inode threshold"},
    {0xE131, 0xE13D, "a known partition is above its space threshold"},
    {0xE141, 0xE14D, "a known partition is above its inode threshold"},
    {0xE150, 0xE150, "a process used too much CPU over the recent samples"},
    {0xE151, 0xE151, "the appliance as a whole used too much CPU"},
    {0xE152, 0xE153, "the monitor's last sleep took too long"},
    {0xE160, 0xE160, "system-wide open file descriptors above their threshold"},
    {0xE161, 0xE161, "one process holds more descriptors than its threshold"},
    {0xE170, 0xE170, "monitoring was asked to terminate"},
};

// The meaning of `code`, or an empty view for a code the monitor never raises.
constexpr std::string_view reason_code_meaning(uint32_t code) {
    for (const auto &entry : REASON_CODE_TEXTS) {
        if (code >= entry.first && code <= entry.last) {
            return entry.meaning;
        }
    }
    return {};
}

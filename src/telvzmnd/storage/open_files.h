// The open files check: the kernel's file handles in use, from /proc/sys/fs/file-nr, against the
// system-wide percentage, and the descriptor listing of every process, printed by the root script
// lsmon.sh one /proc/<pid>/fd directory after the other, against the per-process line count.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "export.h"

// The loop's integers the check writes through, as the check contract hands them over.
struct open_files_pass {
    int32_t *takeLogCrc;
    int32_t *takeLogValue;
    const uint32_t *tookLog;
};

// The three numbers of a file-nr line, each read and taken times ten in 64 bits, then kept within
// the 32-bit range: the maximum of a host without a limit (9223372036854775807) stays 2147483647,
// so that its share is the small one it really is.
struct file_nr_figures {
    int32_t allocated = 0;
    int32_t free = 0; // allocated handles not in use
    int32_t maximum = 0;
};

// Handles in use against the maximum in tenths of a percent: ((allocated - free) x 1000) / maximum,
// truncated toward zero. It is computed in 64 bits and clamped to the 32-bit range, where 32-bit
// arithmetic would wrap once more than 214,748 handles are in use: a share that large stays a
// share above every threshold, with its sign. A maximum of 0 gives no share.
std::optional<int32_t> share_in_use(const file_nr_figures &figures);

// Takes one line of file-nr (NUL-terminated, line end removed): copies it into primaryDataBlock,
// traces its figures and judges the share. A line of fewer than three words reads the words of the
// line before it in the slots it does not fill.
void file_nr_line(const open_files_pass &pass, const char *text);

// What the check keeps while it reads the listing.
struct open_files_listing {
    open_files_pass pass;
    // Lines read since the last directory header, that header included: at the next header, the
    // lines of a block and the header that closes it.
    int32_t block_lines = 0;
    // The line read last, which the report of the last block quotes.
    std::string last_line;
};

// Takes one line of the listing: traces and counts it; a directory header (a first word beginning
// with "/proc") closes the block before it, which is judged, summed up in primaryDataBlock and
// cleared from lsDataBlock; every line then goes into lsDataBlock.
void listing_line(open_files_listing &listing, const char *text);

// After the last line: sums up and judges the last block.
void listing_end(open_files_listing &listing);

// The check. Out: on a finding *takeLogCrc and *takeLogValue; reads *tookLog; *crc is only traced.
// Returns src, always 0.
TARN_EXPORT uint32_t tarn_check_open_files(int32_t *takeLogCrc, int32_t *takeLogValue,
                                           uint32_t *tookLog, uint32_t *crc);

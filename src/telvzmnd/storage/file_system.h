// The file system check: how full every local file system is, by space and then by inodes, as two
// runs of df report it, judged mount point by mount point against the control file's thresholds.
// A full partition also has its files listed and is cleaned up.
#pragma once

#include <cstdint>

#include "export.h"

// 1 while a full /extra has been reported as information and is held back until /extra has been
// at or below its threshold again; the loop sets it after reporting, this check clears it.
extern int32_t extraFileSystemSRCOn;

// The two runs of df and how the check reads their lines.
enum class df_pass {
    space,  // df -h -l -T: device, type, size, used, available, use%, mount point
    inodes, // df --inodes -l: device, inodes, used, free, use%, mount point
};

// The loop's integers the check writes through, as the check contract hands them over.
struct file_system_pass {
    int32_t *takeLogCrc;
    int32_t *takeLogValue;
    uint32_t *tookLog;
    uint32_t *crc; // handed to the file listing and the clean-up, which set it
};

// Takes one line of df's output (NUL-terminated, line end removed): copies it into
// primaryDataBlock, splits it into `words` (a short line keeps the previous line's words in the
// slots it does not fill) and judges its mount point.
void df_line(const file_system_pass &pass, df_pass kind, const char *text);

// The check. Out: on a finding *takeLogCrc and *takeLogValue; *crc through the listing and
// clean-up runs. Returns src, always 0.
TARN_EXPORT uint32_t tarn_check_file_system(int32_t *takeLogCrc, int32_t *takeLogValue,
                                            uint32_t *tookLog, uint32_t *crc);

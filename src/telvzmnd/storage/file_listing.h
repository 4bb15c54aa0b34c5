// The two maintenance runs the file system check asks for on a partition it reported: a listing
// of the partition's files by disk usage, written by the appliance's root script rundu.sh into the
// data file "telvzdu.trm", and a clean-up by its root command cleanupPartition. Both run
// synchronously through runAsRoot and only trace what the script prints.
#pragma once

#include <cstddef>
#include <cstdint>

#include "export.h"

inline constexpr const char *FILE_LISTING_NAME = "telvzdu.trm";
// The clean-up's copy of a mount point with "/" appended: at most 511 characters of it are kept.
inline constexpr size_t MODIFIED_PARTITION_SIZE = 513;

// Has rundu.sh list the files of `hddPartition` into "telvzdu.trm", then asks the data-file
// service for that file's size. Out: *crc, 0 on entry, then the size query's. Returns the size
// query's src; 0 when no pipe could be made.
TARN_EXPORT uint32_t tarn_gather_file_list(const char *hddPartition, uint32_t *crc);

// Has cleanupPartition clean up `hddPartition`, named with a "/" appended ("/" becomes "//"). Out:
// *crc = 0. Returns 0.
TARN_EXPORT uint32_t tarn_cleanup_partition(const char *hddPartition, uint32_t *crc);

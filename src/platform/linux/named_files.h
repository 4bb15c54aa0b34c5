// The data-file service of the default platform: the named files of the data directory
// (TELV_DATA_DIR, created on first use), reached through the handles of telv::data_files.
#pragma once

#include <cstdint>

#include "filesvc.h"

namespace telv::named_files {

// As the data-file service: 0, or data_files::FAILED with the errno in *crc (also when the data
// directory cannot be created). *info is always 0.
uint32_t open(const char *name, uint32_t open_mode, uint32_t access, filesvc_handle_t *handle,
              uint32_t *info, uint32_t *crc);
uint32_t query_size(const char *name, uint32_t *size, uint32_t *crc);
uint32_t remove(const char *name, uint32_t *crc);

} // namespace telv::named_files

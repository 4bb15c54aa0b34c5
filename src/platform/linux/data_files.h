// Named data files in one directory, reached through 32-bit handles: the implementation behind the
// data-file service of the default platform and of the tests' recording platform.
#pragma once

#include <cstdint>
#include <string>

#include "filesvc.h"

namespace telv::data_files {

// Result of a failed call; the errno of the failing system call goes to *crc.
inline constexpr uint32_t FAILED = 8;

uint32_t open(const std::string &directory, const char *name, uint32_t open_mode, uint32_t access,
              filesvc_handle_t *handle, uint32_t *crc);
uint32_t read(filesvc_handle_t handle, void *buffer, uint32_t length, uint32_t mode,
              uint32_t offset, uint32_t *bytes_read, uint32_t *crc);
uint32_t write(filesvc_handle_t handle, const void *buffer, uint32_t length, uint32_t mode,
               uint32_t offset, uint32_t *bytes_written, uint32_t *crc);
uint32_t query_size(const std::string &directory, const char *name, uint32_t *size, uint32_t *crc);
uint32_t remove(const std::string &directory, const char *name, uint32_t *crc);
uint32_t close(filesvc_handle_t handle, uint32_t *crc);

// Handles currently open; a test uses it to see that every open was closed.
int open_count();

} // namespace telv::data_files

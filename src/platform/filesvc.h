/* Data-file service: named files kept in the service's data directory. */
#pragma once
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef uint32_t filesvc_handle_t;

/* open_mode */
#define FILESVC_OPEN_EXISTING 0u /* the file must exist */
#define FILESVC_OPEN_OR_CREATE 17u
/* access */
#define FILESVC_ACCESS_READ 1u
#define FILESVC_ACCESS_READ_WRITE 34u
/* mode of random_read and random_write */
#define FILESVC_AT_OFFSET 0u
#define FILESVC_APPEND 2u

/* Out: *handle, *info, *crc. share and options are advisory. */
uint32_t filesvc_search_file_open(const char *name, uint32_t open_mode, uint32_t access,
                                  uint32_t share, uint32_t options, filesvc_handle_t *handle,
                                  uint32_t *info, uint32_t *crc);
/* Out: buffer, *bytes_read, *info, *crc. */
uint32_t filesvc_random_read(filesvc_handle_t handle, void *buffer, uint32_t length, uint32_t mode,
                             uint32_t offset, uint32_t *bytes_read, uint32_t *info, uint32_t *crc);
/* Out: *bytes_written, *info, *crc. mode 2 appends and ignores offset. */
uint32_t filesvc_random_write(filesvc_handle_t handle, const void *buffer, uint32_t length,
                              uint32_t mode, uint32_t offset, uint32_t *bytes_written,
                              uint32_t *info, uint32_t *crc);
/* Out: *size, *crc. */
uint32_t filesvc_query_file_size(const char *name, uint32_t *size, uint32_t *crc);
/* Out: *crc. */
uint32_t filesvc_delete_file(const char *name, uint32_t *crc);
/* Out: *crc. */
uint32_t filesvc_close_file(filesvc_handle_t handle, uint32_t *crc);

#ifdef __cplusplus
}
#endif

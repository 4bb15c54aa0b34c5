// The data-file service over the files of the data directory.
#include "filesvc.h"

#include "data_files.h"
#include "named_files.h"
#include "platform_export.h"

using telv::api::serve;
using telv::data_files::FAILED;

TELV_PLATFORM_EXPORT uint32_t filesvc_search_file_open(const char *name, uint32_t open_mode,
                                                       uint32_t access, uint32_t, uint32_t,
                                                       filesvc_handle_t *handle, uint32_t *info,
                                                       uint32_t *crc) {
    return serve(FAILED, crc, [&] {
        return telv::named_files::open(name, open_mode, access, handle, info, crc);
    });
}

TELV_PLATFORM_EXPORT uint32_t filesvc_random_read(filesvc_handle_t handle, void *buffer,
                                                  uint32_t length, uint32_t mode, uint32_t offset,
                                                  uint32_t *bytes_read, uint32_t *info,
                                                  uint32_t *crc) {
    if (info != nullptr) {
        *info = 0;
    }
    return serve(FAILED, crc, [&] {
        return telv::data_files::read(handle, buffer, length, mode, offset, bytes_read, crc);
    });
}

TELV_PLATFORM_EXPORT uint32_t filesvc_random_write(filesvc_handle_t handle, const void *buffer,
                                                   uint32_t length, uint32_t mode, uint32_t offset,
                                                   uint32_t *bytes_written, uint32_t *info,
                                                   uint32_t *crc) {
    if (info != nullptr) {
        *info = 0;
    }
    return serve(FAILED, crc, [&] {
        return telv::data_files::write(handle, buffer, length, mode, offset, bytes_written, crc);
    });
}

TELV_PLATFORM_EXPORT uint32_t filesvc_query_file_size(const char *name, uint32_t *size,
                                                      uint32_t *crc) {
    return serve(FAILED, crc, [&] { return telv::named_files::query_size(name, size, crc); });
}

TELV_PLATFORM_EXPORT uint32_t filesvc_delete_file(const char *name, uint32_t *crc) {
    return serve(FAILED, crc, [&] { return telv::named_files::remove(name, crc); });
}

TELV_PLATFORM_EXPORT uint32_t filesvc_close_file(filesvc_handle_t handle, uint32_t *crc) {
    return serve(FAILED, crc, [&] { return telv::data_files::close(handle, crc); });
}

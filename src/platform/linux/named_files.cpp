#include "named_files.h"

#include <string>

#include "data_files.h"
#include "environment.h"

namespace telv::named_files {
namespace {

// Runs `call` on the data directory, or fails with the errno of its creation.
template <typename Call>
uint32_t in_data_directory(uint32_t *crc, Call call) {
    int error = 0;
    std::string directory = environment::data_directory(&error);
    if (error != 0) {
        if (crc != nullptr) {
            *crc = static_cast<uint32_t>(error);
        }
        return data_files::FAILED;
    }
    return call(directory);
}

} // namespace

uint32_t open(const char *name, uint32_t open_mode, uint32_t access, filesvc_handle_t *handle,
              uint32_t *info, uint32_t *crc) {
    if (info != nullptr) {
        *info = 0;
    }
    return in_data_directory(crc, [&](const std::string &directory) {
        return data_files::open(directory, name, open_mode, access, handle, crc);
    });
}

uint32_t query_size(const char *name, uint32_t *size, uint32_t *crc) {
    return in_data_directory(crc, [&](const std::string &directory) {
        return data_files::query_size(directory, name, size, crc);
    });
}

uint32_t remove(const char *name, uint32_t *crc) {
    return in_data_directory(crc, [&](const std::string &directory) {
        return data_files::remove(directory, name, crc);
    });
}

} // namespace telv::named_files

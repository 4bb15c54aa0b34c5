#include "data_files.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace telv::data_files {
namespace {

std::mutex table_lock;
std::vector<int> descriptors; // handle n is descriptors[n - 1]; -1 = free

uint32_t fail(uint32_t *crc, int error) {
    if (crc != nullptr) {
        *crc = static_cast<uint32_t>(error);
    }
    return FAILED;
}

// A data file is named, not pathed: a name that could leave the directory is refused.
bool valid_name(const char *name) {
    if (name == nullptr || name[0] == '\0' || std::strchr(name, '/') != nullptr) {
        return false;
    }
    return std::strcmp(name, ".") != 0 && std::strcmp(name, "..") != 0;
}

std::string path_of(const std::string &directory, const char *name) {
    return directory + "/" + name;
}

// Holds an exclusive lock on a file for its lifetime; fd -1 holds nothing.
class file_lock {
  public:
    explicit file_lock(int fd) : fd_(fd) {
        while (fd_ >= 0 && ::flock(fd_, LOCK_EX) != 0 && errno == EINTR) {
        }
    }
    ~file_lock() {
        if (fd_ >= 0) {
            ::flock(fd_, LOCK_UN);
        }
    }
    file_lock(const file_lock &) = delete;
    file_lock &operator=(const file_lock &) = delete;

  private:
    int fd_;
};

int descriptor_of(filesvc_handle_t handle) {
    std::lock_guard guard(table_lock);
    if (handle == 0 || handle > descriptors.size()) {
        return -1;
    }
    return descriptors[handle - 1];
}

} // namespace

uint32_t open(const std::string &directory, const char *name, uint32_t open_mode, uint32_t access,
              filesvc_handle_t *handle, uint32_t *crc) {
    if (!valid_name(name) || handle == nullptr) {
        return fail(crc, EINVAL);
    }
    int flags = O_CLOEXEC;
    if (access == FILESVC_ACCESS_READ) {
        flags |= O_RDONLY;
    } else if (access == FILESVC_ACCESS_READ_WRITE) {
        flags |= O_RDWR;
    } else {
        return fail(crc, EINVAL);
    }
    if (open_mode == FILESVC_OPEN_OR_CREATE) {
        flags |= O_CREAT;
    } else if (open_mode != FILESVC_OPEN_EXISTING) {
        return fail(crc, EINVAL);
    }
    std::lock_guard guard(table_lock);
    // Room for the handle first, so that a descriptor is never opened without a place to keep it.
    descriptors.reserve(descriptors.size() + 1);
    int fd = ::open(path_of(directory, name).c_str(), flags, 0644);
    if (fd < 0) {
        return fail(crc, errno);
    }
    size_t slot = 0;
    while (slot < descriptors.size() && descriptors[slot] >= 0) {
        ++slot;
    }
    if (slot == descriptors.size()) {
        descriptors.push_back(fd);
    } else {
        descriptors[slot] = fd;
    }
    *handle = static_cast<filesvc_handle_t>(slot + 1);
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

uint32_t read(filesvc_handle_t handle, void *buffer, uint32_t length, uint32_t mode,
              uint32_t offset, uint32_t *bytes_read, uint32_t *crc) {
    int fd = descriptor_of(handle);
    if (fd < 0) {
        return fail(crc, EBADF);
    }
    if (mode != FILESVC_AT_OFFSET || buffer == nullptr || bytes_read == nullptr) {
        return fail(crc, EINVAL);
    }
    uint32_t total = 0;
    while (total < length) {
        ssize_t n = ::pread(fd, static_cast<char *>(buffer) + total, length - total,
                            static_cast<off_t>(offset) + total);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return fail(crc, errno);
        }
        if (n == 0) {
            break;
        }
        total += static_cast<uint32_t>(n);
    }
    *bytes_read = total;
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

uint32_t write(filesvc_handle_t handle, const void *buffer, uint32_t length, uint32_t mode,
               uint32_t offset, uint32_t *bytes_written, uint32_t *crc) {
    int fd = descriptor_of(handle);
    if (fd < 0) {
        return fail(crc, EBADF);
    }
    if ((mode != FILESVC_AT_OFFSET && mode != FILESVC_APPEND) || buffer == nullptr ||
        bytes_written == nullptr) {
        return fail(crc, EINVAL);
    }
    off_t position = offset;
    // Appenders through other handles, here or in another process, take the same lock, so that
    // no two of them find the same end and write over each other.
    file_lock append_lock(mode == FILESVC_APPEND ? fd : -1);
    if (mode == FILESVC_APPEND) {
        struct stat st;
        if (::fstat(fd, &st) != 0) {
            return fail(crc, errno);
        }
        position = st.st_size;
    }
    uint32_t total = 0;
    while (total < length) {
        ssize_t n = ::pwrite(fd, static_cast<const char *>(buffer) + total, length - total,
                             position + total);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            *bytes_written = total;
            return fail(crc, errno);
        }
        total += static_cast<uint32_t>(n);
    }
    *bytes_written = total;
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

uint32_t query_size(const std::string &directory, const char *name, uint32_t *size, uint32_t *crc) {
    if (!valid_name(name) || size == nullptr) {
        return fail(crc, EINVAL);
    }
    struct stat st;
    if (::stat(path_of(directory, name).c_str(), &st) != 0) {
        return fail(crc, errno);
    }
    if (static_cast<uint64_t>(st.st_size) > UINT32_MAX) {
        return fail(crc, EFBIG);
    }
    *size = static_cast<uint32_t>(st.st_size);
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

uint32_t remove(const std::string &directory, const char *name, uint32_t *crc) {
    if (!valid_name(name)) {
        return fail(crc, EINVAL);
    }
    if (::unlink(path_of(directory, name).c_str()) != 0) {
        return fail(crc, errno);
    }
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

uint32_t close(filesvc_handle_t handle, uint32_t *crc) {
    int fd;
    {
        std::lock_guard guard(table_lock);
        if (handle == 0 || handle > descriptors.size() || descriptors[handle - 1] < 0) {
            return fail(crc, EBADF);
        }
        fd = descriptors[handle - 1];
        descriptors[handle - 1] = -1;
    }
    if (::close(fd) != 0) {
        return fail(crc, errno);
    }
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

int open_count() {
    std::lock_guard guard(table_lock);
    int count = 0;
    for (int fd : descriptors) {
        count += fd >= 0 ? 1 : 0;
    }
    return count;
}

} // namespace telv::data_files

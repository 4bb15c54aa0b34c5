#include "io.h"

#include <cerrno>
#include <unistd.h>

namespace telv::io {

int write_all(int fd, const void *data, size_t length) {
    const auto *next = static_cast<const char *>(data);
    int error = 0;
    while (length > 0 && error == 0) {
        ssize_t n = ::write(fd, next, length);
        if (n > 0) {
            next += n;
            length -= static_cast<size_t>(n);
        } else if (n == 0) {
            error = EIO;
        } else if (errno != EINTR) {
            error = errno;
        }
    }
    return error;
}

} // namespace telv::io

// A file descriptor that the commands open and that closes itself when it goes out of scope.
#pragma once

#include <unistd.h>

struct descriptor {
    explicit descriptor(int opened) : fd(opened) {}
    descriptor(const descriptor &) = delete;
    descriptor &operator=(const descriptor &) = delete;
    ~descriptor() {
        if (fd >= 0) {
            ::close(fd);
        }
    }
    const int fd;
};

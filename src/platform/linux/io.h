// Small descriptor helpers shared by the files of the default platform.
#pragma once

#include <cstddef>

namespace telv::io {

// Writes all `length` bytes, resuming after signals and short writes. 0, or the errno of the
// failing write (EIO when the file took nothing without saying why).
int write_all(int fd, const void *data, size_t length);

} // namespace telv::io

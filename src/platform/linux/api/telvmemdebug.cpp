// The debugging allocator over the table of live blocks.
#include "telvmemdebug.h"

#include "memdebug.h"
#include "platform_export.h"

using telv::api::serve;

// A failed allocation leaves ENOMEM in errno, as the C library's allocators do.
TELV_PLATFORM_EXPORT void *telvmemdebug_malloc(size_t size, const char *file, int line) {
    void *block =
        serve<void *>(nullptr, [&] { return telv::memdebug::allocate(size, file, line); });
    if (block == nullptr) {
        errno = ENOMEM;
    }
    return block;
}

TELV_PLATFORM_EXPORT void *telvmemdebug_calloc(size_t count, size_t size, const char *file,
                                               int line) {
    void *block = serve<void *>(
        nullptr, [&] { return telv::memdebug::allocate_zeroed(count, size, file, line); });
    if (block == nullptr) {
        errno = ENOMEM;
    }
    return block;
}

TELV_PLATFORM_EXPORT void telvmemdebug_free(void *ptr, const char *file, int line) {
    serve(0, [&] {
        telv::memdebug::release(ptr, file, line);
        return 0;
    });
}

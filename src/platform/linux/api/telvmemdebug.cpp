// The debugging allocator over the table of live blocks.
#include "telvmemdebug.h"

#include "memdebug.h"
#include "platform_export.h"

TELV_PLATFORM_EXPORT void *telvmemdebug_malloc(size_t size, const char *file, int line) {
    return telv::memdebug::allocate(size, file, line);
}

TELV_PLATFORM_EXPORT void *telvmemdebug_calloc(size_t count, size_t size, const char *file,
                                               int line) {
    return telv::memdebug::allocate_zeroed(count, size, file, line);
}

TELV_PLATFORM_EXPORT void telvmemdebug_free(void *ptr, const char *file, int line) {
    telv::memdebug::release(ptr, file, line);
}

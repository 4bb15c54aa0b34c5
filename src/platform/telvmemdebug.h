/* Debugging allocator: every block remembers the source file and line that took it. */
#pragma once
#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

void *telvmemdebug_malloc(size_t size, const char *file, int line);
void *telvmemdebug_calloc(size_t count, size_t size, const char *file, int line);
void telvmemdebug_free(void *ptr, const char *file, int line);

#ifdef __cplusplus
}
#endif

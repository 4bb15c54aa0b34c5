// Every allocation of the monitor goes through the platform's debugging allocator, which remembers
// the source file and line that took each block.
#pragma once

#include "telvmemdebug.h"

#define TARN_MALLOC(size) telvmemdebug_malloc((size), __FILE_NAME__, __LINE__)
#define TARN_CALLOC(count, size) telvmemdebug_calloc((count), (size), __FILE_NAME__, __LINE__)
#define TARN_FREE(block) telvmemdebug_free((block), __FILE_NAME__, __LINE__)

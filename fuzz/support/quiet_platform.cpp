// A platform that records nothing, for fuzz targets: trace lines are formatted (so that every
// argument is read as the monitor hands it over) and dropped, dumps are read and dropped, files
// are refused, the module service resolves nothing, and the allocator is the C library's.
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

#include "filesvc.h"
#include "jcb.h"
#include "logsvc.h"
#include "memsvc.h"
#include "modsvc.h"
#include "telvmemdebug.h"
#include "tracesvc.h"

namespace {

constexpr uint32_t REFUSED = 8;

uint32_t refuse(uint32_t *crc) {
    if (crc != nullptr) {
        *crc = ENOENT;
    }
    return REFUSED;
}

volatile unsigned char sink; // keeps the reads of a dump from being optimised away

} // namespace

extern "C" {

uint32_t filesvc_search_file_open(const char *, uint32_t, uint32_t, uint32_t, uint32_t,
                                  filesvc_handle_t *, uint32_t *, uint32_t *crc) {
    return refuse(crc);
}
uint32_t filesvc_random_read(filesvc_handle_t, void *, uint32_t, uint32_t, uint32_t,
                             uint32_t *bytes_read, uint32_t *, uint32_t *crc) {
    if (bytes_read != nullptr) {
        *bytes_read = 0;
    }
    return refuse(crc);
}
uint32_t filesvc_random_write(filesvc_handle_t, const void *, uint32_t, uint32_t, uint32_t,
                              uint32_t *bytes_written, uint32_t *, uint32_t *crc) {
    if (bytes_written != nullptr) {
        *bytes_written = 0;
    }
    return refuse(crc);
}
uint32_t filesvc_query_file_size(const char *, uint32_t *, uint32_t *crc) {
    return refuse(crc);
}
uint32_t filesvc_delete_file(const char *, uint32_t *crc) {
    return refuse(crc);
}
uint32_t filesvc_close_file(filesvc_handle_t, uint32_t *crc) {
    return refuse(crc);
}

int tracesvc_trace(const char *format, ...) {
    va_list args;
    va_start(args, format);
    int length = std::vsnprintf(nullptr, 0, format, args);
    va_end(args);
    return length;
}
int tracesvc_dump_bytes(const char *, const void *data, uint32_t length) {
    const auto *bytes = static_cast<const unsigned char *>(data);
    unsigned char sum = 0;
    for (uint32_t i = 0; bytes != nullptr && i < length; ++i) {
        sum = static_cast<unsigned char>(sum + bytes[i]);
    }
    sink = sum;
    return 0;
}
uint32_t tracesvc_getpid(void) {
    return static_cast<uint32_t>(getpid());
}

uint32_t logsvc_microcode_log(void *, uint32_t *crc) {
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

int jcbGetBooleanArgument(jcb_context *, int *value) {
    if (value != nullptr) {
        *value = 0;
    }
    return 0;
}
const char *jcbGetLastErrorMessage(void) {
    return "";
}
void jcbSetNativeFunctionError(jcb_context *, const char *, ...) {}
void jcbSetReturnCodes(jcb_context *, uint32_t, uint32_t) {}
void jcbSetVoidResult(jcb_context *) {}

uint32_t modsvc_get_func_addr2(const char *, const char *, void **, void **, uint32_t *crc) {
    return refuse(crc);
}
uint32_t modsvc_release_func_addr(const char *, void *, uint32_t *crc) {
    return refuse(crc);
}

uint32_t memsvc_ckptr(const void *ptr, uint32_t) {
    return ptr == nullptr ? 1u : 0u;
}

void *telvmemdebug_malloc(size_t size, const char *, int) {
    return std::malloc(size);
}
void *telvmemdebug_calloc(size_t count, size_t size, const char *, int) {
    return std::calloc(count, size);
}
void telvmemdebug_free(void *ptr, const char *, int) {
    std::free(ptr);
}

} // extern "C"

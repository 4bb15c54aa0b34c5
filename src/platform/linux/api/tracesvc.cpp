// The trace service over the trace file.
#include "tracesvc.h"

#include <cstdarg>
#include <unistd.h>

#include "platform_export.h"
#include "trace_file.h"

using telv::api::serve;

TELV_PLATFORM_EXPORT int tracesvc_trace(const char *format, ...) {
    va_list args;
    va_start(args, format);
    int length = serve(-1, [&] { return telv::trace::vline(format, args); });
    va_end(args);
    return length;
}

TELV_PLATFORM_EXPORT int tracesvc_dump_bytes(const char *title, const void *data, uint32_t length) {
    return serve(-1, [&] { return telv::trace::dump(title, data, length); });
}

TELV_PLATFORM_EXPORT uint32_t tracesvc_getpid(void) {
    return static_cast<uint32_t>(::getpid());
}

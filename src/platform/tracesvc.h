/* Trace service: one formatted line per call, hex dumps, and the caller's pid. */
#pragma once
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

int tracesvc_trace(const char *format, ...) __attribute__((format(printf, 1, 2)));
int tracesvc_dump_bytes(const char *title, const void *data, uint32_t length);
uint32_t tracesvc_getpid(void);

#ifdef __cplusplus
}
#endif

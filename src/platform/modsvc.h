/* Module service: resolves a function by module and name. */
#pragma once
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The name under which the monitor's own library is known to the module service. */
#define MODSVC_MONITOR_MODULE "telvzmnd"

/* Out: *address, *handle, *crc. 0 = resolved. */
uint32_t modsvc_get_func_addr2(const char *module, const char *function, void **address,
                               void **handle, uint32_t *crc);
/* Out: *crc. */
uint32_t modsvc_release_func_addr(const char *function, void *handle, uint32_t *crc);

#ifdef __cplusplus
}
#endif

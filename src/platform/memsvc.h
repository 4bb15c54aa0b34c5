/* Pointer check. */
#pragma once
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* 0 when `length` bytes at `ptr` can be read and written. */
uint32_t memsvc_ckptr(const void *ptr, uint32_t length);

#ifdef __cplusplus
}
#endif

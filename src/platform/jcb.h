/* Java native-call bridge: arguments and results of a native method call. */
#pragma once
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct jcb_context jcb_context;

/* Out: *value. */
int jcbGetBooleanArgument(jcb_context *ctx, int *value);
const char *jcbGetLastErrorMessage(void);
void jcbSetNativeFunctionError(jcb_context *ctx, const char *format, ...)
    __attribute__((format(printf, 2, 3)));
void jcbSetReturnCodes(jcb_context *ctx, uint32_t src, uint32_t crc);
void jcbSetVoidResult(jcb_context *ctx);

#ifdef __cplusplus
}
#endif

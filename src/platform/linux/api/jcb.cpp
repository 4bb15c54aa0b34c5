// The Java native-call bridge over JNI.
#include "jcb.h"

#include <cstdarg>

#include "java_bridge.h"
#include "jcb_jni.h"
#include "platform_export.h"

using telv::api::serve;
namespace bridge = telv::java_bridge;

TELV_PLATFORM_EXPORT int jcbGetBooleanArgument(jcb_context *ctx, int *value) {
    return serve(int{JCB_NO_ENVIRONMENT}, [&] { return bridge::get_boolean_argument(ctx, value); });
}

TELV_PLATFORM_EXPORT const char *jcbGetLastErrorMessage(void) {
    return bridge::last_error_message();
}

TELV_PLATFORM_EXPORT void jcbSetNativeFunctionError(jcb_context *ctx, const char *format, ...) {
    va_list arguments;
    va_start(arguments, format);
    serve(0, [&] {
        bridge::set_native_function_error(ctx, format, arguments);
        return 0;
    });
    va_end(arguments);
}

TELV_PLATFORM_EXPORT void jcbSetReturnCodes(jcb_context *ctx, uint32_t src, uint32_t crc) {
    serve(0, [&] {
        bridge::set_return_codes(ctx, src, crc);
        return 0;
    });
}

TELV_PLATFORM_EXPORT void jcbSetVoidResult(jcb_context *ctx) {
    serve(0, [&] {
        bridge::set_void_result(ctx);
        return 0;
    });
}

TELV_PLATFORM_EXPORT void jcbBeginCall(jcb_context *ctx, JNIEnv *env, const jcb_argument *arguments,
                                       int count) {
    serve(0, [&] {
        bridge::begin_call(ctx, env, arguments, count);
        return 0;
    });
}

TELV_PLATFORM_EXPORT int jcbEndCall(jcb_context *ctx, const char *function, int rc) {
    return serve(0, [&] { return bridge::end_call(ctx, function, rc); });
}

// The Java native-call bridge of the default platform: the arguments of one native call read from
// its jcb_context, and a native-function error turned into a Java exception when the call ends.
// Nothing here may bring down the JVM: a call without an environment, with an exception pending
// or with an argument of the wrong kind answers with a code and a message instead.
#pragma once

#include <cstdarg>
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "jcb_jni.h"

namespace telv::java_bridge {

// The last failure of a bridge call on the calling thread (each thread has its own); empty
// until one fails. It stays valid until the thread's next failing bridge call.
const char *last_error_message();

void begin_call(jcb_context *ctx, JNIEnv *env, const jcb_argument *arguments, int count);
int get_boolean_argument(jcb_context *ctx, int *value);
void set_native_function_error(jcb_context *ctx, const char *format, va_list arguments);
void set_return_codes(jcb_context *ctx, uint32_t src, uint32_t crc);
void set_void_result(jcb_context *ctx);
int end_call(jcb_context *ctx, const char *function, int rc);

// `text` as UTF-16 for a Java string, into `out` (room for `room` units): well-formed UTF-8
// sequences as their characters, every other byte as the Latin-1 character of that value, so any
// bytes make a valid string. Returns the number of units written; text beyond the room is dropped.
size_t to_utf16(std::string_view text, jchar *out, size_t room);

// `text` cut to fit `size` bytes with its NUL, at a character boundary: a UTF-8 sequence that
// would be cut is dropped whole. Returns the length kept.
size_t cut_to_fit(char *text, size_t length, size_t size);

} // namespace telv::java_bridge

#include "java_bridge.h"

#include <cstdio>
#include <cstring>

namespace telv::java_bridge {
namespace {

thread_local char last_error[JCB_MESSAGE_SIZE];

// Sets the calling thread's last error message.
__attribute__((format(printf, 1, 2))) void fail_with(const char *format, ...) {
    va_list arguments;
    va_start(arguments, format);
    int length = std::vsnprintf(last_error, sizeof last_error, format, arguments);
    va_end(arguments);
    if (length < 0) {
        last_error[0] = '\0';
        return;
    }
    cut_to_fit(last_error, static_cast<size_t>(length), sizeof last_error);
}

bool has_environment(const jcb_context *ctx) {
    if (ctx == nullptr) {
        fail_with("no JNI environment: the call context is null");
        return false;
    }
    if (ctx->env == nullptr) {
        fail_with("no JNI environment: the call context holds none");
        return false;
    }
    return true;
}

// The primitive kinds of argument by their JNI signature letter, as a message names them.
struct Kind {
    char letter;
    const char *name;
};
constexpr Kind KINDS[] = {{'B', "a byte"}, {'C', "a char"},  {'S', "a short"}, {'I', "an int"},
                          {'J', "a long"}, {'F', "a float"}, {'D', "a double"}};

const char *kind_name(char letter) {
    for (const Kind &kind : KINDS) {
        if (kind.letter == letter) {
            return kind.name;
        }
    }
    return "of no known kind";
}

// The class name of `object` into `name`; "an object" when it cannot be had. An exception raised
// on the way is this routine's own, not the caller's, and is cleared.
void class_name_of(JNIEnv *env, jobject object, char *name, size_t size) {
    std::snprintf(name, size, "an object");
    jclass of_object = env->GetObjectClass(object);
    jclass class_class = env->FindClass("java/lang/Class");
    jmethodID get_name = nullptr;
    if (class_class != nullptr) {
        get_name = env->GetMethodID(class_class, "getName", "()Ljava/lang/String;");
    }
    jstring text = nullptr;
    if (get_name != nullptr && of_object != nullptr) {
        text = static_cast<jstring>(env->CallObjectMethod(of_object, get_name));
    }
    if (!env->ExceptionCheck() && text != nullptr) {
        if (const char *chars = env->GetStringUTFChars(text, nullptr); chars != nullptr) {
            int length = std::snprintf(name, size, "a %s", chars);
            cut_to_fit(name, length < 0 ? 0 : static_cast<size_t>(length), size);
            env->ReleaseStringUTFChars(text, chars);
        }
    }
    env->ExceptionClear();
    for (jobject local : {static_cast<jobject>(text), static_cast<jobject>(class_class),
                          static_cast<jobject>(of_object)}) {
        if (local != nullptr) {
            env->DeleteLocalRef(local);
        }
    }
}

// The value of argument `position`, an object that must be a java.lang.Boolean.
int unbox(JNIEnv *env, jobject object, int position, int *value) {
    if (object == nullptr) {
        fail_with("argument %d is null, not a boolean", position);
        return JCB_NOT_BOOLEAN;
    }
    jclass boolean_class = env->FindClass("java/lang/Boolean");
    if (boolean_class == nullptr) {
        fail_with("argument %d: class java.lang.Boolean not found", position);
        return JCB_EXCEPTION_PENDING;
    }
    int rc = JCB_OK;
    if (!env->IsInstanceOf(object, boolean_class)) {
        char name[256];
        class_name_of(env, object, name, sizeof name);
        fail_with("argument %d is %s, not a boolean", position, name);
        rc = JCB_NOT_BOOLEAN;
    } else {
        jmethodID boolean_value = env->GetMethodID(boolean_class, "booleanValue", "()Z");
        jboolean flag =
            boolean_value != nullptr ? env->CallBooleanMethod(object, boolean_value) : JNI_FALSE;
        if (env->ExceptionCheck()) {
            fail_with("argument %d: reading the Boolean raised a Java exception", position);
            rc = JCB_EXCEPTION_PENDING;
        } else {
            *value = flag != JNI_FALSE ? 1 : 0;
        }
    }
    env->DeleteLocalRef(boolean_class);
    return rc;
}

// The character of the well-formed UTF-8 sequence at the start of `text` into `character`; its
// length, or 0 when none starts there (a stray byte, an overlong form, a surrogate, a cut end).
size_t decode_utf8(std::string_view text, char32_t *character) {
    static constexpr char32_t SMALLEST[] = {0, 0, 0x80, 0x800, 0x10000}; // by sequence length
    auto byte = [&](size_t i) { return static_cast<unsigned char>(text[i]); };
    if (byte(0) < 0x80) {
        *character = byte(0);
        return 1;
    }
    size_t length = byte(0) >= 0xF8   ? 0
                    : byte(0) >= 0xF0 ? 4
                    : byte(0) >= 0xE0 ? 3
                    : byte(0) >= 0xC0 ? 2
                                      : 0;
    if (length == 0 || text.size() < length) {
        return 0;
    }
    char32_t value = byte(0) & (0x7Fu >> length);
    for (size_t i = 1; i < length; ++i) {
        if ((byte(i) & 0xC0) != 0x80) {
            return 0;
        }
        value = value << 6 | (byte(i) & 0x3F);
    }
    if (value < SMALLEST[length] || value > 0x10FFFF || (value >= 0xD800 && value <= 0xDFFF)) {
        return 0;
    }
    *character = value;
    return length;
}

// Raises the bridge's exception in the calling thread; an exception pending already becomes its
// cause. When the bridge's class cannot be had from the caller's class loader, a
// RuntimeException carries the message instead, so that it reaches Java all the same.
void raise(JNIEnv *env, const char *message, uint32_t src, uint32_t crc) {
    jthrowable cause = env->ExceptionOccurred();
    env->ExceptionClear();
    jchar text[JCB_MESSAGE_SIZE];
    size_t units = to_utf16(message, text, JCB_MESSAGE_SIZE);
    jstring java_text = env->NewString(text, static_cast<jsize>(units));
    if (java_text == nullptr) {
        return; // the OutOfMemoryError is pending
    }
    jobject exception = nullptr;
    if (jclass bridge_class = env->FindClass(JCB_EXCEPTION_CLASS); bridge_class != nullptr) {
        jmethodID make = env->GetMethodID(bridge_class, "<init>",
                                          "(Ljava/lang/String;IILjava/lang/Throwable;)V");
        if (make != nullptr) {
            exception = env->NewObject(bridge_class, make, java_text, static_cast<jint>(src),
                                       static_cast<jint>(crc), cause);
        }
    }
    if (exception == nullptr) {
        env->ExceptionClear();
        if (jclass fallback = env->FindClass("java/lang/RuntimeException"); fallback != nullptr) {
            jmethodID make =
                env->GetMethodID(fallback, "<init>", "(Ljava/lang/String;Ljava/lang/Throwable;)V");
            if (make != nullptr) {
                exception = env->NewObject(fallback, make, java_text, cause);
            }
        }
    }
    if (exception != nullptr) {
        env->Throw(static_cast<jthrowable>(exception));
    }
}

} // namespace

const char *last_error_message() {
    return last_error;
}

void begin_call(jcb_context *ctx, JNIEnv *env, const jcb_argument *arguments, int count) {
    if (ctx == nullptr) {
        fail_with("no call context to begin: the call context is null");
        return;
    }
    std::memset(ctx, 0, sizeof *ctx);
    ctx->env = env;
    ctx->arguments = arguments;
    ctx->argument_count = arguments != nullptr && count > 0 ? count : 0;
}

int get_boolean_argument(jcb_context *ctx, int *value) {
    if (!has_environment(ctx)) {
        return JCB_NO_ENVIRONMENT;
    }
    if (value == nullptr) {
        fail_with("no place for the value: its pointer is null");
        return JCB_NO_OUTPUT;
    }
    // Every JNI call but a few is forbidden while an exception is pending.
    if (ctx->env->ExceptionCheck()) {
        fail_with("a Java exception is pending in the calling thread");
        return JCB_EXCEPTION_PENDING;
    }
    int next = ctx->next_argument;
    if (next < 0 || next >= ctx->argument_count) {
        fail_with("the call has no argument %d: it was given %d", next + 1, ctx->argument_count);
        return JCB_NO_ARGUMENT;
    }
    // A refused argument is not taken: the next fetch looks at it again.
    const jcb_argument &argument = ctx->arguments[next];
    int position = next + 1;
    int rc = JCB_OK;
    if (argument.type == 'Z') {
        *value = argument.value.z != JNI_FALSE ? 1 : 0;
    } else if (argument.type == 'L') {
        rc = unbox(ctx->env, argument.value.l, position, value);
    } else {
        fail_with("argument %d is %s, not a boolean", position, kind_name(argument.type));
        rc = JCB_NOT_BOOLEAN;
    }
    if (rc == JCB_OK) {
        ctx->next_argument = position;
    }
    return rc;
}

void set_native_function_error(jcb_context *ctx, const char *format, va_list arguments) {
    if (ctx == nullptr) {
        fail_with("no call context for the native-function error: the call context is null");
        return;
    }
    int length = format != nullptr
                     ? std::vsnprintf(ctx->message, sizeof ctx->message, format, arguments)
                     : -1;
    if (length < 0) {
        std::snprintf(ctx->message, sizeof ctx->message, "the native function failed");
    } else {
        cut_to_fit(ctx->message, static_cast<size_t>(length), sizeof ctx->message);
    }
    ctx->failed = 1;
}

void set_return_codes(jcb_context *ctx, uint32_t src, uint32_t crc) {
    if (ctx == nullptr) {
        fail_with("no call context for the return codes: the call context is null");
        return;
    }
    ctx->src = src;
    ctx->crc = crc;
    ctx->codes_set = 1;
}

void set_void_result(jcb_context *ctx) {
    if (ctx == nullptr) {
        fail_with("no call context for the result: the call context is null");
        return;
    }
    ctx->void_result = 1;
}

int end_call(jcb_context *ctx, const char *function, int rc) {
    if (!has_environment(ctx)) {
        return 0;
    }
    JNIEnv *env = ctx->env;
    if (ctx->failed == 0 && rc == 0) {
        return env->ExceptionCheck() ? 1 : 0;
    }
    if (ctx->failed == 0) {
        int length = std::snprintf(ctx->message, sizeof ctx->message, "%s() returned %d",
                                   function != nullptr ? function : "the native function", rc);
        cut_to_fit(ctx->message, length < 0 ? 0 : static_cast<size_t>(length), sizeof ctx->message);
    }
    uint32_t src = ctx->codes_set != 0 ? ctx->src : static_cast<uint32_t>(rc);
    uint32_t crc = ctx->codes_set != 0 ? ctx->crc : 0;
    raise(env, ctx->message, src, crc);
    return env->ExceptionCheck() ? 1 : 0;
}

size_t to_utf16(std::string_view text, jchar *out, size_t room) {
    size_t units = 0;
    for (size_t at = 0; at < text.size();) {
        char32_t character = 0;
        size_t length = decode_utf8(text.substr(at), &character);
        if (length == 0) {
            character = static_cast<unsigned char>(text[at]);
            length = 1;
        }
        size_t needed = character > 0xFFFF ? 2 : 1;
        if (units + needed > room) {
            break;
        }
        if (needed == 2) {
            character -= 0x10000;
            out[units++] = static_cast<jchar>(0xD800 + (character >> 10));
            out[units++] = static_cast<jchar>(0xDC00 + (character & 0x3FF));
        } else {
            out[units++] = static_cast<jchar>(character);
        }
        at += length;
    }
    return units;
}

size_t cut_to_fit(char *text, size_t length, size_t size) {
    if (size == 0) {
        return 0;
    }
    if (length < size) {
        return length;
    }
    size_t kept = size - 1;
    // Back to the first byte of the last sequence that the cut reaches; drop it if it is cut.
    size_t start = kept;
    while (start > 0 && kept - start < 4 &&
           (static_cast<unsigned char>(text[start - 1]) & 0xC0) == 0x80) {
        --start;
    }
    if (start > 0) {
        char32_t character = 0;
        std::string_view last(text + start - 1, kept - start + 1);
        if (static_cast<unsigned char>(text[start - 1]) >= 0xC0 &&
            decode_utf8(last, &character) != last.size()) {
            kept = start - 1;
        }
    }
    text[kept] = '\0';
    return kept;
}

} // namespace telv::java_bridge

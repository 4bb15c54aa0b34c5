// The Java bridge of libtelvplatform.so in a real JVM, created inside this test program: the
// arguments of a call read from its context, the exception a failed call raises, and the ways a
// call can go wrong (no environment, an exception pending, an argument missing or of another
// kind), which must answer with a code and a message and never bring the JVM down.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <jni.h>
#include <set>
#include <sstream>
#include <string>
#include <thread>

#include "java_bridge.h"
#include "java_vm.h"
#include "jcb_jni.h"

namespace {

std::string env_of(const char *name) {
    const char *value = std::getenv(name);
    return value != nullptr ? value : "";
}

// The JVM of this process, with the jar of the bridge's exception class.
JNIEnv *java() {
    return java_vm::env({"-Djava.class.path=" TARN_JAVA_CLASS_PATH});
}

// The result of a getter without arguments of `object`, or null when it threw.
jobject call_getter(JNIEnv *env, jobject object, const char *name, const char *signature) {
    jmethodID method = env->GetMethodID(env->GetObjectClass(object), name, signature);
    jobject result = method != nullptr ? env->CallObjectMethod(object, method) : nullptr;
    if (env->ExceptionCheck()) {
        env->ExceptionClear();
        return nullptr;
    }
    return result;
}

// The message of a Java throwable as UTF-16 units, exactly as Java has it.
std::u16string units_of_message(JNIEnv *env, jthrowable thrown) {
    auto text =
        static_cast<jstring>(call_getter(env, thrown, "getMessage", "()Ljava/lang/String;"));
    if (text == nullptr) {
        return u"(none)";
    }
    std::u16string units(static_cast<size_t>(env->GetStringLength(text)), u'\0');
    env->GetStringRegion(text, 0, env->GetStringLength(text),
                         reinterpret_cast<jchar *>(units.data()));
    return units;
}

// The same as text, for messages that are ASCII.
std::string message_of(JNIEnv *env, jthrowable thrown) {
    std::u16string units = units_of_message(env, thrown);
    return std::string(units.begin(), units.end());
}

jint int_of(JNIEnv *env, jobject object, const char *getter) {
    jmethodID method = env->GetMethodID(env->GetObjectClass(object), getter, "()I");
    jint value = method != nullptr ? env->CallIntMethod(object, method) : -99;
    if (env->ExceptionCheck()) {
        env->ExceptionClear();
        return -99;
    }
    return value;
}

// The exception pending in this thread, taken (cleared); null when there is none.
jthrowable take_exception(JNIEnv *env) {
    jthrowable thrown = env->ExceptionOccurred();
    env->ExceptionClear();
    return thrown;
}

// A Boolean or an Integer, as Java boxes them.
jobject boxed(JNIEnv *env, const char *class_name, const char *signature, jvalue value) {
    jclass box = env->FindClass(class_name);
    jmethodID value_of = env->GetStaticMethodID(box, "valueOf", signature);
    jobject object = env->CallStaticObjectMethodA(box, value_of, &value);
    if (env->ExceptionCheck()) {
        env->ExceptionClear();
        return nullptr;
    }
    return object;
}

jobject boxed_boolean(JNIEnv *env, bool flag) {
    jvalue value = {};
    value.z = flag ? JNI_TRUE : JNI_FALSE;
    return boxed(env, "java/lang/Boolean", "(Z)Ljava/lang/Boolean;", value);
}

jobject boxed_integer(JNIEnv *env, int number) {
    jvalue value = {};
    value.i = number;
    return boxed(env, "java/lang/Integer", "(I)Ljava/lang/Integer;", value);
}

jcb_argument argument(char type, jvalue value) {
    return {type, value};
}

jcb_argument boolean_argument(bool flag) {
    jvalue value = {};
    value.z = flag ? JNI_TRUE : JNI_FALSE;
    return argument('Z', value);
}

jcb_argument object_argument(jobject object) {
    jvalue value = {};
    value.l = object;
    return argument('L', value);
}

std::string last_error() {
    return jcbGetLastErrorMessage();
}

class JavaBridge : public ::testing::Test {
  protected:
    // Each test's local references live in a frame of its own, as those of a native call do.
    void SetUp() override {
        env = java();
        ASSERT_NE(env, nullptr) << "no JVM could be created";
        ASSERT_FALSE(env->ExceptionCheck());
        ASSERT_EQ(env->PushLocalFrame(64), 0);
        java_vm::output().clear();
    }
    void TearDown() override {
        if (env == nullptr) {
            return;
        }
        env->ExceptionClear();
        env->PopLocalFrame(nullptr);
        EXPECT_EQ(java_vm::output().find("WARNING"), std::string::npos) << java_vm::output();
    }

    // The exception pending after a call, taken: the bridge's, with this message and these codes.
    void expect_raised(const std::string &message, jint src, jint crc) {
        jthrowable thrown = take_exception(env);
        ASSERT_NE(thrown, nullptr);
        EXPECT_TRUE(env->IsInstanceOf(thrown, env->FindClass(JCB_EXCEPTION_CLASS)));
        EXPECT_EQ(message_of(env, thrown), message);
        EXPECT_EQ(int_of(env, thrown, "getSrc"), src);
        EXPECT_EQ(int_of(env, thrown, "getCrc"), crc);
    }

    JNIEnv *env = nullptr;
    jcb_context ctx;
};

// ---- Arguments ----

TEST_F(JavaBridge, BooleansArePassedInOrderAsPrimitivesOrBoxed) {
    jcb_argument arguments[] = {boolean_argument(true), object_argument(boxed_boolean(env, false)),
                                object_argument(boxed_boolean(env, true)), boolean_argument(false)};
    jcbBeginCall(&ctx, env, arguments, 4);
    int values[4] = {7, 7, 7, 7};
    for (int &value : values) {
        EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_OK) << last_error();
    }
    EXPECT_EQ(values[0], 1);
    EXPECT_EQ(values[1], 0);
    EXPECT_EQ(values[2], 1);
    EXPECT_EQ(values[3], 0);

    int value = 7;
    EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_NO_ARGUMENT);
    EXPECT_EQ(last_error(), "the call has no argument 5: it was given 4");
    EXPECT_EQ(value, 7);
    EXPECT_EQ(jcbEndCall(&ctx, "fetch", 0), 0);
    EXPECT_FALSE(env->ExceptionCheck());
}

TEST_F(JavaBridge, ACallWithoutArgumentsHasNoBoolean) {
    jcbBeginCall(&ctx, env, nullptr, 3); // no arguments, whatever the count says
    int value = 7;
    EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_NO_ARGUMENT);
    EXPECT_EQ(last_error(), "the call has no argument 1: it was given 0");
    EXPECT_EQ(value, 7);
    EXPECT_FALSE(env->ExceptionCheck());
}

TEST_F(JavaBridge, OtherKindsAreRefusedAndNotTaken) {
    jvalue number = {};
    number.i = 1;
    jcb_argument arguments[] = {argument('I', number), boolean_argument(true)};
    jcbBeginCall(&ctx, env, arguments, 2);
    int value = 7;
    for (int attempt = 0; attempt < 2; ++attempt) {
        EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_NOT_BOOLEAN);
        EXPECT_EQ(last_error(), "argument 1 is an int, not a boolean");
    }
    EXPECT_EQ(value, 7);

    struct {
        jobject object;
        const char *message;
    } const objects[] = {
        {boxed_integer(env, 42), "argument 1 is a java.lang.Integer, not a boolean"},
        {env->NewStringUTF("true"), "argument 1 is a java.lang.String, not a boolean"},
        {nullptr, "argument 1 is null, not a boolean"},
    };
    for (const auto &object : objects) {
        jcb_argument refused = object_argument(object.object);
        jcbBeginCall(&ctx, env, &refused, 1);
        EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_NOT_BOOLEAN);
        EXPECT_EQ(last_error(), object.message);
        EXPECT_FALSE(env->ExceptionCheck()) << object.message;
    }
    EXPECT_EQ(value, 7);
}

// ---- Failure paths ----

TEST_F(JavaBridge, NoContextOrNoEnvironmentIsAnErrorNotACrash) {
    int value = 7;
    EXPECT_EQ(jcbGetBooleanArgument(nullptr, &value), JCB_NO_ENVIRONMENT);
    EXPECT_EQ(last_error(), "no JNI environment: the call context is null");
    EXPECT_EQ(value, 7);

    jcbSetNativeFunctionError(nullptr, "lost %d", 1);
    EXPECT_EQ(last_error(),
              "no call context for the native-function error: the call context is null");
    jcbSetReturnCodes(nullptr, 8, 9);
    EXPECT_EQ(last_error(), "no call context for the return codes: the call context is null");
    jcbSetVoidResult(nullptr);
    EXPECT_EQ(last_error(), "no call context for the result: the call context is null");
    jcbBeginCall(nullptr, env, nullptr, 0);
    EXPECT_EQ(last_error(), "no call context to begin: the call context is null");
    EXPECT_EQ(jcbEndCall(nullptr, "tarn_x", 22), 0);
    EXPECT_EQ(last_error(), "no JNI environment: the call context is null");

    jcb_argument flag = boolean_argument(true);
    jcbBeginCall(&ctx, nullptr, &flag, 1);
    EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_NO_ENVIRONMENT);
    EXPECT_EQ(last_error(), "no JNI environment: the call context holds none");
    EXPECT_EQ(value, 7);
    // The error is kept in the context, but nothing can be raised without an environment.
    jcbSetNativeFunctionError(&ctx, "tarn_x() failed");
    EXPECT_EQ(jcbEndCall(&ctx, "tarn_x", 22), 0);
    EXPECT_EQ(last_error(), "no JNI environment: the call context holds none");
    EXPECT_FALSE(env->ExceptionCheck());
}

TEST_F(JavaBridge, NoPlaceForTheValueIsAnError) {
    jcb_argument flag = boolean_argument(true);
    jcbBeginCall(&ctx, env, &flag, 1);
    EXPECT_EQ(jcbGetBooleanArgument(&ctx, nullptr), JCB_NO_OUTPUT);
    EXPECT_EQ(last_error(), "no place for the value: its pointer is null");
    int value = 7;
    EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_OK) << "the argument is still there";
    EXPECT_EQ(value, 1);
}

TEST_F(JavaBridge, PendingExceptionIsAnsweredAndBecomesTheCause) {
    ASSERT_EQ(env->ThrowNew(env->FindClass("java/lang/IllegalStateException"), "earlier"), 0);
    jcb_argument flag = boolean_argument(true);
    jcbBeginCall(&ctx, env, &flag, 1);
    int value = 7;
    EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_EXCEPTION_PENDING);
    EXPECT_EQ(last_error(), "a Java exception is pending in the calling thread");
    EXPECT_EQ(value, 7);
    ASSERT_TRUE(env->ExceptionCheck()) << "the pending exception is left alone";

    jcbSetNativeFunctionError(&ctx, "fetch failed: rc=%d", JCB_EXCEPTION_PENDING);
    EXPECT_EQ(jcbEndCall(&ctx, "java_set_logging_type", 22), 1);
    jthrowable thrown = take_exception(env);
    ASSERT_NE(thrown, nullptr);
    ASSERT_TRUE(env->IsInstanceOf(thrown, env->FindClass(JCB_EXCEPTION_CLASS)));
    EXPECT_EQ(message_of(env, thrown), "fetch failed: rc=3");
    auto cause =
        static_cast<jthrowable>(call_getter(env, thrown, "getCause", "()Ljava/lang/Throwable;"));
    ASSERT_NE(cause, nullptr);
    EXPECT_TRUE(env->IsInstanceOf(cause, env->FindClass("java/lang/IllegalStateException")));
    EXPECT_EQ(message_of(env, cause), "earlier");
}

TEST_F(JavaBridge, LastErrorMessageBelongsToItsThread) {
    EXPECT_EQ(jcbGetBooleanArgument(nullptr, nullptr), JCB_NO_ENVIRONMENT);
    std::string here = last_error();
    std::string there_before;
    std::string there_after;
    std::thread other([&] {
        there_before = last_error();
        jcbSetVoidResult(nullptr);
        there_after = last_error();
    });
    other.join();
    EXPECT_EQ(there_before, "");
    EXPECT_EQ(there_after, "no call context for the result: the call context is null");
    EXPECT_EQ(last_error(), here);
    // A fetch that works leaves the last failure as it was.
    jcb_argument flag = boolean_argument(false);
    jcbBeginCall(&ctx, env, &flag, 1);
    int value = 7;
    EXPECT_EQ(jcbGetBooleanArgument(&ctx, &value), JCB_OK);
    EXPECT_EQ(last_error(), here);
}

// ---- The outcome of a call ----

TEST_F(JavaBridge, NativeFunctionErrorRaisesTheBridgeExceptionWithItsCodes) {
    jcbBeginCall(&ctx, env, nullptr, 0);
    jcbSetNativeFunctionError(&ctx, "tarn_x() failed with system rc=%d and component rc=%d", 8, -1);
    jcbSetReturnCodes(&ctx, 8, 0xFFFFFFFFu);
    EXPECT_EQ(jcbEndCall(&ctx, "tarn_x", 22), 1);
    // 0xFFFFFFFF, unsigned, reaches Java as the int -1.
    expect_raised("tarn_x() failed with system rc=8 and component rc=-1", 8, -1);
}

TEST_F(JavaBridge, ErrorWithoutReturnCodesCarriesTheResult) {
    jcbBeginCall(&ctx, env, nullptr, 0);
    jcbSetNativeFunctionError(&ctx, "no flag");
    EXPECT_EQ(jcbEndCall(&ctx, "java_set_logging_type", 22), 1);
    expect_raised("no flag", 22, 0);
}

TEST_F(JavaBridge, NonZeroResultWithoutAnErrorStillFails) {
    jcbBeginCall(&ctx, env, nullptr, 0);
    EXPECT_EQ(jcbEndCall(&ctx, "tarn_y", 5), 1);
    expect_raised("tarn_y() returned 5", 5, 0);
}

TEST_F(JavaBridge, VoidResultRaisesNothing) {
    jcbBeginCall(&ctx, env, nullptr, 0);
    jcbSetVoidResult(&ctx);
    EXPECT_EQ(jcbEndCall(&ctx, "tarn_z", 0), 0);
    EXPECT_FALSE(env->ExceptionCheck());
}

TEST_F(JavaBridge, LongMessageIsCutAtACharacterAndStrayBytesReachJavaAsLatin1) {
    // 600 two-byte characters: the cut at 1,023 bytes falls inside the 512th, which is dropped.
    std::string long_text;
    for (int i = 0; i < 600; ++i) {
        long_text += "\xC3\xA9";
    }
    jcbBeginCall(&ctx, env, nullptr, 0);
    jcbSetNativeFunctionError(&ctx, "%s", long_text.c_str());
    EXPECT_EQ(std::strlen(ctx.message), 1022u);
    EXPECT_EQ(jcbEndCall(&ctx, "tarn_x", 22), 1);
    jthrowable thrown = take_exception(env);
    ASSERT_NE(thrown, nullptr);
    EXPECT_EQ(units_of_message(env, thrown), std::u16string(511, u'\u00E9'));

    jcbBeginCall(&ctx, env, nullptr, 0);
    jcbSetNativeFunctionError(&ctx, "a\xFF"
                                    "b\xF0\x9F\x98\x80"
                                    "c\xE2\x82");
    EXPECT_EQ(jcbEndCall(&ctx, "tarn_x", 22), 1);
    thrown = take_exception(env);
    ASSERT_NE(thrown, nullptr);
    EXPECT_EQ(units_of_message(env, thrown), u"a\u00FFb\U0001F600c\u00E2\u0082");
}

// ---- The text helpers of the bridge ----

TEST(JavaBridgeText, Utf16KeepsWellFormedCharactersAndTakesOtherBytesAsLatin1) {
    using telv::java_bridge::to_utf16;
    jchar out[16];
    auto units = [&](std::string_view text, size_t room) {
        return std::u16string(reinterpret_cast<char16_t *>(out), to_utf16(text, out, room));
    };
    EXPECT_EQ(units("plain", 16), u"plain");
    EXPECT_EQ(units("\xE2\x82\xAC", 16), u"\u20AC");
    EXPECT_EQ(units("\xC0\xAF", 16), u"\u00C0\u00AF") << "an overlong form";
    EXPECT_EQ(units("\xED\xA0\x80", 16), u"\u00ED\u00A0\u0080") << "a surrogate";
    EXPECT_EQ(units("\xF4\x90\x80\x80", 16), u"\u00F4\u0090\u0080\u0080") << "beyond U+10FFFF";
    EXPECT_EQ(units("x\xF0\x9F\x98\x80", 2), u"x") << "a pair is never split by the room";
}

TEST(JavaBridgeText, CutKeepsWholeCharactersOnly) {
    using telv::java_bridge::cut_to_fit;
    char text[] = "ab\xC3\xA9";
    EXPECT_EQ(cut_to_fit(text, 4, 5), 4u) << "it fits";
    EXPECT_EQ(cut_to_fit(text, 4, 4), 2u) << "the cut would split the last character";
    EXPECT_STREQ(text, "ab");
    char three[] = "a\xE2\x82\xAC"
                   "b";
    EXPECT_EQ(cut_to_fit(three, 5, 5), 4u) << "the character before the cut is whole";
    EXPECT_STREQ(three, "a\xE2\x82\xAC");
}

// ---- What the shared libraries show the dynamic linker ----

std::set<std::string> defined_symbols(const std::string &library) {
    std::set<std::string> names;
    FILE *pipe = popen(("nm -D --defined-only " + library).c_str(), "r");
    if (pipe == nullptr) {
        return names;
    }
    char line[1024];
    while (std::fgets(line, sizeof line, pipe) != nullptr) {
        std::istringstream fields(line);
        std::string word;
        std::string last;
        while (fields >> word) {
            last = word;
        }
        names.insert(last.substr(0, last.find('@')));
    }
    pclose(pipe);
    return names;
}

TEST(JavaBridgeExports, ThePlatformExportsTheBridge) {
    std::set<std::string> defined =
        defined_symbols(env_of("TARN_BUILD_DIR") + "/libtelvplatform.so");
    for (const char *service :
         {"jcbGetBooleanArgument", "jcbGetLastErrorMessage", "jcbSetNativeFunctionError",
          "jcbSetReturnCodes", "jcbSetVoidResult", "jcbBeginCall", "jcbEndCall"}) {
        EXPECT_TRUE(defined.contains(service)) << service;
    }
}

TEST(JavaBridgeExports, TheNativeLibraryOfTheJavaClassExportsOnlyItsLoadHook) {
    std::set<std::string> defined = defined_symbols(env_of("TARN_BUILD_DIR") + "/libtelvzjava.so");
#ifdef TARN_SANITIZED
    std::erase_if(defined, [](const std::string &name) {
        return name.starts_with("_ZTI") || name.starts_with("_ZTS") || name.starts_with("__");
    });
#endif
    EXPECT_EQ(defined, std::set<std::string>{"JNI_OnLoad"});
}

} // namespace

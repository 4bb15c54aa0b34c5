#include "java_vm.h"

#include <algorithm>
#include <cstdarg>
#include <cstdio>

#ifdef TARN_SANITIZED
// The JVM handles SIGSEGV itself: its null checks and safepoints are faults by design.
extern "C" const char *__asan_default_options() {
    return "handle_segv=0:allow_user_segv_handler=1";
}
// What the JVM keeps until it is destroyed, which it never is here, is no leak of the code tested;
// nor are the expressions that a monitor compiles from its control file, which it keeps until its
// process ends (the library's own tests count its allocations).
extern "C" const char *__lsan_default_suppressions() {
    return "leak:libjvm.so\nleak:libjava.so\nleak:libzip.so\nleak:libz.so\nleak:regcomp\n"
           "leak:re_compile_internal\n";
}
// The JVM synchronizes its threads in ways the thread sanitizer does not see: only what the
// instrumented code does is judged.
extern "C" const char *__tsan_default_options() {
    return "ignore_noninstrumented_modules=1";
}
#endif

namespace java_vm {
namespace {

jint JNICALL keep_output(FILE *, const char *format, va_list arguments) {
    char text[4096];
    int length = std::vsnprintf(text, sizeof text, format, arguments);
    output().append(text, length < 0 ? 0 : std::min(static_cast<size_t>(length), sizeof text - 1));
    return length;
}

} // namespace

std::string &output() {
    static std::string printed;
    return printed;
}

JNIEnv *env(const std::vector<std::string> &options) {
    static JNIEnv *made = [&] {
        // -Xrs: the test program keeps its signals to itself.
        std::vector<std::string> words = {"-Xcheck:jni", "-Xrs"};
        words.insert(words.end(), options.begin(), options.end());
        std::vector<JavaVMOption> given;
        for (std::string &word : words) {
            given.push_back({word.data(), nullptr});
        }
        given.push_back({const_cast<char *>("vfprintf"), reinterpret_cast<void *>(keep_output)});
        JavaVMInitArgs arguments = {};
        arguments.version = JNI_VERSION_1_8;
        arguments.nOptions = static_cast<jint>(given.size());
        arguments.options = given.data();
        JavaVM *vm = nullptr;
        JNIEnv *env = nullptr;
        if (JNI_CreateJavaVM(&vm, reinterpret_cast<void **>(&env), &arguments) != JNI_OK) {
            return static_cast<JNIEnv *>(nullptr);
        }
        return env;
    }();
    return made;
}

} // namespace java_vm

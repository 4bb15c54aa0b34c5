// A JVM inside the test program, made at first use on the calling thread: the given class path and
// system properties, every JNI call of native code checked (-Xcheck:jni), and what the JVM prints
// kept, so that a test can see whether those checks found anything. A process has one JVM.
#pragma once

#include <jni.h>
#include <string>
#include <vector>

namespace java_vm {

// The JVM's environment for the calling thread, the thread that made it; null when no JVM could
// be made. `options` (as "-Dname=value") count only at the first call.
JNIEnv *env(const std::vector<std::string> &options);

// What the JVM has printed (its warnings and errors, not what Java code writes to System.out).
std::string &output();

} // namespace java_vm

// HostMonitor in a real JVM, as an application runs it: telvzmnd.jar, and libtelvzjava.so loaded
// by the class over the built libtelvzmnd.so and libtelvplatform.so, in a JVM that this program
// makes (so that the sanitizers of a sanitized build see the native code on the JVM's threads too).
// Each scenario has a data directory of its own with the example control file, quiet fake commands
// first on PATH, and the control block in a private IPC namespace. The scenarios and their checks
// are the Java program's (tests/java/telv/monitor/HostMonitorTest.java); this program sets the
// stage, runs a scenario and shows what failed.
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "example_control_file.h"
#include "fake_commands.h"
#include "java_vm.h"
#include "private_ipc.h"
#include "quiet_host.h"

namespace {

std::string env_of(const char *name) {
    const char *value = std::getenv(name);
    return value != nullptr ? value : "";
}

// A host with nothing to report: its numbers are far below every threshold of the example.
const std::string PS = "    1     1  1000  20000  3000 init            00:00:01\n"
                       " 4242  4242  2000  30000  4000 quietd          00:00:02\n";

class JavaHost : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        private_ipc::remove_control_block_objects();
        private_ipc::use_up_id_zero();
        char pattern[] = "/tmp/java-host-data-XXXXXX";
        data_dir = mkdtemp(pattern);
        setenv("TELV_DATA_DIR", data_dir.c_str(), 1);
        for (const char *name : {"TELV_EVENT_LOG", "TELV_TRACE_FILE", "TELV_MODULE_PATH"}) {
            unsetenv(name);
        }
        setenv("TELV_TRACE_DETAIL", "0", 1);
        setenv("TELV_TRACE_MAX_BYTES", "1073741824", 1);
        std::ofstream(data_dir + "/telvzopt.trm") << example::text();

        quiet_host::add_commands(fakes, PS);
        fakes.add("runAsRoot", "#!/bin/sh\nexit 0\n");
    }

    void TearDown() override {
        if (!key_is_ours) {
            return;
        }
        private_ipc::remove_control_block_objects();
        std::filesystem::remove_all(data_dir);
    }

    // Runs the Java program's scenario: its failures, "" when it passed.
    std::string scenario(const std::string &name) {
        JNIEnv *env =
            java_vm::env({"-Djava.class.path=" TARN_JAVA_CLASS_PATH,
                          "-Dtelv.monitor.library=" TARN_JAVA_NATIVE_LIBRARY,
                          "-Dtelv.test.tarnmon=" + env_of("TARN_BUILD_DIR") + "/tarnmon"});
        if (env == nullptr) {
            return "no JVM could be made";
        }
        env->PushLocalFrame(16);
        std::string failed = "the test program could not be run";
        jclass program = env->FindClass("telv/monitor/HostMonitorTest");
        jmethodID run =
            program != nullptr
                ? env->GetStaticMethodID(program, "run",
                                         "(Ljava/lang/String;Ljava/lang/String;)Ljava/lang/String;")
                : nullptr;
        jstring scenario_name = env->NewStringUTF(name.c_str());
        jstring data = env->NewStringUTF(data_dir.c_str());
        jstring result = nullptr;
        if (run != nullptr && scenario_name != nullptr && data != nullptr) {
            result = static_cast<jstring>(
                env->CallStaticObjectMethod(program, run, scenario_name, data));
        }
        if (env->ExceptionCheck()) {
            env->ExceptionDescribe();
        } else if (result != nullptr) {
            const char *chars = env->GetStringUTFChars(result, nullptr);
            failed = chars != nullptr ? chars : failed;
            env->ReleaseStringUTFChars(result, chars);
        }
        env->PopLocalFrame(nullptr);
        return failed;
    }

    // The scenario passed, and the JVM found no misuse of JNI on the way.
    void passes(const std::string &name) {
        java_vm::output().clear();
        EXPECT_EQ(scenario(name), "");
        EXPECT_EQ(java_vm::output().find("WARNING"), std::string::npos) << java_vm::output();
    }

    bool key_is_ours = false;
    std::string data_dir;
    fake::fake_commands fakes;
};

TEST_F(JavaHost, SwitchesWithoutAMonitorChangeNothingAndRefuseWhatTheyCannotTake) {
    passes("refusals");
}

TEST_F(JavaHost, ForcedSleepAlertEndsTheSleepAndItsEventFollowsTheEventClass) {
    passes("switches");
}

TEST_F(JavaHost, StopDuringTheSleepEndsTheMonitorAfterOneMorePass) {
    passes("stop");
}

TEST_F(JavaHost, OnePassOnlyEndsByItself) {
    passes("once");
}

} // namespace

// The native methods of telv.monitor.HostMonitor: each turns its Java arguments into the call of
// one entry point of the monitor, and a failed call into the bridge's exception. They are
// registered by JNI_OnLoad from one table, so JNI_OnLoad is all that leaves this library.
#include <jni.h>

#include <cstdint>
#include <cstdio>

#include "core/alert_switches.h"
#include "core/control_block.h"
#include "core/monitor_loop.h"
#include "jcb_jni.h"
#include "memory/override_table.h"

namespace {

constexpr char HOST_MONITOR_CLASS[] = "telv/monitor/HostMonitor";

// One call of an entry point through the bridge: `entry` is given the call's context and returns
// the entry point's result; what it left in the context becomes the Java outcome.
template <typename Entry>
void through_bridge(JNIEnv *env, const char *function, const jcb_argument *arguments, int count,
                    Entry entry) {
    jcb_context ctx;
    jcbBeginCall(&ctx, env, arguments, count);
    jcbEndCall(&ctx, function, entry(&ctx));
}

// The outcome of an entry point that returns src and sets crc: a src other than 0 fails the call
// with both codes.
int outcome(jcb_context *ctx, const char *function, uint32_t src, uint32_t crc) {
    if (src != 0) {
        jcbSetNativeFunctionError(ctx, "%s() failed with system rc=%u and component rc=%u",
                                  function, src, crc);
        jcbSetReturnCodes(ctx, src, crc);
    } else {
        jcbSetVoidResult(ctx);
    }
    return static_cast<int>(src);
}

// The alert switches: uint32_t switch(uint32_t *crc).
void alert_switch(JNIEnv *env, const char *function, uint32_t (*entry)(uint32_t *)) {
    through_bridge(env, function, nullptr, 0, [&](jcb_context *ctx) {
        uint32_t crc = 0;
        uint32_t src = entry(&crc);
        return outcome(ctx, function, src, crc);
    });
}

jint JNICALL monitor_main(JNIEnv *, jclass, jint checking_interval, jboolean one_pass_only) {
    // argv as a host gives it: the interval, and a third word for one pass only.
    char program[] = "telvzjava";
    char interval[16];
    std::snprintf(interval, sizeof interval, "%d", static_cast<int>(checking_interval));
    char once[] = "once";
    char *argv[] = {program, interval, once, nullptr};
    keep_block_off_id_zero();
    return static_cast<jint>(tarn_mon_main(one_pass_only != JNI_FALSE ? 3 : 2, argv));
}

void JNICALL stop(JNIEnv *, jclass) {
    tarn_terminate_monitoring();
}

void JNICALL set_informational_events(JNIEnv *env, jclass, jboolean informational) {
    jcb_argument flag = {'Z', {}};
    flag.value.z = informational;
    through_bridge(env, "java_set_logging_type", &flag, 1,
                   [](jcb_context *ctx) { return static_cast<int>(java_set_logging_type(ctx)); });
}

void JNICALL set_logging_type_of(JNIEnv *env, jclass, jobjectArray arguments) {
    constexpr jsize MOST = 8;
    jsize count = arguments != nullptr ? env->GetArrayLength(arguments) : 0;
    if (count > MOST) {
        jclass refused = env->FindClass("java/lang/IllegalArgumentException");
        if (refused != nullptr) {
            env->ThrowNew(refused, "at most 8 arguments");
        }
        return;
    }
    jcb_argument taken[MOST];
    for (jsize i = 0; i < count; ++i) {
        taken[i].type = 'L';
        taken[i].value.l = env->GetObjectArrayElement(arguments, i);
    }
    through_bridge(env, "java_set_logging_type", taken, static_cast<int>(count),
                   [](jcb_context *ctx) { return static_cast<int>(java_set_logging_type(ctx)); });
}

void JNICALL enable_cpu_alerts(JNIEnv *env, jclass) {
    alert_switch(env, "tarn_enable_cpu_alerts", tarn_enable_cpu_alerts);
}

void JNICALL disable_cpu_alerts(JNIEnv *env, jclass) {
    alert_switch(env, "tarn_disable_cpu_alerts", tarn_disable_cpu_alerts);
}

void JNICALL trigger_cpu_alert(JNIEnv *env, jclass) {
    alert_switch(env, "tarn_trigger_cpu_alert04", tarn_trigger_cpu_alert04);
}

void JNICALL override_thresholds(JNIEnv *env, jclass, jint rss, jint dsiz, jint vsize,
                                 jint rss_abort, jint dsiz_abort, jint vsize_abort) {
    through_bridge(env, "tarn_override_thresholds", nullptr, 0, [&](jcb_context *ctx) {
        uint32_t crc = 0;
        uint32_t src =
            tarn_override_thresholds(rss, dsiz, vsize, rss_abort, dsiz_abort, vsize_abort, &crc);
        return outcome(ctx, "tarn_override_thresholds", src, crc);
    });
}

// JNINativeMethod's strings are not const in jni.h, though the JVM only reads them.
JNINativeMethod native(const char *name, const char *signature, void *function) {
    return {const_cast<char *>(name), const_cast<char *>(signature), function};
}

template <typename Function>
void *address_of(Function *function) {
    return reinterpret_cast<void *>(function);
}

} // namespace

extern "C" JNIEXPORT jint JNICALL JNI_OnLoad(JavaVM *vm, void *) {
    const JNINativeMethod methods[] = {
        native("monitorMain", "(IZ)I", address_of(monitor_main)),
        native("stop", "()V", address_of(stop)),
        native("setInformationalEvents", "(Z)V", address_of(set_informational_events)),
        native("setLoggingTypeOf", "([Ljava/lang/Object;)V", address_of(set_logging_type_of)),
        native("enableCpuAlerts", "()V", address_of(enable_cpu_alerts)),
        native("disableCpuAlerts", "()V", address_of(disable_cpu_alerts)),
        native("triggerCpuAlert", "()V", address_of(trigger_cpu_alert)),
        native("overrideThresholds", "(IIIIII)V", address_of(override_thresholds)),
    };
    JNIEnv *env = nullptr;
    if (vm->GetEnv(reinterpret_cast<void **>(&env), JNI_VERSION_1_8) != JNI_OK) {
        return JNI_ERR;
    }
    jclass host_monitor = env->FindClass(HOST_MONITOR_CLASS);
    if (host_monitor == nullptr ||
        env->RegisterNatives(host_monitor, methods, sizeof methods / sizeof methods[0]) != 0) {
        return JNI_ERR;
    }
    return JNI_VERSION_1_8;
}

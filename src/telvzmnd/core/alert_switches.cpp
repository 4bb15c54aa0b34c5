#include "core/alert_switches.h"

#include <span>

#include "memsvc.h"
#include "tracesvc.h"

namespace {

void store_field(tarn_control_block &block, const field_store &store) {
    // Every field a switch sets is an aligned 32-bit word; a signed one takes the same bits.
    auto *field =
        reinterpret_cast<uint32_t *>(reinterpret_cast<unsigned char *>(&block) + store.offset);
    write_field(*field, store.value);
}

// A switch: the entry point its traces name, and its stores in the order they are made.
struct alert_switch {
    const char *name;
    std::span<const field_store> stores;
};

constexpr field_store ENABLE_STORES[] = {
    {offsetof(tarn_control_block, tookLog), 0},
    {offsetof(tarn_control_block, numLoopsBeforeCPUChecking), CPU_ALERTS_ON_COUNTDOWN},
};
constexpr field_store DISABLE_STORES[] = {
    {offsetof(tarn_control_block, numLoopsBeforeCPUChecking), CPU_ALERTS_OFF_COUNTDOWN},
};
// sleepTimeExceeded last: it ends the loop's sleep, and the performance check that sees it reads
// the other fields with it. A measure of 0 makes the alert that of a sleep without a positive
// overrun: 0xE153, value 0.
constexpr field_store TRIGGER_STORES[] = {
    {offsetof(tarn_control_block, sleep_time_percent), 0},
    {offsetof(tarn_control_block, maxSleepTime), 0},
    {offsetof(tarn_control_block, tookLog), 0},
    {offsetof(tarn_control_block, numLoopsBeforeCPUChecking), CPU_ALERTS_NOW_COUNTDOWN},
    {offsetof(tarn_control_block, sleepTimeExceeded), 1},
};

constexpr alert_switch ENABLE = {"tarn_enable_cpu_alerts", ENABLE_STORES};
constexpr alert_switch DISABLE = {"tarn_disable_cpu_alerts", DISABLE_STORES};
constexpr alert_switch TRIGGER = {"tarn_trigger_cpu_alert04", TRIGGER_STORES};

// The shape of the three switches: the pointer check of `crc`, the attach, the stores. Returns src.
uint32_t turn(const alert_switch &which, uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> %s", which.name);
    uint32_t src = memsvc_ckptr(crc, sizeof *crc);
    // A refused crc pointer is never read; the closing trace shows 0 for it.
    uint32_t shown_crc = 0;
    if (src == 0) {
        uint32_t localCrc = 0;
        src = tarn_init_tarn_cb_ptr(&localCrc);
        shown_crc = *crc;
    }
    tarn_control_block *block = TARN_CB_PTR;
    if (src == 0 && block != nullptr) {
        for (const field_store &store : which.stores) {
            switch_store(*block, store); // a release: whoever sees it sees those before it
        }
    }
    tracesvc_trace("TARNOTHF: <-- %s, src = %x, crc = %x (hex)", which.name, src, shown_crc);
    return src;
}

} // namespace

void (*switch_store)(tarn_control_block &block, const field_store &store) = store_field;

TARN_EXPORT uint32_t tarn_enable_cpu_alerts(uint32_t *crc) {
    return turn(ENABLE, crc);
}

TARN_EXPORT uint32_t tarn_disable_cpu_alerts(uint32_t *crc) {
    return turn(DISABLE, crc);
}

TARN_EXPORT uint32_t tarn_trigger_cpu_alert04(uint32_t *crc) {
    return turn(TRIGGER, crc);
}

TARN_EXPORT uint32_t tarn_set_logging_type(uint32_t value, uint32_t *crc) {
    tracesvc_trace("TARNSLTF: about to set logging flag to %x (hex)", value);
    uint32_t localCrc = 0;
    uint32_t src = tarn_init_tarn_cb_ptr(&localCrc);
    tarn_control_block *block = TARN_CB_PTR;
    if (src == 0 && block != nullptr) {
        write_field(block->logAsInfo, value);
        tracesvc_trace("TARNSLTF: TARN_CB_PTR->logAsInfo set to %x", value);
    }
    *crc = localCrc;
    tracesvc_trace("TARNSLTF: tarn_init_tarn_cb_ptr src=%x, crc=%x (hex)", src, *crc);
    return src;
}

TARN_EXPORT int32_t java_set_logging_type(jcb_context *ctx) {
    int flag = 0;
    int rc = jcbGetBooleanArgument(ctx, &flag);
    if (rc != 0) {
        jcbSetNativeFunctionError(ctx,
                                  "Unable to fetch the requested logging type parameter; "
                                  "jcbGetBooleanArgument() rc=%d, msg=\"%s\"",
                                  rc, jcbGetLastErrorMessage());
        return JAVA_CALL_FAILED;
    }
    uint32_t crc = 0;
    uint32_t src = tarn_set_logging_type(static_cast<uint32_t>(flag), &crc);
    if (src != 0) {
        jcbSetNativeFunctionError(
            ctx, "tarn_set_logging_type() failed with system rc=%d and component rc=%d",
            static_cast<int32_t>(src), static_cast<int32_t>(crc));
        tracesvc_trace("TARNSLTF: about to set Java caller's src=%d and crc=%d",
                       static_cast<int32_t>(src), static_cast<int32_t>(crc));
        jcbSetReturnCodes(ctx, src, crc);
        return JAVA_CALL_FAILED;
    }
    jcbSetVoidResult(ctx);
    return 0;
}

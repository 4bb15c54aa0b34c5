// tarnmon status: the nine fields of the control block, by name; with --json, the same as one JSON
// document.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>

#include "commands.h"
#include "control_block_view.h"
#include "json_writer.h"

namespace {

struct field {
    const char *name;
    size_t offset;
    bool is_signed;
    const char *meaning;
};

constexpr field FIELDS[] = {
    {"analysisIndex", offsetof(tarn_control_block, analysisIndex), true,
     "sample slot of the next trend analysis"},
    {"sleepTimeExceeded", offsetof(tarn_control_block, sleepTimeExceeded), false,
     "1 = the last sleep overran or an alert was forced"},
    {"numLoopsBeforeCPUChecking", offsetof(tarn_control_block, numLoopsBeforeCPUChecking), true,
     "passes before CPU and sleep checks are armed"},
    {"tookLog", offsetof(tarn_control_block, tookLog), false,
     "1 = an event was raised and no clean pass followed"},
    {"maxSleepTime", offsetof(tarn_control_block, maxSleepTime), true,
     "seconds the last sleep was allowed"},
    {"sleep_time_percent", offsetof(tarn_control_block, sleep_time_percent), true,
     "measured sleep in percent, -1 = on time"},
    {"uBufferLock", offsetof(tarn_control_block, uBufferLock), true,
     "id of the override table's semaphore set"},
    {"terminateRequest", offsetof(tarn_control_block, terminateRequest), false,
     "1 = the monitor ends after its current pass"},
    {"logAsInfo", offsetof(tarn_control_block, logAsInfo), false,
     "non-zero = events are raised as informational"},
};

uint32_t raw_field(const control_block_view &view, const field &f) {
    uint32_t raw;
    std::memcpy(&raw, reinterpret_cast<const unsigned char *>(view.block) + f.offset, sizeof raw);
    return raw;
}

void print_text(const control_block_view &view) {
    std::printf("control block 0x%08x: id %d, %u bytes, attached by %llu process(es)\n",
                TARN_CB_KEY, view.id, TARN_CB_SIZE,
                static_cast<unsigned long long>(view.attached_processes));
    for (const auto &f : FIELDS) {
        uint32_t raw = raw_field(view, f);
        if (f.is_signed) {
            std::printf("  %-26s %11d  %s\n", f.name, static_cast<int32_t>(raw), f.meaning);
        } else {
            std::printf("  %-26s %11u  %s\n", f.name, raw, f.meaning);
        }
    }
}

// {"key":…,"id":…,"bytes":…,"attached_processes":…,"fields":[{"name","value","meaning"}…]}, the
// fields in the order of the text.
void print_json(const control_block_view &view) {
    json_writer json;
    json.begin_object()
        .field("key", TARN_CB_KEY)
        .field("id", view.id)
        .field("bytes", TARN_CB_SIZE)
        .field("attached_processes", view.attached_processes)
        .key("fields")
        .begin_array();
    for (const auto &f : FIELDS) {
        uint32_t raw = raw_field(view, f);
        json.begin_object().field("name", f.name).key("value");
        if (f.is_signed) {
            json.value(static_cast<int32_t>(raw));
        } else {
            json.value(raw);
        }
        json.field("meaning", f.meaning).end_object();
    }
    json.end_array().end_object().print();
}

} // namespace

int command_status(const command_line &line) {
    control_block_view view = attach_control_block();
    if (view.block == nullptr) {
        std::fprintf(stderr, "tarnmon: %s\n", view.problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    if (line.json != nullptr) {
        print_json(view);
    } else {
        print_text(view);
    }
    detach_control_block(view);
    return EXIT_OK;
}

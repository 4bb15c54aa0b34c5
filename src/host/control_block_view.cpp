#include "control_block_view.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <sys/ipc.h>
#include <sys/shm.h>

control_block_view attach_control_block() {
    control_block_view view;
    char text[256];
    view.id = shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0);
    if (view.id == -1) {
        if (errno == ENOENT) {
            std::snprintf(text, sizeof text,
                          "no monitor has created its control block (key 0x%08x) on this host",
                          TARN_CB_KEY);
        } else {
            std::snprintf(text, sizeof text, "cannot reach the control block (key 0x%08x): %s",
                          TARN_CB_KEY, std::strerror(errno));
        }
        view.problem = text;
        return view;
    }
    shmid_ds info;
    if (shmctl(view.id, IPC_STAT, &info) != 0) {
        std::snprintf(text, sizeof text, "cannot read the control block's size: %s",
                      std::strerror(errno));
        view.problem = text;
        return view;
    }
    if (info.shm_segsz != TARN_CB_SIZE) {
        std::snprintf(text, sizeof text,
                      "the segment of key 0x%08x is not a control block: it has %zu bytes, not %u",
                      TARN_CB_KEY, static_cast<size_t>(info.shm_segsz), TARN_CB_SIZE);
        view.problem = text;
        return view;
    }
    void *address = shmat(view.id, nullptr, SHM_RDONLY);
    if (address == reinterpret_cast<void *>(-1)) {
        std::snprintf(text, sizeof text, "cannot attach the control block: %s",
                      std::strerror(errno));
        view.problem = text;
        return view;
    }
    view.block = static_cast<const tarn_control_block *>(address);
    view.attached_processes = info.shm_nattch;
    return view;
}

void detach_control_block(control_block_view &view) {
    if (view.block != nullptr) {
        shmdt(view.block);
        view.block = nullptr;
    }
}

std::array<uint32_t, 6> entry_limits(const override_entry &entry) {
    return {read_field(entry.rss_limit),        read_field(entry.dsiz_limit),
            read_field(entry.vsize_limit),      read_field(entry.rss_abort_limit),
            read_field(entry.dsiz_abort_limit), read_field(entry.vsize_abort_limit)};
}

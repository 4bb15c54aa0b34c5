// What a test of the loop resets before it runs the monitor in its own process again: the
// recording platform, the settings, the CPU accounting, the pass's data kept between passes and
// the snapshot file's staging, and a control block id other than 0 (the loop takes 0 as none).
// The snapshot clock stands still in UTC, so that every time stamp is known.
#pragma once

#include <cstdlib>
#include <cstring>
#include <ctime>

#include "capture/snapshot_file.h"
#include "core/settings.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "private_ipc.h"
#include "recording_platform.h"
#include "snapshot_stamp.h"
#include "storage/file_system.h"

namespace fresh_monitor {

inline void reset() {
    private_ipc::use_up_id_zero();
    rec::reset();
    reset_settings();
    reset_process_listing_state();
    extraFileSystemSRCOn = 0;
    clear_ps_data_block();
    setenv("TZ", "UTC", 1);
    tzset();
    snapshot_clock = snapshot_stamp::fixed_clock;
    std::memset(file_buffer, 0, FILE_BUFFER_SIZE);
}

} // namespace fresh_monitor

// A read-only view of the monitor's control block from the tarnmon process.
#pragma once

#include <array>
#include <cstdint>
#include <string>

#include "core/control_block.h"

struct control_block_view {
    const tarn_control_block *block = nullptr; // null when not attached
    int id = -1;
    uint64_t attached_processes = 0;
    std::string problem; // why there is no block, for a person to read
};

// Attaches the block read-only; view.block is null and view.problem says why on failure.
control_block_view attach_control_block();
void detach_control_block(control_block_view &view);

// The six limits of an override entry, in KB, in the order of the entry: rss, dsiz, vsize, then the
// abort limits of the same. Each word is read once, as one aligned word, since the processes that
// set limits write entries while a reader looks at them.
std::array<uint32_t, 6> entry_limits(const override_entry &entry);

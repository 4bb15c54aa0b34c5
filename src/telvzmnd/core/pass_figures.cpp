#include "core/pass_figures.h"

#include <cstddef>
#include <cstdio>
#include <cstring>
#include <mutex>

namespace {

tarn_pass_figures figures;
// Where the last partition was found: df lists the partitions in the same order in both its
// runs, so the inode run finds each one at the place after the one before.
uint32_t partition_cursor = 0;

struct observation {
    std::mutex lock;
    tarn_pass_observer observer = nullptr;
    void *context = nullptr;
};

observation &observed() {
    static observation the_observation;
    return the_observation;
}

tarn_partition_figures *find_partition(const char *mount_point) {
    for (uint32_t i = 0; i < figures.partition_count; ++i) {
        uint32_t at = (partition_cursor + i) % figures.partition_count;
        // A mount point longer than the field is kept, and found, under its cut name.
        if (std::strncmp(figures.partitions[at].mount_point, mount_point,
                         TARN_MOUNT_POINT_SIZE - 1) == 0) {
            partition_cursor = (at + 1) % figures.partition_count;
            return &figures.partitions[at];
        }
    }
    return nullptr;
}

tarn_partition_figures *add_partition(const char *mount_point) {
    if (figures.partition_count == TARN_PARTITIONS_KEPT) {
        ++figures.partition_lines_dropped;
        return nullptr;
    }
    tarn_partition_figures &added = figures.partitions[figures.partition_count++];
    std::snprintf(added.mount_point, sizeof added.mount_point, "%s", mount_point);
    added.space_tenths = TARN_FIGURE_NONE;
    added.inodes_tenths = TARN_FIGURE_NONE;
    return &added;
}

} // namespace

TARN_EXPORT void tarn_observe_passes(tarn_pass_observer observer, void *context) {
    observation &o = observed();
    std::lock_guard hold(o.lock);
    o.observer = observer;
    o.context = context;
}

void note_memory_percent(int32_t tenths) {
    figures.memory_known = 1;
    figures.memory_tenths = tenths;
}

void note_descriptor_share(int32_t tenths) {
    figures.descriptors_known = 1;
    figures.descriptors_tenths = tenths;
}

void note_partition_use(bool space, const char *mount_point, int32_t tenths) {
    tarn_partition_figures *partition = find_partition(mount_point);
    if (partition == nullptr) {
        partition = add_partition(mount_point);
    }
    if (partition != nullptr) {
        (space ? partition->space_tenths : partition->inodes_tenths) = tenths;
    }
}

void note_appliance_cpu(float user_percent, float kernel_percent) {
    figures.cpu_known = 1;
    figures.cpu_user_percent = user_percent;
    figures.cpu_kernel_percent = kernel_percent;
}

void start_pass_figures(uint64_t pass) {
    // Only the header and the partitions in use are ever read: the table is not cleared.
    std::memset(&figures, 0, offsetof(tarn_pass_figures, partitions));
    figures.pass = pass;
    partition_cursor = 0;
}

void publish_pass_figures(const pass_outcome &outcome) {
    figures.duration_ns = outcome.duration_ns;
    figures.reason_code = outcome.reason_code;
    figures.finding_held_back = outcome.finding_held_back ? 1 : 0;
    figures.sleep_known = outcome.sleep_known ? 1 : 0;
    figures.sleep_seconds = outcome.sleep_seconds;
    figures.sleep_interval = outcome.sleep_interval;
    // The first pass has no earlier sample: every share it computed is 0.
    if (figures.pass < 2) {
        figures.cpu_known = 0;
    }
    // Called under the lock, so that a host that ends the observation knows the call is over.
    observation &o = observed();
    std::lock_guard hold(o.lock);
    if (o.observer != nullptr) {
        o.observer(&figures, o.context);
    }
}

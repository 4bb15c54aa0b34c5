#include "storage/file_listing.h"

#include <cstring>

#include "command_runner.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "filesvc.h"
#include "tracesvc.h"

namespace {

// Both runs have always shared their failure texts with the system memory check.
constexpr const char *FAILURE_WORD = "free";

// What the script prints is only traced, under the words of the listing for both runs.
command_outcome run_traced(const char *const *argv) {
    return run_command(command_spec{nullptr, argv, FAILURE_WORD, FAILURE_WORD},
                       [](char *text, size_t) { tracesvc_trace("TARNMNDF: du data: [%s]", text); });
}

} // namespace

TARN_EXPORT uint32_t tarn_gather_file_list(const char *hddPartition, uint32_t *crc) {
    tracesvc_trace("TARNGFLF: --> tarn_gather_file_list");
    tracesvc_trace("TARNGFLF: hddPartition is [%s]", hddPartition);
    *crc = 0;
    uint32_t src = 0;
    const char *argv[] = {"runAsRoot", "rundu.sh", hddPartition, FILE_LISTING_NAME, nullptr};
    command_outcome outcome = run_traced(argv);
    if (outcome == command_outcome::ran) {
        tracesvc_trace("TARNGFLF: 'runAsRoot rundu.sh' call worked. Make sure file exists.");
        uint32_t size = 0;
        src = filesvc_query_file_size(FILE_LISTING_NAME, &size, crc);
        // The failure report has always been guarded by the outcome of the pipe, which is known
        // good here, not by the size query: it stays dormant, and a missing listing shows only in
        // the closing trace.
        if (outcome == command_outcome::pipe_failed) {
            tracesvc_trace("TARNGFLF: DFC query size failed = %d (dec)",
                           static_cast<int32_t>(*crc));
            src = tarn_mon_error_handler(src | 2, *crc, RC_FILE_LISTING_SIZE);
        }
    }
    tracesvc_trace("TARNGFLF: <-- tarn_gather_file_list, src = %x, crc = %x (hex)", src, *crc);
    return src;
}

TARN_EXPORT uint32_t tarn_cleanup_partition(const char *hddPartition, uint32_t *crc) {
    tracesvc_trace("TARNGFLF: --> tarn_cleanup_partition");
    tracesvc_trace("TARNGFLF: hddPartition is [%s]", hddPartition);
    *crc = 0;
    uint32_t src = 0;
    // At most 511 characters of the mount point, then "/" and the NULs of the cleared buffer.
    char modifiedHddPartition[MODIFIED_PARTITION_SIZE] = {};
    size_t kept = strnlen(hddPartition, MODIFIED_PARTITION_SIZE - 2);
    std::memcpy(modifiedHddPartition, hddPartition, kept);
    modifiedHddPartition[kept] = '/';
    tracesvc_trace("TARNGFLF: modifiedHddPartition is [%s]", modifiedHddPartition);
    const char *argv[] = {"runAsRoot", "cleanupPartition", modifiedHddPartition, nullptr};
    run_traced(argv);
    tracesvc_trace("TARNGFLF: <-- tarn_cleanup_partition, src = %x, crc = %x (hex)", src, *crc);
    return src;
}

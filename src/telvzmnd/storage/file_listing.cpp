#include "storage/file_listing.h"

#include <cstring>

#include "core/reason_codes.h"
#include "maintenance_run.h"
#include "tracesvc.h"

namespace {

// Both runs trace what the script prints under the words of the listing.
constexpr const char *DU_DATA = "TARNMNDF: du data: [%s]";

} // namespace

TARN_EXPORT uint32_t tarn_gather_file_list(const char *hddPartition, uint32_t *crc) {
    tracesvc_trace("TARNGFLF: --> tarn_gather_file_list");
    tracesvc_trace("TARNGFLF: hddPartition is [%s]", hddPartition);
    const char *argv[] = {"runAsRoot", "rundu.sh", hddPartition, FILE_LISTING_NAME, nullptr};
    uint32_t src = run_and_query(
        {argv, DU_DATA, "TARNGFLF: 'runAsRoot rundu.sh' call worked. Make sure file exists.",
         FILE_LISTING_NAME, "TARNGFLF: DFC query size failed = %d (dec)", RC_FILE_LISTING_SIZE},
        crc);
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
    run_traced(argv, DU_DATA);
    tracesvc_trace("TARNGFLF: <-- tarn_cleanup_partition, src = %x, crc = %x (hex)", src, *crc);
    return src;
}

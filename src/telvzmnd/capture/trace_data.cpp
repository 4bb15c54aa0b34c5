#include "capture/trace_data.h"

#include "core/reason_codes.h"
#include "maintenance_run.h"
#include "tracesvc.h"

TARN_EXPORT uint32_t tarn_gather_trace_data(uint32_t *crc) {
    tracesvc_trace("TARNGTDF: --> tarn_gather_trace_data");
    const char *argv[] = {"runAsRoot", "telvzstba", "all", TRACE_DATA_NAME, nullptr};
    // The tool's traces still call it by its old name, showTraceBuf.
    uint32_t src = run_and_query(
        {argv, "TARNMNDF: stba data: [%s]",
         "TARNGTDF: 'showTraceBuf all' call worked. Make sure file exists.", TRACE_DATA_NAME,
         "TARNGTDF: DFC query size failed = %d (dec)", RC_TRACE_DATA_SIZE},
        crc);
    tracesvc_trace("TARNGTDF: <-- tarn_gather_trace_data, src = %x, crc = %x (hex)", src, *crc);
    return src;
}

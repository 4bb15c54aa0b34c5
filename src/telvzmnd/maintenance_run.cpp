#include "maintenance_run.h"

#include "core/problem_reporting.h"
#include "filesvc.h"
#include "tracesvc.h"

namespace {

constexpr const char *FAILURE_WORD = "free";

} // namespace

command_outcome run_traced(const char *const *argv, const char *output_trace) {
    return run_command(command_spec{nullptr, argv, FAILURE_WORD, FAILURE_WORD},
                       [output_trace](char *text, size_t) { tracesvc_trace(output_trace, text); });
}

uint32_t run_and_query(const maintenance_run &run, uint32_t *crc) {
    *crc = 0;
    command_outcome outcome = run_traced(run.argv, run.output_trace);
    if (outcome == command_outcome::pipe_failed) {
        return 0;
    }
    tracesvc_trace("%s", run.worked_trace);
    uint32_t size = 0;
    uint32_t src = filesvc_query_file_size(run.file_name, &size, crc);
    if (outcome == command_outcome::pipe_failed) {
        tracesvc_trace(run.size_failed_trace, static_cast<int32_t>(*crc));
        src = tarn_mon_error_handler(src | 2, *crc, run.size_failed_reason);
    }
    return src;
}

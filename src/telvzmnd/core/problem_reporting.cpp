#include "core/problem_reporting.h"

#include <cstring>

#include "allocation.h"
#include "core/control_block.h"
#include "core/reason_codes.h"
#include "data_blocks.h"
#include "logsvc.h"
#include "tracesvc.h"

namespace {

enum class report_class { report, pass_through, system };

// A caller's own reason code goes out only while its src is still 0 or 2: once an earlier report
// of the same routine has made src 8, `src | 2` is 10 and the next report is a system one (0xE0F1).
report_class class_of(uint32_t sysRc) {
    switch (sysRc) {
    case 0:
    case 1:
    case 2:
    case 4:
        return report_class::report;
    case 8:
    case 12:
        return report_class::pass_through;
    default:
        return report_class::system;
    }
}

// Fills the attachment: `head` (the finding's error text, or nothing), then at most 39,000
// characters of `data`, then the closing line that says whether the data was cut.
void fill_attachment(char *attachment, const char *head, const char *data) {
    size_t used = 0;
    if (head != nullptr) {
        used = strnlen(head, TOP_DATA_BLOCK_SIZE);
        std::memcpy(attachment, head, used);
    }
    size_t length = std::strlen(data);
    size_t kept = length <= ATTACHMENT_DATA_LIMIT ? length : ATTACHMENT_DATA_LIMIT;
    std::memcpy(attachment + used, data, kept);
    used += kept;
    const char *closing = length <= ATTACHMENT_DATA_LIMIT ? "end of data \n\r"
                                                          : "No room to output more data... \n\r";
    std::strcpy(attachment + used, closing);
}

} // namespace

TARN_EXPORT uint32_t tarn_mon_error_handler_p(uint32_t sysRc, uint32_t compRc, const char *data,
                                              uint32_t uiErrorId) {
    tracesvc_trace("TARNMNDF: --> tarn_mon_error_handler_p");
    tracesvc_trace("TARNMNDF:     sysRc = %x   compRc = %x   uiErrorId = %x", sysRc, compRc,
                   uiErrorId);
    logsvc_record record;
    std::memset(&record, 0, sizeof record);
    uint32_t result = sysRc;
    uint32_t crc = 0;
    report_class kind = class_of(sysRc);

    if (kind != report_class::pass_through) {
        bool system = kind == report_class::system;
        record.record_type = LOGSVC_RECORD_TYPE_EVENT;
        record.option = LOGSVC_REPORT_ERROR;
        const tarn_control_block *block = TARN_CB_PTR;
        if (!system && block != nullptr) {
            if (read_field(block->logAsInfo) != 0) {
                record.option = LOGSVC_REPORT_INFORMATIONAL;
                tracesvc_trace("TARNSLTF: LOGSVC_REPORT_INFORMATIONAL option set.");
            } else {
                tracesvc_trace("TARNSLTF: LOGSVC_REPORT_ERROR option set.");
            }
        }
        std::strncpy(record.component, "LinMonitor", LOGSVC_COMPONENT_LENGTH);
        record.reason_code = static_cast<uint16_t>(system ? RC_SYSTEM_CLASS : uiErrorId);
        record.comp_rc = compRc;

        char *attachment = nullptr;
        if (data != nullptr) {
            attachment = static_cast<char *>(TARN_MALLOC(ATTACHMENT_SIZE));
            if (attachment != nullptr) {
                std::memset(attachment, 0, ATTACHMENT_SIZE);
                // A system report carries only the caller's text: the finding's error text
                // belongs to the pass, not to a failure of the monitor itself.
                fill_attachment(attachment, system ? nullptr : topLogDataBlock, data);
                record.attachment = attachment;
                record.attachment_length = static_cast<uint32_t>(std::strlen(attachment));
            }
            if (system) {
                record.option = LOGSVC_DATA_ATTACHED;
            } else {
                record.option += LOGSVC_DATA_ATTACHED;
            }
        }

        if (logsvc_microcode_log(&record, &crc) != 0) {
            tracesvc_trace("TARNMNDF:     logsvc_microcode_log failed; sysRc=%x, crc=%x", sysRc,
                           crc);
        }
        if (attachment != nullptr) {
            TARN_FREE(attachment);
        }
        result = REPORT_RESULT;
    }

    tracesvc_trace("TARNMNDF:     sysRc= %d, compRc = 0x%X", result, crc);
    tracesvc_trace("TARNMNDF: <-- tarn_mon_error_handler_p");
    return result;
}

TARN_EXPORT uint32_t tarn_mon_error_handler(uint32_t sysRc, uint32_t compRc, uint32_t uiErrorId) {
    return tarn_mon_error_handler_p(sysRc, compRc, nullptr, uiErrorId);
}

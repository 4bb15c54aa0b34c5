// The event log over the event-log file.
#include "logsvc.h"

#include "event_log.h"
#include "platform_export.h"

TELV_PLATFORM_EXPORT uint32_t logsvc_microcode_log(void *record, uint32_t *crc) {
    return telv::api::serve(telv::event_log::FAILED, crc,
                            [&] { return telv::event_log::log(record, crc); });
}

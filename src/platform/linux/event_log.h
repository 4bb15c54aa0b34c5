// The event log of the default platform: one JSON object a line in a file beside the data files.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "logsvc.h"

namespace telv::event_log {

inline constexpr const char *FILE_VARIABLE = "TELV_EVENT_LOG";
inline constexpr const char *DEFAULT_FILE_NAME = "telvzmnd.events";
// Result of a refused or unwritten event; the reason goes to *crc.
inline constexpr uint32_t FAILED = 8;

// Appends `text` to `out` as a JSON string, quotes included. Control characters are escaped;
// bytes that do not form UTF-8 are taken as Latin-1 and written as \u00XX, so that every line
// stays valid JSON whatever the attachment holds.
void append_json_string(std::string &out, std::string_view text);

// "informational" when the option word asks for it (0x200 without 0x100, the attachment bits
// 0xC000 aside), else "error".
const char *severity(uint32_t option);

// The JSON line of one event (line feed included): time, pid, component, reason, severity,
// option, compRc and the attachment text or null.
std::string format(const logsvc_record &record, std::string_view time, long pid);

// Checks and appends one event. 0, or FAILED with *crc = EINVAL (no record, not an event) or the
// errno of the write.
uint32_t log(const void *record, uint32_t *crc);

} // namespace telv::event_log

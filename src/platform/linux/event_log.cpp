#include "event_log.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include "environment.h"
#include "io.h"
#include "stamp.h"

namespace telv::event_log {
namespace {

// Well-formed UTF-8 sequences by their first byte: the range allowed for the second byte (which
// excludes overlong forms and surrogates) and the total length.
struct Sequence {
    unsigned char first_low, first_high, second_low, second_high;
    size_t length;
};
constexpr Sequence SEQUENCES[] = {
    {0xC2, 0xDF, 0x80, 0xBF, 2}, {0xE0, 0xE0, 0xA0, 0xBF, 3}, {0xE1, 0xEC, 0x80, 0xBF, 3},
    {0xED, 0xED, 0x80, 0x9F, 3}, {0xEE, 0xEF, 0x80, 0xBF, 3}, {0xF0, 0xF0, 0x90, 0xBF, 4},
    {0xF1, 0xF3, 0x80, 0xBF, 4}, {0xF4, 0xF4, 0x80, 0x8F, 4},
};

// Length of the well-formed UTF-8 sequence at the start of `text`, or 0.
size_t utf8_length(std::string_view text) {
    auto byte = [&](size_t i) { return static_cast<unsigned char>(text[i]); };
    for (const Sequence &seq : SEQUENCES) {
        if (byte(0) < seq.first_low || byte(0) > seq.first_high) {
            continue;
        }
        if (text.size() < seq.length || byte(1) < seq.second_low || byte(1) > seq.second_high) {
            return 0;
        }
        for (size_t i = 2; i < seq.length; ++i) {
            if (byte(i) < 0x80 || byte(i) > 0xBF) {
                return 0;
            }
        }
        return seq.length;
    }
    return 0;
}

void append_hex_field(std::string &out, const char *name, const char *format, uint32_t value) {
    char text[32];
    std::snprintf(text, sizeof text, format, value);
    out += ",\"";
    out += name;
    out += "\":\"";
    out += text;
    out += '"';
}

// 0, or the errno of the step that failed.
int append_line(const std::string &path, const std::string &line) {
    int fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (fd < 0) {
        return errno;
    }
    // Processes sharing the log write whole lines, never pieces of two.
    ::flock(fd, LOCK_EX);
    int error = io::write_all(fd, line.data(), line.size());
    if (::close(fd) != 0 && error == 0) {
        error = errno;
    }
    return error;
}

} // namespace

void append_json_string(std::string &out, std::string_view text) {
    static constexpr char HEX[] = "0123456789ABCDEF";
    out += '"';
    size_t i = 0;
    while (i < text.size()) {
        auto c = static_cast<unsigned char>(text[i]);
        size_t width = c >= 0x80 ? utf8_length(text.substr(i)) : 1;
        if (c == '"' || c == '\\') {
            out += '\\';
            out += static_cast<char>(c);
        } else if (c == '\n') {
            out += "\\n";
        } else if (c == '\r') {
            out += "\\r";
        } else if (c == '\t') {
            out += "\\t";
        } else if (c == '\b') {
            out += "\\b";
        } else if (c == '\f') {
            out += "\\f";
        } else if (c < 0x20 || width == 0) {
            out += "\\u00";
            out += HEX[c >> 4];
            out += HEX[c & 0xF];
            width = 1;
        } else {
            out.append(text.substr(i, width));
        }
        i += width;
    }
    out += '"';
}

const char *severity(uint32_t option) {
    // 0x100: the bit that makes 0x300 an error where 0x200 alone is informational.
    constexpr uint32_t ERROR_BIT = LOGSVC_REPORT_ERROR & ~LOGSVC_REPORT_INFORMATIONAL;
    uint32_t report = option & ~LOGSVC_DATA_ATTACHED;
    bool informational = (report & LOGSVC_REPORT_INFORMATIONAL) != 0 && (report & ERROR_BIT) == 0;
    return informational ? "informational" : "error";
}

std::string format(const logsvc_record &record, std::string_view time, long pid) {
    std::string out = "{\"time\":";
    append_json_string(out, time);
    out += ",\"pid\":" + std::to_string(pid);
    out += ",\"component\":";
    append_json_string(out, std::string_view(record.component,
                                             strnlen(record.component, sizeof record.component)));
    append_hex_field(out, "reason", "0x%04X", record.reason_code);
    out += ",\"severity\":\"";
    out += severity(record.option);
    out += '"';
    append_hex_field(out, "option", "0x%X", record.option);
    append_hex_field(out, "compRc", "0x%X", record.comp_rc);
    out += ",\"attachment\":";
    if (record.attachment != nullptr) {
        append_json_string(out,
                           std::string_view(record.attachment,
                                            strnlen(record.attachment, record.attachment_length)));
    } else {
        out += "null";
    }
    out += "}\n";
    return out;
}

uint32_t log(const void *record, uint32_t *crc) {
    int error = EINVAL;
    if (record != nullptr) {
        logsvc_record event;
        std::memcpy(&event, record, sizeof event);
        if (event.record_type == LOGSVC_RECORD_TYPE_EVENT) {
            std::string path =
                environment::file_in_data_directory(FILE_VARIABLE, DEFAULT_FILE_NAME);
            error = append_line(path, format(event, stamp::utc_now().text, ::getpid()));
        }
    }
    if (crc != nullptr) {
        *crc = static_cast<uint32_t>(error);
    }
    return error == 0 ? 0 : FAILED;
}

} // namespace telv::event_log

#include "capture/snapshot_file.h"

#include <cstdio>
#include <cstring>
#include <string_view>

#include "allocation.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "filesvc.h"
#include "tracesvc.h"

time_t (*snapshot_clock)(time_t *) = time;

namespace {

constexpr char LINE_END[] = "\n\r"; // LF then CR: the file's line end, deliberately not CR LF
constexpr size_t LINE_END_LENGTH = 2;
constexpr int64_t STAGING_ROOM = 10; // a line is staged only while more than this stays free

// Indexed by tm_mon + 1; index 0 stands for a month the clock cannot name.
constexpr char month[13][10] = {"Error",   "January",  "February", "March",  "April",
                                "May",     "June",     "July",     "August", "September",
                                "October", "November", "December"};
static_assert(sizeof month == 13 * 10);

// What one flush works on: the line that did not fit (empty when it was staged), the staged text,
// and `combined`, the length of both when the line came in.
struct flush_request {
    char *data;
    size_t in_len;
    char *buffer;
    size_t capacity;
    uint64_t combined;
};

// The text staged so far; none at all when the caller gave no usable buffer.
std::string_view staged_text(const flush_request &request) {
    if (request.capacity == 0) {
        return "";
    }
    return {request.buffer, strnlen(request.buffer, request.capacity)};
}

// A failure of the file service goes out with the result of the last open, OR 2, as the system
// return code: after a failed open that result makes it a system-class report (0xE0F1).
void report(uint32_t open_rc, uint32_t crc, reason_code code) {
    tarn_mon_error_handler(open_rc | 2, crc, code);
}

uint32_t open_snapshot_file(filesvc_handle_t *handle, uint32_t *crc) {
    uint32_t info = 0;
    return filesvc_search_file_open(SNAPSHOT_FILE_NAME, FILESVC_OPEN_OR_CREATE,
                                    FILESVC_ACCESS_READ_WRITE, 0, 0, handle, &info, crc);
}

// The open that begins a flush: a failure is traced and reported with `reason`.
uint32_t open_or_report(filesvc_handle_t *handle, uint32_t *crc, reason_code reason) {
    uint32_t rc = open_snapshot_file(handle, crc);
    if (rc != 0) {
        tracesvc_trace("TARNSDAF: filesvc_search_file_open failed");
        report(rc, *crc, reason);
    }
    return rc;
}

// True when the service took the text: a result of 0 and at least one byte written.
bool write_text(filesvc_handle_t handle, const char *text, size_t length, uint32_t mode,
                uint32_t *crc) {
    uint32_t written = 0;
    uint32_t info = 0;
    uint32_t rc = filesvc_random_write(handle, text, static_cast<uint32_t>(length), mode, 0,
                                       &written, &info, crc);
    tracesvc_trace("TARNSDAD: byte_count = %d", static_cast<int>(written));
    return rc == 0 && written != 0;
}

// Appends the line that did not fit, with its line end, behind the staged text just written.
bool append_oversized_line(filesvc_handle_t handle, const flush_request &request, uint32_t *crc) {
    if (request.in_len + LINE_END_LENGTH < request.capacity) {
        std::memcpy(request.buffer, request.data, request.in_len);
        std::memcpy(request.buffer + request.in_len, LINE_END, LINE_END_LENGTH + 1);
        return write_text(handle, request.buffer, request.in_len + LINE_END_LENGTH, FILESVC_APPEND,
                          crc);
    }
    // A line too long for the staging buffer even on its own is never copied there: it goes out
    // straight from the caller's buffer, and its line end after it.
    return write_text(handle, request.data, request.in_len, FILESVC_APPEND, crc) &&
           write_text(handle, LINE_END, LINE_END_LENGTH, FILESVC_APPEND, crc);
}

void append_to_file(const flush_request &request) {
    filesvc_handle_t handle = 0;
    uint32_t crc = 0;
    uint32_t open_rc = open_or_report(&handle, &crc, RC_SNAPSHOT_OPEN_APPEND);
    if (open_rc != 0) {
        return;
    }
    std::string_view staged = staged_text(request);
    if (!write_text(handle, staged.data(), staged.size(), FILESVC_APPEND, &crc)) {
        report(open_rc, crc, RC_SNAPSHOT_WRITE_STAGED);
    } else if (request.data[0] != '\0' && !append_oversized_line(handle, request, &crc)) {
        report(open_rc, crc, RC_SNAPSHOT_WRITE_LINE);
    }
    if (filesvc_close_file(handle, &crc) != 0) {
        report(open_rc, crc, RC_SNAPSHOT_CLOSE_APPEND);
    }
}

// Builds the old file plus the new text in `work` and returns the length of that text, or -1 when
// the old file could not be read. `work` holds `combined` + `file_size` + 45,056 bytes.
int64_t read_old_and_add_new(const flush_request &request, uint32_t file_size, char *work) {
    filesvc_handle_t handle = 0;
    uint32_t crc = 0;
    uint32_t open_rc = open_or_report(&handle, &crc, RC_SNAPSHOT_OPEN_WRAP);
    if (open_rc != 0) {
        return -1;
    }
    // The work area is not cleared first: no byte of it is read that was not written here, and
    // clearing megabytes would make every page of it resident for nothing.
    uint32_t bytes_read = 0;
    uint32_t info = 0;
    uint32_t rc = filesvc_random_read(handle, work, file_size, FILESVC_AT_OFFSET, 0, &bytes_read,
                                      &info, &crc);
    tracesvc_trace("TARNSDAD: byte_count = %d", static_cast<int>(bytes_read));
    if (rc != 0 || bytes_read == 0) {
        // The file stays open here: a missing or empty file fails at this point whenever a wrap
        // is due, and the handle is left as it is.
        report(open_rc, crc, RC_SNAPSHOT_READ_WRAP);
        return -1;
    }
    if (filesvc_close_file(handle, &crc) != 0) {
        report(open_rc, crc, RC_SNAPSHOT_CLOSE_AFTER_READ);
        return -1;
    }
    // The old text ends at its first NUL, as a string would: the new text follows it there.
    size_t length = strnlen(work, bytes_read);
    std::string_view staged = staged_text(request);
    if (!staged.empty()) {
        std::memcpy(work + length, staged.data(), staged.size());
        length += staged.size();
    }
    if (request.data[0] != '\0') {
        std::memcpy(work + length, request.data, request.in_len);
        std::memcpy(work + length + request.in_len, LINE_END, LINE_END_LENGTH);
        length += request.in_len + LINE_END_LENGTH;
    }
    work[length] = '\0';
    return static_cast<int64_t>(length);
}

// Where the kept text starts: the first wrap marker at or after `delta`, else `delta` itself
// (mid-line). A `delta` beyond the text (an old file that held a NUL or shrank after its size was
// taken) keeps nothing, and the write of that nothing fails as a write of 0 bytes does.
size_t kept_start(const char *work, size_t length, uint32_t delta) {
    size_t cut = delta < length ? static_cast<size_t>(delta) : length;
    size_t marker = std::string_view(work + cut, length - cut).find(WRAP_MARKER);
    return marker == std::string_view::npos ? cut : cut + marker;
}

void rewrite_file(const char *text, size_t length) {
    uint32_t crc = 0;
    uint32_t rc = filesvc_delete_file(SNAPSHOT_FILE_NAME, &crc);
    if (rc != 0) {
        tracesvc_trace("TARNSDAF: filesvc_delete_file() returned:");
        tracesvc_trace("TARNSDAF: src = %x, crc = %x (hex)", rc, crc);
    }
    filesvc_handle_t handle = 0;
    uint32_t open_rc = open_snapshot_file(&handle, &crc);
    if (open_rc != 0) {
        return; // the old file is gone and the text with it; there is nothing left to report on
    }
    if (!write_text(handle, text, length, FILESVC_AT_OFFSET, &crc)) {
        report(open_rc, crc, RC_SNAPSHOT_WRITE_TRIMMED);
    }
    if (filesvc_close_file(handle, &crc) != 0) {
        report(open_rc, crc, RC_SNAPSHOT_CLOSE_AFTER_WRITE);
    }
}

// Drops the oldest text so that the file keeps at most `max_snapshot_file_size` + 2 bytes,
// preferring to restart at a plain snapshot.
void wrap_file(const flush_request &request, uint32_t file_size, uint32_t delta) {
    // Sized in 64 bits whatever the sum in 32 came to, so that the whole old file always fits.
    size_t work_size = request.combined + file_size + WRAP_SLACK;
    char *work = static_cast<char *>(TARN_MALLOC(work_size));
    if (work == nullptr) {
        return;
    }
    int64_t length = read_old_and_add_new(request, file_size, work);
    if (length >= 0) {
        tracesvc_trace("TARNSDAD: delta = %x (hex)", delta);
        size_t start = kept_start(work, static_cast<size_t>(length), delta);
        tracesvc_trace("TARNSDAD: start_ptr = %p", static_cast<void *>(work + start));
        rewrite_file(work + start, static_cast<size_t>(length) - start);
    }
    TARN_FREE(work);
}

void flush(const flush_request &request) {
    uint32_t file_size = 0;
    uint32_t crc = 0;
    if (filesvc_query_file_size(SNAPSHOT_FILE_NAME, &file_size, &crc) != 0) {
        file_size = 0; // not there yet: the append creates it
    }
    tracesvc_trace("TARNSDAD: buflen = %d (dec)", static_cast<int>(staged_text(request).size()));
    // An unsigned 32-bit sum, like the file sizes of the service: a file and a text that pass
    // 4 GB together roll over to a small sum and are appended.
    uint32_t total = file_size + static_cast<uint32_t>(request.combined);
    if (total >= max_snapshot_file_size) {
        wrap_file(request, file_size, total - max_snapshot_file_size);
    } else {
        append_to_file(request);
    }
}

// Two digits, zero-padded: "%2d" into a field of "00", a lone digit moved right behind a '0', and
// a leading blank made '0'.
void two_digits(char (&field)[3], int value) {
    std::memcpy(field, "00", sizeof field);
    if (std::snprintf(field, sizeof field, "%2d", value) == 1) {
        field[1] = field[0];
        field[0] = '0';
    }
    if (field[0] == ' ') {
        field[0] = '0';
    }
}

} // namespace

TARN_EXPORT void tarn_save_data(char *data, char *buffer, int32_t buffer_size, int32_t final) {
    if (data == nullptr) {
        tracesvc_trace("TARNSDAD: data to append was NULL");
        return;
    }
    size_t capacity = buffer != nullptr && buffer_size > 0 ? static_cast<size_t>(buffer_size) : 0;
    size_t in_len = std::strlen(data);
    size_t buf_len = capacity != 0 ? strnlen(buffer, capacity) : 0;
    uint64_t combined = in_len + buf_len;
    bool staged = static_cast<int64_t>(combined) + STAGING_ROOM < static_cast<int64_t>(capacity);
    if (staged) {
        std::memcpy(buffer + buf_len, data, in_len);
        std::memcpy(buffer + buf_len + in_len, LINE_END, LINE_END_LENGTH + 1);
        data[0] = '\0';
    } else {
        final = 1; // the staged text goes out now, and the line on its own behind it
    }
    if (final != 1) {
        return;
    }
    flush(flush_request{data, staged ? 0 : in_len, buffer, capacity, combined});
    data[0] = '\0';
    if (capacity != 0) {
        buffer[0] = '\0';
    }
}

TARN_EXPORT int tarn_add_timestamp(void) {
    tracesvc_trace("TARNATSF: --> tarn_add_timestamp");
    time_t now = snapshot_clock(nullptr);
    struct tm local {};
    if (localtime_r(&now, &local) == nullptr) {
        local = tm{};
        local.tm_mon = -1; // a time the calendar cannot hold is stamped with the month "Error"
    }
    char hours[3];
    char minutes[3];
    char seconds[3];
    two_digits(hours, local.tm_hour);
    two_digits(minutes, local.tm_min);
    two_digits(seconds, local.tm_sec);
    int index = local.tm_mon >= 0 && local.tm_mon < 12 ? local.tm_mon + 1 : 0;
    std::snprintf(line, sizeof line, "Local date and time = %d %s %4d at %s:%s:%s ", local.tm_mday,
                  month[index], local.tm_year + 1900, hours, minutes, seconds);
    tarn_save_data(line, file_buffer, FILE_BUFFER_SIZE, 0);
    std::snprintf(line, sizeof line, "%s", "Code Version 61.001");
    tarn_save_data(line, file_buffer, FILE_BUFFER_SIZE, 0);
    return tracesvc_trace("TARNATSF: <-- tarn_add_timestamp");
}

// The trace file of the default platform: one line per trace call, stamped with the time, the pid
// and the thread, kept within a size bound by renaming a full file to "<name>.1" when the path is
// that regular file's own name (a link or a device is written to, never renamed).
//
// Such a file is shared through ".<name>.lock" beside it, which every writer maps: its lock keeps
// the lines and rotations of all threads and processes apart, and it holds the file's size and a
// count of the files begun at the path, so that a line costs one write and no other system call.
// What only the file system can tell (the file renamed or removed by someone else) is looked at
// every LOOK_EVERY_LINES lines or LOOK_EVERY_MS milliseconds; until then the lines go with the
// file. Any other path, or a file whose shared state cannot be had, is looked at for every line,
// under flock. The state file is the writers' own: cut short under them, it stops them (SIGBUS).
//
// Detail lines are many (a pass traces a line for every descriptor it lists) and a write each was
// most of their cost, so they wait, composed and stamped, to be written together: before the next
// line that is no detail line, once WAITING_BYTES (at most the bound) would be passed, when the
// first has waited WAIT_AT_MOST_MS by the time of the next line, and when the process ends. A
// detail line that waits counts as written; one lost with its batch is not told to its caller,
// nor is a batch still waiting when the process is killed. A dump is written whole, with its rows.
#pragma once

#include <cstdarg>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace telv::trace {

inline constexpr const char *FILE_VARIABLE = "TELV_TRACE_FILE";
inline constexpr const char *DEFAULT_FILE_NAME = "telvzmnd.trace";
inline constexpr const char *MAX_BYTES_VARIABLE = "TELV_TRACE_MAX_BYTES";
inline constexpr uint64_t DEFAULT_MAX_BYTES = 8u << 20;
inline constexpr const char *DETAIL_VARIABLE = "TELV_TRACE_DETAIL";
// A line, stamp and line feed included, is cut to this many bytes.
inline constexpr size_t MAX_LINE = 8192;
inline constexpr size_t DUMP_BYTES_PER_ROW = 16;
inline constexpr uint32_t LOOK_EVERY_LINES = 1000;
inline constexpr int64_t LOOK_EVERY_MS = 100;
inline constexpr size_t WAITING_BYTES = 64u << 10;
inline constexpr int64_t WAIT_AT_MOST_MS = 100;

// A detail line: its eye-catcher (the first nine characters, "TARNSDAD:") has 'D' as the eighth.
bool is_detail(std::string_view text);

// Composes "<stamp><text>\n" into `out` (room bytes, room >= 1) and returns its length. Line ends
// at the end of the text are dropped and those inside it written as "\n" and "\r", so that one
// call is always one line; whatever does not fit is cut, the line feed always stays.
size_t compose(char *out, size_t room, std::string_view stamp, std::string_view text);

// One row of a dump: "00000010  41 42 ...  |AB..|", the offset and up to 16 bytes, in hex and as
// text with '.' for anything unprintable. Returns its length (without a line end).
size_t dump_row(char *out, size_t room, uint32_t offset, const unsigned char *bytes, size_t count);

// Writes the formatted text as one trace line. The length of the text, or -1 when the trace file
// could not be written.
int vline(const char *format, va_list args);
int line(const char *format, ...) __attribute__((format(printf, 1, 2)));

// A title line, then the rows of the dump; 0, or -1 when the trace file could not be written.
int dump(const char *title, const void *data, uint32_t length);

// Writes the detail lines waiting now; false when they could not be written.
bool write_waiting_lines();

} // namespace telv::trace

// What the routines of libtelvzextra.so share: the outside world they read (a redirectable /proc
// root, the kernel log, statvfs and a clock, each a global that tests replace), bounded reads of
// small files, the bounded text a routine hands back, the keywords a routine reads from the control
// file's text, and the number parsing of /proc text.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>
#include <sys/statvfs.h>

// The one mark of a routine that leaves the module.
#define EXTRA_EXPORT extern "C" __attribute__((visibility("default")))

// ---- The outside world, one global each ----

using statvfs_source = int (*)(const char *path, struct statvfs *figures);
using milliseconds_source = int64_t (*)();

extern const char *extra_proc_root;     // "/proc"; every /proc path is built under it
extern const char *extra_kmsg_path;     // "/dev/kmsg"
extern statvfs_source extra_statvfs;    // ::statvfs
extern milliseconds_source extra_clock; // CLOCK_MONOTONIC, in milliseconds

// Puts the four back to the real host.
void reset_extra_seams();

// ---- Reads ----

inline constexpr size_t EXTRA_PATH_SIZE = 4096;

// A file's text as read: absent (with the errno of open or read), or up to the buffer's size - 1
// bytes and a NUL; `cut` when the file held more.
struct file_text {
    std::string_view text;
    bool present;
    bool cut;
    int error;
};

// Reads `relative` ("pressure/cpu", "1234/limits") under extra_proc_root into `buffer`.
file_text read_proc_file(const char *relative, char *buffer, size_t size);
// Writes extra_proc_root + "/" + relative into `path`; false (and an empty path) when it does not
// fit.
bool proc_path(char *path, size_t size, const char *relative);

// ---- The returned text ----

// A routine's text in a fixed buffer: whole lines, each ending "\n\r", and never a byte past the
// buffer. A line that does not fit is replaced, once, by TRUNCATED_LINE, for which room is kept
// from the start; every line after it is dropped.
class routine_text {
  public:
    static constexpr std::string_view TRUNCATED_LINE =
        "truncated: more lines than this routine's text holds\n\r";
    static constexpr size_t LINE_SIZE = 512; // a longer line is cut to 509 bytes and its ending

    routine_text(char *buffer, size_t size);
    void line(const char *format, ...) __attribute__((format(printf, 2, 3)));
    bool truncated() const { return truncated_; }
    bool empty() const { return length_ == 0; }
    size_t length() const { return length_; }
    const char *text() const { return buffer_; }

  private:
    char *buffer_;
    size_t size_;
    size_t length_ = 0;
    bool truncated_ = false;
};

// Hands the text to the loop: *returnedData is left as it is (null) when the text is empty, so that
// a pass with nothing to say leaves no frame in the snapshot.
void hand_back(const routine_text &text, char **returnedData);

// ---- Keywords of the control file ----

// The value of the last line of `fileData` whose first word is `keyword` and whose second word,
// on the same line, is a whole number in [low, high] (0 <= low); `fallback` when there is no
// such line.
// Comment lines (a '*' as the first byte) are passed over, as the monitor passes them over.
int64_t keyword_number(const char *fileData, std::string_view keyword, int64_t fallback,
                       int64_t low, int64_t high);

// ---- Parsing /proc text ----

// The digits at the front of `text` as a number, consumed from `text`; false on no digit or on
// overflow of 64 bits.
bool take_number(std::string_view &text, uint64_t *value);
// Drops blanks (spaces and tabs) at the front of `text`.
void skip_blanks(std::string_view &text);
// The next line of `text` (without its line feed), consumed with it.
std::string_view take_line(std::string_view &text);
// Copies `from` into `to` (NUL-terminated, cut to size - 1), every byte outside printable ASCII
// written as '?': names from /proc may hold any byte, a snapshot line must not.
void printable_copy(char *to, size_t size, std::string_view from);

// The snapshot file "telvzmnd.trm": one wrapping text file that keeps every snapshot the monitor
// writes for later diagnosis. Lines are staged in `file_buffer` and reach the file once per block,
// when the block's closing separator asks for a flush.
#pragma once

#include <cstdint>
#include <ctime>
#include <string_view>

#include "export.h"

inline constexpr const char *SNAPSHOT_FILE_NAME = "telvzmnd.trm";

// The separator lines that open and close each block (52 characters, no line end of their own).
// Only the plain opening begins with the wrap marker: after a wrap the file restarts at the oldest
// complete plain snapshot, never at a problem snapshot, whose opening has a blank after "START".
inline constexpr std::string_view PROBLEM_SNAPSHOT_OPENING =
    "=START FEDC SNAPSHOT================================";
inline constexpr std::string_view PROBLEM_SNAPSHOT_CLOSING =
    "=END FEDC SNAPSHOT==================================";
inline constexpr std::string_view PLAIN_SNAPSHOT_OPENING =
    "=START==============================================";
inline constexpr std::string_view PLAIN_SNAPSHOT_CLOSING =
    "=END================================================";
inline constexpr std::string_view WRAP_MARKER = "=START=";

// Room a wrap takes beyond the old file and the new text.
inline constexpr uint32_t WRAP_SLACK = 45056;

// Where the time stamp takes the calendar time from: time() in production, a fixed clock in tests.
extern time_t (*snapshot_clock)(time_t *);

// Stages the NUL-terminated line `data` (followed by "\n\r") in `buffer` of `buffer_size` bytes
// and, when `final` is 1 or the line does not fit, writes the staged text to the snapshot file.
// `data` and `buffer` are consumed: their first byte is NUL once the line was staged or flushed. A
// NULL `data` is only traced: nothing is staged or flushed.
TARN_EXPORT void tarn_save_data(char *data, char *buffer, int32_t buffer_size, int32_t final);

// Stages the two lines that follow every opening separator: the local date and time, and the code
// version. Returns the result of its closing trace.
TARN_EXPORT int tarn_add_timestamp(void);

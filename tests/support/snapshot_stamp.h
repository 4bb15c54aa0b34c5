// The time stamp of the snapshots the tests write: a clock fixed at 5 March 2021, 07:04:09 UTC,
// and the two lines the writer stages for it when the tests run with TZ=UTC.
#pragma once

#include <ctime>
#include <string>

namespace snapshot_stamp {

inline const std::string STAMP =
    "Local date and time = 5 March 2021 at 07:04:09 \n\rCode Version 61.001\n\r";

inline time_t fixed_clock(time_t *out) {
    struct tm t {};
    t.tm_year = 121;
    t.tm_mon = 2;
    t.tm_mday = 5;
    t.tm_hour = 7;
    t.tm_min = 4;
    t.tm_sec = 9;
    time_t now = timegm(&t);
    if (out != nullptr) {
        *out = now;
    }
    return now;
}

} // namespace snapshot_stamp

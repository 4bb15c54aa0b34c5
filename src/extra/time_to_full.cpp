#include "time_to_full.h"

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>

namespace {

// Network file systems: most are "nodev" too, but not all of them are on every kernel.
constexpr std::string_view NETWORK_TYPES[] = {
    "nfs", "nfs4", "cifs",  "smb3",      "smbfs",  "ncpfs", "afs",      "ceph",
    "9p",  "gfs2", "ocfs2", "glusterfs", "lustre", "coda",  "orangefs", "beegfs",
};

constexpr size_t FILESYSTEMS_SIZE = 8192; // some 60 lines of less than 20 bytes
constexpr size_t MOUNTS_SIZE = 131072;    // about a thousand mounts
constexpr size_t TEXT_SIZE = 24576;       // 64 lines of at most 350 bytes, and three more
constexpr double SECONDS_SHOWN_MAX = 100.0 * 365 * 86400;

// A file system followed from pass to pass.
struct followed {
    bool in_use;
    bool seen;                          // in this pass's mounts
    char mount_point[MOUNT_POINT_SIZE]; // escaped
    char device[DEVICE_SIZE];
    int64_t first_milliseconds; // of its first pass: the origin of its time
    double first_used;          // bytes at its first pass: the origin of its used space
    used_trend trend;
};

followed file_systems[FILE_SYSTEMS_MAX];
char returned[TEXT_SIZE];

bool equals(const char *field, std::string_view text) {
    return std::strlen(field) == text.size() && text.compare(field) == 0;
}

// The slot of this mount, a new one when it is not followed yet, or null when the table is full.
// A device already seen in this pass (a bind mount, a second subvolume) gives `duplicate`.
followed *slot_of(const mount_entry &entry, bool *duplicate) {
    followed *free_slot = nullptr;
    *duplicate = false;
    for (followed &each : file_systems) {
        if (!each.in_use) {
            free_slot = free_slot == nullptr ? &each : free_slot;
        } else if (equals(each.device, entry.device) &&
                   (each.seen || equals(each.mount_point, entry.mount_point))) {
            *duplicate = each.seen;
            return &each;
        }
    }
    if (free_slot != nullptr) {
        *free_slot = {};
        free_slot->in_use = true;
        std::memcpy(free_slot->mount_point, entry.mount_point.data(), entry.mount_point.size());
        std::memcpy(free_slot->device, entry.device.data(), entry.device.size());
    }
    return free_slot;
}

// "2 d 03 h 10 min"
void write_duration(char *text, size_t size, double seconds) {
    if (seconds >= SECONDS_SHOWN_MAX) {
        std::snprintf(text, size, "more than 100 years");
        return;
    }
    auto minutes = static_cast<int64_t>(std::llround(seconds / 60));
    std::snprintf(text, size, "%" PRId64 " d %02" PRId64 " h %02" PRId64 " min", minutes / 1440,
                  minutes / 60 % 24, minutes % 60);
}

// What follows the used space in a file system's line: its rate and time to full.
void write_outlook(char *text, size_t size, const followed &each, uint64_t available,
                   int64_t horizon_hours) {
    double rate = 0;
    if (!growth_rate(each.trend, &rate)) {
        std::snprintf(text, size, "rate known from the next pass");
        return;
    }
    auto kib_an_hour = static_cast<int64_t>(std::llround(rate * 3600 / 1024));
    int used = std::snprintf(text, size, "%+" PRId64 " KiB/h over %" PRIu64 " passes, ",
                             kib_an_hour, each.trend.passes);
    size_t offset = used < 0 ? 0 : std::min(static_cast<size_t>(used), size - 1);
    char *rest = text + offset;
    size_t room = size - offset;
    if (rate <= 0) {
        std::snprintf(rest, room, "not growing");
        return;
    }
    double seconds = static_cast<double>(available) / rate;
    char duration[48];
    write_duration(duration, sizeof duration, seconds);
    bool soon = seconds < static_cast<double>(horizon_hours) * 3600;
    if (available == 0) {
        std::snprintf(rest, room, "full now");
    } else if (soon) {
        std::snprintf(rest, room, "full in %s, within the %" PRId64 " h horizon", duration,
                      horizon_hours);
    } else {
        std::snprintf(rest, room, "full in %s", duration);
    }
}

void follow(routine_text &text, const mount_entry &entry, int64_t now, int64_t horizon_hours,
            uint64_t *not_followed) {
    char path[MOUNT_POINT_SIZE];
    bool duplicate = false;
    followed *each = entry.mount_point.size() < MOUNT_POINT_SIZE &&
                             entry.device.size() < DEVICE_SIZE &&
                             unescape_mount_path(entry.mount_point, path, sizeof path)
                         ? slot_of(entry, &duplicate)
                         : nullptr;
    if (duplicate) {
        return;
    }
    if (each == nullptr) {
        ++*not_followed;
        return;
    }
    each->seen = true;
    char shown_point[MOUNT_POINT_SIZE];
    char shown_device[DEVICE_SIZE];
    char shown_type[32];
    printable_copy(shown_point, sizeof shown_point, entry.mount_point);
    printable_copy(shown_device, sizeof shown_device, entry.device);
    printable_copy(shown_type, sizeof shown_type, entry.type);
    struct statvfs figures {};
    if (extra_statvfs(path, &figures) != 0) {
        text.line("time to full: %s (%s on %s) not measured (statvfs: %s)", shown_point, shown_type,
                  shown_device, std::strerror(errno));
        each->trend = {};
        return;
    }
    uint64_t unit = figures.f_frsize != 0 ? figures.f_frsize : figures.f_bsize;
    uint64_t size = static_cast<uint64_t>(figures.f_blocks) * unit;
    uint64_t used =
        static_cast<uint64_t>(figures.f_blocks - std::min(figures.f_bfree, figures.f_blocks)) *
        unit;
    uint64_t available = static_cast<uint64_t>(figures.f_bavail) * unit;
    if (each->trend.passes == 0) {
        each->first_milliseconds = now;
        each->first_used = static_cast<double>(used);
    }
    add_sample(each->trend, static_cast<double>(now - each->first_milliseconds) / 1000,
               static_cast<double>(used) - each->first_used);
    char outlook[160];
    write_outlook(outlook, sizeof outlook, *each, available, horizon_hours);
    text.line("time to full: %s (%s on %s) used %" PRIu64 " of %" PRIu64 " KiB, %s", shown_point,
              shown_type, shown_device, used / 1024, size / 1024, outlook);
}

} // namespace

bool parse_mount_line(std::string_view line, mount_entry *entry) {
    std::string_view *fields[] = {&entry->device, &entry->mount_point, &entry->type};
    for (std::string_view *field : fields) {
        skip_blanks(line);
        size_t end = line.find_first_of(" \t");
        *field = line.substr(0, end);
        line.remove_prefix(field->size());
        if (field->empty()) {
            return false;
        }
    }
    return true;
}

bool unescape_mount_path(std::string_view escaped, char *path, size_t size) {
    size_t length = 0;
    for (size_t i = 0; i < escaped.size(); ++i) {
        char c = escaped[i];
        if (c == '\\' && escaped.size() - i >= 4 &&
            escaped.substr(i + 1, 3).find_first_not_of("01234567") == std::string_view::npos) {
            c = static_cast<char>((escaped[i + 1] - '0') * 64 + (escaped[i + 2] - '0') * 8 +
                                  (escaped[i + 3] - '0'));
            i += 3;
        }
        if (length + 1 >= size) {
            return false;
        }
        path[length++] = c;
    }
    path[length] = '\0';
    return true;
}

file_system_kind classify_file_system(std::string_view filesystems, std::string_view type) {
    for (std::string_view network : NETWORK_TYPES) {
        if (type == network) {
            return file_system_kind::network;
        }
    }
    while (!filesystems.empty()) {
        std::string_view line = take_line(filesystems);
        bool nodev = line.starts_with("nodev");
        line.remove_prefix(nodev ? 5 : 0);
        skip_blanks(line);
        if (line == type) {
            return nodev ? file_system_kind::pseudo : file_system_kind::local;
        }
    }
    return file_system_kind::unlisted;
}

void add_sample(used_trend &trend, double seconds, double used) {
    ++trend.passes;
    double n = static_cast<double>(trend.passes);
    double seconds_off = seconds - trend.mean_seconds;
    trend.mean_seconds += seconds_off / n;
    trend.mean_used += (used - trend.mean_used) / n;
    trend.squares_seconds += seconds_off * (seconds - trend.mean_seconds);
    trend.products += seconds_off * (used - trend.mean_used);
}

bool growth_rate(const used_trend &trend, double *bytes_per_second) {
    if (trend.passes < 2 || !(trend.squares_seconds > 0)) {
        return false;
    }
    *bytes_per_second = trend.products / trend.squares_seconds;
    return std::isfinite(*bytes_per_second);
}

EXTRA_EXPORT void telvzextra_time_to_full(const char *fileData, char **returnedData) {
    routine_text text(returned, sizeof returned);
    int64_t horizon_hours =
        keyword_number(fileData, HORIZON_KEYWORD, HORIZON_DEFAULT, 0, HORIZON_MAX);
    static char filesystems_text[FILESYSTEMS_SIZE];
    static char mounts_text[MOUNTS_SIZE];
    file_text filesystems =
        read_proc_file("filesystems", filesystems_text, sizeof filesystems_text);
    file_text mounts = read_proc_file("self/mounts", mounts_text, sizeof mounts_text);
    if (!filesystems.present || !mounts.present) {
        text.line("time to full: /proc/%s cannot be read",
                  filesystems.present ? "self/mounts" : "filesystems");
        hand_back(text, returnedData);
        return;
    }
    int64_t now = extra_clock();
    for (followed &each : file_systems) {
        each.seen = false;
    }
    std::string_view lines = mounts.text;
    if (mounts.cut) {
        lines = lines.substr(0, lines.rfind('\n') + 1); // a cut line is no mount
    }
    uint64_t not_followed = 0;
    while (!lines.empty()) {
        mount_entry entry;
        if (parse_mount_line(take_line(lines), &entry) &&
            classify_file_system(filesystems.text, entry.type) == file_system_kind::local) {
            follow(text, entry, now, horizon_hours, &not_followed);
        }
    }
    for (followed &each : file_systems) {
        each.in_use = each.in_use && each.seen;
    }
    if (not_followed != 0) {
        text.line("time to full: %" PRIu64 " more local file systems not followed (at most %zu, "
                  "names of at most %zu bytes)",
                  not_followed, FILE_SYSTEMS_MAX, MOUNT_POINT_SIZE - 1);
    }
    if (mounts.cut) {
        text.line("time to full: the mount table was read up to %zu bytes", MOUNTS_SIZE - 1);
    }
    hand_back(text, returnedData);
}

void reset_time_to_full_state() {
    std::memset(static_cast<void *>(file_systems), 0, sizeof file_systems);
}

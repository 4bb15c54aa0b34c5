// The parsers of /proc/filesystems and /proc/self/mounts, fed any bytes: up to the first NUL as
// /proc/filesystems, after it as the mount table. Every line of the table is parsed, classified and
// its mount point unescaped into a small buffer that is never written past; a running line of used
// space over time takes every sample and gives a finite rate or none.
#include <cmath>
#include <cstddef>
#include <cstdint>

#include "support/extra_fuzz.h"
#include "time_to_full.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string_view input(reinterpret_cast<const char *>(data), size);
    size_t split = input.find('\0');
    std::string_view filesystems = input.substr(0, split);
    std::string_view mounts = split == std::string_view::npos ? "" : input.substr(split + 1);
    used_trend trend{};
    double seconds = 0;
    extra_fuzz::for_each_line(mounts, [&](std::string_view line) {
        mount_entry entry;
        if (!parse_mount_line(line, &entry)) {
            return;
        }
        extra_fuzz::require(!entry.device.empty() && !entry.mount_point.empty() &&
                            !entry.type.empty());
        file_system_kind kind = classify_file_system(filesystems, entry.type);
        extra_fuzz::require(kind != file_system_kind::local ||
                            filesystems.find(entry.type) != std::string_view::npos);
        char path[32 + 8];
        std::memset(path + 32, 0x5a, 8);
        if (unescape_mount_path(entry.mount_point, path, 32)) {
            extra_fuzz::require(strnlen(path, 32) < 32);
        }
        for (size_t i = 32; i < sizeof path; ++i) {
            extra_fuzz::require(path[i] == 0x5a);
        }
        seconds += static_cast<double>(line.size() % 7);
        add_sample(trend, seconds, static_cast<double>(entry.mount_point.size()) * 1e9);
        double rate = 0;
        if (growth_rate(trend, &rate)) {
            extra_fuzz::require(std::isfinite(rate));
        }
    });
    return 0;
}

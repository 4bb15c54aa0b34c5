#include "metrics_file.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

#include "snapshot_reader.h"
#include "utf8.h"

namespace {

constexpr mode_t METRICS_MODE = 0644; // the collector reads it as a user of its own

struct family {
    const char *name;
    const char *type;
    const char *help;
};

enum family_id {
    PASSES,
    FINDINGS,
    HELD_BACK,
    MEMORY,
    PARTITION,
    PARTITIONS_LEFT_OUT,
    DESCRIPTORS,
    CPU,
    SLEEP_DRIFT,
    PASS_DURATION,
    PASS_END,
};

// In the order of the file. A family without a sample in a pass (a figure its command did not
// give) is left out whole.
constexpr family FAMILIES[] = {
    {"telvzmnd_passes_total", "counter", "Passes the monitor made since it started."},
    {"telvzmnd_findings_total", "counter",
     "Findings the monitor reported with an event, by reason code."},
    {"telvzmnd_findings_held_back_total", "counter",
     "Passes whose finding was not reported because an earlier event still holds reports back."},
    {"telvzmnd_memory_in_use_percent", "gauge",
     "Memory and swap in use, in percent of both together, as the system memory check judges it."},
    {"telvzmnd_partition_used_percent", "gauge",
     "Space and inodes in use of each local partition, in percent, as df printed them."},
    {"telvzmnd_partition_lines_left_out", "gauge",
     "Lines of df about partitions beyond the 64 the figures keep, left out of this file."},
    {"telvzmnd_file_descriptors_in_use_percent", "gauge",
     "File handles in use, in percent of the system's maximum (file-nr)."},
    {"telvzmnd_appliance_cpu_percent", "gauge",
     "CPU used by every process together in the newest sample, in percent of the machine."},
    {"telvzmnd_sleep_drift_seconds", "gauge",
     "How much longer than asked the monitor's sleep before the last pass took."},
    {"telvzmnd_pass_duration_seconds", "gauge",
     "How long the last pass took, its commands included."},
    {"telvzmnd_last_pass_timestamp_seconds", "gauge",
     "When the last pass ended, in seconds since the epoch."},
};

// A label value as the exposition quotes it: backslash, quote and line end escaped, and any byte
// that is not part of valid UTF-8 as the character of its own number, so that the file stays UTF-8.
std::string label_value(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for_each_character(text, [&out](const text_character &c) {
        if (c.code == '\\' || c.code == '"') {
            out += '\\';
            out += static_cast<char>(c.code);
        } else if (c.code == '\n') {
            out += "\\n";
        } else if (!c.valid) {
            append_byte_as_character(&out, static_cast<unsigned char>(c.code));
        } else {
            out += c.bytes;
        }
    });
    return out;
}

std::string number(double value) {
    if (std::isnan(value)) {
        return "NaN";
    }
    if (std::isinf(value)) {
        return value > 0 ? "+Inf" : "-Inf";
    }
    char text[32];
    auto end = std::to_chars(text, text + sizeof text, value).ptr;
    return std::string(text, end);
}

// Shortest text of a float, as its own precision has it ("3.2", not "3.2000000476837158").
std::string number(float value) {
    if (!std::isfinite(value)) {
        return number(static_cast<double>(value));
    }
    char text[32];
    auto end = std::to_chars(text, text + sizeof text, value).ptr;
    return std::string(text, end);
}

std::string number(uint64_t value) {
    return std::to_string(value);
}

std::string tenths(int32_t value) {
    return number(value / 10.0);
}

class exposition {
  public:
    // A sample of the family; `labels` as written between the braces, empty for none.
    void sample(family_id id, std::string_view labels, std::string_view value) {
        const family &f = FAMILIES[id];
        if (id != open_) {
            out_ += std::string("# HELP ") + f.name + " " + f.help + "\n";
            out_ += std::string("# TYPE ") + f.name + " " + f.type + "\n";
            open_ = id;
        }
        out_ += f.name;
        if (!labels.empty()) {
            out_ += '{';
            out_ += labels;
            out_ += '}';
        }
        out_ += ' ';
        out_ += value;
        out_ += '\n';
    }

    std::string text() && { return std::move(out_); }

  private:
    std::string out_;
    int open_ = -1;
};

std::string label(const char *name, std::string_view value) {
    return std::string(name) + "=\"" + label_value(value) + "\"";
}

std::string reason_code_label(int32_t code) {
    char text[16];
    std::snprintf(text, sizeof text, "0x%04X", static_cast<uint32_t>(code));
    return label("reason_code", text);
}

void add_partitions(exposition &e, const tarn_pass_figures &figures) {
    uint32_t count = std::min(figures.partition_count, TARN_PARTITIONS_KEPT);
    for (uint32_t i = 0; i < count; ++i) {
        const tarn_partition_figures &p = figures.partitions[i];
        // A name the library cut to fit ends at its last byte all the same.
        std::string_view mount_point(p.mount_point, strnlen(p.mount_point, sizeof p.mount_point));
        std::string where = label("mount_point", mount_point);
        if (p.space_tenths != TARN_FIGURE_NONE) {
            e.sample(PARTITION, where + "," + label("resource", "space"), tenths(p.space_tenths));
        }
        if (p.inodes_tenths != TARN_FIGURE_NONE) {
            e.sample(PARTITION, where + "," + label("resource", "inodes"), tenths(p.inodes_tenths));
        }
    }
}

// Writes all of `text` to `fd`, 0 or the errno of the failure.
int write_all(int fd, std::string_view text) {
    while (!text.empty()) {
        ssize_t written = ::write(fd, text.data(), text.size());
        if (written < 0 && errno == EINTR) {
            continue;
        }
        if (written <= 0) {
            return written < 0 ? errno : EIO;
        }
        text.remove_prefix(static_cast<size_t>(written));
    }
    return 0;
}

// A new, empty file beside `path`, named in *name: hidden, and not ending in ".prom", so that no
// collector reads it half written. Its descriptor, or -1 with errno set.
int new_file_beside(const std::string &path, std::string *name) {
    size_t after_slash = path.rfind('/') + 1; // 0 without a slash
    *name = path.substr(0, after_slash) + "." + path.substr(after_slash) + ".XXXXXX";
    return ::mkostemp(name->data(), O_CLOEXEC);
}

} // namespace

void metrics_totals::count(const tarn_pass_figures &figures) {
    ++passes;
    if (figures.reason_code != 0) {
        ++findings[figures.reason_code];
    }
    if (figures.finding_held_back != 0) {
        ++held_back;
    }
}

std::string metrics_text(const tarn_pass_figures &figures, const metrics_totals &totals,
                         double end_time) {
    exposition e;
    e.sample(PASSES, "", number(totals.passes));
    for (const auto &[code, count] : totals.findings) {
        e.sample(FINDINGS, reason_code_label(code), number(count));
    }
    e.sample(HELD_BACK, "", number(totals.held_back));
    if (figures.memory_known != 0) {
        e.sample(MEMORY, "", tenths(figures.memory_tenths));
    }
    add_partitions(e, figures);
    e.sample(PARTITIONS_LEFT_OUT, "", number(uint64_t{figures.partition_lines_dropped}));
    if (figures.descriptors_known != 0) {
        e.sample(DESCRIPTORS, "", tenths(figures.descriptors_tenths));
    }
    if (figures.cpu_known != 0) {
        e.sample(CPU, label("mode", "user"), number(figures.cpu_user_percent));
        e.sample(CPU, label("mode", "kernel"), number(figures.cpu_kernel_percent));
    }
    if (figures.sleep_known != 0) {
        e.sample(SLEEP_DRIFT, "",
                 std::to_string(int64_t{figures.sleep_seconds} - figures.sleep_interval));
    }
    e.sample(PASS_DURATION, "", number(static_cast<double>(figures.duration_ns) / 1e9));
    e.sample(PASS_END, "", number(end_time));
    return std::move(e).text();
}

int replace_file(const std::string &path, std::string_view text) {
    std::string name;
    int fd = new_file_beside(path, &name);
    if (fd < 0) {
        return errno;
    }
    int error = write_all(fd, text);
    if (error == 0 && ::fchmod(fd, METRICS_MODE) != 0) {
        error = errno;
    }
    if (::close(fd) != 0 && error == 0) {
        error = errno;
    }
    if (error == 0 && ::rename(name.c_str(), path.c_str()) != 0) {
        error = errno;
    }
    if (error != 0) {
        ::unlink(name.c_str());
    }
    return error;
}

int settle_replaceable_file(const std::string &path, std::string *absolute_path) {
    if (path.empty() || path.back() == '/') {
        return EISDIR;
    }
    size_t slash = path.rfind('/');
    std::string directory = slash == std::string::npos ? "." : path.substr(0, slash);
    if (directory.empty()) {
        directory = "/";
    }
    char *resolved = ::realpath(directory.c_str(), nullptr);
    if (resolved == nullptr) {
        return errno;
    }
    std::string full = std::string(resolved) + (std::strcmp(resolved, "/") == 0 ? "" : "/") +
                       (slash == std::string::npos ? path : path.substr(slash + 1));
    std::free(resolved);
    struct stat st;
    if (::stat(full.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) {
        return EISDIR;
    }
    // A new file is made and removed again, as every pass will make one.
    std::string name;
    int fd = new_file_beside(full, &name);
    if (fd < 0) {
        return errno;
    }
    ::close(fd);
    ::unlink(name.c_str());
    *absolute_path = full;
    return 0;
}

void metrics_file::observe(const tarn_pass_figures *figures, void *self) {
    static_cast<metrics_file *>(self)->write(*figures);
}

void metrics_file::write(const tarn_pass_figures &figures) {
    totals_.count(figures);
    double now =
        std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
    int error = replace_file(path_, metrics_text(figures, totals_, now));
    if (error != 0 && error != failing_) {
        std::fprintf(stderr, "tarnmon: cannot write the metrics file %s: %s\n",
                     terminal_text(path_).c_str(), std::strerror(error));
    } else if (error == 0 && failing_ != 0) {
        std::fprintf(stderr, "tarnmon: the metrics file %s is written again\n",
                     terminal_text(path_).c_str());
    }
    failing_ = error;
}

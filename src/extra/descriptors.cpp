#include "descriptors.h"

#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <dirent.h>

namespace {

constexpr size_t LIMITS_SIZE = 4096; // some 17 lines of 80 bytes
constexpr size_t NAME_FILE_SIZE = 64;
constexpr size_t TEXT_SIZE = 16384; // 100 lines of at most 150 bytes, the header, the cut line

char returned[TEXT_SIZE];

// What became of one process of the scan.
enum class reading { ranked, unlimited, skipped };

// The entries of <pid>/fd, or false when the directory cannot be opened.
bool count_descriptors(const char *pid, uint64_t *open) {
    char relative[64];
    std::snprintf(relative, sizeof relative, "%s/fd", pid);
    char path[EXTRA_PATH_SIZE];
    DIR *directory = proc_path(path, sizeof path, relative) ? opendir(path) : nullptr;
    if (directory == nullptr) {
        return false;
    }
    *open = 0;
    while (const dirent *entry = readdir(directory)) {
        *open += entry->d_name[0] != '.';
    }
    closedir(directory);
    return true;
}

bool is_pid(const char *name) {
    size_t length = std::strlen(name);
    return length > 0 && length < 20 && std::strspn(name, "0123456789") == length;
}

// Reads one process's limit and count: skipped when it vanished, cannot be read, or gives a limit
// that is no number. A process without a limit cannot run out, and its descriptors are not
// counted. Its name is read only once it makes the list.
reading read_process(const char *pid, descriptor_share *process) {
    char relative[64];
    std::snprintf(relative, sizeof relative, "%s/limits", pid);
    char limits[LIMITS_SIZE];
    file_text file = read_proc_file(relative, limits, sizeof limits);
    open_files_limit limit = file.present ? parse_open_files_limit(file.text)
                                          : open_files_limit{open_files_limit::malformed, 0};
    if (limit.kind == open_files_limit::unlimited) {
        return reading::unlimited;
    }
    if (limit.kind == open_files_limit::malformed || !count_descriptors(pid, &process->open)) {
        return reading::skipped;
    }
    std::string_view digits = pid;
    take_number(digits, &process->pid);
    process->limit = limit.soft;
    uint64_t share = process->open > UINT64_MAX / 10000 ? UINT64_MAX : process->open * 10000;
    process->basis_points = share / (limit.soft == 0 ? 1 : limit.soft);
    return reading::ranked;
}

bool ranks_before(const descriptor_share &a, const descriptor_share &b) {
    return a.basis_points != b.basis_points ? a.basis_points > b.basis_points : a.pid < b.pid;
}

void read_name(const char *pid, descriptor_share *process) {
    char relative[64];
    std::snprintf(relative, sizeof relative, "%s/comm", pid);
    char name[NAME_FILE_SIZE];
    std::string_view comm = read_proc_file(relative, name, sizeof name).text;
    comm.remove_suffix(comm.ends_with('\n') ? 1 : 0); // the kernel's line feed; any other shows
    printable_copy(process->name, sizeof process->name, comm);
}

} // namespace

open_files_limit parse_open_files_limit(std::string_view text) {
    constexpr std::string_view LINE = "Max open files";
    while (!text.empty()) {
        std::string_view line = take_line(text);
        if (!line.starts_with(LINE)) {
            continue;
        }
        line.remove_prefix(LINE.size());
        skip_blanks(line);
        if (line.starts_with("unlimited") &&
            (line.size() == 9 || line[9] == ' ' || line[9] == '\t')) {
            return {open_files_limit::unlimited, 0};
        }
        uint64_t soft = 0;
        if (take_number(line, &soft) && (line.empty() || line[0] == ' ' || line[0] == '\t')) {
            return {open_files_limit::value, soft};
        }
        return {open_files_limit::malformed, 0};
    }
    return {open_files_limit::malformed, 0};
}

size_t rank_process(descriptor_share *listed, size_t count, size_t capacity,
                    const descriptor_share &process) {
    size_t at = count;
    while (at > 0 && ranks_before(process, listed[at - 1])) {
        --at;
    }
    if (at >= capacity) {
        return count;
    }
    size_t kept = count < capacity ? count + 1 : capacity;
    std::memmove(listed + at + 1, listed + at, (kept - 1 - at) * sizeof *listed);
    listed[at] = process;
    return kept;
}

EXTRA_EXPORT void telvzextra_descriptors(const char *fileData, char **returnedData) {
    routine_text text(returned, sizeof returned);
    size_t capacity = static_cast<size_t>(
        keyword_number(fileData, LISTED_KEYWORD, LISTED_DEFAULT, 1, LISTED_MAX));
    static descriptor_share listed[LISTED_MAX];
    size_t count = 0;
    uint64_t counts[3] = {}; // by reading
    DIR *proc = opendir(extra_proc_root);
    if (proc == nullptr) {
        text.line("descriptors: /proc cannot be read");
        hand_back(text, returnedData);
        return;
    }
    while (const dirent *entry = readdir(proc)) {
        if (!is_pid(entry->d_name)) {
            continue;
        }
        descriptor_share process{};
        reading outcome = read_process(entry->d_name, &process);
        ++counts[static_cast<int>(outcome)];
        if (outcome == reading::ranked &&
            (count < capacity || ranks_before(process, listed[count - 1]))) {
            read_name(entry->d_name, &process);
            count = rank_process(listed, count, capacity, process);
        }
    }
    closedir(proc);
    text.line("descriptors: %zu largest shares of the soft limit among %" PRIu64
              " processes (%" PRIu64 " unlimited, %" PRIu64 " skipped: vanished or not readable)",
              count, counts[static_cast<int>(reading::ranked)],
              counts[static_cast<int>(reading::unlimited)],
              counts[static_cast<int>(reading::skipped)]);
    for (size_t i = 0; i < count; ++i) {
        const descriptor_share &process = listed[i];
        text.line("descriptors: pid %" PRIu64 " (%s) %" PRIu64 " open of %" PRIu64 ", %" PRIu64
                  ".%02" PRIu64 "%%",
                  process.pid, process.name, process.open, process.limit,
                  process.basis_points / 100, process.basis_points % 100);
    }
    hand_back(text, returnedData);
}

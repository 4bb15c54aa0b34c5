// cleanupPartition [--dry-run] MOUNT: removes from the file system mounted at MOUNT the files that
// the clean-up policy names for it, and nothing else.
//
// The monitor calls it with the mount point and a "/" appended ("/var/", and "//" for the root).
// It runs with root rights, so it removes only what a line of the policy file names: regular files
// under the line's directory, older than its number of days, whose names match its pattern. It
// never follows a symbolic link, never leaves the file system of the mount (nor enters another
// mount of it), and removes a directory only when it emptied that directory itself. Without a
// policy line for the mount it says so and removes nothing; --dry-run says what it would remove.
//
// The policy is read from one fixed file that must belong to root and be writable by no one else,
// in a directory of the same kind: a caller cannot point this program at a policy of its own.
//
// Exit status: 0 done (also when nothing is named); 1 the policy cannot be used, or something it
// names could not be removed; 2 wrong command line, or MOUNT is not a mount point.
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <fnmatch.h>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace {

constexpr const char *POLICY_FILE = "/etc/telvzmnd/cleanup.policy";

constexpr int STATUS_FINE = 0;
constexpr int STATUS_INCOMPLETE = 1;
constexpr int STATUS_USAGE = 2;

// A policy larger than this is a mistake, not a policy.
constexpr size_t MAX_POLICY_BYTES = 1 << 20;
constexpr unsigned long MAX_DAYS = 100000;
// Directories nested deeper than this are left alone; each level holds one descriptor open.
constexpr int MAX_DEPTH = 128;
// At most this many removed paths are printed, one a line, and beyond them only their number: the
// monitor traces every line this program prints.
constexpr unsigned long MAX_LISTED = 100;

// One policy line: MOUNT DIRECTORY DAYS PATTERN.
struct policy_entry {
    std::string mount;
    std::string directory;
    unsigned long days = 0;
    std::string pattern;
};

struct counts {
    unsigned long files = 0;
    unsigned long directories = 0;
    unsigned long failures = 0;
};

struct walk_settings {
    dev_t device;
    time_t cutoff; // files last modified before this time are old enough
    const std::string *pattern;
    bool dry_run;
};

std::string printable(std::string_view text) {
    static constexpr char HEX[] = "0123456789abcdef";
    std::string shown;
    for (char c : text) {
        auto byte = static_cast<unsigned char>(c);
        if (byte >= 0x20 && byte < 0x7f && byte != '\\') {
            shown += c;
        } else {
            shown += "\\x";
            shown += HEX[byte >> 4];
            shown += HEX[byte & 0xf];
        }
    }
    return shown;
}

void complain(const std::string &message) {
    std::fprintf(stderr, "cleanupPartition: %s\n", message.c_str());
}

std::string failed(const std::string &what, const std::string &path) {
    return what + " " + printable(path) + ": " + std::strerror(errno);
}

std::string joined(const std::string &directory, std::string_view name) {
    return directory == "/" ? "/" + std::string(name) : directory + "/" + std::string(name);
}

class descriptor {
  public:
    explicit descriptor(int fd = -1) : fd_(fd) {}
    descriptor(const descriptor &) = delete;
    descriptor &operator=(const descriptor &) = delete;
    descriptor(descriptor &&other) noexcept : fd_(other.fd_) { other.fd_ = -1; }
    descriptor &operator=(descriptor &&other) noexcept {
        std::swap(fd_, other.fd_);
        return *this;
    }
    ~descriptor() {
        if (fd_ >= 0) {
            close(fd_);
        }
    }
    int get() const { return fd_; }
    bool valid() const { return fd_ >= 0; }

  private:
    int fd_;
};

descriptor open_directory_at(int parent, const char *name) {
    return descriptor(openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
}

// The path without trailing slashes ("/var/" is /var, "//" is /), when it is absolute and has no
// empty, "." or ".." component; empty otherwise.
std::string normal_absolute_path(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') {
        path.remove_suffix(1);
    }
    if (path.empty() || path.front() != '/') {
        return "";
    }
    if (path == "/") {
        return "/";
    }
    for (size_t start = 1; start <= path.size();) {
        size_t end = std::min(path.find('/', start), path.size());
        std::string_view component = path.substr(start, end - start);
        if (component.empty() || component == "." || component == "..") {
            return "";
        }
        start = end + 1;
    }
    return std::string(path);
}

std::vector<std::string> components_of(std::string_view path) {
    std::vector<std::string> components;
    for (size_t start = 0; start < path.size();) {
        size_t end = std::min(path.find('/', start), path.size());
        if (end > start) {
            components.emplace_back(path.substr(start, end - start));
        }
        start = end + 1;
    }
    return components;
}

// Whether the open directory is the root of a mount: the kernel says so, or, where it cannot,
// its parent lies on another device or is itself (the root of the tree).
bool is_mount_root(int fd) {
    struct statx attributes {};
    if (statx(fd, "", AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS, &attributes) == 0 &&
        (attributes.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) != 0) {
        return (attributes.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0;
    }
    struct stat self {};
    struct stat parent {};
    if (fstat(fd, &self) != 0 || fstatat(fd, "..", &parent, AT_SYMLINK_NOFOLLOW) != 0) {
        return false;
    }
    return self.st_dev != parent.st_dev || self.st_ino == parent.st_ino;
}

// The names in the open directory, sorted, so that what is printed follows the same order each run.
bool names_in(int directory_fd, std::vector<std::string> *names) {
    int reader = dup(directory_fd);
    DIR *listing = reader >= 0 ? fdopendir(reader) : nullptr;
    if (listing == nullptr) {
        if (reader >= 0) {
            close(reader);
        }
        return false;
    }
    rewinddir(listing);
    errno = 0;
    while (const dirent *entry = readdir(listing)) {
        std::string_view name = entry->d_name;
        if (name != "." && name != "..") {
            names->emplace_back(name);
        }
        errno = 0;
    }
    int error = errno;
    closedir(listing);
    std::sort(names->begin(), names->end());
    errno = error;
    return error == 0;
}

class cleaner {
  public:
    cleaner(const walk_settings &settings, counts *removed)
        : settings_(settings), removed_(removed) {}

    // Removes what the entry names under the open directory `path`; true when the directory holds
    // nothing any more (or would hold nothing, in a dry run).
    bool clean(int directory_fd, const std::string &path, int depth) {
        std::vector<std::string> names;
        if (!names_in(directory_fd, &names)) {
            complain(failed("cannot read", path));
            ++removed_->failures;
            return false;
        }
        bool emptied = true;
        for (const std::string &name : names) {
            if (!clean_entry(directory_fd, path, name, depth)) {
                emptied = false;
            }
        }
        return emptied;
    }

  private:
    // True when the entry is gone (or would be).
    bool clean_entry(int directory_fd, const std::string &directory, const std::string &name,
                     int depth) {
        std::string path = joined(directory, name);
        struct stat entry {};
        if (fstatat(directory_fd, name.c_str(), &entry, AT_SYMLINK_NOFOLLOW) != 0) {
            return errno == ENOENT;
        }
        if (entry.st_dev != settings_.device) {
            return false;
        }
        if (S_ISDIR(entry.st_mode)) {
            return clean_directory(directory_fd, path, name, entry, depth);
        }
        if (!S_ISREG(entry.st_mode) || entry.st_mtime >= settings_.cutoff ||
            fnmatch(settings_.pattern->c_str(), name.c_str(), FNM_PERIOD) != 0) {
            return false;
        }
        if (!settings_.dry_run && unlinkat(directory_fd, name.c_str(), 0) != 0) {
            complain(failed("cannot remove", path));
            ++removed_->failures;
            return false;
        }
        report(path, "");
        ++removed_->files;
        return true;
    }

    bool clean_directory(int parent_fd, const std::string &path, const std::string &name,
                         const struct stat &seen, int depth) {
        if (depth >= MAX_DEPTH) {
            complain("not entered, nested too deep: " + printable(path));
            return false;
        }
        descriptor directory = open_directory_at(parent_fd, name.c_str());
        struct stat opened {};
        if (!directory.valid() || fstat(directory.get(), &opened) != 0 ||
            opened.st_dev != seen.st_dev || opened.st_ino != seen.st_ino ||
            is_mount_root(directory.get())) {
            // Replaced since it was looked at, or another mount: not this walk's to touch.
            return false;
        }
        counts before = *removed_;
        bool emptied = clean(directory.get(), path, depth + 1);
        bool removed_inside =
            removed_->files != before.files || removed_->directories != before.directories;
        if (!emptied || !removed_inside) {
            return false;
        }
        struct stat now {};
        if (fstatat(parent_fd, name.c_str(), &now, AT_SYMLINK_NOFOLLOW) != 0 ||
            now.st_ino != seen.st_ino || now.st_dev != seen.st_dev) {
            return false;
        }
        if (!settings_.dry_run && unlinkat(parent_fd, name.c_str(), AT_REMOVEDIR) != 0) {
            complain(failed("cannot remove the directory", path));
            ++removed_->failures;
            return false;
        }
        report(path, "directory ");
        ++removed_->directories;
        return true;
    }

    void report(const std::string &path, const char *kind) {
        if (removed_->files + removed_->directories < MAX_LISTED) {
            std::printf("%s %s%s\n", settings_.dry_run ? "would remove" : "removed", kind,
                        printable(path).c_str());
        }
    }

    walk_settings settings_;
    counts *removed_;
};

// Why the policy line is not one, or empty when it is.
std::string parse_entry(std::string_view line, policy_entry *entry) {
    std::vector<std::string> fields;
    for (size_t start = 0; start < line.size();) {
        size_t end = line.find_first_of(" \t", start);
        if (end == std::string_view::npos) {
            end = line.size();
        }
        if (end > start) {
            fields.emplace_back(line.substr(start, end - start));
        }
        start = end + 1;
    }
    if (fields.size() != 4) {
        return "wants four fields, MOUNT DIRECTORY DAYS PATTERN, and has " +
               std::to_string(fields.size());
    }
    entry->mount = normal_absolute_path(fields[0]);
    if (entry->mount.empty()) {
        return "the mount point \"" + printable(fields[0]) +
               "\" is not an absolute path without \".\" or \"..\"";
    }
    entry->directory = normal_absolute_path(fields[1]);
    if (entry->directory.empty()) {
        return "the directory \"" + printable(fields[1]) +
               "\" is not an absolute path without \".\" or \"..\"";
    }
    if (entry->mount != "/" && entry->directory != entry->mount &&
        !entry->directory.starts_with(entry->mount + "/")) {
        return "the directory " + printable(entry->directory) + " is not inside " +
               printable(entry->mount);
    }
    const std::string &days = fields[2];
    if (days.size() > 6 ||
        !std::all_of(days.begin(), days.end(), [](char c) { return c >= '0' && c <= '9'; }) ||
        std::strtoul(days.c_str(), nullptr, 10) > MAX_DAYS) {
        return "the days \"" + printable(days) + "\" are not a whole number from 0 to " +
               std::to_string(MAX_DAYS);
    }
    entry->days = std::strtoul(days.c_str(), nullptr, 10);
    entry->pattern = fields[3];
    if (entry->pattern.find('/') != std::string::npos) {
        return "the pattern \"" + printable(entry->pattern) + "\" matches names, so has no \"/\"";
    }
    return "";
}

// Why a policy file with these attributes may not steer a program with root rights; empty when
// it may.
std::string unsafe_owner(const struct stat &attributes) {
    if (attributes.st_uid != 0) {
        return "does not belong to root";
    }
    if ((attributes.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        return "is writable by others than root";
    }
    return "";
}

enum class policy_state { read, missing, unusable };

policy_state read_policy(const std::string &path, std::vector<policy_entry> *entries) {
    size_t slash = path.rfind('/');
    std::string folder = slash == 0 ? "/" : path.substr(0, slash);
    std::string name = path.substr(slash + 1);
    descriptor directory(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    struct stat attributes {};
    if (!directory.valid() || fstat(directory.get(), &attributes) != 0) {
        if (errno == ENOENT) {
            return policy_state::missing;
        }
        complain(failed("cannot open the folder of the policy", folder));
        return policy_state::unusable;
    }
    if (std::string why = unsafe_owner(attributes); !why.empty()) {
        complain("the folder of the policy, " + printable(folder) + ", " + why);
        return policy_state::unusable;
    }
    // O_NONBLOCK: a FIFO in its place must not hold the program up; a regular file reads the same.
    descriptor file(
        openat(directory.get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (!file.valid() || fstat(file.get(), &attributes) != 0) {
        if (errno == ENOENT) {
            return policy_state::missing;
        }
        complain(failed("cannot open the policy", path));
        return policy_state::unusable;
    }
    if (!S_ISREG(attributes.st_mode)) {
        complain("the policy " + printable(path) + " is not a regular file");
        return policy_state::unusable;
    }
    if (std::string why = unsafe_owner(attributes); !why.empty()) {
        complain("the policy " + printable(path) + " " + why);
        return policy_state::unusable;
    }
    if (static_cast<unsigned long long>(attributes.st_size) > MAX_POLICY_BYTES) {
        complain("the policy " + printable(path) + " is larger than " +
                 std::to_string(MAX_POLICY_BYTES) + " bytes");
        return policy_state::unusable;
    }
    std::string text;
    char buffer[4096];
    ssize_t length;
    while ((length = read(file.get(), buffer, sizeof buffer)) > 0 &&
           text.size() <= MAX_POLICY_BYTES) {
        text.append(buffer, static_cast<size_t>(length));
    }
    if (length < 0 || text.size() > MAX_POLICY_BYTES) {
        complain(length < 0 ? failed("cannot read the policy", path)
                            : "the policy " + printable(path) + " grew while it was read");
        return policy_state::unusable;
    }
    unsigned line_number = 0;
    for (size_t start = 0; start < text.size();) {
        size_t end = std::min(text.find('\n', start), text.size());
        std::string_view line = std::string_view(text).substr(start, end - start);
        start = end + 1;
        ++line_number;
        size_t first = line.find_first_not_of(" \t\r");
        if (first == std::string_view::npos || line[first] == '#') {
            continue;
        }
        if (line.back() == '\r') {
            line.remove_suffix(1);
        }
        policy_entry entry;
        if (std::string why = parse_entry(line, &entry); !why.empty()) {
            complain("the policy " + printable(path) + ", line " + std::to_string(line_number) +
                     ": " + why);
            return policy_state::unusable;
        }
        entries->push_back(std::move(entry));
    }
    return policy_state::read;
}

const char *policy_path() {
#ifdef CLEANUP_POLICY_VARIABLE
    // Only the tests' own build of this program takes its policy from where a test says.
    const char *chosen = std::getenv(CLEANUP_POLICY_VARIABLE);
    if (chosen != nullptr && chosen[0] == '/') {
        return chosen;
    }
#endif
    return POLICY_FILE;
}

// Opens the directory `path` below the open directory `base` (whose path is `base_path`) one
// component at a time, never following a symbolic link. With `device` given, it never enters
// another file system or another mount either (errno EXDEV). An invalid descriptor, with errno
// set, when that fails.
descriptor open_below(int base, const std::string &base_path, const std::string &path,
                      const dev_t *device) {
    std::string rest = base_path == "/" ? path : path.substr(base_path.size());
    descriptor current(dup(base));
    for (const std::string &component : components_of(rest)) {
        if (!current.valid()) {
            break;
        }
        descriptor next = open_directory_at(current.get(), component.c_str());
        struct stat attributes {};
        if (!next.valid() || fstat(next.get(), &attributes) != 0) {
            return descriptor();
        }
        if (device != nullptr && (attributes.st_dev != *device || is_mount_root(next.get()))) {
            errno = EXDEV;
            return descriptor();
        }
        current = std::move(next);
    }
    return current;
}

std::string counted(unsigned long number, const char *one, const char *many) {
    return std::to_string(number) + " " + (number == 1 ? one : many);
}

// Cleans what one policy line names, counting what it removed and what it could not.
void apply(const policy_entry &entry, int mount_fd, dev_t device, time_t now, bool dry_run,
           counts *removed) {
    descriptor directory = open_below(mount_fd, entry.mount, entry.directory, &device);
    if (!directory.valid()) {
        std::string shown = printable(entry.directory);
        if (errno == ENOENT) {
            std::printf("cleanupPartition: %s does not exist: nothing to remove there\n",
                        shown.c_str());
        } else if (errno == EXDEV) {
            std::printf("cleanupPartition: %s is not on the file system of %s: skipped\n",
                        shown.c_str(), printable(entry.mount).c_str());
        } else if (errno == ELOOP || errno == ENOTDIR) {
            std::printf("cleanupPartition: %s is not a directory (a symbolic link or a file is on "
                        "its path): skipped\n",
                        shown.c_str());
        } else {
            complain(failed("cannot open", entry.directory));
            ++removed->failures;
        }
        return;
    }
    time_t age = static_cast<time_t>(entry.days) * 86400;
    walk_settings settings{device, now - age, &entry.pattern, dry_run};
    cleaner(settings, removed).clean(directory.get(), entry.directory, 0);
}

int usage() {
    complain("usage: cleanupPartition [--dry-run] MOUNT");
    return STATUS_USAGE;
}

} // namespace

int main(int argc, char **argv) {
    bool dry_run = false;
    const char *argument = nullptr;
    for (int index = 1; index < argc; ++index) {
        std::string_view word = argv[index];
        if (word == "--dry-run" && argument == nullptr) {
            dry_run = true;
        } else if (word.starts_with("-") || argument != nullptr) {
            return usage();
        } else {
            argument = argv[index];
        }
    }
    if (argument == nullptr) {
        return usage();
    }
    std::string mount = normal_absolute_path(argument);
    if (mount.empty()) {
        complain("the mount point \"" + printable(argument) +
                 "\" is not an absolute path without \".\" or \"..\"");
        return STATUS_USAGE;
    }
    descriptor root(open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    descriptor mounted = open_below(root.get(), "/", mount, nullptr);
    struct stat attributes {};
    if (!mounted.valid() || fstat(mounted.get(), &attributes) != 0) {
        complain(errno == ELOOP || errno == ENOTDIR
                     ? printable(mount) + " is not a directory (a symbolic link or a file is on "
                                          "its path)"
                     : failed("cannot open", mount));
        return STATUS_USAGE;
    }
    if (!is_mount_root(mounted.get())) {
        complain(printable(mount) + " is not a mount point");
        return STATUS_USAGE;
    }

    std::string policy = policy_path();
    std::vector<policy_entry> entries;
    switch (read_policy(policy, &entries)) {
    case policy_state::missing:
        std::printf("cleanupPartition: no clean-up policy at %s: nothing removed from %s\n",
                    printable(policy).c_str(), printable(mount).c_str());
        return STATUS_FINE;
    case policy_state::unusable:
        std::printf("cleanupPartition: the clean-up policy cannot be used: nothing removed from "
                    "%s\n",
                    printable(mount).c_str());
        return STATUS_INCOMPLETE;
    case policy_state::read:
        break;
    }
    std::erase_if(entries, [&](const policy_entry &entry) { return entry.mount != mount; });
    if (entries.empty()) {
        std::printf("cleanupPartition: the clean-up policy at %s names nothing on %s: nothing "
                    "removed\n",
                    printable(policy).c_str(), printable(mount).c_str());
        return STATUS_FINE;
    }

    counts removed;
    time_t now = std::time(nullptr);
    for (const policy_entry &entry : entries) {
        apply(entry, mounted.get(), attributes.st_dev, now, dry_run, &removed);
    }
    std::string summary = std::string(dry_run ? "would remove " : "removed ") +
                          counted(removed.files, "file", "files") + " and " +
                          counted(removed.directories, "directory", "directories") + " from " +
                          printable(mount);
    if (removed.files + removed.directories > MAX_LISTED) {
        summary += ", the first " + std::to_string(MAX_LISTED) + " listed above";
    }
    std::printf("cleanupPartition: %s\n", summary.c_str());
    return removed.failures == 0 ? STATUS_FINE : STATUS_INCOMPLETE;
}

#include "trace_file.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <pthread.h>
#include <set>
#include <string>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include "environment.h"
#include "io.h"
#include "stamp.h"

namespace telv::trace {
namespace {

// What the writers of one trace file share, in the file ".<name>.lock" beside it that each maps.
struct Shared {
    uint64_t layout;      // LAYOUT once made; a file that says anything else is left alone
    pthread_mutex_t lock; // robust: a writer that dies holding it stops no one
    // Counts the files begun at the path: a writer whose file is of an older count opens the
    // path again before it writes.
    uint64_t generation;
    uint64_t size; // of the current file, kept by its writers
};
constexpr uint64_t LAYOUT = 0x54454c5654524331u ^ sizeof(Shared); // "TELVTRC1"

bool same_file(const struct stat &a, const struct stat &b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// flock, which a signal while waiting is no reason to give up.
bool lock_file(int fd) {
    int result;
    while ((result = ::flock(fd, LOCK_EX)) != 0 && errno == EINTR) {
    }
    return result == 0;
}

class FileLock {
  public:
    explicit FileLock(int fd) : fd_(fd), held_(lock_file(fd)) {}
    ~FileLock() {
        if (held_) {
            ::flock(fd_, LOCK_UN);
        }
    }
    FileLock(const FileLock &) = delete;
    FileLock &operator=(const FileLock &) = delete;
    bool held() const { return held_; }

  private:
    int fd_;
    bool held_;
};

// The shared state of a trace file, mapped for as long as the file is written through its path.
class SharedFile {
  public:
    SharedFile() = default;
    SharedFile(const SharedFile &) = delete;
    SharedFile &operator=(const SharedFile &) = delete;
    ~SharedFile() { release(); }

    Shared *get() const { return shared_; }

    // Maps the state of the trace file at `trace_path`, making it when it is missing with the
    // trace file's own access (`mode`), so that whoever may write the one may share the other.
    bool attach(const std::string &trace_path, mode_t mode) {
        release();
        size_t name = trace_path.rfind('/') + 1; // 0 when there is no '/'
        path_ = trace_path.substr(0, name) + "." + trace_path.substr(name) + ".lock";
        int fd = ::open(path_.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, mode);
        if (fd >= 0) {
            map(fd, mode);
            ::close(fd);
        }
        return shared_ != nullptr;
    }

    void release() {
        if (shared_ != nullptr) {
            ::munmap(shared_, sizeof(Shared));
        }
        shared_ = nullptr;
    }

    // Whether the name of the state still names the file mapped: one made anew by someone else
    // would part its writers from ours.
    bool still_named() const {
        struct stat named;
        return ::lstat(path_.c_str(), &named) == 0 && same_file(named, identity_);
    }

  private:
    // Under flock, so that one writer makes the state and the others find it made.
    void map(int fd, mode_t mode) {
        FileLock made_by_one(fd);
        struct stat st;
        if (!made_by_one.held() || ::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) ||
            (st.st_size < static_cast<off_t>(sizeof(Shared)) &&
             ::ftruncate(fd, sizeof(Shared)) != 0)) {
            return;
        }
        void *mapped = ::mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
        if (mapped == MAP_FAILED) {
            return;
        }
        shared_ = static_cast<Shared *>(mapped);
        identity_ = st;
        if (shared_->layout == 0 && lay_out(shared_)) {
            ::fchmod(fd, mode); // the umask may have taken from it
        }
        if (shared_->layout != LAYOUT) {
            release();
        }
    }

    static bool lay_out(Shared *shared) {
        pthread_mutexattr_t attributes;
        if (::pthread_mutexattr_init(&attributes) != 0) {
            return false;
        }
        bool made = ::pthread_mutexattr_setpshared(&attributes, PTHREAD_PROCESS_SHARED) == 0 &&
                    ::pthread_mutexattr_setrobust(&attributes, PTHREAD_MUTEX_ROBUST) == 0 &&
                    ::pthread_mutex_init(&shared->lock, &attributes) == 0;
        ::pthread_mutexattr_destroy(&attributes);
        if (made) {
            shared->generation = 0;
            shared->size = 0;
            shared->layout = LAYOUT;
        }
        return made;
    }

    std::string path_;
    Shared *shared_ = nullptr;
    struct stat identity_ {};
};

// The open trace file. One lock keeps the lines of the threads apart; the shared lock of the file,
// or flock on it, keeps the processes that share it apart, and O_APPEND puts every line at its end.
struct Sink {
    std::mutex lock;
    std::string path;
    int fd = -1;
    pid_t owner = 0; // a forked child opens its own: flock is shared with the opener's description
    SharedFile shared;
    bool tried_to_share = false; // since the file was opened
    // Since the last look at the file and its path, under the round's lock: the file is the one
    // the path names, and by then the shared state counted `generation` files at the path.
    bool looked = false;
    uint64_t generation = 0;
    uint32_t lines_since_look = 0;
    int64_t looked_at_ms = 0;
    // Paths already said in the trace to be past their bound and not rotated: once a process is
    // enough (a forked child inherits what its parent has said).
    std::set<std::string> said_unrotated;
    // Detail lines waiting to be written together, composed, with the target they were traced to.
    char waiting[WAITING_BYTES];
    size_t waiting_length = 0;
    int64_t waiting_since_ms = 0;
    std::string waiting_file;
    std::string waiting_data_directory;
    uint64_t waiting_max_bytes = 0;
};

// Made as the library loads, as is all that is made once here: a fork that came while another
// thread was making it would leave the child waiting for it for ever. Never destroyed: the leak
// report written while the process exits still traces.
Sink *const sink = new Sink;

// A child forked while another thread is inside a line would find the lock held for ever; the
// fork waits for the line instead.
// The child leaves the lines still waiting to its parent, which writes them.
[[maybe_unused]] const bool lines_end_before_a_fork =
    ::pthread_atfork([] { sink->lock.lock(); }, [] { sink->lock.unlock(); },
                     [] {
                         sink->waiting_length = 0;
                         sink->lock.unlock();
                     }) == 0;

void close_sink(Sink &s) {
    if (s.fd >= 0) {
        ::close(s.fd);
    }
    s.fd = -1;
}

// Where this line goes and under which rules, as the environment says now.
struct Target {
    std::string_view file;           // TELV_TRACE_FILE; empty for the default file
    std::string_view data_directory; // where the default file lies
    uint64_t max_bytes;
    bool detail;

    bool in_data_directory() const { return file.empty(); }

    std::string path() const {
        return in_data_directory() ? std::string(data_directory) + "/" + DEFAULT_FILE_NAME
                                   : std::string(file);
    }

    // The same as path() == `path`, without making a string for every line.
    bool is(std::string_view path) const {
        if (!in_data_directory()) {
            return path == file;
        }
        std::string_view name = DEFAULT_FILE_NAME;
        return path.size() == data_directory.size() + 1 + name.size() &&
               path.starts_with(data_directory) && path[data_directory.size()] == '/' &&
               path.ends_with(name);
    }
};

// The most that waits to be written at once: no more than the bound, so that a file rotated for
// the lines waiting takes them whole.
size_t batch_bytes(const Target &target) {
    return static_cast<size_t>(std::min<uint64_t>(WAITING_BYTES, target.max_bytes));
}

constexpr const char *TARGET_VARIABLES[] = {FILE_VARIABLE, environment::DATA_DIR_VARIABLE,
                                            MAX_BYTES_VARIABLE, DETAIL_VARIABLE};

// The environment as the calling thread last looked at it: each thread keeps its own, so that
// looking takes no lock. A thread's watch goes when the thread ends; the main thread's stays
// while the process exits, when the leak report still writes lines.
thread_local environment::Watch *this_threads_watch = nullptr;

void end_watch(void *watch) {
    delete static_cast<environment::Watch *>(watch);
    this_threads_watch = nullptr;
}

pthread_key_t watch_ending;
const bool watch_keyed = ::pthread_key_create(&watch_ending, end_watch) == 0;

// Once the platform is unloaded, no thread that ends may call into it: the watches still held are
// left to the process.
__attribute__((destructor)) void stop_ending_watches() {
    if (watch_keyed) {
        ::pthread_key_delete(watch_ending);
    }
}

environment::Watch &thread_watch() {
    if (this_threads_watch == nullptr) {
        this_threads_watch = new environment::Watch(TARGET_VARIABLES);
        if (watch_keyed) {
            ::pthread_setspecific(watch_ending, this_threads_watch);
        }
    }
    return *this_threads_watch;
}

// Read anew for every line, so that a change of the environment takes effect at once.
Target current_target() {
    environment::Watch &watch = thread_watch();
    watch.refresh();
    auto text = [&](size_t which, const char *fallback) {
        const char *value = watch.value(which);
        return std::string_view(value != nullptr && value[0] != '\0' ? value : fallback);
    };
    return Target{text(0, ""), text(1, environment::DEFAULT_DATA_DIR),
                  environment::number_of(watch.value(2), DEFAULT_MAX_BYTES), text(3, "1") != "0"};
}

// Opens the target for appending in place of the sink's file. The former file stays open until
// the new one is, so that no new file can take over its inode number and the two can be told
// apart: when `must_change` (the former was just renamed away), a path that opens the former file
// again is refused, since then nothing has moved on and another round would find the same again.
bool open_sink(Sink &s, const Target &target, pid_t pid, bool must_change) {
    std::string path = target.path();
    if (target.in_data_directory()) {
        environment::data_directory();
    }
    int fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    struct stat opened;
    struct stat former;
    bool same = fd >= 0 && must_change && s.fd >= 0 && ::fstat(fd, &opened) == 0 &&
                ::fstat(s.fd, &former) == 0 && same_file(opened, former);
    close_sink(s);
    if (path != s.path || pid != s.owner) {
        s.shared.release();
    }
    s.path = std::move(path);
    s.owner = pid;
    s.tried_to_share = false;
    s.looked = false;
    if (fd >= 0 && same) {
        ::close(fd);
        fd = -1;
    }
    s.fd = fd;
    return fd >= 0;
}

// Keeps the other writers of the file out for one round: the shared lock when the file has one,
// else flock on the file.
class RoundLock {
  public:
    explicit RoundLock(Sink &s) {
        if (Shared *shared = s.shared.get()) {
            int result = ::pthread_mutex_lock(&shared->lock);
            if (result == EOWNERDEAD) {
                // Its last holder died inside a round: the size it left may be short.
                ::pthread_mutex_consistent(&shared->lock);
                s.looked = false;
                result = 0;
            }
            if (result == 0) {
                mutex_ = &shared->lock;
                return;
            }
            // A lock that cannot be had at all leaves the file to flock, as if it were not shared.
            s.shared.release();
        }
        if (lock_file(s.fd)) {
            file_ = s.fd;
        }
    }
    ~RoundLock() {
        if (mutex_ != nullptr) {
            ::pthread_mutex_unlock(mutex_);
        }
        if (file_ >= 0) {
            ::flock(file_, LOCK_UN);
        }
    }
    RoundLock(const RoundLock &) = delete;
    RoundLock &operator=(const RoundLock &) = delete;
    bool held() const { return mutex_ != nullptr || file_ >= 0; }

  private:
    pthread_mutex_t *mutex_ = nullptr;
    int file_ = -1; // flocked
};

// How the path leads to the open file, looked at under the round's lock.
enum class Reach {
    directly,  // the path is the regular file's own name: the file is rotated when full
    unrotated, // the path leads to the file some other way, through a symbolic link (renaming
               // would move the link, not the trace) or as a device or FIFO: never rotated
    elsewhere, // the path names another file now: this one was renamed away, or removed
};

Reach reach(const std::string &path, const struct stat &open_file) {
    // Only a regular file is ever rotated, so only one can have been renamed away. A device node
    // may open another device than itself (/dev/tty opens the terminal), so it is not compared.
    if (!S_ISREG(open_file.st_mode)) {
        return Reach::unrotated;
    }
    struct stat named;
    if (::lstat(path.c_str(), &named) == 0 && S_ISREG(named.st_mode)) {
        return same_file(named, open_file) ? Reach::directly : Reach::elsewhere;
    }
    return ::stat(path.c_str(), &named) == 0 && same_file(named, open_file) ? Reach::unrotated
                                                                            : Reach::elsewhere;
}

// Whether the round must look at the file and its path before it writes: always without shared
// state; with it, when the line would take the file past its bound by the size its writers kept,
// and every so often for what only the file system can tell.
bool look_due(const Sink &s, const Target &target, int64_t now_ms, size_t length) {
    const Shared *shared = s.shared.get();
    if (shared == nullptr || !s.looked) {
        return true;
    }
    bool full = shared->size > 0 && shared->size + length > target.max_bytes;
    return full || s.lines_since_look >= LOOK_EVERY_LINES || now_ms < s.looked_at_ms ||
           now_ms - s.looked_at_ms >= LOOK_EVERY_MS;
}

// What a round does once it holds its lock.
enum class Step {
    write,
    write_past_bound, // into a full file that is not rotated
    reopen,           // the shared state counts a newer file at the path than the sink's
    reopen_renamed,   // the sink's file was renamed away, here or elsewhere, or removed
    share,            // the file is shared from now on: again, under the shared lock
    unshare,          // the shared state no longer serves the path: again, without it
    failed,
};

Step look(Sink &s, const Target &target, int64_t now_ms, size_t length) {
    Shared *shared = s.shared.get();
    if (shared != nullptr && s.looked && shared->generation != s.generation) {
        return Step::reopen;
    }
    if (!look_due(s, target, now_ms, length)) {
        return Step::write;
    }
    struct stat open_file;
    if (::fstat(s.fd, &open_file) != 0) {
        return Step::failed;
    }
    Reach how = reach(s.path, open_file);
    if (shared == nullptr && how == Reach::directly && !s.tried_to_share) {
        // This round holds only flock, which the writers already sharing do not take.
        s.tried_to_share = true;
        if (s.shared.attach(s.path, open_file.st_mode & 0666)) {
            s.looked = false;
            return Step::share;
        }
    }
    if (shared != nullptr && (how == Reach::unrotated || !s.shared.still_named())) {
        s.tried_to_share = false;
        return Step::unshare;
    }
    auto size = static_cast<uint64_t>(open_file.st_size);
    bool full = how != Reach::elsewhere && size > 0 && size + length > target.max_bytes;
    if (how == Reach::elsewhere || (full && how == Reach::directly)) {
        if (how == Reach::directly && ::rename(s.path.c_str(), (s.path + ".1").c_str()) != 0) {
            return Step::failed;
        }
        // The writers holding the file follow at their next line; one more count than needed
        // costs the others a look, one less would leave them writing to it.
        if (shared != nullptr) {
            ++shared->generation;
        }
        return Step::reopen_renamed;
    }
    if (shared != nullptr) {
        shared->size = size;
        s.generation = shared->generation;
    }
    s.looked = true;
    s.lines_since_look = 0;
    s.looked_at_ms = now_ms;
    return full ? Step::write_past_bound : Step::write;
}

// What became of a line.
enum class Outcome {
    written,
    written_past_bound,
    failed,
};

// Appends one composed line, first moving a file that it would take past the bound to
// "<name>.1". Another process rotating the file under us loses no line: the path is opened again
// and the line goes to the new file. Each such round follows a rename, here or elsewhere, so the
// loop moves on; a rename that moves nothing (the path opens the same file again) fails, and so
// does every failing open, lock or write.
Outcome append(Sink &s, const Target &target, int64_t now_ms, const char *line, size_t length) {
    pid_t pid = stamp::process_id();
    Step last = Step::write; // how the round before ended
    for (;;) {
        bool renamed = last == Step::reopen_renamed;
        if (renamed || last == Step::reopen || s.fd < 0 || s.owner != pid || !target.is(s.path)) {
            if (!open_sink(s, target, pid, renamed)) {
                return Outcome::failed;
            }
        }
        if (last == Step::unshare) {
            s.shared.release();
        }
        RoundLock round(s);
        if (!round.held()) {
            return Outcome::failed;
        }
        last = look(s, target, now_ms, length);
        if (last == Step::failed) {
            return Outcome::failed;
        }
        if (last == Step::write || last == Step::write_past_bound) {
            if (io::write_all(s.fd, line, length) != 0) {
                s.looked = false; // how much reached the file is not known
                return Outcome::failed;
            }
            if (Shared *shared = s.shared.get()) {
                shared->size += length;
            }
            ++s.lines_since_look;
            return last == Step::write ? Outcome::written : Outcome::written_past_bound;
        }
    }
}

// What snprintf left in `buffer` (`size` bytes): the text as far as it fits, nothing on failure.
std::string_view printed(const char *buffer, size_t size, int length) {
    return std::string_view(buffer,
                            length < 0 ? 0 : std::min(static_cast<size_t>(length), size - 1));
}

int64_t milliseconds_of(const struct timespec &time) {
    return static_cast<int64_t>(time.tv_sec) * 1000 + time.tv_nsec / 1000000;
}

bool emit(Sink &s, const Target &target, std::string_view text, bool may_wait);

// Appends composed lines, and says once when they went past the bound of a file that is not
// rotated: a reader who finds the file past its bound learns why. The note is a line past the
// bound too, but by then the path has been said.
bool write_out(Sink &s, const Target &target, int64_t now_ms, const char *lines, size_t length) {
    Outcome outcome = append(s, target, now_ms, lines, length);
    if (outcome == Outcome::written_past_bound && s.said_unrotated.insert(s.path).second) {
        char note[MAX_LINE];
        int note_length =
            std::snprintf(note, sizeof note,
                          "TELVTRCF: trace file %s is not a regular file: it is not rotated and "
                          "grows past its bound of %llu bytes",
                          s.path.c_str(), static_cast<unsigned long long>(target.max_bytes));
        emit(s, target, printed(note, sizeof note, note_length), false);
    }
    return outcome != Outcome::failed;
}

// Writes the lines waiting, if any, to the target they were traced to.
bool write_waiting(Sink &s, int64_t now_ms) {
    if (s.waiting_length == 0) {
        return true;
    }
    Target target{s.waiting_file, s.waiting_data_directory, s.waiting_max_bytes, true};
    size_t length = s.waiting_length;
    s.waiting_length = 0;
    return write_out(s, target, now_ms, s.waiting, length);
}

// Whether the lines waiting must be written before a line traced at `now_ms` to `target`: they
// were traced elsewhere, the line does not wait or would not fit with them, or they are old.
bool waiting_must_go(const Sink &s, const Target &target, int64_t now_ms, size_t length,
                     bool may_wait) {
    bool elsewhere = target.file != s.waiting_file ||
                     target.data_directory != s.waiting_data_directory ||
                     target.max_bytes != s.waiting_max_bytes;
    return s.waiting_length > 0 &&
           (!may_wait || elsewhere || s.waiting_length + length > batch_bytes(target) ||
            now_ms < s.waiting_since_ms || now_ms - s.waiting_since_ms >= WAIT_AT_MOST_MS);
}

// Stamps and composes one line, and appends it, or lets it wait with the lines before it when
// `may_wait`. The caller holds the sink's lock.
bool emit(Sink &s, const Target &target, std::string_view text, bool may_wait) {
    stamp::LineStamp stamp = stamp::line_stamp();
    int64_t now_ms = milliseconds_of(stamp.time);
    char line[MAX_LINE];
    size_t room = static_cast<size_t>(std::min<uint64_t>(sizeof line, target.max_bytes));
    size_t length = compose(line, room, std::string_view(stamp.text, stamp.length), text);
    if (waiting_must_go(s, target, now_ms, length, may_wait)) {
        write_waiting(s, now_ms); // lost when it fails; this line is still tried
    }
    if (!may_wait) {
        return write_out(s, target, now_ms, line, length);
    }
    if (s.waiting_length == 0) {
        s.waiting_since_ms = now_ms;
        s.waiting_file = target.file;
        s.waiting_data_directory = target.data_directory;
        s.waiting_max_bytes = target.max_bytes;
    }
    std::memcpy(s.waiting + s.waiting_length, line, length);
    s.waiting_length += length;
    return true;
}

// Where the next line end ('\n' or '\r') of `text` lies; its size when there is none.
size_t next_line_end(std::string_view text) {
    const void *feed = std::memchr(text.data(), '\n', text.size());
    const void *back = std::memchr(text.data(), '\r', text.size());
    const char *first = text.data() + text.size();
    for (const void *found : {feed, back}) {
        if (found != nullptr) {
            first = std::min(first, static_cast<const char *>(found));
        }
    }
    return static_cast<size_t>(first - text.data());
}

} // namespace

bool write_waiting_lines() {
    Sink &s = *sink;
    std::lock_guard guard(s.lock);
    return write_waiting(s, milliseconds_of(stamp::line_stamp().time));
}

namespace {
// The lines still waiting when the process ends, or the platform is unloaded, are written then.
__attribute__((destructor)) void write_waiting_at_exit() {
    write_waiting_lines();
}
} // namespace

bool is_detail(std::string_view text) {
    return text.size() >= 9 && text[7] == 'D' && text[8] == ':';
}

size_t compose(char *out, size_t room, std::string_view stamp, std::string_view text) {
    while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
        text.remove_suffix(1);
    }
    const size_t limit = room - 1; // the line feed always fits
    size_t used = std::min(stamp.size(), limit);
    std::memcpy(out, stamp.data(), used);
    while (!text.empty()) {
        size_t plain = next_line_end(text);
        size_t copied = std::min(plain, limit - used);
        std::memcpy(out + used, text.data(), copied);
        used += copied;
        // An escape is never cut in half.
        if (copied < plain || plain == text.size() || used + 2 > limit) {
            break;
        }
        out[used++] = '\\';
        out[used++] = text[plain] == '\n' ? 'n' : 'r';
        text.remove_prefix(plain + 1);
    }
    out[used++] = '\n';
    return used;
}

size_t dump_row(char *out, size_t room, uint32_t offset, const unsigned char *bytes, size_t count) {
    static constexpr char HEX[] = "0123456789ABCDEF";
    char row[128];
    size_t used = static_cast<size_t>(std::snprintf(row, sizeof row, "%08X  ", offset));
    count = std::min(count, DUMP_BYTES_PER_ROW);
    for (size_t i = 0; i < DUMP_BYTES_PER_ROW; ++i) {
        if (i == DUMP_BYTES_PER_ROW / 2) {
            row[used++] = ' ';
        }
        row[used++] = i < count ? HEX[bytes[i] >> 4] : ' ';
        row[used++] = i < count ? HEX[bytes[i] & 0xF] : ' ';
        row[used++] = ' ';
    }
    row[used++] = ' ';
    row[used++] = '|';
    for (size_t i = 0; i < count; ++i) {
        row[used++] = bytes[i] >= 0x20 && bytes[i] < 0x7F ? static_cast<char>(bytes[i]) : '.';
    }
    row[used++] = '|';
    used = std::min(used, room);
    std::memcpy(out, row, used);
    return used;
}

int vline(const char *format, va_list args) {
    if (format == nullptr) {
        return -1;
    }
    Target target = current_target();
    char text[MAX_LINE];
    int length = std::vsnprintf(text, sizeof text, format, args);
    if (length < 0) {
        return -1;
    }
    std::string_view kept(text, std::min(static_cast<size_t>(length), sizeof text - 1));
    if (!target.detail && is_detail(kept)) {
        return length;
    }
    Sink &s = *sink;
    std::lock_guard guard(s.lock);
    return emit(s, target, kept, is_detail(kept)) ? length : -1;
}

int line(const char *format, ...) {
    va_list args;
    va_start(args, format);
    int length = vline(format, args);
    va_end(args);
    return length;
}

int dump(const char *title, const void *data, uint32_t length) {
    std::string_view heading = title != nullptr ? title : "";
    Target target = current_target();
    if (!target.detail && is_detail(heading)) {
        return 0;
    }
    // The rows wait with their title, and a dump that is no detail goes out whole at its end.
    Sink &s = *sink;
    std::lock_guard guard(s.lock);
    bool written = emit(s, target, heading, true);
    const auto *bytes = static_cast<const unsigned char *>(data);
    // 64 bits: the offset of the row after the last one may pass 32 bits.
    for (uint64_t offset = 0; written && bytes != nullptr && offset < length;
         offset += DUMP_BYTES_PER_ROW) {
        char row[128];
        size_t count = std::min<uint64_t>(DUMP_BYTES_PER_ROW, length - offset);
        size_t row_length =
            dump_row(row, sizeof row, static_cast<uint32_t>(offset), bytes + offset, count);
        written = emit(s, target, std::string_view(row, row_length), true);
    }
    if (!is_detail(heading)) {
        written = write_waiting(s, milliseconds_of(stamp::line_stamp().time)) && written;
    }
    return written && (bytes != nullptr || length == 0) ? 0 : -1;
}

} // namespace telv::trace

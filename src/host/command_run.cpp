// tarnmon run: runs the monitor of the shared library libtelvzmnd.so, the file that the appliance
// loads, on a thread of this process over the default platform, until SIGINT, SIGTERM or a
// terminate request (tarnmon stop) ends it, or for one pass.
//
// Between its passes the monitor sleeps one second at a time through sleep() of the C library,
// which it reaches through the dynamic symbol. This executable defines sleep() and exports it, so
// that the library binds to this one: a wait on a condition variable that ends at once when the
// monitor is to stop. The loop then counts down the seconds left without the uptime moving, so it
// measures no overrun of its sleep, and the pass after the cut sleep sees the request and ends
// the loop. SIGINT and SIGTERM are blocked in every thread and read from a signalfd by the main
// thread, so that no handler ever interrupts the monitor, a snapshot write least of all.
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <link.h>
#include <mutex>
#include <poll.h>
#include <string>
#include <string_view>
#include <sys/eventfd.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/signalfd.h>
#include <sys/stat.h>
#include <system_error>
#include <thread>
#include <unistd.h>
#include <vector>

#include "commands.h"
#include "control_block_view.h"
#include "core/control_file.h"
#include "descriptor.h"
#include "linux/environment.h"
#include "metrics_file.h"
#include "snapshot_reader.h"

#ifdef __has_feature
#if __has_feature(address_sanitizer) || __has_feature(leak_sanitizer)
#define TARNMON_LEAK_CHECKED 1
#endif
#endif
#ifdef __SANITIZE_ADDRESS__
#define TARNMON_LEAK_CHECKED 1
#endif
#ifdef TARNMON_LEAK_CHECKED
#include <sanitizer/lsan_interface.h>
#endif

namespace {

constexpr const char *LIBRARY = "libtelvzmnd.so";
constexpr const char *APPLIANCE_PROGRAM = "runAsRoot"; // the one program the monitor finds on PATH
// Where tarnmon looks for the appliance programs, from its own directory: beside it in the build,
// and where the install puts them.
constexpr const char *OWN_LIBEXEC[] = {"libexec", TARN_INSTALLED_LIBEXEC};
constexpr const char *EVENT_LOG_VARIABLE = "TELV_EVENT_LOG";
constexpr const char *TRACE_FILE_VARIABLE = "TELV_TRACE_FILE";
constexpr const char *EVENT_LOG_NAME = "telvzmnd.events";
constexpr const char *TRACE_FILE_NAME = "telvzmnd.trace";
constexpr int32_t INTERVAL_MINIMUM = 5; // a shorter interval from the host is the default
constexpr int32_t INTERVAL_DEFAULT = 60;

using monitor_main = uint32_t (*)(int32_t, char **);
using terminate_call = void (*)();
using observe_call = void (*)(tarn_pass_observer, void *);

// ---- The sleep that a stop cuts short ----

// What the monitor's sleep shares with the thread that stops it.
struct sleep_gate {
    std::mutex lock;
    std::condition_variable woken;
    bool monitoring = false; // the monitor runs in this process: sleep() is its sleep
    bool stopping = false;   // SIGINT or SIGTERM came, and the terminate request was made
    bool request_checked = false;
    bool view_tried = false;
    // The block as the monitor's sleep sees it, attached at the first sleep, when the loop has its
    // block: a request from tarnmon stop also ends the sleep.
    control_block_view view;
    terminate_call terminate = nullptr;

    bool request_in_block() const {
        return view.block != nullptr && read_field(view.block->terminateRequest) == 1;
    }
    bool ending() const { return stopping || request_in_block(); }
};

sleep_gate &gate() {
    static sleep_gate the_gate;
    return the_gate;
}

// Asks the monitor to end after its pass and cuts its sleep short: the request comes first, so
// that the pass after the cut sleep sees it.
void stop_monitor(sleep_gate &g) {
    g.terminate();
    std::lock_guard hold(g.lock);
    g.stopping = true;
    g.woken.notify_all();
}

// ---- Options ----

// --interval: a whole number of seconds that fits the monitor's 32 bits; false when it is not.
bool read_interval(std::string_view text, int32_t *seconds) {
    if (text.empty() || text.size() > 10 ||
        text.find_first_not_of("0123456789") != std::string_view::npos) {
        return false;
    }
    int64_t value = 0;
    for (char digit : text) {
        value = value * 10 + (digit - '0');
    }
    if (value > INT32_MAX) {
        return false;
    }
    *seconds = static_cast<int32_t>(value);
    return true;
}

// ---- The data directory and the control file ----

// Makes `path` and its missing parents, mode 0755 less the umask, as the platform makes its data
// directory. 0, or the errno of the step that failed.
int make_directories(const std::string &path) {
    for (size_t at = path.find('/', 1);; at = path.find('/', at + 1)) {
        std::string part = path.substr(0, at);
        if (!part.empty() && ::mkdir(part.c_str(), 0755) != 0 && errno != EEXIST) {
            return errno;
        }
        if (at == std::string::npos) {
            break;
        }
    }
    struct stat st;
    if (::stat(path.c_str(), &st) != 0) {
        return errno;
    }
    return S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
}

std::string absolute(const char *path) {
    char *resolved = ::realpath(path, nullptr);
    std::string text = resolved != nullptr ? resolved : "";
    std::free(resolved);
    return text;
}

// The data directory for the monitor, made when missing and given to it (and to the appliance
// programs, which runAsRoot hands it only as an absolute path without "..") by its real path.
bool settle_data_directory(const command_line &line, std::string *directory) {
    const char *chosen = line.data_dir;
    if (chosen == nullptr) {
        chosen = std::getenv(telv::environment::DATA_DIR_VARIABLE);
    }
    if (chosen == nullptr || chosen[0] == '\0') {
        chosen = telv::environment::DEFAULT_DATA_DIR;
    }
    int error = make_directories(chosen);
    *directory = error == 0 ? absolute(chosen) : "";
    if (error == 0 && directory->empty()) {
        error = errno;
    }
    if (error != 0) {
        std::fprintf(stderr, "tarnmon: cannot make the data directory %s: %s\n",
                     terminal_text(chosen).c_str(), std::strerror(error));
        return false;
    }
    setenv(telv::environment::DATA_DIR_VARIABLE, directory->c_str(), 1);
    return true;
}

// The file of --config under the one name the monitor reads, "telvzopt.trm" in the data
// directory, for as long as the monitor runs: a symbolic link to it, so that the monitor reads
// exactly that file. A control file that the directory holds already is never replaced; the link
// is removed again when the monitor has ended, and only when it is still the one placed here.
class control_file_link {
  public:
    control_file_link() = default;
    control_file_link(const control_file_link &) = delete;
    control_file_link &operator=(const control_file_link &) = delete;
    ~control_file_link() {
        if (placed_.empty()) {
            return;
        }
        std::vector<char> target(placed_.size() + 2);
        ssize_t length = ::readlink(link_.c_str(), target.data(), target.size());
        if (length >= 0 &&
            std::string_view(target.data(), static_cast<size_t>(length)) == placed_) {
            ::unlink(link_.c_str());
        }
    }

    // EXIT_OK, or the exit status with the reason told on standard error.
    int place(const char *file, const std::string &directory) {
        std::string shown = terminal_text(file);
        std::string target = absolute(file);
        int error = errno;
        struct stat given;
        if (target.empty() || ::stat(target.c_str(), &given) != 0) {
            error = target.empty() ? error : errno;
            std::fprintf(stderr, "tarnmon: cannot find %s again: %s\n", shown.c_str(),
                         std::strerror(error));
            return EXIT_UNAVAILABLE;
        }
        std::string name = directory + "/" + CONTROL_FILE_NAME;
        struct stat present;
        if (::stat(name.c_str(), &present) == 0 && present.st_dev == given.st_dev &&
            present.st_ino == given.st_ino) {
            return EXIT_OK; // the monitor reads that very file already
        }
        if (::symlink(target.c_str(), name.c_str()) != 0) {
            if (errno == EEXIST) {
                std::fprintf(stderr,
                             "tarnmon: the data directory %s holds a control file of its own, %s, "
                             "which the monitor would read instead of %s: move it away, or leave "
                             "out --config to run with it\n",
                             terminal_text(directory).c_str(), CONTROL_FILE_NAME, shown.c_str());
            } else {
                std::fprintf(stderr, "tarnmon: cannot link %s into the data directory %s: %s\n",
                             shown.c_str(), terminal_text(directory).c_str(), std::strerror(errno));
            }
            return EXIT_UNAVAILABLE;
        }
        link_ = name;
        placed_ = target;
        return EXIT_OK;
    }

  private:
    std::string link_;
    std::string placed_;
};

// ---- Who else uses the control block ----

// A monitor started here creates the block afresh, removing whatever the key names: refuse while
// a process has the block attached (a running monitor, which would lose its block), or when the
// key names a segment of some other program. The first segment of a fresh IPC namespace gets id
// 0, and a monitor that finds a block of id 0 left by an earlier run takes it for a failure and
// does not run: a segment made and removed here takes id 0 while it is free, and a stale block of
// id 0, attached by nobody, is removed here as the monitor would remove it.
bool prepare_control_block_key() {
    int id = ::shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0);
    if (id == -1 && errno == ENOENT) {
        keep_block_off_id_zero();
        return true;
    }
    if (id == -1) {
        std::fprintf(stderr, "tarnmon: cannot reach the control block (key 0x%08x): %s\n",
                     TARN_CB_KEY, std::strerror(errno));
        return false;
    }
    shmid_ds info;
    if (::shmctl(id, IPC_STAT, &info) != 0) {
        std::fprintf(stderr, "tarnmon: cannot read the control block's size: %s\n",
                     std::strerror(errno));
        return false;
    }
    if (info.shm_segsz != TARN_CB_SIZE) {
        std::fprintf(stderr,
                     "tarnmon: the segment of key 0x%08x is not a control block: it has %zu "
                     "bytes, not %u; a monitor would remove it\n",
                     TARN_CB_KEY, static_cast<size_t>(info.shm_segsz), TARN_CB_SIZE);
        return false;
    }
    if (info.shm_nattch > 0) {
        std::fprintf(stderr,
                     "tarnmon: the control block (key 0x%08x) is attached by %lu process%s: a "
                     "monitor runs on this host (see tarnmon status); a second one would take "
                     "its block away\n",
                     TARN_CB_KEY, static_cast<unsigned long>(info.shm_nattch),
                     info.shm_nattch == 1 ? "" : "es");
        return false;
    }
    if (id == 0) {
        ::shmctl(id, IPC_RMID, nullptr);
    }
    return true;
}

// ---- The appliance programs ----

// The directory of this tarnmon's executable, as the kernel knows it.
std::string own_directory() {
    std::string path = absolute("/proc/self/exe");
    size_t slash = path.rfind('/');
    return slash == std::string::npos ? "" : path.substr(0, slash);
}

bool is_program(const std::string &path) {
    struct stat st;
    return ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) &&
           ::access(path.c_str(), X_OK) == 0;
}

// The file that a search of `path` finds for `name`, as posix_spawnp searches (an empty entry is
// the working directory); empty when none.
std::string find_on_path(std::string_view path, const char *name) {
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = std::min(path.find(':', start), path.size());
        std::string directory(path.substr(start, end - start));
        std::string candidate = (directory.empty() ? "." : directory) + "/" + name;
        if (is_program(candidate)) {
            return candidate;
        }
        start = end + 1;
    }
    return "";
}

// The PATH the C library searches when none is set.
std::string default_search_path() {
    size_t size = ::confstr(_CS_PATH, nullptr, 0);
    std::string text(size, '\0');
    if (size == 0 || ::confstr(_CS_PATH, text.data(), size) == 0) {
        return "/bin:/usr/bin";
    }
    text.resize(size - 1);
    return text;
}

// runAsRoot from the PATH tarnmon was given when it has one: an appliance's own programs, or an
// installed runAsRoot with its rights, stay in force. Otherwise the libexec directory of this
// build goes first on the monitor's PATH. Returns the runAsRoot the monitor will run, and why.
std::string settle_appliance_programs() {
    const char *given = std::getenv("PATH");
    std::string path = given != nullptr ? given : default_search_path();
    std::string found = find_on_path(path, APPLIANCE_PROGRAM);
    if (!found.empty()) {
        return terminal_text(found) + " (from PATH)";
    }
    std::string looked_in;
    for (const char *place : OWN_LIBEXEC) {
        std::string libexec = own_directory() + "/" + place;
        std::string own = libexec + "/" + APPLIANCE_PROGRAM;
        if (is_program(own)) {
            libexec = absolute(libexec.c_str()); // without the ".." of the installed layout
            own = libexec + "/" + APPLIANCE_PROGRAM;
            setenv("PATH", (libexec + ":" + path).c_str(), 1);
            return terminal_text(own) + " (this tarnmon's, put first on PATH)";
        }
        looked_in += (looked_in.empty() ? "" : " or ") + terminal_text(libexec);
    }
    std::fprintf(stderr,
                 "tarnmon: no %s on PATH, nor in %s: the monitor runs without the appliance "
                 "programs (no descriptor listing, no clean-up, no trace dump)\n",
                 APPLIANCE_PROGRAM, looked_in.c_str());
    return "none";
}

// ---- The library ----

struct monitor_library {
    monitor_main main = nullptr;
    terminate_call terminate = nullptr;
    observe_call observe = nullptr;
    std::string path;
};

// The library as the loader finds it for this tarnmon, through the same search that found
// libtelvplatform.so (the build's folder, or ../lib once installed).
bool load_library(monitor_library *library) {
    void *handle = ::dlopen(LIBRARY, RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) {
        const char *why = ::dlerror();
        std::fprintf(stderr, "tarnmon: cannot load the monitor %s: %s\n", LIBRARY,
                     why != nullptr ? why : "unknown reason");
        return false;
    }
    library->main = reinterpret_cast<monitor_main>(::dlsym(handle, "tarn_mon_main"));
    library->terminate =
        reinterpret_cast<terminate_call>(::dlsym(handle, "tarn_terminate_monitoring"));
    library->observe = reinterpret_cast<observe_call>(::dlsym(handle, "tarn_observe_passes"));
    link_map *map = nullptr;
    if (::dlinfo(handle, RTLD_DI_LINKMAP, &map) == 0 && map != nullptr && map->l_name != nullptr) {
        library->path = absolute(map->l_name);
    }
    if (library->path.empty()) {
        library->path = LIBRARY;
    }
    if (library->main == nullptr || library->terminate == nullptr) {
        std::fprintf(stderr, "tarnmon: %s has no tarn_mon_main or tarn_terminate_monitoring\n",
                     terminal_text(library->path).c_str());
        return false;
    }
    return true;
}

// ---- Running ----

// The monitor's passes observed for as long as this lives: declared after what the observer
// writes to, so that the observation ends before that goes.
class observation {
  public:
    observation() = default;
    observation(const observation &) = delete;
    observation &operator=(const observation &) = delete;
    ~observation() {
        if (observe_ != nullptr) {
            observe_(nullptr, nullptr);
        }
    }

    void begin(observe_call observe, tarn_pass_observer observer, void *context) {
        observe_ = observe;
        observe_(observer, context);
    }

  private:
    observe_call observe_ = nullptr;
};

// The monitor keeps some of what it allocates until its process ends: the expressions it compiled
// from the control file, which it never gives back (it frees the rows that held them), and what
// the C library's matcher caches in them. The leak checker of a sanitized build leaves the
// monitor's thread alone, as the library's own tests count its allocations; tarnmon's are counted.
uint32_t run_monitor(const monitor_library &library, size_t argc, char **argv) {
#ifdef TARNMON_LEAK_CHECKED
    __lsan_disable();
#endif
    uint32_t src = library.main(static_cast<int32_t>(argc), argv);
#ifdef TARNMON_LEAK_CHECKED
    __lsan_enable();
#endif
    return src;
}

std::string file_of(const char *variable, const std::string &directory, const char *name) {
    const char *chosen = std::getenv(variable);
    return chosen != nullptr && chosen[0] != '\0' ? chosen : directory + "/" + name;
}

const char *signal_name(uint32_t number) {
    return number == SIGINT ? "SIGINT" : number == SIGTERM ? "SIGTERM" : "a signal";
}

// Waits until the monitor's thread says it has ended; the first SIGINT or SIGTERM on the way stops
// the monitor, and any later one only waits with it.
void wait_for_monitor(int signals, int ended, sleep_gate &g) {
    pollfd watched[2] = {{signals, POLLIN, 0}, {ended, POLLIN, 0}};
    bool stopped = false;
    for (;;) {
        if (::poll(watched, 2, -1) < 0) {
            if (errno == EINTR) {
                continue;
            }
            return; // the thread is joined all the same
        }
        if (watched[1].revents != 0) {
            return;
        }
        signalfd_siginfo info;
        if (watched[0].revents != 0 && ::read(signals, &info, sizeof info) == sizeof info &&
            !stopped) {
            stopped = true;
            std::fprintf(stderr, "tarnmon: %s: the monitor ends after its current pass\n",
                         signal_name(info.ssi_signo));
            stop_monitor(g);
        }
    }
}

} // namespace

// The monitor's one-second sleep, and the sleep of anything else in this process: it waits the
// seconds asked for unless the monitor is to stop, and returns the seconds it did not wait, as the
// C library's sleep does.
extern "C" unsigned int sleep(unsigned int seconds) {
    sleep_gate &g = gate();
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    std::unique_lock hold(g.lock);
    if (g.monitoring && !g.view_tried) {
        g.view_tried = true;
        g.view = attach_control_block();
    }
    // A request made before the monitor set up its block was cleared by that set-up: make it
    // again, now that the loop has its block.
    if (g.monitoring && g.stopping && !g.request_checked) {
        g.request_checked = true;
        if (!g.request_in_block()) {
            hold.unlock();
            g.terminate();
            hold.lock();
        }
    }
    g.woken.wait_until(hold, deadline, [&g] { return g.ending(); });
    auto left = deadline - std::chrono::steady_clock::now();
    if (!g.ending() || left <= std::chrono::steady_clock::duration::zero()) {
        return 0;
    }
    return static_cast<unsigned int>(std::chrono::ceil<std::chrono::seconds>(left).count());
}

int command_run(const command_line &line) {
    int32_t interval = 0;
    if (line.interval != nullptr && !read_interval(line.interval, &interval)) {
        std::fprintf(stderr, "tarnmon: --interval takes seconds in the range 0..%d, not '%s'\n",
                     INT32_MAX, terminal_text(line.interval).c_str());
        return EXIT_USAGE;
    }
    std::string directory;
    if (!settle_data_directory(line, &directory)) {
        return EXIT_UNAVAILABLE;
    }
    std::string metrics_path;
    if (line.metrics != nullptr) {
        if (int error = settle_replaceable_file(line.metrics, &metrics_path); error != 0) {
            std::fprintf(stderr, "tarnmon: cannot write the metrics file %s: %s\n",
                         terminal_text(line.metrics).c_str(), std::strerror(error));
            return EXIT_UNAVAILABLE;
        }
    }
    int32_t file_interval = INTERVAL_DEFAULT;
    int verdict = check_control_file(line.config, check_report::verdict, &file_interval);
    std::fflush(stdout);
    if (verdict != EXIT_OK) {
        return verdict;
    }
    if (!prepare_control_block_key()) {
        return EXIT_UNAVAILABLE;
    }
    std::string appliance_programs = settle_appliance_programs();

    // Blocked before any thread starts, so that every thread inherits the mask; the programs the
    // monitor runs inherit it too, so a Ctrl-C at the terminal cuts none of a pass's data short.
    sigset_t stop_signals;
    sigemptyset(&stop_signals);
    sigaddset(&stop_signals, SIGINT);
    sigaddset(&stop_signals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stop_signals, nullptr);
    descriptor signals{::signalfd(-1, &stop_signals, SFD_CLOEXEC)};
    descriptor ended{::eventfd(0, EFD_CLOEXEC)};
    if (signals.fd < 0 || ended.fd < 0) {
        std::fprintf(stderr, "tarnmon: cannot wait for signals: %s\n", std::strerror(errno));
        return EXIT_UNAVAILABLE;
    }

    control_file_link link;
    if (line.config != nullptr) {
        if (int placed = link.place(line.config, directory); placed != EXIT_OK) {
            return placed;
        }
    }
    monitor_library library;
    if (!load_library(&library)) {
        return EXIT_UNAVAILABLE;
    }
    if (line.metrics != nullptr && library.observe == nullptr) {
        std::fprintf(stderr, "tarnmon: %s gives no figures of its passes (tarn_observe_passes)\n",
                     terminal_text(library.path).c_str());
        return EXIT_UNAVAILABLE;
    }

    // The monitor's arguments as a host gives them: the checking interval, which overrides the
    // control file's, and a third word for one pass. One pass takes the file's interval, to keep
    // the run as the file describes it.
    std::string interval_word;
    std::string schedule;
    if (line.interval != nullptr) {
        interval_word = std::to_string(interval);
        int32_t used = interval < INTERVAL_MINIMUM ? INTERVAL_DEFAULT : interval;
        schedule = "a pass every " + std::to_string(used) + " seconds (--interval" +
                   (used != interval ? " below 5" : "") + ")";
    } else {
        interval_word = std::to_string(file_interval);
        schedule = "a pass every " + std::to_string(file_interval) +
                   " seconds (the control file's CHECKING_INTERVAL)";
    }
    std::vector<std::string> words = {"tarnmon"};
    if (line.interval != nullptr || line.once != nullptr) {
        words.push_back(interval_word);
    }
    if (line.once != nullptr) {
        words.push_back("once");
        schedule = "one pass";
    } else {
        schedule += ", until SIGINT, SIGTERM or tarnmon stop";
    }
    std::vector<char *> argv;
    for (std::string &word : words) {
        argv.push_back(word.data());
    }
    argv.push_back(nullptr);

    std::printf("monitor: %s, %s\n", terminal_text(library.path).c_str(), schedule.c_str());
    std::printf("data directory: %s\n", terminal_text(directory).c_str());
    std::printf("event log: %s\n",
                terminal_text(file_of(EVENT_LOG_VARIABLE, directory, EVENT_LOG_NAME)).c_str());
    std::printf("trace: %s\n",
                terminal_text(file_of(TRACE_FILE_VARIABLE, directory, TRACE_FILE_NAME)).c_str());
    std::printf("runAsRoot: %s\n", appliance_programs.c_str());
    metrics_file metrics(metrics_path);
    observation metrics_observed;
    if (line.metrics != nullptr) {
        std::printf("metrics: %s, after every pass\n", terminal_text(metrics_path).c_str());
        metrics_observed.begin(library.observe, metrics_file::observe, &metrics);
    }
    std::fflush(stdout);

    sleep_gate &g = gate();
    {
        std::lock_guard hold(g.lock);
        g.monitoring = true;
        g.terminate = library.terminate;
    }
    uint32_t src = 0;
    try {
        std::thread monitor([&] {
            src = run_monitor(library, words.size(), argv.data());
            uint64_t one = 1;
            while (::write(ended.fd, &one, sizeof one) < 0 && errno == EINTR) {
            }
        });
        wait_for_monitor(signals.fd, ended.fd, g);
        monitor.join();
    } catch (const std::system_error &failure) {
        std::fprintf(stderr, "tarnmon: cannot start the monitor's thread: %s\n", failure.what());
        return EXIT_UNAVAILABLE;
    }
    {
        std::lock_guard hold(g.lock);
        g.monitoring = false;
        detach_control_block(g.view);
    }
    if (src != 0) {
        std::fprintf(stderr,
                     "tarnmon: the monitor ended on a failure of its own (system return code "
                     "%u): see its event log and trace\n",
                     src);
        return EXIT_FINDING;
    }
    return EXIT_OK;
}

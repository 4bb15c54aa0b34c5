// runAsRoot SCRIPT [ARGUMENTS...]: runs one of the appliance's maintenance scripts, found in the
// directory of this program, with the rights this program was given.
//
// The monitor starts this program from its PATH; an appliance gives it its rights as a file
// capability (or runs the monitor as root). So it trusts nothing the caller controls: the script
// must be one of its own list and sit beside its own executable (never looked up on PATH), the
// environment is replaced by a fixed one, the arguments reach the script unchanged through execve
// with no shell between, and the script inherits no descriptor, signal mask or ignored signal of
// the caller.
//
// Exit status: the script's, since the script replaces this program; 2 when no script is named;
// 126 when the name is refused, the script cannot be run or the rights cannot be passed on; 127
// when the script is missing.
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <linux/capability.h>
#include <string>
#include <string_view>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

extern char **environ;

namespace {

// The only scripts this program runs. A new maintenance script of the appliance is added here.
constexpr std::array SCRIPTS = {
    "rundu.sh",
    "cleanupPartition",
    "lsmon.sh",
    "telvzstba",
#ifdef RUN_AS_ROOT_EXTRA_SCRIPT
    // Only the tests' own build of this program has a name of theirs on the list.
    RUN_AS_ROOT_EXTRA_SCRIPT,
#endif
};

constexpr int STATUS_USAGE = 2;
constexpr int STATUS_REFUSED = 126;
constexpr int STATUS_MISSING = 127;

constexpr const char *SAFE_PATH = "PATH=/usr/sbin:/usr/bin:/sbin:/bin";
constexpr const char *C_LOCALE = "LC_ALL=C";
// The scripts write their files into the monitor's data directory, which the monitor's platform
// takes from this variable.
constexpr std::string_view DATA_DIR_ENTRY = "TELV_DATA_DIR=";

// A name or value as it can be shown on one line of a message: control bytes and bytes beyond
// ASCII as \xHH.
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

int refuse(int status, const std::string &message) {
    std::fprintf(stderr, "runAsRoot: %s\n", message.c_str());
    return status;
}

bool on_the_list(std::string_view name) {
    for (std::string_view script : SCRIPTS) {
        if (name == script) {
            return true;
        }
    }
    return false;
}

// An absolute path none of whose components is "..": it cannot climb out of where it points.
bool absolute_without_parent_steps(std::string_view path) {
    if (path.empty() || path.front() != '/') {
        return false;
    }
    size_t start = 0;
    while (start < path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string_view::npos) {
            end = path.size();
        }
        if (path.substr(start, end - start) == "..") {
            return false;
        }
        start = end + 1;
    }
    return true;
}

// The first TELV_DATA_DIR entry of the environment (the one getenv reads), when it is safe to pass.
const char *data_dir_entry() {
    for (char **entry = environ; entry != nullptr && *entry != nullptr; ++entry) {
        std::string_view text = *entry;
        if (text.starts_with(DATA_DIR_ENTRY)) {
            return absolute_without_parent_steps(text.substr(DATA_DIR_ENTRY.size())) ? *entry
                                                                                     : nullptr;
        }
    }
    return nullptr;
}

// The directory of this program's executable, as the kernel knows it: neither argv[0] nor PATH
// can point it elsewhere. Empty when it cannot be read.
std::string own_directory() {
    char path[4096];
    ssize_t length = readlink("/proc/self/exe", path, sizeof path - 1);
    if (length <= 0 || static_cast<size_t>(length) >= sizeof path - 1) {
        return "";
    }
    std::string_view executable(path, static_cast<size_t>(length));
    size_t slash = executable.rfind('/');
    return slash == std::string_view::npos ? "" : std::string(executable.substr(0, slash));
}

// File capabilities of this program are lost when it executes a script, since the script's
// interpreter has none of its own; raised into the ambient set they pass to the script and to
// the commands it runs. Root needs nothing: its exec of any program restores its full rights.
bool pass_on_capabilities(std::string *failure) {
    if (geteuid() == 0) {
        return true;
    }
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    std::array<__user_cap_data_struct, _LINUX_CAPABILITY_U32S_3> sets{};
    if (syscall(SYS_capget, &header, sets.data()) != 0) {
        *failure = std::string("cannot read its capabilities: ") + std::strerror(errno);
        return false;
    }
    uint64_t permitted = 0;
    for (size_t word = 0; word < sets.size(); ++word) {
        permitted |= static_cast<uint64_t>(sets[word].permitted) << (32 * word);
        sets[word].inheritable |= sets[word].permitted;
    }
    if (permitted == 0) {
        return true;
    }
    if (syscall(SYS_capset, &header, sets.data()) != 0) {
        *failure = std::string("cannot make its capabilities inheritable: ") + std::strerror(errno);
        return false;
    }
    for (unsigned capability = 0; capability < 64; ++capability) {
        if ((permitted >> capability & 1) != 0 &&
            prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_RAISE, capability, 0, 0) != 0) {
            *failure = "cannot pass capability " + std::to_string(capability) +
                       " on to the script: " + std::strerror(errno);
            return false;
        }
    }
    return true;
}

// Ignored signals and the signal mask survive execve; the scripts expect neither (a pipeline whose
// reader has ended must end on SIGPIPE, not print write errors).
void restore_default_signals() {
    struct sigaction default_action {};
    default_action.sa_handler = SIG_DFL;
    for (int signal_number = 1; signal_number < NSIG; ++signal_number) {
        sigaction(signal_number, &default_action, nullptr);
    }
    sigset_t nothing;
    sigemptyset(&nothing);
    sigprocmask(SIG_SETMASK, &nothing, nullptr);
}

} // namespace

int main(int argc, char **argv) {
    if (argc < 2) {
        return refuse(STATUS_USAGE, "usage: runAsRoot SCRIPT [ARGUMENTS...]");
    }
    std::string_view name = argv[1];
    if (name.find('/') != std::string_view::npos) {
        return refuse(STATUS_REFUSED,
                      "refused \"" + printable(name) + "\": a script is named without a directory");
    }
    if (!on_the_list(name)) {
        return refuse(STATUS_REFUSED, "refused \"" + printable(name) +
                                          "\": not one of the appliance's maintenance scripts");
    }
    std::string directory = own_directory();
    if (directory.empty()) {
        return refuse(STATUS_REFUSED, "cannot find its own directory through /proc/self/exe");
    }
    std::string script = directory + "/" + std::string(name);
    std::string failure;
    if (!pass_on_capabilities(&failure)) {
        return refuse(STATUS_REFUSED, failure);
    }

    const char *environment[] = {SAFE_PATH, C_LOCALE, data_dir_entry(), nullptr};
    umask(022);
    if (chdir("/") != 0) {
        return refuse(STATUS_REFUSED, std::string("cannot change to /: ") + std::strerror(errno));
    }
    restore_default_signals();
    close_range(3, ~0U, 0);
    // The script's argv[0] is its path, as a shell would give it; the caller's arguments follow.
    argv[1] = script.data();
    execve(script.c_str(), argv + 1, const_cast<char **>(environment));
    int error = errno;
    return refuse(error == ENOENT ? STATUS_MISSING : STATUS_REFUSED,
                  "cannot run " + printable(script) + ": " + std::strerror(error));
}

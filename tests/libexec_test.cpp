// The appliance programs of libexec/, run as the monitor runs them: runAsRoot's refusals, the
// environment, arguments and process state it gives a script, and the file capabilities it passes
// on; rundu.sh and cleanupPartition on file systems mounted in a mount namespace of the test's
// own; the layout of lsmon.sh's listing; the part of the trace that telvzstba copies.
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <filesystem>
#include <functional>
#include <grp.h>
#include <linux/capability.h>
#include <pwd.h>
#include <sched.h>
#include <string>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <vector>

namespace {

namespace fs = std::filesystem;
using lines = std::vector<std::string>;

const bool started_as_root = getuid() == 0;

const std::string LIBEXEC = TELV_LIBEXEC_DIR;
const std::string RUN_AS_ROOT = LIBEXEC + "/runAsRoot";
const std::string RUNDU = LIBEXEC + "/rundu.sh";
const std::string LSMON = LIBEXEC + "/lsmon.sh";
const std::string STBA = LIBEXEC + "/telvzstba";
// The tests' own builds: runAsRoot with "show-call" on its list, cleanupPartition reading the
// policy named by TELV_CLEANUP_POLICY.
const std::string RUN_AS_ROOT_FOR_TESTS = TELV_RUN_AS_ROOT_FOR_TESTS;
const std::string CLEANUP_FOR_TESTS = TELV_CLEANUP_PARTITION_FOR_TESTS;

const std::string SAFE_PATH = "PATH=/usr/sbin:/usr/bin:/sbin:/bin";

struct outcome {
    int status = -1; // exit status, or 128 + signal
    std::string out;
    std::string err;
};

struct launch {
    std::vector<std::string> environment; // the program's whole environment
    std::string argv0;                    // when it differs from the path
    std::string working_directory;
    uid_t user = 0; // with as_other_user: the user and group it runs as
    gid_t group = 0;
    bool as_other_user = false;
    // SIGPIPE ignored, SIGUSR1 blocked, descriptor 7 open and umask 077, as a host may leave them.
    bool unusual_state = false;
};

std::string contents_of(int fd) {
    std::string text;
    char buffer[4096];
    ssize_t length;
    lseek(fd, 0, SEEK_SET);
    while ((length = read(fd, buffer, sizeof buffer)) > 0) {
        text.append(buffer, static_cast<size_t>(length));
    }
    return text;
}

std::vector<char *> pointers_to(const std::vector<std::string> &texts) {
    std::vector<char *> pointers;
    for (const std::string &text : texts) {
        pointers.push_back(const_cast<char *>(text.c_str()));
    }
    pointers.push_back(nullptr);
    return pointers;
}

// Starts the program with standard input from /dev/null and standard output and error into
// `out` and `err` (or /dev/null). The child runs only async-signal-safe calls before execve.
pid_t start(const std::string &path, std::vector<std::string> arguments, const launch &how,
            int out = -1, int err = -1) {
    if (!how.argv0.empty()) {
        arguments.insert(arguments.begin(), how.argv0);
    } else {
        arguments.insert(arguments.begin(), path);
    }
    std::vector<char *> argv = pointers_to(arguments);
    std::vector<char *> envp = pointers_to(how.environment);
    int null = open("/dev/null", O_RDWR | O_CLOEXEC);
    pid_t pid = fork();
    if (pid == 0) {
        dup2(null, 0);
        dup2(out >= 0 ? out : null, 1);
        dup2(err >= 0 ? err : null, 2);
        if (how.unusual_state) {
            struct sigaction ignore {};
            ignore.sa_handler = SIG_IGN;
            sigaction(SIGPIPE, &ignore, nullptr);
            sigset_t blocked;
            sigemptyset(&blocked);
            sigaddset(&blocked, SIGUSR1);
            sigprocmask(SIG_BLOCK, &blocked, nullptr);
            dup2(null, 7);
            umask(077);
        }
        if (!how.working_directory.empty() && chdir(how.working_directory.c_str()) != 0) {
            _exit(125);
        }
        if (how.as_other_user &&
            (setgroups(0, nullptr) != 0 || setgid(how.group) != 0 || setuid(how.user) != 0)) {
            _exit(125);
        }
        execve(path.c_str(), argv.data(), envp.data());
        _exit(124);
    }
    close(null);
    return pid;
}

int status_of(pid_t pid) {
    int status = 0;
    if (pid < 0 || waitpid(pid, &status, 0) != pid) {
        return -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

outcome run(const std::string &path, const std::vector<std::string> &arguments,
            const launch &how = {}) {
    int out = memfd_create("out", MFD_CLOEXEC);
    int err = memfd_create("err", MFD_CLOEXEC);
    outcome result;
    result.status = status_of(start(path, arguments, how, out, err));
    result.out = contents_of(out);
    result.err = contents_of(err);
    close(out);
    close(err);
    return result;
}

std::string nul_separated(const lines &texts) {
    std::string joined;
    for (const std::string &text : texts) {
        joined += text;
        joined += '\0';
    }
    return joined;
}

lines lines_of(const std::string &text) {
    lines all;
    size_t start = 0;
    while (start < text.size()) {
        size_t end = text.find('\n', start);
        if (end == std::string::npos) {
            end = text.size();
        }
        all.push_back(text.substr(start, end - start));
        start = end + 1;
    }
    return all;
}

void write_file(const std::string &path, const std::string &text, mode_t mode = 0644) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    ASSERT_GE(fd, 0) << path << ": " << std::strerror(errno);
    ASSERT_EQ(write(fd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    ASSERT_EQ(fchmod(fd, mode), 0);
    close(fd);
}

std::string read_file(const std::string &path) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return "(missing)";
    }
    std::string text = contents_of(fd);
    close(fd);
    return text;
}

void make_directory(const std::string &path, mode_t mode = 0755) {
    ASSERT_EQ(mkdir(path.c_str(), mode), 0) << path << ": " << std::strerror(errno);
    ASSERT_EQ(chmod(path.c_str(), mode), 0);
}

// A file of `bytes` zero bytes: on tmpfs it takes exactly that much room when a multiple of 4096.
void file_of_size(const std::string &path, size_t bytes) {
    write_file(path, std::string(bytes, '\0'));
}

// Sets the modification time `days` days back, of a symbolic link itself when it is one.
void make_old(const std::string &path, int days) {
    timespec times[2];
    times[0].tv_sec = times[1].tv_sec = std::time(nullptr) - static_cast<time_t>(days) * 86400;
    times[0].tv_nsec = times[1].tv_nsec = 0;
    ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << path;
}

// Everything under `root`, relative and sorted: directories with a trailing "/", symbolic links
// with their target. Links are not followed.
lines tree_of(const std::string &root) {
    lines entries;
    std::error_code error;
    for (auto it = fs::recursive_directory_iterator(root, error);
         !error && it != fs::recursive_directory_iterator(); it.increment(error)) {
        std::string relative = fs::relative(it->path(), root).string();
        if (it->is_symlink()) {
            entries.push_back(relative + " -> " + fs::read_symlink(it->path()).string());
        } else if (it->is_directory()) {
            entries.push_back(relative + "/");
        } else {
            entries.push_back(relative);
        }
    }
    std::sort(entries.begin(), entries.end());
    return entries;
}

void copy_program(const std::string &from, const std::string &to) {
    std::error_code error;
    fs::copy_file(from, to, fs::copy_options::overwrite_existing, error);
    ASSERT_FALSE(error) << from << " -> " << to << ": " << error.message();
    ASSERT_EQ(chmod(to.c_str(), 0755), 0);
}

bool write_proc_file(const char *path, const std::string &text) {
    int fd = open(path, O_WRONLY | O_CLOEXEC);
    bool written = fd >= 0 && write(fd, text.data(), text.size()) == ssize_t(text.size());
    if (fd >= 0) {
        close(fd);
    }
    return written;
}

// The mounts of a test stay in a mount namespace of the test process's own, gone when it ends.
// Root makes one; another user makes a user namespace in which it is root. Empty, or why neither
// could be made.
const std::string &private_mounts() {
    static const std::string failure = []() -> std::string {
        if (getuid() != 0) {
            uid_t user = getuid();
            gid_t group = getgid();
            if (unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) {
                return std::string("no user namespace: ") + std::strerror(errno);
            }
            if (!write_proc_file("/proc/self/setgroups", "deny") ||
                !write_proc_file("/proc/self/uid_map", "0 " + std::to_string(user) + " 1") ||
                !write_proc_file("/proc/self/gid_map", "0 " + std::to_string(group) + " 1")) {
                return std::string("cannot map the user: ") + std::strerror(errno);
            }
        } else if (unshare(CLONE_NEWNS) != 0) {
            return std::string("no mount namespace: ") + std::strerror(errno);
        }
        if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
            return std::string("cannot make the mounts private: ") + std::strerror(errno);
        }
        return "";
    }();
    return failure;
}

struct nobody_user {
    uid_t user = 0;
    gid_t group = 0;
    bool found = false;
};

nobody_user nobody() {
    const passwd *entry = getpwnam("nobody");
    return entry == nullptr ? nobody_user{} : nobody_user{entry->pw_uid, entry->pw_gid, true};
}

// A folder of the test's own under /tmp (its real path, as /proc/self/exe gives paths), and the
// mounts it made inside, undone at the end.
class Scratch : public testing::Test {
  protected:
    void SetUp() override {
        char name[] = "/tmp/telv-libexec-XXXXXX";
        ASSERT_NE(mkdtemp(name), nullptr);
        scratch = fs::canonical(name).string();
    }
    void TearDown() override {
        for (auto it = mounts.rbegin(); it != mounts.rend(); ++it) {
            umount2(it->c_str(), MNT_DETACH);
        }
        std::error_code ignored;
        fs::remove_all(scratch, ignored);
    }

    // Mounts a new tmpfs at `path` (made when missing); false, with the reason in `why`, when
    // this process cannot mount.
    bool mount_tmpfs(const std::string &path, std::string *why) {
        *why = private_mounts();
        if (!why->empty()) {
            return false;
        }
        mkdir(path.c_str(), 0755);
        if (mount("tmpfs", path.c_str(), "tmpfs", 0, "mode=0755,size=64m") != 0) {
            *why = std::string("cannot mount a tmpfs: ") + std::strerror(errno);
            return false;
        }
        mounts.push_back(path);
        return true;
    }

    bool bind(const std::string &from, const std::string &to) {
        if (mount(from.c_str(), to.c_str(), nullptr, MS_BIND, nullptr) != 0) {
            return false;
        }
        mounts.push_back(to);
        return true;
    }

    std::string scratch;
    std::vector<std::string> mounts;
};

// ---- runAsRoot

class RunAsRoot : public Scratch {
  protected:
    // A libexec folder of the test's own, holding the tests' build of runAsRoot and its script
    // "show-call" with the given text.
    std::string folder_with_show_call(const std::string &script) {
        std::string folder = scratch + "/libexec";
        mkdir(folder.c_str(), 0755);
        copy_program(RUN_AS_ROOT_FOR_TESTS, folder + "/runAsRoot");
        write_file(folder + "/show-call", script, 0755);
        return folder;
    }
};

constexpr const char *SHOW_ENVIRONMENT = "#!/bin/sh\ncat /proc/$$/environ\n";
constexpr const char *SHOW_ARGUMENTS = "#!/bin/sh\nexec /usr/bin/printf '%s\\0' \"$0\" \"$@\"\n";

TEST_F(RunAsRoot, WithoutAScriptGivesItsUsage) {
    outcome result = run(RUN_AS_ROOT, {});
    EXPECT_EQ(result.status, 2);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "runAsRoot: usage: runAsRoot SCRIPT [ARGUMENTS...]\n");
}

TEST_F(RunAsRoot, RefusesANameWithADirectory) {
    for (const std::string name :
         {"../rundu.sh", "/bin/sh", "libexec/lsmon.sh", "rundu.sh/", "./cleanupPartition"}) {
        outcome result = run(RUN_AS_ROOT, {name, "/"});
        EXPECT_EQ(result.status, 126) << name;
        EXPECT_EQ(result.out, "") << name;
        EXPECT_EQ(result.err,
                  "runAsRoot: refused \"" + name + "\": a script is named without a directory\n");
    }
}

TEST_F(RunAsRoot, RefusesANameNotOnItsList) {
    // "show-call" is on the list of the tests' build only.
    for (const std::string name : {"sh", "rundu", "", "RUNDU.SH", "lsmon.sh ", "show-call"}) {
        outcome result = run(RUN_AS_ROOT, {name});
        EXPECT_EQ(result.status, 126) << name;
        EXPECT_EQ(result.out, "") << name;
        EXPECT_EQ(result.err, "runAsRoot: refused \"" + name +
                                  "\": not one of the appliance's maintenance scripts\n");
    }
    outcome control_bytes = run(RUN_AS_ROOT, {"a\nb\\"});
    EXPECT_EQ(control_bytes.status, 126);
    EXPECT_EQ(control_bytes.err,
              "runAsRoot: refused \"a\\x0ab\\x5c\": not one of the appliance's maintenance "
              "scripts\n");
}

TEST_F(RunAsRoot, AMissingScriptIs127) {
    std::string folder = scratch + "/alone";
    make_directory(folder);
    copy_program(RUN_AS_ROOT, folder + "/runAsRoot");
    outcome result = run(folder + "/runAsRoot", {"rundu.sh", "/", "telvzdu.trm"});
    EXPECT_EQ(result.status, 127);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err,
              "runAsRoot: cannot run " + folder + "/rundu.sh: No such file or directory\n");
}

TEST_F(RunAsRoot, AScriptThatCannotBeRunIs126) {
    std::string folder = scratch + "/plain";
    make_directory(folder);
    copy_program(RUN_AS_ROOT, folder + "/runAsRoot");
    write_file(folder + "/lsmon.sh", "#!/bin/sh\necho ran\n", 0644);
    outcome result = run(folder + "/runAsRoot", {"lsmon.sh"});
    EXPECT_EQ(result.status, 126);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "runAsRoot: cannot run " + folder + "/lsmon.sh: Permission denied\n");
}

TEST_F(RunAsRoot, GivesTheScriptOnlyItsFixedEnvironment) {
    std::string folder = folder_with_show_call(SHOW_ENVIRONMENT);
    launch how;
    how.environment = {"PATH=/nowhere:/usr/bin",
                       "LD_LIBRARY_PATH=/nowhere",
                       "BASH_ENV=/nowhere/env",
                       "ENV=/nowhere/env",
                       "IFS=x",
                       "SHELLOPTS=xtrace",
                       "TELV_DATA_DIR=/var/lib/telvzmnd-test",
                       "TELV_CLEANUP_POLICY=/nowhere/cleanup.policy",
                       "LC_ALL=de_DE.UTF-8",
                       "LANG=de_DE.UTF-8",
                       "HOME=/root"};
    outcome result = run(folder + "/runAsRoot", {"show-call"}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out,
              nul_separated({SAFE_PATH, "LC_ALL=C", "TELV_DATA_DIR=/var/lib/telvzmnd-test"}));
}

TEST_F(RunAsRoot, KeepsTheDataDirectoryOnlyWhenAbsoluteWithoutAParentStep) {
    std::string folder = folder_with_show_call(SHOW_ENVIRONMENT);
    struct example {
        std::vector<std::string> given;
        std::string kept; // empty: none passed
    };
    const std::vector<example> examples = {
        {{"TELV_DATA_DIR=/var/lib/x"}, "TELV_DATA_DIR=/var/lib/x"},
        {{"TELV_DATA_DIR=/"}, "TELV_DATA_DIR=/"},
        {{"TELV_DATA_DIR=/a/..b/c"}, "TELV_DATA_DIR=/a/..b/c"},
        {{"TELV_DATA_DIR=/a/./b"}, "TELV_DATA_DIR=/a/./b"},
        {{"TELV_DATA_DIR=relative/dir"}, ""},
        {{"TELV_DATA_DIR="}, ""},
        {{"TELV_DATA_DIR=/var/../etc"}, ""},
        {{"TELV_DATA_DIR=/var/lib/.."}, ""},
        {{"TELV_DATA_DIR=.."}, ""},
        {{"TELV_DATA_DIR=/first", "TELV_DATA_DIR=/second"}, "TELV_DATA_DIR=/first"},
        {{"TELV_DATA_DIR=first", "TELV_DATA_DIR=/second"}, ""},
        {{"TELV_DATA_DIRECTORY=/x"}, ""},
    };
    for (const example &each : examples) {
        launch how;
        how.environment = each.given;
        outcome result = run(folder + "/runAsRoot", {"show-call"}, how);
        lines expected = {SAFE_PATH, "LC_ALL=C"};
        if (!each.kept.empty()) {
            expected.push_back(each.kept);
        }
        EXPECT_EQ(result.status, 0) << each.given[0];
        EXPECT_EQ(result.out, nul_separated(expected)) << each.given[0];
    }
}

TEST_F(RunAsRoot, PassesTheArgumentsUnchanged) {
    std::string folder = folder_with_show_call(SHOW_ARGUMENTS);
    std::string marker = scratch + "/marker";
    const lines arguments = {"a b",
                             "$(touch " + marker + ")",
                             "`touch " + marker + "`",
                             "; touch " + marker,
                             "| touch " + marker,
                             ">" + marker,
                             "*",
                             "",
                             "--",
                             "-n",
                             "line\nfeed",
                             "'\"\\",
                             "$HOME ~"};
    launch how;
    how.environment = {"HOME=/root"};
    lines call = arguments;
    call.insert(call.begin(), "show-call");
    outcome result = run(folder + "/runAsRoot", call, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    lines expected = arguments;
    expected.insert(expected.begin(), folder + "/show-call");
    EXPECT_EQ(result.out, nul_separated(expected));
    EXPECT_FALSE(fs::exists(marker));
}

TEST_F(RunAsRoot, ItsExitStatusIsTheScripts) {
    std::string folder = folder_with_show_call("#!/bin/sh\necho \"$#\"\nexit 7\n");
    outcome result = run(folder + "/runAsRoot", {"show-call", "one", "two"});
    EXPECT_EQ(result.status, 7);
    EXPECT_EQ(result.out, "2\n");
    EXPECT_EQ(result.err, "");
}

TEST_F(RunAsRoot, FindsItsScriptsBesideItsOwnExecutableNotWhereItWasCalled) {
    std::string folder = folder_with_show_call("#!/bin/sh\necho \"$0\"\n");
    std::string elsewhere = scratch + "/bin";
    make_directory(elsewhere);
    ASSERT_EQ(symlink((folder + "/runAsRoot").c_str(), (elsewhere + "/runAsRoot").c_str()), 0);
    write_file(elsewhere + "/show-call", "#!/bin/sh\necho decoy\n", 0755);
    launch how;
    how.argv0 = "runAsRoot";
    how.working_directory = elsewhere;
    how.environment = {"PATH=" + elsewhere};
    outcome result = run(elsewhere + "/runAsRoot", {"show-call"}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.out, folder + "/show-call\n");
    EXPECT_EQ(result.err, "");
}

TEST_F(RunAsRoot, StartsTheScriptInAKnownState) {
    // The signal state is read by a command the script becomes: the shell itself blocks signals
    // for a moment whenever it starts a command.
    std::string folder = folder_with_show_call(
        "#!/bin/sh\npwd\numask\n"
        "if [ -e /proc/$$/fd/7 ]; then echo 'descriptor 7 open'; else echo 'descriptor 7 "
        "closed'; fi\nexec grep -E '^Sig(Blk|Ign):' /proc/self/status\n");
    launch how;
    how.unusual_state = true;
    how.working_directory = scratch;
    outcome result = run(folder + "/runAsRoot", {"show-call"}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "/\n0022\ndescriptor 7 closed\nSigBlk:\t0000000000000000\n"
                          "SigIgn:\t0000000000000000\n");
}

// The rights an appliance gives the installed runAsRoot (README: "setcap
// cap_dac_override,cap_dac_read_search,cap_fowner,cap_sys_ptrace+p"), written as the extended
// attribute that setcap writes.
bool give_capabilities(const std::string &program) {
    vfs_cap_data capabilities{};
    uint32_t permitted = 1u << CAP_DAC_OVERRIDE | 1u << CAP_DAC_READ_SEARCH | 1u << CAP_FOWNER |
                         1u << CAP_SYS_PTRACE;
    capabilities.magic_etc = VFS_CAP_REVISION_2;
    capabilities.data[0].permitted = permitted;
    return setxattr(program.c_str(), "security.capability", &capabilities, XATTR_CAPS_SZ_2, 0) == 0;
}

TEST_F(RunAsRoot, PassesItsFileCapabilitiesToTheScriptAndItsCommands) {
    nobody_user other = nobody();
    if (!started_as_root || !other.found) {
        GTEST_SKIP() << "needs root, to give a file capability and run as the user nobody";
    }
    std::string why;
    std::string top = scratch + "/top";
    if (!mount_tmpfs(top, &why)) {
        GTEST_SKIP() << why;
    }
    ASSERT_EQ(chmod(scratch.c_str(), 0755), 0);
    std::string folder = top + "/libexec";
    make_directory(folder);
    copy_program(RUN_AS_ROOT, folder + "/runAsRoot");
    copy_program(LSMON, folder + "/lsmon.sh");
    copy_program(RUNDU, folder + "/rundu.sh");
    std::string data = top + "/data";
    make_directory(data);
    ASSERT_EQ(chown(data.c_str(), other.user, other.group), 0);
    std::string listed = top + "/listed";
    ASSERT_TRUE(mount_tmpfs(listed, &why)) << why;
    make_directory(listed + "/secret", 0700);
    file_of_size(listed + "/secret/hidden", 4096);
    std::string held = top + "/held open by the test";
    write_file(held, "");
    int descriptor = open(held.c_str(), O_RDONLY | O_CLOEXEC);
    ASSERT_GE(descriptor, 0);
    std::string header = "/proc/" + std::to_string(getpid()) + "/fd:";
    std::string held_line_end = " " + std::to_string(descriptor) + " -> " + held;

    launch how;
    how.as_other_user = true;
    how.user = other.user;
    how.group = other.group;
    how.environment = {"TELV_DATA_DIR=" + data};
    auto listing_shows_the_test = [&](const outcome &result) {
        lines shown = lines_of(result.out);
        auto at = std::find(shown.begin(), shown.end(), header);
        return at != shown.end() && std::any_of(at, shown.end(), [&](const std::string &line) {
                   return line.ends_with(held_line_end);
               });
    };

    // Without the capability the user sees neither the test's descriptors nor the hidden file.
    outcome bare = run(folder + "/runAsRoot", {"lsmon.sh"}, how);
    EXPECT_EQ(bare.status, 0);
    EXPECT_EQ(bare.err, "");
    EXPECT_FALSE(listing_shows_the_test(bare));
    outcome bare_du = run(folder + "/runAsRoot", {"rundu.sh", listed, "telvzdu.trm"}, how);
    EXPECT_EQ(bare_du.status, 0) << bare_du.err;
    // Equal sizes are ordered by the whole line, in reverse as the sizes are.
    EXPECT_EQ(read_file(data + "/telvzdu.trm"), "0\t" + listed + "/secret\n0\t" + listed + "\n");

    ASSERT_TRUE(give_capabilities(folder + "/runAsRoot")) << std::strerror(errno);
    outcome capable = run(folder + "/runAsRoot", {"lsmon.sh"}, how);
    EXPECT_EQ(capable.status, 0);
    EXPECT_EQ(capable.err, "");
    EXPECT_TRUE(listing_shows_the_test(capable)) << capable.out.substr(0, 2000);
    outcome capable_du = run(folder + "/runAsRoot", {"rundu.sh", listed, "telvzdu.trm"}, how);
    EXPECT_EQ(capable_du.status, 0) << capable_du.err;
    EXPECT_EQ(capable_du.out, "rundu.sh: 3 largest entries of " + listed + " written to " + data +
                                  "/telvzdu.trm\n");
    EXPECT_EQ(read_file(data + "/telvzdu.trm"),
              "4\t" + listed + "/secret/hidden\n4\t" + listed + "/secret\n4\t" + listed + "\n");
    struct stat written {};
    ASSERT_EQ(stat((data + "/telvzdu.trm").c_str(), &written), 0);
    EXPECT_EQ(written.st_uid, other.user);
    close(descriptor);
}

// ---- rundu.sh

// A tmpfs at <scratch>/mnt to list, and a data directory.
class OnAMount : public Scratch {
  protected:
    void SetUp() override {
        Scratch::SetUp();
        mnt = scratch + "/mnt";
        data = scratch + "/data";
        make_directory(data);
        std::string why;
        if (!mount_tmpfs(mnt, &why)) {
            GTEST_SKIP() << "needs a tmpfs in a mount namespace of its own: " << why;
        }
    }

    launch in_data_directory() const {
        launch how;
        how.environment = {"TELV_DATA_DIR=" + data};
        return how;
    }

    std::string mnt;
    std::string data;
};

using Rundu = OnAMount;

TEST_F(Rundu, ListsTheFileSystemLargestFirst) {
    file_of_size(mnt + "/big", 40960);
    make_directory(mnt + "/dir");
    file_of_size(mnt + "/dir/mid", 12288);
    file_of_size(mnt + "/dir/small", 4096);
    file_of_size(mnt + "/line\nfeed", 8192);
    write_file(mnt + "/empty", "");
    outcome result = run(RUNDU, {mnt, "telvzdu.trm"}, in_data_directory());
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out,
              "rundu.sh: 7 largest entries of " + mnt + " written to " + data + "/telvzdu.trm\n");
    EXPECT_EQ(read_file(data + "/telvzdu.trm"), "64\t" + mnt + "\n40\t" + mnt + "/big\n16\t" + mnt +
                                                    "/dir\n12\t" + mnt + "/dir/mid\n8\t" + mnt +
                                                    "/line?feed\n4\t" + mnt + "/dir/small\n0\t" +
                                                    mnt + "/empty\n");
    EXPECT_EQ(tree_of(data), lines{"telvzdu.trm"});
    struct stat written {};
    ASSERT_EQ(stat((data + "/telvzdu.trm").c_str(), &written), 0);
    EXPECT_EQ(written.st_mode & 07777, 0640u);
}

TEST_F(Rundu, DoesNotCrossIntoANestedMount) {
    file_of_size(mnt + "/own", 4096);
    file_of_size(mnt + "/other", 8192);
    std::string why;
    ASSERT_TRUE(mount_tmpfs(mnt + "/inner", &why)) << why;
    file_of_size(mnt + "/inner/large", 81920);
    outcome result = run(RUNDU, {mnt + "/", "telvzdu.trm"}, in_data_directory());
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(read_file(data + "/telvzdu.trm"),
              "12\t" + mnt + "/\n8\t" + mnt + "/other\n4\t" + mnt + "/own\n");
}

TEST_F(Rundu, KeepsTheThousandLargestEntries) {
    file_of_size(mnt + "/big", 8192);
    file_of_size(mnt + "/small", 4096);
    for (int number = 0; number < 1200; ++number) {
        char name[32];
        std::snprintf(name, sizeof name, "/f%04d", number);
        write_file(mnt + name, "");
    }
    outcome result = run(RUNDU, {mnt, "telvzdu.trm"}, in_data_directory());
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "rundu.sh: 1000 largest entries of " + mnt + " written to " + data +
                              "/telvzdu.trm\n");
    lines listing = lines_of(read_file(data + "/telvzdu.trm"));
    ASSERT_EQ(listing.size(), 1000u);
    EXPECT_EQ(listing[0], "12\t" + mnt);
    EXPECT_EQ(listing[1], "8\t" + mnt + "/big");
    EXPECT_EQ(listing[2], "4\t" + mnt + "/small");
    for (size_t index = 3; index < listing.size(); ++index) {
        EXPECT_TRUE(listing[index].starts_with("0\t" + mnt + "/f")) << listing[index];
    }
}

TEST_F(Rundu, ReplacesTheFileWholeAndLeavesNoTemporaryFile) {
    file_of_size(mnt + "/only", 4096);
    write_file(data + "/telvzdu.trm", "old listing\n");
    // A second name of the old file keeps its text only if the new listing is a new file.
    ASSERT_EQ(link((data + "/telvzdu.trm").c_str(), (data + "/kept").c_str()), 0);
    outcome result = run(RUNDU, {mnt, "telvzdu.trm"}, in_data_directory());
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(read_file(data + "/telvzdu.trm"), "4\t" + mnt + "/only\n4\t" + mnt + "\n");
    EXPECT_EQ(read_file(data + "/kept"), "old listing\n");
    EXPECT_EQ(tree_of(data), (lines{"kept", "telvzdu.trm"}));
}

TEST_F(Rundu, RefusesBadArgumentsAndWritesNothing) {
    write_file(data + "/telvzdu.trm", "old\n");
    make_directory(scratch + "/plain");
    ASSERT_EQ(symlink(mnt.c_str(), (scratch + "/link").c_str()), 0);
    write_file(mnt + "/file", "");
    struct example {
        std::vector<std::string> arguments;
        std::string data_dir;
        std::string message;
    };
    const std::string usage = "usage: rundu.sh MOUNT FILE";
    const std::string bad_name =
        "the file is not a name of letters, digits, '.', '_' and '-' that begins with no '.': ";
    std::vector<example> examples = {
        {{}, data, usage},
        {{mnt}, data, usage},
        {{mnt, "telvzdu.trm", "extra"}, data, usage},
        {{"mnt", "telvzdu.trm"}, data, "the mount point is not an absolute path: mnt"},
        {{"", "telvzdu.trm"}, data, "the mount point is not an absolute path: "},
        {{scratch + "/missing", "telvzdu.trm"},
         data,
         "the mount point is not a directory: " + scratch + "/missing"},
        {{mnt + "/file", "telvzdu.trm"},
         data,
         "the mount point is not a directory: " + mnt + "/file"},
        {{scratch + "/plain", "telvzdu.trm"}, data, "not a mount point: " + scratch + "/plain"},
        {{scratch + "/link", "telvzdu.trm"},
         data,
         "the mount point is a symbolic link: " + scratch + "/link"},
        {{mnt, "sub/telvzdu.trm"}, data, bad_name + "sub/telvzdu.trm"},
        {{mnt, "../telvzdu.trm"}, data, bad_name + "../telvzdu.trm"},
        {{mnt, ".."}, data, bad_name + ".."},
        {{mnt, ".hidden"}, data, bad_name + ".hidden"},
        {{mnt, ""}, data, bad_name},
        {{mnt, "a b"}, data, bad_name + "a b"},
        {{mnt, "x;y"}, data, bad_name + "x;y"},
        {{mnt, "telvzdu.trm"}, "data", "the data directory is not an absolute path: data"},
        {{mnt, "telvzdu.trm"}, scratch + "/nodata", "no data directory: " + scratch + "/nodata"},
    };
    if (started_as_root && nobody().found) {
        std::string foreign = scratch + "/foreign";
        make_directory(foreign);
        ASSERT_EQ(chown(foreign.c_str(), nobody().user, nobody().group), 0);
        examples.push_back({{mnt, "telvzdu.trm"},
                            foreign,
                            "the data directory does not belong to user 0: " + foreign});
    }
    for (const example &each : examples) {
        launch how;
        how.environment = {"TELV_DATA_DIR=" + each.data_dir};
        outcome result = run(RUNDU, each.arguments, how);
        EXPECT_EQ(result.status, 2) << each.message;
        EXPECT_EQ(result.out, "") << each.message;
        EXPECT_EQ(result.err, "rundu.sh: " + each.message + "\n");
        EXPECT_EQ(tree_of(data), lines{"telvzdu.trm"}) << each.message;
        EXPECT_EQ(read_file(data + "/telvzdu.trm"), "old\n") << each.message;
    }
    if (started_as_root && nobody().found) {
        EXPECT_EQ(tree_of(scratch + "/foreign"), lines{});
    }
}

TEST_F(Rundu, RunsThroughRunAsRootAsTheMonitorCallsIt) {
    file_of_size(mnt + "/only", 4096);
    launch how = in_data_directory();
    how.environment.push_back("PATH=/nowhere");
    outcome result = run(RUN_AS_ROOT, {"rundu.sh", mnt, "telvzdu.trm"}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out,
              "rundu.sh: 2 largest entries of " + mnt + " written to " + data + "/telvzdu.trm\n");
    EXPECT_EQ(read_file(data + "/telvzdu.trm"), "4\t" + mnt + "/only\n4\t" + mnt + "\n");
}

// ---- cleanupPartition

class CleanupPartition : public OnAMount {
  protected:
    void SetUp() override {
        OnAMount::SetUp();
        if (IsSkipped()) {
            return;
        }
        policy_folder = scratch + "/etc";
        policy = policy_folder + "/cleanup.policy";
        make_directory(policy_folder);
    }

    outcome cleanup(const std::vector<std::string> &arguments) {
        launch how;
        how.environment = {"TELV_CLEANUP_POLICY=" + policy};
        return run(CLEANUP_FOR_TESTS, arguments, how);
    }

    // logs/ with old and new files of both kinds, a hidden old one, one in a subfolder, and an old
    // one outside logs/.
    void make_logs() {
        make_directory(mnt + "/logs");
        make_directory(mnt + "/logs/sub");
        make_directory(mnt + "/other");
        for (const char *name : {"/logs/old.gz", "/logs/old.txt", "/logs/.old.gz",
                                 "/logs/sub/old2.gz", "/logs/sub/keep.txt", "/other/old.gz"}) {
            write_file(mnt + name, "x");
            make_old(mnt + name, 40);
        }
        write_file(mnt + "/logs/new.gz", "x");
        write_file(mnt + "/logs/young.gz", "x");
        make_old(mnt + "/logs/young.gz", 29);
    }

    const lines logs_tree = {
        "logs/",         "logs/.old.gz", "logs/new.gz",       "logs/old.gz",
        "logs/old.txt",  "logs/sub/",    "logs/sub/keep.txt", "logs/sub/old2.gz",
        "logs/young.gz", "other/",       "other/old.gz"};

    std::string policy_folder;
    std::string policy;
};

TEST_F(CleanupPartition, RemovesExactlyTheOldMatchingFilesNamedByThePolicy) {
    make_logs();
    write_file(policy, "# what may go\n\n  \t\n" + mnt + "/\t" + mnt + "/logs/  30   *.gz\r\n");
    outcome result = cleanup({mnt + "/"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "removed " + mnt + "/logs/old.gz\nremoved " + mnt +
                              "/logs/sub/old2.gz\ncleanupPartition: removed 2 files and 0 "
                              "directories from " +
                              mnt + "\n");
    EXPECT_EQ(tree_of(mnt),
              (lines{"logs/", "logs/.old.gz", "logs/new.gz", "logs/old.txt", "logs/sub/",
                     "logs/sub/keep.txt", "logs/young.gz", "other/", "other/old.gz"}));
}

TEST_F(CleanupPartition, DryRunSaysWhatItWouldRemoveAndRemovesNothing) {
    make_logs();
    write_file(policy, mnt + " " + mnt + "/logs 30 *.gz\n");
    outcome result = cleanup({"--dry-run", mnt + "/"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "would remove " + mnt + "/logs/old.gz\nwould remove " + mnt +
                              "/logs/sub/old2.gz\ncleanupPartition: would remove 2 files and 0 "
                              "directories from " +
                              mnt + "\n");
    EXPECT_EQ(tree_of(mnt), logs_tree);
}

TEST_F(CleanupPartition, WithoutAPolicyRemovesNothing) {
    make_logs();
    outcome result = cleanup({mnt + "/"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "cleanupPartition: no clean-up policy at " + policy +
                              ": nothing removed from " + mnt + "\n");
    EXPECT_EQ(tree_of(mnt), logs_tree);
}

TEST_F(CleanupPartition, WithoutAPolicyEntryForTheMountRemovesNothing) {
    make_logs();
    write_file(policy, "/elsewhere /elsewhere/logs 1 *\n# " + mnt + " " + mnt + "/logs 0 *\n" +
                           mnt + "/logs " + mnt + "/logs 0 *\n");
    outcome result = cleanup({mnt + "/"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "cleanupPartition: the clean-up policy at " + policy +
                              " names nothing on " + mnt + ": nothing removed\n");
    EXPECT_EQ(tree_of(mnt), logs_tree);
}

TEST_F(CleanupPartition, NeverFollowsASymbolicLink) {
    std::string outside = scratch + "/outside";
    make_directory(outside);
    make_directory(outside + "/deep");
    write_file(outside + "/old.gz", "x");
    write_file(outside + "/deep/old.gz", "x");
    make_old(outside + "/old.gz", 40);
    make_old(outside + "/deep/old.gz", 40);
    make_directory(mnt + "/logs");
    ASSERT_EQ(symlink((outside + "/old.gz").c_str(), (mnt + "/logs/link.gz").c_str()), 0);
    ASSERT_EQ(symlink((outside + "/deep").c_str(), (mnt + "/logs/linkdir").c_str()), 0);
    ASSERT_EQ(symlink(outside.c_str(), (mnt + "/via-link").c_str()), 0);
    make_old(mnt + "/logs/link.gz", 40);
    make_old(mnt + "/logs/linkdir", 40);
    write_file(policy,
               mnt + " " + mnt + "/logs 30 *\n" + mnt + " " + mnt + "/via-link/deep 30 *\n");
    lines outside_before = tree_of(outside);
    lines mnt_before = tree_of(mnt);
    outcome result = cleanup({mnt + "/"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "cleanupPartition: " + mnt +
                              "/via-link/deep is not a directory (a symbolic link or a file is on "
                              "its path): skipped\ncleanupPartition: removed 0 files and 0 "
                              "directories from " +
                              mnt + "\n");
    EXPECT_EQ(tree_of(outside), outside_before);
    EXPECT_EQ(tree_of(mnt), mnt_before);
    EXPECT_EQ(outside_before, (lines{"deep/", "deep/old.gz", "old.gz"}));
}

TEST_F(CleanupPartition, RemovesOnlyDirectoriesItEmptiedItself) {
    make_directory(mnt + "/logs");
    make_directory(mnt + "/logs/was-empty");
    make_directory(mnt + "/logs/emptied");
    make_directory(mnt + "/logs/emptied/deeper");
    make_directory(mnt + "/logs/mixed");
    make_directory(mnt + "/alone");
    for (const char *name : {"/logs/emptied/old.gz", "/logs/emptied/deeper/old.gz",
                             "/logs/mixed/old.gz", "/alone/old.gz"}) {
        write_file(mnt + name, "x");
        make_old(mnt + name, 40);
    }
    write_file(mnt + "/logs/mixed/keep.txt", "x");
    make_old(mnt + "/logs/was-empty", 40);
    write_file(policy, mnt + " " + mnt + "/logs 30 *.gz\n" + mnt + " " + mnt + "/alone 30 *.gz\n");
    outcome result = cleanup({mnt + "/"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "removed " + mnt + "/logs/emptied/deeper/old.gz\nremoved directory " +
                              mnt + "/logs/emptied/deeper\nremoved " + mnt +
                              "/logs/emptied/old.gz\nremoved directory " + mnt +
                              "/logs/emptied\nremoved " + mnt + "/logs/mixed/old.gz\nremoved " +
                              mnt +
                              "/alone/old.gz\ncleanupPartition: removed 4 files and 2 "
                              "directories from " +
                              mnt + "\n");
    EXPECT_EQ(tree_of(mnt),
              (lines{"alone/", "logs/", "logs/mixed/", "logs/mixed/keep.txt", "logs/was-empty/"}));
}

TEST_F(CleanupPartition, StaysOnTheFileSystemOfTheMount) {
    make_directory(mnt + "/logs");
    make_directory(mnt + "/logs/bound");
    make_directory(mnt + "/other");
    std::string why;
    ASSERT_TRUE(mount_tmpfs(mnt + "/logs/nested", &why)) << why;
    // The same file system mounted a second time inside: still another mount.
    ASSERT_TRUE(bind(mnt + "/other", mnt + "/logs/bound"));
    for (const char *name : {"/logs/old.gz", "/logs/nested/old.gz", "/other/old.gz"}) {
        write_file(mnt + name, "x");
        make_old(mnt + name, 40);
    }
    write_file(policy,
               mnt + " " + mnt + "/logs 30 *.gz\n" + mnt + " " + mnt + "/logs/nested 30 *.gz\n");
    outcome result = cleanup({mnt + "/"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "removed " + mnt + "/logs/old.gz\ncleanupPartition: " + mnt +
                              "/logs/nested is not on the file system of " + mnt +
                              ": skipped\ncleanupPartition: removed 1 file and 0 directories "
                              "from " +
                              mnt + "\n");
    EXPECT_EQ(read_file(mnt + "/logs/nested/old.gz"), "x");
    EXPECT_EQ(read_file(mnt + "/other/old.gz"), "x");
}

TEST_F(CleanupPartition, ListsTheFirstHundredAndCountsTheRest) {
    make_directory(mnt + "/logs");
    for (int number = 0; number < 150; ++number) {
        char name[32];
        std::snprintf(name, sizeof name, "/logs/%03d.gz", number);
        write_file(mnt + name, "x");
        make_old(mnt + name, 40);
    }
    write_file(policy, mnt + " " + mnt + "/logs 30 *.gz\n");
    outcome result = cleanup({mnt + "/"});
    EXPECT_EQ(result.status, 0);
    lines shown = lines_of(result.out);
    ASSERT_EQ(shown.size(), 101u);
    EXPECT_EQ(shown[0], "removed " + mnt + "/logs/000.gz");
    EXPECT_EQ(shown[99], "removed " + mnt + "/logs/099.gz");
    EXPECT_EQ(shown[100], "cleanupPartition: removed 150 files and 0 directories from " + mnt +
                              ", the first 100 listed above");
    EXPECT_EQ(tree_of(mnt), lines{"logs/"});
}

TEST_F(CleanupPartition, RefusesWhatIsNoMountPoint) {
    make_logs();
    write_file(policy, mnt + "/logs " + mnt + "/logs 0 *\n");
    ASSERT_EQ(symlink(mnt.c_str(), (scratch + "/link").c_str()), 0);
    struct example {
        std::string argument;
        std::string message;
    };
    const std::vector<example> examples = {
        {mnt + "/logs/", mnt + "/logs is not a mount point"},
        {scratch + "/link/", scratch +
                                 "/link is not a directory (a symbolic link or a file is on its "
                                 "path)"},
        {scratch + "/link/logs/", scratch +
                                      "/link/logs is not a directory (a symbolic link or a file "
                                      "is on its path)"},
        {mnt + "/logs/old.gz/", mnt + "/logs/old.gz is not a directory (a symbolic link or a file "
                                      "is on its path)"},
        {scratch + "/missing/", "cannot open " + scratch + "/missing: No such file or directory"},
    };
    for (const example &each : examples) {
        outcome result = cleanup({each.argument});
        EXPECT_EQ(result.status, 2) << each.argument;
        EXPECT_EQ(result.out, "") << each.argument;
        EXPECT_EQ(result.err, "cleanupPartition: " + each.message + "\n");
    }
    EXPECT_EQ(tree_of(mnt), logs_tree);
}

TEST_F(CleanupPartition, TakesTheRootAsTheMonitorWritesIt) {
    write_file(policy, "/ /nonexistent-telvzmnd-cleanup-test 0 *\n");
    for (const std::string argument : {"//", "/"}) {
        outcome result = cleanup({argument});
        EXPECT_EQ(result.status, 0) << argument;
        EXPECT_EQ(result.err, "") << argument;
        EXPECT_EQ(result.out,
                  "cleanupPartition: /nonexistent-telvzmnd-cleanup-test does not exist: nothing to "
                  "remove there\ncleanupPartition: removed 0 files and 0 directories from /\n");
    }
}

TEST_F(CleanupPartition, RefusesAPolicyThatAnotherUserCouldHaveWritten) {
    make_logs();
    const std::string entry = mnt + " " + mnt + "/logs 0 *\n";
    const std::string unusable =
        "cleanupPartition: the clean-up policy cannot be used: nothing removed from " + mnt + "\n";
    struct example {
        std::string name;
        std::function<void()> prepare;
        std::string message;
    };
    std::vector<example> examples = {
        {"writable by the group", [&] { write_file(policy, entry, 0664); },
         "the policy " + policy + " is writable by others than root"},
        {"writable by all", [&] { write_file(policy, entry, 0646); },
         "the policy " + policy + " is writable by others than root"},
        {"in a folder all may write",
         [&] {
             write_file(policy, entry, 0644);
             EXPECT_EQ(chmod(policy_folder.c_str(), 0777), 0);
         },
         "the folder of the policy, " + policy_folder + ", is writable by others than root"},
        {"a symbolic link",
         [&] {
             EXPECT_EQ(chmod(policy_folder.c_str(), 0755), 0);
             write_file(scratch + "/real.policy", entry, 0644);
             EXPECT_EQ(unlink(policy.c_str()), 0);
             EXPECT_EQ(symlink((scratch + "/real.policy").c_str(), policy.c_str()), 0);
         },
         "cannot open the policy " + policy + ": Too many levels of symbolic links"},
        {"a folder",
         [&] {
             EXPECT_EQ(unlink(policy.c_str()), 0);
             EXPECT_EQ(mkdir(policy.c_str(), 0755), 0);
         },
         "the policy " + policy + " is not a regular file"},
    };
    if (started_as_root && nobody().found) {
        examples.push_back({"another user's",
                            [&] {
                                EXPECT_EQ(rmdir(policy.c_str()), 0);
                                write_file(policy, entry, 0644);
                                EXPECT_EQ(chown(policy.c_str(), nobody().user, nobody().group), 0);
                            },
                            "the policy " + policy + " does not belong to root"});
    }
    for (const example &each : examples) {
        each.prepare();
        outcome result = cleanup({mnt + "/"});
        EXPECT_EQ(result.status, 1) << each.name;
        EXPECT_EQ(result.err, "cleanupPartition: " + each.message + "\n") << each.name;
        EXPECT_EQ(result.out, unusable) << each.name;
        EXPECT_EQ(tree_of(mnt), logs_tree) << each.name;
    }
}

TEST_F(CleanupPartition, RefusesAPolicyWithAMalformedLineWhole) {
    make_logs();
    const std::string valid = mnt + " " + mnt + "/logs 0 *\n";
    const std::string not_normal = "\" is not an absolute path without \".\" or \"..\"";
    struct example {
        std::string line;
        std::string reason;
    };
    const std::vector<example> examples = {
        {mnt + " " + mnt + "/logs 30",
         "wants four fields, MOUNT DIRECTORY DAYS PATTERN, and has 3"},
        {mnt + " " + mnt + "/logs 30 *.gz extra",
         "wants four fields, MOUNT DIRECTORY DAYS PATTERN, and has 5"},
        {"mnt " + mnt + "/logs 30 *.gz", "the mount point \"mnt" + not_normal},
        {mnt + " logs 30 *.gz", "the directory \"logs" + not_normal},
        {mnt + " " + mnt + "/../etc 30 *", "the directory \"" + mnt + "/../etc" + not_normal},
        {mnt + " " + mnt + "//logs 30 *", "the directory \"" + mnt + "//logs" + not_normal},
        {mnt + " /etc 30 *", "the directory /etc is not inside " + mnt},
        {mnt + " " + mnt + "x/logs 30 *", "the directory " + mnt + "x/logs is not inside " + mnt},
        {mnt + " " + mnt + "/logs 3x *", "the days \"3x\" are not a whole number from 0 to 100000"},
        {mnt + " " + mnt + "/logs -1 *", "the days \"-1\" are not a whole number from 0 to 100000"},
        {mnt + " " + mnt + "/logs 100001 *",
         "the days \"100001\" are not a whole number from 0 to 100000"},
        {mnt + " " + mnt + "/logs 30 a/b", "the pattern \"a/b\" matches names, so has no \"/\""},
    };
    for (const example &each : examples) {
        write_file(policy, valid + each.line + "\n");
        outcome result = cleanup({mnt + "/"});
        EXPECT_EQ(result.status, 1) << each.line;
        EXPECT_EQ(result.err,
                  "cleanupPartition: the policy " + policy + ", line 2: " + each.reason + "\n");
        EXPECT_EQ(result.out,
                  "cleanupPartition: the clean-up policy cannot be used: nothing removed from " +
                      mnt + "\n");
        EXPECT_EQ(tree_of(mnt), logs_tree) << each.line;
    }
}

TEST_F(CleanupPartition, RefusesAWrongCommandLine) {
    const std::string usage = "cleanupPartition: usage: cleanupPartition [--dry-run] MOUNT\n";
    const std::string not_normal = "\" is not an absolute path without \".\" or \"..\"\n";
    struct example {
        std::vector<std::string> arguments;
        std::string message;
    };
    const std::vector<example> examples = {
        {{}, usage},
        {{"--dry-run"}, usage},
        {{"--force", mnt + "/"}, usage},
        {{mnt + "/", "--dry-run"}, usage},
        {{mnt + "/", mnt + "/"}, usage},
        {{"mnt/"}, "cleanupPartition: the mount point \"mnt/" + not_normal},
        {{mnt + "/../mnt/"},
         "cleanupPartition: the mount point \"" + mnt + "/../mnt/" + not_normal},
    };
    for (const example &each : examples) {
        outcome result = cleanup(each.arguments);
        EXPECT_EQ(result.status, 2) << each.message;
        EXPECT_EQ(result.out, "");
        EXPECT_EQ(result.err, each.message);
    }
}

// ---- lsmon.sh

// Why the listing is not laid out as the open files check reads it; empty when it is: each
// directory a header "/proc/<pid>/fd:", then "total N", then its descriptors, with a blank line
// before every header but the first.
std::string layout_problem(const std::string &listing) {
    if (listing.empty() || listing.back() != '\n') {
        return "does not end with a line feed";
    }
    lines all = lines_of(listing);
    auto is_header = [](const std::string &line) {
        return line.size() > 10 && line.starts_with("/proc/") && line.ends_with("/fd:") &&
               std::all_of(line.begin() + 6, line.end() - 4,
                           [](char c) { return c >= '0' && c <= '9'; });
    };
    for (size_t index = 0; index < all.size(); ++index) {
        const std::string &line = all[index];
        bool header = is_header(line);
        if (index == 0 && !header) {
            return "begins with \"" + line + "\"";
        }
        if (header && index > 0 && !all[index - 1].empty()) {
            return "no blank line before \"" + line + "\"";
        }
        if (header && (index + 1 == all.size() || !all[index + 1].starts_with("total "))) {
            return "no total after \"" + line + "\"";
        }
        if (line.empty() && (index + 1 == all.size() || !is_header(all[index + 1]))) {
            return "a blank line that precedes no header, at line " + std::to_string(index + 1);
        }
    }
    return "";
}

class Lsmon : public Scratch {};

TEST_F(Lsmon, ListsEveryDescriptorDirectoryInTheLayoutTheCheckCounts) {
    const lines targets = {"/dev/null",
                           "/dev/null",
                           "/dev/null",
                           scratch + "/first",
                           scratch + "/with blank",
                           scratch + "/line\nfeed"};
    for (size_t index = 3; index < targets.size(); ++index) {
        write_file(targets[index], "");
    }
    // A child that holds exactly these descriptors, 0 to 5, until it is killed.
    pid_t holder = fork();
    if (holder == 0) {
        close_range(0, ~0U, 0);
        for (const std::string &target : targets) {
            open(target.c_str(), O_RDONLY);
        }
        for (;;) {
            pause();
        }
    }
    ASSERT_GT(holder, 0);
    std::string last = "/proc/" + std::to_string(holder) + "/fd/5";
    for (int wait = 0; wait < 500 && access(last.c_str(), F_OK) != 0; ++wait) {
        usleep(10000);
    }
    outcome result = run(LSMON, {});
    kill(holder, SIGKILL);
    waitpid(holder, nullptr, 0);

    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(layout_problem(result.out), "");
    lines all = lines_of(result.out);
    std::string header = "/proc/" + std::to_string(holder) + "/fd:";
    auto at = std::find(all.begin(), all.end(), header);
    ASSERT_NE(at, all.end()) << result.out.substr(0, 2000);
    ASSERT_GE(all.end() - at, 8);
    EXPECT_EQ(at[1], "total 0");
    const lines shown_targets = {"/dev/null",
                                 "/dev/null",
                                 "/dev/null",
                                 scratch + "/first",
                                 scratch + "/with blank",
                                 scratch + "/line?feed"};
    for (size_t descriptor = 0; descriptor < shown_targets.size(); ++descriptor) {
        const std::string &line = at[2 + static_cast<long>(descriptor)];
        EXPECT_TRUE(line.starts_with("lr-x------ 1 ")) << line;
        EXPECT_TRUE(
            line.ends_with(" " + std::to_string(descriptor) + " -> " + shown_targets[descriptor]))
            << line;
    }
    // One line per descriptor, then the blank line before the next directory, or the end.
    std::string after = at + 8 == all.end() ? "" : at[8];
    EXPECT_EQ(after, "");
}

TEST_F(Lsmon, ProcessesEndingWhileItListsDoNotFailIt) {
    // Processes that keep starting and ending while the listing runs.
    std::vector<pid_t> churners;
    for (int count = 0; count < 4; ++count) {
        churners.push_back(start("/bin/sh", {"-c", "while :; do /bin/true; done"}, launch{}));
    }
    for (int round = 0; round < 20; ++round) {
        outcome result = run(LSMON, {});
        EXPECT_EQ(result.status, 0) << round;
        EXPECT_EQ(result.err, "") << round;
        EXPECT_EQ(layout_problem(result.out), "") << round;
    }
    for (pid_t churner : churners) {
        kill(churner, SIGKILL);
        waitpid(churner, nullptr, 0);
    }
}

TEST_F(Lsmon, DirectoriesItCannotReadDoNotFailIt) {
    nobody_user other = nobody();
    if (!started_as_root || !other.found) {
        GTEST_SKIP() << "needs root, to list root's processes as the user nobody";
    }
    // A copy the other user can reach, whatever the folders above the build allow.
    ASSERT_EQ(chmod(scratch.c_str(), 0755), 0);
    const std::string reachable = scratch + "/lsmon.sh";
    copy_program(LSMON, reachable);
    launch how;
    how.as_other_user = true;
    how.user = other.user;
    how.group = other.group;
    outcome result = run(reachable, {}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(layout_problem(result.out), "");
    lines all = lines_of(result.out);
    std::string own_header = "/proc/" + std::to_string(getpid()) + "/fd:";
    EXPECT_EQ(std::find(all.begin(), all.end(), own_header), all.end());
}

TEST_F(Lsmon, TakesNoArguments) {
    outcome result = run(LSMON, {"/proc/1/fd"});
    EXPECT_EQ(result.status, 2);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "lsmon.sh: usage: lsmon.sh (no arguments)\n");
}

TEST_F(Lsmon, RunsThroughRunAsRootAsTheMonitorCallsIt) {
    launch how;
    how.environment = {"PATH=/nowhere"};
    outcome result = run(RUN_AS_ROOT, {"lsmon.sh"}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(layout_problem(result.out), "");
    lines all = lines_of(result.out);
    std::string own_header = "/proc/" + std::to_string(getpid()) + "/fd:";
    EXPECT_NE(std::find(all.begin(), all.end(), own_header), all.end());
}

// ---- telvzstba

// The bound of what telvzstba copies of the trace (README: the last 1 MiB).
constexpr size_t TRACE_DUMP_BYTES = 1048576;

// A data directory holding the trace files of the default platform.
class Telvzstba : public Scratch {
  protected:
    void SetUp() override {
        Scratch::SetUp();
        data = scratch + "/data";
        make_directory(data);
        trace = data + "/telvzmnd.trace";
        previous = trace + ".1";
        dump = data + "/telvzstba.trm";
    }

    launch in_data_directory() const {
        launch how;
        how.environment = {"TELV_DATA_DIR=" + data};
        return how;
    }

    outcome stba(const std::vector<std::string> &arguments = {"all", "telvzstba.trm"}) const {
        return run(STBA, arguments, in_data_directory());
    }

    std::string written(size_t lines_count, size_t bytes) const {
        return "telvzstba: " + std::to_string(lines_count) + " trace lines (" +
               std::to_string(bytes) + " bytes) written to " + data + "/telvzstba.trm\n";
    }

    std::string no_trace_note() const {
        return "telvzstba: no trace found in " + data + "/telvzmnd.trace or " + data +
               "/telvzmnd.trace.1\n";
    }

    std::string left_out(const std::string &name) const {
        return "telvzstba: left out " + data + "/" + name + ": not a regular file of user " +
               std::to_string(getuid()) + "\n";
    }

    std::string data;
    std::string trace;
    std::string previous;
    std::string dump;
};

// Trace line `number` as the platform writes it, 100 bytes with its line feed.
std::string trace_line(int number) {
    char line[128];
    std::snprintf(line, sizeof line, "2026-11-22T02:31:30.123Z 4321 4322 TARNMNDF: line %06d ",
                  number);
    std::string text = line;
    text.resize(99, '.');
    return text + "\n";
}

// Lines `first` to `first + count - 1`.
std::string trace_lines(int first, int count) {
    std::string text;
    for (int number = first; number < first + count; ++number) {
        text += trace_line(number);
    }
    return text;
}

TEST_F(Telvzstba, WritesThePredecessorThenTheCurrentTraceNewestLast) {
    write_file(previous, trace_lines(1, 3));
    write_file(trace, trace_lines(4, 2));
    outcome result = stba();
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, written(5, 500));
    EXPECT_EQ(read_file(dump), trace_lines(1, 5));
    EXPECT_EQ(tree_of(data), (lines{"telvzmnd.trace", "telvzmnd.trace.1", "telvzstba.trm"}));
    struct stat status {};
    ASSERT_EQ(stat(dump.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0640u);
    EXPECT_EQ(status.st_uid, getuid());
    // The trace files are read, never changed.
    EXPECT_EQ(read_file(previous), trace_lines(1, 3));
    EXPECT_EQ(read_file(trace), trace_lines(4, 2));
}

TEST_F(Telvzstba, TakesEitherFileAlone) {
    write_file(trace, trace_lines(1, 2));
    outcome current_only = stba();
    EXPECT_EQ(current_only.status, 0);
    EXPECT_EQ(current_only.err, "");
    EXPECT_EQ(current_only.out, written(2, 200));
    EXPECT_EQ(read_file(dump), trace_lines(1, 2));

    ASSERT_EQ(rename(trace.c_str(), previous.c_str()), 0);
    outcome previous_only = stba();
    EXPECT_EQ(previous_only.status, 0);
    EXPECT_EQ(previous_only.err, "");
    EXPECT_EQ(previous_only.out, written(2, 200));
    EXPECT_EQ(read_file(dump), trace_lines(1, 2));
}

TEST_F(Telvzstba, TakesAPredecessorThatIsTheCurrentFileOnlyOnce) {
    write_file(trace, trace_lines(1, 2));
    ASSERT_EQ(link(trace.c_str(), previous.c_str()), 0);
    outcome result = stba();
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, written(2, 200));
    EXPECT_EQ(read_file(dump), trace_lines(1, 2));
}

TEST_F(Telvzstba, KeepsTheLastWholeLinesWithinTheBound) {
    // 1,400,000 bytes of 100-byte lines: the bound begins 24 bytes into line 3,515, so it holds
    // the 10,485 whole lines from 3,516 on.
    write_file(previous, trace_lines(1, 8000));
    write_file(trace, trace_lines(8001, 6000));
    outcome result = stba();
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, written(10485, 1048500));
    std::string text = read_file(dump);
    EXPECT_EQ(text.size(), 1048500u);
    EXPECT_TRUE(text == trace_lines(3516, 10485)) << text.substr(0, 200);

    // A current file larger than the bound by itself leaves its predecessor out.
    write_file(trace, trace_lines(20001, 11000));
    outcome current_only = stba();
    EXPECT_EQ(current_only.status, 0);
    EXPECT_EQ(current_only.out, written(10485, 1048500));
    text = read_file(dump);
    EXPECT_TRUE(text == trace_lines(20516, 10485)) << text.substr(0, 200);
}

TEST_F(Telvzstba, KeepsALineThatBeginsRightAtTheBound) {
    // Lines of exactly the bound together, after a line that ends where the bound begins.
    const std::string first = "2026-11-22T02:31:30.123Z 4321 4322 TARNMNDF: just outside\n";
    std::string within = trace_lines(1, 10485);
    within += std::string(TRACE_DUMP_BYTES - within.size() - 1, 'x') + "\n";
    ASSERT_EQ(within.size(), TRACE_DUMP_BYTES);
    write_file(previous, first + within.substr(0, 500000));
    write_file(trace, within.substr(500000));
    outcome result = stba();
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.out, written(10486, TRACE_DUMP_BYTES));
    EXPECT_TRUE(read_file(dump) == within);

    // Two bytes more, and the first of those lines no longer fits whole: it is left out.
    write_file(trace, within.substr(500000) + "y\n");
    outcome longer = stba();
    EXPECT_EQ(longer.status, 0);
    EXPECT_EQ(longer.out, written(10486, TRACE_DUMP_BYTES - 98));
    EXPECT_TRUE(read_file(dump) == within.substr(100) + "y\n");
}

TEST_F(Telvzstba, WithoutATraceWritesANote) {
    outcome result = stba();
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "telvzstba: no trace found, a note saying so written to " + data +
                              "/telvzstba.trm\n");
    EXPECT_EQ(read_file(dump), no_trace_note());
    EXPECT_EQ(tree_of(data), lines{"telvzstba.trm"});
    struct stat status {};
    ASSERT_EQ(stat(dump.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0640u);

    // Empty trace files hold no trace either.
    write_file(trace, "");
    write_file(previous, "");
    outcome empty = stba();
    EXPECT_EQ(empty.status, 0);
    EXPECT_EQ(empty.err, "");
    EXPECT_EQ(read_file(dump), no_trace_note());
}

TEST_F(Telvzstba, LeavesOutATraceThatIsNoRegularFileOfItsUser) {
    // A link to a file the running user could not read itself, and a pipe that no one writes to.
    std::string secret = scratch + "/secret";
    write_file(secret, "not the trace\n", 0600);
    ASSERT_EQ(symlink(secret.c_str(), trace.c_str()), 0);
    ASSERT_EQ(mkfifo(previous.c_str(), 0644), 0);
    outcome result = stba();
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, left_out("telvzmnd.trace") + left_out("telvzmnd.trace.1"));
    EXPECT_EQ(read_file(dump), no_trace_note());

    ASSERT_EQ(unlink(previous.c_str()), 0);
    make_directory(previous);
    write_file(data + "/elsewhere", trace_lines(1, 1));
    ASSERT_EQ(unlink(trace.c_str()), 0);
    ASSERT_EQ(symlink("elsewhere", trace.c_str()), 0);
    outcome relative_link = stba();
    EXPECT_EQ(relative_link.status, 0);
    EXPECT_EQ(relative_link.err, left_out("telvzmnd.trace") + left_out("telvzmnd.trace.1"));
    EXPECT_EQ(read_file(dump), no_trace_note());

    nobody_user other = nobody();
    if (started_as_root && other.found) {
        ASSERT_EQ(unlink(trace.c_str()), 0);
        write_file(trace, trace_lines(1, 2));
        ASSERT_EQ(chown(trace.c_str(), other.user, other.group), 0);
        ASSERT_EQ(rmdir(previous.c_str()), 0);
        write_file(previous, trace_lines(3, 1));
        outcome foreign = stba();
        EXPECT_EQ(foreign.status, 0);
        EXPECT_EQ(foreign.err, left_out("telvzmnd.trace"));
        EXPECT_EQ(foreign.out, written(1, 100));
        EXPECT_EQ(read_file(dump), trace_lines(3, 1));
    }
}

TEST_F(Telvzstba, ReadsOnlyTheDefaultTraceName) {
    std::string moved = scratch + "/moved.trace";
    write_file(moved, trace_lines(1, 1));
    write_file(trace, trace_lines(2, 1));
    launch how = in_data_directory();
    how.environment.push_back("TELV_TRACE_FILE=" + moved);
    outcome result = run(STBA, {"all", "telvzstba.trm"}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(read_file(dump), trace_lines(2, 1));
}

TEST_F(Telvzstba, ReplacesTheFileWholeAndLeavesNoTemporaryFile) {
    write_file(trace, trace_lines(1, 2));
    write_file(dump, "old dump\n");
    // A second name of the old file keeps its text only if the new dump is a new file.
    ASSERT_EQ(link(dump.c_str(), (data + "/kept").c_str()), 0);
    outcome result = stba();
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(read_file(dump), trace_lines(1, 2));
    EXPECT_EQ(read_file(data + "/kept"), "old dump\n");
    EXPECT_EQ(tree_of(data), (lines{"kept", "telvzmnd.trace", "telvzstba.trm"}));
}

TEST_F(Telvzstba, RefusesBadArgumentsAndWritesNothing) {
    write_file(trace, trace_lines(1, 1));
    write_file(previous, trace_lines(2, 1));
    write_file(dump, "old\n");
    struct example {
        std::vector<std::string> arguments;
        std::string data_dir;
        std::string message;
    };
    const std::string usage = "usage: telvzstba all FILE";
    const std::string bad_name =
        "the file is not a name of letters, digits, '.', '_' and '-' that begins with no '.': ";
    std::vector<example> examples = {
        {{}, data, usage},
        {{"all"}, data, usage},
        {{"all", "telvzstba.trm", "extra"}, data, usage},
        {{"ALL", "telvzstba.trm"}, data, "unknown dump \"ALL\": the only one is \"all\""},
        {{"", "telvzstba.trm"}, data, "unknown dump \"\": the only one is \"all\""},
        {{"current", "telvzstba.trm"}, data, "unknown dump \"current\": the only one is \"all\""},
        {{"all", "sub/telvzstba.trm"}, data, bad_name + "sub/telvzstba.trm"},
        {{"all", "../telvzstba.trm"}, data, bad_name + "../telvzstba.trm"},
        {{"all", "/tmp/telvzstba.trm"}, data, bad_name + "/tmp/telvzstba.trm"},
        {{"all", ".."}, data, bad_name + ".."},
        {{"all", ".hidden"}, data, bad_name + ".hidden"},
        {{"all", ".telvzmnd.trace.lock"}, data, bad_name + ".telvzmnd.trace.lock"},
        {{"all", ""}, data, bad_name},
        {{"all", "a b"}, data, bad_name + "a b"},
        {{"all", "x;y"}, data, bad_name + "x;y"},
        {{"all", "telvzmnd.trace"}, data, "the file is the trace itself: telvzmnd.trace"},
        {{"all", "telvzmnd.trace.1"}, data, "the file is the trace itself: telvzmnd.trace.1"},
        {{"all", "telvzstba.trm"}, "data", "the data directory is not an absolute path: data"},
        {{"all", "telvzstba.trm"},
         scratch + "/nodata",
         "no data directory: " + scratch + "/nodata"},
    };
    if (started_as_root && nobody().found) {
        std::string foreign = scratch + "/foreign";
        make_directory(foreign);
        ASSERT_EQ(chown(foreign.c_str(), nobody().user, nobody().group), 0);
        examples.push_back({{"all", "telvzstba.trm"},
                            foreign,
                            "the data directory does not belong to user 0: " + foreign});
    }
    for (const example &each : examples) {
        launch how;
        how.environment = {"TELV_DATA_DIR=" + each.data_dir};
        outcome result = run(STBA, each.arguments, how);
        EXPECT_EQ(result.status, 2) << each.message;
        EXPECT_EQ(result.out, "") << each.message;
        EXPECT_EQ(result.err, "telvzstba: " + each.message + "\n");
        EXPECT_EQ(tree_of(data), (lines{"telvzmnd.trace", "telvzmnd.trace.1", "telvzstba.trm"}))
            << each.message;
        EXPECT_EQ(read_file(dump), "old\n") << each.message;
        EXPECT_EQ(read_file(trace), trace_lines(1, 1)) << each.message;
        EXPECT_EQ(read_file(previous), trace_lines(2, 1)) << each.message;
    }
    if (started_as_root && nobody().found) {
        EXPECT_EQ(tree_of(scratch + "/foreign"), lines{});
    }
}

TEST_F(Telvzstba, RunsThroughRunAsRootAsTheMonitorCallsIt) {
    write_file(previous, trace_lines(1, 1));
    write_file(trace, trace_lines(2, 2));
    launch how = in_data_directory();
    how.environment.push_back("PATH=/nowhere");
    outcome result = run(RUN_AS_ROOT, {"telvzstba", "all", "telvzstba.trm"}, how);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, written(3, 300));
    EXPECT_EQ(read_file(dump), trace_lines(1, 3));
}

} // namespace

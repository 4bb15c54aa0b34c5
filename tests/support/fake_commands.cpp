#include "fake_commands.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace fake {
namespace {

[[noreturn]] void give_up(const char *what, const std::string &path) {
    std::fprintf(stderr, "fake_commands: %s %s: %s\n", what, path.c_str(), std::strerror(errno));
    std::abort();
}

// Writes `contents` to `path` through a new file renamed into place: a command that a child still
// runs keeps its old file, and no descriptor open for writing is ever inherited by a child that
// execs the new one (which would fail with "text file busy").
void write_file(const std::string &path, std::string_view contents, mode_t mode) {
    std::string staged = path + ".new";
    int fd = open(staged.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    if (fd == -1) {
        give_up("cannot create", staged);
    }
    size_t done = 0;
    while (done < contents.size()) {
        ssize_t written = write(fd, contents.data() + done, contents.size() - done);
        if (written == -1 && errno == EINTR) {
            continue;
        }
        if (written <= 0) {
            give_up("cannot write", staged);
        }
        done += static_cast<size_t>(written);
    }
    if (close(fd) != 0 || fchmodat(AT_FDCWD, staged.c_str(), mode, 0) != 0 ||
        std::rename(staged.c_str(), path.c_str()) != 0) {
        give_up("cannot finish", path);
    }
}

// `text` as one word of a shell script.
std::string shell_word(std::string_view text) {
    std::string word = "'";
    for (char c : text) {
        if (c == '\'') {
            word += "'\\''";
        } else {
            word += c;
        }
    }
    return word + "'";
}

std::string base_of(const std::string &bin) {
    return std::filesystem::path(bin).parent_path().string();
}

} // namespace

fake_commands::fake_commands(path_mode mode) {
    char pattern[] = "/tmp/tarn-commands-XXXXXX";
    if (mkdtemp(pattern) == nullptr) {
        give_up("cannot make", pattern);
    }
    dir_ = std::string(pattern) + "/bin";
    std::filesystem::create_directories(dir_);
    std::filesystem::create_directories(std::string(pattern) + "/fixtures");
    const char *path = std::getenv("PATH");
    had_path_ = path != nullptr;
    saved_path_ = had_path_ ? path : "";
    std::string new_path = dir_;
    if (mode == path_mode::first && had_path_ && !saved_path_.empty()) {
        new_path += ":" + saved_path_;
    }
    setenv("PATH", new_path.c_str(), 1);
}

fake_commands::~fake_commands() {
    if (had_path_) {
        setenv("PATH", saved_path_.c_str(), 1);
    } else {
        unsetenv("PATH");
    }
    std::error_code ignored;
    std::filesystem::remove_all(base_of(dir_), ignored);
}

std::string fake_commands::path_of(std::string_view name) const {
    return dir_ + "/" + std::string(name);
}

void fake_commands::add(std::string_view name, std::string_view script_text) {
    write_file(path_of(name), script_text, 0755);
}

void fake_commands::add_printing(std::string_view name, std::string_view fixture_text,
                                 int exit_status) {
    std::string fixture = base_of(dir_) + "/fixtures/" + std::string(name);
    write_file(fixture, fixture_text, 0644);
    add(name,
        "#!/bin/sh\ncat " + shell_word(fixture) + "\nexit " + std::to_string(exit_status) + "\n");
}

void fake_commands::add_forwarding(std::string_view name, std::string_view program) {
    add(name, "#!/bin/sh\nexec " + shell_word(program) + " \"$@\"\n");
}

void fake_commands::remove(std::string_view name) {
    std::filesystem::remove(path_of(name));
}

captured_stderr::captured_stderr() {
    char pattern[] = "/tmp/tarn-stderr-XXXXXX";
    int fd = mkstemp(pattern);
    if (fd == -1) {
        give_up("cannot make", pattern);
    }
    path_ = pattern;
    std::fflush(stderr);
    saved_ = dup(STDERR_FILENO);
    dup2(fd, STDERR_FILENO);
    close(fd);
}

captured_stderr::~captured_stderr() {
    restore();
    std::remove(path_.c_str());
}

std::string captured_stderr::text() {
    restore();
    std::ifstream in(path_, std::ios::binary);
    std::ostringstream all;
    all << in.rdbuf();
    return all.str();
}

void captured_stderr::restore() {
    if (saved_ != -1) {
        std::fflush(stderr);
        dup2(saved_, STDERR_FILENO);
        close(saved_);
        saved_ = -1;
    }
}

namespace {
constexpr int UNRELATED_EXIT_STATUS = 42;
}

unrelated_child::unrelated_child() {
    pid_ = fork();
    if (pid_ == 0) {
        _exit(UNRELATED_EXIT_STATUS);
    }
    // Ended, and left unreaped.
    siginfo_t info{};
    waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOWAIT);
}

unrelated_child::~unrelated_child() {
    if (!reaped_) {
        waitpid(pid_, nullptr, 0);
    }
}

bool unrelated_child::still_to_reap() {
    int status = 0;
    reaped_ = waitpid(pid_, &status, WNOHANG) == pid_;
    return reaped_ && WIFEXITED(status) && WEXITSTATUS(status) == UNRELATED_EXIT_STATUS;
}

} // namespace fake

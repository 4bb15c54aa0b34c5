#include "platform_test_support.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <poll.h>
#include <spawn.h>
#include <sstream>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

extern char **environ;

namespace platform_test {

void PlatformTest::SetUp() {
    for (const char *name : VARIABLES) {
        ::unsetenv(name);
    }
    char pattern[] = "/tmp/telv-platform-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir = pattern;
    set_variable("TELV_DATA_DIR", dir);
}

void PlatformTest::TearDown() {
    for (const char *name : VARIABLES) {
        ::unsetenv(name);
    }
    std::error_code ignored;
    std::filesystem::remove_all(dir, ignored);
}

void set_variable(const char *name, const std::string &value) {
    ::setenv(name, value.c_str(), 1);
}

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

std::vector<std::string> lines_of(const std::string &text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) {
        lines.push_back(line);
    }
    return lines;
}

std::vector<std::string> read_lines(const std::string &path) {
    return lines_of(read_file(path));
}

bool exists(const std::string &path) {
    return std::filesystem::exists(path);
}

long file_size(const std::string &path) {
    std::error_code error;
    auto size = std::filesystem::file_size(path, error);
    return error ? -1 : static_cast<long>(size);
}

ChildResult run_child(const std::string &program, const std::vector<std::string> &arguments,
                      const std::vector<std::string> &extra) {
    ChildResult result;
    int out[2];
    int err[2];
    if (::pipe(out) != 0 || ::pipe(err) != 0) {
        return result;
    }
    std::vector<std::string> argument_texts{program};
    argument_texts.insert(argument_texts.end(), arguments.begin(), arguments.end());
    std::vector<char *> argv;
    for (auto &text : argument_texts) {
        argv.push_back(text.data());
    }
    argv.push_back(nullptr);
    std::vector<std::string> environment_texts;
    for (char **entry = environ; *entry != nullptr; ++entry) {
        environment_texts.emplace_back(*entry);
    }
    environment_texts.insert(environment_texts.end(), extra.begin(), extra.end());
    std::vector<char *> envp;
    for (auto &text : environment_texts) {
        envp.push_back(text.data());
    }
    envp.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, out[1], 1);
    posix_spawn_file_actions_adddup2(&actions, err[1], 2);
    posix_spawn_file_actions_addclose(&actions, out[0]);
    posix_spawn_file_actions_addclose(&actions, err[0]);
    pid_t pid = -1;
    int spawned = ::posix_spawn(&pid, program.c_str(), &actions, nullptr, argv.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    ::close(out[1]);
    ::close(err[1]);
    pollfd fds[2] = {{out[0], POLLIN, 0}, {err[0], POLLIN, 0}};
    std::string *sinks[2] = {&result.out, &result.err};
    int open_count = 2;
    while (spawned == 0 && open_count > 0 && ::poll(fds, 2, -1) > 0) {
        for (int i = 0; i < 2; ++i) {
            if (fds[i].fd < 0 || fds[i].revents == 0) {
                continue;
            }
            char chunk[4096];
            ssize_t n = ::read(fds[i].fd, chunk, sizeof chunk);
            if (n > 0) {
                sinks[i]->append(chunk, static_cast<size_t>(n));
            } else {
                fds[i].fd = -1;
                --open_count;
            }
        }
    }
    ::close(out[0]);
    ::close(err[0]);
    int status = 0;
    if (spawned == 0 && ::waitpid(pid, &status, 0) == pid && WIFEXITED(status)) {
        result.exit_status = WEXITSTATUS(status);
    }
    return result;
}

long own_thread_id() {
    return ::syscall(SYS_gettid);
}

} // namespace platform_test

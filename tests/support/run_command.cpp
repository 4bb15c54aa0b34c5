#include "run_command.h"

#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

extern char **environ;

namespace {

std::string slurp(int fd) {
    std::string text;
    char buffer[4096];
    ssize_t n;
    while ((n = read(fd, buffer, sizeof buffer)) > 0) {
        text.append(buffer, static_cast<size_t>(n));
    }
    return text;
}

std::string temporary_file() {
    char name[] = "/tmp/tarn-run-XXXXXX";
    int fd = mkstemp(name);
    if (fd >= 0) {
        close(fd);
    }
    return name;
}

} // namespace

command_result run_command(const std::vector<std::string> &argv) {
    command_result result;
    std::string out_name = temporary_file();
    std::string err_name = temporary_file();
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, out_name.c_str(), O_WRONLY | O_TRUNC, 0);
    posix_spawn_file_actions_addopen(&actions, 2, err_name.c_str(), O_WRONLY | O_TRUNC, 0);
    std::vector<char *> args;
    for (const auto &a : argv) {
        args.push_back(const_cast<char *>(a.c_str()));
    }
    args.push_back(nullptr);
    pid_t pid;
    if (posix_spawn(&pid, args[0], &actions, nullptr, args.data(), environ) == 0) {
        int status = 0;
        waitpid(pid, &status, 0);
        result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }
    posix_spawn_file_actions_destroy(&actions);
    for (auto [name, text] :
         {std::pair{&out_name, &result.out}, std::pair{&err_name, &result.err}}) {
        int fd = open(name->c_str(), O_RDONLY);
        if (fd >= 0) {
            *text = slurp(fd);
            close(fd);
        }
        unlink(name->c_str());
    }
    return result;
}

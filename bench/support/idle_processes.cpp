#include "idle_processes.h"

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>

extern char **environ;

namespace {

// Descriptors 3 to `descriptors` - 1 of a child opened on /dev/null.
posix_spawn_file_actions_t *descriptor_actions(posix_spawn_file_actions_t *actions,
                                               int descriptors) {
    posix_spawn_file_actions_init(actions);
    for (int fd = 3; fd < descriptors; ++fd) {
        posix_spawn_file_actions_addopen(actions, fd, "/dev/null", O_RDONLY, 0);
    }
    return actions;
}

} // namespace

void idle_processes::resize(size_t count, int descriptors) {
    while (pids_.size() > count) {
        pid_t pid = pids_.back();
        pids_.pop_back();
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }
    const char *argv[] = {"sleep", "1000", nullptr};
    posix_spawn_file_actions_t actions;
    descriptor_actions(&actions, descriptors);
    while (pids_.size() < count) {
        pid_t pid = 0;
        int error =
            posix_spawn(&pid, "/bin/sleep", &actions, nullptr, const_cast<char **>(argv), environ);
        if (error != 0) {
            std::fprintf(stderr, "posix_spawn /bin/sleep: %s\n", std::strerror(error));
            std::exit(1);
        }
        pids_.push_back(pid);
    }
    posix_spawn_file_actions_destroy(&actions);
}

int pids_in_proc() {
    int count = 0;
    DIR *directory = opendir("/proc/");
    for (const dirent *found = directory != nullptr ? readdir(directory) : nullptr;
         found != nullptr; found = readdir(directory)) {
        count += std::atoi(found->d_name) != 0 ? 1 : 0;
    }
    if (directory != nullptr) {
        closedir(directory);
    }
    return count;
}

int bare_stat_reads() {
    char text[4096];
    int pids = 0;
    DIR *directory = opendir("/proc/");
    for (const dirent *found = directory != nullptr ? readdir(directory) : nullptr;
         found != nullptr; found = readdir(directory)) {
        int pid = std::atoi(found->d_name);
        if (pid == 0) {
            continue;
        }
        char path[64];
        std::snprintf(path, sizeof path, "/proc/%d/stat", pid);
        int fd = open(path, O_RDONLY | O_CLOEXEC);
        if (fd >= 0) {
            ssize_t got = read(fd, text, sizeof text - 1);
            __asm__ volatile("" : : "r"(got), "r"(text) : "memory"); // the read stays
            close(fd);
        }
        ++pids;
    }
    if (directory != nullptr) {
        closedir(directory);
    }
    return pids;
}

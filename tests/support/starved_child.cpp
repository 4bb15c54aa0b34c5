#include "starved_child.h"

#include <cstdio>
#include <cstdlib>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include "recording_platform.h"

namespace fake {

std::string run_without_descriptors(const std::function<std::string()> &body) {
    int report[2];
    if (pipe(report) != 0) {
        std::perror("starved_child: pipe");
        std::abort();
    }
    pid_t child = fork();
    if (child == 0) {
        close(report[0]);
        // Not rec::reset(): that would remove the data directory the parent still uses.
        rec::clear_traces();
        rlimit limit{64, 64};
        setrlimit(RLIMIT_NOFILE, &limit);
        while (dup(report[1]) != -1) {
        }
        std::string text = body();
        size_t done = 0;
        while (done < text.size()) {
            ssize_t written = write(report[1], text.data() + done, text.size() - done);
            if (written <= 0) {
                _exit(1);
            }
            done += static_cast<size_t>(written);
        }
        _exit(0);
    }
    close(report[1]);
    std::string text;
    char buffer[4096];
    ssize_t got;
    while ((got = read(report[0], buffer, sizeof buffer)) > 0) {
        text.append(buffer, static_cast<size_t>(got));
    }
    close(report[0]);
    int status = 0;
    waitpid(child, &status, 0);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        return "the child failed: status " + std::to_string(status) + "\n" + text;
    }
    return text;
}

} // namespace fake

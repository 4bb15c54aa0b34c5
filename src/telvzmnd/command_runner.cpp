#include "command_runner.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include "tracesvc.h"

extern char **environ;

const char *command_shell = "/bin/bash";

namespace {

// Starts the command with the pipe's write end as its standard output. Both ends of the pipe are
// close-on-exec, so the child inherits no descriptor of the monitor but that one, and it starts
// with no signal blocked and every signal at its default, whatever the host had set up for
// itself. Returns 0, or the error of the spawn.
int spawn_child(const command_spec &command, int write_end, pid_t *child) {
    const char *shell_argv[] = {command_shell, "-c", command.command_line, nullptr};
    const char *const *argv = command.command_line != nullptr ? shell_argv : command.argv;
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    int rc = posix_spawn_file_actions_init(&actions);
    if (rc != 0) {
        return rc;
    }
    rc = posix_spawnattr_init(&attributes);
    if (rc == 0) {
        sigset_t none;
        sigset_t all;
        sigemptyset(&none);
        sigfillset(&all);
        rc = posix_spawn_file_actions_adddup2(&actions, write_end, STDOUT_FILENO);
        rc = rc != 0 ? rc : posix_spawnattr_setsigmask(&attributes, &none);
        rc = rc != 0 ? rc : posix_spawnattr_setsigdefault(&attributes, &all);
        rc = rc != 0 ? rc
                     : posix_spawnattr_setflags(&attributes,
                                                POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
        if (rc == 0) {
            bool search = std::strchr(argv[0], '/') == nullptr;
            rc = (search ? posix_spawnp : posix_spawn)(child, argv[0], &actions, &attributes,
                                                       const_cast<char *const *>(argv), environ);
        }
        posix_spawnattr_destroy(&attributes);
    }
    posix_spawn_file_actions_destroy(&actions);
    return rc;
}

// Hands every line of the stream to the handler, its last byte (the line feed) made NUL unseen.
void read_lines(int read_end, command_line_handler handler, void *context) {
    FILE *stream = fdopen(read_end, "r");
    if (stream == nullptr) {
        close(read_end);
        return;
    }
    char *buffer = nullptr;
    size_t capacity = 0;
    ssize_t length;
    while ((length = getline(&buffer, &capacity, stream)) != -1 && buffer != nullptr) {
        buffer[length - 1] = '\0';
        handler(context, buffer, static_cast<size_t>(length - 1));
    }
    // getline's buffer comes from the C library's allocator, not the monitor's.
    std::free(buffer);
    // Closed before the wait: a child still writing then ends on a broken pipe instead of waiting
    // for a reader that is gone.
    std::fclose(stream);
}

} // namespace

command_outcome run_command(const command_spec &command, command_line_handler handler,
                            void *context) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) == -1) {
        tracesvc_trace("TARNMNDF: rc from %s pipe call is: %d; errno=%d.", command.pipe_word, -1,
                       errno);
        return command_outcome::pipe_failed;
    }
    if (command.starting_trace != nullptr) {
        tracesvc_trace("%s", command.starting_trace);
    }
    pid_t child = 0;
    int spawn_error = spawn_child(command, ends[1], &child);
    close(ends[1]);
    if (spawn_error != 0) {
        tracesvc_trace("TARNMNDF: rc from %s execvp call is: %d; errno=%d.", command.exec_word, -1,
                       spawn_error);
    }
    if (command.started_trace != nullptr) {
        tracesvc_trace("%s", command.started_trace);
    }
    if (spawn_error != 0) {
        close(ends[0]);
        return command_outcome::ran;
    }
    read_lines(ends[0], handler, context);
    // Only our own child is reaped; its status tells the check nothing.
    int status = 0;
    while (waitpid(child, &status, 0) == -1 && errno == EINTR) {
    }
    return command_outcome::ran;
}

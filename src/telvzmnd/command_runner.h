// The one way every check runs a command and reads what it prints: a pipe, a spawned child whose
// standard output is the pipe's write end, and the lines read one by one and handed to the check's
// line handler. Nothing of ours runs in the child: the monitor lives in a multi-threaded host,
// where a forked child could call nothing but async-signal-safe functions.
#pragma once

#include <cstddef>
#include <memory>
#include <type_traits>

// The shell that runs a command line: "/bin/bash" in production; tests point it elsewhere.
extern const char *command_shell;

struct command_spec {
    // Either a command line, run as command_shell "-c" command_line, ...
    const char *command_line;
    // ... or, when command_line is null, a vector of its own ending in null: argv[0] is searched on
    // PATH unless it holds a '/'.
    const char *const *argv;
    // The words that name the command in the traces of a failure: "ps", "free", "df", "df1" ...
    const char *pipe_word;
    const char *exec_word;
    // Trace lines that belong to the child's start, when the check has them: the first is written
    // once the pipe is made, just before the child is started; the second right after the start,
    // whether or not it succeeded. Neither is written when no pipe could be made.
    const char *starting_trace = nullptr;
    const char *started_trace = nullptr;
};

enum class command_outcome {
    pipe_failed, // no pipe, nothing run; the check skips what it does with the output
    ran,         // the child was started, or its start failed (then no line was read)
};

// Called with each line, its line end overwritten with NUL, and the number of bytes read without
// that last one (a line may hold NUL bytes of its own).
using command_line_handler = void (*)(void *context, char *line, size_t length);

command_outcome run_command(const command_spec &command, command_line_handler handler,
                            void *context);

// The same with any callable taking (char *line, size_t length).
template <typename Handler>
command_outcome run_command(const command_spec &command, Handler &&handler) {
    using handler_type = std::remove_reference_t<Handler>;
    return run_command(
        command,
        [](void *context, char *line, size_t length) {
            (*static_cast<handler_type *>(context))(line, length);
        },
        const_cast<void *>(static_cast<const void *>(std::addressof(handler))));
}

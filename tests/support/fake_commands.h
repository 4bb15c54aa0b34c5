// A directory of fake commands for the checks that run programs (ps, free, df, cat, runAsRoot):
// while a fake_commands lives, its directory stands first on PATH (or alone on it), so that the
// monitor, and the shell it starts, find the fakes before the real programs. PATH is put back
// and the directory removed when it goes.
#pragma once

#include <functional>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace fake {

class fake_commands {
  public:
    enum class path_mode {
        first, // the fakes, then the PATH the test had
        only,  // the fakes alone: a program not added is a program that is missing
    };

    explicit fake_commands(path_mode mode = path_mode::first);
    ~fake_commands();
    fake_commands(const fake_commands &) = delete;
    fake_commands &operator=(const fake_commands &) = delete;

    const std::string &dir() const { return dir_; }
    // The absolute path of the command `name` in the directory.
    std::string path_of(std::string_view name) const;

    // An executable `name` holding exactly `script_text` (its first line names the interpreter).
    // Adding a name again replaces the command.
    void add(std::string_view name, std::string_view script_text);
    // A command that prints `fixture_text` byte for byte, whatever its arguments, and then exits
    // with `exit_status`.
    void add_printing(std::string_view name, std::string_view fixture_text, int exit_status = 0);
    // A command that runs the real program at the absolute path `program` with its arguments:
    // for the programs a PATH of the fakes alone must still offer (sort behind a fake ps).
    void add_forwarding(std::string_view name, std::string_view program);
    // Takes the command `name` away again.
    void remove(std::string_view name);

  private:
    std::string dir_;
    std::string saved_path_;
    bool had_path_;
};

// Standard error of the test process sent to a file while the object lives: what a command run by
// the monitor says there (it is never redirected) can be read back.
class captured_stderr {
  public:
    captured_stderr();
    ~captured_stderr();
    captured_stderr(const captured_stderr &) = delete;
    captured_stderr &operator=(const captured_stderr &) = delete;

    // Everything written so far; standard error goes back to where it was.
    std::string text();

  private:
    void restore();
    std::string path_;
    int saved_ = -1;
};

// A child of the test that has ended and is not yet reaped, started before a command runs: only a
// waitpid(-1, ...) could take it away before the test reaps it.
class unrelated_child {
  public:
    unrelated_child();
    ~unrelated_child();
    unrelated_child(const unrelated_child &) = delete;
    unrelated_child &operator=(const unrelated_child &) = delete;

    // True when the child is still there to reap, with its own exit status (and reaps it).
    bool still_to_reap();

  private:
    pid_t pid_;
    bool reaped_ = false;
};

} // namespace fake

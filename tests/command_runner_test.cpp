#include <gtest/gtest.h>

#include <csignal>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "command_runner.h"
#include "fake_commands.h"
#include "recording_platform.h"
#include "starved_child.h"

namespace {

using fake::captured_stderr;
using fake::fake_commands;
using fake::unrelated_child;

// What a handler was given: each line as its bytes, and whether the byte after it was the NUL.
struct captured {
    std::vector<std::string> lines;
    bool all_terminated = true;
};

command_outcome run(const command_spec &command, captured &into) {
    return run_command(command, [&into](char *line, size_t length) {
        into.lines.emplace_back(line, length);
        into.all_terminated = into.all_terminated && line[length] == '\0';
    });
}

// A command line run through the shell, named "sh" in the traces of a failure.
captured run_shell(const char *command_line) {
    captured got;
    EXPECT_EQ(run(command_spec{command_line, nullptr, "sh", "sh"}, got), command_outcome::ran);
    EXPECT_TRUE(got.all_terminated);
    return got;
}

// A vector run without a shell, named "vec" in the traces of a failure.
captured run_vector(std::vector<const char *> argv,
                    command_outcome expected = command_outcome::ran) {
    argv.push_back(nullptr);
    captured got;
    EXPECT_EQ(run(command_spec{nullptr, argv.data(), "vecpipe", "vec"}, got), expected);
    EXPECT_TRUE(got.all_terminated);
    return got;
}

using lines = std::vector<std::string>;

class CommandRunner : public ::testing::Test {
  protected:
    void SetUp() override { rec::reset(); }
    void TearDown() override { command_shell = "/bin/bash"; }

    fake_commands fakes;
};

TEST_F(CommandRunner, LinesReachTheHandlerWithTheLineFeedMadeNul) {
    fakes.add_printing("lister", "alpha\nbeta gamma\n\n  indented\t\n");
    captured got = run_vector({"lister"});
    EXPECT_EQ(got.lines, (lines{"alpha", "beta gamma", "", "  indented\t"}));
    EXPECT_TRUE(rec::traces().empty());
}

TEST_F(CommandRunner, LastLineWithoutALineFeedLosesItsLastCharacter) {
    fakes.add_printing("lister", "one\ntwo");
    EXPECT_EQ(run_vector({"lister"}).lines, (lines{"one", "tw"}));
}

TEST_F(CommandRunner, SingleCharacterWithoutALineFeedBecomesAnEmptyLine) {
    fakes.add_printing("lister", "x");
    EXPECT_EQ(run_vector({"lister"}).lines, (lines{""}));
}

TEST_F(CommandRunner, CarriageReturnBeforeTheLineFeedStaysInTheLine) {
    fakes.add_printing("lister", "dos\r\n");
    EXPECT_EQ(run_vector({"lister"}).lines, (lines{"dos\r"}));
}

TEST_F(CommandRunner, LinesKeepTheirNulBytesAndTheirLength) {
    fakes.add_printing("lister", std::string("ab\0cd\n\0\n\0\0x\n", 12));
    captured got = run_vector({"lister"});
    EXPECT_EQ(got.lines,
              (lines{std::string("ab\0cd", 5), std::string(1, '\0'), std::string("\0\0x", 3)}));
}

TEST_F(CommandRunner, NoOutputGivesNoLine) {
    fakes.add_printing("lister", "");
    EXPECT_TRUE(run_vector({"lister"}).lines.empty());
    EXPECT_TRUE(rec::traces().empty());
}

TEST_F(CommandRunner, HandlerMayBeAConstCallable) {
    fakes.add_printing("lister", "a\nb\n");
    int count = 0;
    const auto count_lines = [&count](char *, size_t) { ++count; };
    const char *argv[] = {"lister", nullptr};
    EXPECT_EQ(run_command(command_spec{nullptr, argv, "lister", "lister"}, count_lines),
              command_outcome::ran);
    EXPECT_EQ(count, 2);
}

TEST_F(CommandRunner, ExitStatusOfTheCommandIsNotLookedAt) {
    fakes.add_printing("lister", "printed\n", 3);
    EXPECT_EQ(run_vector({"lister"}).lines, (lines{"printed"}));
    EXPECT_TRUE(rec::traces().empty());
}

TEST_F(CommandRunner, ShellFormRunsTheCommandLineThroughBash) {
    EXPECT_STREQ(command_shell, "/bin/bash");
    captured got = run_shell("echo $((6 * 7)); echo ${BASH_VERSION:+bash}; printf 'a  b\\n' | cat");
    EXPECT_EQ(got.lines, (lines{"42", "bash", "a  b"}));
}

TEST_F(CommandRunner, ShellFormFindsItsCommandsOnPath) {
    fakes.add_printing("tarn-fake-lister", "from the fake\n");
    EXPECT_EQ(run_shell("tarn-fake-lister | sort").lines, (lines{"from the fake"}));
}

TEST_F(CommandRunner, ShellFormUsesTheShellThatCommandShellNames) {
    fakes.add("fake-shell", "#!/bin/sh\nprintf '[%s]\\n' \"$@\"\n");
    std::string shell = fakes.path_of("fake-shell");
    command_shell = shell.c_str();
    EXPECT_EQ(run_shell("a b").lines, (lines{"[-c]", "[a b]"}));
}

TEST_F(CommandRunner, DirectFormSearchesPathAndPassesEachArgumentWhole) {
    fakes.add("show-args", "#!/bin/sh\nfor a in \"$@\"; do echo \"[$a]\"; done\n");
    EXPECT_EQ(run_vector({"show-args", "x y", "", "$HOME"}).lines,
              (lines{"[x y]", "[]", "[$HOME]"}));
}

TEST_F(CommandRunner, DirectFormRunsAnAbsolutePathWithoutSearching) {
    fake_commands later; // first on PATH now
    fakes.add_printing("which-one", "the one named by its path\n");
    later.add_printing("which-one", "the one first on PATH\n");
    EXPECT_EQ(run_vector({"which-one"}).lines, (lines{"the one first on PATH"}));
    std::string named = fakes.path_of("which-one");
    EXPECT_EQ(run_vector({named.c_str()}).lines, (lines{"the one named by its path"}));
}

TEST_F(CommandRunner, MissingProgramOnPathTracesTheExecWordAndReadsNothing) {
    unrelated_child other;
    captured got = run_vector({"tarn-no-such-program", "arg"});
    EXPECT_TRUE(got.lines.empty());
    EXPECT_EQ(rec::traces(), (lines{"TARNMNDF: rc from vec execvp call is: -1; errno=2."}));
    EXPECT_TRUE(other.still_to_reap());
}

TEST_F(CommandRunner, MissingAbsoluteProgramTracesTheExecWordAndReadsNothing) {
    unrelated_child other;
    captured got = run_vector({"/nonexistent/tarn/program"});
    EXPECT_TRUE(got.lines.empty());
    EXPECT_EQ(rec::traces(), (lines{"TARNMNDF: rc from vec execvp call is: -1; errno=2."}));
    EXPECT_TRUE(other.still_to_reap());
}

TEST_F(CommandRunner, MissingShellTracesTheExecWordAndReadsNothing) {
    unrelated_child other;
    command_shell = "/nonexistent/bash";
    captured got;
    EXPECT_EQ(run(command_spec{"echo never", nullptr, "ps", "ps"}, got), command_outcome::ran);
    EXPECT_TRUE(got.lines.empty());
    EXPECT_EQ(rec::traces(), (lines{"TARNMNDF: rc from ps execvp call is: -1; errno=2."}));
    EXPECT_TRUE(other.still_to_reap());
}

TEST_F(CommandRunner, ProgramThatCannotBeExecutedTracesItsError) {
    fakes.add("not-executable", "#!/bin/sh\necho never\n");
    std::string path = fakes.path_of("not-executable");
    ASSERT_EQ(chmod(path.c_str(), 0644), 0);
    captured got = run_vector({path.c_str()});
    EXPECT_TRUE(got.lines.empty());
    EXPECT_EQ(rec::traces(), (lines{"TARNMNDF: rc from vec execvp call is: -1; errno=13."}));
}

TEST_F(CommandRunner, OnlyItsOwnChildIsReapedAfterARun) {
    unrelated_child other;
    EXPECT_EQ(run_shell("echo done").lines, (lines{"done"}));
    EXPECT_TRUE(other.still_to_reap());
}

// Runs the command where no descriptor is left for its pipe; gives the outcome, the number of
// lines handled and the trace lines, one a line.
lines in_child_without_descriptors(const command_spec &command) {
    std::string text = fake::run_without_descriptors([&command] {
        int handled = 0;
        command_outcome outcome = run_command(command, [&handled](char *, size_t) { ++handled; });
        std::string report = outcome == command_outcome::pipe_failed ? "pipe_failed\n" : "ran\n";
        report += std::to_string(handled) + "\n";
        for (const std::string &trace : rec::traces()) {
            report += trace + "\n";
        }
        return report;
    });
    lines sent;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) {
        sent.push_back(line);
    }
    return sent;
}

TEST_F(CommandRunner, PipeFailureTracesThePipeWordAndRunsNothing) {
    fakes.add("must-not-run", "#!/bin/sh\ntouch \"$0.ran\"\necho ran\n");
    std::string program = fakes.path_of("must-not-run");
    const char *argv[] = {program.c_str(), nullptr};
    EXPECT_EQ(in_child_without_descriptors(command_spec{nullptr, argv, "df1", "df"}),
              (lines{"pipe_failed", "0", "TARNMNDF: rc from df1 pipe call is: -1; errno=24."}));
    EXPECT_FALSE(std::ifstream(program + ".ran").good());
}

TEST_F(CommandRunner, PipeFailureOfTheShellFormTracesThePipeWord) {
    EXPECT_EQ(in_child_without_descriptors(command_spec{"echo never", nullptr, "ps", "ps"}),
              (lines{"pipe_failed", "0", "TARNMNDF: rc from ps pipe call is: -1; errno=24."}));
}

// The descriptors of this process that a child inherits (those without close-on-exec), by number,
// with what each refers to.
std::map<int, std::string> inheritable_descriptors() {
    std::map<int, std::string> found;
    DIR *listing = opendir("/proc/self/fd");
    int own = dirfd(listing);
    for (dirent *entry = readdir(listing); entry != nullptr; entry = readdir(listing)) {
        if (entry->d_name[0] == '.') {
            continue;
        }
        int fd = std::atoi(entry->d_name);
        int flags = fcntl(fd, F_GETFD);
        if (fd == own || flags == -1 || (flags & FD_CLOEXEC) != 0) {
            continue;
        }
        char target[4096] = {};
        std::string link = std::string("/proc/self/fd/") + entry->d_name;
        ssize_t length = readlink(link.c_str(), target, sizeof target - 1);
        found[fd] = std::string(target, length > 0 ? static_cast<size_t>(length) : 0);
    }
    closedir(listing);
    return found;
}

// The descriptors a child has, from its "ls -l /proc/self/fd", without the one ls reads the
// directory through.
std::map<int, std::string> descriptors_of_a_child() {
    std::map<int, std::string> found;
    for (const std::string &line : run_vector({"ls", "-l", "/proc/self/fd"}).lines) {
        size_t arrow = line.find(" -> ");
        if (arrow == std::string::npos) {
            continue; // "total 0"
        }
        size_t number = line.rfind(' ', arrow - 1) + 1;
        int fd = std::atoi(line.substr(number, arrow - number).c_str());
        std::string target = line.substr(arrow + 4);
        if (target.starts_with("/proc/") && target.ends_with("/fd")) {
            continue;
        }
        found[fd] = target;
    }
    return found;
}

TEST_F(CommandRunner, ChildGetsThePipeAsStandardOutputAndNoOtherDescriptorOfOurs) {
    // One descriptor left inheritable on purpose shows that the listing sees what leaks; one
    // closed on exec does not reach the child.
    int leaked = open("/dev/null", O_RDONLY);
    int kept = open("/dev/null", O_RDONLY | O_CLOEXEC);
    ASSERT_NE(leaked, -1);
    ASSERT_NE(kept, -1);
    std::map<int, std::string> expected = inheritable_descriptors();
    std::map<int, std::string> seen = descriptors_of_a_child();
    close(leaked);
    close(kept);

    ASSERT_TRUE(seen.count(1) == 1);
    const std::string pipe = seen[1];
    EXPECT_TRUE(pipe.starts_with("pipe:[")) << pipe;
    // Neither the read end nor a second copy of the write end: the pipe appears once.
    int uses_of_the_pipe = 0;
    for (const auto &[fd, target] : seen) {
        uses_of_the_pipe += target == pipe ? 1 : 0;
    }
    EXPECT_EQ(uses_of_the_pipe, 1);

    expected[1] = pipe;
    EXPECT_EQ(seen, expected);
    EXPECT_EQ(seen.count(leaked), 1u);
    EXPECT_EQ(seen.count(kept), 0u);
}

TEST_F(CommandRunner, ManyMegabytesOfOutputAreReadWhole) {
    constexpr int COUNT = 200000;
    const std::string tail = " 0123456789abcdefghijklmnopqrstuvwxyz";
    std::string command = "seq 1 " + std::to_string(COUNT) + " | sed 's/$/" + tail + "/'";
    captured got = run_shell(command.c_str());
    ASSERT_EQ(got.lines.size(), static_cast<size_t>(COUNT));
    size_t bytes = 0;
    int wrong = 0;
    for (int i = 0; i < COUNT; ++i) {
        wrong += got.lines[static_cast<size_t>(i)] == std::to_string(i + 1) + tail ? 0 : 1;
        bytes += got.lines[static_cast<size_t>(i)].size() + 1;
    }
    EXPECT_EQ(wrong, 0);
    EXPECT_GT(bytes, 8000000u);
}

TEST_F(CommandRunner, OneLineOfManyMegabytesIsReadWhole) {
    captured got = run_shell("head -c 5000000 /dev/zero | tr '\\0' 'z'; echo");
    ASSERT_EQ(got.lines.size(), 1u);
    EXPECT_EQ(got.lines[0], std::string(5000000, 'z'));
}

TEST_F(CommandRunner, StandardErrorOfTheChildIsNotRedirected) {
    captured_stderr errors;
    captured got = run_shell("echo to-standard-output; echo to-standard-error >&2");
    EXPECT_EQ(got.lines, (lines{"to-standard-output"}));
    EXPECT_EQ(errors.text(), "to-standard-error\n");
}

// The signals 1 to 31 set in a mask line of /proc/<pid>/status ("SigBlk:\t0000000000004000");
// the C library's own real-time signals above them are its business.
unsigned long classic_signals(const std::string &status_line) {
    return std::strtoul(status_line.substr(status_line.find('\t') + 1).c_str(), nullptr, 16) &
           0x7FFFFFFFul;
}

TEST_F(CommandRunner, ChildStartsWithNoSignalBlockedOrIgnored) {
    sigset_t blocked;
    sigset_t before;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGTERM);
    sigprocmask(SIG_BLOCK, &blocked, &before);
    struct sigaction ignore {};
    struct sigaction saved {};
    ignore.sa_handler = SIG_IGN;
    sigaction(SIGPIPE, &ignore, &saved);

    captured got = run_shell("grep -E '^Sig(Blk|Ign):' /proc/self/status");
    sigaction(SIGPIPE, &saved, nullptr);
    sigprocmask(SIG_SETMASK, &before, nullptr);

    ASSERT_EQ(got.lines.size(), 2u);
    EXPECT_TRUE(got.lines[0].starts_with("SigBlk:"));
    EXPECT_EQ(classic_signals(got.lines[0]), 0ul);
    EXPECT_TRUE(got.lines[1].starts_with("SigIgn:"));
    EXPECT_EQ(classic_signals(got.lines[1]), 0ul);
}

} // namespace

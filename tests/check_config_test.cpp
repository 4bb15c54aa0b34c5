// tarnmon check-config, run as a service engineer runs it: the built program over files written
// here, with the default platform's data directory in a fresh temporary directory.
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "example_control_file.h"
#include "platform_test_support.h"

namespace {

using platform_test::ChildResult;

std::string env(const char *name) {
    const char *value = std::getenv(name);
    return value != nullptr ? value : "";
}

class CheckConfig : public platform_test::PlatformTest {
  protected:
    std::string write(const std::string &name, const std::string &contents) {
        std::string path = dir + "/" + name;
        std::ofstream out(path, std::ios::binary | std::ios::trunc);
        out << contents;
        return path;
    }
    ChildResult check(const std::vector<std::string> &arguments) {
        std::vector<std::string> all{"check-config"};
        all.insert(all.end(), arguments.begin(), arguments.end());
        return platform_test::run_child(env("TARN_BUILD_DIR") + "/tarnmon", all, {});
    }
    ChildResult check_text(const std::string &contents) {
        return check({write("candidate.trm", contents)});
    }
};

bool contains(const std::string &text, const std::string &part) {
    return text.find(part) != std::string::npos;
}

TEST_F(CheckConfig, ExampleFileIsValid) {
    ChildResult result = check({env("TARN_SOURCE_DIR") + "/examples/telvzopt.trm"});
    EXPECT_EQ(result.exit_status, 0) << result.out << result.err;
    EXPECT_TRUE(contains(result.out, "VALID: the monitor would run with this control file"))
        << result.out;
    EXPECT_FALSE(contains(result.out, "PROBLEM")) << result.out;
    EXPECT_TRUE(contains(result.out, "External checking routines: 5\n"
                                     "  0: tarn_external_check1  resolved\n"
                                     "  1: telvzextra_pressure  resolved\n"
                                     "  2: telvzextra_oom_kills  resolved\n"
                                     "  3: telvzextra_descriptors  resolved\n"
                                     "  4: telvzextra_time_to_full  resolved\n"))
        << result.out;
}

std::string setting_line(const char *keyword, const char *value, const char *unit) {
    char line[256];
    std::snprintf(line, sizeof line, "  %-42s %12s  %s\n", keyword, value, unit);
    return line;
}

TEST_F(CheckConfig, PrintsEverySettingWithItsUnit) {
    ChildResult result = check_text(example::text());
    ASSERT_EQ(result.exit_status, 0) << result.out;
    EXPECT_TRUE(contains(result.out, "Settings:\n" + setting_line("ACTUALLY_RUN", "1",
                                                                  "1 = the monitor runs (the "
                                                                  "keyword takes no value)")))
        << result.out;
    EXPECT_TRUE(contains(result.out, setting_line("CHECKING_INTERVAL", "60",
                                                  "seconds between passes (below 5: 60)")))
        << result.out;
    EXPECT_TRUE(
        contains(result.out, setting_line("MAX_SNAPSHOT_FILE_SIZE", "5000000",
                                          "bytes (the file gives thousands of bytes; at least "
                                          "1545056)")))
        << result.out;
    EXPECT_TRUE(contains(result.out, setting_line("DASD_PERCENT_VAR_WQN_LOG_INODE_THRESHOLD", "900",
                                                  "percent (x10) of inodes of /var/wqn/log")))
        << result.out;
    EXPECT_TRUE(
        contains(result.out, setting_line("CPU_SLEEP_TIME_THRESHOLD", "1100",
                                          "percent (x10) of the checking interval that a sleep may "
                                          "overrun") +
                                 "\nExternal checking routines: 5\n"))
        << result.out;
    EXPECT_TRUE(contains(result.out, "Process log thresholds: 1\n  0: processes matching "
                                     "[appserver]  rss 1500000 KB  dsiz 0 KB  vsize 0 KB  "
                                     "memoryCheckFlag 0\n"))
        << result.out;
    EXPECT_TRUE(contains(result.out, "Process abort thresholds: 1\n  0: processes matching "
                                     "[^appserver$]  rss 3000000 KB  dsiz 0 KB  vsize 0 KB\n"))
        << result.out;
}

TEST_F(CheckConfig, ShowsTheValuesMonitoringStartsWith) {
    std::string text = example::with("CHECKING_INTERVAL", "");
    text = text.substr(0, text.find("TREND_ANALYSIS_NUM_INCREASES")) +
           text.substr(text.find("MAX_SNAPSHOT_FILE_SIZE"));
    ChildResult result = check_text(text);
    EXPECT_EQ(result.exit_status, 0) << result.out;
    EXPECT_TRUE(contains(result.out, setting_line("CHECKING_INTERVAL", "60",
                                                  "seconds between passes (below 5: 60)")))
        << result.out;
    EXPECT_TRUE(contains(result.out, setting_line("TREND_ANALYSIS_NUM_INCREASES", "25",
                                                  "rises in a row that make a trend")))
        << result.out;
}

TEST_F(CheckConfig, WithoutFileReadsTheDataDirectory) {
    write("telvzopt.trm", example::text());
    ChildResult result = check({});
    EXPECT_EQ(result.exit_status, 0) << result.out;
    EXPECT_TRUE(contains(result.out, "Control file: telvzopt.trm in the data directory " + dir))
        << result.out;
}

TEST_F(CheckConfig, MissingDefaultFile) {
    ChildResult result = check({});
    EXPECT_EQ(result.exit_status, 3);
    EXPECT_EQ(result.out, "PROBLEM: the control file telvzopt.trm in the data directory " + dir +
                              " does not exist; without it the monitor does not run (and "
                              "reports nothing)\n");
}

TEST_F(CheckConfig, MissingFile) {
    ChildResult result = check({dir + "/nothing.trm"});
    EXPECT_EQ(result.exit_status, 3);
    EXPECT_EQ(result.out, "PROBLEM: the control file " + dir +
                              "/nothing.trm does not exist; without it the monitor does not run "
                              "(and reports nothing)\n");
}

TEST_F(CheckConfig, UnreadableFile) {
    ChildResult result = check({dir}); // a directory opens but cannot be read
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_EQ(result.out, "PROBLEM: the control file " + dir + " cannot be read (" +
                              std::strerror(EISDIR) +
                              "); the monitor reports 0xE081 and does not run\n");
}

TEST_F(CheckConfig, FileThatCannotBeOpened) {
    std::string plain = write("plain", "x");
    ChildResult result = check({plain + "/telvzopt.trm"});
    EXPECT_EQ(result.exit_status, 3);
    EXPECT_EQ(result.out, "PROBLEM: the control file " + plain +
                              "/telvzopt.trm cannot be opened (" + std::strerror(ENOTDIR) +
                              "); without it the monitor does not run (and reports nothing)\n");
}

TEST_F(CheckConfig, FileOfOneByte) {
    ChildResult result = check_text("\n");
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "/candidate.trm holds fewer than 2 bytes; the monitor "
                                     "reports 0xE081 and does not run\n"))
        << result.out;
}

TEST_F(CheckConfig, EmptyFile) {
    ChildResult result = check_text("");
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "holds fewer than 2 bytes")) << result.out;
}

TEST_F(CheckConfig, ActuallyRunMissing) {
    ChildResult result = check_text(example::with("ACTUALLY_RUN", ""));
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "PROBLEM: ACTUALLY_RUN is missing; the monitor runs only "
                                     "when the file holds a line starting with it\n"))
        << result.out;
    EXPECT_FALSE(contains(result.out, "VALID")) << result.out;
}

TEST_F(CheckConfig, ExpressionThatDoesNotCompileIsNamed) {
    std::string text = example::text() + "PROCESS_LOG_THRESHOLDS 1 2 3 1 [abc\n";
    ChildResult result = check_text(text);
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "the process name expression [[abc] of "
                                     "PROCESS_LOG_THRESHOLDS does not compile ("))
        << result.out;
    EXPECT_TRUE(contains(result.out, "the monitor drops this row without a message\n"))
        << result.out;
    EXPECT_TRUE(contains(result.out, "  1: (empty: its expression did not compile)\n"))
        << result.out;
}

TEST_F(CheckConfig, AbortExpressionThatDoesNotCompileIsNamedWithItsLine) {
    std::string text = "PROCESS_ABORT_THRESHOLDS 1 2 3 a\\{1\n" + example::text();
    ChildResult result = check_text(text);
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "PROBLEM: line 1: the process name expression [a\\{1] of "
                                     "PROCESS_ABORT_THRESHOLDS does not compile ("))
        << result.out;
}

TEST_F(CheckConfig, RoutineThatCannotBeResolved) {
    std::string text = example::with("EXTERNAL_CHECKING_ROUTINE",
                                     "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_no_such_check");
    ChildResult result = check_text(text);
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "the routine tarn_no_such_check of module telvzmnd cannot "
                                     "be resolved (module service result "))
        << result.out;
    EXPECT_TRUE(contains(result.out, "the monitor reports 0xE086 and does not run\n"))
        << result.out;
    EXPECT_TRUE(contains(result.out, "  0: tarn_no_such_check  NOT resolved\n")) << result.out;
    // Told in words only: the event log of the appliance gets no event from a check.
    EXPECT_FALSE(platform_test::exists(event_path()));
}

TEST_F(CheckConfig, RuleThatFailsIsNamedWithValueRuleAndUnit) {
    ChildResult result =
        check_text(example::with("VSZ_MEMORY_THRESHOLD", "VSZ_MEMORY_THRESHOLD 10"));
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "PROBLEM: VSZ_MEMORY_THRESHOLD is 10 (KB of a process's "
                                     "virtual size), but it must be at least 11; the monitor "
                                     "does not run\n"))
        << result.out;
}

TEST_F(CheckConfig, CrossRuleNamesTheOtherSetting) {
    ChildResult result =
        check_text(example::with("RESUME_JAVA_LOG_ON_PERCENT", "RESUME_JAVA_LOG_ON_PERCENT 50"));
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "PROBLEM: RESUME_JAVA_LOG_ON_PERCENT is 50 (percent (x10) "
                                     "of free Java heap), but it must be from 11 to 1000 and "
                                     "not below MINIMUM_JAVA_FREE_SPACE (which is 100); the "
                                     "monitor does not run\n"))
        << result.out;
}

TEST_F(CheckConfig, OnlyTheFirstFailingRuleIsNamed) {
    std::string text = example::with("LOW_FREE_SIZE", "LOW_FREE_SIZE 0");
    size_t at = text.find("NUM_THREADS_THRESHOLD 2000");
    ASSERT_NE(at, std::string::npos);
    text.replace(at, 26, "NUM_THREADS_THRESHOLD 5");
    ChildResult result = check_text(text);
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_TRUE(contains(result.out, "PROBLEM: NUM_THREADS_THRESHOLD is 5")) << result.out;
    EXPECT_FALSE(contains(result.out, "PROBLEM: LOW_FREE_SIZE")) << result.out;
}

TEST_F(CheckConfig, TextBeyond100000BytesIsNotRead) {
    std::string text = example::text();
    while (text.size() < 100000) {
        text += "* padding that the monitor reads and passes over\n";
    }
    text += "VSZ_MEMORY_THRESHOLD 1\n";
    ChildResult result = check_text(text);
    EXPECT_EQ(result.exit_status, 0) << result.out;
    EXPECT_TRUE(contains(result.out, "(100000 bytes read)")) << result.out;
}

TEST_F(CheckConfig, TooManyArguments) {
    ChildResult result = check({"a", "b"});
    EXPECT_EQ(result.exit_status, 2);
    EXPECT_EQ(result.err, "usage: tarnmon check-config [FILE]\n");
}

TEST_F(CheckConfig, HelpIsTheUsageOnStandardOutput) {
    ChildResult result = check({"--help"});
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_EQ(result.out.rfind("usage: tarnmon check-config [FILE]\n", 0), 0u) << result.out;
    EXPECT_EQ(result.err, "");
}

TEST_F(CheckConfig, OptionsAndADashAreNoFileNames) {
    for (const char *word : {"--bogus", "-", "-x"}) {
        ChildResult result = check({word});
        EXPECT_EQ(result.exit_status, 2) << word;
        EXPECT_EQ(result.out, "") << word;
        EXPECT_EQ(result.err, "usage: tarnmon check-config [FILE]\n") << word;
    }
}

TEST_F(CheckConfig, AFileNameBeginningWithADashFollowsTheEndOfOptions) {
    write("-name", example::text());
    std::filesystem::path here = std::filesystem::current_path();
    std::filesystem::current_path(dir);
    ChildResult result = check({"--", "-name"});
    std::filesystem::current_path(here);
    EXPECT_EQ(result.exit_status, 0) << result.out << result.err;
    EXPECT_TRUE(contains(result.out, "Control file: -name (")) << result.out;
}

// Bytes of the file that would drive a terminal: a title change ended by BEL, a screen clear.
TEST_F(CheckConfig, ControlBytesOfTheFileAreShownEscaped) {
    std::string text = example::with("EXTERNAL_CHECKING_ROUTINE",
                                     "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_\x1b[2J\x07"
                                     "check");
    text += "PROCESS_LOG_THRESHOLDS 1 2 3 1 \x1b]0;owned\x07\n";
    text += "PROCESS_ABORT_THRESHOLDS 1 2 3 \x1b[2J\n"; // an open bracket: does not compile
    ChildResult result = check_text(text);
    EXPECT_EQ(result.exit_status, 1);
    for (const std::string *output : {&result.out, &result.err}) {
        for (char c : *output) {
            ASSERT_TRUE(static_cast<unsigned char>(c) >= 0x20 || c == '\n' || c == '\t')
                << static_cast<int>(c) << " in " << *output;
        }
    }
    EXPECT_TRUE(contains(result.out, "  0: tarn_\\x1b[2J\\x07check  NOT resolved\n")) << result.out;
    EXPECT_TRUE(contains(result.out, "the routine tarn_\\x1b[2J\\x07check of module telvzmnd"))
        << result.out;
    EXPECT_TRUE(contains(result.out, "processes matching [\\x1b]0;owned\\x07]")) << result.out;
    EXPECT_TRUE(contains(result.out, "the process name expression [\\x1b[2J] of "
                                     "PROCESS_ABORT_THRESHOLDS does not compile"))
        << result.out;
}

// A check leaves the data directory of the running monitor as it found it.
TEST_F(CheckConfig, AnExplicitFileCreatesNoDataDirectory) {
    std::string candidate = write("candidate.trm", example::text());
    std::string absent = dir + "/data";
    platform_test::set_variable("TELV_DATA_DIR", absent);
    ChildResult result = check({candidate});
    EXPECT_EQ(result.exit_status, 0) << result.out;
    EXPECT_FALSE(platform_test::exists(absent));
}

TEST_F(CheckConfig, TheMonitorsTraceIsLeftAlone) {
    std::string data = dir + "/data";
    std::filesystem::create_directory(data);
    platform_test::set_variable("TELV_DATA_DIR", data);
    std::string trace = "2021-03-05T07:04:09Z 4711 4711 TARNMNDF: a line of the running monitor\n";
    std::ofstream(data + "/telvzmnd.trace", std::ios::binary) << trace;
    std::ofstream(data + "/telvzopt.trm", std::ios::binary) << example::text();

    EXPECT_EQ(check({write("candidate.trm", example::text())}).exit_status, 0);
    EXPECT_EQ(check({}).exit_status, 0); // the monitor's own control file, read its way
    EXPECT_EQ(platform_test::read_file(data + "/telvzmnd.trace"), trace);
    std::vector<std::string> names;
    for (const auto &entry : std::filesystem::directory_iterator(data)) {
        names.push_back(entry.path().filename());
    }
    std::sort(names.begin(), names.end());
    EXPECT_EQ(names, (std::vector<std::string>{"telvzmnd.trace", "telvzopt.trm"}));
}

} // namespace

// Helpers of the default platform's tests: a fresh data directory per test with the platform's
// variables pointing at it, file reading, and child processes with their output.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

namespace platform_test {

// Every variable the platform reads. Each test begins with them unset, then sets TELV_DATA_DIR.
inline constexpr const char *VARIABLES[] = {
    "TELV_DATA_DIR",  "TELV_TRACE_FILE",  "TELV_TRACE_MAX_BYTES", "TELV_TRACE_DETAIL",
    "TELV_EVENT_LOG", "TELV_MODULE_PATH", "TELV_MEMDEBUG_REPORT",
};

class PlatformTest : public ::testing::Test {
  protected:
    void SetUp() override;
    void TearDown() override;

    // The temporary directory of the test, which TELV_DATA_DIR names.
    std::string dir;
    std::string trace_path() const { return dir + "/telvzmnd.trace"; }
    std::string event_path() const { return dir + "/telvzmnd.events"; }
};

void set_variable(const char *name, const std::string &value);

// Whole contents; empty when missing.
std::string read_file(const std::string &path);
// Lines without their line feed: of a text, and of a file.
std::vector<std::string> lines_of(const std::string &text);
std::vector<std::string> read_lines(const std::string &path);
bool exists(const std::string &path);
long file_size(const std::string &path); // -1 when missing

struct ChildResult {
    int exit_status = -1; // the exit code, or -1 when the child did not exit normally
    std::string out;
    std::string err;
};
// Runs `program` with `arguments` and the current environment plus `extra` ("NAME=value"),
// and collects both of its outputs.
ChildResult run_child(const std::string &program, const std::vector<std::string> &arguments,
                      const std::vector<std::string> &extra);

// The kernel's id of the calling thread.
long own_thread_id();

} // namespace platform_test

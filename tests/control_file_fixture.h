// Shared by the control file's tests: a fresh platform and fresh settings for every test, parsing
// of a text, and the release of everything a parse took.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "core/control_file.h"
#include "core/settings.h"
#include "recording_platform.h"

namespace control_file_test {

// Frees what a parse took: the compiled expressions (which the monitor itself never frees), then
// the tables through the monitor's own release.
inline void release_everything() {
    free_compiled_expressions();
    uint32_t crc = 0;
    release_control_file_tables(&crc);
}

class ControlFileTest : public ::testing::Test {
  protected:
    void SetUp() override {
        release_everything();
        rec::reset();
        reset_settings();
    }
    void TearDown() override {
        release_everything();
        EXPECT_TRUE(rec::live_allocations().empty());
    }

    // Parses `text` as the monitor hands it over: NUL-terminated, in a buffer of its own.
    uint32_t parse(const std::string &text) {
        buffer = text;
        crc = 0xDEADBEEF;
        return tarn_parse_control_file(buffer.c_str(), &crc);
    }

    std::string buffer;
    uint32_t crc = 0;
};

// The trace line of the first pass for the 12 words given (missing ones empty).
inline std::string input_line(const char *prefix, const std::vector<std::string> &given) {
    std::string line = prefix;
    size_t n = 0;
    for (const auto &word : given) {
        line += (n == 0 ? "" : " ") + ("[" + word + "]");
        ++n;
    }
    for (; n < 12; ++n) {
        line += n == 0 ? "[]" : " []";
    }
    return line;
}

inline std::string first_pass(const std::vector<std::string> &given) {
    return input_line("TARNMNDF:    Input data = ", given);
}

inline std::string second_pass(const std::vector<std::string> &given) {
    return input_line("TARNMNDF:  second pass Input data = ", given);
}

} // namespace control_file_test

// Fixture trees of /proc files for the routines of libtelvzextra.so: each test writes the files it
// needs into a temporary directory that extra_proc_root names, and may stand in for the kernel log,
// statvfs and the clock. The module's seams and state are put back when the test ends.
#pragma once

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "descriptors.h"
#include "extra_support.h"
#include "oom_kills.h"
#include "pressure.h"
#include "time_to_full.h"

namespace extra_test {

// The file systems statvfs reports, by path; a path not listed fails with `error` (ENOENT by
// default).
struct fake_file_system {
    struct statvfs figures;
    int error; // when not 0, statvfs fails with it
};
inline std::map<std::string, fake_file_system> file_systems;
inline int64_t clock_milliseconds = 0;

inline int fake_statvfs(const char *path, struct statvfs *figures) {
    auto found = file_systems.find(path);
    if (found == file_systems.end() || found->second.error != 0) {
        errno = found == file_systems.end() ? ENOENT : found->second.error;
        return -1;
    }
    *figures = found->second.figures;
    return 0;
}

inline int64_t fake_clock() {
    return clock_milliseconds;
}

// A file system of `blocks` blocks of 4 KiB, `free_blocks` of them free (all available).
inline fake_file_system blocks_of_4k(uint64_t blocks, uint64_t free_blocks) {
    fake_file_system fs{};
    fs.figures.f_bsize = 4096;
    fs.figures.f_frsize = 4096;
    fs.figures.f_blocks = blocks;
    fs.figures.f_bfree = free_blocks;
    fs.figures.f_bavail = free_blocks;
    return fs;
}

// A routine's text, or "(null)" when it handed back nothing.
inline std::string call(void (*routine)(const char *, char **), const char *control = "") {
    char *returned = nullptr;
    routine(control, &returned);
    return returned == nullptr ? std::string("(null)") : std::string(returned);
}

class ExtraTest : public ::testing::Test {
  protected:
    void SetUp() override {
        char pattern[] = "/tmp/extra-test-XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        root = pattern;
        std::filesystem::permissions(root, std::filesystem::perms(0755));
        extra_proc_root = root.c_str();
        kmsg = root + "/kmsg";
        extra_kmsg_path = kmsg.c_str();
        extra_statvfs = fake_statvfs;
        extra_clock = fake_clock;
        file_systems.clear();
        clock_milliseconds = 0;
        forget();
    }

    void TearDown() override {
        reset_extra_seams();
        forget();
        std::filesystem::remove_all(root);
    }

    static void forget() {
        reset_pressure_state();
        reset_oom_kills_state();
        reset_time_to_full_state();
    }

    // Writes `text` to `relative` under the root, making its directories.
    void write(const std::string &relative, std::string_view text) const {
        std::filesystem::path path = root + "/" + relative;
        std::filesystem::create_directories(path.parent_path());
        std::ofstream out(path, std::ios::binary | std::ios::trunc);
        out.write(text.data(), static_cast<std::streamsize>(text.size()));
    }

    void remove(const std::string &relative) const {
        std::filesystem::remove_all(root + "/" + relative);
    }

    std::string root;
    std::string kmsg;
};

// Every line of `text` ends "\n\r" and `text` ends with a line's end.
inline void expect_lines_end_properly(const std::string &text) {
    ASSERT_GE(text.size(), 2u);
    EXPECT_EQ(text.substr(text.size() - 2), "\n\r");
    for (size_t at = text.find('\n'); at != std::string::npos; at = text.find('\n', at + 1)) {
        ASSERT_LT(at + 1, text.size());
        EXPECT_EQ(text[at + 1], '\r') << text;
    }
}

} // namespace extra_test

// The descriptor routine over a fixture /proc of processes: the ranking by share of the soft limit,
// the processes that are unlimited, vanish or cannot be read, the keyword that sets how many are
// listed, and hostile limits and names.
#include <gtest/gtest.h>

#include <algorithm>

#include "extra_fixture.h"

namespace {

using extra_test::call;

std::string limits(const std::string &soft, const std::string &hard = "524288") {
    return "Limit                     Soft Limit           Hard Limit           Units     \n"
           "Max cpu time              unlimited            unlimited            seconds   \n"
           "Max open files            " +
           soft + std::string(soft.size() < 21 ? 21 - soft.size() : 1, ' ') + hard +
           "               files     \n"
           "Max locked memory         8388608              8388608              bytes     \n";
}

class Descriptors : public extra_test::ExtraTest {
  protected:
    // A process with `open` descriptors; an empty limits text leaves the limits file out.
    void process(int pid, const std::string &name, int open, const std::string &limits_text) {
        const std::string dir = std::to_string(pid);
        write(dir + "/comm", name + "\n");
        if (!limits_text.empty()) {
            write(dir + "/limits", limits_text);
        }
        std::filesystem::create_directories(root + "/" + dir + "/fd");
        for (int fd = 0; fd < open; ++fd) {
            write(dir + "/fd/" + std::to_string(fd), "");
        }
    }
};

TEST_F(Descriptors, ProcessesAreRankedByTheShareOfTheirOwnSoftLimit) {
    process(10, "a", 512, limits("1024"));
    process(20, "b", 900, limits("1000"));
    process(30, "c", 3, limits("0")); // a limit of 0 counts as 1
    process(40, "d", 9, limits("unlimited", "unlimited"));
    process(50, "e", 9, limits("abc")); // not a number: skipped
    process(60, "f", 9, "");            // vanished before its limits were read
    process(70, "g", 0, limits("1024"));
    remove("70/fd"); // vanished before its descriptors were counted
    process(80, "h", 256, limits("512"));
    process(90, "i", 1, limits("1024"));
    process(91, "j", 1, limits("18446744073709551616"));
    write("self/limits", limits("1"));
    write("123abc", "");
    write("sys/x", "");
    EXPECT_EQ(call(telvzextra_descriptors),
              "descriptors: 5 largest shares of the soft limit among 5 processes (1 unlimited, 4 "
              "skipped: vanished or not readable)\n\r"
              "descriptors: pid 30 (c) 3 open of 0, 300.00%\n\r"
              "descriptors: pid 20 (b) 900 open of 1000, 90.00%\n\r"
              "descriptors: pid 10 (a) 512 open of 1024, 50.00%\n\r"
              "descriptors: pid 80 (h) 256 open of 512, 50.00%\n\r"
              "descriptors: pid 90 (i) 1 open of 1024, 0.09%\n\r");
}

TEST_F(Descriptors, TheKeywordSetsHowManyAreListed) {
    for (int pid = 1; pid <= 12; ++pid) {
        process(pid, "p" + std::to_string(pid), pid, limits("100"));
    }
    const std::string header = "descriptors: 10 largest shares of the soft limit among 12 "
                               "processes (0 unlimited, 0 skipped: vanished or not readable)\n\r";
    std::string ten = call(telvzextra_descriptors);
    EXPECT_EQ(ten.rfind(header, 0), 0u) << ten;
    EXPECT_NE(ten.find("pid 3 (p3) 3 open of 100, 3.00%\n\r"), std::string::npos) << ten;
    EXPECT_EQ(ten.find("pid 2 (p2)"), std::string::npos) << ten;
    // Values out of range, not numbers, or on a comment line leave the default.
    for (const char *control : {"EXTRA_DESCRIPTORS_LISTED 0\n", "EXTRA_DESCRIPTORS_LISTED 101\n",
                                "EXTRA_DESCRIPTORS_LISTED -3\n", "EXTRA_DESCRIPTORS_LISTED x\n",
                                "*EXTRA_DESCRIPTORS_LISTED 2\n", "EXTRA_DESCRIPTORS_LISTED\n2\n"}) {
        EXPECT_EQ(call(telvzextra_descriptors, control), ten) << control;
    }
    EXPECT_EQ(call(telvzextra_descriptors, "ACTUALLY_RUN\n  EXTRA_DESCRIPTORS_LISTED\t2\n"),
              "descriptors: 2 largest shares of the soft limit among 12 processes (0 unlimited, 0 "
              "skipped: vanished or not readable)\n\r"
              "descriptors: pid 12 (p12) 12 open of 100, 12.00%\n\r"
              "descriptors: pid 11 (p11) 11 open of 100, 11.00%\n\r");
}

TEST_F(Descriptors, NamesAreShownPrintableAndCut) {
    process(7, "ev\til\n\x1b[2J", 1, limits("10"));
    process(8, std::string(300, 'n'), 1, limits("100"));
    process(9, "", 1, limits("1000"));
    remove("9/comm");
    EXPECT_EQ(call(telvzextra_descriptors),
              "descriptors: 3 largest shares of the soft limit among 3 processes (0 unlimited, 0 "
              "skipped: vanished or not readable)\n\r"
              "descriptors: pid 7 (ev?il??[2J) 1 open of 10, 10.00%\n\r"
              "descriptors: pid 8 (" +
                  std::string(PROCESS_NAME_SIZE - 1, 'n') +
                  ") 1 open of 100, 1.00%\n\r"
                  "descriptors: pid 9 () 1 open of 1000, 0.10%\n\r");
}

TEST_F(Descriptors, AHundredListedProcessesFitTheText) {
    for (int pid = 1; pid <= 150; ++pid) {
        process(1000000 + pid, std::string(60, 'a' + pid % 26), pid % 7, limits("1000000000"));
    }
    std::string text = call(telvzextra_descriptors, "EXTRA_DESCRIPTORS_LISTED 100\n");
    extra_test::expect_lines_end_properly(text);
    EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), 101);
    EXPECT_EQ(text.find("truncated"), std::string::npos);
}

TEST_F(Descriptors, RankingKeepsTheLargestSharesThenTheLowestPids) {
    descriptor_share listed[3];
    size_t count = 0;
    for (uint64_t pid : {5, 4, 3, 2, 1}) {
        descriptor_share process{};
        process.pid = pid;
        process.basis_points = pid == 3 ? 9000 : 100;
        count = rank_process(listed, count, 3, process);
    }
    ASSERT_EQ(count, 3u);
    EXPECT_EQ(listed[0].pid, 3u);
    EXPECT_EQ(listed[1].pid, 1u);
    EXPECT_EQ(listed[2].pid, 2u);
}

TEST_F(Descriptors, LimitsParse) {
    EXPECT_EQ(parse_open_files_limit(limits("1024")).soft, 1024u);
    EXPECT_EQ(parse_open_files_limit(limits("unlimited")).kind, open_files_limit::unlimited);
    EXPECT_EQ(parse_open_files_limit("Max open files 7").kind, open_files_limit::value);
    for (const char *text :
         {"", "Max open files", "Max open files -1 2 files", "Max open files unlimitedx 1",
          "Max open files 1x 2", "Max open filesx 5 5"}) {
        EXPECT_EQ(parse_open_files_limit(text).kind, open_files_limit::malformed) << text;
    }
}

TEST_F(Descriptors, OnThisHostTheOwnProcessIsRead) {
    reset_extra_seams();
    std::string text = call(telvzextra_descriptors, "EXTRA_DESCRIPTORS_LISTED 100\n");
    extra_test::expect_lines_end_properly(text);
    EXPECT_EQ(text.rfind("descriptors: ", 0), 0u) << text;
    EXPECT_NE(text.find(" largest shares of the soft limit among "), std::string::npos) << text;
}

} // namespace

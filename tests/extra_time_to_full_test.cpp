// The time-to-full routine over fixture mounts and file systems, a statvfs that reports what the
// test sets and a clock the test moves: which file systems are followed, the rate and time to full
// over several passes, the horizon keyword, and the bounds of the table and of the text.
#include <gtest/gtest.h>

#include <algorithm>

#include "extra_fixture.h"

namespace {

using extra_test::blocks_of_4k;
using extra_test::call;
using extra_test::clock_milliseconds;
using extra_test::file_systems;

const std::string FILESYSTEMS = "nodev\tsysfs\nnodev\ttmpfs\nnodev\tproc\n\text4\n\txfs\n"
                                "nodev\tnfs4\n\tvfat\n\tcifs\n";
const std::string MOUNTS = "sysfs /sys sysfs rw 0 0\n"
                           "proc /proc proc rw 0 0\n"
                           "/dev/sda1 / ext4 rw,relatime 0 0\n"
                           "tmpfs /tmp tmpfs rw 0 0\n"
                           "/dev/sda2 /data xfs rw 0 0\n"
                           "server:/x /net nfs4 rw 0 0\n"
                           "//server/share /share cifs rw 0 0\n"
                           "/dev/sda1 /bind ext4 rw 0 0\n"
                           "/dev/sdb1 /mnt/my\\040disk vfat rw 0 0\n"
                           "/dev/sdc1 /weird btrfs rw 0 0\n";

void expect_part(const std::string &text, const std::string &part) {
    EXPECT_NE(text.find(part), std::string::npos) << text;
}

class TimeToFull : public extra_test::ExtraTest {
  protected:
    void SetUp() override {
        ExtraTest::SetUp();
        write("filesystems", FILESYSTEMS);
        write("self/mounts", MOUNTS);
        file_systems["/"] = blocks_of_4k(1000000, 500000);
        file_systems["/data"] = {};
        file_systems["/data"].error = EACCES;
        file_systems["/mnt/my disk"] = blocks_of_4k(1000, 1000);
    }
};

TEST_F(TimeToFull, LocalFileSystemsGetARateFromTheirSecondPassAndATimeWhereTheyGrow) {
    EXPECT_EQ(call(telvzextra_time_to_full),
              "time to full: / (ext4 on /dev/sda1) used 2000000 of 4000000 KiB, rate known from "
              "the next pass\n\r"
              "time to full: /data (xfs on /dev/sda2) not measured (statvfs: Permission "
              "denied)\n\r"
              "time to full: /mnt/my\\040disk (vfat on /dev/sdb1) used 0 of 4000 KiB, rate known "
              "from the next pass\n\r");

    clock_milliseconds = 3600000;
    file_systems["/"] = blocks_of_4k(1000000, 499000);
    EXPECT_EQ(call(telvzextra_time_to_full),
              "time to full: / (ext4 on /dev/sda1) used 2004000 of 4000000 KiB, +4000 KiB/h over "
              "2 passes, full in 20 d 19 h 00 min\n\r"
              "time to full: /data (xfs on /dev/sda2) not measured (statvfs: Permission "
              "denied)\n\r"
              "time to full: /mnt/my\\040disk (vfat on /dev/sdb1) used 0 of 4000 KiB, +0 KiB/h "
              "over 2 passes, not growing\n\r");

    clock_milliseconds = 7200000;
    file_systems["/"] = blocks_of_4k(1000000, 498000);
    file_systems["/data"] = blocks_of_4k(100, 0);
    file_systems["/mnt/my disk"] = blocks_of_4k(1000, 1010); // more free than there are blocks
    EXPECT_EQ(call(telvzextra_time_to_full, "EXTRA_TIME_TO_FULL_HORIZON 500\n"),
              "time to full: / (ext4 on /dev/sda1) used 2008000 of 4000000 KiB, +4000 KiB/h over "
              "3 passes, full in 20 d 18 h 00 min, within the 500 h horizon\n\r"
              "time to full: /data (xfs on /dev/sda2) used 400 of 400 KiB, rate known from the "
              "next pass\n\r"
              "time to full: /mnt/my\\040disk (vfat on /dev/sdb1) used 0 of 4000 KiB, +0 KiB/h "
              "over 3 passes, not growing\n\r");

    // Used space falls: not growing; a full file system that grows is full now.
    clock_milliseconds = 10800000;
    file_systems["/"] = blocks_of_4k(1000000, 800000);
    file_systems["/data"] = blocks_of_4k(200, 0);
    std::string fourth = call(telvzextra_time_to_full);
    expect_part(fourth, "time to full: / (ext4 on /dev/sda1) used 800000 of 4000000 KiB, -");
    expect_part(fourth, " over 4 passes, not growing\n\r");
    expect_part(fourth, "time to full: /data (xfs on /dev/sda2) used 800 of 800 KiB, +400 "
                        "KiB/h over 2 passes, full now\n\r");
}

TEST_F(TimeToFull, AFileSystemNoLongerMountedIsForgottenAndStartsAfreshWhenBack) {
    call(telvzextra_time_to_full);
    clock_milliseconds = 1000;
    call(telvzextra_time_to_full);
    write("self/mounts", "/dev/sda1 / ext4 rw 0 0\n");
    clock_milliseconds = 2000;
    EXPECT_EQ(call(telvzextra_time_to_full),
              "time to full: / (ext4 on /dev/sda1) used 2000000 of 4000000 KiB, +0 KiB/h over 3 "
              "passes, not growing\n\r");
    write("self/mounts", MOUNTS);
    clock_milliseconds = 3000;
    std::string back = call(telvzextra_time_to_full);
    expect_part(back, "/mnt/my\\040disk (vfat on /dev/sdb1) used 0 of 4000 KiB, rate known from "
                      "the next pass\n\r");
}

TEST_F(TimeToFull, PassesAtTheSameTimeGiveNoRate) {
    call(telvzextra_time_to_full);
    std::string again = call(telvzextra_time_to_full);
    expect_part(again, "/ (ext4 on /dev/sda1) used 2000000 of 4000000 KiB, rate known from the "
                       "next pass");
}

TEST_F(TimeToFull, UnreadableTablesAndHostileMountLinesAreSaidOrPassedOver) {
    write("self/mounts", std::string("\n\n   \n/dev/sda1\n/dev/sda1 /\n\0\0\0\n", 32) +
                             "/dev/sda1 / ext4" + std::string(5000, ' ') + "\n" + "/dev/x /" +
                             std::string(300, 'l') + " ext4 rw 0 0\n" + "/dev/sda1 / ext4 rw 0 0");
    EXPECT_EQ(call(telvzextra_time_to_full),
              "time to full: / (ext4 on /dev/sda1) used 2000000 of 4000000 KiB, rate known from "
              "the next pass\n\r"
              "time to full: 1 more local file systems not followed (at most 64, names of at most "
              "255 bytes)\n\r");
    remove("filesystems");
    EXPECT_EQ(call(telvzextra_time_to_full), "time to full: /proc/filesystems cannot be read\n\r");
    write("filesystems", FILESYSTEMS);
    remove("self/mounts");
    EXPECT_EQ(call(telvzextra_time_to_full), "time to full: /proc/self/mounts cannot be read\n\r");
    write("self/mounts", "");
    EXPECT_EQ(call(telvzextra_time_to_full), "(null)");
}

TEST_F(TimeToFull, TheTableFollowsSixtyFourAndTheTextStaysInItsBounds) {
    std::string mounts;
    for (int i = 0; i < 100; ++i) {
        std::string point = "/m" + std::to_string(i) + std::string(240, 'p');
        mounts +=
            "/dev/d" + std::to_string(i) + std::string(100, 'd') + " " + point + " ext4 rw 0 0\n";
        file_systems[point] = blocks_of_4k(100, 50);
    }
    write("self/mounts", mounts);
    std::string text = call(telvzextra_time_to_full);
    extra_test::expect_lines_end_properly(text);
    EXPECT_LT(text.size(), 24576u);
    const std::string truncated(routine_text::TRUNCATED_LINE);
    EXPECT_EQ(text.substr(text.size() - truncated.size()), truncated);
    EXPECT_EQ(text.find(truncated), text.size() - truncated.size());

    // With short names the 64 followed and the line of the others all fit.
    mounts.clear();
    for (int i = 0; i < 100; ++i) {
        mounts += "/dev/d" + std::to_string(i) + " /m" + std::to_string(i) + " ext4 rw 0 0\n";
        file_systems["/m" + std::to_string(i)] = blocks_of_4k(100, 50);
    }
    write("self/mounts", mounts);
    reset_time_to_full_state();
    text = call(telvzextra_time_to_full);
    EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), 65);
    EXPECT_NE(text.find("time to full: 36 more local file systems not followed"),
              std::string::npos);
}

TEST_F(TimeToFull, AMountTableLongerThanTheRoutineReadsIsSaid) {
    std::string mounts;
    while (mounts.size() < 140000) {
        mounts += "tmpfs /run/user/" + std::to_string(mounts.size()) + " tmpfs rw 0 0\n";
    }
    write("self/mounts", "/dev/sda1 / ext4 rw 0 0\n" + mounts);
    EXPECT_EQ(call(telvzextra_time_to_full),
              "time to full: / (ext4 on /dev/sda1) used 2000000 of 4000000 KiB, rate known from "
              "the next pass\n\r"
              "time to full: the mount table was read up to 131071 bytes\n\r");
}

TEST_F(TimeToFull, PiecesParse) {
    EXPECT_EQ(classify_file_system(FILESYSTEMS, "ext4"), file_system_kind::local);
    EXPECT_EQ(classify_file_system(FILESYSTEMS, "tmpfs"), file_system_kind::pseudo);
    EXPECT_EQ(classify_file_system(FILESYSTEMS, "cifs"), file_system_kind::network);
    EXPECT_EQ(classify_file_system(FILESYSTEMS, "btrfs"), file_system_kind::unlisted);
    EXPECT_EQ(classify_file_system(FILESYSTEMS, "ext"), file_system_kind::unlisted);
    char path[8];
    ASSERT_TRUE(unescape_mount_path("/a\\040b\\134", path, sizeof path));
    EXPECT_STREQ(path, "/a b\\");
    ASSERT_TRUE(unescape_mount_path("/\\04x\\9", path, sizeof path));
    EXPECT_STREQ(path, "/\\04x\\9");
    EXPECT_FALSE(unescape_mount_path("/12345678", path, sizeof path));
    used_trend trend{};
    double rate = 0;
    EXPECT_FALSE(growth_rate(trend, &rate));
    for (int i = 0; i < 1000; ++i) {
        add_sample(trend, 1e8 + i * 60.0, 5e12 + i * 600.0); // far from the origin: stays exact
    }
    ASSERT_TRUE(growth_rate(trend, &rate));
    EXPECT_NEAR(rate, 10.0, 1e-6);
}

TEST_F(TimeToFull, OnThisHostEveryLocalFileSystemHasALine) {
    reset_extra_seams();
    std::string text = call(telvzextra_time_to_full);
    if (text == "(null)") {
        GTEST_SKIP() << "no local file system here (an overlay root, say)";
    }
    extra_test::expect_lines_end_properly(text);
    for (size_t at = 0; at < text.size(); at = text.find("\n\r", at) + 2) {
        EXPECT_EQ(text.compare(at, 14, "time to full: "), 0) << text;
    }
}

} // namespace

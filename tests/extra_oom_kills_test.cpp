// The out-of-memory kill routine over a fixture /proc/vmstat and a file standing in for the kernel
// log: the counter and its rise over several passes, the victims of each rise named once, and the
// kernel log absent, unreadable or hostile.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "extra_fixture.h"

namespace {

using extra_test::call;
using namespace std::string_literals;

std::string vmstat(const std::string &count) {
    return "nr_free_pages 123\nnr_zone_inactive_anon 5\noom_kill " + count + "\nnr_foll_pin 0\n";
}

std::string kill_record(int sequence, int pid, const std::string &name,
                        const std::string &reason = "Out of memory") {
    return "3," + std::to_string(sequence) + ",5171234567,-;" + reason + ": Killed process " +
           std::to_string(pid) + " (" + name +
           ") total-vm:1234kB, anon-rss:100kB, file-rss:0kB, shmem-rss:0kB, UID:0 "
           "pgtables:100kB oom_score_adj:0\n SUBSYSTEM=memory\n";
}

std::string other_record(int sequence) {
    return "6," + std::to_string(sequence) +
           ",5171234000,-;oom-kill:constraint=CONSTRAINT_NONE,task=stress-ng,pid=4242,uid=0\n";
}

class OomKills : public extra_test::ExtraTest {
  protected:
    // A pass with the counter at `count`.
    std::string pass(const std::string &count) {
        write("vmstat", vmstat(count));
        return call(telvzextra_oom_kills);
    }
};

TEST_F(OomKills, EachRiseNamesItsVictimsOnce) {
    EXPECT_EQ(pass("3"), "oom kills: 3 since boot (first reading)\n\r");

    std::string log = other_record(1200) + kill_record(1201, 4242, "stress-ng") +
                      kill_record(1300, 5000, "java", "Memory cgroup out of memory");
    write("kmsg", log);
    EXPECT_EQ(pass("5"), "oom kills: 5 since boot (+2)\n\r"
                         "oom kills: victim pid 4242 (stress-ng)\n\r"
                         "oom kills: victim pid 5000 (java)\n\r");
    EXPECT_EQ(call(telvzextra_oom_kills), "oom kills: 5 since boot (+0)\n\r");

    // A name may hold ") "; a name with bytes a snapshot must not hold is shown with '?'.
    write("kmsg", log + kill_record(1400, 6000, "a) b") + kill_record(1401, 6001, "x\ty"));
    EXPECT_EQ(pass("7"), "oom kills: 7 since boot (+2)\n\r"
                         "oom kills: victim pid 6000 (a) b)\n\r"
                         "oom kills: victim pid 6001 (x?y)\n\r");
}

TEST_F(OomKills, ARiseNamesTheNewestKillsOnlyAsManyAsItRoseBy) {
    pass("0");
    write("kmsg", kill_record(10, 100, "old") + kill_record(11, 101, "older") +
                      kill_record(12, 102, "newest"));
    EXPECT_EQ(pass("1"), "oom kills: 1 since boot (+1)\n\r"
                         "oom kills: victim pid 102 (newest)\n\r");
}

TEST_F(OomKills, ARiseOfMoreThanSixteenNamesTheNewestSixteen) {
    pass("0");
    std::string log;
    std::string expected = "oom kills: 40 since boot (+40)\n\r";
    for (int i = 0; i < 40; ++i) {
        log += kill_record(100 + i, 1000 + i, "p" + std::to_string(i));
        if (i >= 24) {
            expected += "oom kills: victim pid " + std::to_string(1000 + i) + " (p" +
                        std::to_string(i) + ")\n\r";
        }
    }
    write("kmsg", log);
    EXPECT_EQ(pass("40"), expected);
}

TEST_F(OomKills, AKernelLogOfManyPiecesAndOverlongRecordsIsReadRecordByRecord) {
    pass("0");
    std::string log;
    for (int i = 0; i < 3000; ++i) {
        log += other_record(i); // some 230 KB: records straddle the reads of a file
    }
    // A record longer than any the kernel writes is passed over whole, even when it names a kill.
    log += "3,4000,1,-;Out of memory: Killed process 1 (" + std::string(20000, 'x') + ")\n";
    log += kill_record(4001, 4242, "after");
    log += "3,4002,1,-;Out of memory: Killed process 77 (no newline at the end)";
    write("kmsg", log);
    EXPECT_EQ(pass("2"), "oom kills: 2 since boot (+2)\n\r"
                         "oom kills: victim pid 4242 (after)\n\r");
}

TEST_F(OomKills, ALogThatNamesNoVictimOrCannotBeReadSaysSo) {
    pass("1");
    EXPECT_EQ(pass("2"),
              "oom kills: 2 since boot (+1)\n\r"
              "oom kills: the kernel log cannot be read (No such file or directory); victims not "
              "named\n\r");
    write("kmsg", other_record(1) + "garbage\n\0\0\n;;;\n"s);
    EXPECT_EQ(pass("3"), "oom kills: 3 since boot (+1)\n\r"
                         "oom kills: the kernel log names no victim of this "
                         "rise\n\r");
}

// The routine as a process without privilege runs it: a child with the ids of nobody.
std::string without_privilege(void (*routine)(const char *, char **)) {
    int ends[2];
    if (pipe(ends) != 0) {
        return "no pipe";
    }
    pid_t child = fork();
    if (child == 0) {
        close(ends[0]);
        if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) {
            _exit(2);
        }
        std::string text = call(routine);
        _exit(write(ends[1], text.data(), text.size()) == static_cast<ssize_t>(text.size()) ? 0
                                                                                            : 3);
    }
    close(ends[1]);
    std::string text;
    char buffer[4096];
    for (ssize_t got; (got = read(ends[0], buffer, sizeof buffer)) > 0;) {
        text.append(buffer, static_cast<size_t>(got));
    }
    close(ends[0]);
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? text : "child failed";
}

TEST_F(OomKills, AKernelLogThatNeedsPrivilegeIsSaidInOneLine) {
    pass("1");
    write("kmsg", kill_record(1, 1, "init"));
    ASSERT_EQ(chmod(kmsg.c_str(), 0600), 0);
    write("vmstat", vmstat("2"));
    EXPECT_EQ(without_privilege(telvzextra_oom_kills),
              "oom kills: 2 since boot (+1)\n\r"
              "oom kills: the kernel log is not readable without privilege; victims not named\n\r");
}

TEST_F(OomKills, AnAbsentCounterIsSaidOnceAndAMalformedOneOnEveryPass) {
    const std::string absent = "oom kills: not counted (no oom_kill line in /proc/vmstat)\n\r";
    EXPECT_EQ(call(telvzextra_oom_kills), absent);
    EXPECT_EQ(call(telvzextra_oom_kills), "(null)");
    write("vmstat", "nr_free_pages 1\noom_kill_other 4\noom_kill\n");
    EXPECT_EQ(call(telvzextra_oom_kills), "(null)");
    const std::string malformed = "oom kills: the oom_kill line of /proc/vmstat is not a count\n\r";
    for (const std::string &value :
         {"-1"s, "18446744073709551616"s, "5 x"s, ""s, "0x10"s, "1\0"s}) {
        SCOPED_TRACE(value);
        write("vmstat", vmstat(value));
        EXPECT_EQ(call(telvzextra_oom_kills), malformed);
        EXPECT_EQ(call(telvzextra_oom_kills), malformed);
    }
    // After a malformed pass the next count is a first reading again; the absence is said anew.
    EXPECT_EQ(pass("4"), "oom kills: 4 since boot (first reading)\n\r");
    remove("vmstat");
    EXPECT_EQ(call(telvzextra_oom_kills), absent);
    // A vmstat without a line feed at its end, and one longer than the routine reads.
    write("vmstat", "oom_kill 9");
    EXPECT_EQ(call(telvzextra_oom_kills), "oom kills: 9 since boot (first reading)\n\r");
    write("vmstat", std::string(40000, 'x') + "\noom_kill 10\n");
    EXPECT_EQ(call(telvzextra_oom_kills), absent);
}

TEST_F(OomKills, RecordsOfTheKernelLogParse) {
    kernel_kill kill{};
    ASSERT_TRUE(
        parse_kmsg_kill("3,77,1,-;Out of memory: Killed process 12 (sh) total-vm:1kB", &kill));
    EXPECT_EQ(kill.sequence, 77u);
    EXPECT_EQ(kill.pid, 12u);
    EXPECT_STREQ(kill.name, "sh");
    ASSERT_TRUE(parse_kmsg_kill(
        "3,78,1,-,caller=T1;Killed process 13 (" + std::string(200, 'n') + ")", &kill));
    EXPECT_EQ(std::string(kill.name), std::string(VICTIM_NAME_SIZE - 1, 'n'));
    for (const char *record :
         {"", ";Killed process 1 (a)", "3,x,1,-;Killed process 1 (a)",
          "3,1,1,-;Killed process x (a)", "3,1,1,-;Killed process 1 a",
          "3,1,1,-;Killed process 1 (a", "Killed process 1 (a)", "3,1;Killed process 1 (a)"}) {
        EXPECT_FALSE(parse_kmsg_kill(record, &kill)) << record;
    }
}

TEST_F(OomKills, OnThisHostTheCounterHasALine) {
    reset_extra_seams();
    std::string text = call(telvzextra_oom_kills);
    extra_test::expect_lines_end_properly(text);
    EXPECT_EQ(text.rfind("oom kills: ", 0), 0u) << text;
    EXPECT_NE(text.find(" since boot (first reading)\n\r"), std::string::npos) << text;
}

} // namespace

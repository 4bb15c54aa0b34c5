// The pressure routine over fixture files of /proc/pressure: the text of a pass byte for byte, the
// growth of the totals from pass to pass, and the files that are absent, malformed or hostile.
#include <gtest/gtest.h>

#include "extra_fixture.h"

namespace {

using extra_test::call;
using namespace std::string_literals;

class Pressure : public extra_test::ExtraTest {
  protected:
    void write_all(const std::string &memory, const std::string &cpu, const std::string &io) {
        write("pressure/memory", memory);
        write("pressure/cpu", cpu);
        write("pressure/io", io);
    }
};

std::string file(const std::string &some, const std::string &full) {
    return "some " + some + "\nfull " + full + "\n";
}

const std::string IDLE = "avg10=0.00 avg60=0.00 avg300=0.00 total=0";
const std::string ABSENT_IO =
    "pressure io: not available (no /proc/pressure/io: an old kernel, or pressure accounting "
    "off)\n\r";

TEST_F(Pressure, EachResourceHasALineAndItsTotalsGrowFromPassToPass) {
    write_all(file("avg10=1.25 avg60=0.50 avg300=0.10 total=1000", IDLE),
              "some avg10=12.00 avg60=8.40 avg300=3.07 total=5000000\n",
              file("avg10=0.00 avg60=0.00 avg300=0.00 total=77",
                   "avg10=0.00 avg60=0.00 avg300=0.00 total=7"));
    EXPECT_EQ(call(telvzextra_pressure),
              "pressure memory: some avg10=1.25 avg60=0.50 avg300=0.10 total=1000 us (first "
              "reading); full avg10=0.00 avg60=0.00 avg300=0.00 total=0 us (first reading)\n\r"
              "pressure cpu: some avg10=12.00 avg60=8.40 avg300=3.07 total=5000000 us (first "
              "reading)\n\r"
              "pressure io: some avg10=0.00 avg60=0.00 avg300=0.00 total=77 us (first reading); "
              "full avg10=0.00 avg60=0.00 avg300=0.00 total=7 us (first reading)\n\r");

    write_all(file("avg10=2.00 avg60=0.75 avg300=0.15 total=1500", IDLE),
              file("avg10=11.00 avg60=8.00 avg300=3.00 total=5250000", IDLE),
              file("avg10=0.00 avg60=0.00 avg300=0.00 total=70",
                   "avg10=0.00 avg60=0.00 avg300=0.00 total=7"));
    EXPECT_EQ(call(telvzextra_pressure),
              "pressure memory: some avg10=2.00 avg60=0.75 avg300=0.15 total=1500 us (+500 us); "
              "full avg10=0.00 avg60=0.00 avg300=0.00 total=0 us (+0 us)\n\r"
              "pressure cpu: some avg10=11.00 avg60=8.00 avg300=3.00 total=5250000 us (+250000 "
              "us); full avg10=0.00 avg60=0.00 avg300=0.00 total=0 us (first reading)\n\r"
              "pressure io: some avg10=0.00 avg60=0.00 avg300=0.00 total=70 us (counter went "
              "back); full avg10=0.00 avg60=0.00 avg300=0.00 total=7 us (+0 us)\n\r");
}

TEST_F(Pressure, AnAbsentFileIsSaidOnceUntilItComesBack) {
    const std::string line = "pressure memory: some avg10=0.00 avg60=0.00 avg300=0.00 total=0 us ";
    write("pressure/memory", file(IDLE, IDLE));
    write("pressure/cpu", file(IDLE, IDLE));
    std::string first = call(telvzextra_pressure);
    EXPECT_EQ(first.substr(first.size() - ABSENT_IO.size()), ABSENT_IO);
    std::string second = call(telvzextra_pressure);
    EXPECT_EQ(second.find("pressure io"), std::string::npos) << second;
    EXPECT_EQ(second.rfind(line + "(+0 us)", 0), 0u) << second;

    write("pressure/io", file(IDLE, IDLE));
    EXPECT_NE(call(telvzextra_pressure)
                  .find("pressure io: some avg10=0.00 avg60=0.00 "
                        "avg300=0.00 total=0 us (first reading)"),
              std::string::npos);
    remove("pressure/io");
    std::string again = call(telvzextra_pressure);
    EXPECT_EQ(again.substr(again.size() - ABSENT_IO.size()), ABSENT_IO);
}

TEST_F(Pressure, AKernelWithoutAnyPressureFileIsSaidOnceThenTheRoutineHandsBackNothing) {
    EXPECT_EQ(call(telvzextra_pressure),
              "pressure: not available (no /proc/pressure: an old kernel, or pressure accounting "
              "off)\n\r");
    EXPECT_EQ(call(telvzextra_pressure), "(null)");
    EXPECT_EQ(call(telvzextra_pressure), "(null)");
    // Accounting turned on, and off again: said once more.
    for (const char *name : {"pressure/memory", "pressure/cpu", "pressure/io"}) {
        write(name, file(IDLE, IDLE));
    }
    EXPECT_NE(call(telvzextra_pressure).find("pressure io: some"), std::string::npos);
    for (const char *name : {"pressure/memory", "pressure/cpu", "pressure/io"}) {
        remove(name);
    }
    EXPECT_EQ(call(telvzextra_pressure),
              "pressure: not available (no /proc/pressure: an old kernel, or pressure accounting "
              "off)\n\r");
    EXPECT_EQ(call(telvzextra_pressure), "(null)");
}

TEST_F(Pressure, MalformedAndHostileFilesAreSaidOnEveryPassAndForgetTheTotals) {
    const std::vector<std::string> hostile = {
        "",
        "full " + IDLE + "\n",                                                 // no some line
        "some avg10=0.00 avg60=0.00 avg300=0.00\n",                            // no total
        "some avg10=0.00 avg60=0.00 avg300=0.00 total=-5\n",                   // negative
        "some avg10=0.00 avg60=0.00 avg300=0.00 total=18446744073709551616\n", // 2^64
        "some avg10=100.01 avg60=0.00 avg300=0.00 total=1\n",     // above all of the time
        "some avg10=0.001 avg60=0.00 avg300=0.00 total=1\n",      // three decimals
        "some avg10=0.00 avg60=0.00 avg300=0.00 total=1 extra\n", // more after the total
        "some " + IDLE + "\nsome " + IDLE + "\n",                 // twice
        "some avg10=0.00\0 avg60=0.00 avg300=0.00 total=1\n"s,    // a NUL inside
        "some avg10=0.00 avg60=0.00 avg300=0.00 total=1" + std::string(100000, '7'), // huge
    };
    write("pressure/memory", file(IDLE, IDLE));
    write("pressure/io", file(IDLE, IDLE));
    for (const std::string &text : hostile) {
        SCOPED_TRACE(text.substr(0, 80));
        write("pressure/cpu", "some avg10=0.00 avg60=0.00 avg300=0.00 total=10\n");
        call(telvzextra_pressure);
        write("pressure/cpu", text);
        std::string returned = call(telvzextra_pressure);
        EXPECT_NE(returned.find("pressure cpu: /proc/pressure/cpu does not hold pressure "
                                "figures\n\r"),
                  std::string::npos)
            << returned;
        EXPECT_EQ(call(telvzextra_pressure), returned);
        // The totals before the malformed pass are forgotten.
        write("pressure/cpu", "some avg10=0.00 avg60=0.00 avg300=0.00 total=20\n");
        EXPECT_NE(call(telvzextra_pressure).find("total=20 us (first reading)"), std::string::npos);
    }
}

TEST_F(Pressure, FiguresParseFromTheKernelsLinesAndLinesOfOtherKindsArePassedOver) {
    pressure_file parsed;
    ASSERT_TRUE(parse_pressure("some avg10=0.5 avg60=1 avg300=99.99 total=42\nnew kind 1\n"
                               "full\tavg10=0.00  avg60=0.00 avg300=0.00 total=0",
                               &parsed));
    EXPECT_EQ(parsed.some.avg10, 50u);
    EXPECT_EQ(parsed.some.avg60, 100u);
    EXPECT_EQ(parsed.some.avg300, 9999u);
    EXPECT_EQ(parsed.some.total, 42u);
    EXPECT_FALSE(parsed.full.present); // "full\t" is not the kernel's "full "
}

TEST_F(Pressure, OnThisHostEveryResourceHasOneLine) {
    reset_extra_seams();
    std::string text = call(telvzextra_pressure);
    extra_test::expect_lines_end_properly(text);
    for (const char *resource : {"memory", "cpu", "io"}) {
        EXPECT_NE(text.find(std::string("pressure ") + resource + ": "), std::string::npos) << text;
    }
}

} // namespace

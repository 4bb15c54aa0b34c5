// The sample routine resolved through the default platform's module service, as a control file
// line names it, and run.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "capture/external_checks.h"
#include "core/control_file.h"
#include "platform_test_support.h"

namespace {

class ExternalRoutineOnThePlatform : public platform_test::PlatformTest {};

TEST_F(ExternalRoutineOnThePlatform, ControlFileLineResolvesAndRunsTheSample) {
    const char text[] = "ACTUALLY_RUN\nEXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check2\n";
    uint32_t crc = 99;
    ASSERT_EQ(tarn_parse_control_file(text, &crc), 0u);
    EXPECT_EQ(crc, 0u);
    // The table dump shows where the module service found the routine: the library's own export.
    std::string trace = platform_test::read_file(trace_path());
    char address[64];
    std::snprintf(address, sizeof address, "TARNOTHF:   address of function is %p",
                  reinterpret_cast<void *>(&tarn_external_check2));
    EXPECT_NE(trace.find("TARNOTHF:   function name is [tarn_external_check2]"), std::string::npos);
    EXPECT_NE(trace.find(address), std::string::npos) << address;
    EXPECT_EQ(trace.find("TARNOTHF:   handle is (nil)"), std::string::npos);

    char *returnedData = nullptr;
    tarn_external_check2(text, &returnedData);
    ASSERT_NE(returnedData, nullptr);
    EXPECT_STREQ(returnedData, "Message 2 returned data \n\r Second line of Message 2\n\r");

    // The routine's traces reach the platform's trace file.
    trace = platform_test::read_file(trace_path());
    EXPECT_NE(trace.find("TARNOTHF: --> tarn_external_check2"), std::string::npos);
    EXPECT_NE(trace.find("TARNOTHF: <-- tarn_parse_control_file(), src = 0, crc = 0 (hex)"),
              std::string::npos);
}

} // namespace

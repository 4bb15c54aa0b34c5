// The sample routine resolved through the default platform's module service, as a control file
// line names it, and run.
#include <gtest/gtest.h>

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
    control_file_tables tables{};
    tarn_control_file_tables(&tables);
    ASSERT_EQ(tables.call_count, 1);
    ASSERT_NE(tables.calls, nullptr);
    EXPECT_STREQ(tables.calls[0].name, "tarn_external_check2");
    EXPECT_NE(tables.calls[0].handle, nullptr);
    ASSERT_EQ(tables.calls[0].address, reinterpret_cast<void *>(&tarn_external_check2));

    char *returnedData = nullptr;
    reinterpret_cast<external_check_routine>(tables.calls[0].address)(text, &returnedData);
    ASSERT_NE(returnedData, nullptr);
    EXPECT_STREQ(returnedData, "Message 2 returned data \n\r Second line of Message 2\n\r");

    // The routine's traces reach the platform's trace file.
    std::string trace = platform_test::read_file(trace_path());
    EXPECT_NE(trace.find("TARNOTHF: --> tarn_external_check2"), std::string::npos);
    EXPECT_NE(trace.find("TARNOTHF: <-- tarn_parse_control_file(), src = 0, crc = 0 (hex)"),
              std::string::npos);
}

} // namespace

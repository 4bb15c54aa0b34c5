#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "capture/external_checks.h"
#include "control_file_fixture.h"
#include "core/control_file.h"
#include "recording_platform.h"

namespace {

std::string pointer_text(const void *pointer) {
    char text[64];
    std::snprintf(text, sizeof text, "%p", pointer);
    return text;
}

class ExternalChecks : public control_file_test::ControlFileTest {};

struct sample {
    external_check_routine routine;
    const char *number;
    char *message;
    const char *text;
};

const sample SAMPLES[] = {
    {tarn_external_check1, "1", message1,
     "Message 1 returned data \n\r Second line of Message 1\n\r"},
    {tarn_external_check2, "2", message2,
     "Message 2 returned data \n\r Second line of Message 2\n\r"},
    {tarn_external_check3, "3", message3,
     "Message 3 returned data \n\r Second line of Message 3\n\r"},
};

TEST_F(ExternalChecks, MessagesAreExact) {
    for (const sample &s : SAMPLES) {
        EXPECT_STREQ(s.message, s.text);
        EXPECT_EQ(std::strlen(s.message) + 1, 54u);
    }
    EXPECT_EQ(sizeof message1, 54u);
}

TEST_F(ExternalChecks, EachSampleTracesAndHandsBackItsMessage) {
    const char fileData[] = "ACTUALLY_RUN\nEXTERNAL_CHECKING_ROUTINE telvzmnd x\n";
    for (const sample &s : SAMPLES) {
        rec::clear_traces();
        char *returnedData = nullptr;
        s.routine(fileData, &returnedData);
        EXPECT_EQ(returnedData, s.message);
        std::string n = s.number;
        const std::vector<std::string> expected = {
            "TARNOTHF: --> tarn_external_check" + n,
            "TARNOTHF: fileData pointer = " + pointer_text(fileData),
            "TARNOTHF: returnedData pointer = " + pointer_text(&returnedData),
            "TARNOTHF: start of fileData is: = [" + std::string(fileData) + "]",
            "TARNOTHF: message" + n + " is: = [" + std::string(s.text) + "]",
            "TARNOTHF: <-- tarn_external_check" + n,
        };
        EXPECT_EQ(rec::traces(), expected);
    }
}

TEST_F(ExternalChecks, MessagesAreWritable) {
    char *returnedData = nullptr;
    message2[0] = 'm';
    tarn_external_check2("", &returnedData);
    EXPECT_EQ(returnedData[0], 'm');
    message2[0] = 'M';
}

TEST_F(ExternalChecks, ControlFileLineResolvesTheSampleByModuleAndName) {
    rec::register_function("telvzmnd", "tarn_external_check2",
                           reinterpret_cast<void *>(&tarn_external_check2));
    EXPECT_EQ(parse("EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check2\n"), 0u);
    ASSERT_EQ(num_external_calls, 1);
    EXPECT_STREQ(calllist1[0].name, "tarn_external_check2");
    ASSERT_EQ(calllist1[0].address, reinterpret_cast<void *>(&tarn_external_check2));
    char *returnedData = nullptr;
    reinterpret_cast<external_check_routine>(calllist1[0].address)(buffer.c_str(), &returnedData);
    EXPECT_STREQ(returnedData, "Message 2 returned data \n\r Second line of Message 2\n\r");
}

} // namespace

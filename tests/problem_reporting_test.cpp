#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>

#include "core/control_block.h"
#include "core/problem_reporting.h"
#include "data_blocks.h"
#include "recording_platform.h"

namespace {

class ProblemReporting : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        std::memset(topLogDataBlock, 0, sizeof topLogDataBlock);
        TARN_CB_PTR = nullptr;
    }
    void TearDown() override { TARN_CB_PTR = nullptr; }

    // A control block in ordinary memory: reporting only reads logAsInfo through TARN_CB_PTR.
    void attach_block(uint32_t log_as_info) {
        block = std::make_unique<tarn_control_block>();
        block->logAsInfo = log_as_info;
        TARN_CB_PTR = block.get();
    }

    static const rec::Event &only_event() {
        EXPECT_EQ(rec::events().size(), 1u);
        return rec::events().front();
    }

    std::unique_ptr<tarn_control_block> block;
};

TEST_F(ProblemReporting, ShortFormRaisesTheCodeWithoutAttachment) {
    EXPECT_EQ(tarn_mon_error_handler(2, 5, 0xE081), 8u);
    const auto &event = only_event();
    EXPECT_EQ(event.record.record_type, 18);
    EXPECT_EQ(event.record.option, 0x300u);
    EXPECT_EQ(std::string(event.record.component, 12), std::string("LinMonitor\0\0", 12));
    EXPECT_EQ(event.record.reason_code, 0xE081);
    EXPECT_EQ(event.record.comp_rc, 5u);
    EXPECT_FALSE(event.has_attachment);
    EXPECT_EQ(event.record.attachment_length, 0u);
    EXPECT_EQ(rec::traces(), (std::vector<std::string>{
                                 "TARNMNDF: --> tarn_mon_error_handler_p",
                                 "TARNMNDF:     sysRc = 2   compRc = 5   uiErrorId = e081",
                                 "TARNMNDF:     sysRc= 8, compRc = 0x0",
                                 "TARNMNDF: <-- tarn_mon_error_handler_p",
                             }));
}

TEST_F(ProblemReporting, EveryOtherByteOfTheRecordIsZero) {
    tarn_mon_error_handler(0, 0x12345678, 0xE099);
    logsvc_record expected;
    std::memset(&expected, 0, sizeof expected);
    expected.record_type = 18;
    expected.option = 0x300;
    std::memcpy(expected.component, "LinMonitor", 10);
    expected.reason_code = 0xE099;
    expected.comp_rc = 0x12345678;
    EXPECT_EQ(std::memcmp(&only_event().record, &expected, sizeof expected), 0);
}

TEST_F(ProblemReporting, OnlyTheLowSixteenBitsOfTheReasonAreRecorded) {
    tarn_mon_error_handler(2, 0, 0x1E081);
    EXPECT_EQ(only_event().record.reason_code, 0xE081);
}

TEST_F(ProblemReporting, ReportAfterAnEarlierReportGoesOutInTheSystemClass) {
    EXPECT_EQ(tarn_mon_error_handler(8 | 2, 0, 0xE086), 8u);
    const auto &event = only_event();
    EXPECT_EQ(event.record.reason_code, 0xE0F1);
    EXPECT_EQ(event.record.option, 0x300u);
}

TEST_F(ProblemReporting, SecondReportOfOneRoutineBecomesE0F1) {
    uint32_t src = 0;
    src = tarn_mon_error_handler(src | 2, 0, 0xE085);
    src = tarn_mon_error_handler(src | 2, 7, 0xE087);
    EXPECT_EQ(src, 8u);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.reason_code, 0xE085);
    EXPECT_EQ(rec::events()[1].record.reason_code, 0xE0F1);
    EXPECT_EQ(rec::events()[1].record.comp_rc, 7u);
}

TEST_F(ProblemReporting, PassThroughClassRaisesNothing) {
    EXPECT_EQ(tarn_mon_error_handler(8, 1, 0xE081), 8u);
    EXPECT_EQ(tarn_mon_error_handler_p(12, 1, "text", 0xE081), 12u);
    EXPECT_TRUE(rec::events().empty());
    EXPECT_EQ(rec::find_trace("TARNMNDF:     sysRc= 12, compRc = 0x0"), 6);
    EXPECT_EQ(rec::traces().size(), 8u);
}

TEST_F(ProblemReporting, ClassOfEverySystemReturnCode) {
    struct {
        uint32_t sysRc;
        int events;
        uint16_t reason;
    } const table[] = {
        {0, 1, 0xE081}, {1, 1, 0xE081},  {2, 1, 0xE081},  {3, 1, 0xE0F1},
        {4, 1, 0xE081}, {5, 1, 0xE0F1},  {6, 1, 0xE0F1},  {7, 1, 0xE0F1},
        {8, 0, 0},      {9, 1, 0xE0F1},  {10, 1, 0xE0F1}, {11, 1, 0xE0F1},
        {12, 0, 0},     {13, 1, 0xE0F1}, {14, 1, 0xE0F1}, {0xFFFFFFFF, 1, 0xE0F1},
    };
    for (const auto &row : table) {
        rec::reset();
        uint32_t result = tarn_mon_error_handler(row.sysRc, 0, 0xE081);
        ASSERT_EQ(static_cast<int>(rec::events().size()), row.events) << row.sysRc;
        if (row.events == 1) {
            EXPECT_EQ(result, 8u) << row.sysRc;
            EXPECT_EQ(rec::events()[0].record.reason_code, row.reason) << row.sysRc;
        } else {
            EXPECT_EQ(result, row.sysRc);
        }
    }
}

TEST_F(ProblemReporting, LongDataIsCutBehindTheFindingText) {
    std::strcpy(topLogDataBlock, "rss of appserver is 2000000 KB\n\r");
    std::string data(50000, 'x');
    for (size_t i = 0; i < data.size(); ++i) {
        data[i] = static_cast<char>('a' + i % 26);
    }
    EXPECT_EQ(tarn_mon_error_handler_p(2, 0, data.c_str(), 0xE111), 8u);
    const auto &event = only_event();
    std::string expected = std::string("rss of appserver is 2000000 KB\n\r") +
                           data.substr(0, 39000) + "No room to output more data... \n\r";
    EXPECT_EQ(event.attachment, expected);
    EXPECT_EQ(event.record.attachment_length, expected.size());
    EXPECT_EQ(event.record.option, 0xC300u);
    EXPECT_EQ(event.record.reason_code, 0xE111);
}

TEST_F(ProblemReporting, DataOfExactlyTheLimitIsKeptWhole) {
    std::string data(39000, 'd');
    tarn_mon_error_handler_p(2, 0, data.c_str(), 0xE111);
    EXPECT_EQ(only_event().attachment, data + "end of data \n\r");
}

TEST_F(ProblemReporting, OneCharacterOverTheLimitIsCut) {
    std::string data(39001, 'd');
    tarn_mon_error_handler_p(2, 0, data.c_str(), 0xE111);
    EXPECT_EQ(only_event().attachment,
              std::string(39000, 'd') + "No room to output more data... \n\r");
}

TEST_F(ProblemReporting, EmptyDataStillAttachesTheClosingLine) {
    std::strcpy(topLogDataBlock, "top");
    tarn_mon_error_handler_p(2, 0, "", 0xE114);
    EXPECT_EQ(only_event().attachment, "topend of data \n\r");
    EXPECT_EQ(only_event().record.option, 0xC300u);
}

TEST_F(ProblemReporting, FullFindingTextIsReadWithinItsBlock) {
    std::memset(topLogDataBlock, 'T', sizeof topLogDataBlock); // no terminating NUL
    tarn_mon_error_handler_p(2, 0, "data", 0xE114);
    EXPECT_EQ(only_event().attachment, std::string(4096, 'T') + "dataend of data \n\r");
}

TEST_F(ProblemReporting, AttachmentIsFreedAfterTheEvent) {
    tarn_mon_error_handler_p(2, 0, "data", 0xE114);
    EXPECT_TRUE(rec::live_allocations().empty());
    EXPECT_EQ(rec::calls(rec::Call::malloc), 1);
}

TEST_F(ProblemReporting, LogAsInfoMakesReportsInformational) {
    attach_block(1);
    tarn_mon_error_handler(2, 0, 0xE114);
    tarn_mon_error_handler_p(2, 0, "data", 0xE114);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.option, 0x200u);
    EXPECT_EQ(rec::events()[1].record.option, 0xC200u);
    EXPECT_EQ(rec::find_trace("TARNSLTF: LOGSVC_REPORT_INFORMATIONAL option set."), 2);
}

TEST_F(ProblemReporting, AttachedBlockWithoutLogAsInfoTracesTheErrorOption) {
    attach_block(0);
    tarn_mon_error_handler(2, 0, 0xE114);
    EXPECT_EQ(only_event().record.option, 0x300u);
    EXPECT_EQ(rec::find_trace("TARNSLTF: LOGSVC_REPORT_ERROR option set."), 2);
}

TEST_F(ProblemReporting, NoBlockAttachedMeansErrorWithoutOptionTrace) {
    tarn_mon_error_handler(2, 0, 0xE114);
    EXPECT_TRUE(rec::traces_starting("TARNSLTF:").empty());
}

TEST_F(ProblemReporting, SystemClassIgnoresLogAsInfoAndReplacesTheFindingText) {
    attach_block(1);
    std::strcpy(topLogDataBlock, "finding text");
    EXPECT_EQ(tarn_mon_error_handler_p(3, 9, "own failure", 0xE098), 8u);
    const auto &event = only_event();
    EXPECT_EQ(event.record.reason_code, 0xE0F1);
    EXPECT_EQ(event.record.option, 0xC000u);
    EXPECT_EQ(event.record.comp_rc, 9u);
    EXPECT_EQ(event.attachment, "own failureend of data \n\r");
    EXPECT_TRUE(rec::traces_starting("TARNSLTF:").empty());
}

TEST_F(ProblemReporting, SystemClassCutsLongDataToo) {
    std::string data(45000, 's');
    tarn_mon_error_handler_p(10, 0, data.c_str(), 0xE098);
    EXPECT_EQ(only_event().attachment,
              std::string(39000, 's') + "No room to output more data... \n\r");
}

TEST_F(ProblemReporting, SystemClassWithoutDataKeepsTheErrorOption) {
    tarn_mon_error_handler(10, 0, 0xE098);
    EXPECT_EQ(only_event().record.option, 0x300u);
    EXPECT_FALSE(only_event().has_attachment);
}

TEST_F(ProblemReporting, FailingEventServiceIsTracedAndStillGivesEight) {
    rec::fail(rec::Call::microcode_log, 4, 0x77);
    EXPECT_EQ(tarn_mon_error_handler(2, 1, 0xE081), 8u);
    EXPECT_TRUE(rec::has_trace("TARNMNDF:     logsvc_microcode_log failed; sysRc=2, crc=77"));
    EXPECT_TRUE(rec::has_trace("TARNMNDF:     sysRc= 8, compRc = 0x77"));
}

TEST_F(ProblemReporting, FailedAttachmentAllocationSendsTheEventWithoutText) {
    rec::fail(rec::Call::malloc, 0);
    EXPECT_EQ(tarn_mon_error_handler_p(2, 0, "data", 0xE111), 8u);
    const auto &event = only_event();
    EXPECT_EQ(event.record.option, 0xC300u);
    EXPECT_FALSE(event.has_attachment);
    EXPECT_EQ(event.record.attachment_length, 0u);
}

TEST_F(ProblemReporting, FailedAttachmentAllocationInTheSystemClass) {
    rec::fail(rec::Call::malloc, 0);
    tarn_mon_error_handler_p(10, 0, "data", 0xE111);
    EXPECT_EQ(only_event().record.option, 0xC000u);
    EXPECT_FALSE(only_event().has_attachment);
}

} // namespace

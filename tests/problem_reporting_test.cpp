#include <gtest/gtest.h>

#include <cstring>
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
};

TEST_F(ProblemReporting, ShortFormRaisesTheCodeWithoutAttachment) {
    EXPECT_EQ(tarn_mon_error_handler(2, 5, 0xE081), 8u);
    ASSERT_EQ(rec::events().size(), 1u);
    const auto &event = rec::events()[0];
    EXPECT_EQ(event.record.record_type, 18);
    EXPECT_EQ(event.record.option, 0x300u);
    EXPECT_STREQ(event.record.component, "LinMonitor");
    EXPECT_EQ(event.record.reason_code, 0xE081);
    EXPECT_EQ(event.record.comp_rc, 5u);
    EXPECT_FALSE(event.has_attachment);
    EXPECT_EQ(event.record.attachment_length, 0u);
}

} // namespace

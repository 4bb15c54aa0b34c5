// The gathering of the appliance's trace through runAsRoot telvzstba, over a fake runAsRoot first
// on PATH that records its arguments, prints what the test gives it and writes the dump file when
// asked to.
#include <gtest/gtest.h>

#include <cstdint>
#include <fstream>
#include <sstream>
#include <string>

#include "capture/trace_data.h"
#include "fake_commands.h"
#include "filesvc.h"
#include "recording_platform.h"
#include "starved_child.h"
#include "text_lines.h"

namespace {

using fake::fake_commands;
using text::joined;
using text::lines;

const std::string ENTRY = "TARNGTDF: --> tarn_gather_trace_data";
const std::string CALL_WORKED = "TARNGTDF: 'showTraceBuf all' call worked. Make sure file exists.";

std::string hex(uint32_t value) {
    std::ostringstream out;
    out << std::hex << value;
    return out.str();
}

std::string exit_trace(uint32_t src, uint32_t crc) {
    return "TARNGTDF: <-- tarn_gather_trace_data, src = " + hex(src) + ", crc = " + hex(crc) +
           " (hex)";
}

lines stba_traces(const lines &printed) {
    lines traced;
    for (const std::string &line : printed) {
        traced.push_back("TARNMNDF: stba data: [" + line + "]");
    }
    return traced;
}

class TraceData : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        log_path = fakes.dir() + "/runAsRoot.log";
    }

    // A runAsRoot that logs its arguments as "[a][b]...", prints `printed` byte for byte, writes
    // the dump file named by its fourth argument when `writes_dump`, and exits with `status`.
    void fake_run_as_root(const std::string &printed, bool writes_dump, int status = 0) {
        std::string script = "#!/bin/sh\nfor a in \"$@\"; do printf '[%s]' \"$a\"; done >> '" +
                             log_path + "'\necho >> '" + log_path + "'\nprintf '%s' '" + printed +
                             "'\n";
        if (writes_dump) {
            script += "echo trace > '" + rec::data_dir() + "/'\"$3\"\n";
        }
        fakes.add("runAsRoot", script + "exit " + std::to_string(status) + "\n");
    }

    std::string runs() {
        std::ifstream in(log_path);
        std::stringstream text;
        text << in.rdbuf();
        return text.str();
    }

    // What the data-file service answers for a dump that is not there.
    static std::pair<uint32_t, uint32_t> missing_dump_answer() {
        uint32_t size = 0;
        uint32_t crc = 0;
        uint32_t src = filesvc_query_file_size(TRACE_DATA_NAME, &size, &crc);
        return {src, crc};
    }

    fake_commands fakes;
    std::string log_path;
};

TEST_F(TraceData, ThreeLinesOfTheToolAreThreeTraceLinesWithoutTheirLineEnds) {
    fake_run_as_root("dumped 3 buffers\nfirst 00:00:01\nlast 00:00:59\n", true);
    uint32_t crc = 0xDEAD;

    EXPECT_EQ(tarn_gather_trace_data(&crc), 0u);

    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(runs(), "[telvzstba][all][telvzstba.trm]\n");
    EXPECT_EQ(rec::traces(),
              joined({{ENTRY},
                      stba_traces({"dumped 3 buffers", "first 00:00:01", "last 00:00:59"}),
                      {CALL_WORKED, exit_trace(0, 0)}}));
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 1);
}

TEST_F(TraceData, ToolThatFailsStillHasTheCallWorkedLineAndItsFileQueried) {
    fake_run_as_root("telvzstba: no trace\n", true, 3);
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_trace_data(&crc), 0u);

    EXPECT_EQ(
        rec::traces(),
        joined({{ENTRY}, stba_traces({"telvzstba: no trace"}), {CALL_WORKED, exit_trace(0, 0)}}));
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 1);
}

TEST_F(TraceData, MissingDumpIsReturnedAndNeverReported) {
    fake_run_as_root("", false);
    auto [missing_src, missing_crc] = missing_dump_answer();
    ASSERT_NE(missing_src, 0u);
    rec::reset();
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_trace_data(&crc), missing_src);

    EXPECT_EQ(crc, missing_crc);
    EXPECT_EQ(rec::traces(), (lines{ENTRY, CALL_WORKED, exit_trace(missing_src, missing_crc)}));
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(TraceData, FailedSizeQueryIsReturnedWithItsCode) {
    fake_run_as_root("", true);
    rec::fail(rec::Call::query_file_size, 8, 0x1234);
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_trace_data(&crc), 8u);

    EXPECT_EQ(crc, 0x1234u);
    EXPECT_EQ(rec::traces().back(), exit_trace(8, 0x1234));
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(TraceData, LastLineWithoutALineEndLosesItsLastCharacter) {
    // The runner cuts the last character of every line, which is the line feed of all but an
    // unended last line.
    fake_run_as_root("done\nno end", true);
    uint32_t crc = 0;

    tarn_gather_trace_data(&crc);

    EXPECT_EQ(rec::traces()[1], "TARNMNDF: stba data: [done]");
    EXPECT_EQ(rec::traces()[2], "TARNMNDF: stba data: [no en]");
}

TEST_F(TraceData, MissingRunAsRootIsTracedAndTheFileStillQueried) {
    fake_commands only(fake_commands::path_mode::only);
    auto [missing_src, missing_crc] = missing_dump_answer();
    rec::reset();
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_trace_data(&crc), missing_src);

    EXPECT_EQ(rec::traces(), (lines{ENTRY, "TARNMNDF: rc from free execvp call is: -1; errno=2.",
                                    CALL_WORKED, exit_trace(missing_src, missing_crc)}));
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 1);
}

TEST_F(TraceData, NoPipeRunsNothingQueriesNothingAndReturnsZero) {
    fake_run_as_root("", true);
    std::string traces = fake::run_without_descriptors([] {
        uint32_t crc = 0x55;
        uint32_t src = tarn_gather_trace_data(&crc);
        std::string all = std::to_string(src) + " " + std::to_string(crc) + " " +
                          std::to_string(rec::calls(rec::Call::query_file_size)) + "\n";
        for (const std::string &line : rec::traces()) {
            all += line + "\n";
        }
        return all;
    });
    EXPECT_EQ(traces, "0 0 0\n" + ENTRY + "\nTARNMNDF: rc from free pipe call is: -1; errno=24.\n" +
                          exit_trace(0, 0) + "\n");
    EXPECT_EQ(runs(), "");
}

} // namespace

// The file listing and clean-up runs of a reported partition, over a fake runAsRoot first on PATH
// that records its arguments and prints what the test gives it.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>
#include <fstream>
#include <sstream>
#include <string>

#include "fake_commands.h"
#include "filesvc.h"
#include "recording_platform.h"
#include "starved_child.h"
#include "storage/file_listing.h"
#include "text_lines.h"

namespace {

using fake::fake_commands;
using text::joined;
using text::lines;

const std::string GATHER_ENTRY = "TARNGFLF: --> tarn_gather_file_list";
const std::string CALL_WORKED =
    "TARNGFLF: 'runAsRoot rundu.sh' call worked. Make sure file exists.";
const std::string CLEANUP_ENTRY = "TARNGFLF: --> tarn_cleanup_partition";

std::string partition_trace(const std::string &partition) {
    return "TARNGFLF: hddPartition is [" + partition + "]";
}

std::string hex(uint32_t value) {
    std::ostringstream out;
    out << std::hex << value;
    return out.str();
}

std::string gather_exit(uint32_t src, uint32_t crc) {
    return "TARNGFLF: <-- tarn_gather_file_list, src = " + hex(src) + ", crc = " + hex(crc) +
           " (hex)";
}

std::string cleanup_exit(uint32_t crc = 0) {
    return "TARNGFLF: <-- tarn_cleanup_partition, src = 0, crc = " + hex(crc) + " (hex)";
}

lines du_traces(const lines &printed) {
    lines traced;
    for (const std::string &line : printed) {
        traced.push_back("TARNMNDF: du data: [" + line + "]");
    }
    return traced;
}

class FileListing : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        log_path = fakes.dir() + "/runAsRoot.log";
    }

    // A runAsRoot that logs its arguments as "[a][b]..." a line, prints `printed`, and, for
    // rundu.sh, writes `listing` into the file it is named in the data directory when `listing`
    // is not empty.
    void fake_run_as_root(const lines &printed, const std::string &listing = "") {
        std::string script = "#!/bin/sh\nfor a in \"$@\"; do printf '[%s]' \"$a\"; done >> '" +
                             log_path + "'\necho >> '" + log_path + "'\n";
        for (const std::string &line : printed) {
            script += "printf '%s\\n' '" + line + "'\n";
        }
        if (!listing.empty()) {
            script += "[ \"$1\" = rundu.sh ] && printf '%s' '" + listing + "' > '" +
                      rec::data_dir() + "/'\"$3\"\n";
        }
        fakes.add("runAsRoot", script + "exit 0\n");
    }

    std::string runs() {
        std::ifstream in(log_path);
        std::stringstream text;
        text << in.rdbuf();
        return text.str();
    }

    // What the data-file service answers for a listing that is not there.
    static std::pair<uint32_t, uint32_t> missing_listing_answer() {
        uint32_t size = 0;
        uint32_t crc = 0;
        uint32_t src = filesvc_query_file_size(FILE_LISTING_NAME, &size, &crc);
        return {src, crc};
    }

    fake_commands fakes;
    std::string log_path;
};

TEST_F(FileListing, ListingRunsRunduWithThePartitionAndTheFileNameAndTracesWhatItPrints) {
    fake_run_as_root({"120 /var/log/big", "40 /var/tmp"}, "120 /var/log/big\n");
    uint32_t crc = 0xDEAD;

    EXPECT_EQ(tarn_gather_file_list("/var", &crc), 0u);

    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(runs(), "[rundu.sh][/var][telvzdu.trm]\n");
    EXPECT_EQ(rec::read_data_file(FILE_LISTING_NAME), "120 /var/log/big\n");
    EXPECT_EQ(rec::traces(), joined({{GATHER_ENTRY, partition_trace("/var")},
                                     du_traces({"120 /var/log/big", "40 /var/tmp"}),
                                     {CALL_WORKED, gather_exit(0, 0)}}));
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 1);
}

TEST_F(FileListing, ScriptThatPrintsNothingStillHasTheListingQueried) {
    fake_run_as_root({});
    auto [missing_src, missing_crc] = missing_listing_answer();
    ASSERT_NE(missing_src, 0u);
    rec::reset();
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_file_list("/data", &crc), missing_src);

    // A missing listing shows only in the closing trace: its report has always stayed dormant.
    EXPECT_EQ(crc, missing_crc);
    EXPECT_EQ(rec::traces(), (lines{GATHER_ENTRY, partition_trace("/data"), CALL_WORKED,
                                    gather_exit(missing_src, missing_crc)}));
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 1);
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(FileListing, FailedSizeQueryIsOnlyTraced) {
    fake_run_as_root({}, "listing\n");
    rec::fail(rec::Call::query_file_size, 8, 0x1234);
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_file_list("/var", &crc), 8u);

    EXPECT_EQ(crc, 0x1234u);
    EXPECT_EQ(rec::traces().back(), gather_exit(8, 0x1234));
    EXPECT_TRUE(rec::events().empty());
}

TEST_F(FileListing, EveryReportedPartitionGetsItsOwnListingIntoTheSameFile) {
    fake_run_as_root({}, "listing\n");
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_file_list("/var", &crc), 0u);
    EXPECT_EQ(tarn_gather_file_list("/tmp", &crc), 0u);

    EXPECT_EQ(runs(), "[rundu.sh][/var][telvzdu.trm]\n[rundu.sh][/tmp][telvzdu.trm]\n");
    EXPECT_EQ(rec::calls(rec::Call::query_file_size), 2);
}

TEST_F(FileListing, RootIsCleanedUpAsDoubleSlash) {
    fake_run_as_root({"removed /tmp/old"});
    uint32_t crc = 0x55;

    EXPECT_EQ(tarn_cleanup_partition("/", &crc), 0u);

    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(runs(), "[cleanupPartition][//]\n");
    EXPECT_EQ(rec::traces(), joined({{CLEANUP_ENTRY, partition_trace("/"),
                                      "TARNGFLF: modifiedHddPartition is [//]"},
                                     du_traces({"removed /tmp/old"}),
                                     {cleanup_exit()}}));
}

TEST_F(FileListing, MountPointGetsASlashAppended) {
    fake_run_as_root({});
    uint32_t crc = 0;

    tarn_cleanup_partition("/var", &crc);

    EXPECT_EQ(runs(), "[cleanupPartition][/var/]\n");
}

TEST_F(FileListing, CrcIsZeroAfterACleanUpEvenWhenTheListingBeforeItSetIt) {
    fake_run_as_root({});
    uint32_t crc = 0;
    tarn_gather_file_list("/var", &crc);
    ASSERT_NE(crc, 0u); // no listing was written

    EXPECT_EQ(tarn_cleanup_partition("/var", &crc), 0u);

    EXPECT_EQ(crc, 0u);
}

TEST_F(FileListing, LongMountPointKeepsItsFirst511CharactersBeforeTheSlash) {
    fake_run_as_root({});
    const std::string mount(600, 'm');
    uint32_t crc = 0;

    tarn_cleanup_partition(mount.c_str(), &crc);

    const std::string modified = mount.substr(0, 511) + "/";
    EXPECT_EQ(runs(), "[cleanupPartition][" + modified + "]\n");
    EXPECT_EQ(rec::traces()[2], "TARNGFLF: modifiedHddPartition is [" + modified + "]");
}

TEST_F(FileListing, MountPointOf511CharactersKeepsThemAll) {
    fake_run_as_root({});
    const std::string mount(511, 'm');
    uint32_t crc = 0;

    tarn_cleanup_partition(mount.c_str(), &crc);

    EXPECT_EQ(runs(), "[cleanupPartition][" + mount + "/]\n");
}

TEST_F(FileListing, MissingRunAsRootIsTracedAndTheListingStillQueried) {
    fake_commands alone(fake_commands::path_mode::only);
    rec::write_data_file(FILE_LISTING_NAME, "an earlier listing\n");
    uint32_t crc = 0;

    EXPECT_EQ(tarn_gather_file_list("/var", &crc), 0u);
    EXPECT_EQ(tarn_cleanup_partition("/var", &crc), 0u);

    const std::string exec_failed =
        "TARNMNDF: rc from free execvp call is: -1; errno=" + std::to_string(ENOENT) + ".";
    EXPECT_EQ(rec::traces(),
              (lines{GATHER_ENTRY, partition_trace("/var"), exec_failed, CALL_WORKED,
                     gather_exit(0, 0), CLEANUP_ENTRY, partition_trace("/var"),
                     "TARNGFLF: modifiedHddPartition is [/var/]", exec_failed, cleanup_exit()}));
}

TEST_F(FileListing, WithoutAPipeNothingRunsAndNothingIsQueried) {
    fake_run_as_root({"never"}, "listing\n");

    std::string report = fake::run_without_descriptors([] {
        uint32_t crc = 7;
        uint32_t listing_src = tarn_gather_file_list("/var", &crc);
        std::string text = std::to_string(listing_src) + " " + std::to_string(crc) + " " +
                           std::to_string(rec::calls(rec::Call::query_file_size)) + "\n";
        crc = 7;
        tarn_cleanup_partition("/var", &crc);
        text += std::to_string(crc) + "\n";
        for (const std::string &trace : rec::traces()) {
            text += trace + "\n";
        }
        return text;
    });

    const std::string pipe_failed =
        "TARNMNDF: rc from free pipe call is: -1; errno=" + std::to_string(EMFILE) + ".";
    EXPECT_EQ(report, "0 0 0\n0\n" + GATHER_ENTRY + "\n" + partition_trace("/var") + "\n" +
                          pipe_failed + "\n" + gather_exit(0, 0) + "\n" + CLEANUP_ENTRY + "\n" +
                          partition_trace("/var") +
                          "\nTARNGFLF: modifiedHddPartition is [/var/]\n" + pipe_failed + "\n" +
                          cleanup_exit() + "\n");
    EXPECT_EQ(runs(), "");
}

} // namespace

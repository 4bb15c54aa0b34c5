// The file system check over a fake df that prints what each test gives it for the space run and
// for the inode run, and a fake runAsRoot that records the listing and clean-up runs it is asked
// for. One test runs the real df of the test host.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>

#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "filesvc.h"
#include "recording_platform.h"
#include "starved_child.h"
#include "storage/file_listing.h"
#include "storage/file_system.h"
#include "text_lines.h"

namespace {

using fake::fake_commands;
using text::joined;
using text::left_aligned;
using text::lines;
using text::right_aligned;

constexpr char SPACE_SECTION[] = "\n\rAbout to output df data \n\r";
constexpr char INODE_SECTION[] = "\n\rAbout to output df --inodes data \n\r";
constexpr int32_t SPACE_HEADER_LENGTH = 26;
constexpr int32_t INODE_HEADER_LENGTH = 35;
constexpr char OVERFLOW_LINE[] = "No room to output more lines... \n\r";
constexpr uint32_t CRC_GIVEN = 0x1234;
constexpr int32_t THRESHOLD = 900; // every threshold of a test unless it says otherwise
constexpr int32_t SUPPRESSED = TAKE_LOG_SUPPRESSED;
constexpr int32_t EARLIER_FINDING = RC_PROCESS_CPU;

// ---- What df prints ----

const std::string SPACE_HEADING = "Filesystem     Type      Size  Used Avail Use% Mounted on";
const std::string INODE_HEADING = "Filesystem      Inodes  IUsed   IFree IUse% Mounted on";

std::string space_line(const std::string &device, const std::string &type, int percent,
                       const std::string &mount) {
    return left_aligned(device, 14) + " " + left_aligned(type, 8) + "   20G   10G   10G " +
           right_aligned(std::to_string(percent) + "%", 4) + " " + mount;
}

std::string inode_line(const std::string &device, const std::string &percent,
                       const std::string &mount) {
    return left_aligned(device, 14) + " 1310720 123456 1187264 " + right_aligned(percent, 5) + " " +
           mount;
}

std::string inode_line(const std::string &device, int percent, const std::string &mount) {
    return inode_line(device, std::to_string(percent) + "%", mount);
}

std::string text_of(const lines &output) {
    std::string text;
    for (const std::string &line : output) {
        text += line + "\n";
    }
    return text;
}

std::string copied(const lines &output) {
    std::string text;
    for (const std::string &line : output) {
        text += line + "\n\r";
    }
    return text;
}

int32_t cost_of(const lines &output) {
    int32_t cost = 0;
    for (const std::string &line : output) {
        cost += static_cast<int32_t>(line.size()) + 3;
    }
    return cost;
}

std::string hex(uint32_t value) {
    std::ostringstream out;
    out << std::hex << value;
    return out.str();
}

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream all;
    all << in.rdbuf();
    return all.str();
}

// ---- What the check traces ----

const std::string CHECK_ENTRY = "TARNOTHF: --> tarn_check_file_system";

std::string check_exit(uint32_t crc, int32_t take_log_crc) {
    return "TARNOTHF: <-- tarn_check_file_system, src = 0, compRc = " + hex(crc) +
           " (hex), TakeLogCrc = " + hex(static_cast<uint32_t>(take_log_crc)) + "(hex) ";
}

// The traces of a space line before its rule.
lines space_line_traces(const std::string &line, const std::string &mount) {
    return {"TARNMNDD: ps data: [" + line + "]", "TARNMNDD: words[6] = [" + mount + "]"};
}

lines report_traces(const std::string &message, int32_t used, const std::string &line) {
    return {"TARNMNDF: " + message,
            "TARNMNDF: percent_used = " + std::to_string(used / 10) + " (dec)",
            "TARNMNDF: Entire line was [" + line + "]"};
}

std::string loop_trace(const std::string &device) {
    return "TARNMNDF: found loop device [" + device + "], ignore";
}

std::string media_trace(const std::string &mount) {
    return "TARNMNDF: found removeable media [" + mount + "], ignore";
}

const std::string EXTRA_CLEARED = "TARNMNDF: setting extraFileSystemSRCOn as false";

// The runs of runAsRoot as the fake logs them.
std::string listing_run(const std::string &mount) {
    return "[rundu.sh][" + mount + "][telvzdu.trm]\n";
}
std::string cleanup_run(const std::string &mount) {
    return "[cleanupPartition][" + mount + "/]\n";
}

// Every threshold of the file system check set to `value`.
void set_all_thresholds(int32_t value) {
    for (int32_t *threshold : {&dasd_percent_threshold,
                               &dasd_percent_slash_threshold,
                               &dasd_percent_slash_inode_threshold,
                               &dasd_percent_var_threshold,
                               &dasd_percent_var_inode_threshold,
                               &dasd_percent_tmp_threshold,
                               &dasd_percent_tmp_inode_threshold,
                               &dasd_percent_console_threshold,
                               &dasd_percent_console_inode_threshold,
                               &dasd_percent_ffdc_threshold,
                               &dasd_percent_ffdc_inode_threshold,
                               &dasd_percent_console_ffdc_threshold,
                               &dasd_percent_console_ffdc_inode_threshold,
                               &dasd_percent_dev_shm_threshold,
                               &dasd_percent_dev_shm_inode_threshold,
                               &dasd_percent_dump_threshold,
                               &dasd_percent_dump_inode_threshold,
                               &dasd_percent_extra_threshold,
                               &dasd_percent_extra_inode_threshold,
                               &dasd_percent_kzrdump_threshold,
                               &dasd_percent_kzrdump_inode_threshold,
                               &dasd_percent_mnt_upgrade_threshold,
                               &dasd_percent_mnt_upgrade_inode_threshold,
                               &dasd_percent_data_threshold,
                               &dasd_percent_data_inode_threshold,
                               &dasd_percent_var_wqn_log_threshold,
                               &dasd_percent_var_wqn_log_inode_threshold}) {
        *threshold = value;
    }
}

// ---- The fixture ----

class FileSystem : public ::testing::Test {
  protected:
    void SetUp() override {
        rec::reset();
        reset_settings();
        set_all_thresholds(THRESHOLD);
        extraFileSystemSRCOn = 0;
        std::memset(words, 0, sizeof words);
        start_pass();
        fake_run_as_root();
        fake_df({}, {});
    }

    void start_pass() {
        start_pass_data();
        takeLogCrc = 0;
        takeLogValue = 0;
    }

    // A df that logs its arguments and prints `space` for -h and `inodes` for --inodes.
    void fake_df(const lines &space, const lines &inodes) {
        std::ofstream(fakes.dir() + "/df.space", std::ios::binary) << text_of(space);
        std::ofstream(fakes.dir() + "/df.inodes", std::ios::binary) << text_of(inodes);
        const std::string dir = fakes.dir();
        fakes.add("df", "#!/bin/sh\nfor a in \"$@\"; do printf '[%s]' \"$a\"; done >> '" + dir +
                            "/df.log'\necho >> '" + dir + "/df.log'\ncase \"$1\" in\n-h) exec " +
                            "/bin/cat '" + dir + "/df.space';;\n--inodes) exec /bin/cat '" + dir +
                            "/df.inodes';;\nesac\n");
    }

    // A runAsRoot that logs its arguments and, for rundu.sh, writes a listing into the data
    // directory, so that the size query finds it.
    void fake_run_as_root() {
        const std::string log = fakes.dir() + "/runAsRoot.log";
        fakes.add("runAsRoot", "#!/bin/sh\nfor a in \"$@\"; do printf '[%s]' \"$a\"; done >> '" +
                                   log + "'\necho >> '" + log +
                                   "'\n[ \"$1\" = rundu.sh ] && echo listing > '" +
                                   rec::data_dir() + "/'\"$3\"\nexit 0\n");
    }

    uint32_t check() {
        crc = CRC_GIVEN;
        rec::clear_traces();
        return tarn_check_file_system(&takeLogCrc, &takeLogValue, &tookLog, &crc);
    }

    uint32_t check_with(const lines &space, const lines &inodes) {
        fake_df(space, inodes);
        return check();
    }

    std::string runs() { return read_file(fakes.dir() + "/runAsRoot.log"); }
    std::string df_runs() { return read_file(fakes.dir() + "/df.log"); }

    // The check's own traces between its entry and exit, without those of the listing and
    // clean-up runs.
    lines own_traces() {
        lines own;
        for (const std::string &line : rec::traces()) {
            if (line.rfind("TARNGFLF:", 0) != 0 && line.rfind("TARNMNDF: du data", 0) != 0) {
                own.push_back(line);
            }
        }
        return own;
    }

    lines check_traces(const lines &body) {
        return joined({{CHECK_ENTRY}, body, {check_exit(crc, takeLogCrc)}});
    }

    void expect_finding(int32_t code, int32_t value) {
        EXPECT_EQ(takeLogCrc, code);
        EXPECT_EQ(takeLogValue, value);
    }

    fake_commands fakes;
    int32_t takeLogCrc = 0;
    int32_t takeLogValue = 0;
    uint32_t tookLog = 0;
    uint32_t crc = 0;
};

std::string block_of(const lines &space, const lines &inodes) {
    return SPACE_SECTION + copied(space) + INODE_SECTION + copied(inodes);
}

std::string block_text() {
    return std::string(primaryDataBlock, strnlen(primaryDataBlock, PRIMARY_DATA_BLOCK_SIZE));
}

// ---- The two runs ----

TEST_F(FileSystem, RunsDfForSpaceAndThenForInodesAndCopiesBothIntoTheOutputBlock) {
    const lines space = {SPACE_HEADING, space_line("/dev/sda1", "ext4", 20, "/")};
    const lines inodes = {INODE_HEADING, inode_line("/dev/sda1", 3, "/")};

    EXPECT_EQ(check_with(space, inodes), 0u);

    EXPECT_EQ(df_runs(), "[-h][-l][-T]\n[--inodes][-l]\n");
    EXPECT_EQ(block_text(), block_of(space, inodes));
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET + SPACE_HEADER_LENGTH - cost_of(space) +
                                 INODE_HEADER_LENGTH - cost_of(inodes));
    expect_finding(0, 0);
    EXPECT_EQ(crc, CRC_GIVEN);
    EXPECT_EQ(runs(), "");
    // df's heading line is of no type judged by space: it is skipped as its "Filesystem" device.
    EXPECT_EQ(rec::traces(), check_traces(joined({space_line_traces(space[0], "Mounted"),
                                                  {loop_trace("Filesystem")},
                                                  space_line_traces(space[1], "/")})));
}

TEST_F(FileSystem, EmptyOutputLeavesTheTwoHeadersOnly) {
    EXPECT_EQ(check_with({}, {}), 0u);

    EXPECT_EQ(block_text(), std::string(SPACE_SECTION) + INODE_SECTION);
    EXPECT_EQ(outbufferleft, OUTBUFFER_BUDGET + SPACE_HEADER_LENGTH + INODE_HEADER_LENGTH);
    EXPECT_EQ(rec::traces(), check_traces({}));
}

TEST_F(FileSystem, ClosingTraceEndsInABlankAndShowsCrcAndTakeLogCrcInHex) {
    takeLogCrc = EARLIER_FINDING;
    check_with({}, {});
    EXPECT_EQ(rec::traces().back(),
              "TARNOTHF: <-- tarn_check_file_system, src = 0, compRc = 1234 (hex), TakeLogCrc = "
              "e150(hex) ");
}

// ---- Thresholds of the known partitions ----

TEST_F(FileSystem, PercentAtTheThresholdIsNotAFinding) {
    const lines space = {space_line("/dev/sda2", "ext4", 90, "/var")};
    const lines inodes = {inode_line("/dev/sda2", 90, "/var")};

    check_with(space, inodes);

    expect_finding(0, 0);
    EXPECT_EQ(runs(), "");
    EXPECT_EQ(rec::traces(), check_traces(space_line_traces(space[0], "/var")));
}

TEST_F(FileSystem, OnePercentOverTheThresholdIsReportedWithListingAndCleanUp) {
    const lines space = {space_line("/dev/sda2", "ext4", 91, "/var")};

    check_with(space, {});

    expect_finding(0xE134, 910);
    EXPECT_EQ(crc, 0u); // set by the clean-up run
    EXPECT_EQ(runs(), listing_run("/var") + cleanup_run("/var"));
    EXPECT_EQ(own_traces(),
              check_traces(joined({space_line_traces(space[0], "/var"),
                                   report_traces("/var is too full", 910, space[0])})));
    // The listing comes before the clean-up, both after the report's traces.
    int listing = rec::find_trace("TARNGFLF: --> tarn_gather_file_list");
    int cleanup = rec::find_trace("TARNGFLF: --> tarn_cleanup_partition");
    EXPECT_GT(listing, rec::find_trace("TARNMNDF: Entire line was [" + space[0] + "]"));
    EXPECT_GT(cleanup, listing);
}

TEST_F(FileSystem, InodeThresholdIsJudgedInTheInodePass) {
    dasd_percent_var_threshold = 1000;
    const lines inodes = {inode_line("/dev/sda2", 91, "/var")};

    check_with({}, inodes);

    expect_finding(0xE144, 910);
    EXPECT_EQ(runs(), listing_run("/var") + cleanup_run("/var"));
    EXPECT_EQ(own_traces(), check_traces(report_traces("/var has too many files", 910, inodes[0])));
}

TEST_F(FileSystem, TookLogSetMarksTheFindingOnlyAndLeavesTheValue) {
    tookLog = 1;
    takeLogValue = 77;
    const lines space = {space_line("/dev/sda2", "ext4", 95, "/var")};

    check_with(space, {});

    expect_finding(SUPPRESSED, 77);
    EXPECT_EQ(runs(), "");
    EXPECT_EQ(rec::traces(), check_traces(space_line_traces(space[0], "/var")));
}

TEST_F(FileSystem, TookLogSetMarksEvenOverAnEarlierChecksCode) {
    tookLog = 1;
    takeLogCrc = EARLIER_FINDING;
    check_with({}, {inode_line("/dev/sda2", 99, "/tmp")});
    EXPECT_EQ(takeLogCrc, SUPPRESSED);
}

TEST_F(FileSystem, AFindingOverwritesAnEarlierChecksFinding) {
    takeLogCrc = EARLIER_FINDING;
    takeLogValue = 5;
    check_with({space_line("/dev/sda3", "ext4", 95, "/tmp")}, {});
    expect_finding(0xE135, 950);
}

// Each known mount point with its codes and the name its messages give it, as the appliance's
// event catalogue has them.
struct known_row {
    const char *mount;
    const char *named_as;
    int32_t space_code;
    int32_t inode_code;
    int32_t *space_threshold;
    int32_t *inode_threshold;
};

const known_row KNOWN_ROWS[] = {
    {"/console/ffdc", "/console/ffdc", 0xE131, 0xE141, &dasd_percent_console_ffdc_threshold,
     &dasd_percent_console_ffdc_inode_threshold},
    {"/console", "/console", 0xE132, 0xE142, &dasd_percent_console_threshold,
     &dasd_percent_console_inode_threshold},
    {"/ffdc", "/ffdc", 0xE133, 0xE143, &dasd_percent_ffdc_threshold,
     &dasd_percent_ffdc_inode_threshold},
    {"/var", "/var", 0xE134, 0xE144, &dasd_percent_var_threshold,
     &dasd_percent_var_inode_threshold},
    {"/tmp", "/tmp", 0xE135, 0xE145, &dasd_percent_tmp_threshold,
     &dasd_percent_tmp_inode_threshold},
    {"/", "/", 0xE136, 0xE146, &dasd_percent_slash_threshold, &dasd_percent_slash_inode_threshold},
    {"/dev/shm", "/dev/shm", 0xE137, 0xE147, &dasd_percent_dev_shm_threshold,
     &dasd_percent_dev_shm_inode_threshold},
    {"/dump", "/dump", 0xE138, 0xE148, &dasd_percent_dump_threshold,
     &dasd_percent_dump_inode_threshold},
    {"/extra", "/extra", 0xE139, 0xE149, &dasd_percent_extra_threshold,
     &dasd_percent_extra_inode_threshold},
    {"/kzrdump", "/kzrdump", 0xE13A, 0xE14A, &dasd_percent_kzrdump_threshold,
     &dasd_percent_kzrdump_inode_threshold},
    {"/mnt/upgrade", "/mnt_upgrade", 0xE13B, 0xE14B, &dasd_percent_mnt_upgrade_threshold,
     &dasd_percent_mnt_upgrade_inode_threshold},
    {"/data", "/data", 0xE13C, 0xE14C, &dasd_percent_data_threshold,
     &dasd_percent_data_inode_threshold},
    {"/var/wqn/log", "/var/wqn/log", 0xE13D, 0xE14D, &dasd_percent_var_wqn_log_threshold,
     &dasd_percent_var_wqn_log_inode_threshold},
};

TEST_F(FileSystem, EveryKnownMountPointHasItsOwnThresholdsCodesAndMessages) {
    for (const known_row &row : KNOWN_ROWS) {
        SCOPED_TRACE(row.mount);
        set_all_thresholds(0); // any other threshold would fire first if it were the one used
        dasd_percent_threshold = 1000;
        *row.space_threshold = 940;
        *row.inode_threshold = 1000;
        // A type df never judges by space elsewhere: known mount points are judged whatever it is.
        const std::string space = space_line("/dev/x", "xfs", 95, row.mount);
        start_pass();
        fake_run_as_root();
        std::remove((fakes.dir() + "/runAsRoot.log").c_str());
        check_with({space}, {});
        expect_finding(row.space_code, 950);
        EXPECT_EQ(own_traces(),
                  check_traces(joined(
                      {space_line_traces(space, row.mount),
                       report_traces(std::string(row.named_as) + " is too full", 950, space)})));
        EXPECT_EQ(runs(), listing_run(row.mount) + cleanup_run(row.mount));

        *row.space_threshold = 1000;
        *row.inode_threshold = 940;
        const std::string inodes = inode_line("/dev/loop1", 95, row.mount);
        start_pass();
        std::remove((fakes.dir() + "/runAsRoot.log").c_str());
        check_with({}, {inodes});
        expect_finding(row.inode_code, 950);
        EXPECT_EQ(own_traces(),
                  check_traces(report_traces(std::string(row.named_as) + " has too many files", 950,
                                             inodes)));
        EXPECT_EQ(runs(), listing_run(row.mount) + cleanup_run(row.mount));
    }
}

TEST_F(FileSystem, RootIsOnlyTheOneCharacterMountPoint) {
    set_all_thresholds(1000);
    dasd_percent_threshold = 900;
    // "//" and "/ " are other mount points to the table: the general rule judges them.
    check_with({space_line("/dev/sda9", "ext4", 95, "//")}, {});
    expect_finding(RC_OTHER_PARTITION_SPACE, 950);
}

TEST_F(FileSystem, MountPointsAreComparedCaseSensitively) {
    set_all_thresholds(1000);
    dasd_percent_threshold = 900;
    check_with({}, {inode_line("/dev/sda2", 95, "/VAR")});
    expect_finding(RC_OTHER_PARTITION_INODES, 950);
}

// ---- /extra by space ----

TEST_F(FileSystem, FullExtraIsReportedOnceAsItsOwnCodeWithoutTheMark) {
    const lines space = {space_line("/dev/sdc1", "ext4", 95, "/extra")};

    check_with(space, {});

    expect_finding(0xE139, 950);
    EXPECT_EQ(extraFileSystemSRCOn, 0);
    EXPECT_EQ(runs(), listing_run("/extra") + cleanup_run("/extra"));
    EXPECT_EQ(own_traces(),
              check_traces(joined({space_line_traces(space[0], "/extra"),
                                   report_traces("/extra is too full", 950, space[0])})));
}

TEST_F(FileSystem, FullExtraIsHeldBackWhileItsFlagIsSet) {
    extraFileSystemSRCOn = 1;
    const lines space = {space_line("/dev/sdc1", "ext4", 95, "/extra")};

    check_with(space, {});

    expect_finding(0, 0);
    EXPECT_EQ(extraFileSystemSRCOn, 1);
    EXPECT_EQ(runs(), "");
    EXPECT_EQ(rec::traces(), check_traces(space_line_traces(space[0], "/extra")));
}

TEST_F(FileSystem, FullExtraWithTookLogSetLeavesNoMark) {
    tookLog = 1;
    check_with({space_line("/dev/sdc1", "ext4", 95, "/extra")}, {});
    expect_finding(0, 0);
    EXPECT_EQ(runs(), "");
}

TEST_F(FileSystem, ExtraAtItsThresholdClearsTheFlagOnEveryPass) {
    extraFileSystemSRCOn = 1;
    const lines space = {space_line("/dev/sdc1", "ext4", 90, "/extra")};
    for (int pass = 0; pass < 2; ++pass) {
        start_pass();
        check_with(space, {});
        EXPECT_EQ(extraFileSystemSRCOn, 0);
        expect_finding(0, 0);
        EXPECT_EQ(rec::traces(),
                  check_traces(joined({space_line_traces(space[0], "/extra"), {EXTRA_CLEARED}})));
    }
}

TEST_F(FileSystem, ExtraByInodesFollowsTheOrdinaryRule) {
    extraFileSystemSRCOn = 1;
    check_with({}, {inode_line("/dev/sdc1", 95, "/extra")});
    expect_finding(0xE149, 950);
    EXPECT_EQ(runs(), listing_run("/extra") + cleanup_run("/extra"));

    start_pass();
    tookLog = 1;
    check_with({}, {inode_line("/dev/sdc1", 95, "/extra")});
    expect_finding(SUPPRESSED, 0);
}

// ---- Mount points in no row ----

TEST_F(FileSystem, OtherFileSystemTypesAreJudgedByInodesOnly) {
    const lines space = {space_line("/dev/sdd1", "xfs", 99, "/opt"),
                         space_line("tmpfs", "tmpfs", 99, "/run")};
    const lines inodes = {inode_line("/dev/sdd1", 95, "/opt")};

    check_with(space, inodes);

    expect_finding(RC_OTHER_PARTITION_INODES, 950);
    // By inodes every reported partition has its files listed; there is no clean-up.
    EXPECT_EQ(runs(), listing_run("/opt"));
    EXPECT_EQ(own_traces(),
              check_traces(
                  joined({space_line_traces(space[0], "/opt"),
                          {loop_trace("/dev/sdd1")},
                          space_line_traces(space[1], "/run"),
                          {loop_trace("tmpfs")},
                          report_traces("A DASD partition has too many files", 950, inodes[0])})));
}

TEST_F(FileSystem, Ext3AndExt4AreJudgedByTheFirstFourCharactersOfTheirType) {
    for (const char *type : {"ext3", "ext4", "ext4dev"}) {
        SCOPED_TRACE(type);
        start_pass();
        check_with({space_line("/dev/sdd1", type, 95, "/srv")}, {});
        expect_finding(RC_OTHER_PARTITION_SPACE, 950);
    }
    start_pass();
    check_with({space_line("/dev/sdd1", "ext2", 95, "/srv")}, {});
    expect_finding(0, 0);
}

TEST_F(FileSystem, FullHomeBySpaceHasItsFilesListedAndOtherPartitionsDoNot) {
    const lines home = {space_line("/dev/sde1", "ext4", 95, "/home")};
    check_with(home, {});
    expect_finding(RC_OTHER_PARTITION_SPACE, 950);
    EXPECT_EQ(runs(), listing_run("/home"));
    EXPECT_EQ(own_traces(),
              check_traces(joined({space_line_traces(home[0], "/home"),
                                   report_traces("A DASD partition is too full", 950, home[0])})));

    start_pass();
    std::remove((fakes.dir() + "/runAsRoot.log").c_str());
    check_with({space_line("/dev/sde2", "ext4", 95, "/srv")}, {});
    expect_finding(RC_OTHER_PARTITION_SPACE, 950);
    EXPECT_EQ(runs(), "");
}

TEST_F(FileSystem, EveryPartitionFullByInodesHasItsFilesListed) {
    check_with({}, {inode_line("/dev/sde1", 95, "/home"), inode_line("/dev/sde2", 96, "/srv")});
    expect_finding(RC_OTHER_PARTITION_INODES, 960);
    EXPECT_EQ(runs(), listing_run("/home") + listing_run("/srv"));
}

TEST_F(FileSystem, RemovableMediaAreIgnoredInBothPasses) {
    const lines space = {space_line("/dev/sdf1", "ext4", 99, "/media/usb0")};
    const lines inodes = {inode_line("/dev/sdf1", 99, "/media/usb0")};

    check_with(space, inodes);

    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(),
              check_traces(joined({space_line_traces(space[0], "/media/usb0"),
                                   {media_trace("/media/usb0"), media_trace("/media/usb0")}})));
}

TEST_F(FileSystem, LoopDevicesAreIgnoredByInodesAndBySpaceUnlessExt) {
    const lines space = {space_line("/dev/loop3", "squashfs", 100, "/snap/core/1"),
                         space_line("/dev/loop4", "ext4", 95, "/mnt/image")};
    const lines inodes = {inode_line("/dev/loop3", 100, "/snap/core/1"),
                          inode_line("/dev/loop4", 100, "/mnt/image")};

    check_with(space, inodes);

    expect_finding(RC_OTHER_PARTITION_SPACE, 950);
    EXPECT_EQ(own_traces(),
              check_traces(joined({space_line_traces(space[0], "/snap/core/1"),
                                   {loop_trace("/dev/loop3")},
                                   space_line_traces(space[1], "/mnt/image"),
                                   report_traces("A DASD partition is too full", 950, space[1]),
                                   {loop_trace("/dev/loop3"), loop_trace("/dev/loop4")}})));
}

TEST_F(FileSystem, InstallImagesAreIgnoredByInodesUnderTheLoopDeviceTrace) {
    check_with({}, {inode_line("/dev/sdg1", 100, "/dump/wqn_install.images.2"),
                    inode_line("/dev/sdg2", 100, "/dump/wqn_install.image")});
    // Only the full 24 characters of the prefix ignore a mount point.
    expect_finding(RC_OTHER_PARTITION_INODES, 1000);
    EXPECT_EQ(own_traces()[1], loop_trace("/dev/sdg1"));
}

// ---- Order of findings ----

TEST_F(FileSystem, TwoFullPartitionsAreBothListedAndCleanedUpAndTheLaterOneIsReported) {
    check_with(
        {space_line("/dev/sda2", "ext4", 95, "/var"), space_line("/dev/sda3", "ext4", 97, "/tmp")},
        {});
    expect_finding(0xE135, 970);
    EXPECT_EQ(runs(), listing_run("/var") + cleanup_run("/var") + listing_run("/tmp") +
                          cleanup_run("/tmp"));
}

TEST_F(FileSystem, AnInodeFindingOverridesASpaceFindingOfTheSamePass) {
    check_with({space_line("/dev/sda3", "ext4", 97, "/tmp")},
               {inode_line("/dev/sda2", 92, "/var")});
    expect_finding(0xE144, 920);
}

// ---- Lines that do not look like df's ----

TEST_F(FileSystem, ShortLineKeepsThePreviousLinesWordsAndIsJudgedWithThem) {
    const std::string var = space_line("/dev/sda2", "ext4", 95, "/var");
    const lines space = {var, "/dev/sdh1 ext4"};
    tookLog = 0;

    check_with(space, {});

    // The short line takes the previous line's use and mount point: /var is reported twice, the
    // second time quoting the short line.
    expect_finding(0xE134, 950);
    EXPECT_EQ(own_traces(),
              check_traces(joined({space_line_traces(var, "/var"),
                                   report_traces("/var is too full", 950, var),
                                   space_line_traces(space[1], "/var"),
                                   report_traces("/var is too full", 950, space[1])})));
    EXPECT_EQ(runs(), listing_run("/var") + cleanup_run("/var") + listing_run("/var") +
                          cleanup_run("/var"));
}

TEST_F(FileSystem, WordsOfTheSpacePassCarryIntoTheInodePass) {
    // The inode pass splits six words: the seventh slot still holds the last space line's.
    check_with({space_line("/dev/sda2", "ext4", 10, "/var")}, {"a b c d 95%"});
    // "a b c d 95%" fills slots 0 to 4; its mount point is slot 5, left from the space line.
    EXPECT_EQ(std::string(words[5]), "10%");
    expect_finding(RC_OTHER_PARTITION_INODES, 950);
    EXPECT_EQ(own_traces().back(), check_exit(crc, takeLogCrc));
}

TEST_F(FileSystem, WrappedLineOfALongDeviceNameIsJudgedWithLeftOverWords) {
    const std::string device = "/dev/mapper/vg_appliance-lv_data_volume_long";
    const lines space = {space_line("/dev/sda2", "ext4", 10, "/var"), device,
                         "               ext4       20G   19G  1.0G  95% /data"};

    check_with(space, {});

    // The device alone keeps /var's words; the rest of the line fills slots 0 to 5, so its use
    // is read from "/data" (0) and its mount point is still "/var".
    expect_finding(0, 0);
    EXPECT_EQ(rec::traces(), check_traces(joined({space_line_traces(space[0], "/var"),
                                                  space_line_traces(space[1], "/var"),
                                                  space_line_traces(space[2], "/var")})));
}

TEST_F(FileSystem, MountPointWithABlankIsJudgedByItsFirstWord) {
    const std::string line = space_line("/dev/sdi1", "ext4", 95, "/mnt/my disk");
    check_with({line}, {});
    expect_finding(RC_OTHER_PARTITION_SPACE, 950);
    EXPECT_EQ(own_traces()[2], "TARNMNDD: words[6] = [/mnt/my]");
    EXPECT_EQ(own_traces()[4], "TARNMNDF: percent_used = 95 (dec)");
}

TEST_F(FileSystem, InodePercentOfADashReadsAsZero) {
    dasd_percent_threshold = -1;
    set_all_thresholds(-1);
    check_with({}, {inode_line("/dev/sdj1", "-", "/boot/efi")});
    // "-" reads as 0, which is over a threshold of -1: the used value is 0.
    expect_finding(RC_OTHER_PARTITION_INODES, 0);

    start_pass();
    set_all_thresholds(0);
    check_with({}, {inode_line("/dev/sdj1", "-", "/boot/efi")});
    expect_finding(0, 0);
}

TEST_F(FileSystem, HugePercentWrapsAsTheThirtyTwoBitProductDoes) {
    // 300,000,000 x 10 passes 32 bits and wraps to a negative used value: no finding.
    check_with({}, {inode_line("/dev/sdk1", "300000000%", "/var")});
    expect_finding(0, 0);
    // 2,147,483,647 clamps, then x 10 wraps to -10.
    set_all_thresholds(-20);
    start_pass();
    check_with({}, {inode_line("/dev/sdk1", "99999999999%", "/var")});
    expect_finding(0xE144, -10);
}

TEST_F(FileSystem, LongWordsAreCutAndNeverSpillIntoTheNextSlot) {
    const std::string mount = "/" + std::string(400, 'm');
    check_with({space_line("/dev/sdl1", "ext4", 95, mount)}, {});
    EXPECT_EQ(std::string(words[6]), mount.substr(0, 249));
    EXPECT_EQ(own_traces()[2], "TARNMNDD: words[6] = [" + mount.substr(0, 249) + "]");
    expect_finding(RC_OTHER_PARTITION_SPACE, 950);
}

// ---- The output block ----

TEST_F(FileSystem, OutputBeyondTheBlocksRoomGetsOneNoteAndIsStillJudged) {
    outbufferleft = 200;
    lines space;
    for (int i = 0; i < 5; ++i) {
        space.push_back(
            space_line("/dev/sdm" + std::to_string(i), "ext4", 10, "/m" + std::to_string(i)));
    }
    space.push_back(space_line("/dev/sda2", "ext4", 95, "/var"));

    check_with(space, {inode_line("/dev/sda2", 1, "/var")});

    expect_finding(0xE134, 950);
    std::string text = block_text();
    EXPECT_EQ(text.find(OVERFLOW_LINE), text.rfind(OVERFLOW_LINE));
    EXPECT_NE(text.find(OVERFLOW_LINE), std::string::npos);
    EXPECT_EQ(pdboverflow, 1);
    // The inode header still goes in after the note, and adds its length.
    EXPECT_NE(text.find(INODE_SECTION), std::string::npos);
    EXPECT_EQ(outbufferleft, 4 + INODE_HEADER_LENGTH);
}

// ---- Failures ----

TEST_F(FileSystem, MissingDfIsTracedForEachRunAndTheCheckGoesOn) {
    fake_commands only(fake_commands::path_mode::only);

    EXPECT_EQ(check(), 0u);

    expect_finding(0, 0);
    EXPECT_EQ(block_text(), std::string(SPACE_SECTION) + INODE_SECTION);
    EXPECT_EQ(rec::traces(), check_traces({"TARNMNDF: rc from df execvp call is: -1; errno=2.",
                                           "TARNMNDF: rc from df1 execvp call is: -1; errno=2."}));
}

TEST_F(FileSystem, NoPipeSkipsEachRunWithItsOwnTrace) {
    std::string traces = fake::run_without_descriptors([] {
        uint32_t given = CRC_GIVEN;
        int32_t code = 0;
        int32_t value = 0;
        uint32_t took = 0;
        tarn_check_file_system(&code, &value, &took, &given);
        std::string all;
        for (const std::string &line : rec::traces()) {
            all += line + "\n";
        }
        return all + (block_text() == std::string(SPACE_SECTION) + INODE_SECTION ? "headers\n"
                                                                                 : "block?\n");
    });
    EXPECT_EQ(traces, CHECK_ENTRY + "\n" +
                          "TARNMNDF: rc from df pipe call is: -1; errno=24.\n"
                          "TARNMNDF: rc from df1 pipe call is: -1; errno=24.\n" +
                          check_exit(CRC_GIVEN, 0) + "\nheaders\n");
}

TEST_F(FileSystem, ListingThatCannotBeFoundIsSeenInTheClosingTraceOnly) {
    fakes.add("runAsRoot", "#!/bin/sh\nexit 0\n");
    uint32_t size = 0;
    uint32_t missing_crc = 0;
    filesvc_query_file_size(FILE_LISTING_NAME, &size, &missing_crc);

    check_with({space_line("/dev/sda2", "ext4", 95, "/home")}, {});

    expect_finding(RC_OTHER_PARTITION_SPACE, 950);
    EXPECT_EQ(crc, missing_crc);
    EXPECT_EQ(rec::traces().back(), check_exit(missing_crc, RC_OTHER_PARTITION_SPACE));
    EXPECT_TRUE(rec::events().empty());
}

// ---- The real df ----

TEST_F(FileSystem, RealDfUnderGenerousThresholdsFindsNothing) {
    fakes.remove("df");
    set_all_thresholds(1000);

    EXPECT_EQ(check(), 0u);

    expect_finding(0, 0);
    EXPECT_NE(rec::find_trace("TARNMNDD: words[6] = [/]"), -1);
    std::string text = block_text();
    EXPECT_NE(text.find("Mounted on\n\r"), std::string::npos);
    EXPECT_NE(text.find(INODE_SECTION), std::string::npos);
    EXPECT_EQ(runs(), "");
}

TEST_F(FileSystem, RealDfUnderAThresholdOf11OnRootReportsIt) {
    fakes.remove("df");
    set_all_thresholds(1000);
    dasd_percent_slash_threshold = 11;

    check();

    // The test host's root holds more than 1.1 % of its space.
    EXPECT_EQ(takeLogCrc, 0xE136);
    EXPECT_GT(takeLogValue, 11);
    EXPECT_EQ(runs(), listing_run("/") + cleanup_run("/"));
}

} // namespace

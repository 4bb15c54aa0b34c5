// tarnmon's metrics file: the exposition of a pass's figures, read back by a strict reader of the
// format; its replacement in one step while a reader keeps reading it; and what tarnmon says when
// the file cannot be written, and when it can again.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <limits>
#include <map>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

#include "metrics_file.h"
#include "prometheus_text.h"

namespace {

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

// A pass with a finding, every figure known, and the run's totals of two passes.
tarn_pass_figures busy_pass() {
    tarn_pass_figures f{};
    f.pass = 2;
    f.duration_ns = 1'250'000'000;
    f.reason_code = 0xE136;
    f.memory_known = 1;
    f.memory_tenths = 953;
    f.descriptors_known = 1;
    f.descriptors_tenths = 10;
    f.cpu_known = 1;
    f.cpu_user_percent = 20.0f;
    f.cpu_kernel_percent = 10.5f;
    f.sleep_known = 1;
    f.sleep_seconds = 10;
    f.sleep_interval = 5;
    f.partition_count = 2;
    std::snprintf(f.partitions[0].mount_point, TARN_MOUNT_POINT_SIZE, "/");
    f.partitions[0].space_tenths = 950;
    f.partitions[0].inodes_tenths = 100;
    std::snprintf(f.partitions[1].mount_point, TARN_MOUNT_POINT_SIZE, "/extra");
    f.partitions[1].space_tenths = 100;
    f.partitions[1].inodes_tenths = TARN_FIGURE_NONE;
    return f;
}

constexpr double END_TIME = 1764000000.5;

class MetricsFile : public ::testing::Test {
  protected:
    void SetUp() override {
        char pattern[] = "/tmp/tarnmon-metrics-XXXXXX";
        directory = mkdtemp(pattern);
        path = directory + "/telvzmnd.prom";
    }
    void TearDown() override { std::filesystem::remove_all(directory); }

    std::vector<std::string> names() const {
        std::vector<std::string> found;
        for (const auto &entry : std::filesystem::directory_iterator(directory)) {
            found.push_back(entry.path().filename().string());
        }
        return found;
    }

    std::string directory;
    std::string path;
};

// ---- The exposition ----

TEST(MetricsText, PassWithAFindingGivesEveryFamilyWithItsHelpTypeAndSamples) {
    metrics_totals totals;
    totals.passes = 2;
    totals.held_back = 1;
    totals.findings = {{0xE136, 1}, {0xE111, 2}};
    EXPECT_EQ(metrics_text(busy_pass(), totals, END_TIME),
              "# HELP telvzmnd_passes_total Passes the monitor made since it started.\n"
              "# TYPE telvzmnd_passes_total counter\n"
              "telvzmnd_passes_total 2\n"
              "# HELP telvzmnd_findings_total Findings the monitor reported with an event, by "
              "reason code.\n"
              "# TYPE telvzmnd_findings_total counter\n"
              "telvzmnd_findings_total{reason_code=\"0xE111\"} 2\n"
              "telvzmnd_findings_total{reason_code=\"0xE136\"} 1\n"
              "# HELP telvzmnd_findings_held_back_total Passes whose finding was not reported "
              "because an earlier event still holds reports back.\n"
              "# TYPE telvzmnd_findings_held_back_total counter\n"
              "telvzmnd_findings_held_back_total 1\n"
              "# HELP telvzmnd_memory_in_use_percent Memory and swap in use, in percent of both "
              "together, as the system memory check judges it.\n"
              "# TYPE telvzmnd_memory_in_use_percent gauge\n"
              "telvzmnd_memory_in_use_percent 95.3\n"
              "# HELP telvzmnd_partition_used_percent Space and inodes in use of each local "
              "partition, in percent, as df printed them.\n"
              "# TYPE telvzmnd_partition_used_percent gauge\n"
              "telvzmnd_partition_used_percent{mount_point=\"/\",resource=\"space\"} 95\n"
              "telvzmnd_partition_used_percent{mount_point=\"/\",resource=\"inodes\"} 10\n"
              "telvzmnd_partition_used_percent{mount_point=\"/extra\",resource=\"space\"} 10\n"
              "# HELP telvzmnd_partition_lines_left_out Lines of df about partitions beyond the "
              "64 the figures keep, left out of this file.\n"
              "# TYPE telvzmnd_partition_lines_left_out gauge\n"
              "telvzmnd_partition_lines_left_out 0\n"
              "# HELP telvzmnd_file_descriptors_in_use_percent File handles in use, in percent "
              "of the system's maximum (file-nr).\n"
              "# TYPE telvzmnd_file_descriptors_in_use_percent gauge\n"
              "telvzmnd_file_descriptors_in_use_percent 1\n"
              "# HELP telvzmnd_appliance_cpu_percent CPU used by every process together in the "
              "newest sample, in percent of the machine.\n"
              "# TYPE telvzmnd_appliance_cpu_percent gauge\n"
              "telvzmnd_appliance_cpu_percent{mode=\"user\"} 20\n"
              "telvzmnd_appliance_cpu_percent{mode=\"kernel\"} 10.5\n"
              "# HELP telvzmnd_sleep_drift_seconds How much longer than asked the monitor's "
              "sleep before the last pass took.\n"
              "# TYPE telvzmnd_sleep_drift_seconds gauge\n"
              "telvzmnd_sleep_drift_seconds 5\n"
              "# HELP telvzmnd_pass_duration_seconds How long the last pass took, its commands "
              "included.\n"
              "# TYPE telvzmnd_pass_duration_seconds gauge\n"
              "telvzmnd_pass_duration_seconds 1.25\n"
              "# HELP telvzmnd_last_pass_timestamp_seconds When the last pass ended, in seconds "
              "since the epoch.\n"
              "# TYPE telvzmnd_last_pass_timestamp_seconds gauge\n"
              "telvzmnd_last_pass_timestamp_seconds 1764000000.5\n");
}

TEST(MetricsText, ReadsBackWithTheFiguresItWasGiven) {
    metrics_totals totals;
    totals.count(busy_pass());
    auto read = prometheus::parse(metrics_text(busy_pass(), totals, END_TIME));
    ASSERT_EQ(read.error, "");
    const prometheus::document &doc = read.doc;
    EXPECT_EQ(doc.value("telvzmnd_findings_total", {{"reason_code", "0xE136"}}), 1.0);
    EXPECT_EQ(doc.value("telvzmnd_memory_in_use_percent"), 95.3);
    EXPECT_EQ(doc.value("telvzmnd_partition_used_percent",
                        {{"mount_point", "/extra"}, {"resource", "space"}}),
              10.0);
    EXPECT_EQ(doc.value("telvzmnd_partition_used_percent",
                        {{"mount_point", "/extra"}, {"resource", "inodes"}}),
              std::nullopt);
    EXPECT_EQ(doc.value("telvzmnd_appliance_cpu_percent", {{"mode", "kernel"}}), 10.5);
    EXPECT_EQ(doc.value("telvzmnd_sleep_drift_seconds"), 5.0);
    EXPECT_EQ(doc.value("telvzmnd_pass_duration_seconds"), 1.25);
    ASSERT_NE(doc.family_of("telvzmnd_findings_total"), nullptr);
    EXPECT_EQ(doc.family_of("telvzmnd_findings_total")->type, "counter");
}

TEST(MetricsText, FiguresNotKnownLeaveTheirFamiliesOut) {
    tarn_pass_figures first{};
    first.pass = 1;
    metrics_totals totals;
    totals.count(first);
    auto read = prometheus::parse(metrics_text(first, totals, END_TIME));
    ASSERT_EQ(read.error, "");
    std::vector<std::string> families;
    for (const auto &f : read.doc.families) {
        families.push_back(f.name);
    }
    EXPECT_EQ(families, (std::vector<std::string>{
                            "telvzmnd_passes_total", "telvzmnd_findings_held_back_total",
                            "telvzmnd_partition_lines_left_out", "telvzmnd_pass_duration_seconds",
                            "telvzmnd_last_pass_timestamp_seconds"}));
    EXPECT_EQ(read.doc.value("telvzmnd_passes_total"), 1.0);
    EXPECT_EQ(read.doc.value("telvzmnd_findings_held_back_total"), 0.0);
}

TEST(MetricsText, NegativeAndExtremeFiguresStayNumbers) {
    tarn_pass_figures f = busy_pass();
    f.memory_tenths = -5;
    f.descriptors_tenths = INT32_MIN;
    f.sleep_seconds = INT32_MIN;
    f.sleep_interval = INT32_MAX;
    f.cpu_user_percent = std::numeric_limits<float>::quiet_NaN();
    f.cpu_kernel_percent = std::numeric_limits<float>::infinity();
    f.partition_lines_dropped = UINT32_MAX;
    auto read = prometheus::parse(metrics_text(f, metrics_totals{}, END_TIME));
    ASSERT_EQ(read.error, "");
    EXPECT_EQ(read.doc.value("telvzmnd_memory_in_use_percent"), -0.5);
    EXPECT_EQ(read.doc.value("telvzmnd_file_descriptors_in_use_percent"), -214748364.8);
    EXPECT_EQ(read.doc.value("telvzmnd_sleep_drift_seconds"), -4294967295.0);
    EXPECT_TRUE(std::isnan(*read.doc.value("telvzmnd_appliance_cpu_percent", {{"mode", "user"}})));
    EXPECT_EQ(read.doc.value("telvzmnd_appliance_cpu_percent", {{"mode", "kernel"}}), INFINITY);
    EXPECT_EQ(read.doc.value("telvzmnd_partition_lines_left_out"), 4294967295.0);
}

struct mount_point_case {
    std::string given;    // as df printed it
    std::string expected; // as the label reads back
};

class MetricsMountPoint : public ::testing::TestWithParam<mount_point_case> {};

TEST_P(MetricsMountPoint, AnyBytesGiveAValidLabel) {
    tarn_pass_figures f{};
    f.partition_count = 1;
    const mount_point_case &c = GetParam();
    std::memcpy(f.partitions[0].mount_point, c.given.data(),
                std::min(c.given.size(), size_t{TARN_MOUNT_POINT_SIZE}));
    f.partitions[0].space_tenths = 10;
    f.partitions[0].inodes_tenths = TARN_FIGURE_NONE;
    std::string text = metrics_text(f, metrics_totals{}, END_TIME);
    auto read = prometheus::parse(text);
    ASSERT_EQ(read.error, "") << text;
    auto found = read.doc.samples_of("telvzmnd_partition_used_percent");
    ASSERT_EQ(found.size(), 1u);
    EXPECT_EQ(found[0].label_values.at("mount_point"), c.expected);
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, MetricsMountPoint,
    ::testing::Values(mount_point_case{"/mnt/a\"b", "/mnt/a\"b"},
                      mount_point_case{"/mnt/back\\slash", "/mnt/back\\slash"},
                      mount_point_case{"/mnt/line\nend", "/mnt/line\nend"},
                      mount_point_case{"/mnt/\xc3\xbc", "/mnt/\xc3\xbc"},
                      // A byte that is not UTF-8 reads back as the character of its number.
                      mount_point_case{"/mnt/\xff", "/mnt/\xc3\xbf"},
                      mount_point_case{"/mnt/\xe2\x82", "/mnt/\xc3\xa2\xc2\x82"},
                      mount_point_case{"/mnt/\"}\\n 1\n# TYPE x gauge",
                                       "/mnt/\"}\\n 1\n# TYPE x gauge"},
                      // A name that fills the whole field, without its NUL.
                      mount_point_case{std::string(TARN_MOUNT_POINT_SIZE, 'm'),
                                       std::string(TARN_MOUNT_POINT_SIZE, 'm')}));

TEST(MetricsTotals, CountPassesFindingsByReasonCodeAndHeldBackPasses) {
    metrics_totals totals;
    tarn_pass_figures f{};
    totals.count(f);
    f.reason_code = 0xE114;
    totals.count(f);
    f.reason_code = 0;
    f.finding_held_back = 1;
    totals.count(f);
    f.finding_held_back = 0;
    f.reason_code = 0xE114;
    totals.count(f);
    f.reason_code = 0xE139;
    totals.count(f);
    EXPECT_EQ(totals.passes, 5u);
    EXPECT_EQ(totals.held_back, 1u);
    EXPECT_EQ(totals.findings, (std::map<int32_t, uint64_t>{{0xE114, 2}, {0xE139, 1}}));
}

// ---- The file ----

TEST_F(MetricsFile, ReplacedFileHoldsTheTextReadableByOthersAndNothingElseIsLeft) {
    ASSERT_EQ(replace_file(path, "first\n"), 0);
    struct stat before;
    ASSERT_EQ(stat(path.c_str(), &before), 0);
    ASSERT_EQ(replace_file(path, "second\n"), 0);
    struct stat after;
    ASSERT_EQ(stat(path.c_str(), &after), 0);
    EXPECT_EQ(read_file(path), "second\n");
    EXPECT_EQ(after.st_mode & 07777, 0644u);
    EXPECT_NE(after.st_ino, before.st_ino); // a new file, not the old one rewritten
    EXPECT_EQ(names(), std::vector<std::string>{"telvzmnd.prom"});
}

TEST_F(MetricsFile, AReaderNeverSeesPartOfAFile) {
    const std::string large = std::string(256 * 1024, 'l') + "\n";
    const std::string small = "small\n";
    ASSERT_EQ(replace_file(path, small), 0);
    std::atomic<bool> writing{true};
    std::atomic<int> reads{0};
    std::atomic<int> torn{0};
    std::thread reader([&] {
        while (writing.load()) {
            std::string seen = read_file(path);
            if (seen != large && seen != small) {
                ++torn;
            }
            ++reads;
        }
    });
    int failures = 0;
    for (int i = 0; i < 400; ++i) {
        failures += replace_file(path, i % 2 == 0 ? large : small) != 0 ? 1 : 0;
    }
    // At least a few reads while the writes go on, however the threads are scheduled.
    while (reads.load() < 20) {
        replace_file(path, large);
    }
    writing = false;
    reader.join();
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(torn.load(), 0) << "of " << reads.load() << " reads";
    EXPECT_EQ(names(), std::vector<std::string>{"telvzmnd.prom"});
}

TEST_F(MetricsFile, FailedReplacementLeavesTheOldFileAndNoNewOne) {
    ASSERT_EQ(replace_file(path, "kept\n"), 0);
    // A directory in the file's place: the rename fails, after the new file was written.
    std::string occupied = directory + "/occupied";
    ASSERT_EQ(mkdir(occupied.c_str(), 0755), 0);
    ASSERT_EQ(mkdir((occupied + "/inside").c_str(), 0755), 0);
    int error = replace_file(occupied, "lost\n");
    EXPECT_TRUE(error == EISDIR || error == ENOTEMPTY || error == EEXIST) << error;
    EXPECT_EQ(read_file(path), "kept\n");
    auto left = names();
    std::sort(left.begin(), left.end());
    EXPECT_EQ(left, (std::vector<std::string>{"occupied", "telvzmnd.prom"}));
    EXPECT_EQ(replace_file(directory + "/missing/telvzmnd.prom", "x\n"), ENOENT);
    // A directory that takes no new file.
    EXPECT_NE(replace_file("/proc/telvzmnd.prom", "x\n"), 0);
}

TEST_F(MetricsFile, SettledNameIsAbsoluteAndItsDirectoryTakesAFile) {
    std::string settled;
    ASSERT_EQ(chdir(directory.c_str()), 0);
    EXPECT_EQ(settle_replaceable_file("telvzmnd.prom", &settled), 0);
    char *real = realpath(directory.c_str(), nullptr);
    EXPECT_EQ(settled, std::string(real) + "/telvzmnd.prom");
    std::free(real);
    EXPECT_EQ(names(), std::vector<std::string>{}); // the trial file is gone
    ASSERT_EQ(chdir("/"), 0);
    std::string unchanged = "untouched";
    EXPECT_EQ(settle_replaceable_file(directory + "/missing/x.prom", &unchanged), ENOENT);
    EXPECT_EQ(settle_replaceable_file(directory, &unchanged), EISDIR);
    EXPECT_EQ(settle_replaceable_file(directory + "/", &unchanged), EISDIR);
    EXPECT_EQ(settle_replaceable_file("", &unchanged), EISDIR);
    EXPECT_NE(settle_replaceable_file("/proc/x.prom", &unchanged), 0);
    EXPECT_EQ(unchanged, "untouched");
}

// What the observer writes to standard error while `act` runs.
template <typename Act>
std::string standard_error_of(Act act) {
    std::fflush(stderr);
    char pattern[] = "/tmp/tarnmon-metrics-err-XXXXXX";
    int file = mkstemp(pattern);
    int saved = dup(2);
    dup2(file, 2);
    act();
    std::fflush(stderr);
    dup2(saved, 2);
    close(saved);
    close(file);
    std::string text = read_file(pattern);
    unlink(pattern);
    return text;
}

TEST_F(MetricsFile, LastingFailureIsToldOnceAndItsEndToo) {
    std::string settled;
    ASSERT_EQ(settle_replaceable_file(path, &settled), 0);
    metrics_file observer(settled);
    tarn_pass_figures f{};
    std::filesystem::remove_all(directory);
    std::string told = standard_error_of([&] {
        metrics_file::observe(&f, &observer);
        metrics_file::observe(&f, &observer);
    });
    EXPECT_EQ(told, "tarnmon: cannot write the metrics file " + settled +
                        ": No such file or directory\n");
    ASSERT_EQ(mkdir(directory.c_str(), 0755), 0);
    told = standard_error_of([&] {
        metrics_file::observe(&f, &observer);
        metrics_file::observe(&f, &observer);
    });
    EXPECT_EQ(told, "tarnmon: the metrics file " + settled + " is written again\n");
    auto read = prometheus::parse(read_file(settled));
    ASSERT_EQ(read.error, "");
    EXPECT_EQ(read.doc.value("telvzmnd_passes_total"), 4.0); // the failed passes counted too
}

// ---- The reader the tests rely on refuses what a scraper refuses ----

TEST(PrometheusReader, RefusesBrokenFiles) {
    const std::pair<const char *, const char *> broken[] = {
        {"a 1", "the last line has no line end"},
        {"a{b=\"1\"} x\n", "line 1: value 'x' is not a number"},
        {"a{b=1} 1\n", "line 1: label b has no quoted value"},
        {"a{b=\"\\t\"} 1\n", "line 1: unknown escape in a label value"},
        {"a{b=\"1\",b=\"2\"} 1\n", "line 1: label b twice"},
        {"a 1\na 2\n", "line 2: series a given twice"},
        {"a 1\nb 1\na 2\n", "line 3: the lines of a do not stand together"},
        {"a 1\n# TYPE a gauge\n", "line 2: TYPE of a after its samples"},
        {"# TYPE a gauge\n# TYPE a gauge\n", "line 2: TYPE of a twice"},
        {"# TYPE a meter\n", "line 1: unknown type 'meter'"},
        {"9a 1\n", "line 1: no metric name"},
        {"a{__b=\"1\"} 1\n", "line 1: bad label name '__b'"},
        {"a{b=\"\xff\"} 1\n", "not UTF-8"},
        {"a 1 x\n", "line 1: timestamp 'x' is not an integer"},
    };
    for (const auto &[text, error] : broken) {
        EXPECT_EQ(prometheus::parse(text).error, error) << text;
    }
    auto fine = prometheus::parse("# a comment\n\n# HELP a x\\ny\n# TYPE a gauge\n"
                                  "a{b=\"q\\\"\\\\\\n\",} -Inf 17\n");
    ASSERT_EQ(fine.error, "");
    EXPECT_EQ(fine.doc.family_of("a")->help, "x\ny");
    EXPECT_EQ(fine.doc.value("a", {{"b", "q\"\\\n"}}), -INFINITY);
}

} // namespace

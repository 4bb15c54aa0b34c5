// The monitoring loop as a host runs it: the built libtelvzmnd.so over the default platform, with
// its data directory, trace file and event log in a directory of the test's own, fake commands
// first on PATH (a quiet host), and external checking routines that the platform's module service
// loads from TELV_MODULE_PATH: the samples of the library itself (module telvzmnd) and those of the
// test module tarnchecktest. One pass, run once: what the routines handed back is framed into the
// plain snapshot, the loop's traces say what it called, and every handle is given back at the end.
#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <dlfcn.h>
#include <fstream>
#include <map>
#include <string>
#include <vector>

#include "capture/external_checks.h"
#include "core/monitor_loop.h"
#include "fake_commands.h"
#include "modsvc.h"
#include "monitor_on_the_platform.h"
#include "platform_test_support.h"
#include "private_ipc.h"
#include "quiet_control_file.h"
#include "quiet_host.h"
#include "tracesvc.h"

// ---- The module service, seen from in front ----
//
// The test stands in front of the default platform's module service, as a host may stand in for
// any platform service: every call goes on to the platform's own (the next definition after this
// program's), and the test keeps what was asked and what came back. A release also leaves a line in
// the trace file, so that the trace shows where in the run it came.

namespace {

using monitor_on_the_platform::as_traced;
using monitor_on_the_platform::loaded;
using monitor_on_the_platform::run_once;

struct module_call {
    std::string module; // empty for a release
    std::string function;
    void *address;
    void *handle;
    uint32_t src;
    uint32_t crc;
};

std::vector<module_call> resolutions;
std::vector<module_call> releases;

template <typename F>
F platform_service(const char *name) {
    return reinterpret_cast<F>(dlsym(RTLD_NEXT, name));
}

} // namespace

extern "C" uint32_t modsvc_get_func_addr2(const char *module, const char *function, void **address,
                                          void **handle, uint32_t *crc) {
    static const auto service =
        platform_service<decltype(&modsvc_get_func_addr2)>("modsvc_get_func_addr2");
    uint32_t src = service(module, function, address, handle, crc);
    resolutions.push_back({module, function, *address, *handle, src, *crc});
    return src;
}

extern "C" uint32_t modsvc_release_func_addr(const char *function, void *handle, uint32_t *crc) {
    static const auto service =
        platform_service<decltype(&modsvc_release_func_addr)>("modsvc_release_func_addr");
    uint32_t src = service(function, handle, crc);
    releases.push_back({"", function, nullptr, handle, src, *crc});
    tracesvc_trace("TESTMODF: released %s, src = %x, crc = %x (hex)", function, src, *crc);
    return src;
}

namespace {

const std::string CHECK_MODULE_PATH = std::string(TARN_CHECK_MODULE_DIR) + "/libtarnchecktest.so";

// The routines, in the order the loop calls them: two samples, the module's three answers (the
// flood twice, so that the second meets a pass whose overflow line is written already), and a
// sample after each flood.
const char ROUTINES[] = "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check1\n"
                        "EXTERNAL_CHECKING_ROUTINE tarnchecktest tarn_check_status\n"
                        "EXTERNAL_CHECKING_ROUTINE tarnchecktest tarn_check_nothing\n"
                        "EXTERNAL_CHECKING_ROUTINE tarnchecktest tarn_check_flood\n"
                        "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check2\n"
                        "EXTERNAL_CHECKING_ROUTINE tarnchecktest tarn_check_flood\n"
                        "EXTERNAL_CHECKING_ROUTINE telvzmnd tarn_external_check3\n";

// A keyword of the test module's own, which the monitor passes over, and the routines.
std::string control_text() {
    return quiet_control::text({{"SNAPSHOT_INTERVAL", "1"}},
                               std::string("TARNCHECKTEST_STATUS green\n") + ROUTINES);
}

// What the quiet host's ps prints.
const std::string PS = "    1     1  1000  20000  3000 init            00:00:01\n";
const std::string LSMON = "/proc/1/fd:\ntotal 0\nlrwx------ 1 root root 64 Mar  5 07:00 0 -> "
                          "/dev/null\n\n";

// The texts the routines hand back.
const std::string MESSAGE1 = "Message 1 returned data \n\r Second line of Message 1\n\r";
const std::string MESSAGE2 = "Message 2 returned data \n\r Second line of Message 2\n\r";
const std::string MESSAGE3 = "Message 3 returned data \n\r Second line of Message 3\n\r";
const std::string STATUS = "tarnchecktest status is green \n\r Second line of tarnchecktest\n\r";
const std::string FLOOD_START = "tarn_check_flood has more to say than a pass can hold \n\r";
constexpr int FLOOD_LENGTH = 1545056;

const std::string OVERFLOW_LINE = "No room to output more lines... \n\r";

// A routine's text in the pass's data, between the lines that frame it.
std::string framed(const std::string &name, const std::string &body) {
    return "  \n\rAbout to output data from function " + name + " \n\r" + body +
           "  \n\rDone outputting data from function " + name + " \n\r";
}

// A text as the trace file holds it: a line end inside a line is written as \n or \r.
// `text` with every address ("0x" and hex digits) written as "<address>".
std::string without_addresses(const std::string &text) {
    std::string plain;
    for (size_t at = 0; at < text.size();) {
        if (text.compare(at, 2, "0x") == 0 && at + 2 < text.size() &&
            std::isxdigit(static_cast<unsigned char>(text[at + 2]))) {
            at += 2;
            while (at < text.size() && std::isxdigit(static_cast<unsigned char>(text[at]))) {
                ++at;
            }
            plain += "<address>";
        } else {
            plain += text[at++];
        }
    }
    return plain;
}

// True when `line` is the date line of a snapshot's stamp, as in "Local date and time = 5 March
// 2021 at 07:04:09 ": the day unpadded, the month by name, the time two digits a field.
bool is_date_line(const std::string &line) {
    static const char *const months[] = {"January",   "February", "March",    "April",
                                         "May",       "June",     "July",     "August",
                                         "September", "October",  "November", "December"};
    int day = 0;
    int year = 0;
    int hours = 0;
    int minutes = 0;
    int seconds = 0;
    char month[16] = "";
    if (std::sscanf(line.c_str(), "Local date and time = %d %15s %d at %d:%d:%d", &day, month,
                    &year, &hours, &minutes, &seconds) != 6) {
        return false;
    }
    char rebuilt[128];
    std::snprintf(rebuilt, sizeof rebuilt, "Local date and time = %d %s %4d at %02d:%02d:%02d ",
                  day, month, year, hours, minutes, seconds);
    return line == rebuilt &&
           std::find(std::begin(months), std::end(months), std::string(month)) != std::end(months);
}

class MonitorLoopOnThePlatform : public platform_test::PlatformTest {
  protected:
    void SetUp() override {
        PlatformTest::SetUp();
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        private_ipc::use_up_id_zero();
        platform_test::set_variable("TELV_MODULE_PATH",
                                    std::string(TARN_CHECK_MODULE_DIR) + ":" + TARN_LIBRARY_DIR);
        quiet_host::add_commands(fakes, PS);
        fakes.add("runAsRoot",
                  "#!/bin/sh\ncase \"$1\" in\nlsmon.sh) printf '%s' '" + LSMON + "' ;;\nesac\n");
        resolutions.clear();
        releases.clear();
    }

    void TearDown() override {
        if (key_is_ours) {
            private_ipc::remove_control_block_objects();
        }
        PlatformTest::TearDown();
    }

    // The texts of the trace file's lines, without the time, pid and thread id before them;
    // addresses as "<address>", and the flood's line, which the file cuts, to where it is cut.
    std::vector<std::string> traces() const {
        const std::string flood_line = "TARNMNDF: caller's data is [" + as_traced(FLOOD_START);
        std::vector<std::string> texts;
        for (const std::string &line : platform_test::read_lines(trace_path())) {
            size_t at = 0;
            for (int field = 0; field < 3 && at != std::string::npos; ++field) {
                at = line.find(' ', at);
                at = at == std::string::npos ? at : at + 1;
            }
            std::string text = at == std::string::npos ? line : line.substr(at);
            if (text.rfind(flood_line, 0) == 0) {
                text = flood_line + "(cut)";
            }
            texts.push_back(without_addresses(text));
        }
        return texts;
    }

    bool key_is_ours = false;
    fake::fake_commands fakes;
};

// The lines a sample routine traces, and the loop's after it.
std::vector<std::string> sample_traces(int number, const std::string &control,
                                       const std::string &message) {
    const std::string n = std::to_string(number);
    return {"TARNMNDF: about to call tarn_external_check" + n,
            "TARNOTHF: --> tarn_external_check" + n,
            "TARNOTHF: fileData pointer = <address>",
            "TARNOTHF: returnedData pointer = <address>",
            "TARNOTHF: start of fileData is: = [" + as_traced(control) + "]",
            "TARNOTHF: message" + n + " is: = [" + as_traced(message) + "]",
            "TARNOTHF: <-- tarn_external_check" + n,
            "TARNMNDF: length of caller's data is " + std::to_string(message.size()),
            "TARNMNDF: caller's data is [" + as_traced(message) + "]"};
}

TEST_F(MonitorLoopOnThePlatform, RoutinesOfTheLibraryAndOfAModuleAreFramedIntoThePassAndReleased) {
    const std::string control = control_text();
    {
        std::ofstream file(dir + "/telvzopt.trm", std::ios::binary);
        file << control;
    }
    ASSERT_FALSE(loaded(CHECK_MODULE_PATH));

    EXPECT_EQ(run_once(), 0u);

    // Every routine was resolved by the platform: the samples are the very functions of the
    // library this program runs, found in TELV_MODULE_PATH like any module.
    const std::vector<std::pair<std::string, std::string>> named = {
        {"telvzmnd", "tarn_external_check1"},    {"tarnchecktest", "tarn_check_status"},
        {"tarnchecktest", "tarn_check_nothing"}, {"tarnchecktest", "tarn_check_flood"},
        {"telvzmnd", "tarn_external_check2"},    {"tarnchecktest", "tarn_check_flood"},
        {"telvzmnd", "tarn_external_check3"}};
    ASSERT_EQ(resolutions.size(), named.size());
    for (size_t i = 0; i < named.size(); ++i) {
        SCOPED_TRACE(named[i].second);
        EXPECT_EQ(resolutions[i].module, named[i].first);
        EXPECT_EQ(resolutions[i].function, named[i].second);
        EXPECT_EQ(resolutions[i].src, 0u);
        EXPECT_EQ(resolutions[i].crc, 0u);
        EXPECT_NE(resolutions[i].address, nullptr);
        EXPECT_NE(resolutions[i].handle, nullptr);
    }
    EXPECT_EQ(resolutions[0].address, reinterpret_cast<void *>(&tarn_external_check1));
    EXPECT_EQ(resolutions[4].address, reinterpret_cast<void *>(&tarn_external_check2));
    EXPECT_EQ(resolutions[6].address, reinterpret_cast<void *>(&tarn_external_check3));

    // The plain snapshot of the pass: its separator and time stamp, the checks' data, then the
    // routines' texts, each in its frame. The flood found the room too small: the pass's one
    // overflow line stands in its frame. The frame's lines gave room back, so the short text of
    // the next sample fits again; the second flood gets its frame and nothing else. The routine
    // that handed back nothing left no trace in the data, not even a frame.
    const std::string file = platform_test::read_file(dir + "/telvzmnd.trm");
    const std::string opening = "=START" + std::string(46, '=') + "\n\r";
    const std::string closing = "=END" + std::string(48, '=') + "\n\r";
    ASSERT_EQ(file.rfind(opening, 0), 0u) << file.substr(0, 300);
    // The stamp: the date line, then the code version line.
    const size_t date_end = file.find("\n\r", opening.size());
    ASSERT_NE(date_end, std::string::npos);
    EXPECT_TRUE(is_date_line(file.substr(opening.size(), date_end - opening.size())))
        << file.substr(opening.size(), 100);
    const std::string version = "\n\rCode Version 61.001\n\r";
    EXPECT_EQ(file.substr(date_end, version.size()), version);
    const size_t data_at = date_end + version.size();
    EXPECT_EQ(file.substr(data_at, 30), "  \n\rAbout to output ps data \n\r");
    const std::string routines =
        framed("tarn_external_check1", MESSAGE1 + "\n\r") +
        framed("tarn_check_status", STATUS + "\n\r") + framed("tarn_check_flood", OVERFLOW_LINE) +
        framed("tarn_external_check2", MESSAGE2 + "\n\r") + framed("tarn_check_flood", "") +
        framed("tarn_external_check3", MESSAGE3 + "\n\r");
    const std::string ending = routines + "\n\r" + closing;
    ASSERT_GE(file.size(), ending.size());
    EXPECT_EQ(file.substr(file.size() - ending.size()), ending);
    // The checks before the routines wrote no overflow line of their own, and no flood text is
    // anywhere.
    EXPECT_EQ(file.find(OVERFLOW_LINE), file.size() - ending.size() + routines.find(OVERFLOW_LINE));
    EXPECT_EQ(file.find("tarn_check_flood has more"), std::string::npos);
    EXPECT_EQ(file.find("tarn_check_nothing"), std::string::npos);
    EXPECT_EQ(file.find("=START", 1), std::string::npos);

    // The trace of the calls: each routine called in turn, with what it handed back; the one
    // handing back nothing is called and no more is said of it.
    const std::vector<std::string> lines = traces();
    const auto first_call =
        std::find(lines.begin(), lines.end(), "TARNMNDF: about to call tarn_external_check1");
    ASSERT_NE(first_call, lines.end());
    const auto decision = std::find(first_call, lines.end(), "TARNMNDD: takeLogCrc = 0 (dec)");
    ASSERT_NE(decision, lines.end());
    EXPECT_EQ(*(first_call - 1), "TARNMNDF: num_external_calls = 7");
    std::vector<std::string> expected = sample_traces(1, control, MESSAGE1);
    const std::vector<std::string> module_part = {
        "TARNMNDF: about to call tarn_check_status",
        "TARNCKTF: --> tarn_check_status",
        "TARNCKTF: <-- tarn_check_status",
        "TARNMNDF: length of caller's data is " + std::to_string(STATUS.size()),
        "TARNMNDF: caller's data is [" + as_traced(STATUS) + "]",
        "TARNMNDF: about to call tarn_check_nothing",
        "TARNCKTF: --> tarn_check_nothing",
        "TARNCKTF: <-- tarn_check_nothing",
        "TARNMNDF: about to call tarn_check_flood",
        "TARNCKTF: --> tarn_check_flood",
        "TARNCKTF: <-- tarn_check_flood",
        "TARNMNDF: length of caller's data is " + std::to_string(FLOOD_LENGTH),
        "TARNMNDF: caller's data is [" + as_traced(FLOOD_START) + "(cut)"};
    expected.insert(expected.end(), module_part.begin(), module_part.end());
    const std::vector<std::string> second = sample_traces(2, control, MESSAGE2);
    expected.insert(expected.end(), second.begin(), second.end());
    expected.insert(expected.end(), module_part.end() - 5, module_part.end());
    const std::vector<std::string> third = sample_traces(3, control, MESSAGE3);
    expected.insert(expected.end(), third.begin(), third.end());
    EXPECT_EQ(std::vector<std::string>(first_call, decision), expected);

    // Ending: the routines' count traced again, then every handle given back, in the table's
    // order and each exactly once, before the monitor's last word. The platform took each one
    // back (a handle it did not hold would have been refused), and with the last of the module's
    // four the module itself was unloaded.
    ASSERT_GE(lines.size(), 9u);
    std::vector<std::string> ending_lines = {"TARNMNDF: num_external_calls = 7"};
    for (const auto &[module, function] : named) {
        ending_lines.push_back("TESTMODF: released " + function + ", src = 0, crc = 0 (hex)");
    }
    ending_lines.push_back("TARNMNDF:    System Return Code: 0");
    EXPECT_EQ(std::vector<std::string>(lines.end() - 9, lines.end()), ending_lines);
    EXPECT_FALSE(loaded(CHECK_MODULE_PATH));
    ASSERT_EQ(releases.size(), named.size());
    for (size_t i = 0; i < named.size(); ++i) {
        SCOPED_TRACE(named[i].second);
        EXPECT_EQ(releases[i].function, named[i].second);
        EXPECT_EQ(releases[i].handle, resolutions[i].handle);
        EXPECT_EQ(releases[i].src, 0u);
        EXPECT_EQ(releases[i].crc, 0u);
    }

    // A quiet pass: nothing went to the event log.
    EXPECT_EQ(platform_test::read_file(event_path()), "");
}

} // namespace

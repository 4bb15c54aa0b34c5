// The module telvzextra as a host runs it: the built libtelvzmnd.so over the default platform, the
// four routines of libtelvzextra.so resolved by the platform's module service from
// TELV_MODULE_PATH and called by the real loop on a quiet host. They read this host's /proc, so
// their texts are not known beforehand: what is checked is that each one's text stands in the plain
// snapshot in its frame, exactly as the loop traced it, in lines of the routine's own form, with
// the keywords of the control file applied, and that the module is unloaded at the end.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <dlfcn.h>
#include <fstream>
#include <string>
#include <vector>

#include "core/monitor_loop.h"
#include "fake_commands.h"
#include "monitor_on_the_platform.h"
#include "platform_test_support.h"
#include "private_ipc.h"
#include "quiet_control_file.h"
#include "quiet_host.h"

namespace {

using monitor_on_the_platform::as_traced;
using monitor_on_the_platform::loaded;
using monitor_on_the_platform::run_once;

const std::string MODULE_PATH = std::string(TARN_LIBRARY_DIR) + "/libtelvzextra.so";

struct routine {
    const char *name;
    const char *line_start; // every line of its text begins so
};

constexpr routine ROUTINES[] = {
    {"telvzextra_pressure", "pressure "},
    {"telvzextra_oom_kills", "oom kills: "},
    {"telvzextra_descriptors", "descriptors: "},
    {"telvzextra_time_to_full", "time to full: "},
};

std::string control_text() {
    std::string lines = "* The module's keywords, which the monitor passes over.\n"
                        "EXTRA_DESCRIPTORS_LISTED 3\n"
                        "EXTRA_TIME_TO_FULL_HORIZON 48\n";
    for (const routine &each : ROUTINES) {
        lines += std::string("EXTERNAL_CHECKING_ROUTINE telvzextra ") + each.name + "\n";
    }
    return quiet_control::text({{"SNAPSHOT_INTERVAL", "1"}}, lines);
}

class ExtraModuleOnThePlatform : public platform_test::PlatformTest {
  protected:
    void SetUp() override {
        PlatformTest::SetUp();
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        private_ipc::use_up_id_zero();
        platform_test::set_variable("TELV_MODULE_PATH", TARN_LIBRARY_DIR);
        quiet_host::add_commands(fakes,
                                 "    1     1  1000  20000  3000 init            00:00:01\n");
        fakes.add("runAsRoot", "#!/bin/sh\nexit 0\n");
    }

    void TearDown() override {
        if (key_is_ours) {
            private_ipc::remove_control_block_objects();
        }
        PlatformTest::TearDown();
    }

    bool key_is_ours = false;
    fake::fake_commands fakes;
};

TEST_F(ExtraModuleOnThePlatform, EachRoutinesTextIsFramedIntoThePlainSnapshot) {
    {
        std::ofstream file(dir + "/telvzopt.trm", std::ios::binary);
        file << control_text();
    }
    ASSERT_FALSE(loaded(MODULE_PATH));
    EXPECT_EQ(run_once(), 0u);

    const std::string snapshot = platform_test::read_file(dir + "/telvzmnd.trm");
    const std::string trace = platform_test::read_file(trace_path());
    for (const routine &each : ROUTINES) {
        SCOPED_TRACE(each.name);
        const std::string name = each.name;
        EXPECT_NE(trace.find("TARNMNDF: about to call " + name + "\n"), std::string::npos);
        const std::string opening = "  \n\rAbout to output data from function " + name + " \n\r";
        const std::string closing = "  \n\rDone outputting data from function " + name + " \n\r";
        size_t start = snapshot.find(opening);
        if (start == std::string::npos && name == "telvzextra_time_to_full") {
            continue; // a host without a local file system: nothing to say, no frame
        }
        ASSERT_NE(start, std::string::npos) << snapshot;
        start += opening.size();
        size_t end = snapshot.find(closing, start);
        ASSERT_NE(end, std::string::npos);
        // The routine's text, and the line end the loop writes after it.
        const std::string framed = snapshot.substr(start, end - start);
        ASSERT_GE(framed.size(), 4u);
        ASSERT_EQ(framed.substr(framed.size() - 2), "\n\r");
        const std::string text = framed.substr(0, framed.size() - 2);
        EXPECT_NE(trace.find("TARNMNDF: caller's data is [" + as_traced(text) + "]"),
                  std::string::npos);
        for (size_t at = 0; at < text.size(); at = text.find("\n\r", at) + 2) {
            EXPECT_EQ(text.compare(at, std::strlen(each.line_start), each.line_start), 0) << text;
        }
        EXPECT_EQ(text.substr(text.size() - 2), "\n\r");
        if (name == "telvzextra_descriptors") {
            EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), 4) << text;
        }
    }
    EXPECT_FALSE(loaded(MODULE_PATH));
    EXPECT_NE(trace.find("TARNMNDF:    System Return Code: 0"), std::string::npos);
    EXPECT_EQ(platform_test::read_file(event_path()), "");
}

} // namespace

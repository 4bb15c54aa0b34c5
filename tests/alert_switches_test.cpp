// The alert switches and the logging type over a real control block in a private IPC namespace:
// what each entry point stores and traces, a refused crc pointer, a process without a block, the
// Java form over the recording platform's bridge; and what the monitoring loop makes of each
// switch turned during its sleep, driven through its time seams over fake commands and a fake
// /proc.
#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <functional>
#include <map>
#include <optional>
#include <ostream>
#include <string>
#include <sys/shm.h>
#include <utility>
#include <vector>

#include "core/alert_switches.h"
#include "core/control_block.h"
#include "core/control_file.h"
#include "core/monitor_loop.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "fake_commands.h"
#include "fake_proc.h"
#include "fresh_monitor.h"
#include "logsvc.h"
#include "private_ipc.h"
#include "quiet_control_file.h"
#include "recording_platform.h"
#include "text_lines.h"

namespace {

using text::lines;

std::string printed(const char *pattern, auto... values) {
    char text[256];
    std::snprintf(text, sizeof text, pattern, values...);
    return text;
}

// The nine fields at the end of the block, as they lie there.
struct fields {
    int32_t analysisIndex;
    uint32_t sleepTimeExceeded;
    int32_t numLoopsBeforeCPUChecking;
    uint32_t tookLog;
    int32_t maxSleepTime;
    int32_t sleep_time_percent;
    int32_t uBufferLock;
    uint32_t terminateRequest;
    uint32_t logAsInfo;
    bool operator==(const fields &) const = default;
};
static_assert(sizeof(fields) == TARN_CB_SIZE - offsetof(tarn_control_block, analysisIndex));

void PrintTo(const fields &f, std::ostream *out) {
    *out << "{analysisIndex " << f.analysisIndex << ", sleepTimeExceeded " << f.sleepTimeExceeded
         << ", numLoopsBeforeCPUChecking " << f.numLoopsBeforeCPUChecking << ", tookLog "
         << f.tookLog << ", maxSleepTime " << f.maxSleepTime << ", sleep_time_percent "
         << f.sleep_time_percent << ", uBufferLock " << f.uBufferLock << ", terminateRequest "
         << f.terminateRequest << ", logAsInfo " << f.logAsInfo << "}";
}

fields fields_of(const tarn_control_block &block) {
    fields f;
    std::memcpy(&f, &block.analysisIndex, sizeof f);
    return f;
}

void set_fields(tarn_control_block &block, const fields &f) {
    std::memcpy(&block.analysisIndex, &f, sizeof f);
}

// A running monitor's fields, none of them at a value that a switch stores.
constexpr fields RUNNING = {7, 0, 5, 1, 66, -1, 3, 0, 9};

// One switch: its entry point, its name in the traces, and the fields it stores, in order, each
// with its value.
struct switch_case {
    const char *name;
    uint32_t (*entry)(uint32_t *crc);
    std::vector<std::pair<size_t, int32_t>> stores;
};

void PrintTo(const switch_case &c, std::ostream *out) {
    *out << c.name;
}

fields with_stores(fields f, const switch_case &c) {
    auto *words = reinterpret_cast<unsigned char *>(&f);
    for (const auto &[offset, value] : c.stores) {
        std::memcpy(words + offset - offsetof(tarn_control_block, analysisIndex), &value, 4);
    }
    return f;
}

constexpr size_t SLEEP_TIME_EXCEEDED = offsetof(tarn_control_block, sleepTimeExceeded);
constexpr size_t COUNTDOWN = offsetof(tarn_control_block, numLoopsBeforeCPUChecking);
constexpr size_t TOOK_LOG = offsetof(tarn_control_block, tookLog);
constexpr size_t MAX_SLEEP_TIME = offsetof(tarn_control_block, maxSleepTime);
constexpr size_t SLEEP_TIME_PERCENT = offsetof(tarn_control_block, sleep_time_percent);

const switch_case ENABLE = {
    "tarn_enable_cpu_alerts", tarn_enable_cpu_alerts, {{TOOK_LOG, 0}, {COUNTDOWN, 11}}};
const switch_case DISABLE = {"tarn_disable_cpu_alerts", tarn_disable_cpu_alerts, {{COUNTDOWN, 60}}};
const switch_case TRIGGER = {"tarn_trigger_cpu_alert04",
                             tarn_trigger_cpu_alert04,
                             {{SLEEP_TIME_PERCENT, 0},
                              {MAX_SLEEP_TIME, 0},
                              {TOOK_LOG, 0},
                              {COUNTDOWN, 0},
                              {SLEEP_TIME_EXCEEDED, 1}}};

lines operator+(lines head, const lines &tail) {
    head.insert(head.end(), tail.begin(), tail.end());
    return head;
}

// The traces of tarn_init_tarn_cb_ptr as it finds the block this process has attached: those of
// an attach made for the purpose.
lines attach_traces() {
    rec::clear_traces();
    uint32_t crc = 0;
    tarn_init_tarn_cb_ptr(&crc);
    lines attach = rec::traces();
    rec::clear_traces();
    return attach;
}

bool control_block_exists() {
    return shmget(static_cast<key_t>(TARN_CB_KEY), 0, 0) != -1;
}

class AlertSwitches : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        rec::reset();
        block = private_ipc::fresh_control_block();
        ASSERT_NE(block, nullptr);
        set_fields(*block, RUNNING);
        attach = attach_traces();
    }
    void TearDown() override {
        switch_store = saved_store;
        if (key_is_ours) {
            private_ipc::remove_control_block();
        }
    }

    // No block in this process, nor under the key: as before any monitor has started.
    void remove_block() {
        private_ipc::remove_control_block();
        block = nullptr;
        ASSERT_EQ(TARN_CB_PTR, nullptr);
        ASSERT_FALSE(control_block_exists());
        rec::clear_traces();
    }

    bool key_is_ours = false;
    tarn_control_block *block = nullptr;
    lines attach;
    void (*saved_store)(tarn_control_block &, const field_store &) = switch_store;
};

// ---- The three switches ----

class AlertSwitch : public AlertSwitches, public ::testing::WithParamInterface<switch_case> {
  protected:
    std::string entering() const { return printed("TARNOTHF: --> %s", GetParam().name); }
    std::string leaving(uint32_t src, uint32_t crc) const {
        return printed("TARNOTHF: <-- %s, src = %x, crc = %x (hex)", GetParam().name, src, crc);
    }
};

TEST_P(AlertSwitch, StoresItsFieldsAndReadsButNeverWritesCrc) {
    const switch_case &c = GetParam();
    uint32_t crc = 0xC0FFEE;
    EXPECT_EQ(c.entry(&crc), 0u);
    EXPECT_EQ(crc, 0xC0FFEEu);
    EXPECT_EQ(fields_of(*block), with_stores(RUNNING, c));
    EXPECT_EQ(rec::traces(), lines{entering()} + attach + lines{leaving(0, 0xC0FFEE)});
    EXPECT_TRUE(rec::events().empty());
}

// The stores go out one by one in their order: whoever reads the fields as the loop does, on
// seeing a store, sees every store before it. The trigger's last is sleepTimeExceeded, which
// ends the loop's sleep and makes the performance check read the others.
std::vector<std::pair<size_t, fields>> recorded_stores;
void (*const store_of_the_library)(tarn_control_block &, const field_store &) = switch_store;

TEST_P(AlertSwitch, StoresInTheirOrderEachAfterThoseBeforeIt) {
    const switch_case &c = GetParam();
    recorded_stores.clear();
    switch_store = [](tarn_control_block &block, const field_store &store) {
        recorded_stores.emplace_back(store.offset, fields_of(block));
        store_of_the_library(block, store);
    };
    uint32_t crc = 0;
    EXPECT_EQ(c.entry(&crc), 0u);
    ASSERT_EQ(recorded_stores.size(), c.stores.size());
    for (size_t i = 0; i < c.stores.size(); ++i) {
        switch_case made_so_far = c;
        made_so_far.stores.resize(i);
        EXPECT_EQ(recorded_stores[i].first, c.stores[i].first) << i;
        EXPECT_EQ(recorded_stores[i].second, with_stores(RUNNING, made_so_far)) << i;
    }
    EXPECT_EQ(fields_of(*block), with_stores(RUNNING, c));
}

TEST_P(AlertSwitch, RefusedCrcPointerIsReturnedAndNeitherReadNorAttached) {
    rec::fail(rec::Call::ckptr, 0x2A, 0, 0, -1);
    uint32_t crc = 0xC0FFEE;
    EXPECT_EQ(GetParam().entry(&crc), 0x2Au);
    EXPECT_EQ(crc, 0xC0FFEEu);
    EXPECT_EQ(fields_of(*block), RUNNING);
    EXPECT_EQ(rec::traces(), (lines{entering(), leaving(0x2A, 0)}));
    // The check the platform makes of a null pointer refuses it the same way.
    rec::reset();
    EXPECT_EQ(GetParam().entry(nullptr), 1u);
    EXPECT_EQ(fields_of(*block), RUNNING);
    EXPECT_EQ(rec::traces(), (lines{entering(), leaving(1, 0)}));
}

TEST_P(AlertSwitch, WithoutABlockReturnsZeroAndChangesNothing) {
    remove_block();
    uint32_t crc = 0x55;
    EXPECT_EQ(GetParam().entry(&crc), 0u);
    EXPECT_EQ(crc, 0x55u);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    EXPECT_FALSE(control_block_exists());
    EXPECT_EQ(rec::traces().front(), entering());
    EXPECT_EQ(rec::traces_starting("TARNICBF: shmget failed").size(), 10u);
    EXPECT_EQ(rec::traces().back(), leaving(0, 0x55));
    EXPECT_TRUE(rec::events().empty());
}

INSTANTIATE_TEST_SUITE_P(Switches, AlertSwitch, ::testing::Values(ENABLE, DISABLE, TRIGGER),
                         [](const ::testing::TestParamInfo<switch_case> &info) {
                             return std::string(info.param.name);
                         });

// ---- The logging type ----

lines logging_type_traces(uint32_t value, const lines &attach, bool stored) {
    lines expected =
        lines{printed("TARNSLTF: about to set logging flag to %x (hex)", value)} + attach;
    if (stored) {
        expected.push_back(printed("TARNSLTF: TARN_CB_PTR->logAsInfo set to %x", value));
    }
    expected.push_back("TARNSLTF: tarn_init_tarn_cb_ptr src=0, crc=0 (hex)");
    return expected;
}

TEST_F(AlertSwitches, LoggingTypeTwoIsStoredAsTwoAndEventsAreInformational) {
    uint32_t crc = 0x77;
    EXPECT_EQ(tarn_set_logging_type(2, &crc), 0u);
    EXPECT_EQ(crc, 0u);
    fields expected = RUNNING;
    expected.logAsInfo = 2;
    EXPECT_EQ(fields_of(*block), expected);
    EXPECT_EQ(rec::traces(), logging_type_traces(2, attach, true));

    rec::clear_traces();
    EXPECT_EQ(tarn_mon_error_handler(2, 5, RC_CONTROL_FILE_READ), REPORT_RESULT);
    EXPECT_EQ(tarn_mon_error_handler_p(2, 6, "text", RC_CONTROL_FILE_READ), REPORT_RESULT);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.option, LOGSVC_REPORT_INFORMATIONAL);
    EXPECT_EQ(rec::events()[1].record.option, LOGSVC_REPORT_INFORMATIONAL + LOGSVC_DATA_ATTACHED);
    EXPECT_EQ(rec::traces_starting("TARNSLTF: LOGSVC_REPORT_INFORMATIONAL option set.").size(), 2u);

    // 0 switches back to error events.
    EXPECT_EQ(tarn_set_logging_type(0, &crc), 0u);
    EXPECT_EQ(block->logAsInfo, 0u);
    EXPECT_EQ(tarn_mon_error_handler(2, 5, RC_CONTROL_FILE_READ), REPORT_RESULT);
    EXPECT_EQ(rec::events().back().record.option, LOGSVC_REPORT_ERROR);
}

TEST_F(AlertSwitches, LoggingTypeIsStoredWithAllItsBits) {
    uint32_t crc = 0;
    EXPECT_EQ(tarn_set_logging_type(0x80000001u, &crc), 0u);
    EXPECT_EQ(block->logAsInfo, 0x80000001u);
    EXPECT_EQ(rec::traces(), logging_type_traces(0x80000001u, attach, true));
}

TEST_F(AlertSwitches, LoggingTypeWithoutABlockReturnsZeroAndChangesNothing) {
    remove_block();
    uint32_t crc = 0x77;
    EXPECT_EQ(tarn_set_logging_type(1, &crc), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    EXPECT_FALSE(control_block_exists());
    EXPECT_EQ(rec::traces().front(), "TARNSLTF: about to set logging flag to 1 (hex)");
    EXPECT_TRUE(rec::traces_starting("TARNSLTF: TARN_CB_PTR->logAsInfo").empty());
    EXPECT_EQ(rec::traces().back(), "TARNSLTF: tarn_init_tarn_cb_ptr src=0, crc=0 (hex)");
    // The events of this process stay errors.
    tarn_mon_error_handler(2, 5, RC_CONTROL_FILE_READ);
    EXPECT_EQ(rec::events().back().record.option, LOGSVC_REPORT_ERROR);
}

// ---- The logging type through the Java bridge ----

using Kind = rec::BridgeCall::Kind;

TEST_F(AlertSwitches, JavaCallWhoseArgumentCannotBeFetchedFailsWith22AndSaysWhy) {
    rec::fail(rec::Call::get_boolean_argument, 5);
    rec::set_last_error_message("argument 1 is not a boolean");
    EXPECT_EQ(java_set_logging_type(rec::java_context()), 22);
    ASSERT_EQ(rec::bridge_calls().size(), 1u);
    const rec::BridgeCall &call = rec::bridge_calls()[0];
    EXPECT_EQ(call.kind, Kind::native_function_error);
    EXPECT_EQ(call.context, rec::java_context());
    EXPECT_EQ(call.text, "Unable to fetch the requested logging type parameter; "
                         "jcbGetBooleanArgument() rc=5, msg=\"argument 1 is not a boolean\"");
    EXPECT_EQ(fields_of(*block), RUNNING);
    EXPECT_TRUE(rec::traces().empty());
}

class JavaLoggingType : public AlertSwitches, public ::testing::WithParamInterface<int> {};

TEST_P(JavaLoggingType, JavaCallStoresItsBooleanAndSetsTheVoidResult) {
    const int flag = GetParam();
    block->logAsInfo = flag == 0 ? 1 : 0;
    rec::set_boolean_argument(flag);
    EXPECT_EQ(java_set_logging_type(rec::java_context()), 0);
    EXPECT_EQ(block->logAsInfo, static_cast<uint32_t>(flag));
    ASSERT_EQ(rec::bridge_calls().size(), 1u);
    EXPECT_EQ(rec::bridge_calls()[0].kind, Kind::void_result);
    EXPECT_EQ(rec::bridge_calls()[0].context, rec::java_context());
    EXPECT_EQ(rec::traces(), logging_type_traces(static_cast<uint32_t>(flag), attach, true));
}

INSTANTIATE_TEST_SUITE_P(Booleans, JavaLoggingType, ::testing::Values(0, 1),
                         [](const ::testing::TestParamInfo<int> &info) {
                             return std::string(info.param != 0 ? "True" : "False");
                         });

TEST_F(AlertSwitches, JavaCallWithoutABlockSucceedsAndChangesNothing) {
    remove_block();
    rec::set_boolean_argument(1);
    EXPECT_EQ(java_set_logging_type(rec::java_context()), 0);
    EXPECT_EQ(TARN_CB_PTR, nullptr);
    EXPECT_FALSE(control_block_exists());
    ASSERT_EQ(rec::bridge_calls().size(), 1u);
    EXPECT_EQ(rec::bridge_calls()[0].kind, Kind::void_result);
}

// ---- The switches as the monitoring loop sees them ----

// A host of one process that uses no memory to speak of, one CPU and one file system.
const std::string PS = "    1     1  1000  20000  3000 init            00:00:01\n";
const std::string CAT = "#!/bin/sh\ncase \"$1\" in\n"
                        "/proc/meminfo) printf 'MemTotal: 1000000 kB\\nMemFree: 600000 kB\\n' ;;\n"
                        "/proc/sys/fs/file-nr) printf '1000\\t0\\t100000\\n' ;;\n"
                        "*) exec /bin/cat \"$@\" ;;\nesac\n";

// free: `in_use` KB of 1,000,000 in use (neither free nor cache), no swap.
std::string free_output(int in_use) {
    return "               total        used        free      shared  buff/cache   available\n"
           "Mem:         1000000  " +
           std::to_string(in_use) + "  " + std::to_string(960000 - in_use) +
           "        1000       40000       50000\nSwap:              0           0           0\n";
}

// df: "/" at `slash_percent` of its space, its inodes at 10 %.
std::string df(int slash_percent) {
    return "#!/bin/sh\nif [ \"$1\" = -h ]; then\n"
           "echo 'Filesystem     Type      Size  Used Avail Use% Mounted on'\n"
           "echo '/dev/vda1      ext4       20G   10G   10G " +
           std::to_string(slash_percent) +
           "% /'\nelse\necho 'Filesystem      Inodes  IUsed   IFree IUse% Mounted on'\n"
           "echo '/dev/vda1      1310720 123456 1187264   10% /'\nfi\n";
}

constexpr uint16_t SLASH_SPACE = 0xE136; // "/" above its space threshold
constexpr int BUSY = 77;                 // a process of the fake /proc at 95 % of the CPU

// The loop's time while it lives: the uptime stands still but for the loop's one-second sleep,
// which steps it by a second and then calls `each_second` with the seconds slept in all.
class stepped_clock {
  public:
    explicit stepped_clock(std::function<void(int)> each_second)
        : each_second_(std::move(each_second)) {
        running = this;
        uptime_source = [] { return 1000L + running->slept; };
        one_second_sleep = [] { running->each_second_(++running->slept); };
    }
    ~stepped_clock() {
        uptime_source = saved_uptime_;
        one_second_sleep = saved_sleep_;
        running = nullptr;
    }
    stepped_clock(const stepped_clock &) = delete;
    stepped_clock &operator=(const stepped_clock &) = delete;

    int slept = 0;

  private:
    static inline stepped_clock *running = nullptr;
    std::function<void(int)> each_second_;
    long (*saved_uptime_)() = uptime_source;
    void (*saved_sleep_)() = one_second_sleep;
};

// The monitor over a quiet host: fake commands, and a fake /proc in which BUSY uses 95 % of the
// only CPU every second the loop sleeps. A test turns the switches from on_sleep, which runs
// inside the loop's sleep.
class AlertSwitchesInTheLoop : public ::testing::Test {
  protected:
    void SetUp() override {
        REQUIRE_PRIVATE_KEY();
        key_is_ours = true;
        fresh_monitor::reset();
        tree.set_cpus(1);
        tree.set_process(1, "init", 1, 1);
        tree.set_process(BUSY, "busy", busy_time, 1);
        fakes.add_printing("ps", PS);
        fakes.add_printing("free", free_output(200000));
        fakes.add("cat", CAT);
        fakes.add("df", df(10));
        fakes.add("runAsRoot", "#!/bin/sh\ncase \"$1\" in\n"
                               "lsmon.sh) printf '/proc/1/fd:\\ntotal 0\\n\\n' ;;\n"
                               "telvzstba) echo trace > '" +
                                   rec::data_dir() + "/'\"$3\" ;;\nesac\nexit 0\n");
    }
    void TearDown() override {
        if (key_is_ours) {
            free_compiled_expressions();
            delete_process_list(&process_list);
            private_ipc::remove_control_block();
        }
    }

    // The monitor with a checking interval of `interval` seconds until the pass after the sleep
    // in which `last_sleep` seconds have been slept in all.
    void run_monitor(int interval, int last_sleep,
                     const std::map<std::string, std::string> &changes = {}) {
        rec::write_data_file("telvzopt.trm", quiet_control::text(changes));
        stepped_clock clock([this, last_sleep](int slept) {
            tree.advance(100);
            busy_time += 95;
            tree.set_process(BUSY, "busy", busy_time, 1);
            if (on_sleep) {
                on_sleep(slept);
            }
            if (slept == last_sleep) {
                write_field(TARN_CB_PTR->terminateRequest, 1);
            }
        });
        std::string interval_text = std::to_string(interval);
        char name[] = "telvzmnd";
        char *argv[] = {name, interval_text.data(), nullptr};
        EXPECT_EQ(tarn_mon_main(2, argv), 0u);
        sleeps = clock.slept;
    }

    // Index of the trace line that begins pass `pass` (1 the first), or -1.
    static int pass_start(int pass) {
        int at = -1;
        for (int i = 0; i < pass; ++i) {
            at = rec::find_trace("TARNMNDF: inside while loop", at + 1);
            if (at == -1) {
                return -1;
            }
        }
        return at;
    }

    bool key_is_ours = false;
    fake::fake_proc tree{1000, 100};
    fake::fake_commands fakes;
    uint32_t busy_time = 1;
    std::function<void(int)> on_sleep;
    int sleeps = 0; // in all, once the monitor has ended
};

// Pass 1 counts the countdown of the start down to 10; the switch, in the sleep after it, sets
// 60; passes 2 to 60 count it down to 1 without judging, and pass 61 brings it to 0, judges, and
// reports the busy process that every pass before it left alone.
TEST_F(AlertSwitchesInTheLoop, DisableHoldsCpuJudgingOffFor59PassesThenItResumesByItself) {
    on_sleep = [](int count) {
        if (count == 1) {
            uint32_t crc = 0;
            EXPECT_EQ(tarn_disable_cpu_alerts(&crc), 0u);
            EXPECT_EQ(read_field(TARN_CB_PTR->numLoopsBeforeCPUChecking), 60);
        }
    };
    run_monitor(5, 60 * 5, {{"CPU_TIME_THRESHOLD", "3"}, {"CPU_PERCENT_THRESHOLD_QV", "1000"}});

    lines countdown = {"TARNMNDF: TARN_CB_PTR->numLoopsBeforeCPUChecking = 10 (dec)"};
    for (int left = 59; left >= 0; --left) {
        countdown.push_back(
            printed("TARNMNDF: TARN_CB_PTR->numLoopsBeforeCPUChecking = %d (dec)", left));
    }
    EXPECT_EQ(rec::traces_starting("TARNMNDF: TARN_CB_PTR->numLoopsBeforeCPUChecking"), countdown);
    EXPECT_EQ(pass_start(62), -1);
    ASSERT_NE(pass_start(61), -1);
    EXPECT_EQ(rec::traces_starting("TARNMNDF: Actually check the CPU usage").size(), 1u);
    EXPECT_GT(rec::find_trace("TARNMNDF: Actually check the CPU usage"), pass_start(61));
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, RC_PROCESS_CPU);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 31u); // the oldest of three samples at 95 %, over 3
    EXPECT_GT(rec::find_trace("TARNMNDF:     process_name   = [(busy)]    "), pass_start(61));
}

// "/" is full in pass 1, which reports it and sets tookLog. The switch in the sleep after it
// clears tookLog at once, so pass 2 reports what the system memory check finds; without it the
// finding would only be marked (0x10000).
TEST_F(AlertSwitchesInTheLoop, EnableRightAfterAReportReportsTheNextFindingOfAnyCheck) {
    fakes.add("df", df(95));
    std::optional<fields> after_switch;
    on_sleep = [&](int count) {
        if (count == 1) {
            EXPECT_EQ(read_field(TARN_CB_PTR->tookLog), 1u);
            uint32_t crc = 0;
            EXPECT_EQ(tarn_enable_cpu_alerts(&crc), 0u);
            after_switch = fields_of(*TARN_CB_PTR);
            fakes.add("df", df(10));
            fakes.add_printing("free", free_output(950000));
        }
    };
    run_monitor(5, 5);
    ASSERT_TRUE(after_switch.has_value());
    EXPECT_EQ(after_switch->tookLog, 0u);
    EXPECT_EQ(after_switch->numLoopsBeforeCPUChecking, 11);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.reason_code, SLASH_SPACE);
    EXPECT_EQ(rec::events()[1].record.reason_code, RC_MEMORY_IN_USE);
    EXPECT_EQ(rec::events()[1].record.comp_rc, 950u);
    EXPECT_GT(rec::find_trace("TARNMNDD: takeLogCrc = 57620 (dec)"), pass_start(2));
    EXPECT_EQ(read_field(TARN_CB_PTR->tookLog), 1u); // set again by the report of pass 2
}

// The trigger comes in the third second of a 60-second sleep: that second is the last one slept,
// and pass 2 reports the sleep alert with the measure the trigger left, 0. The loop has set its
// allowance again after the second (66 seconds); the sleep took 60 by its measure, no overrun.
TEST_F(AlertSwitchesInTheLoop, TriggerWhileTheLoopSleepsEndsTheSleepAndTheNextPassReportsIt) {
    on_sleep = [](int count) {
        if (count == 3) {
            uint32_t crc = 0;
            EXPECT_EQ(tarn_trigger_cpu_alert04(&crc), 0u);
            write_field(TARN_CB_PTR->terminateRequest, 1);
        }
    };
    run_monitor(60, 3);
    EXPECT_EQ(sleeps, 3);
    EXPECT_EQ(rec::traces_starting("TARNMNDF: slept for 1 second;").back(),
              "TARNMNDF: slept for 1 second; 57 seconds left");
    ASSERT_NE(pass_start(2), -1);
    EXPECT_EQ(pass_start(3), -1);
    const lines alert = {
        "TARNMNDF: The QV is running too slowly",
        "TARNMNDF:     The actual sleep time was 60 seconds instead of the expected 66 seconds",
        "TARNMNDF:     TARN_CB_PTR->sleep_time_percent = 0 percent",
    };
    int at = rec::find_trace(alert[0], pass_start(2));
    ASSERT_NE(at, -1);
    EXPECT_EQ(lines(rec::traces().begin() + at, rec::traces().begin() + at + 3), alert);
    // Armed at once: pass 2 counts nothing down and judges.
    EXPECT_NE(rec::find_trace("TARNMNDF: TARN_CB_PTR->numLoopsBeforeCPUChecking = 0 (dec)",
                              pass_start(2)),
              -1);
    ASSERT_EQ(rec::events().size(), 1u);
    EXPECT_EQ(rec::events()[0].record.reason_code, RC_SLEEP_OVERRUN_NOT_POSITIVE);
    EXPECT_EQ(rec::events()[0].record.comp_rc, 0u);
    EXPECT_EQ(rec::events()[0].record.option, LOGSVC_REPORT_ERROR + LOGSVC_DATA_ATTACHED);
    EXPECT_EQ(read_field(TARN_CB_PTR->sleepTimeExceeded), 0u);
    EXPECT_EQ(read_field(TARN_CB_PTR->tookLog), 1u);
}

// Set during the sleep after pass 1, the logging type makes the event of pass 2 informational;
// set back to 0 in the next sleep, it makes that of pass 3 an error again.
TEST_F(AlertSwitchesInTheLoop, LoggingTypeTurnsTheMonitorsNextEventInformationalAndBack) {
    on_sleep = [this](int count) {
        uint32_t crc = 0;
        if (count == 1) {
            EXPECT_EQ(tarn_set_logging_type(2, &crc), 0u);
            EXPECT_EQ(read_field(TARN_CB_PTR->logAsInfo), 2u);
            fakes.add("df", df(95));
        }
        if (count == 6) {
            EXPECT_EQ(tarn_set_logging_type(0, &crc), 0u);
            EXPECT_EQ(tarn_enable_cpu_alerts(&crc), 0u); // pass 3 reports "/" again
        }
    };
    run_monitor(5, 10);
    ASSERT_EQ(rec::events().size(), 2u);
    EXPECT_EQ(rec::events()[0].record.reason_code, SLASH_SPACE);
    EXPECT_EQ(rec::events()[0].record.option, LOGSVC_REPORT_INFORMATIONAL + LOGSVC_DATA_ATTACHED);
    EXPECT_EQ(rec::events()[1].record.reason_code, SLASH_SPACE);
    EXPECT_EQ(rec::events()[1].record.option, LOGSVC_REPORT_ERROR + LOGSVC_DATA_ATTACHED);
    int informational = rec::find_trace("TARNSLTF: LOGSVC_REPORT_INFORMATIONAL option set.");
    EXPECT_GT(informational, pass_start(2));
    EXPECT_LT(informational, pass_start(3));
    EXPECT_GT(rec::find_trace("TARNSLTF: LOGSVC_REPORT_ERROR option set."), pass_start(3));
}

} // namespace

// The hidden core of the default platform: the pieces that work on text and tables alone.
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "environment.h"
#include "event_log.h"
#include "memdebug.h"
#include "modsvc.h"
#include "modules.h"
#include "platform_test_support.h"
#include "pointer_check.h"
#include "trace_file.h"

namespace {

using platform_test::set_variable;
using telv::pointer_check::readable_and_writable;

// A map as the kernel writes it: a heap, a guard page and a stack below a gap, code.
constexpr const char *MAPS = "00400000-00452000 r-xp 00000000 08:02 173521      /usr/bin/monitor\n"
                             "00651000-00652000 rw-p 00051000 08:02 173521      /usr/bin/monitor\n"
                             "00652000-00700000 rw-p 00000000 00:00 0           [heap]\n"
                             "7f0000000000-7f0000001000 ---p 00000000 00:00 0\n"
                             "7f0000001000-7f0000005000 rw-p 00000000 00:00 0\n"
                             "7f0000005000-7f0000006000 r--p 00000000 00:00 0\n"
                             "7ffd00000000-7ffd00021000 rw-p 00000000 00:00 0   [stack]";

TEST(PlatformCoreMemoryMap, ARangeInOneReadWriteMappingPasses) {
    EXPECT_TRUE(readable_and_writable(MAPS, 0x652000, 0x700000));
    EXPECT_TRUE(readable_and_writable(MAPS, 0x6FFFFF, 0x700000));
    EXPECT_TRUE(readable_and_writable(MAPS, 0x7ffd00000010, 0x7ffd00000020)); // last line, no \n
}

TEST(PlatformCoreMemoryMap, ARangeOverAdjacentMappingsPasses) {
    EXPECT_TRUE(readable_and_writable(MAPS, 0x651000, 0x700000));
    EXPECT_TRUE(readable_and_writable(MAPS, 0x651FFF, 0x652001));
}

TEST(PlatformCoreMemoryMap, ARangeTouchingAGapOrAForbiddenMappingFails) {
    EXPECT_FALSE(readable_and_writable(MAPS, 0x6FFFFF, 0x700001));             // past the heap
    EXPECT_FALSE(readable_and_writable(MAPS, 0x700000, 0x700001));             // in the gap
    EXPECT_FALSE(readable_and_writable(MAPS, 0x400000, 0x400004));             // code
    EXPECT_FALSE(readable_and_writable(MAPS, 0x450000, 0x652000));             // code then data
    EXPECT_FALSE(readable_and_writable(MAPS, 0x7f0000000000, 0x7f0000000001)); // guard page
    EXPECT_FALSE(readable_and_writable(MAPS, 0x7f0000004FFF, 0x7f0000005001)); // into read-only
    EXPECT_FALSE(readable_and_writable(MAPS, 0x100, 0x200));                   // below everything
    EXPECT_FALSE(readable_and_writable(MAPS, 0x7ffd00020000, 0x7ffd00022000)); // past the end
    EXPECT_FALSE(readable_and_writable("", 0x1000, 0x1001));
}

TEST(PlatformCoreMemoryMap, MalformedLinesAreSkipped) {
    EXPECT_TRUE(readable_and_writable("garbage\n1000-2000 rw-p 0 0:0 0\n", 0x1000, 0x2000));
    EXPECT_FALSE(readable_and_writable("1000-2000\n", 0x1000, 0x1001));
    EXPECT_FALSE(readable_and_writable("2000-1000 rw-p\n", 0x1000, 0x1001));
    EXPECT_FALSE(readable_and_writable("1000 2000 rw-p\n", 0x1000, 0x1001));
}

TEST(PlatformCorePointerCheck, TheRealMapOfThisProcessIsRead) {
    static int global_value = 0;
    EXPECT_EQ(telv::pointer_check::check(&global_value, sizeof global_value), 0u);
    EXPECT_EQ(telv::pointer_check::check("literal", 8), telv::pointer_check::REFUSED);
}

std::string json(std::string_view text) {
    std::string out;
    telv::event_log::append_json_string(out, text);
    return out;
}

TEST(PlatformCoreJsonText, ControlCharactersAreEscaped) {
    EXPECT_EQ(json("a\n\rb"), R"("a\n\rb")");
    EXPECT_EQ(json("\"\\\t\b\f"), R"("\"\\\t\b\f")");
    EXPECT_EQ(json(std::string_view("\x01\x1F\0", 3)), R"("\u0001\u001F\u0000")");
    EXPECT_EQ(json("\x7F/"), "\"\x7F/\"");
    EXPECT_EQ(json(""), R"("")");
}

TEST(PlatformCoreJsonText, WellFormedUtf8PassesAndAnythingElseIsLatin1) {
    EXPECT_EQ(json("caf\xC3\xA9"), "\"caf\xC3\xA9\"");
    EXPECT_EQ(json("\xE2\x82\xAC"), "\"\xE2\x82\xAC\"");         // euro sign
    EXPECT_EQ(json("\xF0\x9F\x98\x80"), "\"\xF0\x9F\x98\x80\""); // four bytes
    EXPECT_EQ(json("\xFF"), R"("\u00FF")");
    EXPECT_EQ(json("\xC0\x80"), R"("\u00C0\u0080")");                     // overlong
    EXPECT_EQ(json("\xED\xA0\x80"), R"("\u00ED\u00A0\u0080")");           // surrogate
    EXPECT_EQ(json("\xE2\x82"), R"("\u00E2\u0082")");                     // cut short
    EXPECT_EQ(json("\xF4\x90\x80\x80"), R"("\u00F4\u0090\u0080\u0080")"); // above U+10FFFF
    EXPECT_EQ(json("\xC3"), R"("\u00C3")");
}

TEST(PlatformCoreEventFormat, TheWholeLine) {
    logsvc_record record{};
    record.record_type = LOGSVC_RECORD_TYPE_EVENT;
    record.option = 0xC200;
    std::strcpy(record.component, "LinMonitor");
    record.reason_code = 0xE117;
    record.comp_rc = 0x1F;
    char attachment[] = "Process 12 over its limit \n\rend of data \n\r";
    record.attachment = attachment;
    record.attachment_length = static_cast<uint32_t>(std::strlen(attachment));
    EXPECT_EQ(telv::event_log::format(record, "2026-11-22T02:31:30.123Z", 4321),
              "{\"time\":\"2026-11-22T02:31:30.123Z\",\"pid\":4321,\"component\":\"LinMonitor\","
              "\"reason\":\"0xE117\",\"severity\":\"informational\",\"option\":\"0xC200\","
              "\"compRc\":\"0x1F\",\"attachment\":\"Process 12 over its limit \\n\\rend of data "
              "\\n\\r\"}\n");
}

TEST(PlatformCoreEventFormat, Severity) {
    EXPECT_STREQ(telv::event_log::severity(0x300), "error");
    EXPECT_STREQ(telv::event_log::severity(0x200), "informational");
    EXPECT_STREQ(telv::event_log::severity(0xC300), "error");
    EXPECT_STREQ(telv::event_log::severity(0xC200), "informational");
    EXPECT_STREQ(telv::event_log::severity(0xC000), "error");
    EXPECT_STREQ(telv::event_log::severity(0x8200), "informational");
}

std::string compose(size_t room, std::string_view stamp, std::string_view text) {
    std::string out(room, '#');
    out.resize(telv::trace::compose(out.data(), room, stamp, text));
    return out;
}

TEST(PlatformCoreTraceLine, ComposedWithinItsRoom) {
    EXPECT_EQ(compose(100, "S ", "text"), "S text\n");
    EXPECT_EQ(compose(7, "S ", "text"), "S text\n");
    EXPECT_EQ(compose(6, "S ", "text"), "S tex\n");
    EXPECT_EQ(compose(2, "S ", "text"), "S\n");
    EXPECT_EQ(compose(1, "S ", "text"), "\n");
}

TEST(PlatformCoreTraceLine, AnEscapeIsNeverCutInHalf) {
    EXPECT_EQ(compose(100, "", "a\nb\r\n\r\n"), "a\\nb\n");
    EXPECT_EQ(compose(4, "", "ab\nc"), "ab\n");
    EXPECT_EQ(compose(5, "", "ab\nc"), "ab\\n\n");
}

TEST(PlatformCoreTraceLine, DetailEyeCatchers) {
    EXPECT_TRUE(telv::trace::is_detail("TARNSDAD:"));
    EXPECT_TRUE(telv::trace::is_detail("TARNSDAD: more"));
    EXPECT_FALSE(telv::trace::is_detail("TARNSDAF: more"));
    EXPECT_FALSE(telv::trace::is_detail("TARNSDAD"));
    EXPECT_FALSE(telv::trace::is_detail("TARNSDAD more"));
    EXPECT_FALSE(telv::trace::is_detail("TARNSDDF: D"));
}

TEST(PlatformCoreTraceLine, DumpRowIsCutToItsRoom) {
    const unsigned char bytes[] = {'A', 'B'};
    char row[128];
    std::string full(row, telv::trace::dump_row(row, sizeof row, 0x20, bytes, 2));
    // Two bytes, fourteen empty places, the gap in the middle, then the text.
    EXPECT_EQ(full, "00000020  41 42" + std::string(1 + 14 * 3 + 1 + 1, ' ') + "|AB|");
    EXPECT_EQ(full.size(), 8u + 2 + 16 * 3 + 1 + 2 + 2 + 1);
    EXPECT_EQ(std::string(row, telv::trace::dump_row(row, 12, 0x20, bytes, 2)), "00000020  41");
}

TEST(PlatformCoreEnvironment, NumbersThatAreNoNumbersGiveTheFallback) {
    const char *name = "TELV_CORE_TEST_NUMBER";
    ::unsetenv(name);
    EXPECT_EQ(telv::environment::number(name, 7), 7u);
    for (const char *bad : {"", "0", "-5", "12abc", " 12", "99999999999999999999999"}) {
        set_variable(name, bad);
        EXPECT_EQ(telv::environment::number(name, 7), 7u) << bad;
    }
    set_variable(name, "18446744073709551615");
    EXPECT_EQ(telv::environment::number(name, 7), UINT64_MAX);
    set_variable(name, "1000");
    EXPECT_EQ(telv::environment::number(name, 7), 1000u);
    ::unsetenv(name);
}

TEST(PlatformCoreEnvironment, TheDataDirectoryDefaultsWhenUnsetOrEmpty) {
    ::unsetenv("TELV_DATA_DIR");
    EXPECT_EQ(telv::environment::text("TELV_DATA_DIR", telv::environment::DEFAULT_DATA_DIR),
              "/var/lib/telvzmnd");
    set_variable("TELV_DATA_DIR", "");
    EXPECT_EQ(telv::environment::text("TELV_DATA_DIR", telv::environment::DEFAULT_DATA_DIR),
              "/var/lib/telvzmnd");
    ::unsetenv("TELV_DATA_DIR");
}

using PlatformCoreDirectories = platform_test::PlatformTest;

TEST_F(PlatformCoreDirectories, MadeWithTheirParentsOrRefusedWithTheReason) {
    EXPECT_EQ(telv::environment::make_directories(dir + "/a/b/c/"), 0);
    EXPECT_TRUE(platform_test::exists(dir + "/a/b/c"));
    EXPECT_EQ(telv::environment::make_directories(dir + "/a/b/c"), 0);
    ASSERT_EQ(::close(::creat((dir + "/file").c_str(), 0644)), 0);
    EXPECT_EQ(telv::environment::make_directories(dir + "/file"), ENOTDIR);
    EXPECT_EQ(telv::environment::make_directories(dir + "/file/below"), ENOTDIR);
    EXPECT_EQ(telv::environment::make_directories("relative-" + std::to_string(::getpid())), 0);
    ::rmdir(("relative-" + std::to_string(::getpid())).c_str());
}

TEST_F(PlatformCoreDirectories, AFileInTheDataDirectoryUnlessNamed) {
    EXPECT_EQ(telv::environment::file_in_data_directory("TELV_EVENT_LOG", "telvzmnd.events"),
              dir + "/telvzmnd.events");
    set_variable("TELV_EVENT_LOG", "/somewhere/else");
    EXPECT_EQ(telv::environment::file_in_data_directory("TELV_EVENT_LOG", "telvzmnd.events"),
              "/somewhere/else");
}

using PlatformCoreBlocks = platform_test::PlatformTest;

TEST_F(PlatformCoreBlocks, EveryLiveBlockIsKnownWithItsFileAndLine) {
    size_t before = telv::memdebug::live_blocks();
    size_t bytes_before = telv::memdebug::live_bytes();
    void *first = telv::memdebug::allocate(40, "process_listing", 120);
    void *second = telv::memdebug::allocate_zeroed(3, 10, "telvzmnd", 88);
    EXPECT_EQ(telv::memdebug::live_blocks(), before + 2);
    EXPECT_EQ(telv::memdebug::live_bytes(), bytes_before + 70);
    telv::memdebug::Block block{};
    ASSERT_TRUE(telv::memdebug::find(first, &block));
    EXPECT_EQ(block.size, 40u);
    EXPECT_STREQ(block.file, "process_listing");
    EXPECT_EQ(block.line, 120);
    ASSERT_TRUE(telv::memdebug::find(second, &block));
    EXPECT_EQ(block.size, 30u);
    EXPECT_STREQ(block.file, "telvzmnd");
    EXPECT_EQ(block.line, 88);
    telv::memdebug::release(first, "process_listing", 130);
    EXPECT_FALSE(telv::memdebug::find(first, &block));
    EXPECT_EQ(telv::memdebug::live_blocks(), before + 1);
    telv::memdebug::release(second, "telvzmnd", 99);
    EXPECT_EQ(telv::memdebug::live_blocks(), before);
}

TEST_F(PlatformCoreBlocks, ALongFileNameIsCutAndANullOneShownAsAQuestionMark) {
    std::string long_name(100, 'f');
    void *first = telv::memdebug::allocate(1, long_name.c_str(), 1);
    void *second = telv::memdebug::allocate(1, nullptr, 2);
    telv::memdebug::Block block{};
    ASSERT_TRUE(telv::memdebug::find(first, &block));
    EXPECT_EQ(std::string(block.file), std::string(telv::memdebug::MAX_FILE, 'f'));
    ASSERT_TRUE(telv::memdebug::find(second, &block));
    EXPECT_STREQ(block.file, "?");
    telv::memdebug::release(first, "t", 3);
    telv::memdebug::release(second, "t", 4);
}

TEST_F(PlatformCoreBlocks, ForeignAndRepeatedFreesLeaveTheTableAlone) {
    size_t before = telv::memdebug::live_blocks();
    void *block = telv::memdebug::allocate(8, "t", 1);
    int on_stack = 0;
    telv::memdebug::release(&on_stack, "t", 2);
    EXPECT_EQ(telv::memdebug::live_blocks(), before + 1);
    telv::memdebug::release(block, "t", 3);
    telv::memdebug::release(block, "t", 4);
    EXPECT_EQ(telv::memdebug::live_blocks(), before);
}

TEST_F(PlatformCoreBlocks, CallocOverflowTakesNothing) {
    size_t before = telv::memdebug::live_blocks();
    EXPECT_EQ(telv::memdebug::allocate_zeroed(SIZE_MAX / 4, 8, "t", 1), nullptr);
    EXPECT_EQ(telv::memdebug::live_blocks(), before);
}

TEST_F(PlatformCoreBlocks, ThreadsAllocatingAtOnceKeepEveryBlockApart) {
    constexpr int THREADS = 8;
    constexpr int ROUNDS = 500;
    size_t before = telv::memdebug::live_blocks();
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < THREADS; ++t) {
        threads.emplace_back([t, &wrong] {
            std::vector<void *> held;
            for (int round = 0; round < ROUNDS; ++round) {
                void *block = round % 2 == 0 ? telv::memdebug::allocate(16, "thread", t)
                                             : telv::memdebug::allocate_zeroed(2, 8, "thread", t);
                std::memset(block, t, 16);
                held.push_back(block);
                if (round % 3 == 2) {
                    telv::memdebug::release(held.front(), "thread", t);
                    held.erase(held.begin());
                }
            }
            for (void *block : held) {
                telv::memdebug::Block found{};
                bool ours = telv::memdebug::find(block, &found) && found.line == t &&
                            found.size == 16 && static_cast<unsigned char *>(block)[15] == t;
                wrong += ours ? 0 : 1;
                telv::memdebug::release(block, "thread", t);
            }
        });
    }
    for (std::thread &thread : threads) {
        thread.join();
    }
    EXPECT_EQ(wrong.load(), 0);
    EXPECT_EQ(telv::memdebug::live_blocks(), before);
}

// The anonymous memory this process holds resident, in kB, from /proc/self/status.
long resident_anonymous_kb() {
    for (const std::string &line : platform_test::read_lines("/proc/self/status")) {
        if (line.starts_with("RssAnon:")) {
            return std::strtol(line.c_str() + 8, nullptr, 10);
        }
    }
    return -1;
}

// Whether a line of /proc/self/maps covers `address`.
bool mapped(const void *address) {
    auto at = reinterpret_cast<uintptr_t>(address);
    for (const std::string &line : platform_test::read_lines("/proc/self/maps")) {
        char *end = nullptr;
        uintptr_t from = std::strtoull(line.c_str(), &end, 16);
        uintptr_t to = std::strtoull(end + 1, nullptr, 16);
        if (at >= from && at < to) {
            return true;
        }
    }
    return false;
}

TEST_F(PlatformCoreBlocks, ALargeBlockIsGivenBackToTheSystemWhenReleased) {
    constexpr size_t SIZE = 16u << 20; // as a wrap of a snapshot file of 16 MB takes
    long resident_before = resident_anonymous_kb();
    auto *block = static_cast<unsigned char *>(telv::memdebug::allocate(SIZE, "snapshot_file", 1));
    ASSERT_NE(block, nullptr);
    EXPECT_EQ(reinterpret_cast<uintptr_t>(block) % alignof(std::max_align_t), 0u);
    std::memset(block, 0x5A, SIZE);
    EXPECT_GE(resident_anonymous_kb(), resident_before + static_cast<long>(SIZE >> 10) - 1024);
    telv::memdebug::Block found{};
    ASSERT_TRUE(telv::memdebug::find(block, &found));
    EXPECT_EQ(found.size, SIZE);
    telv::memdebug::release(block, "snapshot_file", 2);
    EXPECT_FALSE(mapped(block));
    EXPECT_FALSE(mapped(block + SIZE - 1));
    EXPECT_LT(resident_anonymous_kb(), resident_before + 1024);
}

TEST_F(PlatformCoreBlocks, ALargeZeroedBlockIsZeroAndAWritePastItsEndFaults) {
    constexpr size_t SIZE = telv::memdebug::LARGE_BLOCK + 5; // ends 11 bytes short of 16
    auto *block =
        static_cast<unsigned char *>(telv::memdebug::allocate_zeroed(1, SIZE, "snapshot_file", 1));
    ASSERT_NE(block, nullptr);
    size_t zero = 0;
    for (size_t i = 0; i < SIZE; ++i) {
        zero += block[i] == 0 ? 1 : 0;
    }
    EXPECT_EQ(zero, SIZE);
    block[SIZE - 1] = 1;
    size_t room = (SIZE + alignof(std::max_align_t) - 1) / alignof(std::max_align_t) *
                  alignof(std::max_align_t);
    volatile unsigned char *bytes = block;
    bytes[room - 1] = 1; // the alignment's slack is still the block's page
    EXPECT_DEATH(bytes[room] = 1, "");
    telv::memdebug::release(block, "snapshot_file", 2);
}

TEST_F(PlatformCoreBlocks, ALargeBlockThatCannotBeMappedIsNull) {
    size_t before = telv::memdebug::live_blocks();
    EXPECT_EQ(telv::memdebug::allocate(SIZE_MAX - 8, "t", 1), nullptr);
    EXPECT_EQ(telv::memdebug::allocate(size_t{1} << 62, "t", 1), nullptr);
    EXPECT_EQ(telv::memdebug::live_blocks(), before);
}

TEST_F(PlatformCoreBlocks, LeakLinesAreOrderedByFileAndLine) {
    ASSERT_EQ(telv::memdebug::live_blocks(), 0u);
    void *blocks[] = {
        telv::memdebug::allocate(5, "snapshot_file", 30),
        telv::memdebug::allocate(6, "control_file", 200),
        telv::memdebug::allocate(7, "snapshot_file", 4),
    };
    std::vector<std::string> expected = {
        "leak of 6 bytes from control_file:200",
        "leak of 7 bytes from snapshot_file:4",
        "leak of 5 bytes from snapshot_file:30",
    };
    EXPECT_EQ(telv::memdebug::leak_lines(), expected);
    EXPECT_EQ(telv::memdebug::report_leaks(nullptr), 3u);
    std::vector<std::string> traced = platform_test::read_lines(trace_path());
    ASSERT_EQ(traced.size(), 3u);
    EXPECT_TRUE(traced[0].ends_with(" TELVMEMF: leak of 6 bytes from control_file:200"));
    for (void *block : blocks) {
        telv::memdebug::release(block, "t", 0);
    }
    EXPECT_TRUE(telv::memdebug::leak_lines().empty());
}

using PlatformCoreWaitingLines = platform_test::PlatformTest;

TEST_F(PlatformCoreWaitingLines, DetailLinesWaitingAreWrittenWhenAsked) {
    telv::trace::line("TARNWATD: waits");
    EXPECT_EQ(platform_test::file_size(trace_path()), -1);
    EXPECT_TRUE(telv::trace::write_waiting_lines());
    std::vector<std::string> lines = platform_test::read_lines(trace_path());
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_TRUE(lines[0].ends_with(" TARNWATD: waits"));
    EXPECT_TRUE(telv::trace::write_waiting_lines()); // nothing waits: nothing to fail
}

TEST_F(PlatformCoreWaitingLines, WaitingLinesThatCannotBeWrittenAreSaidToFail) {
    set_variable("TELV_TRACE_FILE", dir + "/missing/directory/telvzmnd.trace");
    EXPECT_GT(telv::trace::line("TARNWATD: waits"), 0);
    EXPECT_FALSE(telv::trace::write_waiting_lines());
    EXPECT_TRUE(telv::trace::write_waiting_lines()); // they are gone, not tried again
    ::unsetenv("TELV_TRACE_FILE");
}

TEST(PlatformCoreModuleNames, AModuleIsItsSharedLibrary) {
    EXPECT_EQ(telv::modules::library_name(MODSVC_MONITOR_MODULE), "libtelvzmnd.so");
    EXPECT_EQ(telv::modules::library_name("telvtestmodule"), "libtelvtestmodule.so");
}

using PlatformCoreHeldModules = platform_test::PlatformTest;

TEST_F(PlatformCoreHeldModules, EveryResolvedHandleIsHeldUntilReleased) {
    set_variable("TELV_MODULE_PATH", TELV_TEST_MODULE_DIR);
    int before = telv::modules::held_handles();
    void *address = nullptr;
    void *handle = nullptr;
    uint32_t crc = 0;
    ASSERT_EQ(telv::modules::resolve("telvtestmodule", "telv_test_module_answer", &address, &handle,
                                     &crc),
              0u);
    EXPECT_EQ(telv::modules::held_handles(), before + 1);
    void *missing_address = nullptr;
    void *missing_handle = nullptr;
    EXPECT_EQ(telv::modules::resolve("telvtestmodule", "nothing", &missing_address, &missing_handle,
                                     &crc),
              telv::modules::FAILED);
    EXPECT_EQ(telv::modules::held_handles(), before + 1);
    void *held = nullptr;
    ASSERT_EQ(
        telv::modules::resolve("telvtestmodule", "telv_test_module_answer", &address, &held, &crc),
        0u);
    EXPECT_EQ(held, handle); // the loader gives the same handle for a module already open
    EXPECT_EQ(telv::modules::release("f", held, &crc), 0u);
    EXPECT_EQ(telv::modules::held_handles(), before + 1);
    EXPECT_EQ(telv::modules::release("f", handle, &crc), 0u);
    EXPECT_EQ(telv::modules::held_handles(), before);
}

} // namespace

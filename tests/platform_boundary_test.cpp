// What every service of the default platform owes its caller, whatever happens inside: errno as
// it was, and an answer rather than a throw.
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <sys/resource.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "filesvc.h"
#include "logsvc.h"
#include "memsvc.h"
#include "modsvc.h"
#include "platform_test_support.h"
#include "telvmemdebug.h"
#include "tracesvc.h"

namespace {

using platform_test::set_variable;
using PlatformBoundary = platform_test::PlatformTest;

logsvc_record event_record() {
    logsvc_record record;
    std::memset(&record, 0, sizeof record);
    record.record_type = LOGSVC_RECORD_TYPE_EVENT;
    record.option = LOGSVC_REPORT_ERROR;
    std::memcpy(record.component, "LinMonitor", 10);
    return record;
}

// A caller that saw a call fail with EINTR traces and then looks at errno again.
TEST_F(PlatformBoundary, FailingServicesLeaveErrnoAsTheyFoundIt) {
    set_variable("TELV_TRACE_FILE", dir + "/missing/x.trace");
    set_variable("TELV_EVENT_LOG", dir + "/missing/x.events");

    errno = EINTR;
    EXPECT_EQ(tracesvc_trace("TARNERRF: %s", "lost"), -1);
    EXPECT_EQ(errno, EINTR);
    EXPECT_EQ(tracesvc_dump_bytes("TARNERRF: lost", "ab", 2), -1);
    EXPECT_EQ(errno, EINTR);

    int foreign = 0;
    telvmemdebug_free(&foreign, "boundary", 1); // traced, into the missing trace file
    EXPECT_EQ(errno, EINTR);

    logsvc_record record = event_record();
    uint32_t crc = 0;
    EXPECT_EQ(logsvc_microcode_log(&record, &crc), 8u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOENT));
    EXPECT_EQ(errno, EINTR);

    void *address = &foreign;
    void *handle = &foreign;
    EXPECT_EQ(modsvc_get_func_addr2("telvnosuchmodule", "f", &address, &handle, &crc), 8u);
    EXPECT_EQ(errno, EINTR);

    filesvc_handle_t file = 0;
    uint32_t info = 0;
    EXPECT_EQ(filesvc_search_file_open("absent", 0, 1, 0, 0, &file, &info, &crc), 8u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOENT));
    EXPECT_EQ(errno, EINTR);
    uint32_t size = 0;
    EXPECT_EQ(filesvc_query_file_size("absent", &size, &crc), 8u);
    EXPECT_EQ(errno, EINTR);

    EXPECT_EQ(memsvc_ckptr(nullptr, 4), 8u);
    EXPECT_EQ(memsvc_ckptr(&foreign, sizeof foreign), 0u);
    EXPECT_EQ(errno, EINTR);

    void *block = telvmemdebug_malloc(16, "boundary", 2);
    EXPECT_NE(block, nullptr);
    EXPECT_EQ(errno, EINTR);
    telvmemdebug_free(block, "boundary", 3);
    EXPECT_EQ(errno, EINTR);
}

// Events logged by many threads at once each stay one whole line.
TEST_F(PlatformBoundary, EventsOfManyThreadsAreWholeLines) {
    constexpr int THREADS = 6;
    constexpr int EVENTS = 40;
    std::vector<std::thread> threads;
    std::atomic<int> refused{0};
    for (int t = 0; t < THREADS; ++t) {
        threads.emplace_back([t, &refused] {
            std::string attachment(3000, static_cast<char>('a' + t));
            logsvc_record record = event_record();
            record.attachment = attachment.data();
            record.attachment_length = static_cast<uint32_t>(attachment.size());
            for (int e = 0; e < EVENTS; ++e) {
                uint32_t crc = 0;
                refused += logsvc_microcode_log(&record, &crc) == 0 ? 0 : 1;
            }
        });
    }
    for (std::thread &thread : threads) {
        thread.join();
    }
    EXPECT_EQ(refused.load(), 0);
    std::vector<std::string> lines = platform_test::read_lines(event_path());
    ASSERT_EQ(lines.size(), static_cast<size_t>(THREADS * EVENTS));
    std::vector<int> per_thread(THREADS, 0);
    for (const std::string &line : lines) {
        size_t at = line.find("\"attachment\":\"");
        ASSERT_NE(at, std::string::npos) << line;
        std::string text = line.substr(at + 14);
        int t = text.empty() ? -1 : text[0] - 'a';
        ASSERT_TRUE(t >= 0 && t < THREADS) << line;
        EXPECT_EQ(text, std::string(3000, static_cast<char>('a' + t)) + "\"}");
        EXPECT_TRUE(line.starts_with("{\"time\":\"")) << line;
        ++per_thread[static_cast<size_t>(t)];
    }
    EXPECT_EQ(per_thread, std::vector<int>(THREADS, EVENTS));
}

#ifndef TARN_SANITIZED
// The blocks taken by exhaust_memory, chained through their first word, so that none is dropped.
void *volatile taken_blocks = nullptr;

// Takes every byte the heap can still give, so that the next allocation fails: first the large
// blocks, then each small size, since the allocator keeps freed small blocks apart by size.
void exhaust_memory() {
    auto take_all = [](size_t size) {
        for (void *block = std::malloc(size); block != nullptr; block = std::malloc(size)) {
            *static_cast<void **>(block) = taken_blocks;
            taken_blocks = block;
        }
    };
    for (size_t size = size_t{1} << 20; size >= 4096; size /= 2) {
        take_all(size);
    }
    for (size_t size = 4096; size >= sizeof(void *); size -= sizeof(void *)) {
        take_all(size);
    }
}

long address_space_in_use() {
    std::ifstream statm("/proc/self/statm");
    long pages = 0;
    statm >> pages;
    return pages * ::sysconf(_SC_PAGESIZE);
}

// Set in a child that is to end with its memory used up: the program's own objects are destroyed
// (and their memory freed) before the libraries' exit routines run, so the heap is exhausted
// only after them, by the program's last exit routine.
bool exhaust_at_exit = false;
__attribute__((destructor)) void exhaust_before_the_libraries_end() {
    if (exhaust_at_exit) {
        exhaust_memory();
    }
}

// Runs `body` in a child whose address space is capped a little above what it has, and expects
// the child to end normally with exit code 0; `body` ends the child itself.
template <typename Body>
void expect_normal_end_short_of_memory(Body body) {
    long in_use = address_space_in_use();
    ASSERT_GT(in_use, 0);
    pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        auto most = static_cast<rlim_t>(in_use + (64L << 20));
        struct rlimit cap = {most, most};
        if (::setrlimit(RLIMIT_AS, &cap) != 0) {
            ::_exit(100);
        }
        body();
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status)) << "ended by signal " << WTERMSIG(status);
    EXPECT_EQ(WEXITSTATUS(status), 0);
}
#endif

// With the address space capped and the heap used up, every service that needs memory for a path
// or a line refuses instead of throwing into a host that cannot catch it.
TEST_F(PlatformBoundary, MemoryRunningOutInsideAServiceIsARefusal) {
#ifdef TARN_SANITIZED
    GTEST_SKIP() << "the sanitizers' shadow memory needs an address space without a cap";
#else
    logsvc_record record = event_record();
    expect_normal_end_short_of_memory([&] {
        exhaust_memory();
        int wrong = 0;
        errno = EINTR;
        wrong |= tracesvc_trace("TARNOOMF: %s", "no room") != -1 ? 1 : 0;
        int local = 0;
        wrong |= memsvc_ckptr(&local, sizeof local) != 8 ? 2 : 0;
        uint32_t crc = 0;
        wrong |= logsvc_microcode_log(&record, &crc) != 8 || crc != ENOMEM ? 4 : 0;
        crc = 0;
        uint32_t size = 0;
        wrong |= filesvc_query_file_size("absent", &size, &crc) != 8 || crc != ENOMEM ? 8 : 0;
        wrong |= telvmemdebug_malloc(8, "boundary", 1) != nullptr || errno != ENOMEM ? 16 : 0;
        ::_exit(wrong);
    });
#endif
}

// A process that ends while memory is short, with blocks live and their report asked for, still
// ends normally.
TEST_F(PlatformBoundary, TheLeakReportAtExitWithoutMemoryIsSkipped) {
#ifdef TARN_SANITIZED
    GTEST_SKIP() << "the sanitizers' shadow memory needs an address space without a cap";
#else
    set_variable("TELV_MEMDEBUG_REPORT", "1");
    void *live = telvmemdebug_malloc(24, "boundary", 1);
    expect_normal_end_short_of_memory([] {
        exhaust_at_exit = true;
        std::exit(0);
    });
    telvmemdebug_free(live, "boundary", 2);
#endif
}

} // namespace

// The pointer check and the debugging allocator of the default platform.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <sys/mman.h>
#include <unistd.h>

#include "memsvc.h"
#include "platform_test_support.h"
#include "telvmemdebug.h"

namespace {

using platform_test::read_file;

size_t page() {
    return static_cast<size_t>(::sysconf(_SC_PAGESIZE));
}

// Pages of private anonymous memory, unmapped again at the end of the test.
struct Pages {
    explicit Pages(size_t count) : size(count * page()) {
        void *mapped =
            ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        base = mapped == MAP_FAILED ? nullptr : static_cast<char *>(mapped);
    }
    ~Pages() {
        if (base != nullptr) {
            ::munmap(base, size);
        }
    }
    char *at(size_t index) const { return base + index * page(); }
    size_t size;
    char *base;
};

using PlatformPointerCheck = platform_test::PlatformTest;

TEST_F(PlatformPointerCheck, AcceptsAStackVariableAndAHeapBlock) {
    int on_stack[16] = {};
    EXPECT_EQ(memsvc_ckptr(on_stack, sizeof on_stack), 0u);
    void *block = std::malloc(1000);
    EXPECT_EQ(memsvc_ckptr(block, 1000), 0u);
    std::free(block);
}

TEST_F(PlatformPointerCheck, RefusesNull) {
    EXPECT_NE(memsvc_ckptr(nullptr, 4), 0u);
    EXPECT_NE(memsvc_ckptr(nullptr, 0), 0u);
}

TEST_F(PlatformPointerCheck, RefusesAnUnmappedPage) {
    Pages pages(2);
    ASSERT_NE(pages.base, nullptr);
    ASSERT_EQ(::munmap(pages.at(1), page()), 0);
    pages.size = page();
    EXPECT_EQ(memsvc_ckptr(pages.at(0), static_cast<uint32_t>(page())), 0u);
    EXPECT_NE(memsvc_ckptr(pages.at(1), 1), 0u);
    EXPECT_NE(memsvc_ckptr(pages.at(1), 0), 0u);
    // A range that runs one byte past the mapping.
    EXPECT_NE(memsvc_ckptr(pages.at(0), static_cast<uint32_t>(page() + 1)), 0u);
    EXPECT_EQ(memsvc_ckptr(pages.at(1) - 1, 1), 0u);
}

TEST_F(PlatformPointerCheck, RefusesReadOnlyAndInaccessibleMemory) {
    Pages pages(3);
    ASSERT_NE(pages.base, nullptr);
    ASSERT_EQ(::mprotect(pages.at(1), page(), PROT_READ), 0);
    ASSERT_EQ(::mprotect(pages.at(2), page(), PROT_NONE), 0);
    EXPECT_EQ(memsvc_ckptr(pages.at(0), static_cast<uint32_t>(page())), 0u);
    EXPECT_NE(memsvc_ckptr(pages.at(1), 8), 0u);
    EXPECT_NE(memsvc_ckptr(pages.at(2), 8), 0u);
    EXPECT_NE(memsvc_ckptr(pages.at(1) - 4, 8), 0u);
}

TEST_F(PlatformPointerCheck, RefusesCode) {
    EXPECT_NE(memsvc_ckptr(reinterpret_cast<const void *>(&memsvc_ckptr), 4), 0u);
}

TEST_F(PlatformPointerCheck, AcceptsARangeOverAdjacentReadWriteMappings) {
    Pages pages(3);
    ASSERT_NE(pages.base, nullptr);
    // Different protection on the middle page splits the area into three mappings, all of them
    // readable and writable.
    ASSERT_EQ(::mprotect(pages.at(1), page(), PROT_READ | PROT_WRITE | PROT_EXEC), 0);
    EXPECT_EQ(memsvc_ckptr(pages.at(0), static_cast<uint32_t>(3 * page())), 0u);
    EXPECT_EQ(memsvc_ckptr(pages.at(1) - 1, 2), 0u);
}

TEST_F(PlatformPointerCheck, RefusesARangeThatWrapsAround) {
    auto *top = reinterpret_cast<const void *>(UINTPTR_MAX - 10);
    EXPECT_NE(memsvc_ckptr(top, 100), 0u);
    EXPECT_NE(memsvc_ckptr(top, 11), 0u);
    int on_stack = 0;
    EXPECT_NE(memsvc_ckptr(&on_stack, UINT32_MAX), 0u);
}

TEST_F(PlatformPointerCheck, ZeroLengthChecksTheByteAtThePointer) {
    int on_stack = 0;
    EXPECT_EQ(memsvc_ckptr(&on_stack, 0), 0u);
    EXPECT_NE(memsvc_ckptr(reinterpret_cast<const void *>(&memsvc_ckptr), 0), 0u);
}

TEST_F(PlatformPointerCheck, TheCheckDoesNotChangeMemory) {
    char text[] = "unchanged";
    EXPECT_EQ(memsvc_ckptr(text, sizeof text), 0u);
    EXPECT_STREQ(text, "unchanged");
}

using PlatformAllocator = platform_test::PlatformTest;

TEST_F(PlatformAllocator, BlocksAreUsableAndCallocClears) {
    auto *bytes = static_cast<unsigned char *>(telvmemdebug_calloc(64, 4, "alloc_test", 1));
    ASSERT_NE(bytes, nullptr);
    for (int i = 0; i < 256; ++i) {
        ASSERT_EQ(bytes[i], 0) << i;
    }
    auto *text = static_cast<char *>(telvmemdebug_malloc(32, "alloc_test", 2));
    ASSERT_NE(text, nullptr);
    std::strcpy(text, "LinMonitor");
    EXPECT_EQ(memsvc_ckptr(text, 32), 0u);
    telvmemdebug_free(text, "alloc_test", 3);
    telvmemdebug_free(bytes, "alloc_test", 4);
}

TEST_F(PlatformAllocator, ZeroSizedRequestsGiveDistinctBlocks) {
    void *first = telvmemdebug_malloc(0, "alloc_test", 1);
    void *second = telvmemdebug_calloc(0, 8, "alloc_test", 2);
    ASSERT_NE(first, nullptr);
    ASSERT_NE(second, nullptr);
    EXPECT_NE(first, second);
    telvmemdebug_free(first, "alloc_test", 3);
    telvmemdebug_free(second, "alloc_test", 4);
}

TEST_F(PlatformAllocator, CallocOverflowGivesNull) {
    EXPECT_EQ(telvmemdebug_calloc(SIZE_MAX / 2 + 1, 2, "alloc_test", 1), nullptr);
    EXPECT_EQ(telvmemdebug_calloc(2, SIZE_MAX / 2 + 1, "alloc_test", 2), nullptr);
    EXPECT_EQ(telvmemdebug_calloc(SIZE_MAX, SIZE_MAX, "alloc_test", 3), nullptr);
}

TEST_F(PlatformAllocator, FreeOfNullIsNothing) {
    telvmemdebug_free(nullptr, "alloc_test", 1);
    EXPECT_FALSE(platform_test::exists(trace_path()));
}

TEST_F(PlatformAllocator, FreeOfAForeignOrFreedBlockIsTracedAndLeftAlone) {
    int on_stack = 7;
    telvmemdebug_free(&on_stack, "alloc_test", 41);
    EXPECT_EQ(on_stack, 7);
    void *block = telvmemdebug_malloc(8, "alloc_test", 42);
    telvmemdebug_free(block, "alloc_test", 43);
    telvmemdebug_free(block, "alloc_test", 44);
    char foreign[128];
    char repeated[128];
    std::snprintf(foreign, sizeof foreign,
                  " TELVMEMF: free of %p from alloc_test:41, which is no live block\n",
                  static_cast<void *>(&on_stack));
    std::snprintf(repeated, sizeof repeated,
                  " TELVMEMF: free of %p from alloc_test:44, which is no live block\n", block);
    std::string trace = read_file(trace_path());
    EXPECT_NE(trace.find(foreign), std::string::npos) << trace;
    EXPECT_NE(trace.find(repeated), std::string::npos) << trace;
    EXPECT_EQ(trace.find("alloc_test:43"), std::string::npos);
}

TEST_F(PlatformAllocator, LiveBlocksAreReportedAtExitWhenAsked) {
    platform_test::ChildResult child =
        platform_test::run_child(TELV_TEST_LEAKER, {}, {"TELV_MEMDEBUG_REPORT=1"});
    EXPECT_EQ(child.exit_status, 0);
    EXPECT_EQ(child.err, "TELVMEMF: leak of 100 bytes from another.cpp:7\n"
                         "TELVMEMF: leak of 24 bytes from leaker.cpp:11\n");
    std::string trace = read_file(trace_path());
    EXPECT_NE(trace.find(" TELVMEMF: leak of 100 bytes from another.cpp:7\n"), std::string::npos);
    EXPECT_NE(trace.find(" TELVMEMF: leak of 24 bytes from leaker.cpp:11\n"), std::string::npos);
    EXPECT_EQ(trace.find("leaker.cpp:12"), std::string::npos);
}

TEST_F(PlatformAllocator, NoReportUnlessAsked) {
    platform_test::ChildResult child = platform_test::run_child(TELV_TEST_LEAKER, {}, {});
    EXPECT_EQ(child.exit_status, 0);
    EXPECT_EQ(child.err, "");
    child = platform_test::run_child(TELV_TEST_LEAKER, {}, {"TELV_MEMDEBUG_REPORT=0"});
    EXPECT_EQ(child.err, "");
    EXPECT_FALSE(platform_test::exists(trace_path()));
}

} // namespace

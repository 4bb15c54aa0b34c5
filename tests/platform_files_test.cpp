// The data-file service of the default platform: named files in the data directory.
#include <cerrno>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <thread>
#include <vector>

#include "filesvc.h"
#include "platform_test_support.h"

namespace {

using platform_test::read_file;

class PlatformDataFiles : public platform_test::PlatformTest {
  protected:
    filesvc_handle_t open_file(const char *name, uint32_t open_mode = FILESVC_OPEN_OR_CREATE,
                               uint32_t access = FILESVC_ACCESS_READ_WRITE) {
        filesvc_handle_t handle = 0;
        uint32_t info = 77;
        uint32_t crc = 77;
        EXPECT_EQ(filesvc_search_file_open(name, open_mode, access, 0, 0, &handle, &info, &crc),
                  0u);
        EXPECT_EQ(crc, 0u);
        EXPECT_EQ(info, 0u);
        return handle;
    }
    void write(filesvc_handle_t handle, const std::string &text, uint32_t mode, uint32_t offset) {
        uint32_t written = 0;
        uint32_t info = 77;
        uint32_t crc = 77;
        ASSERT_EQ(filesvc_random_write(handle, text.data(), static_cast<uint32_t>(text.size()),
                                       mode, offset, &written, &info, &crc),
                  0u);
        EXPECT_EQ(written, text.size());
        EXPECT_EQ(crc, 0u);
        EXPECT_EQ(info, 0u);
    }
    std::string read(filesvc_handle_t handle, uint32_t length, uint32_t offset) {
        std::string buffer(length, '\0');
        uint32_t got = 0;
        uint32_t info = 77;
        uint32_t crc = 77;
        EXPECT_EQ(filesvc_random_read(handle, buffer.data(), length, FILESVC_AT_OFFSET, offset,
                                      &got, &info, &crc),
                  0u);
        EXPECT_EQ(crc, 0u);
        EXPECT_EQ(info, 0u);
        buffer.resize(got);
        return buffer;
    }
    void close(filesvc_handle_t handle) {
        uint32_t crc = 77;
        EXPECT_EQ(filesvc_close_file(handle, &crc), 0u);
        EXPECT_EQ(crc, 0u);
    }
};

TEST_F(PlatformDataFiles, AppendsThenWritesAtAnOffsetAndReadsBack) {
    filesvc_handle_t handle = open_file("telvzmnd.trm");
    write(handle, "hello", FILESVC_APPEND, 0);
    write(handle, " world", FILESVC_APPEND, 999); // the offset of an append is ignored
    write(handle, "J", FILESVC_AT_OFFSET, 0);
    EXPECT_EQ(read(handle, 100, 0), "Jello world");
    EXPECT_EQ(read(handle, 5, 6), "world");
    EXPECT_EQ(read(handle, 10, 11), "");
    close(handle);
    EXPECT_EQ(read_file(dir + "/telvzmnd.trm"), "Jello world");
}

TEST_F(PlatformDataFiles, WriteAtAnOffsetPastTheEndLeavesZerosBetween) {
    filesvc_handle_t handle = open_file("gap");
    write(handle, "ab", FILESVC_AT_OFFSET, 0);
    write(handle, "z", FILESVC_AT_OFFSET, 4);
    close(handle);
    EXPECT_EQ(read_file(dir + "/gap"), std::string("ab\0\0z", 5));
}

TEST_F(PlatformDataFiles, QueriesTheSizeOfAFile) {
    filesvc_handle_t handle = open_file("sized");
    write(handle, std::string(1234, 'x'), FILESVC_APPEND, 0);
    close(handle);
    uint32_t size = 0;
    uint32_t crc = 77;
    EXPECT_EQ(filesvc_query_file_size("sized", &size, &crc), 0u);
    EXPECT_EQ(size, 1234u);
    EXPECT_EQ(crc, 0u);
}

TEST_F(PlatformDataFiles, SizeOfAMissingFileFailsWithEnoent) {
    uint32_t size = 55;
    uint32_t crc = 0;
    EXPECT_NE(filesvc_query_file_size("telvzdu.trm", &size, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOENT));
    EXPECT_EQ(size, 55u);
}

TEST_F(PlatformDataFiles, OpenOfAMissingFileThatMustExistFails) {
    filesvc_handle_t handle = 0;
    uint32_t info = 77;
    uint32_t crc = 0;
    EXPECT_NE(filesvc_search_file_open("telvzopt.trm", FILESVC_OPEN_EXISTING, FILESVC_ACCESS_READ,
                                       1, 64, &handle, &info, &crc),
              0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOENT));
    EXPECT_EQ(info, 0u);
    EXPECT_FALSE(platform_test::exists(dir + "/telvzopt.trm"));
}

TEST_F(PlatformDataFiles, DeletesAFileAndFailsForAMissingOne) {
    close(open_file("doomed"));
    uint32_t crc = 77;
    EXPECT_EQ(filesvc_delete_file("doomed", &crc), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_FALSE(platform_test::exists(dir + "/doomed"));
    EXPECT_NE(filesvc_delete_file("doomed", &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOENT));
}

TEST_F(PlatformDataFiles, CloseOfABadHandleFails) {
    uint32_t crc = 0;
    EXPECT_NE(filesvc_close_file(0, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EBADF));
    crc = 0;
    EXPECT_NE(filesvc_close_file(123456, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EBADF));
    filesvc_handle_t handle = open_file("twice");
    close(handle);
    crc = 0;
    EXPECT_NE(filesvc_close_file(handle, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EBADF));
}

TEST_F(PlatformDataFiles, ReadAndWriteThroughABadHandleFail) {
    char buffer[4] = {};
    uint32_t count = 9;
    uint32_t info = 77;
    uint32_t crc = 0;
    EXPECT_NE(filesvc_random_read(987, buffer, 4, FILESVC_AT_OFFSET, 0, &count, &info, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EBADF));
    EXPECT_EQ(info, 0u);
    crc = 0;
    EXPECT_NE(filesvc_random_write(987, buffer, 4, FILESVC_APPEND, 0, &count, &info, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EBADF));
}

TEST_F(PlatformDataFiles, WriteThroughAReadOnlyHandleFails) {
    close(open_file("readonly"));
    filesvc_handle_t handle = open_file("readonly", FILESVC_OPEN_EXISTING, FILESVC_ACCESS_READ);
    uint32_t written = 9;
    uint32_t info = 77;
    uint32_t crc = 0;
    EXPECT_NE(filesvc_random_write(handle, "x", 1, FILESVC_APPEND, 0, &written, &info, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EBADF));
    close(handle);
    EXPECT_EQ(read_file(dir + "/readonly"), "");
}

TEST_F(PlatformDataFiles, NamesThatCouldLeaveTheDirectoryAreRefused) {
    for (const char *name : {"../escape", "sub/file", "/etc/passwd", "..", ".", ""}) {
        filesvc_handle_t handle = 0;
        uint32_t info = 77;
        uint32_t crc = 0;
        EXPECT_NE(filesvc_search_file_open(name, FILESVC_OPEN_OR_CREATE, FILESVC_ACCESS_READ_WRITE,
                                           0, 0, &handle, &info, &crc),
                  0u)
            << name;
        EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL)) << name;
        uint32_t size = 0;
        crc = 0;
        EXPECT_NE(filesvc_query_file_size(name, &size, &crc), 0u) << name;
        EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL)) << name;
        crc = 0;
        EXPECT_NE(filesvc_delete_file(name, &crc), 0u) << name;
        EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL)) << name;
    }
    uint32_t crc = 0;
    filesvc_handle_t handle = 0;
    EXPECT_NE(filesvc_search_file_open(nullptr, FILESVC_OPEN_OR_CREATE, FILESVC_ACCESS_READ_WRITE,
                                       0, 0, &handle, nullptr, &crc),
              0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    EXPECT_FALSE(platform_test::exists(dir + "/../escape"));
}

TEST_F(PlatformDataFiles, UnknownOpenModeAccessAndWriteModeAreRefused) {
    filesvc_handle_t handle = 0;
    uint32_t crc = 0;
    EXPECT_NE(
        filesvc_search_file_open("odd", 5, FILESVC_ACCESS_READ_WRITE, 0, 0, &handle, nullptr, &crc),
        0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    crc = 0;
    EXPECT_NE(
        filesvc_search_file_open("odd", FILESVC_OPEN_OR_CREATE, 3, 0, 0, &handle, nullptr, &crc),
        0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    handle = open_file("odd");
    uint32_t written = 0;
    crc = 0;
    EXPECT_NE(filesvc_random_write(handle, "x", 1, 1, 0, &written, nullptr, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    close(handle);
}

TEST_F(PlatformDataFiles, TheDataDirectoryIsCreatedWithItsParents) {
    mode_t old_mask = ::umask(022);
    std::string nested = dir + "/one/two/three";
    platform_test::set_variable("TELV_DATA_DIR", nested);
    close(open_file("fresh"));
    ::umask(old_mask);
    struct stat st;
    ASSERT_EQ(::stat(nested.c_str(), &st), 0);
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(st.st_mode & 0777, 0755u);
    ASSERT_EQ(::stat((dir + "/one").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0755u);
    EXPECT_TRUE(platform_test::exists(nested + "/fresh"));
}

TEST_F(PlatformDataFiles, ADataDirectoryThatCannotBeMadeFailsEveryNamedCall) {
    close(open_file("plain"));
    platform_test::set_variable("TELV_DATA_DIR", dir + "/plain/below");
    filesvc_handle_t handle = 0;
    uint32_t crc = 0;
    EXPECT_NE(filesvc_search_file_open("x", FILESVC_OPEN_OR_CREATE, FILESVC_ACCESS_READ_WRITE, 0, 0,
                                       &handle, nullptr, &crc),
              0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOTDIR));
    uint32_t size = 0;
    crc = 0;
    EXPECT_NE(filesvc_query_file_size("x", &size, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOTDIR));
    crc = 0;
    EXPECT_NE(filesvc_delete_file("x", &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOTDIR));
}

TEST_F(PlatformDataFiles, AFreedHandleIsGivenOutAgain) {
    filesvc_handle_t first = open_file("a");
    filesvc_handle_t second = open_file("b");
    EXPECT_NE(first, second);
    close(first);
    filesvc_handle_t third = open_file("c");
    EXPECT_EQ(third, first);
    close(second);
    close(third);
}

TEST_F(PlatformDataFiles, AppendsThroughTwoHandlesAtOnceLoseNothing) {
    constexpr int APPENDS = 2000;
    const std::string lines[2] = {std::string(63, 'a') + "\n", std::string(63, 'b') + "\n"};
    filesvc_handle_t handles[2] = {open_file("shared"), open_file("shared")};
    std::vector<std::thread> writers;
    for (int w = 0; w < 2; ++w) {
        writers.emplace_back([&, w] {
            for (int i = 0; i < APPENDS; ++i) {
                uint32_t written = 0, info = 0, crc = 0;
                filesvc_random_write(handles[w], lines[w].data(), 64, FILESVC_APPEND, 0, &written,
                                     &info, &crc);
            }
        });
    }
    for (auto &writer : writers) {
        writer.join();
    }
    std::string text = read_file(dir + "/shared");
    ASSERT_EQ(text.size(), 2u * APPENDS * 64);
    for (size_t at = 0; at < text.size(); at += 64) {
        std::string_view line(text.data() + at, 64);
        ASSERT_TRUE(line == lines[0] || line == lines[1]) << "torn line at " << at;
    }
    close(handles[0]);
    close(handles[1]);
}

} // namespace

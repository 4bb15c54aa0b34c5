// The module service of the default platform over the dynamic loader.
#include <cerrno>
#include <dlfcn.h>
#include <string>

#include "modsvc.h"
#include "platform_test_support.h"

namespace {

using platform_test::read_file;
using platform_test::set_variable;

constexpr const char *MODULE = "telvtestmodule";
constexpr const char *FUNCTION = "telv_test_module_answer";
constexpr const char *LIBRARY = TELV_TEST_MODULE_DIR "/libtelvtestmodule.so";

using Answer = int (*)(int);

// Marks the out-values, so that a call that leaves them alone is seen.
void *const UNTOUCHED = reinterpret_cast<void *>(0x5A5A);

class PlatformModules : public platform_test::PlatformTest {
  protected:
    void SetUp() override {
        PlatformTest::SetUp();
        set_variable("TELV_MODULE_PATH", TELV_TEST_MODULE_DIR);
    }
    // Expects a failure with `error`, both out-values null afterwards.
    void expect_failure(const char *module, const char *function, uint32_t error) {
        void *address = UNTOUCHED;
        void *handle = UNTOUCHED;
        uint32_t crc = 0;
        EXPECT_NE(modsvc_get_func_addr2(module, function, &address, &handle, &crc), 0u);
        EXPECT_EQ(crc, error);
        EXPECT_EQ(address, nullptr);
        EXPECT_EQ(handle, nullptr);
    }
};

bool loaded() {
    void *probe = ::dlopen(LIBRARY, RTLD_NOW | RTLD_NOLOAD);
    if (probe != nullptr) {
        ::dlclose(probe);
    }
    return probe != nullptr;
}

TEST_F(PlatformModules, ResolvesAFunctionOfAModuleOnTheModulePath) {
    void *address = nullptr;
    void *handle = nullptr;
    uint32_t crc = 77;
    ASSERT_EQ(modsvc_get_func_addr2(MODULE, FUNCTION, &address, &handle, &crc), 0u);
    EXPECT_EQ(crc, 0u);
    ASSERT_NE(address, nullptr);
    EXPECT_NE(handle, nullptr);
    EXPECT_EQ(reinterpret_cast<Answer>(address)(20), 41);
    EXPECT_TRUE(loaded());
    crc = 77;
    EXPECT_EQ(modsvc_release_func_addr(FUNCTION, handle, &crc), 0u);
    EXPECT_EQ(crc, 0u);
    EXPECT_FALSE(loaded());
}

TEST_F(PlatformModules, SearchesEveryDirectoryOfTheModulePathInOrder) {
    set_variable("TELV_MODULE_PATH", dir + "/empty::" + TELV_TEST_MODULE_DIR);
    void *address = nullptr;
    void *handle = nullptr;
    uint32_t crc = 77;
    ASSERT_EQ(modsvc_get_func_addr2(MODULE, FUNCTION, &address, &handle, &crc), 0u);
    EXPECT_EQ(reinterpret_cast<Answer>(address)(1), 3);
    EXPECT_EQ(modsvc_release_func_addr(FUNCTION, handle, &crc), 0u);
}

TEST_F(PlatformModules, ResolvingTwiceHoldsTheModuleUntilBothAreReleased) {
    void *address = nullptr;
    void *first = nullptr;
    void *second = nullptr;
    uint32_t crc = 0;
    ASSERT_EQ(modsvc_get_func_addr2(MODULE, FUNCTION, &address, &first, &crc), 0u);
    ASSERT_EQ(modsvc_get_func_addr2(MODULE, FUNCTION, &address, &second, &crc), 0u);
    EXPECT_EQ(modsvc_release_func_addr(FUNCTION, first, &crc), 0u);
    EXPECT_TRUE(loaded());
    EXPECT_EQ(modsvc_release_func_addr(FUNCTION, second, &crc), 0u);
    EXPECT_FALSE(loaded());
}

TEST_F(PlatformModules, AMissingModuleFailsCleanly) {
    expect_failure("telvnosuchmodule", FUNCTION, ELIBACC);
    EXPECT_NE(read_file(trace_path())
                  .find(" TELVMODF: module telvnosuchmodule not loaded: libtelvnosuchmodule.so: "),
              std::string::npos);
}

TEST_F(PlatformModules, WithoutTheModulePathTheLoaderSearchesAsUsual) {
    ::unsetenv("TELV_MODULE_PATH");
    expect_failure(MODULE, FUNCTION, ELIBACC);
}

TEST_F(PlatformModules, AMissingFunctionFailsCleanlyAndReleasesTheModule) {
    expect_failure(MODULE, "telv_no_such_function", ENOENT);
    EXPECT_FALSE(loaded());
    EXPECT_NE(
        read_file(trace_path())
            .find(" TELVMODF: function telv_no_such_function not found in module telvtestmodule\n"),
        std::string::npos);
}

TEST_F(PlatformModules, ABadArgumentIsRefused) {
    expect_failure(nullptr, FUNCTION, EINVAL);
    expect_failure("", FUNCTION, EINVAL);
    expect_failure("../tests/telvtestmodule", FUNCTION, EINVAL);
    expect_failure("/usr/lib/x", FUNCTION, EINVAL);
    expect_failure(std::string(241, 'm').c_str(), FUNCTION, EINVAL);
    expect_failure(MODULE, nullptr, EINVAL);
    expect_failure(MODULE, "", EINVAL);
    uint32_t crc = 0;
    void *handle = nullptr;
    EXPECT_NE(modsvc_get_func_addr2(MODULE, FUNCTION, nullptr, &handle, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    void *address = nullptr;
    crc = 0;
    EXPECT_NE(modsvc_get_func_addr2(MODULE, FUNCTION, &address, nullptr, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    EXPECT_FALSE(loaded());
}

TEST_F(PlatformModules, AHandleNotHeldIsNotReleased) {
    uint32_t crc = 0;
    EXPECT_NE(modsvc_release_func_addr(FUNCTION, nullptr, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    int not_a_handle = 0;
    crc = 0;
    EXPECT_NE(modsvc_release_func_addr(FUNCTION, &not_a_handle, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    void *address = nullptr;
    void *handle = nullptr;
    ASSERT_EQ(modsvc_get_func_addr2(MODULE, FUNCTION, &address, &handle, &crc), 0u);
    EXPECT_EQ(modsvc_release_func_addr(nullptr, handle, &crc), 0u);
    crc = 0;
    EXPECT_NE(modsvc_release_func_addr(FUNCTION, handle, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
}

} // namespace

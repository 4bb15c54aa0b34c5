// Makes the build's folders known to every test program as environment variables, so that a test
// and the programs it starts find the built binaries and the sources.
#include <cstdlib>

namespace {

struct test_paths {
    test_paths() {
        setenv("TARN_TEST_BINARY_DIR", TARN_TEST_BINARY_DIR, 0);
        setenv("TARN_BUILD_DIR", TARN_BUILD_DIR, 0);
        setenv("TARN_SOURCE_DIR", TARN_SOURCE_DIR, 0);
    }
} const paths;

} // namespace

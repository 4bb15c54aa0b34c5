// The example control file that the project ships, and the changes the tests of the commands
// make to it one setting at a time.
#pragma once

#include <cstdlib>
#include <fstream>
#include <gtest/gtest.h>
#include <sstream>
#include <string>

namespace example {

inline std::string path() {
    const char *sources = std::getenv("TARN_SOURCE_DIR");
    return std::string(sources != nullptr ? sources : ".") + "/examples/telvzopt.trm";
}

inline std::string text() {
    std::ifstream in(path(), std::ios::binary);
    std::ostringstream contents;
    contents << in.rdbuf();
    return contents.str();
}

// The example with the line that begins with `keyword` replaced by `replacement` (removed when
// empty). A keyword the example does not set fails the test.
inline std::string with(const std::string &keyword, const std::string &replacement) {
    std::string contents = text();
    size_t at = contents.find("\n" + keyword + " ");
    if (at == std::string::npos) {
        at = contents.find("\n" + keyword + "\n");
    }
    if (at == std::string::npos) {
        ADD_FAILURE() << "the example sets no " << keyword;
        return contents;
    }
    size_t end = contents.find('\n', at + 1);
    contents.replace(at + 1, end - at, replacement.empty() ? "" : replacement + "\n");
    return contents;
}

} // namespace example

// What the tests of the loop over the default platform share: one pass of the built monitor as a
// host asks for it, whether a module is loaded, and a text as the trace shows it.
#pragma once

#include <cstdint>
#include <dlfcn.h>
#include <string>
#include <vector>

#include "core/monitor_loop.h"

namespace monitor_on_the_platform {

// The monitor for one pass, with a sixty-second interval and a third argument.
inline uint32_t run_once() {
    std::vector<std::string> words = {"telvzmnd", "60", "once"};
    std::vector<char *> argv;
    for (std::string &word : words) {
        argv.push_back(word.data());
    }
    argv.push_back(nullptr);
    return tarn_mon_main(static_cast<int32_t>(words.size()), argv.data());
}

// Whether the module at `path` is loaded in this process now.
inline bool loaded(const std::string &path) {
    void *handle = dlopen(path.c_str(), RTLD_LAZY | RTLD_NOLOAD);
    if (handle != nullptr) {
        dlclose(handle);
    }
    return handle != nullptr;
}

// `text` as a trace line shows it: line feed and carriage return as "\n" and "\r".
inline std::string as_traced(const std::string &text) {
    std::string traced;
    for (char c : text) {
        traced += c == '\n' ? "\\n" : c == '\r' ? "\\r" : std::string(1, c);
    }
    return traced;
}

} // namespace monitor_on_the_platform

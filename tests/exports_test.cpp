// What the built libtelvzmnd.so shows the dynamic linker: exactly the entry points marked
// TARN_EXPORT in the sources, every platform service left undefined, and libtelvplatform.so needed.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <regex>
#include <set>
#include <sstream>
#include <string>

namespace {

std::string env(const char *name) {
    const char *value = std::getenv(name);
    return value != nullptr ? value : "";
}

std::string library() {
    return env("TARN_BUILD_DIR") + "/libtelvzmnd.so";
}

std::string run(const std::string &command) {
    std::string output;
    FILE *pipe = popen(command.c_str(), "r");
    if (pipe == nullptr) {
        return output;
    }
    char buffer[4096];
    size_t n;
    while ((n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0) {
        output.append(buffer, n);
    }
    EXPECT_EQ(pclose(pipe), 0) << command;
    return output;
}

// Symbol names of `nm -D` output lines of the given kinds.
std::set<std::string> dynamic_symbols(const std::string &options) {
    std::set<std::string> names;
    std::istringstream lines(run("nm -D " + options + " " + library()));
    std::string line;
    while (std::getline(lines, line)) {
        std::istringstream fields(line);
        std::vector<std::string> words;
        std::string word;
        while (fields >> word) {
            words.push_back(word);
        }
        if (words.empty()) {
            continue;
        }
        std::string name = words.back();
#ifdef TARN_SANITIZED
        // The undefined-behaviour sanitizer checks calls through function pointers with type
        // information that it adds, visible, to the library; the library itself has none.
        if (name.starts_with("_ZTI") || name.starts_with("_ZTS")) {
            continue;
        }
#endif
        names.insert(name.substr(0, name.find('@')));
    }
    return names;
}

std::string read_file(const std::filesystem::path &path) {
    std::ifstream in(path);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

// Names declared or defined after the marker in the files below `folder`.
std::set<std::string> names_after(const std::string &folder, const std::regex &pattern,
                                  const std::set<std::string> &endings) {
    std::set<std::string> names;
    for (const auto &entry : std::filesystem::recursive_directory_iterator(folder)) {
        if (!endings.contains(entry.path().extension().string())) {
            continue;
        }
        std::string text = read_file(entry.path());
        for (std::sregex_iterator it(text.begin(), text.end(), pattern), end; it != end; ++it) {
            names.insert((*it)[1]);
        }
    }
    return names;
}

std::set<std::string> marked_entry_points() {
    // A line that starts with the mark, so that the macro's own definition does not count.
    static const std::regex marked(R"((?:^|\n)[ \t]*TARN_EXPORT\s+[^;{(]*?\b(\w+)\s*\()");
    return names_after(env("TARN_SOURCE_DIR") + "/src/telvzmnd", marked, {".h", ".cpp"});
}

std::set<std::string> platform_services() {
    static const std::regex declared(
        R"(\b((?:filesvc|tracesvc|logsvc|jcb|modsvc|memsvc|telvmemdebug)\w*)\s*\()");
    return names_after(env("TARN_SOURCE_DIR") + "/src/platform", declared, {".h"});
}

TEST(Exports, OnlyTheMarkedEntryPointsLeaveTheLibrary) {
    std::set<std::string> defined = dynamic_symbols("--defined-only");
    std::set<std::string> marked = marked_entry_points();
    EXPECT_EQ(defined, marked);
    for (const char *core :
         {"tarn_init", "tarn_init_tarn_cb_ptr", "tarn_override_table_lock_control",
          "tarn_terminate_monitoring", "tarn_mon_error_handler", "tarn_mon_error_handler_p"}) {
        EXPECT_TRUE(defined.contains(core)) << core;
    }
}

TEST(Exports, TheSwitchesOfOtherPartiesLeaveTheLibrary) {
    std::set<std::string> defined = dynamic_symbols("--defined-only");
    for (const char *entry :
         {"tarn_enable_cpu_alerts", "tarn_disable_cpu_alerts", "tarn_trigger_cpu_alert04",
          "tarn_set_logging_type", "java_set_logging_type"}) {
        EXPECT_TRUE(defined.contains(entry)) << entry;
    }
    // The library calls the Java bridge; the platform defines it.
    std::set<std::string> undefined = dynamic_symbols("--undefined-only");
    for (const char *bridge : {"jcbGetBooleanArgument", "jcbGetLastErrorMessage",
                               "jcbSetNativeFunctionError", "jcbSetVoidResult"}) {
        EXPECT_TRUE(undefined.contains(bridge)) << bridge;
    }
}

TEST(Exports, PlatformServicesStayUndefined) {
    std::set<std::string> services = platform_services();
    ASSERT_GE(services.size(), 20u);
    std::set<std::string> defined = dynamic_symbols("--defined-only");
    std::set<std::string> undefined = dynamic_symbols("--undefined-only");
    for (const auto &service : services) {
        EXPECT_FALSE(defined.contains(service)) << service;
    }
    for (const char *used :
         {"tracesvc_trace", "logsvc_microcode_log", "telvmemdebug_malloc", "telvmemdebug_free"}) {
        EXPECT_TRUE(undefined.contains(used)) << used;
    }
}

TEST(Exports, TheDefaultPlatformIsNeeded) {
    std::string dynamic = run("readelf -d " + library());
    EXPECT_NE(dynamic.find("Shared library: [libtelvplatform.so]"), std::string::npos) << dynamic;
}

TEST(Exports, ThePlatformExportsEveryServiceItImplements) {
    std::string platform = env("TARN_BUILD_DIR") + "/libtelvplatform.so";
    std::string symbols = run("nm -D --defined-only " + platform);
    for (const char *service :
         {"filesvc_search_file_open", "filesvc_random_read", "filesvc_random_write",
          "filesvc_query_file_size", "filesvc_delete_file", "filesvc_close_file", "tracesvc_trace",
          "tracesvc_dump_bytes", "tracesvc_getpid", "logsvc_microcode_log", "modsvc_get_func_addr2",
          "modsvc_release_func_addr", "memsvc_ckptr", "telvmemdebug_malloc", "telvmemdebug_calloc",
          "telvmemdebug_free"}) {
        EXPECT_NE(symbols.find(std::string(" ") + service + "\n"), std::string::npos) << service;
    }
}

} // namespace

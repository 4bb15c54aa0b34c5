#include "support/monitor_setup.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <sched.h>
#include <string>

#include "core/control_block.h"
#include "core/control_file.h"
#include "core/settings.h"
#include "data_blocks.h"

bool enter_private_ipc() {
    if (unshare(CLONE_NEWIPC) != 0) {
        std::fprintf(stderr, "an IPC namespace of its own is needed (run as root): %s\n",
                     std::strerror(errno));
        return false;
    }
    return true;
}

void use_temporary_data_dir() {
    static char data_dir[] = "/tmp/tarn-bench-XXXXXX";
    if (std::getenv("TELV_DATA_DIR") == nullptr && mkdtemp(data_dir) != nullptr) {
        setenv("TELV_DATA_DIR", data_dir, 1);
    }
}

bool load_example_control_file() {
    std::ifstream in(std::string(TARN_SOURCE_DIR) + "/examples/telvzopt.trm", std::ios::binary);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (text.empty()) {
        return false;
    }
    settings_start_values();
    uint32_t crc = 0;
    tarn_parse_control_file(text.c_str(), &crc);
    return true;
}

bool write_long_run_control_file(const std::string &path) {
    std::ifstream in(std::string(TARN_SOURCE_DIR) + "/examples/telvzopt.trm", std::ios::binary);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    auto replace = [&text](const std::string &keyword, const std::string &value) {
        size_t at = text.find("\n" + keyword + " ");
        if (at == std::string::npos) {
            return false;
        }
        size_t end = text.find('\n', at + 1);
        text.replace(at + 1, end - at - 1, keyword + " " + value);
        return true;
    };
    bool replaced =
        replace("RSS_MEMORY_THRESHOLD", std::to_string(RSS_OUT_OF_REACH)) &&
        replace("RSS_ABORT_MEMORY_THRESHOLD", "0") &&
        replace("CPU_PERCENT_THRESHOLD_QV", std::to_string(APPLIANCE_CPU_OUT_OF_REACH)) &&
        replace("TREND_ANALYSIS_NUM_INCREASES", std::to_string(TREND_SAMPLES));
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << text;
    return replaced && out.good();
}

bool set_up_monitor() {
    if (!enter_private_ipc()) {
        return false;
    }
    use_temporary_data_dir();
    uint32_t crc = 0;
    if (!load_example_control_file() || tarn_init(&crc) != 0) {
        std::fprintf(stderr, "cannot set up the monitor: control file or control block\n");
        return false;
    }
    return true;
}

void start_pass() {
    start_pass_data();
}

std::vector<char *> unless_named(int argc, char **argv, const char *name) {
    static std::string excluded;
    excluded = std::string("--benchmark_filter=-") + name;
    std::vector<char *> arguments(argv, argv + argc);
    bool filtered = false;
    for (int i = 1; i < argc; ++i) {
        filtered = filtered || std::strncmp(argv[i], "--benchmark_filter", 18) == 0;
    }
    if (!filtered) {
        arguments.push_back(excluded.data());
    }
    arguments.push_back(nullptr);
    return arguments;
}

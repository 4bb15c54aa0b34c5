#include "environment.h"

#include <cerrno>
#include <cstdlib>
#include <sys/stat.h>

namespace telv::environment {

std::string text(const char *variable, const char *fallback) {
    const char *value = std::getenv(variable);
    return value != nullptr && value[0] != '\0' ? value : fallback;
}

uint64_t number(const char *variable, uint64_t fallback) {
    const char *value = std::getenv(variable);
    if (value == nullptr || value[0] == '\0') {
        return fallback;
    }
    uint64_t result = 0;
    for (const char *digit = value; *digit != '\0'; ++digit) {
        auto value_of_digit = static_cast<uint64_t>(*digit - '0');
        if (*digit < '0' || *digit > '9' || result > (UINT64_MAX - value_of_digit) / 10) {
            return fallback;
        }
        result = result * 10 + value_of_digit;
    }
    return result > 0 ? result : fallback;
}

int make_directories(const std::string &path) {
    struct stat st;
    if (::stat(path.c_str(), &st) == 0) {
        return S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
    }
    // Each prefix ending before a '/' is a parent; the whole path comes last.
    int error = 0;
    for (size_t end = path.find('/', 1); error == 0; end = path.find('/', end + 1)) {
        std::string prefix = path.substr(0, end);
        if (::mkdir(prefix.c_str(), 0755) != 0 && errno != EEXIST) {
            error = errno;
        }
        if (end == std::string::npos) {
            break;
        }
    }
    if (error == 0 && (::stat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode))) {
        error = ENOTDIR;
    }
    return error;
}

std::string data_directory(int *error) {
    std::string directory = text(DATA_DIR_VARIABLE, DEFAULT_DATA_DIR);
    int made = make_directories(directory);
    if (error != nullptr) {
        *error = made;
    }
    return directory;
}

std::string path_of_file(const char *variable, const char *default_name, bool *in_data_directory) {
    const char *value = std::getenv(variable);
    *in_data_directory = value == nullptr || value[0] == '\0';
    return *in_data_directory ? text(DATA_DIR_VARIABLE, DEFAULT_DATA_DIR) + "/" + default_name
                              : value;
}

std::string file_in_data_directory(const char *variable, const char *default_name) {
    bool in_data_directory = false;
    std::string path = path_of_file(variable, default_name, &in_data_directory);
    if (in_data_directory) {
        data_directory();
    }
    return path;
}

} // namespace telv::environment

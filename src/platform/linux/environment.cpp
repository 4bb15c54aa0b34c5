#include "environment.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <sys/stat.h>

extern char **environ;

namespace telv::environment {

std::string text(const char *variable, const char *fallback) {
    const char *value = std::getenv(variable);
    return value != nullptr && value[0] != '\0' ? value : fallback;
}

uint64_t number(const char *variable, uint64_t fallback) {
    return number_of(std::getenv(variable), fallback);
}

uint64_t number_of(const char *value, uint64_t fallback) {
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

Watch::Watch(std::span<const char *const> names) : names_(names), values_(names.size(), nullptr) {}

void Watch::refresh() {
    char **array = environ;
    if (holds_last_look(array)) {
        return;
    }
    looked_ = false; // until the look is whole: memory may run out on the way
    entries_.clear();
    std::fill(values_.begin(), values_.end(), nullptr);
    for (char **entry = array; entry != nullptr && *entry != nullptr; ++entry) {
        entries_.push_back(*entry);
        for (size_t which = 0; which < names_.size(); ++which) {
            size_t length = std::strlen(names_[which]);
            // The first entry of a name holds its value, as for getenv.
            if (values_[which] == nullptr && std::strncmp(*entry, names_[which], length) == 0 &&
                (*entry)[length] == '=') {
                values_[which] = *entry + length + 1;
            }
        }
    }
    entries_.push_back(nullptr);
    array_ = array;
    looked_ = true;
}

bool Watch::holds_last_look(char **array) const {
    if (!looked_ || array != array_) {
        return false;
    }
    if (array == nullptr) {
        return true;
    }
    // Never read past the closing null: the same address may hold a shorter array by now, as the
    // C library reallocates the array while it changes.
    const char *const *seen = entries_.data();
    size_t at = 0;
    while (array[at] == seen[at] && seen[at] != nullptr) {
        ++at;
    }
    return array[at] == seen[at];
}

} // namespace telv::environment

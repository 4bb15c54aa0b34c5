// Where the default platform keeps its files, and the knobs it takes from the environment. Every
// value is read again at each use, so a host (or a test) moves the platform by changing its
// environment; nothing is cached that could point at an old directory.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace telv::environment {

inline constexpr const char *DATA_DIR_VARIABLE = "TELV_DATA_DIR";
inline constexpr const char *DEFAULT_DATA_DIR = "/var/lib/telvzmnd";

// The variable's value; `fallback` when it is unset or empty.
std::string text(const char *variable, const char *fallback);
// The variable as a whole decimal number above 0; `fallback` when it is unset, empty, not such a
// number, or too large for 64 bits.
uint64_t number(const char *variable, uint64_t fallback);
// The same rule for a value already read (null when unset).
uint64_t number_of(const char *value, uint64_t fallback);

// Creates `path` and its missing parents with mode 0755. 0, or the errno of the step that failed.
int make_directories(const std::string &path);

// The data directory, created when missing. Out: *error (0, or the errno of the creation).
std::string data_directory(int *error = nullptr);

// The file named by `variable`, or `default_name` inside the data directory when it is unset.
std::string file_in_data_directory(const char *variable, const char *default_name);
// The same path, without making the data directory: true in *in_data_directory when the path is
// the default one inside it, which data_directory() must make before the file is opened.
std::string path_of_file(const char *variable, const char *default_name, bool *in_data_directory);

// A few variables read as getenv reads them, for a caller that reads them at every line it writes.
// A getenv compares names along the whole environment, for each variable; here the entries are
// looked for only when the environment's array no longer holds the entries of the last look, which
// is what setenv, unsetenv and putenv change (they replace, add or remove entries), and comparing
// them costs about one getenv for all the variables. A value is read through its entry, so one
// changed in place, as putenv allows, is seen too.
class Watch {
  public:
    // `names` outlive the watch.
    explicit Watch(std::span<const char *const> names);

    // Looks at the environment again when it has changed; call before value().
    void refresh();
    // The value of names[which] at the last refresh(): null when unset.
    const char *value(size_t which) const { return values_[which]; }

  private:
    bool holds_last_look(char **array) const;

    std::span<const char *const> names_;
    bool looked_ = false;
    char **array_ = nullptr;
    std::vector<char *> entries_; // the array's entries at the last look, its closing null included
    std::vector<const char *> values_;
};

} // namespace telv::environment

// tarnmon snapshots: lists the blocks of the snapshot file, or shows one of them.
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>
#include <string_view>

#include "capture/snapshot_file.h"
#include "commands.h"
#include "linux/environment.h"
#include "snapshot_reader.h"

namespace {

constexpr const char *USAGE = "usage: tarnmon snapshots [--file PATH] [N|last]\n";

struct request {
    std::string path;
    std::string_view which; // empty = list, "last", or a block number
    bool valid = true;
};

// The file the monitor writes: "telvzmnd.trm" in the default platform's data directory.
std::string default_path() {
    const char *directory = std::getenv(telv::environment::DATA_DIR_VARIABLE);
    std::string base = directory != nullptr && directory[0] != '\0'
                           ? directory
                           : telv::environment::DEFAULT_DATA_DIR;
    return base + "/" + SNAPSHOT_FILE_NAME;
}

request parse(command_args args) {
    request r;
    r.path = default_path();
    for (size_t i = 0; i < args.size(); ++i) {
        std::string_view word = args[i];
        if (word == "--file" && i + 1 < args.size()) {
            r.path = args[++i];
        } else if (r.which.empty() && !word.starts_with("-")) {
            r.which = word;
        } else {
            r.valid = false;
        }
    }
    return r;
}

// The whole file; false with `problem` set when it cannot be read.
bool read_file(const std::string &path, std::string *text, std::string *problem) {
    std::ifstream in(path, std::ios::binary);
    if (!in) {
        *problem = errno == ENOENT
                       ? "no snapshot file at " + path + ": the monitor has not written one (or " +
                             telv::environment::DATA_DIR_VARIABLE + " names another directory)"
                       : "cannot open " + path + ": " + std::strerror(errno);
        return false;
    }
    std::ostringstream content;
    content << in.rdbuf();
    if (in.bad()) {
        *problem = "cannot read " + path;
        return false;
    }
    *text = content.str();
    return true;
}

void list(const std::string &path, size_t size, const std::vector<snapshot_block> &blocks) {
    std::printf("%s: %zu bytes, %zu block%s\n", path.c_str(), size, blocks.size(),
                blocks.size() == 1 ? "" : "s");
    if (blocks.empty()) {
        return;
    }
    std::printf("%5s  %-34s  %-34s  %10s\n", "#", "kind", "time stamp", "bytes");
    for (size_t i = 0; i < blocks.size(); ++i) {
        const snapshot_block &b = blocks[i];
        std::string stamp = b.timestamp.empty() ? "-" : terminal_text(b.timestamp);
        std::printf("%5zu  %-34s  %-34s  %10zu\n", i + 1, describe(b).c_str(), stamp.c_str(),
                    b.text.size());
    }
}

// The index of the block that `which` names, or blocks.size() with `problem` set.
size_t select(std::string_view which, const std::vector<snapshot_block> &blocks,
              std::string *problem) {
    if (which == "last") {
        for (size_t i = blocks.size(); i > 0; --i) {
            if (blocks[i - 1].kind == snapshot_kind::problem) {
                return i - 1;
            }
        }
        *problem = "no problem snapshot in the file";
        return blocks.size();
    }
    size_t number = 0;
    auto [end, error] = std::from_chars(which.data(), which.data() + which.size(), number);
    if (error != std::errc() || end != which.data() + which.size() || number == 0 ||
        number > blocks.size()) {
        *problem = "no block " + std::string(which) + ": the file holds " +
                   std::to_string(blocks.size()) + " (see tarnmon snapshots)";
        return blocks.size();
    }
    return number - 1;
}

bool is_selector(std::string_view which) {
    return which == "last" || which.find_first_not_of("0123456789") == std::string_view::npos;
}

} // namespace

int command_snapshots(command_args args) {
    request r = parse(args);
    if (!r.valid || !is_selector(r.which)) {
        std::fputs(USAGE, stderr);
        return EXIT_USAGE;
    }
    std::string text;
    std::string problem;
    if (!read_file(r.path, &text, &problem)) {
        std::fprintf(stderr, "tarnmon: %s\n", problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    std::vector<snapshot_block> blocks = read_snapshots(text);
    if (r.which.empty()) {
        list(r.path, text.size(), blocks);
        return EXIT_OK;
    }
    size_t index = select(r.which, blocks, &problem);
    if (index == blocks.size()) {
        std::fprintf(stderr, "tarnmon: %s\n", problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    std::string shown = terminal_text(blocks[index].text);
    std::fwrite(shown.data(), 1, shown.size(), stdout);
    return EXIT_OK;
}

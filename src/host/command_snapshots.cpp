// tarnmon snapshots: lists the blocks of the snapshot file, or shows one of them; with --json, the
// same as one JSON document.
#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <new>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <unistd.h>

#include "capture/snapshot_file.h"
#include "commands.h"
#include "data_blocks.h"
#include "descriptor.h"
#include "json_writer.h"
#include "linux/environment.h"
#include "snapshot_reader.h"

namespace {

// The most a snapshot file can hold: the largest size its control file can give it, and the one
// flush of the staging buffer that may carry it past that size before it wraps.
constexpr uint64_t SNAPSHOT_FILE_BOUND = uint64_t{UINT32_MAX} + FILE_BUFFER_SIZE;

// The file the monitor writes: "telvzmnd.trm" in the default platform's data directory.
std::string default_path() {
    const char *directory = std::getenv(telv::environment::DATA_DIR_VARIABLE);
    std::string base = directory != nullptr && directory[0] != '\0'
                           ? directory
                           : telv::environment::DEFAULT_DATA_DIR;
    return base + "/" + SNAPSHOT_FILE_NAME;
}

std::string cannot(const char *what, const std::string &path, int error) {
    return std::string("cannot ") + what + " " + path + ": " + std::strerror(error);
}

// The whole file; false with `problem` set when it cannot be read. Only a regular file within the
// bound is read: a device or a pipe has no end, and a directory no text.
bool read_file(const std::string &path, std::string *text, std::string *problem) {
    // Non-blocking, so that the open of a pipe returns for fstat to refuse it.
    descriptor file{::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK)};
    int fd = file.fd;
    if (fd < 0) {
        *problem = errno == ENOENT
                       ? "no snapshot file at " + path + ": the monitor has not written one (or " +
                             telv::environment::DATA_DIR_VARIABLE + " names another directory)"
                       : cannot("open", path, errno);
        return false;
    }
    struct stat st;
    if (::fstat(fd, &st) != 0) {
        *problem = cannot("read", path, errno);
    } else if (!S_ISREG(st.st_mode)) {
        *problem = "cannot read " + path + ": not a regular file";
    } else if (static_cast<uint64_t>(st.st_size) > SNAPSHOT_FILE_BOUND) {
        *problem = "cannot read " + path + ": it holds " + std::to_string(st.st_size) +
                   " bytes, more than a snapshot file can hold (" +
                   std::to_string(SNAPSHOT_FILE_BOUND) + ")";
    } else {
        // The size fstat saw: text the monitor appends meanwhile is left out, and the read stays
        // within the bound.
        text->resize(static_cast<size_t>(st.st_size));
        size_t got = 0;
        for (ssize_t n = 1; n != 0 && got < text->size();) {
            n = ::read(fd, text->data() + got, text->size() - got);
            if (n > 0) {
                got += static_cast<size_t>(n);
            } else if (n < 0 && errno != EINTR) {
                *problem = cannot("read", path, errno);
                break;
            }
        }
        text->resize(got);
    }
    return problem->empty();
}

// A block as a row of the list shows it: its number, kind, time stamp and size; with `text`, also
// the block itself as it is in the file (the text form turns it for a terminal).
void block_json(json_writer &json, size_t index, const snapshot_block &b, bool with_text) {
    json.begin_object().field("number", index + 1).field("kind", describe(b)).key("time_stamp");
    if (b.timestamp.empty()) {
        json.null();
    } else {
        json.value(b.timestamp);
    }
    json.field("bytes", b.text.size());
    if (with_text) {
        json.field("text", b.text);
    }
    json.end_object();
}

// {"file":…,"bytes":…,"blocks":[{"number","kind","time_stamp","bytes"}…]}; a block without a time
// stamp has null.
void list_json(const std::string &path, size_t size, const std::vector<snapshot_block> &blocks) {
    json_writer json;
    json.begin_object().field("file", path).field("bytes", size).key("blocks").begin_array();
    for (size_t i = 0; i < blocks.size(); ++i) {
        block_json(json, i, blocks[i], false);
    }
    json.end_array().end_object().print();
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

// Shows what `which` asks for: the list when it is empty, a block otherwise. In JSON, the block is
// the object of its row in the list with its "text".
int show(const std::string &path, std::string_view which, bool json) {
    std::string text;
    std::string problem;
    if (!read_file(path, &text, &problem)) {
        std::fprintf(stderr, "tarnmon: %s\n", problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    std::vector<snapshot_block> blocks = read_snapshots(text);
    if (which.empty()) {
        (json ? list_json : list)(path, text.size(), blocks);
        return EXIT_OK;
    }
    size_t index = select(which, blocks, &problem);
    if (index == blocks.size()) {
        std::fprintf(stderr, "tarnmon: %s\n", problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    if (json) {
        json_writer document;
        block_json(document, index, blocks[index], true);
        document.print();
        return EXIT_OK;
    }
    std::string shown = terminal_text(blocks[index].text);
    std::fwrite(shown.data(), 1, shown.size(), stdout);
    return EXIT_OK;
}

} // namespace

int command_snapshots(const command_line &line) {
    std::string_view which = line.operands.empty() ? "" : line.operands[0];
    if (!is_selector(which)) {
        return EXIT_USAGE;
    }
    std::string path = line.file != nullptr ? line.file : default_path();
    // A file within the bound may still hold more than this host can hold in memory.
    try {
        return show(path, which, line.json != nullptr);
    } catch (const std::bad_alloc &) {
        std::fprintf(stderr, "tarnmon: %s\n", cannot("read", path, ENOMEM).c_str());
        return EXIT_UNAVAILABLE;
    }
}

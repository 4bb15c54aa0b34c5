// Any bytes as a snapshot file: the blocks must lie inside the text, in order, without overlap, and
// leave out nothing but line ends; the text for a terminal must hold no control byte but newline
// and tab.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "snapshot_reader.h"

namespace {

void require(bool holds) {
    if (!holds) {
        std::abort();
    }
}

bool only_line_ends(std::string_view text) {
    return text.find_first_not_of("\n\r") == std::string_view::npos;
}

void require_terminal_safe(const std::string &shown) {
    for (char c : shown) {
        auto byte = static_cast<unsigned char>(c);
        require(byte == '\n' || byte == '\t' || (byte >= 0x20 && byte != 0x7f));
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string_view file(reinterpret_cast<const char *>(data), size);
    size_t covered = 0;
    for (const snapshot_block &block : read_snapshots(file)) {
        require(block.offset >= covered && block.offset <= size);
        require(block.text.data() == file.data() + block.offset);
        require(block.text.size() <= size - block.offset && !block.text.empty());
        require(only_line_ends(file.substr(covered, block.offset - covered)));
        require(block.timestamp.empty() || (block.timestamp.data() >= block.text.data() &&
                                            block.timestamp.data() + block.timestamp.size() <=
                                                block.text.data() + block.text.size()));
        require(!describe(block).empty());
        require_terminal_safe(terminal_text(block.timestamp));
        covered = block.offset + block.text.size();
    }
    require(only_line_ends(file.substr(covered)));
    require_terminal_safe(terminal_text(file));
    return 0;
}

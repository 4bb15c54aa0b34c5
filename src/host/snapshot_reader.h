// Reading the snapshot file "telvzmnd.trm" for people: the text is split into its blocks without
// any I/O, so that the same code serves the command, the tests and the fuzzer.
#pragma once

#include <concepts>
#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

enum class snapshot_kind {
    plain,   // opened by "=START" and 46 '='
    problem, // opened by "=START FEDC SNAPSHOT" and 32 '='
    unknown, // text whose opening line is not in the file
};

enum class snapshot_state {
    complete,     // opening and closing separator both present
    cut_by_wrap,  // text at the head of the file whose start a wrap dropped
    unterminated, // an opening with no closing separator before the next block or the end
    stray,        // text between two blocks, outside any separators
};

struct snapshot_block {
    snapshot_kind kind;
    snapshot_state state;
    size_t offset;              // of its first byte in the file
    std::string_view text;      // every byte of the block, separators and line ends included
    std::string_view timestamp; // after "Local date and time = ", without the trailing blank
};

// The blocks of `file`, in file order; together they cover every byte that is not a bare line end
// between blocks. Never fails: text it cannot place becomes a cut, unterminated or stray block.
std::vector<snapshot_block> read_snapshots(std::string_view file);
// The blocks point into the text, so a string that dies with the call is refused.
template <typename Text>
requires std::same_as<Text, std::string> std::vector<snapshot_block> read_snapshots(Text &&file)
= delete;

// The text for a terminal: each "\n\r" line end (and a lone "\n") becomes "\n", and every other
// control character but tab is shown as "\xHH", so that no byte of the file can drive the terminal.
std::string terminal_text(std::string_view text);

// "plain", "problem", "partial (cut by wrap)" and so on: how the list names a block.
std::string describe(const snapshot_block &block);

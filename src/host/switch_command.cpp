#include "switch_command.h"

#include <cstdio>
#include <string>

#include "control_block_view.h"
#include "core/control_block.h"
#include "snapshot_reader.h"

namespace {

// "on, off or trigger": the words, as a sentence names them.
std::string word_list(std::span<const switch_word> words) {
    std::string text;
    for (size_t i = 0; i < words.size(); ++i) {
        text += i == 0 ? "" : i + 1 == words.size() ? " or " : ", ";
        text += words[i].word;
    }
    return text;
}

const switch_word *chosen(std::span<const switch_word> words, std::string_view given) {
    for (const switch_word &w : words) {
        if (w.word == given) {
            return &w;
        }
    }
    return nullptr;
}

} // namespace

int turn_switch(std::string_view command, std::span<const switch_word> words,
                const command_line &line) {
    const int name_length = static_cast<int>(command.size());
    if (line.operands.empty()) {
        std::fprintf(stderr, "tarnmon: %.*s needs one word: %s\n", name_length, command.data(),
                     word_list(words).c_str());
        return EXIT_USAGE;
    }
    const switch_word *which = chosen(words, line.operands[0]);
    if (which == nullptr) {
        std::fprintf(stderr, "tarnmon: %.*s takes %s, not '%s'\n", name_length, command.data(),
                     word_list(words).c_str(), terminal_text(line.operands[0]).c_str());
        return EXIT_USAGE;
    }
    // The entry points change nothing, and still return 0, when there is no block: look first,
    // to say why.
    control_block_view view = attach_control_block();
    if (view.block == nullptr) {
        std::fprintf(stderr, "tarnmon: %s; nothing was changed\n", view.problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    detach_control_block(view);
    uint32_t crc = 0;
    uint32_t src = which->turn(&crc);
    if (src != 0 || TARN_CB_PTR == nullptr) {
        std::fprintf(stderr,
                     "tarnmon: the switch did not reach the control block (src %x, crc %x): the "
                     "block went away\n",
                     src, crc);
        return EXIT_UNAVAILABLE;
    }
    std::printf("%s\n", which->done);
    return EXIT_OK;
}

#include "snapshot_reader.h"

#include "capture/snapshot_file.h"

namespace {

constexpr std::string_view TIMESTAMP_PREFIX = "Local date and time = ";

enum class separator { none, opening, closing };

struct line_kind {
    separator role;
    snapshot_kind kind;
};

// A separator is a whole line, equal to one of the four texts; anything else is block text.
line_kind classify(std::string_view content) {
    if (content == PLAIN_SNAPSHOT_OPENING) {
        return {separator::opening, snapshot_kind::plain};
    }
    if (content == PROBLEM_SNAPSHOT_OPENING) {
        return {separator::opening, snapshot_kind::problem};
    }
    if (content == PLAIN_SNAPSHOT_CLOSING) {
        return {separator::closing, snapshot_kind::plain};
    }
    if (content == PROBLEM_SNAPSHOT_CLOSING) {
        return {separator::closing, snapshot_kind::problem};
    }
    return {separator::none, snapshot_kind::unknown};
}

bool only_line_ends(std::string_view text) {
    return text.find_first_not_of("\n\r") == std::string_view::npos;
}

// The first time stamp line of a block, without its trailing blank.
std::string_view timestamp_of(std::string_view block) {
    size_t at = 0;
    while (at < block.size()) {
        size_t end = block.find('\n', at);
        std::string_view content =
            block.substr(at, end == std::string_view::npos ? std::string_view::npos : end - at);
        if (content.starts_with(TIMESTAMP_PREFIX)) {
            content.remove_prefix(TIMESTAMP_PREFIX.size());
            while (!content.empty() && (content.back() == ' ' || content.back() == '\r')) {
                content.remove_suffix(1);
            }
            return content;
        }
        if (end == std::string_view::npos) {
            break;
        }
        at = end + 1;
        if (at < block.size() && block[at] == '\r') {
            ++at;
        }
    }
    return {};
}

// Collects the blocks while the file is walked line by line.
class block_list {
  public:
    explicit block_list(std::string_view file) : file_(file) {}

    void add(snapshot_kind kind, snapshot_state state, size_t from, size_t to) {
        std::string_view text = file_.substr(from, to - from);
        blocks_.push_back(snapshot_block{kind, state, from, text, timestamp_of(text)});
    }
    // Text outside an open block: the head of a file a wrap cut, or stray text later on.
    void add_loose(snapshot_kind kind, size_t from, size_t to) {
        if (only_line_ends(file_.substr(from, to - from))) {
            return;
        }
        add(kind, blocks_.empty() ? snapshot_state::cut_by_wrap : snapshot_state::stray, from, to);
    }
    std::vector<snapshot_block> take() { return std::move(blocks_); }

  private:
    std::string_view file_;
    std::vector<snapshot_block> blocks_;
};

} // namespace

std::vector<snapshot_block> read_snapshots(std::string_view file) {
    block_list blocks(file);
    bool open = false;
    snapshot_kind open_kind = snapshot_kind::unknown;
    size_t pending = 0; // first byte not yet given to a block
    // A wrap that cut between the two bytes of a line end leaves the "\r" at the head of the file,
    // in front of the next line.
    size_t at = file.starts_with('\r') ? 1 : 0;
    while (at < file.size()) {
        size_t newline = file.find('\n', at);
        size_t content_end = newline == std::string_view::npos ? file.size() : newline;
        size_t next = newline == std::string_view::npos ? file.size() : newline + 1;
        if (next < file.size() && file[next] == '\r') {
            ++next; // "\n\r" is the file's line end
        }
        std::string_view content = file.substr(at, content_end - at);
        if (!content.empty() && content.back() == '\r') {
            content.remove_suffix(1);
        }
        line_kind role = classify(content);
        if (role.role == separator::opening) {
            if (open) {
                blocks.add(open_kind, snapshot_state::unterminated, pending, at);
            } else {
                blocks.add_loose(snapshot_kind::unknown, pending, at);
            }
            open = true;
            open_kind = role.kind;
            pending = at;
        } else if (role.role == separator::closing && (!open || role.kind == open_kind)) {
            if (open) {
                blocks.add(open_kind, snapshot_state::complete, pending, next);
            } else {
                blocks.add_loose(role.kind, pending, next);
            }
            open = false;
            pending = next;
        }
        at = next;
    }
    if (open) {
        blocks.add(open_kind, snapshot_state::unterminated, pending, file.size());
    } else {
        blocks.add_loose(snapshot_kind::unknown, pending, file.size());
    }
    return blocks.take();
}

std::string terminal_text(std::string_view text) {
    static constexpr char HEX[] = "0123456789abcdef";
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size(); ++i) {
        auto byte = static_cast<unsigned char>(text[i]);
        if (byte == '\n') {
            out += '\n';
            if (i + 1 < text.size() && text[i + 1] == '\r') {
                ++i;
            }
        } else if ((byte < 0x20 && byte != '\t') || byte == 0x7f) {
            out += "\\x";
            out += HEX[byte >> 4];
            out += HEX[byte & 0xf];
        } else {
            out += static_cast<char>(byte);
        }
    }
    return out;
}

std::string describe(const snapshot_block &block) {
    std::string kind = block.kind == snapshot_kind::plain     ? "plain"
                       : block.kind == snapshot_kind::problem ? "problem"
                                                              : "";
    std::string state;
    switch (block.state) {
    case snapshot_state::complete:
        return kind;
    case snapshot_state::cut_by_wrap:
        state = "partial (cut by wrap)";
        break;
    case snapshot_state::unterminated:
        state = "unterminated";
        break;
    case snapshot_state::stray:
        state = "text outside a snapshot";
        break;
    }
    return kind.empty() ? state : kind + ", " + state;
}

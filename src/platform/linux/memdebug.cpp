#include "memdebug.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>
#include <unordered_map>

#include "environment.h"
#include "trace_file.h"

namespace telv::memdebug {
namespace {

// The side table of live blocks. A table rather than a header in front of each block: a foreign
// or repeated free is then found out without reading memory that is not ours.
struct Table {
    std::mutex lock;
    std::unordered_map<const void *, Block> blocks;
};

// Never destroyed: the report at exit runs after static objects may have gone.
Table &table() {
    static Table *const t = new Table;
    return *t;
}

// Takes ownership of `block` into the table; null (and the block freed) when the table cannot
// grow.
void *remember(void *block, size_t size, const char *file, int line) {
    if (block == nullptr) {
        return nullptr;
    }
    Block entry{size, line, {}};
    const char *name = file != nullptr ? file : "?";
    std::memcpy(entry.file, name, strnlen(name, MAX_FILE));
    Table &t = table();
    std::lock_guard guard(t.lock);
    try {
        t.blocks.emplace(block, entry);
    } catch (const std::bad_alloc &) {
        std::free(block);
        block = nullptr;
    }
    return block;
}

// Blocks still live when the process ends (or the platform is unloaded) are reported when the
// environment asks for it.
__attribute__((destructor)) void report_at_exit() {
    // Memory may be short at exit too; then the report is skipped rather than thrown into exit.
    try {
        if (environment::text(REPORT_VARIABLE, "0") == "1") {
            report_leaks(stderr);
        }
    } catch (...) {
    }
}

} // namespace

void *allocate(size_t size, const char *file, int line) {
    return remember(std::malloc(std::max<size_t>(size, 1)), size, file, line);
}

void *allocate_zeroed(size_t count, size_t size, const char *file, int line) {
    if (size != 0 && count > SIZE_MAX / size) {
        return nullptr;
    }
    size_t total = count * size;
    return remember(std::calloc(std::max<size_t>(total, 1), 1), total, file, line);
}

void release(void *ptr, const char *file, int line) {
    if (ptr == nullptr) {
        return;
    }
    bool known = false;
    {
        Table &t = table();
        std::lock_guard guard(t.lock);
        known = t.blocks.erase(ptr) == 1;
    }
    if (known) {
        std::free(ptr);
    } else {
        trace::line("TELVMEMF: free of %p from %s:%d, which is no live block", ptr,
                    file != nullptr ? file : "?", line);
    }
}

size_t live_blocks() {
    Table &t = table();
    std::lock_guard guard(t.lock);
    return t.blocks.size();
}

size_t live_bytes() {
    Table &t = table();
    std::lock_guard guard(t.lock);
    size_t total = 0;
    for (const auto &[ptr, block] : t.blocks) {
        total += block.size;
    }
    return total;
}

bool find(const void *ptr, Block *block) {
    Table &t = table();
    std::lock_guard guard(t.lock);
    auto entry = t.blocks.find(ptr);
    if (entry == t.blocks.end()) {
        return false;
    }
    *block = entry->second;
    return true;
}

std::vector<std::string> leak_lines() {
    std::vector<Block> live;
    {
        Table &t = table();
        std::lock_guard guard(t.lock);
        for (const auto &[ptr, block] : t.blocks) {
            live.push_back(block);
        }
    }
    std::sort(live.begin(), live.end(), [](const Block &a, const Block &b) {
        int order = std::strcmp(a.file, b.file);
        return order != 0 ? order < 0 : a.line < b.line;
    });
    std::vector<std::string> lines;
    for (const Block &block : live) {
        lines.push_back("leak of " + std::to_string(block.size) + " bytes from " + block.file +
                        ":" + std::to_string(block.line));
    }
    return lines;
}

size_t report_leaks(std::FILE *stream) {
    std::vector<std::string> lines = leak_lines();
    for (const std::string &text : lines) {
        trace::line("TELVMEMF: %s", text.c_str());
        if (stream != nullptr) {
            std::fprintf(stream, "TELVMEMF: %s\n", text.c_str());
        }
    }
    return lines.size();
}

} // namespace telv::memdebug

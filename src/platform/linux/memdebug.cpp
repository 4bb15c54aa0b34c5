#include "memdebug.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>
#include <sys/mman.h>
#include <unistd.h>
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

// Where a large block lies in its own mapping: whole pages for it, then a guard page, with the
// block ending at the guard.
struct Placement {
    size_t pages;  // the block's pages, the guard page not counted
    size_t length; // of the mapping
    size_t offset; // of the block from the start of the mapping
    bool fits;     // false when the sizes pass size_t
};

Placement place(size_t size) {
    static const size_t page = static_cast<size_t>(::sysconf(_SC_PAGESIZE));
    constexpr size_t ALIGN = alignof(std::max_align_t); // as malloc aligns
    size_t aligned = (size + ALIGN - 1) & ~(ALIGN - 1);
    size_t pages = (aligned + page - 1) / page * page;
    bool fits = aligned >= size && pages >= aligned && pages + page > pages;
    return Placement{pages, pages + page, pages - aligned, fits};
}

// A block of `size` bytes, zeroed when `zeroed` (a fresh mapping always is).
void *obtain(size_t size, bool zeroed) {
    if (size < LARGE_BLOCK) {
        size = std::max<size_t>(size, 1);
        return zeroed ? std::calloc(size, 1) : std::malloc(size);
    }
    Placement at = place(size);
    if (!at.fits) {
        return nullptr;
    }
    void *start =
        ::mmap(nullptr, at.length, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (start == MAP_FAILED) {
        return nullptr;
    }
    auto *bytes = static_cast<char *>(start);
    if (::mprotect(bytes + at.pages, at.length - at.pages, PROT_NONE) != 0) {
        ::munmap(start, at.length);
        return nullptr;
    }
    return bytes + at.offset;
}

// Gives back a block of `obtain`, of the size it was asked for.
void give_back(void *block, size_t size) {
    if (size < LARGE_BLOCK) {
        std::free(block);
        return;
    }
    Placement at = place(size);
    ::munmap(static_cast<char *>(block) - at.offset, at.length);
}

// Takes ownership of `block` into the table; null (and the block given back) when the table
// cannot grow.
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
        give_back(block, size);
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
    return remember(obtain(size, false), size, file, line);
}

void *allocate_zeroed(size_t count, size_t size, const char *file, int line) {
    if (size != 0 && count > SIZE_MAX / size) {
        return nullptr;
    }
    size_t total = count * size;
    return remember(obtain(total, true), total, file, line);
}

void release(void *ptr, const char *file, int line) {
    if (ptr == nullptr) {
        return;
    }
    bool known = false;
    size_t size = 0;
    {
        Table &t = table();
        std::lock_guard guard(t.lock);
        auto entry = t.blocks.find(ptr);
        if (entry != t.blocks.end()) {
            known = true;
            size = entry->second.size;
            t.blocks.erase(entry);
        }
    }
    if (known) {
        give_back(ptr, size);
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

// The debugging allocator of the default platform: every live block is known with its size and
// the source file and line that took it, so that what is still live at exit can be named.
//
// A block of LARGE_BLOCK bytes or more (the snapshot file's wrap takes the whole file, megabytes,
// once in a while) is mapped on its own and unmapped when released: the host's heap would keep
// such a block resident for good once it had been freed. It ends right before a page that may not
// be touched, so that a write past its end faults where it happens.
#pragma once

#include <cstddef>
#include <cstdio>
#include <string>
#include <vector>

namespace telv::memdebug {

inline constexpr const char *REPORT_VARIABLE = "TELV_MEMDEBUG_REPORT";
// Longest file name kept; a longer one is cut. The name is copied, since the module that named it
// may be unloaded before the block is reported.
inline constexpr size_t MAX_FILE = 63;
inline constexpr size_t LARGE_BLOCK = 1u << 20;

struct Block {
    size_t size;
    int line;
    char file[MAX_FILE + 1];
};

// Blocks of at least one byte (a request of 0 takes 1, so that every block is distinct), null
// when memory is short or count * size does not fit in size_t.
void *allocate(size_t size, const char *file, int line);
void *allocate_zeroed(size_t count, size_t size, const char *file, int line);
// Null is ignored; a pointer that is not a live block is traced and left alone.
void release(void *ptr, const char *file, int line);

size_t live_blocks();
size_t live_bytes();
// Out: *block. Whether `ptr` is a live block.
bool find(const void *ptr, Block *block);
// The live blocks as "leak of N bytes from FILE:LINE", ordered by file and line.
std::vector<std::string> leak_lines();
// Writes each live block as a trace line "TELVMEMF: leak of ..." and to `stream`; the count.
size_t report_leaks(std::FILE *stream);

} // namespace telv::memdebug

// The pointer check of the default platform: a range passes only when the process's memory map
// says every byte of it lies in mappings that may be read and written. Nothing is touched, so a
// bad pointer costs a refusal, never a crash.
#pragma once

#include <cstdint>
#include <string_view>

namespace telv::pointer_check {

// Result for a refused range.
inline constexpr uint32_t REFUSED = 8;

// Whether [start, end) lies wholly in mappings of `maps` (the text of /proc/<pid>/maps, sorted by
// address, one "start-end perms ..." a line) whose permissions begin with "rw". start < end.
bool readable_and_writable(std::string_view maps, uintptr_t start, uintptr_t end);

// 0 when `length` bytes at `ptr` can be read and written. A null pointer and a range that wraps
// around the address space are refused; length 0 checks the one byte `ptr` points at, since a
// pointer to nothing accessible is no good pointer. Without a readable map everything is refused.
uint32_t check(const void *ptr, uint32_t length);

} // namespace telv::pointer_check

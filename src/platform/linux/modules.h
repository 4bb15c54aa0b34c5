// The module service of the default platform: a module M is the shared library "libM.so", found
// first in the directories of TELV_MODULE_PATH and then by the dynamic loader's own search.
#pragma once

#include <cstdint>
#include <string>

namespace telv::modules {

inline constexpr const char *PATH_VARIABLE = "TELV_MODULE_PATH";
// Result of a failed call; the reason goes to *crc.
inline constexpr uint32_t FAILED = 8;
// Longest module name: "lib<name>.so" must still be a file name.
inline constexpr size_t MAX_NAME = 240;

// "libM.so" for module M; the monitor's own module "telvzmnd" is "libtelvzmnd.so" like any other.
std::string library_name(const char *module);

// Loads the module and resolves `function` in it. On success *address and *handle are set and
// *crc = 0; on failure they stay null and *crc is EINVAL (bad arguments), ELIBACC (the module
// did not load) or ENOENT (no such function in it).
uint32_t resolve(const char *module, const char *function, void **address, void **handle,
                 uint32_t *crc);
// Gives back a handle of `resolve`. *crc = EINVAL for a handle that is not (or no longer) held.
uint32_t release(const char *function, void *handle, uint32_t *crc);

// Handles resolved and not yet released.
int held_handles();

} // namespace telv::modules

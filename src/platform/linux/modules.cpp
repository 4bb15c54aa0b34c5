#include "modules.h"

#include <cerrno>
#include <cstring>
#include <dlfcn.h>
#include <map>
#include <mutex>
#include <unistd.h>

#include "environment.h"
#include "trace_file.h"

namespace telv::modules {
namespace {

// Every handle given out, with the number of times: a handle is closed only as often as it was
// opened, and a stray or repeated release cannot reach dlclose.
struct Held {
    std::mutex lock;
    std::map<void *, int> handles;
};

Held &held() {
    static Held *const h = new Held;
    return *h;
}

bool valid_module(const char *module) {
    return module != nullptr && module[0] != '\0' && std::strchr(module, '/') == nullptr &&
           std::strlen(module) <= MAX_NAME;
}

// The first directory of the module path that holds the library wins; otherwise the loader
// searches as it always does.
void *open_module(const std::string &library) {
    std::string path = environment::text(PATH_VARIABLE, "");
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find(':', start);
        std::string directory = path.substr(start, end - start);
        std::string candidate = directory + "/" + library;
        if (!directory.empty() && ::access(candidate.c_str(), F_OK) == 0) {
            return ::dlopen(candidate.c_str(), RTLD_NOW);
        }
        start = end == std::string::npos ? path.size() + 1 : end + 1;
    }
    return ::dlopen(library.c_str(), RTLD_NOW);
}

uint32_t finish(uint32_t *crc, int error) {
    if (crc != nullptr) {
        *crc = static_cast<uint32_t>(error);
    }
    return error == 0 ? 0 : FAILED;
}

} // namespace

std::string library_name(const char *module) {
    return std::string("lib") + module + ".so";
}

uint32_t resolve(const char *module, const char *function, void **address, void **handle,
                 uint32_t *crc) {
    int error = 0;
    void *opened = nullptr;
    void *found = nullptr;
    if (address == nullptr || handle == nullptr || !valid_module(module) || function == nullptr ||
        function[0] == '\0') {
        error = EINVAL;
    } else if ((opened = open_module(library_name(module))) == nullptr) {
        const char *why = ::dlerror();
        trace::line("TELVMODF: module %s not loaded: %s", module, why != nullptr ? why : "?");
        error = ELIBACC;
    } else if ((found = ::dlsym(opened, function)) == nullptr) {
        trace::line("TELVMODF: function %s not found in module %s", function, module);
        ::dlclose(opened);
        error = ENOENT;
    } else {
        Held &h = held();
        std::lock_guard guard(h.lock);
        h.handles[opened]++;
    }
    if (address != nullptr) {
        *address = error == 0 ? found : nullptr;
    }
    if (handle != nullptr) {
        *handle = error == 0 ? opened : nullptr;
    }
    return finish(crc, error);
}

uint32_t release(const char *function, void *handle, uint32_t *crc) {
    bool known = false;
    {
        Held &h = held();
        std::lock_guard guard(h.lock);
        auto entry = h.handles.find(handle);
        if (entry != h.handles.end()) {
            known = true;
            if (--entry->second == 0) {
                h.handles.erase(entry);
            }
        }
    }
    if (!known) {
        trace::line("TELVMODF: release of %s with a handle not held: %p",
                    function != nullptr ? function : "(null)", handle);
        return finish(crc, EINVAL);
    }
    int error = ::dlclose(handle) == 0 ? 0 : EINVAL;
    return finish(crc, error);
}

int held_handles() {
    Held &h = held();
    std::lock_guard guard(h.lock);
    int count = 0;
    for (const auto &[handle, times] : h.handles) {
        count += times;
    }
    return count;
}

} // namespace telv::modules

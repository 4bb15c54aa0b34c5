// The module service over the dynamic loader.
#include "modsvc.h"

#include "modules.h"
#include "platform_export.h"

using telv::api::serve;
using telv::modules::FAILED;

TELV_PLATFORM_EXPORT uint32_t modsvc_get_func_addr2(const char *module, const char *function,
                                                    void **address, void **handle, uint32_t *crc) {
    return serve(FAILED, crc,
                 [&] { return telv::modules::resolve(module, function, address, handle, crc); });
}

TELV_PLATFORM_EXPORT uint32_t modsvc_release_func_addr(const char *function, void *handle,
                                                       uint32_t *crc) {
    return serve(FAILED, crc, [&] { return telv::modules::release(function, handle, crc); });
}

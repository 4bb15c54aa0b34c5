// The pointer check over the process's memory map.
#include "memsvc.h"

#include "platform_export.h"
#include "pointer_check.h"

TELV_PLATFORM_EXPORT uint32_t memsvc_ckptr(const void *ptr, uint32_t length) {
    return telv::api::serve(telv::pointer_check::REFUSED,
                            [&] { return telv::pointer_check::check(ptr, length); });
}

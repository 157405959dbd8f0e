// What the runtime's C entry points share: a status out-argument that may be
// null, and nothing thrown across the C API. Private to src/platform/ncs.
#ifndef NCS_GUARD_H
#define NCS_GUARD_H

#include "ncs/ncs.h"

#include <new>

namespace ncs {

inline void set_status(uint32_t *status, uint32_t value)
{
    if (status != nullptr)
        *status = value;
}

// Runs `body`, which returns a status, and stores it in `*status`: out of
// memory is rpc__s_no_memory, any other exception `otherwise`.
template <class Body>
void guarded(uint32_t *status, uint32_t otherwise, Body &&body) noexcept
{
    uint32_t result;
    try {
        result = body();
    } catch (const std::bad_alloc &) {
        result = rpc__s_no_memory;
    } catch (...) {
        result = otherwise;
    }
    set_status(status, result);
}

}  // namespace ncs

#endif

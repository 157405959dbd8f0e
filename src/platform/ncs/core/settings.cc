// Settings of the runtime from the environment.
#include "ncs/runtime.h"

#include "plt/plt1.h"

#include <charconv>
#include <cstring>

namespace ncs {

uint32_t setting(const char *name, uint32_t dflt)
{
    const char *text = PLT1_GetEnv(name, nullptr);
    if (text == nullptr)
        return dflt;
    const char *end = text + std::strlen(text);
    uint32_t value = 0;
    auto [stop, error] = std::from_chars(text, end, value);
    if (error != std::errc() || stop != end || stop == text || value == 0)
        return dflt;
    return value;
}

}  // namespace ncs

// What the fuzz targets share: the sender's representation chosen by an
// input byte, and a depot that the path code resolves into.
#ifndef DPX_FUZZ_COMMON_H
#define DPX_FUZZ_COMMON_H

#include "dpx/dpx.h"

#include "afw/afw.h"
#include "ncs/ncs.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>

namespace dpxfuzz {

// The depot every target resolves into: /fuzz-depot, product "prod". The
// targets never touch the file system through it.
constexpr char kRoot[] = "/fuzz-depot";
constexpr char kProduct[] = "prod";
constexpr char kProductDir[] = "/fuzz-depot/prod/";

inline void set_depot()
{
    static const bool done = [] {
        setenv("DPX_DEPOTROOT", kRoot, 1);
        AFW_SetProductName(kProduct);
        return true;
    }();
    (void)done;
}

// A sender's drep from the low bits of `choice`: byte order and character
// set flipped against this machine's, and a foreign float format.
inline uint32_t sender_drep(uint8_t choice)
{
    uint32_t local = NCS_DREP_LOCAL;
    return NCS_DREP(NCS_DREP_INT(local) ^ (choice & 1u), NCS_DREP_CHAR(local) ^ ((choice >> 1) & 1u),
                    (choice >> 2) & 1u);
}

// True when `full` names the product's directory or a path inside it, by
// the text alone: the prefix, and no ".." segment behind it.
inline bool inside_product(const char *full)
{
    size_t prefix = std::strlen(kProductDir);
    if (std::strncmp(full, kProductDir, prefix) != 0)
        return false;
    const char *rest = full + prefix;
    if (*rest == '/')
        return false;
    for (const char *segment = rest; *segment != '\0';) {
        const char *end = std::strchr(segment, '/');
        size_t length = end != nullptr ? static_cast<size_t>(end - segment) : std::strlen(segment);
        if (length == 2 && segment[0] == '.' && segment[1] == '.')
            return false;
        if (end == nullptr)
            break;
        segment = end + 1;
    }
    return true;
}

}  // namespace dpxfuzz

#endif

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
#include <string>

namespace dpxfuzz {

// The depot every target resolves into, never touching the file system.
constexpr char kProductDir[] = "/fuzz-depot/prod/";

inline void set_depot()
{
    static const bool done = (setenv("DPX_DEPOTROOT", "/fuzz-depot", 1), AFW_SetProductName("prod"), true);
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
    const size_t prefix = std::strlen(kProductDir);
    return std::strncmp(full, kProductDir, prefix) == 0 && full[prefix] != '/' &&
           ("/" + std::string(full + prefix) + "/").find("/../") == std::string::npos;
}

}  // namespace dpxfuzz

#endif

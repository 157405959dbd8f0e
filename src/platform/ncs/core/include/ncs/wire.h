// Big-endian integers and UUIDs, as the carrier's frames and the broker's
// messages carry them. Private to src/platform/ncs.
#ifndef NCS_WIRE_H
#define NCS_WIRE_H

#include "ncs/ncs.h"

#include <cstddef>
#include <cstdint>
#include <cstring>

namespace ncs::wire {

constexpr size_t kUuidSize = 16;
static_assert(sizeof(uuid__t) == kUuidSize, "a UUID has no padding");

inline void put16(unsigned char *p, uint16_t v)
{
    p[0] = static_cast<unsigned char>(v >> 8);
    p[1] = static_cast<unsigned char>(v);
}
inline void put32(unsigned char *p, uint32_t v)
{
    put16(p, static_cast<uint16_t>(v >> 16));
    put16(p + 2, static_cast<uint16_t>(v));
}
inline uint16_t get16(const unsigned char *p)
{
    return static_cast<uint16_t>((p[0] << 8) | p[1]);
}
inline uint32_t get32(const unsigned char *p)
{
    return (uint32_t{get16(p)} << 16) | get16(p + 2);
}

// A UUID in kUuidSize bytes: time_high, time_low, reserved, family, host.
inline void put_uuid(unsigned char *p, const uuid__t &u)
{
    put32(p, u.time_high);
    put16(p + 4, u.time_low);
    put16(p + 6, u.reserved);
    p[8] = u.family;
    std::memcpy(p + 9, u.host, sizeof u.host);
}
inline uuid__t get_uuid(const unsigned char *p)
{
    uuid__t u;
    u.time_high = get32(p);
    u.time_low = get16(p + 4);
    u.reserved = get16(p + 6);
    u.family = p[8];
    std::memcpy(u.host, p + 9, sizeof u.host);
    return u;
}

}  // namespace ncs::wire

#endif

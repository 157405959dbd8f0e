// The frames of the TCP carrier. Private to src/platform/ncs.
//
// Every message on a connection is one frame: a header of kHeaderSize bytes,
// then the body. Integers of the header are big-endian. A request carries the
// interface, the operation and the body; the server answers each request
// with one frame of the same call id: a reply with its body, or a fault with
// a status and no body. A fault with call id 0 answers no request: the server
// sends it on a connection it refuses (busy).
//
//  offset size field
//       0    4 magic, kMagic
//       4    2 version of the format, kVersion
//       6    1 kind: kRequest, kReply, kFault
//       7    1 flags: of a request, the options word of rpc__sar; of a reply
//              or fault, kClosing when the server closes the connection after
//              this frame
//       8    4 call id, chosen by the client
//      12    4 drep of the sender of the body
//      16    4 interface UUID: time_high
//      20    2 interface UUID: time_low
//      22    2 interface UUID: reserved
//      24    1 interface UUID: family
//      25    7 interface UUID: host
//      32    4 interface version
//      36    4 operation number
//      40    4 body length, at most RPC_MAX_BODY; 0 in a fault
//      44    4 fault status; 0 but in a fault
// A reply and a fault repeat the interface and operation of their request.
#ifndef NCS_FRAME_H
#define NCS_FRAME_H

#include "ncs/ncs.h"
#include "ncs/wire.h"

#include <cstddef>
#include <cstdint>
#include <cstring>

namespace ncs::frame {

constexpr uint32_t kMagic = 0x4E435346;  // "NCSF"
constexpr uint16_t kVersion = 1;
constexpr uint8_t kRequest = 1;
constexpr uint8_t kReply = 2;
constexpr uint8_t kFault = 3;
constexpr uint8_t kClosing = 1;

constexpr size_t kMagicOffset = 0;
constexpr size_t kVersionOffset = 4;
constexpr size_t kKindOffset = 6;
constexpr size_t kFlagsOffset = 7;
constexpr size_t kCallIdOffset = 8;
constexpr size_t kDrepOffset = 12;
constexpr size_t kUuidOffset = 16;
constexpr size_t kIfVersOffset = 32;
constexpr size_t kOpnumOffset = 36;
constexpr size_t kBodyLenOffset = 40;
constexpr size_t kFaultOffset = 44;
constexpr size_t kHeaderSize = 48;

static_assert(kVersionOffset == kMagicOffset + 4 && kKindOffset == kVersionOffset + 2 &&
              kFlagsOffset == kKindOffset + 1 && kCallIdOffset == kFlagsOffset + 1 &&
              kDrepOffset == kCallIdOffset + 4 && kUuidOffset == kDrepOffset + 4 &&
              kIfVersOffset == kUuidOffset + 16 && kOpnumOffset == kIfVersOffset + 4 &&
              kBodyLenOffset == kOpnumOffset + 4 && kFaultOffset == kBodyLenOffset + 4 &&
              kHeaderSize == kFaultOffset + 4,
              "the header's fields follow each other without gaps");
static_assert(wire::kUuidSize == 16, "a UUID fills its 16 bytes of the header");

struct Header {
    uint8_t kind = 0;
    uint8_t flags = 0;
    uint32_t call_id = 0;
    uint32_t drep = 0;
    uuid__t if_id = {};
    uint32_t if_vers = 0;
    uint32_t opnum = 0;
    uint32_t body_len = 0;
    uint32_t fault = 0;
};

using Bytes = unsigned char[kHeaderSize];

inline void encode(const Header &h, Bytes out)
{
    wire::put32(out + kMagicOffset, kMagic);
    wire::put16(out + kVersionOffset, kVersion);
    out[kKindOffset] = h.kind;
    out[kFlagsOffset] = h.flags;
    wire::put32(out + kCallIdOffset, h.call_id);
    wire::put32(out + kDrepOffset, h.drep);
    wire::put_uuid(out + kUuidOffset, h.if_id);
    wire::put32(out + kIfVersOffset, h.if_vers);
    wire::put32(out + kOpnumOffset, h.opnum);
    wire::put32(out + kBodyLenOffset, h.body_len);
    wire::put32(out + kFaultOffset, h.fault);
}

// Reads a header. False for a frame this format can't take: another magic
// or version, an unknown kind, a fault with a body, or a fault whose status
// is no failure: 0, or the value that exception frames return when no raise
// arrived, which a stub would take for a call that ran to its end. A body
// length above RPC_MAX_BODY is left to the reader, who refuses it with
// rpc__s_too_big.
inline bool decode(const Bytes in, Header &h)
{
    if (wire::get32(in + kMagicOffset) != kMagic || wire::get16(in + kVersionOffset) != kVersion)
        return false;
    h.kind = in[kKindOffset];
    if (h.kind != kRequest && h.kind != kReply && h.kind != kFault)
        return false;
    h.flags = in[kFlagsOffset];
    h.call_id = wire::get32(in + kCallIdOffset);
    h.drep = wire::get32(in + kDrepOffset);
    h.if_id = wire::get_uuid(in + kUuidOffset);
    h.if_vers = wire::get32(in + kIfVersOffset);
    h.opnum = wire::get32(in + kOpnumOffset);
    h.body_len = wire::get32(in + kBodyLenOffset);
    h.fault = wire::get32(in + kFaultOffset);
    return h.kind != kFault || (h.body_len == 0 && h.fault != rpc__s_ok && h.fault != EXC1_FRAME_SET);
}

}  // namespace ncs::frame

#endif

// The messages between a location broker and its clients, over TCP.
// Private to src/platform/ncs.
//
// Every message is a header and a body. All integers are big-endian.
//
// Header, 12 bytes:
//    0  magic     u32  kMagic
//    4  version   u16  kVersion
//    6  kind      u16  Kind
//    8  body_len  u32  bytes of body that follow
//
// UUID, 16 bytes: time_high u32, time_low u16, reserved u16, family u8, host 7 bytes.
//
// Entry, 224 bytes:
//    0  object       UUID
//   16  obj_type     UUID
//   32  interface    UUID
//   48  flags        u32
//   52  annotation   64 bytes; the receiver ends it with a NUL in its last byte
//  116  saddr_len    u32, at most 104
//  120  saddr        104 bytes: the address family as u16, then the rest of the
//                    address as the socket layer holds it (ports and IP addresses
//                    are in network order there already); zero behind saddr_len
//
// Requests and their bodies:
//   kRegister    one entry
//   kUnregister  one entry
//   kLookup      object UUID, type UUID, interface UUID (nil matches any),
//                position u32 (0: the start of the walk), max_results u32
// Every request is answered by one kReply:
//   status u32, position u32, count u32, then `count` entries (lookups only).
//
// A request with a wrong magic, version, kind or body length closes the
// connection without a reply.
#ifndef NCS_LB_FORMAT_H
#define NCS_LB_FORMAT_H

#include "ncs/lb.h"
#include "ncs/wire.h"

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <span>

namespace ncs::lb {

constexpr uint32_t kMagic = 0x4E434C42;  // "NCLB"
constexpr uint16_t kVersion = 1;

enum class Kind : uint16_t { kRegister = 1, kUnregister = 2, kLookup = 3, kReply = 0x80 };

constexpr size_t kHeaderSize = 12;
constexpr size_t kUuidSize = wire::kUuidSize;
constexpr size_t kAddrSize = sizeof(socket__addr_t);
constexpr size_t kEntrySize = 3 * kUuidSize + 4 + LB_ANNOTATION_LEN + 4 + kAddrSize;
constexpr size_t kLookupSize = 3 * kUuidSize + 4 + 4;
constexpr size_t kReplyFixedSize = 12;

// Most entries in one reply; a walk goes on from the position for more.
constexpr uint32_t kMaxResultsPerReply = 32;
// Largest bodies either side accepts.
constexpr size_t kMaxRequestBody = kEntrySize;
constexpr size_t kMaxReplyBody = kReplyFixedSize + kMaxResultsPerReply * kEntrySize;

static_assert(sizeof(uuid__t) == kUuidSize);
static_assert(kAddrSize == 104);
static_assert(kEntrySize == 224);
static_assert(kLookupSize == 56);
static_assert(kMaxRequestBody >= kLookupSize);
static_assert(kMaxReplyBody == 7180);

struct Header {
    uint32_t magic = kMagic;
    uint16_t version = kVersion;
    Kind kind = Kind::kReply;
    uint32_t body_len = 0;
};

// Lookup request.
struct Query {
    uuid__t object;
    uuid__t type;
    uuid__t interface;
    uint32_t position;
    uint32_t max_results;
};

// Fixed part of a reply.
struct ReplyHead {
    uint32_t status;
    uint32_t position;
    uint32_t count;
};

// Appends big-endian fields to a byte area; the caller sizes the area for
// what it writes.
class Writer {
public:
    explicit Writer(std::span<uint8_t> out) : out_(out) {}
    void u8(uint8_t v) { out_[at_++] = v; }
    void u16(uint16_t v)
    {
        wire::put16(out_.data() + at_, v);
        at_ += 2;
    }
    void u32(uint32_t v)
    {
        wire::put32(out_.data() + at_, v);
        at_ += 4;
    }
    void uuid(const uuid__t &u)
    {
        wire::put_uuid(out_.data() + at_, u);
        at_ += wire::kUuidSize;
    }
    void bytes(const void *p, size_t n)
    {
        std::memcpy(out_.data() + at_, p, n);
        at_ += n;
    }
    size_t written() const { return at_; }

private:
    std::span<uint8_t> out_;
    size_t at_ = 0;
};

// Reads big-endian fields from a byte area; the caller checks its length first.
class Reader {
public:
    explicit Reader(std::span<const uint8_t> in) : in_(in) {}
    uint8_t u8() { return in_[at_++]; }
    uint16_t u16()
    {
        at_ += 2;
        return wire::get16(in_.data() + at_ - 2);
    }
    uint32_t u32()
    {
        at_ += 4;
        return wire::get32(in_.data() + at_ - 4);
    }
    uuid__t uuid()
    {
        at_ += wire::kUuidSize;
        return wire::get_uuid(in_.data() + at_ - wire::kUuidSize);
    }
    void bytes(void *p, size_t n)
    {
        std::memcpy(p, in_.data() + at_, n);
        at_ += n;
    }

private:
    std::span<const uint8_t> in_;
    size_t at_ = 0;
};

inline void put_header(Writer &w, const Header &h)
{
    w.u32(h.magic);
    w.u16(h.version);
    w.u16(static_cast<uint16_t>(h.kind));
    w.u32(h.body_len);
}

inline Header get_header(Reader &r)
{
    Header h;
    h.magic = r.u32();
    h.version = r.u16();
    h.kind = static_cast<Kind>(r.u16());
    h.body_len = r.u32();
    return h;
}


inline void put_entry(Writer &w, const lb__entry_t &e)
{
    w.uuid(e.object);
    w.uuid(e.obj_type);
    w.uuid(e.obj_interface);
    w.u32(e.flags);
    w.bytes(e.annotation, LB_ANNOTATION_LEN);
    uint32_t len = e.saddr_len < kAddrSize ? e.saddr_len : kAddrSize;
    w.u32(len);
    socket__addr_t addr{};
    std::memcpy(addr.bytes, e.saddr.bytes, len);
    w.u16(addr.sa.sa_family);
    w.bytes(addr.bytes + sizeof addr.sa.sa_family, kAddrSize - sizeof addr.sa.sa_family);
}

// False when the entry's address length is above kAddrSize.
inline bool get_entry(Reader &r, lb__entry_t &e)
{
    e.object = r.uuid();
    e.obj_type = r.uuid();
    e.obj_interface = r.uuid();
    e.flags = r.u32();
    r.bytes(e.annotation, LB_ANNOTATION_LEN);
    e.annotation[LB_ANNOTATION_LEN - 1] = '\0';
    e.saddr_len = r.u32();
    e.saddr.sa.sa_family = r.u16();
    r.bytes(e.saddr.bytes + sizeof e.saddr.sa.sa_family, kAddrSize - sizeof e.saddr.sa.sa_family);
    return e.saddr_len <= kAddrSize;
}

inline void put_query(Writer &w, const Query &q)
{
    w.uuid(q.object);
    w.uuid(q.type);
    w.uuid(q.interface);
    w.u32(q.position);
    w.u32(q.max_results);
}

inline Query get_query(Reader &r)
{
    Query q;
    q.object = r.uuid();
    q.type = r.uuid();
    q.interface = r.uuid();
    q.position = r.u32();
    q.max_results = r.u32();
    return q;
}

inline void put_reply_head(Writer &w, const ReplyHead &h)
{
    w.u32(h.status);
    w.u32(h.position);
    w.u32(h.count);
}

inline ReplyHead get_reply_head(Reader &r)
{
    ReplyHead h;
    h.status = r.u32();
    h.position = r.u32();
    h.count = r.u32();
    return h;
}

// The body length a request of `kind` must have; 0 for a kind that isn't a request.
constexpr size_t request_body_size(Kind kind)
{
    switch (kind) {
    case Kind::kRegister:
    case Kind::kUnregister:
        return kEntrySize;
    case Kind::kLookup:
        return kLookupSize;
    case Kind::kReply:
        break;
    }
    return 0;
}

}  // namespace ncs::lb

#endif

// Marshalling support of the runtime for stubs: the Network Data
// Representation (NDR) of a call's body.
//
// A Writer lays a body down in this machine's representation; a sender never
// converts. A Reader takes a body in the sender's representation, told by the
// sender's drep, and converts while it reads: 2- and 4-byte integers are
// byte-reversed when the integer byte order differs, characters go through
// one of the two 256-byte translation tables when the character set differs,
// bytes are never converted. Between two machines of one representation
// every read is a plain or bulk copy.
//
// Alignment counts from the body's first byte, never from the packet's, so a
// body's layout doesn't depend on the bytes the runtime keeps in front of it.
// A 4-byte integer stands at a multiple of 4, a 2-byte integer at a multiple
// of 2; bytes and characters stand anywhere.
//
// Both classes are cheap values used by one thread for one body.
#ifndef NCS_NDR_H
#define NCS_NDR_H

#include "exc/exc1.h"
#include "ncs/ncs.h"

#include <cstdint>
#include <cstring>

namespace ncs::ndr {

// Writes a body from its first byte on. A gap in front of an aligned field is
// written as zero bytes; nothing trails the last field.
// REQUIRES: the buffer has room for everything written; stubs size it by an
// upper bound of the body worked out from its counts beforehand.
class Writer {
public:
    explicit Writer(void *body) : body_(static_cast<unsigned char *>(body)) {}

    // Advances to the next multiple of `n`, zeroing the gap.
    void align(uint32_t n)
    {
        while (pos_ % n != 0)
            body_[pos_++] = 0;
    }
    void put_u8(uint8_t value) { body_[pos_++] = value; }
    void put_u16(uint16_t value)
    {
        align(2);
        std::memcpy(body_ + pos_, &value, 2);
        pos_ += 2;
    }
    void put_u32(uint32_t value)
    {
        align(4);
        std::memcpy(body_ + pos_, &value, 4);
        pos_ += 4;
    }
    // A fixed array of bytes, unaligned.
    void put_bytes(const void *source, uint32_t count)
    {
        rpc__block_copy(source, body_ + pos_, count);
        pos_ += count;
    }
    // A fixed array of characters, in this machine's character set.
    void put_chars(const char *source, uint32_t count) { put_bytes(source, count); }

    // Bytes written so far: the body's length once the last field is down.
    uint32_t length() const { return pos_; }

private:
    unsigned char *body_;
    uint32_t pos_ = 0;
};

// Reads a body of `length` received bytes. Any read that would pass the end
// raises rpc__s_fault_invalid_bound with EXC1__Raise before it touches a byte
// behind the body; what was read until then stays read.
class Reader {
public:
    // `sender_drep` is the drep that came with the body, `local_drep` this
    // machine's; the tables translate ASCII to EBCDIC and back (256 bytes
    // each) and are only used when the character sets differ.
    Reader(const void *body, uint32_t length, uint32_t sender_drep, uint32_t local_drep,
           const unsigned char *ascii_to_ebcdic, const unsigned char *ebcdic_to_ascii)
        : body_(static_cast<const unsigned char *>(body)),
          length_(length),
          swap_(NCS_DREP_INT(sender_drep) != NCS_DREP_INT(local_drep)),
          chars_(NCS_DREP_CHAR(sender_drep) == NCS_DREP_CHAR(local_drep) ? nullptr
                 : NCS_DREP_CHAR(local_drep) == NCS_CHAR_ASCII          ? ebcdic_to_ascii
                                                                        : ascii_to_ebcdic)
    {
    }

    // True when integers of this body are byte-reversed on reading; when
    // false, a run of records whose memory layout is their wire layout may
    // be taken with one get_bytes.
    bool swaps_integers() const { return swap_; }

    // Advances to the next multiple of `n`; a position behind the end fails
    // at the next read.
    void align(uint32_t n) { pos_ = (pos_ + n - 1) / n * n; }
    uint8_t get_u8()
    {
        need(1);
        return body_[pos_++];
    }
    uint16_t get_u16()
    {
        align(2);
        need(2);
        uint16_t value;
        std::memcpy(&value, body_ + pos_, 2);
        pos_ += 2;
        return swap_ ? __builtin_bswap16(value) : value;
    }
    int16_t get_i16() { return static_cast<int16_t>(get_u16()); }
    uint32_t get_u32()
    {
        align(4);
        need(4);
        uint32_t value;
        std::memcpy(&value, body_ + pos_, 4);
        pos_ += 4;
        return swap_ ? __builtin_bswap32(value) : value;
    }
    // A fixed array of bytes, copied as it stands.
    void get_bytes(void *destination, uint32_t count)
    {
        need(count);
        rpc__block_copy(body_ + pos_, destination, count);
        pos_ += count;
    }
    // A fixed array of characters, translated into this machine's set.
    void get_chars(char *destination, uint32_t count)
    {
        if (chars_ == nullptr) {
            get_bytes(destination, count);
            return;
        }
        need(count);
        for (uint32_t i = 0; i < count; ++i)
            destination[i] = static_cast<char>(chars_[body_[pos_ + i]]);
        pos_ += count;
    }

private:
    void need(uint32_t count) const
    {
        if (pos_ > length_ || count > length_ - pos_)
            EXC1__Raise(EXC1_Thread(), rpc__s_fault_invalid_bound);
    }

    const unsigned char *body_;
    uint32_t length_;
    uint32_t pos_ = 0;
    bool swap_;
    const unsigned char *chars_;  // table of the translation, null when none
};

}  // namespace ncs::ndr

#endif

// An independent writer and reader of the eight bodies of dpx_transfer
// version 1, for tests: each body is a table of fields at fixed offsets, and
// a body can be written or read in any representation (byte order,
// character set), so tests can play a peer of another kind of machine.
#ifndef DPX_FOREIGN_BODY_H
#define DPX_FOREIGN_BODY_H

#include "dpx/dpx.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace dpxtest {

// The representation of a body's sender.
struct Rep {
    bool big_endian = false;
    bool ebcdic = false;
    uint8_t float_rep = 0;
    uint32_t drep() const;
    std::string name() const;
};
// This machine's.
Rep local_rep();

// Every value that travels in one of the bodies. The size and count words
// are max + 1 and last + 1 unless set; the array carries `chunks` or `nodes`
// whatever the words say.
struct Message {
    dpx_file_desc desc{};
    uint32_t crc = 0;
    uint8_t state = 0;
    uint32_t index = 0;
    int16_t last = -1;
    int16_t max = -1;
    uint32_t status = 0;
    uint32_t result = 0;
    std::string query;   // up to 1024 characters, NUL-filled on the wire
    std::string filter;  // up to 16
    std::optional<uint16_t> size_word;
    std::optional<uint16_t> count_word;
    std::vector<dpx_chunk> chunks;
    std::vector<std::string> nodes;  // up to 33 characters each

    uint16_t size() const { return size_word.value_or(static_cast<uint16_t>(max + 1)); }
    uint16_t count() const { return count_word.value_or(static_cast<uint16_t>(last + 1)); }
};

enum class Field { desc, crc, state, index, last, max, status, result, query, filter, size, count, chunks, nodes,
                   gap, element_gap };
struct Slot {
    Field field;
    uint32_t offset;
    uint32_t gap_length = 0;  // for gaps; an element gap exists only in front of an element
};
using Layout = std::vector<Slot>;

// The eight bodies.
extern const Layout kGetChunksRequest, kGetChunksReply, kPutChunksRequest, kPutChunksReply, kAgentQueryRequest,
    kAgentQueryReply, kListNodesRequest, kListNodesReply;

// Writes `message` by `layout` in `rep`. Gap bytes are filled with 0xA5,
// which no reader may look at.
std::vector<unsigned char> encode(const Layout &layout, const Message &message, Rep rep);
// Reads a body by `layout` in `rep`, taking the array's length from its
// count word. Fails the running test if the body's length isn't the one the
// layout gives, or if `zero_gaps` and a gap byte isn't 0.
Message decode(const Layout &layout, const std::vector<unsigned char> &body, Rep rep, bool zero_gaps = true);

// Test values: a descriptor with texts that use characters from all over
// the code page, and chunks with distinct indices, lengths and data.
dpx_file_desc sample_desc(const std::string &path);
std::vector<dpx_chunk> sample_chunks(size_t n, uint32_t first_index);
std::string text_of(const char *field, size_t length);
// Field by field, gaps aside.
bool same_desc(const dpx_file_desc &a, const dpx_file_desc &b);
bool same_chunks(const std::vector<dpx_chunk> &a, const dpx_chunk *b, size_t n);

}  // namespace dpxtest

#endif

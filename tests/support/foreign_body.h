// An independent writer and reader of the eight bodies of dpx_transfer
// version 1, for tests: each body is a table of fields at fixed offsets, and
// a body can be written or read in any representation (byte order,
// character set), so tests can play a peer of another kind of machine.
#ifndef DPX_FOREIGN_BODY_H
#define DPX_FOREIGN_BODY_H

#include "dpx/dpx.h"

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace dpxtest {

// The representation of a body's sender.
struct Rep {
    bool big_endian = false, ebcdic = false;
    uint8_t float_rep = 0;
    uint32_t drep() const
    {
        return NCS_DREP(big_endian ? NCS_INT_BIG : NCS_INT_LITTLE, ebcdic ? NCS_CHAR_EBCDIC : NCS_CHAR_ASCII,
                        float_rep);
    }
};
// This machine's.
inline Rep local_rep()
{
    return Rep{__BYTE_ORDER__ == __ORDER_BIG_ENDIAN__};
}

// An element of a node list, laid out as a dpx_node_name.
using Node = std::array<char, DPX_NODE_LEN>;

// Every value that travels in one of the bodies. The size and count words
// are max + 1 and last + 1 unless set; the array carries `chunks` or `nodes`
// whatever the words say.
struct Message {
    dpx_file_desc desc{};
    uint32_t crc = 0;
    uint8_t state = 0;
    uint32_t index = 0;
    int16_t last = -1, max = -1;
    uint32_t status = 0, result = 0;
    dpx_query_text query{};
    dpx_node_filter filter{};
    std::optional<uint16_t> size_word{}, count_word{};
    std::vector<dpx_chunk> chunks{};
    std::vector<Node> nodes{};

    uint16_t size() const { return size_word.value_or(static_cast<uint16_t>(max + 1)); }
    uint16_t count() const { return count_word.value_or(static_cast<uint16_t>(last + 1)); }
};
// Every value alike, every byte of texts and arrays included; the size and
// count words aside.
bool operator==(const Message &a, const Message &b);

enum class Field { desc, crc, state, index, last, max, status, result, query, filter, size, count, chunks, nodes };
// A body's fields in order, each at its offset; the bytes between them are gaps.
using Layout = std::vector<std::pair<Field, uint32_t>>;

extern const Layout kGetChunksRequest, kGetChunksReply, kPutChunksRequest, kPutChunksReply, kAgentQueryRequest,
    kAgentQueryReply, kListNodesRequest, kListNodesReply;

// Writes `message` by `layout` in `rep`, with `gap` in every gap byte.
std::vector<unsigned char> encode(const Layout &layout, Message message, Rep rep, unsigned char gap = 0xA5);
// Reads a body by `layout` in `rep`, taking the array's length from its
// count word; bytes that the body lacks read as zero.
Message decode(const Layout &layout, std::vector<unsigned char> body, Rep rep);

// Test values: a descriptor whose texts use characters from all over the
// code page, and chunks with distinct indices, lengths and data.
dpx_file_desc sample_desc(const std::string &path);
std::vector<dpx_chunk> sample_chunks(size_t n, uint32_t first_index);

}  // namespace dpxtest

#endif

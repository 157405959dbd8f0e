#include "foreign_body.h"

#include "nrtr/nrtr1.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>

namespace dpxtest {

uint32_t Rep::drep() const
{
    return NCS_DREP(big_endian ? NCS_INT_BIG : NCS_INT_LITTLE, ebcdic ? NCS_CHAR_EBCDIC : NCS_CHAR_ASCII,
                    float_rep);
}

std::string Rep::name() const
{
    std::string name = std::string(big_endian ? "big" : "little") + (ebcdic ? "_ebcdic" : "_ascii");
    return float_rep != 0 ? name + "_float" + std::to_string(float_rep) : name;
}

Rep local_rep()
{
    Rep rep;
    rep.big_endian = __BYTE_ORDER__ == __ORDER_BIG_ENDIAN__;
    return rep;
}

const Layout kGetChunksRequest = {
    {Field::desc, 0},     {Field::gap, 4149, 3}, {Field::crc, 4152},  {Field::state, 4156},
    {Field::gap, 4157, 3}, {Field::index, 4160},  {Field::last, 4164}, {Field::max, 4166},
    {Field::size, 4168},  {Field::count, 4170},  {Field::chunks, 4172},
};
const Layout kGetChunksReply = {
    {Field::desc, 0},      {Field::gap, 4149, 3},  {Field::crc, 4152},  {Field::state, 4156},
    {Field::gap, 4157, 3}, {Field::index, 4160},   {Field::last, 4164}, {Field::gap, 4166, 2},
    {Field::status, 4168}, {Field::size, 4172},    {Field::count, 4174}, {Field::chunks, 4176},
};
const Layout kPutChunksRequest = {
    {Field::desc, 0},     {Field::gap, 4149, 3}, {Field::crc, 4152},  {Field::state, 4156},
    {Field::gap, 4157, 1}, {Field::last, 4158},   {Field::max, 4160},  {Field::size, 4162},
    {Field::count, 4164}, {Field::element_gap, 4166, 2}, {Field::chunks, 4168},
};
const Layout kPutChunksReply = {
    {Field::last, 0}, {Field::gap, 2, 2}, {Field::status, 4}, {Field::size, 8}, {Field::count, 10},
    {Field::chunks, 12},
};
const Layout kAgentQueryRequest = {{Field::query, 0}, {Field::desc, 1024}};
const Layout kAgentQueryReply = {{Field::result, 0}, {Field::status, 4}};
const Layout kListNodesRequest = {
    {Field::filter, 0}, {Field::last, 16}, {Field::max, 18}, {Field::size, 20}, {Field::count, 22},
    {Field::nodes, 24},
};
const Layout kListNodesReply = {
    {Field::last, 0}, {Field::gap, 2, 2}, {Field::status, 4}, {Field::size, 8}, {Field::count, 10},
    {Field::nodes, 12},
};

namespace {

constexpr unsigned char kGapFill = 0xA5;

uint32_t field_size(const Slot &slot, size_t n)
{
    switch (slot.field) {
    case Field::desc: return 4149;
    case Field::crc: case Field::index: case Field::status: case Field::result: return 4;
    case Field::state: return 1;
    case Field::last: case Field::max: case Field::size: case Field::count: return 2;
    case Field::query: return DPX_QUERY_LEN;
    case Field::filter: return DPX_FILTER_LEN;
    case Field::chunks: return static_cast<uint32_t>(n * sizeof(dpx_chunk));
    case Field::nodes: return static_cast<uint32_t>(n * DPX_NODE_LEN);
    case Field::gap: return slot.gap_length;
    case Field::element_gap: return n > 0 ? slot.gap_length : 0;
    }
    return 0;
}

size_t body_length(const Layout &layout, size_t n)
{
    size_t end = 0;
    for (const Slot &slot : layout) {
        uint32_t size = field_size(slot, n);
        if (size > 0)
            end = std::max<size_t>(end, slot.offset + size);
    }
    return end;
}

// Fields at offsets of one body, in one representation.
class Body {
public:
    Body(std::vector<unsigned char> &bytes, Rep rep) : bytes_(bytes), rep_(rep) {}

    void put16(size_t at, uint16_t value) { put(at, value, 2); }
    void put32(size_t at, uint32_t value) { put(at, value, 4); }
    uint16_t get16(size_t at) const { return static_cast<uint16_t>(get(at, 2)); }
    uint32_t get32(size_t at) const { return static_cast<uint32_t>(get(at, 4)); }
    void put_chars(size_t at, const char *text, size_t n)
    {
        for (size_t i = 0; i < n; ++i) {
            auto c = static_cast<unsigned char>(text[i]);
            bytes_[at + i] = rep_.ebcdic ? NRTR1_AsciiToEbcdic()[c] : c;
        }
    }
    void get_chars(size_t at, char *text, size_t n) const
    {
        for (size_t i = 0; i < n; ++i) {
            unsigned char c = bytes_[at + i];
            text[i] = static_cast<char>(rep_.ebcdic ? NRTR1_EbcdicToAscii()[c] : c);
        }
    }
    void put_desc(size_t at, const dpx_file_desc &desc)
    {
        put_chars(at, desc.node, DPX_NODE_LEN);
        put_chars(at + 33, desc.path, DPX_PATH_LEN);
        std::memset(&bytes_[at + 4129], kGapFill, 3);
        put32(at + 4132, desc.size.chunks);
        put32(at + 4136, desc.size.remainder);
        put32(at + 4140, desc.mtime.low);
        put32(at + 4144, desc.mtime.high);
        bytes_[at + 4148] = desc.reserved;
    }
    dpx_file_desc get_desc(size_t at, bool zero_gaps) const
    {
        dpx_file_desc desc{};
        get_chars(at, desc.node, DPX_NODE_LEN);
        get_chars(at + 33, desc.path, DPX_PATH_LEN);
        if (zero_gaps)
            check_gap(at + 4129, 3);
        desc.size.chunks = get32(at + 4132);
        desc.size.remainder = get32(at + 4136);
        desc.mtime.low = get32(at + 4140);
        desc.mtime.high = get32(at + 4144);
        desc.reserved = bytes_[at + 4148];
        return desc;
    }
    void put_chunk(size_t at, const dpx_chunk &chunk)
    {
        put32(at, chunk.index);
        put32(at + 4, chunk.length);
        std::memcpy(&bytes_[at + 8], chunk.data, DPX_CHUNK_SIZE);
    }
    dpx_chunk get_chunk(size_t at) const
    {
        dpx_chunk chunk;
        chunk.index = get32(at);
        chunk.length = get32(at + 4);
        std::memcpy(chunk.data, &bytes_[at + 8], DPX_CHUNK_SIZE);
        return chunk;
    }
    void check_gap(size_t at, size_t n) const
    {
        for (size_t i = 0; i < n; ++i)
            EXPECT_EQ(bytes_[at + i], 0) << "gap byte at offset " << at + i;
    }

private:
    void put(size_t at, uint32_t value, size_t n)
    {
        for (size_t i = 0; i < n; ++i) {
            size_t shift = rep_.big_endian ? 8 * (n - 1 - i) : 8 * i;
            bytes_[at + i] = static_cast<unsigned char>(value >> shift);
        }
    }
    uint32_t get(size_t at, size_t n) const
    {
        uint32_t value = 0;
        for (size_t i = 0; i < n; ++i) {
            size_t shift = rep_.big_endian ? 8 * (n - 1 - i) : 8 * i;
            value |= static_cast<uint32_t>(bytes_[at + i]) << shift;
        }
        return value;
    }

    std::vector<unsigned char> &bytes_;
    Rep rep_;
};

std::vector<char> fixed_text(const std::string &text, size_t width)
{
    std::vector<char> field(width, '\0');
    std::memcpy(field.data(), text.data(), std::min(text.size(), width));
    return field;
}

size_t element_count(const Layout &layout, const Message &message)
{
    for (const Slot &slot : layout) {
        if (slot.field == Field::chunks)
            return message.chunks.size();
        if (slot.field == Field::nodes)
            return message.nodes.size();
    }
    return 0;
}

}  // namespace

std::vector<unsigned char> encode(const Layout &layout, const Message &message, Rep rep)
{
    const size_t n = element_count(layout, message);
    std::vector<unsigned char> bytes(body_length(layout, n), 0);
    Body body(bytes, rep);
    for (const Slot &slot : layout) {
        const size_t at = slot.offset;
        switch (slot.field) {
        case Field::desc: body.put_desc(at, message.desc); break;
        case Field::crc: body.put32(at, message.crc); break;
        case Field::state: bytes[at] = message.state; break;
        case Field::index: body.put32(at, message.index); break;
        case Field::last: body.put16(at, static_cast<uint16_t>(message.last)); break;
        case Field::max: body.put16(at, static_cast<uint16_t>(message.max)); break;
        case Field::status: body.put32(at, message.status); break;
        case Field::result: body.put32(at, message.result); break;
        case Field::query: body.put_chars(at, fixed_text(message.query, DPX_QUERY_LEN).data(), DPX_QUERY_LEN); break;
        case Field::filter:
            body.put_chars(at, fixed_text(message.filter, DPX_FILTER_LEN).data(), DPX_FILTER_LEN);
            break;
        case Field::size: body.put16(at, message.size()); break;
        case Field::count: body.put16(at, message.count()); break;
        case Field::chunks:
            for (size_t i = 0; i < n; ++i)
                body.put_chunk(at + i * sizeof(dpx_chunk), message.chunks[i]);
            break;
        case Field::nodes:
            for (size_t i = 0; i < n; ++i)
                body.put_chars(at + i * DPX_NODE_LEN, fixed_text(message.nodes[i], DPX_NODE_LEN).data(),
                               DPX_NODE_LEN);
            break;
        case Field::gap:
        case Field::element_gap: std::memset(&bytes[at], kGapFill, field_size(slot, n)); break;
        }
    }
    return bytes;
}

Message decode(const Layout &layout, const std::vector<unsigned char> &bytes, Rep rep, bool zero_gaps)
{
    Message message;
    std::vector<unsigned char> copy = bytes;
    Body body(copy, rep);
    size_t n = 0;
    for (const Slot &slot : layout)
        if (slot.field == Field::count && slot.offset + 2 <= bytes.size())
            n = body.get16(slot.offset);
    if (bytes.size() != body_length(layout, n)) {
        ADD_FAILURE() << "body of " << bytes.size() << " bytes, expected " << body_length(layout, n);
        return message;
    }
    for (const Slot &slot : layout) {
        const size_t at = slot.offset;
        switch (slot.field) {
        case Field::desc: message.desc = body.get_desc(at, zero_gaps); break;
        case Field::crc: message.crc = body.get32(at); break;
        case Field::state: message.state = bytes[at]; break;
        case Field::index: message.index = body.get32(at); break;
        case Field::last: message.last = static_cast<int16_t>(body.get16(at)); break;
        case Field::max: message.max = static_cast<int16_t>(body.get16(at)); break;
        case Field::status: message.status = body.get32(at); break;
        case Field::result: message.result = body.get32(at); break;
        case Field::query: {
            std::vector<char> text(DPX_QUERY_LEN);
            body.get_chars(at, text.data(), DPX_QUERY_LEN);
            message.query = text_of(text.data(), DPX_QUERY_LEN);
            break;
        }
        case Field::filter: {
            char text[DPX_FILTER_LEN];
            body.get_chars(at, text, DPX_FILTER_LEN);
            message.filter = text_of(text, DPX_FILTER_LEN);
            break;
        }
        case Field::size: message.size_word = body.get16(at); break;
        case Field::count: message.count_word = body.get16(at); break;
        case Field::chunks:
            for (size_t i = 0; i < n; ++i)
                message.chunks.push_back(body.get_chunk(at + i * sizeof(dpx_chunk)));
            break;
        case Field::nodes:
            for (size_t i = 0; i < n; ++i) {
                char name[DPX_NODE_LEN];
                body.get_chars(at + i * DPX_NODE_LEN, name, DPX_NODE_LEN);
                message.nodes.push_back(text_of(name, DPX_NODE_LEN));
            }
            break;
        case Field::gap:
        case Field::element_gap:
            if (zero_gaps)
                body.check_gap(at, field_size(slot, n));
            break;
        }
    }
    return message;
}

dpx_file_desc sample_desc(const std::string &path)
{
    dpx_file_desc desc{};
    std::memcpy(desc.node, "n\xC4\xE9-7{}", 8);
    std::memcpy(desc.path, path.data(), std::min<size_t>(path.size(), DPX_PATH_LEN));
    // Behind the text's NUL, every byte value: the whole field travels and
    // every character is translated.
    for (size_t i = path.size() + 1; i < DPX_PATH_LEN; ++i)
        desc.path[i] = static_cast<char>(i * 7);
    desc.size = {0x01020304u, 4095};
    desc.mtime = {0x5F3759DFu, 0};
    desc.reserved = 0xC1;  // 'A' in EBCDIC: must arrive as it is
    return desc;
}

std::vector<dpx_chunk> sample_chunks(size_t n, uint32_t first_index)
{
    std::vector<dpx_chunk> chunks(n);
    for (size_t i = 0; i < n; ++i) {
        chunks[i].index = first_index + static_cast<uint32_t>(i);
        chunks[i].length = static_cast<uint32_t>((i * 1237 + 0x0102) % (DPX_CHUNK_SIZE + 1));
        for (size_t j = 0; j < DPX_CHUNK_SIZE; ++j)
            chunks[i].data[j] = static_cast<unsigned char>(j * 13 + i * 31 + 0xC1);
    }
    return chunks;
}

std::string text_of(const char *field, size_t length)
{
    return std::string(field, strnlen(field, length));
}

bool same_desc(const dpx_file_desc &a, const dpx_file_desc &b)
{
    return std::memcmp(a.node, b.node, DPX_NODE_LEN) == 0 && std::memcmp(a.path, b.path, DPX_PATH_LEN) == 0 &&
           a.size.chunks == b.size.chunks && a.size.remainder == b.size.remainder && a.mtime.low == b.mtime.low &&
           a.mtime.high == b.mtime.high && a.reserved == b.reserved;
}

bool same_chunks(const std::vector<dpx_chunk> &a, const dpx_chunk *b, size_t n)
{
    return a.size() == n && (n == 0 || std::memcmp(a.data(), b, n * sizeof(dpx_chunk)) == 0);
}

}  // namespace dpxtest

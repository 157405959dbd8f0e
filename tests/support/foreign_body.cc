#include "foreign_body.h"

#include "nrtr/nrtr1.h"

#include <algorithm>
#include <cstring>

namespace dpxtest {

using enum Field;
const Layout kGetChunksRequest = {{desc, 0},     {crc, 4152},  {state, 4156}, {index, 4160}, {last, 4164},
                                  {max, 4166},   {size, 4168}, {count, 4170}, {chunks, 4172}};
const Layout kGetChunksReply = {{desc, 0},      {crc, 4152},  {state, 4156}, {index, 4160}, {last, 4164},
                                {status, 4168}, {size, 4172}, {count, 4174}, {chunks, 4176}};
// The gap at 4166 belongs to the first element: with none the body ends there.
const Layout kPutChunksRequest = {{desc, 0},   {crc, 4152},  {state, 4156}, {last, 4158},
                                  {max, 4160}, {size, 4162}, {count, 4164}, {chunks, 4168}};
const Layout kPutChunksReply = {{last, 0}, {status, 4}, {size, 8}, {count, 10}, {chunks, 12}};
const Layout kAgentQueryRequest = {{query, 0}, {desc, 1024}};
const Layout kAgentQueryReply = {{result, 0}, {status, 4}};
const Layout kListNodesRequest = {{filter, 0}, {last, 16}, {max, 18}, {size, 20}, {count, 22}, {nodes, 24}};
const Layout kListNodesReply = {{last, 0}, {status, 4}, {size, 8}, {count, 10}, {nodes, 12}};

// Two messages are alike when they write alike: every field but the size
// and count words, nodes apart since their offset depends on the chunks.
bool operator==(const Message &a, const Message &b)
{
    static const Layout kAll = {{desc, 0},      {crc, 4152},    {state, 4156},   {index, 4160},  {last, 4164},
                                {max, 4166},    {status, 4168}, {result, 4172},  {query, 4176},  {filter, 5200},
                                {chunks, 5216}};
    static const Layout kNodes = {{nodes, 0}};
    return encode(kAll, a, local_rep()) == encode(kAll, b, local_rep()) &&
           encode(kNodes, a, local_rep()) == encode(kNodes, b, local_rep());
}

namespace {

// Moves the fields of a message to or from the bytes of a body in one
// representation. The body grows to what is touched, with `gap` in the
// bytes between fields.
struct Body {
    std::vector<unsigned char> &bytes;
    const Rep rep;
    const bool write;
    const unsigned char gap;

    void move(const Layout &layout, Message &m)
    {
        for (const auto &[field, at] : layout) {
            switch (field) {
            case desc: file_block(at, m.desc); break;
            case crc: integer(at, m.crc); break;
            case state: integer(at, m.state); break;
            case index: integer(at, m.index); break;
            case last: integer(at, m.last); break;
            case max: integer(at, m.max); break;
            case status: integer(at, m.status); break;
            case result: integer(at, m.result); break;
            case query: chars(at, m.query, DPX_QUERY_LEN); break;
            case filter: chars(at, m.filter, DPX_FILTER_LEN); break;
            case size: integer(at, m.size_word.emplace(m.size())); break;
            case count: integer(at, m.count_word.emplace(m.count())); break;
            case chunks:
                if (!write)
                    m.chunks.resize(m.count());
                for (size_t i = 0; i < m.chunks.size(); ++i) {
                    integer(at + i * 4104, m.chunks[i].index);
                    integer(at + i * 4104 + 4, m.chunks[i].length);
                    copy(at + i * 4104 + 8, m.chunks[i].data, DPX_CHUNK_SIZE);
                }
                break;
            case nodes:
                if (!write)
                    m.nodes.resize(m.count());
                for (size_t i = 0; i < m.nodes.size(); ++i)
                    chars(at + i * DPX_NODE_LEN, m.nodes[i].data(), DPX_NODE_LEN);
                break;
            }
        }
    }
    // `n` bytes between the body at `at` and `data`, each through `table`
    // if there is one, in reverse order if `reverse`.
    void copy(size_t at, void *data, size_t n, const unsigned char *table = nullptr, bool reverse = false)
    {
        if (bytes.size() < at + n)
            bytes.resize(at + n, gap);
        for (size_t i = 0; i < n; ++i) {
            unsigned char &wire = bytes[at + (reverse ? n - 1 - i : i)];
            unsigned char &host = static_cast<unsigned char *>(data)[i];
            unsigned char &to = write ? wire : host;
            const unsigned char from = write ? host : wire;
            to = table != nullptr ? table[from] : from;
        }
    }
    // In the sender's byte order.
    void integer(size_t at, auto &v) { copy(at, &v, sizeof v, nullptr, rep.big_endian != local_rep().big_endian); }
    // In the sender's character set.
    void chars(size_t at, char *text, size_t n)
    {
        copy(at, text, n, !rep.ebcdic ? nullptr : write ? NRTR1_AsciiToEbcdic() : NRTR1_EbcdicToAscii());
    }
    void file_block(size_t at, dpx_file_desc &d)
    {
        chars(at, d.node, DPX_NODE_LEN);
        chars(at + 33, d.path, DPX_PATH_LEN);
        integer(at + 4132, d.size.chunks);
        integer(at + 4136, d.size.remainder);
        integer(at + 4140, d.mtime.low);
        integer(at + 4144, d.mtime.high);
        integer(at + 4148, d.reserved);
    }
};

}  // namespace

std::vector<unsigned char> encode(const Layout &layout, Message message, Rep rep, unsigned char gap)
{
    std::vector<unsigned char> bytes;
    Body{bytes, rep, true, gap}.move(layout, message);
    return bytes;
}

Message decode(const Layout &layout, std::vector<unsigned char> body, Rep rep)
{
    Message message;
    Body{body, rep, false, 0}.move(layout, message);
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

}  // namespace dpxtest

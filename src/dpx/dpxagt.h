// The stubs of the interface dpx_transfer version 1: layout of its eight
// bodies, the bounds that buffers are chosen by, and what the client stubs
// (dpxagtc) and the server stubs (dpxagts) share. Internal to the library.
//
// A body is written in the writer's own representation and read through
// ncs::ndr::Reader, which converts and never reads past the received length.
// Arrays travel as two 16-bit words, size (max + 1) and count (last + 1), and
// count elements. The stubs attach no meaning to any field and write no trace.
#ifndef DPX_DPXAGT_H
#define DPX_DPXAGT_H

#include "dpx/dpx.h"
#include "exc/exc1.h"
#include "ncs/ndr.h"
#include "nrtr/nrtr1.h"
#include "plt/plt1.h"

#include <cstdint>

// ======================================================================
// Body layouts
// ======================================================================

// Operation numbers: the slots of every entry-point vector.
enum : uint32_t {
    DPX_OP_GET_CHUNKS = 0,
    DPX_OP_PUT_CHUNKS = 1,
    DPX_OP_AGENT_QUERY = 2,
    DPX_OP_LIST_NODES = 3,
    DPX_OP_COUNT = 4
};

// The alignment rule of a body, worked at compile time: a field of `size`
// bytes follows the previous one at the next multiple of its alignment.
struct dpx_wire_layout {
    uint32_t end;
    constexpr dpx_wire_layout field(uint32_t size, uint32_t alignment) const
    {
        return {(end + alignment - 1) / alignment * alignment + size};
    }
};
constexpr dpx_wire_layout DPX_WIRE_START = {0};

// A dpx_file_desc inside a body: node, path, size.chunks, size.remainder,
// mtime.low, mtime.high, reserved. It always begins at a multiple of 4.
constexpr uint32_t DPX_WIRE_FILE_BLOCK =
    DPX_WIRE_START.field(DPX_NODE_LEN, 1).field(DPX_PATH_LEN, 1).field(4, 4).field(4, 4).field(4, 4).field(4, 4)
        .field(1, 1)
        .end;
// A dpx_chunk inside a body: index, length, data; each begins at a multiple
// of 4, so their wire layout is their memory layout.
constexpr uint32_t DPX_WIRE_CHUNK = DPX_WIRE_START.field(4, 4).field(4, 4).field(DPX_CHUNK_SIZE, 1).end;
// A chunk with the worst-case gap of 3 in front of it, for upper bounds.
constexpr uint32_t DPX_WIRE_CHUNK_BOUND = DPX_WIRE_CHUNK + 3;
// A dpx_node_name inside a body: 33 characters at any offset.
constexpr uint32_t DPX_WIRE_NODE = DPX_NODE_LEN;

static_assert(DPX_WIRE_FILE_BLOCK == 4149, "file block is 4149 bytes");
static_assert(DPX_WIRE_CHUNK == sizeof(dpx_chunk) && DPX_WIRE_CHUNK == 4104, "chunk element is a dpx_chunk");
static_assert(DPX_WIRE_NODE == sizeof(dpx_node_name), "node element is a dpx_node_name");

// Each body up to its array's elements (the head), in the order of the
// operation's argument list. An array's first element is aligned for itself,
// so its gap exists only when there is an element.
constexpr dpx_wire_layout DPX_GET_REQUEST_HEAD = DPX_WIRE_START.field(DPX_WIRE_FILE_BLOCK, 4)
                                                     .field(4, 4)   // crc
                                                     .field(1, 1)   // state
                                                     .field(4, 4)   // index
                                                     .field(2, 2)   // last
                                                     .field(2, 2)   // max
                                                     .field(2, 2)   // size
                                                     .field(2, 2);  // count
constexpr dpx_wire_layout DPX_GET_REPLY_HEAD = DPX_WIRE_START.field(DPX_WIRE_FILE_BLOCK, 4)
                                                   .field(4, 4)   // crc
                                                   .field(1, 1)   // state
                                                   .field(4, 4)   // index
                                                   .field(2, 2)   // last
                                                   .field(4, 4)   // status
                                                   .field(2, 2)   // size
                                                   .field(2, 2);  // count
constexpr dpx_wire_layout DPX_PUT_REQUEST_HEAD = DPX_WIRE_START.field(DPX_WIRE_FILE_BLOCK, 4)
                                                     .field(4, 4)   // crc
                                                     .field(1, 1)   // state
                                                     .field(2, 2)   // last
                                                     .field(2, 2)   // max
                                                     .field(2, 2)   // size
                                                     .field(2, 2);  // count
constexpr dpx_wire_layout DPX_PUT_REPLY_HEAD = DPX_WIRE_START.field(2, 2)   // last
                                                   .field(4, 4)   // status
                                                   .field(2, 2)   // size
                                                   .field(2, 2);  // count
constexpr dpx_wire_layout DPX_QUERY_REQUEST = DPX_WIRE_START.field(DPX_QUERY_LEN, 1).field(DPX_WIRE_FILE_BLOCK, 4);
constexpr dpx_wire_layout DPX_QUERY_REPLY = DPX_WIRE_START.field(4, 4).field(4, 4);  // result, status
constexpr dpx_wire_layout DPX_LIST_REQUEST_HEAD = DPX_WIRE_START.field(DPX_FILTER_LEN, 1)
                                                      .field(2, 2)   // last
                                                      .field(2, 2)   // max
                                                      .field(2, 2)   // size
                                                      .field(2, 2);  // count
constexpr dpx_wire_layout DPX_LIST_REPLY_HEAD = DPX_PUT_REPLY_HEAD;

static_assert(DPX_GET_REQUEST_HEAD.end == 4172 && DPX_GET_REPLY_HEAD.end == 4176, "get_chunks heads");
static_assert(DPX_PUT_REQUEST_HEAD.end == 4166 && DPX_PUT_REPLY_HEAD.end == 12, "put_chunks heads");
static_assert(DPX_QUERY_REQUEST.end == 5173 && DPX_QUERY_REPLY.end == 8, "agent_query bodies");
static_assert(DPX_LIST_REQUEST_HEAD.end == 24 && DPX_LIST_REPLY_HEAD.end == 12, "list_nodes heads");

// Exact length of a body with n chunk or node elements.
constexpr uint32_t dpx_wire_chunks_length(dpx_wire_layout head, uint32_t n)
{
    return n == 0 ? head.end : head.field(n * DPX_WIRE_CHUNK, 4).end;
}
constexpr uint32_t dpx_wire_nodes_length(dpx_wire_layout head, uint32_t n)
{
    return head.field(n * DPX_WIRE_NODE, 1).end;
}
static_assert(dpx_wire_chunks_length(DPX_PUT_REQUEST_HEAD, 1) == 4168 + 4104, "put_chunks request elements at 4168");
static_assert(dpx_wire_chunks_length(DPX_GET_REPLY_HEAD, 128) == 529488, "largest body in use");

// ======================================================================
// Bounds
// ======================================================================

// Upper bounds of each body, without the runtime's data_offs, from the
// highest index in use. A buffer is chosen and allocated by these; `last` is
// at least -1 wherever they are worked out.
constexpr uint32_t dpx_elements(int16_t last)
{
    return static_cast<uint32_t>(last + 1);
}
constexpr uint32_t dpx_get_request_bound(int16_t last)
{
    return dpx_elements(last) * DPX_WIRE_CHUNK_BOUND + 4174;
}
constexpr uint32_t dpx_get_reply_bound(int16_t last)
{
    return dpx_elements(last) * DPX_WIRE_CHUNK_BOUND + 4178;
}
constexpr uint32_t dpx_put_request_bound(int16_t last)
{
    return dpx_elements(last) * DPX_WIRE_CHUNK_BOUND + 4168;
}
constexpr uint32_t dpx_put_reply_bound(int16_t last)
{
    return dpx_elements(last) * DPX_WIRE_CHUNK_BOUND + 14;
}
constexpr uint32_t DPX_QUERY_REQUEST_BOUND = 5173;
constexpr uint32_t DPX_QUERY_REPLY_BOUND = 8;
constexpr uint32_t dpx_list_request_bound(int16_t last)
{
    return dpx_elements(last) * DPX_WIRE_NODE + 25;
}
constexpr uint32_t dpx_list_reply_bound(int16_t last)
{
    return dpx_elements(last) * DPX_WIRE_NODE + 12;
}

// Each bound covers its body: at no elements, and per element (the slope
// takes a worst-case gap).
static_assert(dpx_get_request_bound(-1) >= DPX_GET_REQUEST_HEAD.end &&
                  dpx_get_request_bound(0) >= dpx_wire_chunks_length(DPX_GET_REQUEST_HEAD, 1),
              "get_chunks request bound");
static_assert(dpx_get_reply_bound(-1) >= DPX_GET_REPLY_HEAD.end &&
                  dpx_get_reply_bound(0) >= dpx_wire_chunks_length(DPX_GET_REPLY_HEAD, 1),
              "get_chunks reply bound");
static_assert(dpx_put_request_bound(-1) >= DPX_PUT_REQUEST_HEAD.end &&
                  dpx_put_request_bound(0) >= dpx_wire_chunks_length(DPX_PUT_REQUEST_HEAD, 1),
              "put_chunks request bound");
static_assert(dpx_put_reply_bound(-1) >= DPX_PUT_REPLY_HEAD.end &&
                  dpx_put_reply_bound(0) >= dpx_wire_chunks_length(DPX_PUT_REPLY_HEAD, 1),
              "put_chunks reply bound");
static_assert(DPX_QUERY_REQUEST_BOUND == DPX_QUERY_REQUEST.end && DPX_QUERY_REPLY_BOUND == DPX_QUERY_REPLY.end,
              "agent_query bounds");
static_assert(dpx_list_request_bound(-1) >= DPX_LIST_REQUEST_HEAD.end &&
                  dpx_list_reply_bound(-1) >= DPX_LIST_REPLY_HEAD.end,
              "list_nodes bounds");

// The most elements a server stub takes in one array. The callers never send
// more than 128 (transfer buffers hold 24 to 128 records, the Java bridge
// passes 128 node names); 254 leaves a margin of two for peers with larger
// buffers, and is the most for which the largest reply still fits the
// carrier's limit on a body (RPC_MAX_BODY), so a server never builds a reply
// it can't send. A request, whatever its size word claims, thus makes a
// server take at most 254 x 4104 bytes (1 MiB) for its array, where the
// 16-bit word alone would allow 65,535 x 4104 (256 MiB) before a single
// element arrived.
#define DPX_RPC_MAX_ELEMENTS 254

static_assert(dpx_get_reply_bound(DPX_RPC_MAX_ELEMENTS - 1) <= RPC_MAX_BODY &&
                  dpx_get_reply_bound(DPX_RPC_MAX_ELEMENTS) > RPC_MAX_BODY,
              "the largest array is the largest whose reply fits a body of the carrier");
static_assert(dpx_get_reply_bound(DPX_RPC_MAX_ELEMENTS - 1) < UINT32_MAX / 2, "bounds stay far inside 32 bits");

// ======================================================================
// Shared by both stub groups
// ======================================================================

// The record of a stub group, filled once per process by NRTR1_InitData
// under the group's gate. The gate is read without a lock: a negative value
// means the record is complete and won't change; otherwise
// PLT1_InitializeOnce holds every arrival back until the one fill has run.
inline const IDLBASE_DATA &dpx_stub_data(volatile int32_t *gate, IDLBASE_DATA *data, const char *file, int line)
{
    if (__atomic_load_n(gate, __ATOMIC_ACQUIRE) >= 0)
        PLT1_InitializeOnce(gate, NRTR1_InitData, data, file, line);
    return *data;
}

// A reader of the body of `length` bytes at packet + data_offs, written in
// `drep`, converting into the representation of `data`.
inline ncs::ndr::Reader dpx_body_reader(const IDLBASE_DATA &data, uint32_t drep, const void *packet,
                                        uint16_t data_offs, uint32_t length)
{
    return ncs::ndr::Reader(static_cast<const unsigned char *>(packet) + data_offs, length, drep, data.drep,
                            data.ascii_to_ebcdic, data.ebcdic_to_ascii);
}

[[noreturn]] inline void dpx_raise_bound()
{
    EXC1__Raise(EXC1_Thread(), DPX_RPC_FAULT_INVALID_BOUND);
}

// Raises DPX_RPC_FAULT_INVALID_BOUND unless `last` is at least -1 and its
// count, last + 1, fits the array's size, max + 1, compared as the unsigned
// 16-bit words that travel. Made before a buffer is chosen by a bound that
// rests on `last`, so a refused array leaves nothing written or taken.
inline void dpx_check_last(int16_t last, int16_t max)
{
    if (last < -1 || static_cast<uint16_t>(last + 1) > static_cast<uint16_t>(max + 1))
        dpx_raise_bound();
}

inline void dpx_put_file_block(ncs::ndr::Writer &writer, const dpx_file_desc &desc)
{
    writer.put_chars(desc.node, DPX_NODE_LEN);
    writer.put_chars(desc.path, DPX_PATH_LEN);
    writer.put_u32(desc.size.chunks);
    writer.put_u32(desc.size.remainder);
    writer.put_u32(desc.mtime.low);
    writer.put_u32(desc.mtime.high);
    writer.put_u8(desc.reserved);
}

inline void dpx_get_file_block(ncs::ndr::Reader &reader, dpx_file_desc &desc)
{
    reader.get_chars(desc.node, DPX_NODE_LEN);
    reader.get_chars(desc.path, DPX_PATH_LEN);
    desc.size.chunks = reader.get_u32();
    desc.size.remainder = reader.get_u32();
    desc.mtime.low = reader.get_u32();
    desc.mtime.high = reader.get_u32();
    desc.reserved = reader.get_u8();
}

// Size and count words of an array of highest index `max`, `last` in use.
// REQUIRES: dpx_check_last(last, max) has passed.
inline void dpx_put_array_words(ncs::ndr::Writer &writer, int16_t last, int16_t max)
{
    writer.put_u16(static_cast<uint16_t>(max + 1));
    writer.put_u16(static_cast<uint16_t>(last + 1));
}

// `count` chunk elements: one aligned bulk copy, since a dpx_chunk in memory
// is its own wire layout in this machine's representation.
inline void dpx_put_chunk_elements(ncs::ndr::Writer &writer, const dpx_chunk *chunks, uint32_t count)
{
    if (count == 0)
        return;
    writer.align(4);
    writer.put_bytes(chunks, count * DPX_WIRE_CHUNK);
}

// `count` chunk elements into chunks[0 .. count - 1]: a bulk copy when the
// integers need no conversion, field by field when they do; `data` is never
// converted.
inline void dpx_get_chunk_elements(ncs::ndr::Reader &reader, dpx_chunk *chunks, uint32_t count)
{
    if (count == 0)
        return;
    if (!reader.swaps_integers()) {
        reader.align(4);
        reader.get_bytes(chunks, count * DPX_WIRE_CHUNK);
        return;
    }
    for (uint32_t i = 0; i < count; ++i) {
        chunks[i].index = reader.get_u32();
        chunks[i].length = reader.get_u32();
        reader.get_bytes(chunks[i].data, DPX_CHUNK_SIZE);
    }
}

// `count` node elements: characters at a stride of 33, with no gaps.
inline void dpx_put_node_elements(ncs::ndr::Writer &writer, const dpx_node_name *nodes, uint32_t count)
{
    if (count != 0)
        writer.put_chars(reinterpret_cast<const char *>(nodes), count * DPX_WIRE_NODE);
}

inline void dpx_get_node_elements(ncs::ndr::Reader &reader, dpx_node_name *nodes, uint32_t count)
{
    if (count != 0)
        reader.get_chars(reinterpret_cast<char *>(nodes), count * DPX_WIRE_NODE);
}

// ======================================================================
// The stubs
// ======================================================================

extern "C" {

// Client stubs, reached through dpx_transfer_v1_client_epv. Each writes the
// request, calls rpc__sar and reads the reply into its arguments. A failure
// of the runtime's communication module (0x1C01xxxx) returns normally with
// the status in `*status` and the in-out arguments as they were; any other
// fault, DPX_RPC_FAULT_INVALID_BOUND included, is raised on with EXC1__Raise.
// Every packet taken is given back on both paths.
void dpx_get_chunks_csr(handle_t handle, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index,
                        int16_t *last, int16_t max, dpx_status *status, dpx_chunk buffer[]);
void dpx_put_chunks_csr(handle_t handle, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last,
                        int16_t max, dpx_status *status, dpx_chunk buffer[]);
void dpx_agent_query_csr(handle_t handle, dpx_query_text query, dpx_file_desc desc, uint32_t *result,
                         dpx_status *status);
void dpx_list_nodes_csr(handle_t handle, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                        dpx_node_name nodes[]);

// Server stubs, with the argument list of rpc__server_stub_t; `in_len` is
// the request body's length without data_offs. Each reads the request,
// calls its slot of `mgr_epv` (a dpx_transfer_v1_epv_t) and writes the reply
// into `out_pkt` or a new packet (`*must_free`). A request whose array words
// disagree with its `max` and `last`, whose `last` is below -1, whose size is
// above DPX_RPC_MAX_ELEMENTS or that ends before its fields do is refused
// with a raise of DPX_RPC_FAULT_INVALID_BOUND before the manager runs; a
// manager that leaves `last` outside -1 .. max gets the same raise and no
// reply. A raise leaves `*st` unset and no packet behind.
void dpx_get_chunks_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                        uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                        unsigned char *must_free, uint32_t *st);
void dpx_put_chunks_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                        uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                        unsigned char *must_free, uint32_t *st);
void dpx_agent_query_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                         uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                         unsigned char *must_free, uint32_t *st);
void dpx_list_nodes_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                        uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                        unsigned char *must_free, uint32_t *st);

// The server stubs by operation number; dpx_transfer_v1_server_epv points here.
extern const rpc__server_stub_t dpx_transfer_v1_server_epva[DPX_OP_COUNT];

}  // extern "C"

// The client stubs' readers of the four replies, straight into the caller's
// arguments, in the representation `reader` converts from. They raise
// DPX_RPC_FAULT_INVALID_BOUND for a reply whose count word is above max + 1
// or isn't its `last` field plus 1, or whose `last` is below -1 (the fields
// in front of the array are delivered by then; `*last` and the array are
// left as they were), and for a body that ends before its fields do (what
// came before the end is delivered). `*last` is set only once its elements
// are in.
void dpx_read_get_chunks_reply(ncs::ndr::Reader &reader, dpx_file_desc *desc, uint32_t *crc, uint8_t *state,
                               uint32_t *index, int16_t *last, int16_t max, dpx_status *status,
                               dpx_chunk buffer[]);
void dpx_read_put_chunks_reply(ncs::ndr::Reader &reader, int16_t *last, int16_t max, dpx_status *status,
                               dpx_chunk buffer[]);
void dpx_read_agent_query_reply(ncs::ndr::Reader &reader, uint32_t *result, dpx_status *status);
void dpx_read_list_nodes_reply(ncs::ndr::Reader &reader, int16_t *last, int16_t max, dpx_status *status,
                               dpx_node_name nodes[]);

#endif

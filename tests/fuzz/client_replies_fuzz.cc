// The client stubs' reading of a reply. A reply in this machine's
// representation comes the whole way: the client stub calls through the
// in-process carrier a registered server stub that answers with the input.
// A reply of another representation goes to the stub's reader directly.
//
// Input: byte 0 picks the operation (bits 0-1), the caller's array (bits
// 2-3), and, with bit 4 set, a foreign representation (bits 5-7) read
// directly; the rest is the reply body.
#include "fuzz_common.h"

#include "dpxagt.h"

#include <memory>
#include <vector>

namespace {

const uint8_t *g_reply = nullptr;
uint32_t g_reply_len = 0;

// Answers every operation with the input's body.
void canned_stub(handle_t handle, void *, uint32_t, void *out_pkt, uint32_t out_max, uint32_t *, const void *,
                 void **reply_pkt, uint32_t *reply_len, unsigned char *must_free, uint32_t *st)
{
    *must_free = g_reply_len > out_max;
    if (*must_free)
        rpc__alloc_pkt(g_reply_len, reply_pkt);
    else
        *reply_pkt = out_pkt;
    if (g_reply_len != 0)
        std::memcpy(static_cast<unsigned char *>(*reply_pkt) + handle->data_offs, g_reply, g_reply_len);
    *reply_len = g_reply_len;
    *st = 0;
}

const rpc__server_stub_t kCannedStubs[DPX_OP_COUNT] = {canned_stub, canned_stub, canned_stub, canned_stub};

handle_t inproc_handle()
{
    static handle_t handle = [] {
        uint32_t status = 0;
        rpc__register_mgr(&uuid__nil, &dpx_transfer_v1_if_spec, kCannedStubs, &dpx_transfer_v1_manager_epv,
                          &status);
        socket__addr_t addr{};
        uint32_t addr_len = sizeof addr;
        socket__inproc_addr(&addr, &addr_len);
        return rpc__bind(&uuid__nil, &addr, addr_len, &status);
    }();
    return handle;
}

const int16_t kMax[] = {23, 127, 0, -1};

struct Call {
    dpx_file_desc desc{};
    uint32_t crc = 0, result = 0, index = 0;
    uint8_t state = 0;
    int16_t last = -1;
    int16_t max;
    dpx_status status = 0;
    std::vector<dpx_chunk> chunks;
    std::vector<dpx_node_name> nodes;
    dpx_query_text query{};
    dpx_node_filter filter{};

    explicit Call(int16_t max) : max(max), chunks(static_cast<size_t>(max + 1)), nodes(static_cast<size_t>(max + 1)) {}
};

void through_stub(uint32_t opnum, Call &call)
{
    handle_t handle = inproc_handle();
    switch (opnum) {
    case DPX_OP_GET_CHUNKS:
        dpx_get_chunks_csr(handle, &call.desc, &call.crc, &call.state, &call.index, &call.last, call.max,
                           &call.status, call.chunks.data());
        break;
    case DPX_OP_PUT_CHUNKS:
        dpx_put_chunks_csr(handle, call.desc, call.crc, call.state, &call.last, call.max, &call.status,
                           call.chunks.data());
        break;
    case DPX_OP_AGENT_QUERY:
        dpx_agent_query_csr(handle, call.query, call.desc, &call.result, &call.status);
        break;
    default:
        dpx_list_nodes_csr(handle, call.filter, &call.last, call.max, &call.status, call.nodes.data());
    }
}

void through_reader(uint32_t opnum, uint32_t drep, Call &call)
{
    IDLBASE_DATA data{};
    NRTR1_InitData(&data);
    ncs::ndr::Reader reader(g_reply, g_reply_len, drep, data.drep, data.ascii_to_ebcdic, data.ebcdic_to_ascii);
    switch (opnum) {
    case DPX_OP_GET_CHUNKS:
        dpx_read_get_chunks_reply(reader, &call.desc, &call.crc, &call.state, &call.index, &call.last, call.max,
                                  &call.status, call.chunks.data());
        break;
    case DPX_OP_PUT_CHUNKS:
        dpx_read_put_chunks_reply(reader, &call.last, call.max, &call.status, call.chunks.data());
        break;
    case DPX_OP_AGENT_QUERY:
        dpx_read_agent_query_reply(reader, &call.result, &call.status);
        break;
    default:
        dpx_read_list_nodes_reply(reader, &call.last, call.max, &call.status, call.nodes.data());
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 1 || size - 1 > RPC_MAX_BODY)
        return 0;
    const uint32_t opnum = data[0] & 3u;
    Call call(kMax[(data[0] >> 2) & 3u]);
    g_reply = data + 1;
    g_reply_len = static_cast<uint32_t>(size - 1);
    try {
        if ((data[0] & 0x10u) != 0)
            through_reader(opnum, dpxfuzz::sender_drep(static_cast<uint8_t>(data[0] >> 5)), call);
        else
            through_stub(opnum, call);
    } catch (const exc::Fault &fault) {
        // A reply the stub refuses ends in the bound fault, and the call
        // fails: `last` holds what the reply said, which nobody uses then.
        if (fault.status != DPX_RPC_FAULT_INVALID_BOUND)
            std::abort();
        EXC1_Allow();
        return 0;
    }
    // What the caller may rely on after a reply the stub took: `last` within
    // its array.
    if (call.last < -1 || call.last > call.max)
        std::abort();
    return 0;
}

// Client stubs of dpx_transfer version 1, the interface record (if_spec) and
// the client entry-point vector.
#include "dpxagt.h"

namespace {

// The client stubs' gate and record, apart from the server stubs' pair.
volatile int32_t NRTNIDL_GATE_ = 0;
IDLBASE_DATA IDLBASE_DATA_ = {IDLBASE_DATA_SIZE, 0, nullptr, nullptr, {}};

// Buffers and packets of one client call. The request goes in request_buf
// when it fits, else in a packet of the runtime (free_request); the reply
// arrives in reply_buf or in a packet that rpc__sar took (must_free).
struct dpx_client_call {
    unsigned char request_buf[DPX_RPC_STACK_PACKET];
    unsigned char reply_buf[DPX_RPC_STACK_PACKET];
    uint16_t data_offs = 0;
    void *request_pkt = nullptr;
    bool free_request = false;
    void *reply_pkt = nullptr;
    uint32_t reply_len = 0;
    uint32_t drep = 0;
    unsigned char must_free = 0;  // false until rpc__sar has returned
    EXC1_FRAME frame;
};

// Takes the request buffer for a body of at most `bound` bytes and returns a
// writer at the body's start.
ncs::ndr::Writer client_request(dpx_client_call &call, uint32_t bound)
{
    if (bound + call.data_offs > DPX_RPC_STACK_PACKET) {
        rpc__alloc_pkt(bound, &call.request_pkt);
        call.free_request = true;
    } else {
        call.request_pkt = call.request_buf;
    }
    return ncs::ndr::Writer(static_cast<unsigned char *>(call.request_pkt) + call.data_offs);
}

// Sends the request body of `length` bytes and takes the reply. The call
// record learns of the reply only once rpc__sar has returned, so a raise
// inside it leaves nothing to give back.
void client_send(dpx_client_call &call, handle_t handle, uint32_t options, uint32_t opnum, uint32_t length)
{
    void *reply_pkt = nullptr;
    uint32_t reply_len = 0;
    uint32_t drep = 0;
    unsigned char must_free = 0;
    uint32_t unread = 0;
    rpc__sar(handle, options, &dpx_transfer_v1_if_spec, opnum, call.request_pkt, length, call.reply_buf,
             DPX_RPC_STACK_PACKET, &reply_pkt, &reply_len, &drep, &must_free, &unread);
    call.reply_pkt = reply_pkt;
    call.reply_len = reply_len;
    call.drep = drep;
    call.must_free = must_free;
}

ncs::ndr::Reader client_reply(const dpx_client_call &call, const IDLBASE_DATA &data)
{
    return dpx_body_reader(data, call.drep, call.reply_pkt, call.data_offs, call.reply_len);
}

// Gives back what the call took, then sorts the fault, if any: a status of
// the communication module ends in `*status` and a normal return; any other
// is raised on to the caller's frame.
void client_finish(dpx_client_call &call, uint32_t fault, dpx_status *status)
{
    if (call.must_free)
        rpc__free_pkt(call.reply_pkt);
    if (call.free_request)
        rpc__free_pkt(call.request_pkt);
    if (fault == DPX_RPC_FRAME_SET)
        return;
    if ((fault & 0xFFFF0000u) == DPX_RPC_COMM_MODULE) {
        *status = fault;
        EXC1_Allow();
        return;
    }
    EXC1__Raise(EXC1_Thread(), fault);
}

// Skips a reply's size word (the caller's `max` counts) and reads its count
// word, which has to be the reply's `last` + 1 and within max + 1.
uint32_t client_reply_count(ncs::ndr::Reader &reader, int16_t last, int16_t max)
{
    reader.get_u16();
    const uint16_t count = reader.get_u16();
    if (last < -1 || last > max || count != static_cast<uint16_t>(last + 1))
        dpx_raise_bound();
    return count;
}

}  // namespace

void dpx_read_get_chunks_reply(ncs::ndr::Reader &reader, dpx_file_desc *desc, uint32_t *crc, uint8_t *state,
                               uint32_t *index, int16_t *last, int16_t max, dpx_status *status,
                               dpx_chunk buffer[])
{
    dpx_get_file_block(reader, *desc);
    *crc = reader.get_u32();
    *state = reader.get_u8();
    *index = reader.get_u32();
    // The reply is read into the caller's arguments in the order of the body:
    // a count the array can't take is found after `last` has been taken.
    const int16_t reply_last = *last = reader.get_i16();
    *status = reader.get_u32();
    dpx_get_chunk_elements(reader, buffer, client_reply_count(reader, reply_last, max));
}

void dpx_read_put_chunks_reply(ncs::ndr::Reader &reader, int16_t *last, int16_t max, dpx_status *status,
                               dpx_chunk buffer[])
{
    const int16_t reply_last = *last = reader.get_i16();
    *status = reader.get_u32();
    dpx_get_chunk_elements(reader, buffer, client_reply_count(reader, reply_last, max));
}

void dpx_read_agent_query_reply(ncs::ndr::Reader &reader, uint32_t *result, dpx_status *status)
{
    *result = reader.get_u32();
    *status = reader.get_u32();
}

void dpx_read_list_nodes_reply(ncs::ndr::Reader &reader, int16_t *last, int16_t max, dpx_status *status,
                               dpx_node_name nodes[])
{
    const int16_t reply_last = *last = reader.get_i16();
    *status = reader.get_u32();
    dpx_get_node_elements(reader, nodes, client_reply_count(reader, reply_last, max));
}

extern "C" {

// UUID c00947ae0000.22.04.00.00.00.c0.a8.00, version 1, four operations, no
// well-known port on any family.
const rpc__if_spec_t dpx_transfer_v1_if_spec = {
    1,
    {},
    DPX_OP_COUNT,
    0,
    {0xC00947AEu, 0x0000, 0x0000, 0x22, {0x04, 0x00, 0x00, 0x00, 0xC0, 0xA8, 0x00}},
};

void dpx_get_chunks_csr(handle_t handle, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index,
                        int16_t *last, int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    dpx_client_call call;
    const uint32_t fault = pfm___cleanup(&call.frame, __FILE__, __LINE__, [&] {
        const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
        call.data_offs = handle->data_offs;
        dpx_check_last(*last, max);
        ncs::ndr::Writer writer = client_request(call, dpx_get_request_bound(*last));
        dpx_put_file_block(writer, *desc);
        writer.put_u32(*crc);
        writer.put_u8(*state);
        writer.put_u32(*index);
        writer.put_u16(static_cast<uint16_t>(*last));
        writer.put_u16(static_cast<uint16_t>(max));
        dpx_put_array_words(writer, *last, max);
        dpx_put_chunk_elements(writer, buffer, dpx_elements(*last));
        client_send(call, handle, RPC_OPT_IDEMPOTENT, DPX_OP_GET_CHUNKS, writer.length());
        ncs::ndr::Reader reader = client_reply(call, data);
        dpx_read_get_chunks_reply(reader, desc, crc, state, index, last, max, status, buffer);
    });
    client_finish(call, fault, status);
}

void dpx_put_chunks_csr(handle_t handle, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last,
                        int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    dpx_client_call call;
    const uint32_t fault = pfm___cleanup(&call.frame, __FILE__, __LINE__, [&] {
        const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
        call.data_offs = handle->data_offs;
        dpx_check_last(*last, max);
        ncs::ndr::Writer writer = client_request(call, dpx_put_request_bound(*last));
        dpx_put_file_block(writer, desc);
        writer.put_u32(crc);
        writer.put_u8(state);
        writer.put_u16(static_cast<uint16_t>(*last));
        writer.put_u16(static_cast<uint16_t>(max));
        dpx_put_array_words(writer, *last, max);
        dpx_put_chunk_elements(writer, buffer, dpx_elements(*last));
        client_send(call, handle, RPC_OPT_AT_MOST_ONCE, DPX_OP_PUT_CHUNKS, writer.length());
        ncs::ndr::Reader reader = client_reply(call, data);
        dpx_read_put_chunks_reply(reader, last, max, status, buffer);
    });
    client_finish(call, fault, status);
}

void dpx_agent_query_csr(handle_t handle, dpx_query_text query, dpx_file_desc desc, uint32_t *result,
                         dpx_status *status)
{
    dpx_client_call call;
    const uint32_t fault = pfm___cleanup(&call.frame, __FILE__, __LINE__, [&] {
        const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
        call.data_offs = handle->data_offs;
        ncs::ndr::Writer writer = client_request(call, DPX_QUERY_REQUEST_BOUND);
        writer.put_chars(query, DPX_QUERY_LEN);
        dpx_put_file_block(writer, desc);
        client_send(call, handle, RPC_OPT_IDEMPOTENT, DPX_OP_AGENT_QUERY, writer.length());
        ncs::ndr::Reader reader = client_reply(call, data);
        dpx_read_agent_query_reply(reader, result, status);
    });
    client_finish(call, fault, status);
}

void dpx_list_nodes_csr(handle_t handle, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                        dpx_node_name nodes[])
{
    dpx_client_call call;
    const uint32_t fault = pfm___cleanup(&call.frame, __FILE__, __LINE__, [&] {
        const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
        call.data_offs = handle->data_offs;
        dpx_check_last(*last, max);
        ncs::ndr::Writer writer = client_request(call, dpx_list_request_bound(*last));
        writer.put_chars(filter, DPX_FILTER_LEN);
        writer.put_u16(static_cast<uint16_t>(*last));
        writer.put_u16(static_cast<uint16_t>(max));
        dpx_put_array_words(writer, *last, max);
        dpx_put_node_elements(writer, nodes, dpx_elements(*last));
        client_send(call, handle, RPC_OPT_IDEMPOTENT, DPX_OP_LIST_NODES, writer.length());
        ncs::ndr::Reader reader = client_reply(call, data);
        dpx_read_list_nodes_reply(reader, last, max, status, nodes);
    });
    client_finish(call, fault, status);
}

const dpx_transfer_v1_epv_t dpx_transfer_v1_client_epv = {
    dpx_get_chunks_csr,
    dpx_put_chunks_csr,
    dpx_agent_query_csr,
    dpx_list_nodes_csr,
};

const dpx_transfer_v1_epv_t *dpx_transfer_v1_client_epv_locator(void)
{
    return &dpx_transfer_v1_client_epv;
}

}  // extern "C"

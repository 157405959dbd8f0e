// Server stubs of dpx_transfer version 1 and the server entry-point vector.
#include "dpxagt.h"

namespace {

// The server stubs' gate and record, apart from the client stubs' pair.
volatile int32_t NRTNIDL_GATE_ = 0;
IDLBASE_DATA IDLBASE_DATA_ = {IDLBASE_DATA_SIZE, 0, nullptr, nullptr, {}};

const dpx_transfer_v1_epv_t &managers(const void *mgr_epv)
{
    return *static_cast<const dpx_transfer_v1_epv_t *>(mgr_epv);
}

// Reads the size and count words of a request's array and returns the
// count. The manager trusts `max` and `last` and the array is sized by the
// size word, so all four have to agree: a size above DPX_RPC_MAX_ELEMENTS or
// other than max + 1, a count other than last + 1, a `last` below -1 or a
// count above the size is refused before memory is taken.
uint32_t request_count(ncs::ndr::Reader &reader, int16_t last, int16_t max)
{
    const uint16_t size = reader.get_u16();
    const uint16_t count = reader.get_u16();
    if (size > DPX_RPC_MAX_ELEMENTS || size != static_cast<uint16_t>(max + 1) ||
        count != static_cast<uint16_t>(last + 1))
        dpx_raise_bound();
    dpx_check_last(last, max);
    return count;
}

// Chooses the reply buffer for a body of at most `bound` bytes: the offered
// `out_pkt` when the bound fits `out_max`, else a new packet that the runtime
// gives back after sending. Returns a writer at the body's start.
ncs::ndr::Writer reply_writer(uint16_t data_offs, void *out_pkt, uint32_t out_max, uint32_t bound,
                              void **reply_pkt, unsigned char *must_free)
{
    *must_free = 0;
    if (bound > out_max) {
        rpc__alloc_pkt(bound, reply_pkt);
        *must_free = 1;
    } else {
        *reply_pkt = out_pkt;
    }
    return ncs::ndr::Writer(static_cast<unsigned char *>(*reply_pkt) + data_offs);
}

// Gives the array back, then raises the fault on to the transport's frame or
// reports the normal end.
void server_finish(void *array, uint32_t fault, uint32_t *st)
{
    if (array != nullptr)
        rpc__free(array);
    if (fault != DPX_RPC_FRAME_SET)
        EXC1__Raise(EXC1_Thread(), fault);
    *st = 0;
}

}  // namespace

extern "C" {

void dpx_get_chunks_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                        uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                        unsigned char *must_free, uint32_t *st)
{
    void *array = nullptr;
    EXC1_FRAME frame;
    const uint32_t fault = pfm___cleanup(&frame, __FILE__, __LINE__, [&] {
        const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
        const uint16_t data_offs = handle->data_offs;
        ncs::ndr::Reader reader = dpx_body_reader(data, *drep, in_pkt, data_offs, in_len);
        dpx_file_desc desc{};
        dpx_get_file_block(reader, desc);
        uint32_t crc = reader.get_u32();
        uint8_t state = reader.get_u8();
        uint32_t index = reader.get_u32();
        int16_t last = reader.get_i16();
        const int16_t max = reader.get_i16();
        const uint32_t count = request_count(reader, last, max);
        rpc__malloc(dpx_elements(max) * DPX_WIRE_CHUNK, &array);
        auto *chunks = static_cast<dpx_chunk *>(array);
        dpx_get_chunk_elements(reader, chunks, count);

        dpx_status status = 0;
        managers(mgr_epv).dpx_get_chunks(handle, &desc, &crc, &state, &index, &last, max, &status, chunks);

        dpx_check_last(last, max);
        ncs::ndr::Writer writer =
            reply_writer(data_offs, out_pkt, out_max, dpx_get_reply_bound(last), reply_pkt, must_free);
        dpx_put_file_block(writer, desc);
        writer.put_u32(crc);
        writer.put_u8(state);
        writer.put_u32(index);
        writer.put_u16(static_cast<uint16_t>(last));
        writer.put_u32(status);
        dpx_put_array_words(writer, last, max);
        dpx_put_chunk_elements(writer, chunks, dpx_elements(last));
        *reply_len = writer.length();
    });
    server_finish(array, fault, st);
}

void dpx_put_chunks_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                        uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                        unsigned char *must_free, uint32_t *st)
{
    void *array = nullptr;
    EXC1_FRAME frame;
    const uint32_t fault = pfm___cleanup(&frame, __FILE__, __LINE__, [&] {
        const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
        const uint16_t data_offs = handle->data_offs;
        ncs::ndr::Reader reader = dpx_body_reader(data, *drep, in_pkt, data_offs, in_len);
        dpx_file_desc desc{};
        dpx_get_file_block(reader, desc);
        const uint32_t crc = reader.get_u32();
        const uint8_t state = reader.get_u8();
        int16_t last = reader.get_i16();
        const int16_t max = reader.get_i16();
        const uint32_t count = request_count(reader, last, max);
        rpc__malloc(dpx_elements(max) * DPX_WIRE_CHUNK, &array);
        auto *chunks = static_cast<dpx_chunk *>(array);
        dpx_get_chunk_elements(reader, chunks, count);

        dpx_status status = 0;
        managers(mgr_epv).dpx_put_chunks(handle, desc, crc, state, &last, max, &status, chunks);

        dpx_check_last(last, max);
        ncs::ndr::Writer writer =
            reply_writer(data_offs, out_pkt, out_max, dpx_put_reply_bound(last), reply_pkt, must_free);
        writer.put_u16(static_cast<uint16_t>(last));
        writer.put_u32(status);
        dpx_put_array_words(writer, last, max);
        dpx_put_chunk_elements(writer, chunks, dpx_elements(last));
        *reply_len = writer.length();
    });
    server_finish(array, fault, st);
}

// Holds no memory and has no array: a fault passes through it untouched.
void dpx_agent_query_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                         uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                         unsigned char *must_free, uint32_t *st)
{
    const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
    const uint16_t data_offs = handle->data_offs;
    ncs::ndr::Reader reader = dpx_body_reader(data, *drep, in_pkt, data_offs, in_len);
    dpx_query_text query;
    reader.get_chars(query, DPX_QUERY_LEN);
    dpx_file_desc desc{};
    dpx_get_file_block(reader, desc);

    uint32_t result = 0;
    dpx_status status = 0;
    managers(mgr_epv).dpx_agent_query(handle, query, desc, &result, &status);

    ncs::ndr::Writer writer =
        reply_writer(data_offs, out_pkt, out_max, DPX_QUERY_REPLY_BOUND, reply_pkt, must_free);
    writer.put_u32(result);
    writer.put_u32(status);
    *reply_len = writer.length();
    *st = 0;
}

void dpx_list_nodes_ssr(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                        uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                        unsigned char *must_free, uint32_t *st)
{
    void *array = nullptr;
    EXC1_FRAME frame;
    const uint32_t fault = pfm___cleanup(&frame, __FILE__, __LINE__, [&] {
        const IDLBASE_DATA &data = dpx_stub_data(&NRTNIDL_GATE_, &IDLBASE_DATA_, __FILE__, __LINE__);
        const uint16_t data_offs = handle->data_offs;
        ncs::ndr::Reader reader = dpx_body_reader(data, *drep, in_pkt, data_offs, in_len);
        dpx_node_filter filter;
        reader.get_chars(filter, DPX_FILTER_LEN);
        int16_t last = reader.get_i16();
        const int16_t max = reader.get_i16();
        const uint32_t count = request_count(reader, last, max);
        rpc__malloc(dpx_elements(max) * DPX_WIRE_NODE, &array);
        auto *nodes = static_cast<dpx_node_name *>(array);
        dpx_get_node_elements(reader, nodes, count);

        dpx_status status = 0;
        managers(mgr_epv).dpx_list_nodes(handle, filter, &last, max, &status, nodes);

        dpx_check_last(last, max);
        ncs::ndr::Writer writer =
            reply_writer(data_offs, out_pkt, out_max, dpx_list_reply_bound(last), reply_pkt, must_free);
        writer.put_u16(static_cast<uint16_t>(last));
        writer.put_u32(status);
        dpx_put_array_words(writer, last, max);
        dpx_put_node_elements(writer, nodes, dpx_elements(last));
        *reply_len = writer.length();
    });
    server_finish(array, fault, st);
}

const rpc__server_stub_t dpx_transfer_v1_server_epva[DPX_OP_COUNT] = {
    dpx_get_chunks_ssr,
    dpx_put_chunks_ssr,
    dpx_agent_query_ssr,
    dpx_list_nodes_ssr,
};

const rpc__server_stub_t *const dpx_transfer_v1_server_epv = dpx_transfer_v1_server_epva;

const rpc__server_stub_t *dpx_transfer_v1_server_epv_locator(void)
{
    return dpx_transfer_v1_server_epv;
}

}  // extern "C"

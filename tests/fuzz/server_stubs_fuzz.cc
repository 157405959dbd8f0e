// The server stubs' reading of a request, for all four operations and every
// representation of the sender, with managers that check that what the stub
// hands them lies within its bounds.
//
// Input: byte 0 picks the operation (bits 0-1), the sender's representation
// (bits 2-4) and the room offered for the reply (bits 5-6); the rest is the
// request body.
#include "fuzz_common.h"

#include "dpxagt.h"
#include "dpxserver.h"

#include <memory>

namespace {

// A manager that leaves `last` at max + 1 makes the stub refuse to answer;
// one call in 256 (by the state byte or filter) tries that.
constexpr uint8_t kBreakLast = 0xEE;

void check_array(int16_t last, int16_t max)
{
    if (max >= DPX_RPC_MAX_ELEMENTS || last < -1 || last > max)
        std::abort();
}

void check_path(const char (&path)[DPX_PATH_LEN])
{
    char full[DPX_PATH_LEN];
    if (dpx_get_full_path_of_field(path, sizeof path, full, sizeof full) == DPX_OK && !dpxfuzz::inside_product(full))
        std::abort();
}

// Checks the records that arrived and writes all max + 1 that the stub has to provide.
uint32_t take_chunks(dpx_chunk buffer[], int16_t last, int16_t max)
{
    uint32_t arrived = 0;
    dpx_checksum_xfer_buff(buffer, static_cast<int16_t>(last + 1), &arrived);
    for (int32_t i = 0; i <= max; ++i) {
        buffer[i].index = static_cast<uint32_t>(i);
        buffer[i].length = static_cast<uint32_t>(i) % (DPX_CHUNK_SIZE + 1);
        buffer[i].data[DPX_CHUNK_SIZE - 1] = 0;
    }
    return arrived;
}

int16_t answer_last(int16_t max, uint32_t word, uint8_t breaker)
{
    const auto answered = static_cast<int32_t>(word % (static_cast<uint32_t>(max) + 2)) - 1;
    return static_cast<int16_t>(breaker == kBreakLast ? max + 1 : answered);
}

void fuzz_get_chunks(handle_t, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index, int16_t *last,
                     int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    check_array(*last, max);
    check_path(desc->path);
    uint32_t arrived = take_chunks(buffer, *last, max);
    *last = answer_last(max, *crc ^ *index, *state);
    *crc = arrived;
    *status = DPX_OK;
}

void fuzz_put_chunks(handle_t, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last, int16_t max,
                     dpx_status *status, dpx_chunk buffer[])
{
    check_array(*last, max);
    check_path(desc.path);
    *status = take_chunks(buffer, *last, max) == crc ? DPX_OK : DPX_E_CHECKSUM;
    if (state == kBreakLast)
        *last = static_cast<int16_t>(max + 1);
}

void fuzz_agent_query(handle_t, dpx_query_text query, dpx_file_desc desc, uint32_t *result, dpx_status *status)
{
    check_path(desc.path);
    *result = static_cast<unsigned char>(query[DPX_QUERY_LEN - 1]);
    *status = DPX_E_INVALID_PARAM;
}

void fuzz_list_nodes(handle_t, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                     dpx_node_name nodes[])
{
    check_array(*last, max);
    for (int32_t i = 0; i <= max; ++i)
        nodes[i][DPX_NODE_LEN - 1] = filter[i % DPX_FILTER_LEN];
    *last = answer_last(max, static_cast<unsigned char>(filter[0]), static_cast<uint8_t>(filter[1]));
    *status = DPX_OK;
}

const dpx_transfer_v1_epv_t kManagers = {fuzz_get_chunks, fuzz_put_chunks, fuzz_agent_query, fuzz_list_nodes};

const uint32_t kOfferedRoom[] = {0, 8, 992, 8192};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 1)
        return 0;
    dpxfuzz::set_depot();
    uint32_t drep = dpxfuzz::sender_drep(static_cast<uint8_t>(data[0] >> 2));
    const uint32_t out_max = kOfferedRoom[(data[0] >> 5) & 3u], body_len = static_cast<uint32_t>(size - 1);
    // An odd data_offs: a body's alignment must not depend on it. Both
    // buffers end exactly where the stub may use them.
    constexpr uint16_t kDataOffs = 7;
    rpc__handle_rec handle{kDataOffs};
    std::unique_ptr<unsigned char[]> in(new unsigned char[kDataOffs + body_len]);
    std::memcpy(in.get() + kDataOffs, data + 1, body_len);
    std::unique_ptr<unsigned char[]> out(new unsigned char[kDataOffs + out_max]);
    void *reply_pkt = nullptr;
    uint32_t reply_len = 0, st = 1;
    unsigned char must_free = 0;
    try {
        dpx_transfer_v1_server_epva[data[0] & 3u](&handle, in.get(), body_len, out.get(), out_max, &drep, &kManagers,
                                                 &reply_pkt, &reply_len, &must_free, &st);
    } catch (const exc::Fault &fault) {
        // A refused request: the only fault the stubs raise here.
        if (fault.status != DPX_RPC_FAULT_INVALID_BOUND)
            std::abort();
        EXC1_Allow();
        return 0;
    }
    if (st != 0 || (must_free == 0 && (reply_pkt != out.get() || reply_len > out_max)))
        std::abort();
    if (must_free != 0)
        rpc__free_pkt(reply_pkt);
    return 0;
}

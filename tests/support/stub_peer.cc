#include "stub_peer.h"

#include "dpxagt.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <memory>

namespace dpxtest {

namespace {

StubPeer *g_peer = nullptr;

// Records the manager's arguments and runs the script on them.
void run_script(Message &message)
{
    ManagerScript &script = manager_script();
    ++script.calls;
    script.seen = message;
    if (script.raise)
        EXC1__Raise(EXC1_Thread(), *script.raise);
    if (script.answer)
        script.answer(message);
}

size_t room(int16_t max, size_t wanted)
{
    return std::min<size_t>(wanted, static_cast<size_t>(max + 1));
}

void test_get_chunks(handle_t, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index, int16_t *last,
                     int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    Message m;
    m.desc = *desc;
    m.crc = *crc;
    m.state = *state;
    m.index = *index;
    m.last = *last;
    m.max = max;
    m.chunks.assign(buffer, buffer + (*last + 1));
    run_script(m);
    *desc = m.desc;
    *crc = m.crc;
    *state = m.state;
    *index = m.index;
    *last = m.last;
    *status = m.status;
    std::copy_n(m.chunks.begin(), room(max, m.chunks.size()), buffer);
}

void test_put_chunks(handle_t, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last, int16_t max,
                     dpx_status *status, dpx_chunk buffer[])
{
    Message m;
    m.desc = desc;
    m.crc = crc;
    m.state = state;
    m.last = *last;
    m.max = max;
    m.chunks.assign(buffer, buffer + (*last + 1));
    run_script(m);
    *last = m.last;
    *status = m.status;
    std::copy_n(m.chunks.begin(), room(max, m.chunks.size()), buffer);
}

void test_agent_query(handle_t, dpx_query_text query, dpx_file_desc desc, uint32_t *result, dpx_status *status)
{
    Message m;
    m.query = text_of(query, DPX_QUERY_LEN);
    m.desc = desc;
    run_script(m);
    *result = m.result;
    *status = m.status;
}

void test_list_nodes(handle_t, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                     dpx_node_name nodes[])
{
    Message m;
    m.filter = text_of(filter, DPX_FILTER_LEN);
    m.last = *last;
    m.max = max;
    for (int i = 0; i <= *last; ++i)
        m.nodes.push_back(text_of(nodes[i], DPX_NODE_LEN));
    run_script(m);
    *last = m.last;
    *status = m.status;
    for (size_t i = 0; i < room(max, m.nodes.size()); ++i) {
        std::memset(nodes[i], 0, DPX_NODE_LEN);
        std::memcpy(nodes[i], m.nodes[i].data(), std::min<size_t>(m.nodes[i].size(), DPX_NODE_LEN));
    }
}

// Records the request, then raises, answers with a canned body, or runs the
// library's server stub.
template <uint32_t Op>
void recording_stub(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max, uint32_t *drep,
                    const void *mgr_epv, void **reply_pkt, uint32_t *reply_len, unsigned char *must_free,
                    uint32_t *st)
{
    StubPeer &peer = *g_peer;
    const auto *body = static_cast<const unsigned char *>(in_pkt) + handle->data_offs;
    ++peer.requests;
    peer.request_opnum = Op;
    peer.request.assign(body, body + in_len);
    if (peer.raise)
        EXC1__Raise(EXC1_Thread(), *peer.raise);
    if (!peer.canned_reply) {
        dpx_transfer_v1_server_epva[Op](handle, in_pkt, in_len, out_pkt, out_max, drep, mgr_epv, reply_pkt,
                                        reply_len, must_free, st);
        return;
    }
    const std::vector<unsigned char> &reply = *peer.canned_reply;
    const auto length = static_cast<uint32_t>(reply.size());
    *must_free = length > out_max;
    if (*must_free)
        rpc__alloc_pkt(length, reply_pkt);
    else
        *reply_pkt = out_pkt;
    std::memcpy(static_cast<unsigned char *>(*reply_pkt) + handle->data_offs, reply.data(), length);
    *reply_len = length;
    *st = 0;
}

const rpc__server_stub_t kRecordingStubs[DPX_OP_COUNT] = {
    recording_stub<0>, recording_stub<1>, recording_stub<2>, recording_stub<3>,
};

}  // namespace

ManagerScript &manager_script()
{
    static ManagerScript script;
    return script;
}

const dpx_transfer_v1_epv_t kTestManagers = {test_get_chunks, test_put_chunks, test_agent_query, test_list_nodes};

StubPeer::StubPeer() : StubPeer(kRecordingStubs, &kTestManagers) {}

StubPeer::StubPeer(const rpc__server_stub_t *stubs, const dpx_transfer_v1_epv_t *managers)
{
    manager_script() = ManagerScript{};
    g_peer = this;
    uint32_t status = 1;
    rpc__register_mgr(&uuid__nil, &dpx_transfer_v1_if_spec, stubs, managers, &status);
    EXPECT_EQ(status, rpc__s_ok);
    socket__addr_t addr{};
    uint32_t addr_len = sizeof addr;
    socket__inproc_addr(&addr, &addr_len);
    handle_ = rpc__bind(&uuid__nil, &addr, addr_len, &status);
    EXPECT_EQ(status, rpc__s_ok);
}

StubPeer::~StubPeer()
{
    uint32_t status = 0;
    rpc__free_handle(handle_, &status);
    rpc__unregister(&dpx_transfer_v1_if_spec, &status);
    g_peer = nullptr;
}

uint32_t raised_status(const std::function<void()> &call)
{
    try {
        call();
    } catch (const exc::Fault &fault) {
        return fault.status;
    }
    return 0;
}

ServerReply call_server_stub(rpc__server_stub_t stub, const std::vector<unsigned char> &request, Rep rep,
                             uint32_t out_max)
{
    // An odd data_offs: a body's alignment must not depend on it. The request
    // is allocated to its exact end, so a read past it is caught.
    constexpr uint16_t kDataOffs = 7;
    rpc__handle_rec handle{kDataOffs};
    std::unique_ptr<unsigned char[]> in(new unsigned char[kDataOffs + request.size()]);
    std::copy(request.begin(), request.end(), in.get() + kDataOffs);
    std::unique_ptr<unsigned char[]> out(new unsigned char[kDataOffs + out_max]);
    uint32_t drep = rep.drep();
    void *reply_pkt = nullptr;
    uint32_t reply_len = 0;
    unsigned char must_free = 0;
    uint32_t st = 1;
    stub(&handle, in.get(), static_cast<uint32_t>(request.size()), out.get(), out_max, &drep, &kTestManagers,
         &reply_pkt, &reply_len, &must_free, &st);
    EXPECT_EQ(st, 0u);
    EXPECT_EQ(must_free != 0, reply_pkt != out.get());
    ServerReply reply;
    const auto *body = static_cast<const unsigned char *>(reply_pkt) + kDataOffs;
    reply.body.assign(body, body + reply_len);
    reply.must_free = must_free != 0;
    if (must_free)
        rpc__free_pkt(reply_pkt);
    return reply;
}

}  // namespace dpxtest

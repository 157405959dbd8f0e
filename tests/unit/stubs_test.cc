// The stubs of dpx_transfer version 1: round trips through the in-process
// carrier, bodies of another kind of machine, the bound faults, truncated
// requests, the sorting of faults, and the one-time setup of the stubs.
#include "dpxagt.h"
#include "foreign_body.h"
#include "stub_peer.h"

#include <gtest/gtest.h>

#include <dlfcn.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <map>
#include <mutex>
#include <thread>

using namespace dpxtest;

namespace {

std::mutex g_fills_mutex;
std::map<void *, int> g_fills;  // record -> times filled

}  // namespace

// The stubs resolve NRTR1_InitData to this stand-in, which counts the records
// it fills and hands each on to the runtime's own. It takes its time, so
// that threads arriving meanwhile would fill a record again, or read it half
// filled, if the stubs' gate let them.
extern "C" void NRTR1_InitData(void *data)
{
    using Fill = void (*)(void *);
    static const auto runtime_fill = reinterpret_cast<Fill>(dlsym(RTLD_NEXT, "NRTR1_InitData"));
    {
        std::lock_guard<std::mutex> hold(g_fills_mutex);
        ++g_fills[data];
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    runtime_fill(data);
}

namespace {

class Stubs : public ::testing::Test {
protected:
    StubPeer peer;
};

Message chunk_request(const std::string &path, int16_t last, int16_t max)
{
    Message m;
    m.desc = sample_desc(path);
    m.crc = 0xA1B2C3D4;
    m.state = DPX_STATE_MORE;
    m.index = 0x00102030;
    m.last = last;
    m.max = max;
    m.chunks = sample_chunks(static_cast<size_t>(std::max(last + 1, 0)), 0x00102030);
    return m;
}

Message list_request(int16_t last, int16_t max)
{
    Message m;
    m.filter = "fil\xE9ter";
    m.last = last;
    m.max = max;
    for (int i = 0; i <= last; ++i)
        m.nodes.push_back("node-\xC4-" + std::to_string(i));
    return m;
}

Message query_request()
{
    Message m;
    m.query = "select \xE0 from {nodes}";
    m.desc = sample_desc("asked/about");
    return m;
}

// ---- Round trips in this machine's representation ---------------------------------

TEST_F(Stubs, GetChunksCarriesEveryArgumentToTheManagerAndItsAnswerBack)
{
    dpx_file_desc desc = sample_desc("round/trip");
    uint32_t crc = 0, index = 48;
    uint8_t state = DPX_STATE_FIRST;
    int16_t last = -1;
    dpx_status status = 0xEEEEEEEE;
    std::vector<dpx_chunk> buffer(24);
    manager_script().answer = [](Message &m) {
        m.desc.size = {5, 17};
        m.desc.mtime = {1700000000, 0};
        m.crc = 0x12345678;
        m.state = DPX_STATE_MORE;
        m.chunks = sample_chunks(24, m.index);
        m.last = 23;
        m.index += 24;
        m.status = DPX_OK;
    };
    dpx_transfer_v1_client_epv.dpx_get_chunks(peer.handle(), &desc, &crc, &state, &index, &last, 23, &status,
                                               buffer.data());

    const Message &seen = manager_script().seen;
    EXPECT_TRUE(same_desc(seen.desc, sample_desc("round/trip")));
    EXPECT_EQ(seen.state, DPX_STATE_FIRST);
    EXPECT_EQ(seen.index, 48u);
    EXPECT_EQ(seen.last, -1);
    EXPECT_EQ(seen.max, 23);
    EXPECT_EQ(desc.size.remainder, 17u);
    EXPECT_EQ(desc.mtime.low, 1700000000u);
    EXPECT_EQ(crc, 0x12345678u);
    EXPECT_EQ(state, DPX_STATE_MORE);
    EXPECT_EQ(index, 72u);
    EXPECT_EQ(last, 23);
    EXPECT_EQ(status, DPX_OK);
    EXPECT_TRUE(same_chunks(sample_chunks(24, 48), buffer.data(), 24));
}

TEST_F(Stubs, PutChunksSendsTheRecordsAndTakesTheServicesRecordsBack)
{
    std::vector<dpx_chunk> buffer = sample_chunks(128, 9);
    int16_t last = 127;
    dpx_status status = 0;
    manager_script().answer = [](Message &m) {
        m.last = 1;
        m.chunks = sample_chunks(2, 500);
        m.status = DPX_E_CHECKSUM;
    };
    dpx_transfer_v1_client_epv.dpx_put_chunks(peer.handle(), sample_desc("put"), 0xFEEDFACE, DPX_STATE_DONE, &last,
                                               127, &status, buffer.data());

    const Message &seen = manager_script().seen;
    EXPECT_TRUE(same_desc(seen.desc, sample_desc("put")));
    EXPECT_EQ(seen.crc, 0xFEEDFACEu);
    EXPECT_EQ(seen.state, DPX_STATE_DONE);
    EXPECT_TRUE(same_chunks(sample_chunks(128, 9), seen.chunks.data(), seen.chunks.size()));
    EXPECT_EQ(last, 1);
    EXPECT_EQ(status, DPX_E_CHECKSUM);
    EXPECT_TRUE(same_chunks(sample_chunks(2, 500), buffer.data(), 2));
    EXPECT_TRUE(same_chunks(std::vector<dpx_chunk>(buffer.begin() + 2, buffer.end()), sample_chunks(128, 9).data() + 2, 126))
        << "records behind the reply's last are not touched";
}

TEST_F(Stubs, AgentQueryAndListNodesCarryTheirTextsAndAnswers)
{
    dpx_query_text query = "how many?";
    uint32_t result = 0;
    dpx_status status = 0;
    manager_script().answer = [](Message &m) {
        m.result = 4242;
        m.status = DPX_E_INVALID_PARAM;
    };
    dpx_transfer_v1_client_epv.dpx_agent_query(peer.handle(), query, sample_desc("q"), &result, &status);
    EXPECT_EQ(manager_script().seen.query, "how many?");
    EXPECT_TRUE(same_desc(manager_script().seen.desc, sample_desc("q")));
    EXPECT_EQ(result, 4242u);
    EXPECT_EQ(status, DPX_E_INVALID_PARAM);

    dpx_node_filter filter = "*";
    std::unique_ptr<dpx_node_name[]> nodes(new dpx_node_name[128]());
    int16_t last = -1;
    manager_script().answer = [](Message &m) {
        m.last = 2;
        m.nodes = {"hub", "agent-1", std::string(33, 'x')};
        m.status = DPX_OK;
    };
    dpx_transfer_v1_client_epv.dpx_list_nodes(peer.handle(), filter, &last, 127, &status, nodes.get());
    EXPECT_EQ(manager_script().seen.filter, "*");
    EXPECT_EQ(manager_script().seen.last, -1);
    EXPECT_EQ(last, 2);
    EXPECT_EQ(status, DPX_OK);
    EXPECT_EQ(text_of(nodes[1], DPX_NODE_LEN), "agent-1");
    EXPECT_EQ(text_of(nodes[2], DPX_NODE_LEN), std::string(33, 'x'));
}

// ---- Bodies of another representation ------------------------------------------------

class ForeignBodies : public ::testing::TestWithParam<Rep> {
protected:
    void SetUp() override { manager_script() = ManagerScript{}; }
};

// Integers reversed, texts translated, data, state and reserved as they came:
// the manager sees exactly what the foreign writer meant.
TEST_P(ForeignBodies, ServerStubsReadRequestsOfAnotherMachineAsItMeantThem)
{
    const Rep rep = GetParam();
    Message get = chunk_request("foreign/get", 3, 23);
    call_server_stub(dpx_get_chunks_ssr, encode(kGetChunksRequest, get, rep), rep);
    const Message &seen = manager_script().seen;
    EXPECT_TRUE(same_desc(seen.desc, get.desc));
    EXPECT_EQ(seen.crc, get.crc);
    EXPECT_EQ(seen.state, get.state);
    EXPECT_EQ(seen.index, get.index);
    EXPECT_EQ(seen.last, 3);
    EXPECT_EQ(seen.max, 23);
    EXPECT_TRUE(same_chunks(get.chunks, seen.chunks.data(), seen.chunks.size()));

    Message put = chunk_request("foreign/put", 1, 127);
    ServerReply reply = call_server_stub(dpx_put_chunks_ssr, encode(kPutChunksRequest, put, rep), rep);
    EXPECT_TRUE(same_desc(seen.desc, put.desc));
    EXPECT_EQ(seen.max, 127);
    EXPECT_TRUE(same_chunks(put.chunks, seen.chunks.data(), seen.chunks.size()));
    EXPECT_TRUE(same_chunks(put.chunks, decode(kPutChunksReply, reply.body, local_rep()).chunks.data(), 2))
        << "the reply is in this machine's representation";

    Message query = query_request();
    call_server_stub(dpx_agent_query_ssr, encode(kAgentQueryRequest, query, rep), rep);
    EXPECT_EQ(seen.query, query.query);
    EXPECT_TRUE(same_desc(seen.desc, query.desc));

    Message list = list_request(2, 127);
    call_server_stub(dpx_list_nodes_ssr, encode(kListNodesRequest, list, rep), rep);
    EXPECT_EQ(seen.filter, list.filter);
    EXPECT_EQ(seen.nodes, list.nodes);
    EXPECT_EQ(manager_script().calls, 4);
}

ncs::ndr::Reader reader_of(const std::vector<unsigned char> &body, Rep rep)
{
    return ncs::ndr::Reader(body.data(), static_cast<uint32_t>(body.size()), rep.drep(), NCS_DREP_LOCAL,
                            NRTR1_AsciiToEbcdic(), NRTR1_EbcdicToAscii());
}

TEST_P(ForeignBodies, ClientReadersTakeRepliesOfAnotherMachineAsItMeantThem)
{
    const Rep rep = GetParam();
    Message get = chunk_request("reply/get", 4, 0);
    get.status = 0xF11E0007;
    std::vector<unsigned char> body = encode(kGetChunksReply, get, rep);
    ncs::ndr::Reader get_reader = reader_of(body, rep);
    dpx_file_desc desc{};
    uint32_t crc = 0, index = 0;
    uint8_t state = 0;
    int16_t last = -1;
    dpx_status status = 0;
    std::vector<dpx_chunk> buffer(5);
    dpx_read_get_chunks_reply(get_reader, &desc, &crc, &state, &index, &last, 4, &status, buffer.data());
    EXPECT_TRUE(same_desc(desc, get.desc));
    EXPECT_EQ(crc, get.crc);
    EXPECT_EQ(state, get.state);
    EXPECT_EQ(index, get.index);
    EXPECT_EQ(last, 4);
    EXPECT_EQ(status, 0xF11E0007u);
    EXPECT_TRUE(same_chunks(get.chunks, buffer.data(), 5));

    Message put = chunk_request("reply/put", 0, 0);
    put.status = 0x1C010001;
    body = encode(kPutChunksReply, put, rep);
    ncs::ndr::Reader put_reader = reader_of(body, rep);
    dpx_read_put_chunks_reply(put_reader, &last, 4, &status, buffer.data());
    EXPECT_EQ(last, 0);
    EXPECT_EQ(status, 0x1C010001u);
    EXPECT_TRUE(same_chunks(put.chunks, buffer.data(), 1));

    Message answer;
    answer.result = 0x00ABCDEF;
    answer.status = DPX_E_BUSY;
    body = encode(kAgentQueryReply, answer, rep);
    ncs::ndr::Reader query_reader = reader_of(body, rep);
    uint32_t result = 0;
    dpx_read_agent_query_reply(query_reader, &result, &status);
    EXPECT_EQ(result, 0x00ABCDEFu);
    EXPECT_EQ(status, DPX_E_BUSY);

    Message list = list_request(2, 9);
    body = encode(kListNodesReply, list, rep);
    ncs::ndr::Reader list_reader = reader_of(body, rep);
    dpx_node_name nodes[3];
    dpx_read_list_nodes_reply(list_reader, &last, 2, &status, nodes);
    EXPECT_EQ(last, 2);
    EXPECT_EQ(text_of(nodes[2], DPX_NODE_LEN), list.nodes[2]);
}

INSTANTIATE_TEST_SUITE_P(Representations, ForeignBodies,
                         ::testing::Values(Rep{true, false, 0}, Rep{false, true, 0}, Rep{true, true, 0},
                                           Rep{local_rep().big_endian, false, 1}, local_rep()),
                         [](const ::testing::TestParamInfo<Rep> &info) { return info.param.name(); });

// ---- Bound faults ---------------------------------------------------------------------

TEST_F(Stubs, ClientStubRefusesLastAboveMaxOrBelowMinusOneAndSendsNothing)
{
    for (int16_t bad_last : {int16_t{24}, int16_t{-2}, int16_t{-32768}}) {
        std::vector<dpx_chunk> buffer = sample_chunks(24, 0);
        dpx_file_desc desc = sample_desc("bound");
        uint32_t crc = 7, index = 8;
        uint8_t state = 1;
        int16_t last = bad_last;
        dpx_status status = 0x5555;
        EXPECT_EQ(raised_status([&] {
                      dpx_get_chunks_csr(peer.handle(), &desc, &crc, &state, &index, &last, 23, &status,
                                         buffer.data());
                  }),
                  DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_EQ(raised_status([&] {
                      dpx_put_chunks_csr(peer.handle(), desc, crc, state, &last, 23, &status, buffer.data());
                  }),
                  DPX_RPC_FAULT_INVALID_BOUND);
        dpx_node_name nodes[24] = {};
        EXPECT_EQ(raised_status([&] {
                      dpx_list_nodes_csr(peer.handle(), nodes[0], &last, 23, &status, nodes);
                  }),
                  DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_EQ(peer.requests, 0);
        EXPECT_EQ(last, bad_last);
        EXPECT_EQ(status, 0x5555u);
        EXPECT_EQ(crc, 7u);
        EXPECT_TRUE(same_chunks(sample_chunks(24, 0), buffer.data(), 24));
    }
}

struct RequestWords {
    const char *what;
    int16_t last, max;
    std::optional<uint16_t> size, count;
    bool accepted;
};

class RequestArrays : public ::testing::TestWithParam<RequestWords> {
protected:
    void SetUp() override { manager_script() = ManagerScript{}; }
};

// The manager must never get an array smaller than max + 1, or elements that
// never came: such requests are refused before it runs.
TEST_P(RequestArrays, ServerStubsRefuseArraysWhoseWordsDisagreeBeforeTheManagerRuns)
{
    const RequestWords row = GetParam();
    Message chunks = chunk_request("words", row.last, row.max);
    Message nodes = list_request(row.last, row.max);
    // The elements that the count word announces, as far as a test body can hold them.
    chunks.chunks.resize(std::min<size_t>(row.count.value_or(static_cast<uint16_t>(row.last + 1)), 8));
    nodes.nodes.resize(chunks.chunks.size());
    for (Message *m : {&chunks, &nodes}) {
        m->size_word = row.size;
        m->count_word = row.count;
    }
    const struct {
        rpc__server_stub_t stub;
        std::vector<unsigned char> body;
    } calls[] = {
        {dpx_get_chunks_ssr, encode(kGetChunksRequest, chunks, local_rep())},
        {dpx_put_chunks_ssr, encode(kPutChunksRequest, chunks, local_rep())},
        {dpx_list_nodes_ssr, encode(kListNodesRequest, nodes, local_rep())},
    };
    for (const auto &call : calls) {
        manager_script().calls = 0;
        const uint32_t raised = raised_status([&] { call_server_stub(call.stub, call.body, local_rep()); });
        EXPECT_EQ(raised, row.accepted ? 0u : DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_EQ(manager_script().calls, row.accepted ? 1 : 0);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Words, RequestArrays,
    ::testing::Values(RequestWords{"count_above_size", 3, 2, {}, {}, false},
                      RequestWords{"size_below_max_plus_one", 3, 7, uint16_t{4}, {}, false},
                      RequestWords{"size_above_max_plus_one", 1, 3, uint16_t{5}, {}, false},
                      RequestWords{"count_below_last_plus_one", 2, 7, {}, uint16_t{1}, false},
                      RequestWords{"count_above_last_plus_one", 0, 7, {}, uint16_t{2}, false},
                      RequestWords{"last_below_minus_one", -2, 7, {}, {}, false},
                      RequestWords{"size_above_limit", -1, DPX_RPC_MAX_ELEMENTS, {}, {}, false},
                      RequestWords{"size_at_limit", 1, DPX_RPC_MAX_ELEMENTS - 1, {}, {}, true},
                      RequestWords{"size_zero", -1, -1, {}, {}, true},
                      RequestWords{"count_equal_size", 3, 3, {}, {}, true}),
    [](const ::testing::TestParamInfo<RequestWords> &info) { return std::string(info.param.what); });

TEST_F(Stubs, ServerStubRaisesAfterAManagerLeavesLastOutsideItsArray)
{
    for (int16_t bad_last : {int16_t{24}, int16_t{-2}}) {
        manager_script().answer = [bad_last](Message &m) { m.last = bad_last; };
        manager_script().calls = 0;
        EXPECT_EQ(raised_status([] {
                      call_server_stub(dpx_get_chunks_ssr,
                                       encode(kGetChunksRequest, chunk_request("x", 1, 23), local_rep()), local_rep());
                  }),
                  DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_EQ(raised_status([] {
                      call_server_stub(dpx_put_chunks_ssr,
                                       encode(kPutChunksRequest, chunk_request("x", 1, 23), local_rep()), local_rep());
                  }),
                  DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_EQ(raised_status([] {
                      call_server_stub(dpx_list_nodes_ssr, encode(kListNodesRequest, list_request(1, 23), local_rep()),
                                       local_rep());
                  }),
                  DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_EQ(manager_script().calls, 3) << "the manager's work is done";
    }
}

TEST_F(Stubs, ClientReaderRefusesACountAboveMaxOrOtherThanLastPlusOneAndKeepsLastAndArray)
{
    struct {
        int16_t last;
        uint16_t count;
    } const rows[] = {{5, 6}, {1, 3}, {3, 2}, {-2, 0}};
    for (const auto &row : rows) {
        Message reply = chunk_request("reply", -1, 0);
        reply.last = row.last;
        reply.count_word = row.count;
        reply.status = 0xF11E0014;
        reply.chunks = sample_chunks(row.count, 1000);
        std::vector<unsigned char> body = encode(kGetChunksReply, reply, local_rep());
        ncs::ndr::Reader reader = reader_of(body, local_rep());
        dpx_file_desc desc{};
        uint32_t crc = 0, index = 0;
        uint8_t state = 0;
        int16_t last = 0;
        dpx_status status = 0;
        std::vector<dpx_chunk> buffer = sample_chunks(4, 1);
        EXPECT_EQ(raised_status([&] {
                      dpx_read_get_chunks_reply(reader, &desc, &crc, &state, &index, &last, 3, &status,
                                                buffer.data());
                  }),
                  DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_EQ(crc, reply.crc) << "fields in front of the array are delivered";
        EXPECT_EQ(status, 0xF11E0014u);
        EXPECT_EQ(last, 0);
        EXPECT_TRUE(same_chunks(sample_chunks(4, 1), buffer.data(), 4));
    }
    // The wire's size word is not what counts: the caller's max is.
    Message reply = list_request(1, 0);
    reply.size_word = 0;
    std::vector<unsigned char> body = encode(kListNodesReply, reply, local_rep());
    ncs::ndr::Reader reader = reader_of(body, local_rep());
    int16_t last = -1;
    dpx_status status = 1;
    dpx_node_name nodes[2];
    dpx_read_list_nodes_reply(reader, &last, 1, &status, nodes);
    EXPECT_EQ(last, 1);
}

TEST_F(Stubs, ABadReplyCountPassesOutOfTheClientStubAsARaise)
{
    Message reply = chunk_request("reply", 40, 0);  // 41 records for a buffer of 24
    peer.canned_reply = encode(kGetChunksReply, reply, local_rep());
    dpx_file_desc desc{};
    uint32_t crc = 0, index = 0;
    uint8_t state = 0;
    int16_t last = -1;
    dpx_status status = 0;
    std::vector<dpx_chunk> buffer(24);
    EXPECT_EQ(raised_status([&] {
                  dpx_get_chunks_csr(peer.handle(), &desc, &crc, &state, &index, &last, 23, &status, buffer.data());
              }),
              DPX_RPC_FAULT_INVALID_BOUND);
    EXPECT_EQ(last, -1);
}

// ---- Truncated requests ------------------------------------------------------------------

TEST_F(Stubs, RequestsCutShortAtAnyLengthAreRefusedWithoutCallingTheManager)
{
    const struct {
        rpc__server_stub_t stub;
        const Layout &layout;
        Message message;
    } requests[] = {
        {dpx_get_chunks_ssr, kGetChunksRequest, chunk_request("cut", 2, 23)},
        {dpx_put_chunks_ssr, kPutChunksRequest, chunk_request("cut", 2, 23)},
        {dpx_agent_query_ssr, kAgentQueryRequest, query_request()},
        {dpx_list_nodes_ssr, kListNodesRequest, list_request(2, 23)},
    };
    for (const auto &request : requests) {
        for (Rep rep : {local_rep(), Rep{true, true, 0}}) {
            const std::vector<unsigned char> full = encode(request.layout, request.message, rep);
            manager_script().calls = 0;
            for (size_t length = 0; length < full.size(); ++length) {
                std::vector<unsigned char> cut(full.begin(), full.begin() + static_cast<ptrdiff_t>(length));
                ASSERT_EQ(raised_status([&] { call_server_stub(request.stub, cut, rep); }),
                          DPX_RPC_FAULT_INVALID_BOUND)
                    << rep.name() << " length " << length << " of " << full.size();
            }
            EXPECT_EQ(manager_script().calls, 0);
            call_server_stub(request.stub, full, rep);
            EXPECT_EQ(manager_script().calls, 1);
        }
    }
}

// ---- Sorting of faults and release of buffers -----------------------------------------

TEST_F(Stubs, CommunicationFailureReturnsNormallyWithItsStatusAndTheArgumentsAsTheyWere)
{
    peer.raise = rpc__s_comm_failure;
    std::vector<dpx_chunk> buffer = sample_chunks(24, 3);
    int16_t last = 23;
    dpx_status status = 0;
    dpx_put_chunks_csr(peer.handle(), sample_desc("lost"), 1, DPX_STATE_MORE, &last, 23, &status, buffer.data());
    EXPECT_EQ(status, rpc__s_comm_failure);
    EXPECT_EQ(last, 23);
    EXPECT_TRUE(same_chunks(sample_chunks(24, 3), buffer.data(), 24));

    dpx_file_desc desc = sample_desc("lost");
    uint32_t crc = 11, index = 12;
    uint8_t state = DPX_STATE_FIRST;
    status = 0;
    dpx_get_chunks_csr(peer.handle(), &desc, &crc, &state, &index, &last, 23, &status, buffer.data());
    EXPECT_EQ(status, rpc__s_comm_failure);
    EXPECT_TRUE(same_desc(desc, sample_desc("lost")));
    EXPECT_EQ(crc, 11u);
    EXPECT_EQ(index, 12u);
    EXPECT_EQ(state, DPX_STATE_FIRST);
    EXPECT_EQ(manager_script().calls, 0);

    // A handle without a server fails in the runtime itself.
    uint32_t st = 0;
    handle_t unbound = rpc__dup_handle(peer.handle(), &st);
    rpc__clear_server_binding(unbound, &st);
    dpx_query_text query = "q";
    uint32_t result = 99;
    status = 0;
    dpx_agent_query_csr(unbound, query, desc, &result, &status);
    EXPECT_EQ(status, rpc__s_not_bound);
    EXPECT_EQ(result, 99u);
    rpc__free_handle(unbound, &st);
}

TEST_F(Stubs, FaultsOfAnyOtherModulePassOutOfTheClientStubAsRaises)
{
    for (uint32_t fault : {DPX_RPC_FAULT_INVALID_BOUND, rpc__s_fault_unspec, DPX_E_INVALID_PARAM}) {
        peer.raise = fault;
        dpx_node_name nodes[4] = {};
        int16_t last = 1;
        dpx_status status = 0x77;
        EXPECT_EQ(raised_status([&] { dpx_list_nodes_csr(peer.handle(), nodes[0], &last, 3, &status, nodes); }),
                  fault);
        EXPECT_EQ(status, 0x77u);
        EXPECT_EQ(last, 1);
    }
    // A manager's raise leaves the server stub, which gives its array back,
    // and reaches the client the same way.
    peer.raise.reset();
    manager_script().raise = DPX_E_FILE_WRITE;
    std::vector<dpx_chunk> buffer = sample_chunks(128, 0);
    int16_t last = 127;
    dpx_status status = 0;
    EXPECT_EQ(raised_status([&] {
                  dpx_put_chunks_csr(peer.handle(), sample_desc("w"), 0, DPX_STATE_DONE, &last, 127, &status,
                                     buffer.data());
              }),
              DPX_E_FILE_WRITE);
    EXPECT_EQ(manager_script().calls, 1);
    EXPECT_EQ(raised_status([] {
                  call_server_stub(dpx_agent_query_ssr, encode(kAgentQueryRequest, query_request(), local_rep()),
                                   local_rep());
              }),
              DPX_E_FILE_WRITE)
        << "agent_query's stub has no frame: the fault passes through it";
}

TEST_F(Stubs, ServerStubsAnswerInTheOfferedBufferWhenTheBoundFitsElseInTheirOwnPacket)
{
    const std::vector<unsigned char> query = encode(kAgentQueryRequest, query_request(), local_rep());
    EXPECT_FALSE(call_server_stub(dpx_agent_query_ssr, query, local_rep(), 8).must_free);
    EXPECT_TRUE(call_server_stub(dpx_agent_query_ssr, query, local_rep(), 7).must_free);
    const std::vector<unsigned char> get = encode(kGetChunksRequest, chunk_request("b", -1, 23), local_rep());
    EXPECT_FALSE(call_server_stub(dpx_get_chunks_ssr, get, local_rep(), 4178).must_free);
    EXPECT_TRUE(call_server_stub(dpx_get_chunks_ssr, get, local_rep(), 4177).must_free);
    const std::vector<unsigned char> list = encode(kListNodesRequest, list_request(-1, 127), local_rep());
    EXPECT_FALSE(call_server_stub(dpx_list_nodes_ssr, list, local_rep(), 12).must_free);
    EXPECT_TRUE(call_server_stub(dpx_list_nodes_ssr, list, local_rep(), 11).must_free);
}

// ---- One-time setup ---------------------------------------------------------------------

void answer_query(handle_t, dpx_query_text query, dpx_file_desc desc, uint32_t *result, dpx_status *status)
{
    *result = desc.size.chunks + static_cast<uint32_t>(strnlen(query, DPX_QUERY_LEN));
    *status = DPX_OK;
}

// Runs in a fresh process: the first calls of both stub groups come from
// many threads at once. Each group's record is filled exactly once, and no
// stub reads it before it is complete (an unfilled record says big-endian,
// which would garble every answer on this machine).
[[noreturn]] void first_calls_from_many_threads()
{
    static const dpx_transfer_v1_epv_t managers = {nullptr, nullptr, answer_query, nullptr};
    StubPeer peer(dpx_transfer_v1_server_epv, &managers);
    constexpr int kThreads = 16;
    std::atomic<bool> go{false};
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
        threads.emplace_back([&, i] {
            uint32_t st = 0;
            handle_t handle = rpc__dup_handle(peer.handle(), &st);
            dpx_file_desc desc{};
            desc.size.chunks = 1000u + static_cast<uint32_t>(i);
            dpx_query_text query = "four";
            uint32_t result = 0;
            dpx_status status = 1;
            while (!go.load())
                std::this_thread::yield();
            dpx_agent_query_csr(handle, query, desc, &result, &status);
            if (status != DPX_OK || result != 1004u + static_cast<uint32_t>(i))
                ++wrong;
            rpc__free_handle(handle, &st);
        });
    }
    go = true;
    for (std::thread &thread : threads)
        thread.join();
    int most = 0;
    for (const auto &[record, times] : g_fills)
        most = std::max(most, times);
    std::fprintf(stderr, "records: %zu, filled at most %d times, wrong answers: %d\n", g_fills.size(), most,
                 wrong.load());
    std::fflush(stderr);
    std::_Exit(g_fills.size() == 2 && most == 1 && wrong == 0 ? 0 : 1);
}

TEST(StubSetup, FirstCallsFromManyThreadsFillEachStubGroupsRecordOnce)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(first_calls_from_many_threads(), ::testing::ExitedWithCode(0),                 "records: 2, filled at most 1 times, wrong answers: 0");
}

}  // namespace

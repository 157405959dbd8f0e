// The interface dpx_transfer version 1 and its stubs: bodies in every
// representation, round trips, bound faults, fault sorting, one-time setup.
#include "dpxagt.h"
#include "foreign_body.h"

#include <gtest/gtest.h>

#include <dlfcn.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <functional>
#include <thread>

using namespace dpxtest;

namespace {

std::atomic<int> g_fills{0};
// What this thread's last call sent: body, options word, reply length.
thread_local std::vector<unsigned char> g_request;
thread_local uint32_t g_options = 0, g_reply_len = 0;
// When set, the reply of a peer of another kind instead of a call.
thread_local std::optional<std::pair<std::vector<unsigned char>, Rep>> g_foreign_reply;

}  // namespace

// The stubs resolve NRTR1_InitData and rpc__sar to these stand-ins, which
// record what passes and hand on to the runtime's own. The first is slow, so
// racing threads would see a half-filled record if the stubs' gate let them;
// the second can hand back a foreign reply in a packet with its drep.
extern "C" void NRTR1_InitData(void *data)
{
    static const auto runtime = reinterpret_cast<void (*)(void *)>(dlsym(RTLD_NEXT, "NRTR1_InitData"));
    ++g_fills;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    runtime(data);
}

extern "C" void rpc__sar(handle_t handle, uint32_t options, const rpc__if_spec_t *ifspec, uint32_t opnum,
                         void *request_pkt, uint32_t request_len, void *reply_buf, uint32_t reply_buf_size,
                         void **reply_pkt, uint32_t *reply_len, uint32_t *drep, unsigned char *must_free,
                         uint32_t *status)
{
    static const auto runtime = reinterpret_cast<decltype(&rpc__sar)>(dlsym(RTLD_NEXT, "rpc__sar"));
    const auto *body = static_cast<const unsigned char *>(request_pkt) + handle->data_offs;
    g_request.assign(body, body + request_len);
    g_options = options;
    if (g_foreign_reply) {
        const auto &[reply, rep] = *g_foreign_reply;
        rpc__alloc_pkt(static_cast<uint32_t>(reply.size()), reply_pkt);
        std::copy(reply.begin(), reply.end(), static_cast<unsigned char *>(*reply_pkt) + handle->data_offs);
        std::tie(*reply_len, *drep, *must_free) = std::make_tuple(reply.size(), rep.drep(), 1);
        return;
    }
    runtime(handle, options, ifspec, opnum, request_pkt, request_len, reply_buf, reply_buf_size, reply_pkt,
            reply_len, drep, must_free, status);
    g_reply_len = *reply_len;
}

namespace {

// Managers that record their arguments and answer as the test scripts them.

struct Script {
    int calls = 0;
    Message seen{};                           // the arguments on entry, the array's elements 0 .. last
    std::function<void(Message &)> answer{};  // changes the arguments that go back
    std::optional<uint32_t> raise{};          // raised once the arguments are recorded
};
thread_local Script g_script;

// Runs the script on `m`; the answer's elements go into `array` as far as it holds them.
Message run_script(Message m, void *array = nullptr)
{
    ++g_script.calls;
    g_script.seen = m;
    if (g_script.raise)
        EXC1__Raise(EXC1_Thread(), *g_script.raise);
    if (g_script.answer)
        g_script.answer(m);
    const auto room = static_cast<size_t>(m.max + 1);
    std::copy_n(m.chunks.begin(), std::min(m.chunks.size(), room), static_cast<dpx_chunk *>(array));
    std::copy_n(m.nodes.begin(), std::min(m.nodes.size(), room), static_cast<Node *>(array));
    return m;
}

void get_manager(handle_t, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index, int16_t *last,
                 int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    const Message m = run_script({.desc = *desc, .crc = *crc, .state = *state, .index = *index, .last = *last,
                                  .max = max, .chunks = {buffer, buffer + *last + 1}},
                                 buffer);
    std::tie(*desc, *crc, *state, *index, *last, *status) = std::tie(m.desc, m.crc, m.state, m.index, m.last, m.status);
}

void put_manager(handle_t, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last, int16_t max,
                 dpx_status *status, dpx_chunk buffer[])
{
    const Message m = run_script(
        {.desc = desc, .crc = crc, .state = state, .last = *last, .max = max, .chunks = {buffer, buffer + *last + 1}},
        buffer);
    std::tie(*last, *status) = std::tie(m.last, m.status);
}

void query_manager(handle_t, dpx_query_text query, dpx_file_desc desc, uint32_t *result, dpx_status *status)
{
    Message m{.desc = desc};
    std::memcpy(m.query, query, DPX_QUERY_LEN);
    m = run_script(m);
    std::tie(*result, *status) = std::tie(m.result, m.status);
}

void list_manager(handle_t, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                  dpx_node_name nodes[])
{
    const auto *names = reinterpret_cast<const Node *>(nodes);
    Message m{.last = *last, .max = max, .nodes = {names, names + *last + 1}};
    std::memcpy(m.filter, filter, DPX_FILTER_LEN);
    m = run_script(m, nodes);
    std::tie(*last, *status) = std::tie(m.last, m.status);
}

const dpx_transfer_v1_epv_t kTestManagers = {get_manager, put_manager, query_manager, list_manager};

// A handle to the server stubs with the test managers over the in-process
// carrier; each test starts with a fresh script and record.
handle_t peer()
{
    static const handle_t handle = [] {
        uint32_t status = 0;
        rpc__register_mgr(&uuid__nil, &dpx_transfer_v1_if_spec, dpx_transfer_v1_server_epv, &kTestManagers, &status);
        socket__addr_t addr{};
        uint32_t addr_len = sizeof addr;
        socket__inproc_addr(&addr, &addr_len);
        return rpc__bind(&uuid__nil, &addr, addr_len, &status);
    }();
    g_script = {};
    g_request.clear();
    g_foreign_reply.reset();
    return handle;
}

// Calls the server stub of `opnum` with a request written in `rep`; the reply body.
std::vector<unsigned char> call_server_stub(uint32_t opnum, const std::vector<unsigned char> &request, Rep rep)
{
    // An odd data_offs (alignment must not depend on it); buffers end where the stub may use them.
    constexpr uint16_t kDataOffs = 7, kOutMax = 992;
    rpc__handle_rec handle{kDataOffs};
    std::vector<unsigned char> in(kDataOffs + request.size()), out(kDataOffs + kOutMax);
    std::copy(request.begin(), request.end(), in.begin() + kDataOffs);
    uint32_t drep = rep.drep(), reply_len = 0, st = 1;
    void *reply_pkt = nullptr;
    unsigned char must_free = 0;
    dpx_transfer_v1_server_epva[opnum](&handle, in.data(), static_cast<uint32_t>(request.size()), out.data(),
                                       kOutMax, &drep, &kTestManagers, &reply_pkt, &reply_len, &must_free, &st);
    EXPECT_EQ(st, 0u);
    EXPECT_EQ(must_free != 0, reply_pkt != out.data());
    const auto *body = static_cast<const unsigned char *>(reply_pkt) + kDataOffs;
    std::vector<unsigned char> reply(body, body + reply_len);
    if (must_free)
        rpc__free_pkt(reply_pkt);
    return reply;
}

// `m` with its arrays at the caller's max + 1 elements, zeros behind.
Message sized(Message m)
{
    m.chunks.resize(static_cast<size_t>(std::max(m.max + 1, 0)));
    m.nodes.resize(m.chunks.size());
    return m;
}

// Calls the client stub of `opnum` with the arguments in `m`, arrays max + 1 long.
void client_call(uint32_t opnum, Message &m, handle_t handle)
{
    m = sized(m);
    const dpx_transfer_v1_epv_t &stub = dpx_transfer_v1_client_epv;
    switch (opnum) {
    case DPX_OP_GET_CHUNKS:
        return stub.dpx_get_chunks(handle, &m.desc, &m.crc, &m.state, &m.index, &m.last, m.max, &m.status,
                                   m.chunks.data());
    case DPX_OP_PUT_CHUNKS:
        return stub.dpx_put_chunks(handle, m.desc, m.crc, m.state, &m.last, m.max, &m.status, m.chunks.data());
    case DPX_OP_AGENT_QUERY:
        return stub.dpx_agent_query(handle, m.query, m.desc, &m.result, &m.status);
    default:
        return stub.dpx_list_nodes(handle, m.filter, &m.last, m.max, &m.status,
                                   reinterpret_cast<dpx_node_name *>(m.nodes.data()));
    }
}

// The status that `call` raised, 0 when it returned.
uint32_t raised_status(const std::function<void()> &call)
{
    try {
        call();
    } catch (const exc::Fault &fault) {
        return fault.status;
    }
    return 0;
}

// One call of each operation and how the manager answers it.
struct Case {
    uint32_t opnum;
    const Layout &request_layout, &reply_layout;
    Message request;
    void (*answer)(Message &);
};

std::vector<Case> cases()
{
    return {
        {DPX_OP_GET_CHUNKS, kGetChunksRequest, kGetChunksReply,
         {.desc = sample_desc("dir/file.txt"), .crc = 0xDEADBEEF, .state = DPX_STATE_MORE, .index = 0x00010203,
          .last = 0, .max = 23, .chunks = sample_chunks(1, 0x00010200)},
         [](Message &m) {
             std::tie(m.crc, m.state, m.index, m.last, m.status) =
                 std::make_tuple(0x0BADF00Du, DPX_STATE_DONE, 0x11223344u, int16_t{4}, 0xF11E0007u);
             m.chunks = sample_chunks(5, 77);
         }},
        {DPX_OP_PUT_CHUNKS, kPutChunksRequest, kPutChunksReply,
         {.desc = sample_desc("up/load"), .crc = 0xCAFEBABE, .state = DPX_STATE_DONE, .last = 0, .max = 127,
          .chunks = sample_chunks(1, 5)},
         [](Message &m) { m.status = DPX_E_CHECKSUM; }},
        {DPX_OP_AGENT_QUERY, kAgentQueryRequest, kAgentQueryReply,
         {.desc = sample_desc("query/path"), .query = "select \xE4 from {nodes}"},
         [](Message &m) { std::tie(m.result, m.status) = std::make_tuple(0x01020304u, DPX_E_INVALID_PARAM); }},
        {DPX_OP_LIST_NODES, kListNodesRequest, kListNodesReply,
         {.last = 1, .max = 127, .filter = "filter-16-chars",
          .nodes = {{"\xC4lpha"}, {"name-of-32-characters-and-{}-\xE9!"}}},
         [](Message &m) {
             std::tie(m.last, m.status) = std::make_tuple(int16_t{2}, 0x1234u);
             m.nodes = {{"one"}, {"two"}, {"three"}};
         }},
    };
}

TEST(Interface, TheInterfaceRecordHoldsTheIdentityAndTheLocatorsFindTheVectors)
{
    static_assert(sizeof dpx_transfer_v1_if_spec == 88);
    const rpc__if_spec_t &spec = dpx_transfer_v1_if_spec;
    EXPECT_EQ(std::make_tuple(spec.vers, spec.opcnt, spec.gap), std::make_tuple(1u, uint16_t{4}, uint16_t{0}));
    EXPECT_EQ(std::count(std::begin(spec.port), std::end(spec.port), 0), 32);
    char text[37];
    uuid__encode(&spec.id, text);
    EXPECT_STREQ(text, "c00947ae0000.22.04.00.00.00.c0.a8.00");
    EXPECT_EQ(dpx_transfer_v1_client_epv_locator(), &dpx_transfer_v1_client_epv);
    EXPECT_EQ(dpx_transfer_v1_server_epv_locator(), dpx_transfer_v1_server_epva);
}

// Every operation from senders of every representation: integers reversed,
// texts translated, data taken as it came. A request cut short at any length
// is refused without calling the manager. Bodies written here are byte for
// byte the table's; locally the call goes client stub to manager and back.
TEST(Wire, BodiesAreWrittenByTheTablesAndReadAsTheirSenderMeantThem)
{
    const handle_t handle = peer();
    const Rep reps[] = {local_rep(), {true, true}, {true, false}, {false, true}, {local_rep().big_endian, false, 1}};
    for (const Rep &rep : reps) {
        for (const Case &c : cases()) {
            SCOPED_TRACE(::testing::Message() << "operation " << c.opnum << ", drep " << std::hex << rep.drep());
            const std::vector<unsigned char> request = encode(c.request_layout, c.request, rep);
            g_script = {.answer = c.answer};
            for (auto end = request.begin(); &rep < reps + 2 && end != request.end(); ++end)
                ASSERT_EQ(raised_status([&] { call_server_stub(c.opnum, {request.begin(), end}, rep); }),
                          DPX_RPC_FAULT_INVALID_BOUND)
                    << end - request.begin() << " of " << request.size() << " bytes";
            EXPECT_EQ(g_script.calls, 0);
            const std::vector<unsigned char> reply = call_server_stub(c.opnum, request, rep);
            EXPECT_TRUE(g_script.seen == c.request);
            Message answered = c.request;
            c.answer(answered);
            EXPECT_TRUE(reply == encode(c.reply_layout, answered, local_rep(), 0));

            Message args = c.request;
            g_foreign_reply.reset();
            if (rep.drep() != local_rep().drep())
                g_foreign_reply.emplace(encode(c.reply_layout, answered, rep), rep);
            client_call(c.opnum, args, handle);
            EXPECT_TRUE(g_request == encode(c.request_layout, c.request, local_rep(), 0));
            EXPECT_EQ(g_options, c.opnum == DPX_OP_PUT_CHUNKS ? RPC_OPT_AT_MOST_ONCE : RPC_OPT_IDEMPOTENT);
            EXPECT_TRUE(args == sized(answered));
        }
    }
}

TEST(Wire, BodiesInUseHaveTheLengthsOfTheSizesTable)
{
    const std::tuple<uint32_t, int16_t, size_t, uint32_t> rows[] = {  // operation, n, request, reply
        {DPX_OP_GET_CHUNKS, 0, 4172, 4176},       {DPX_OP_GET_CHUNKS, 24, 102668, 102672},
        {DPX_OP_GET_CHUNKS, 128, 529484, 529488}, {DPX_OP_PUT_CHUNKS, 0, 4166, 12},
        {DPX_OP_PUT_CHUNKS, 24, 102664, 98508},   {DPX_OP_PUT_CHUNKS, 128, 529480, 525324},
        {DPX_OP_AGENT_QUERY, 0, 5173, 8},         {DPX_OP_LIST_NODES, 0, 24, 12},
        {DPX_OP_LIST_NODES, 24, 816, 804},        {DPX_OP_LIST_NODES, 128, 4248, 4236},
    };
    const handle_t handle = peer();
    for (const auto &[opnum, n, request, reply] : rows) {
        Message args{.last = static_cast<int16_t>(n - 1), .max = 127};
        client_call(opnum, args, handle);
        EXPECT_EQ(std::make_tuple(opnum, n, g_request.size(), g_reply_len), std::make_tuple(opnum, n, request, reply));
    }
}

TEST(Stubs, AClientStubRefusesALastOutsideMinusOneToMaxAndSendsNothing)
{
    const handle_t handle = peer();
    for (const Case &c : cases()) {
        for (const int16_t bad : {static_cast<int16_t>(c.request.max + 1), int16_t{-2}}) {
            if (c.opnum == DPX_OP_AGENT_QUERY)
                continue;
            Message args = sized(c.request);
            args.last = bad;
            const Message before = args;
            EXPECT_EQ(raised_status([&] { client_call(c.opnum, args, handle); }), DPX_RPC_FAULT_INVALID_BOUND);
            EXPECT_TRUE(args == before);
        }
    }
    EXPECT_TRUE(g_request.empty()) << "nothing is sent";
}

TEST(Stubs, ServerStubsRefuseArraysWhoseWordsDisagreeWithMaxAndLastBeforeTheManagerRuns)
{
    // last, max, size word and count word (when not max + 1 and last + 1), accepted
    const std::tuple<int16_t, int16_t, std::optional<uint16_t>, std::optional<uint16_t>, bool> rows[] = {
        {3, 2, {}, {}, false},                        // count above size
        {3, 7, 4, {}, false},                         // size below max + 1
        {1, 3, 5, {}, false},                         // size above max + 1
        {2, 7, {}, 1, false},                         // count below last + 1
        {0, 7, {}, 2, false},                         // count above last + 1
        {-2, 7, {}, {}, false},                       // last below -1
        {-1, DPX_RPC_MAX_ELEMENTS, {}, {}, false},    // size above the limit
        {1, DPX_RPC_MAX_ELEMENTS - 1, {}, {}, true},  // size at the limit
        {-1, -1, {}, {}, true},                       // no array at all
    };
    for (const auto &[last, max, size, count, accepted] : rows) {
        for (const Case &c : cases()) {
            if (c.opnum == DPX_OP_AGENT_QUERY)
                continue;
            Message m = c.request;
            std::tie(m.last, m.max, m.size_word, m.count_word) = std::tie(last, max, size, count);
            m.chunks.resize(std::min<size_t>(m.count(), 8));  // as many as a test body holds
            m.nodes.resize(m.chunks.size());
            g_script = {};
            const std::vector<unsigned char> request = encode(c.request_layout, m, local_rep());
            EXPECT_EQ(raised_status([&] { call_server_stub(c.opnum, request, local_rep()); }),
                      accepted ? 0u : DPX_RPC_FAULT_INVALID_BOUND)
                << "operation " << c.opnum << ", last " << last << ", max " << max;
            EXPECT_EQ(g_script.calls, accepted ? 1 : 0);
        }
    }
}

// The fields in front of the array are delivered, `last` among them, as the
// reply is read in order; the array stays.
TEST(Stubs, AClientStubRefusesAReplyCountAboveMaxOrOtherThanLastPlusOneAfterTakingLastAndKeepsTheArray)
{
    const handle_t handle = peer();
    const std::pair<int16_t, uint16_t> rows[] = {{5, 6}, {1, 3}, {3, 2}, {-2, 0}};  // last, count word
    for (const auto &[last, count] : rows) {
        const Message reply{.last = last, .status = 9, .count_word = count, .chunks = sample_chunks(count, 9)};
        g_foreign_reply.emplace(encode(kGetChunksReply, reply, local_rep()), local_rep());
        Message args{.last = 0, .max = 3, .chunks = sample_chunks(4, 1)};
        EXPECT_EQ(raised_status([&] { client_call(DPX_OP_GET_CHUNKS, args, handle); }), DPX_RPC_FAULT_INVALID_BOUND);
        EXPECT_TRUE(args == sized({.last = last, .max = 3, .status = 9, .chunks = sample_chunks(4, 1)}));
    }
    // The wire's size word is not what counts: the caller's max is.
    g_foreign_reply.emplace(encode(kListNodesReply, {.last = 1, .size_word = 0, .nodes = {{"a"}, {"b"}}}, local_rep()),
                            local_rep());
    Message args{.max = 1};
    client_call(DPX_OP_LIST_NODES, args, handle);
    EXPECT_EQ(args.last, 1);
}

// A service-side fault (raised, or the refusal of the manager's `last`) is
// sorted by the client stub; arguments stay, and every packet is freed once.
TEST(Stubs, ACommunicationFailureReturnsInStatusAndAnyOtherFaultIsRaisedOnWithTheArgumentsAsTheyWere)
{
    const handle_t handle = peer();
    for (const Case &c : cases()) {
        const auto above = static_cast<int16_t>(c.request.max + 1);
        const Script faults[] = {{.raise = rpc__s_comm_failure}, {.raise = DPX_RPC_FAULT_INVALID_BOUND},
                                 {.raise = rpc__s_fault_unspec}, {.raise = DPX_E_FILE_WRITE},
                                 {.answer = [above](Message &m) { m.last = above; }},
                                 {.answer = [](Message &m) { m.last = -2; }}};
        for (const Script &fault : faults) {
            if (c.opnum == DPX_OP_AGENT_QUERY && !fault.raise)
                continue;
            g_script = fault;
            const uint32_t status = fault.raise.value_or(DPX_RPC_FAULT_INVALID_BOUND);
            const bool comm = status == rpc__s_comm_failure;
            Message args = sized(c.request), expected = args;
            expected.status = comm ? status : expected.status;
            EXPECT_EQ(raised_status([&] { client_call(c.opnum, args, handle); }), comm ? 0u : status)
                << "operation " << c.opnum << ", status " << std::hex << status;
            EXPECT_TRUE(args == expected);
        }
    }
}

// In a fresh process, first calls of both stub groups from many threads: each
// record is filled once, and none is read half filled (that garbles answers).
TEST(StubSetup, FirstCallsFromManyThreadsFillEachStubGroupsRecordOnce)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const auto first_calls = [] {
        const handle_t handle = peer();
        std::atomic<int> wrong{0};
        std::vector<std::thread> threads;
        for (uint32_t i = 0; i < 16; ++i) {
            threads.emplace_back([&, i] {
                g_script.answer = [](Message &m) { m.result = m.desc.size.chunks; };
                Message args;
                args.desc.size.chunks = 1000 + i;
                client_call(DPX_OP_AGENT_QUERY, args, handle);
                wrong += args.status != DPX_OK || args.result != 1000 + i;
            });
        }
        for (std::thread &thread : threads)
            thread.join();
        std::fprintf(stderr, "records filled: %d, wrong answers: %d\n", g_fills.load(), wrong.load());
        std::_Exit(g_fills == 2 && wrong == 0 ? 0 : 1);
    };
    EXPECT_EXIT(first_calls(), ::testing::ExitedWithCode(0), "records filled: 2, wrong answers: 0");
}

}  // namespace

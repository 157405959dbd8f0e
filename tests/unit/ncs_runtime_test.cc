// The runtime without the network: packets, binding handles, registration,
// dispatch and rpc__sar over the in-process carrier.
#include "ncs/ncs.h"
#include "ncs_echo.h"
#include "test_support.h"

#include <gtest/gtest.h>

#include <cstring>
#include <thread>

namespace {

using ncsecho::call;
using ncsecho::word_body;

socket__addr_t inproc_addr(uint32_t *len)
{
    socket__addr_t addr{};
    addr.sa.sa_family = socket__family_inproc;
    *len = sizeof(sa_family_t);
    return addr;
}

socket__addr_t ipv4_addr(uint16_t port, uint32_t *len)
{
    socket__addr_t addr{};
    addr.in4.sin_family = AF_INET;
    addr.in4.sin_port = htons(port);
    addr.in4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    *len = sizeof(sockaddr_in);
    return addr;
}

// A handle bound to the in-process family, freed at the end of the scope.
struct InprocHandle {
    InprocHandle()
    {
        uint32_t len = 0;
        socket__addr_t addr = inproc_addr(&len);
        uint32_t status = 1;
        handle = rpc__bind(&uuid__nil, &addr, len, &status);
        EXPECT_EQ(status, rpc__s_ok);
    }
    ~InprocHandle()
    {
        uint32_t status = 1;
        rpc__free_handle(handle, &status);
    }
    handle_t handle = nullptr;
};

class InprocCall : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(ncsecho::register_interface(), rpc__s_ok); }
    void TearDown() override { ncsecho::unregister_interface(); }
    InprocHandle h_;
};

TEST(Packets, HoldDataOffsAndTheSizeAndAreReusable)
{
    for (uint32_t size : {0u, 1u, 992u, 4096u, 529488u, 3u * 1024u * 1024u}) {
        for (int round = 0; round < 3; ++round) {
            void *pkt = nullptr;
            rpc__alloc_pkt(size, &pkt);
            ASSERT_NE(pkt, nullptr);
            std::memset(pkt, 0xA5, RPC_DATA_OFFS + size);
            rpc__free_pkt(pkt);
        }
    }
    void *memory = nullptr;
    rpc__malloc(0, &memory);
    EXPECT_NE(memory, nullptr);
    rpc__free(memory);

    const char source[] = "block copy";
    char destination[sizeof source] = {};
    rpc__block_copy(source, destination, sizeof source);
    EXPECT_STREQ(destination, source);
}

TEST_F(InprocCall, ReplyThatFitsComesInTheCallersBuffer)
{
    ncsecho::Outcome out = call(h_.handle, ncsecho::kEcho, "hello");
    EXPECT_EQ(out.fault, 0u);
    EXPECT_EQ(out.body, "hello");
    EXPECT_TRUE(out.in_reply_buf);
    EXPECT_FALSE(out.must_free);
    EXPECT_EQ(out.drep, static_cast<uint32_t>(NCS_DREP_LOCAL));
}

TEST_F(InprocCall, ReplyPlacementFollowsItsSizeNotTheStubsChoice)
{
    struct Case {
        uint32_t op;
        size_t body_size;
        uint32_t reply_buf_size;
        bool must_free;
    };
    const Case cases[] = {
        {ncsecho::kEcho, 1024 - RPC_DATA_OFFS, 1024, false},
        {ncsecho::kEcho, 1024 - RPC_DATA_OFFS + 1, 1024, true},
        {ncsecho::kEcho, 529488, 1024, true},
        {ncsecho::kEchoInPacket, 10, 1024, false},
        {ncsecho::kEchoInPacket, 5000, 1024, true},
        {ncsecho::kEcho, 10, 0, true},
        {ncsecho::kEcho, 10, RPC_DATA_OFFS - 1, true},
        {ncsecho::kEcho, 0, RPC_DATA_OFFS, false},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(testing::Message() << "op " << c.op << " size " << c.body_size << " buf " << c.reply_buf_size);
        std::string body = dpxtest::pattern_bytes(c.body_size, 7);
        ncsecho::Outcome out = call(h_.handle, c.op, body, RPC_OPT_IDEMPOTENT, c.reply_buf_size);
        EXPECT_EQ(out.fault, 0u);
        EXPECT_EQ(out.body, body);
        EXPECT_EQ(out.must_free, c.must_free);
        EXPECT_EQ(out.in_reply_buf, !c.must_free);
    }
}

TEST_F(InprocCall, FaultRaisedByServerStubComesBackWithItsStatus)
{
    for (uint32_t status : {rpc__s_fault_invalid_bound, 0xF11E0003u, rpc__s_comm_failure, rpc__s_no_memory})
        EXPECT_EQ(call(h_.handle, ncsecho::kRaise, word_body(status)).fault, status);
    EXPECT_EQ(call(h_.handle, ncsecho::kThrow, "x").fault, rpc__s_fault_unspec);
    // The thread's frames are all gone: a later call works.
    EXPECT_EQ(call(h_.handle, ncsecho::kEcho, "after").body, "after");
    EXPECT_EQ(EXC1_Thread()->top, nullptr);
}

TEST_F(InprocCall, UnknownInterfaceVersionOrOperationIsRefused)
{
    rpc__if_spec_t other_version = ncsecho::kInterface;
    other_version.vers += 1;
    rpc__if_spec_t other_uuid = ncsecho::kInterface;
    other_uuid.id.host[6] ^= 1;
    EXPECT_EQ(call(h_.handle, 0, "x", 0, 1024, other_version).fault, rpc__s_unknown_if);
    EXPECT_EQ(call(h_.handle, 0, "x", 0, 1024, other_uuid).fault, rpc__s_unknown_if);
    EXPECT_EQ(call(h_.handle, ncsecho::kOpCount, "x").fault, rpc__s_op_rng_error);
    EXPECT_EQ(call(h_.handle, 0xFFFFFFFFu, "x").fault, rpc__s_op_rng_error);
}

TEST(Registration, OneRegistrationPerInterfaceAndVersion)
{
    EXPECT_EQ(ncsecho::register_interface(), rpc__s_ok);
    EXPECT_EQ(ncsecho::register_interface(), rpc__s_already_registered);
    EXPECT_EQ(ncsecho::unregister_interface(), rpc__s_ok);
    EXPECT_EQ(ncsecho::unregister_interface(), rpc__s_not_registered);
    InprocHandle h;
    EXPECT_EQ(call(h.handle, ncsecho::kEcho, "x").fault, rpc__s_unknown_if);
}

TEST(Registration, CallUnderWayFinishesWhenItsInterfaceIsUnregistered)
{
    ASSERT_EQ(ncsecho::register_interface(), rpc__s_ok);
    InprocHandle h;
    uint32_t entered = ncsecho::entered.load();
    ncsecho::Outcome out;
    std::thread caller([&] { out = call(h.handle, ncsecho::kSlowEcho, word_body(200, 64)); });
    while (ncsecho::entered.load() == entered)
        std::this_thread::yield();
    EXPECT_EQ(ncsecho::unregister_interface(), rpc__s_ok);
    caller.join();
    EXPECT_EQ(out.fault, 0u);
    EXPECT_EQ(out.body, word_body(200, 64));
    EXPECT_EQ(call(h.handle, ncsecho::kEcho, "x").fault, rpc__s_unknown_if);
}

TEST(Handles, DuplicateSurvivesClearRepointAndFreeOfItsOrigin)
{
    uint32_t len = 0;
    socket__addr_t first = ipv4_addr(1111, &len);
    socket__addr_t second = ipv4_addr(2222, &len);
    uint32_t status = 1;
    handle_t origin = rpc__bind(&uuid__nil, &first, len, &status);
    ASSERT_EQ(status, rpc__s_ok);
    handle_t dup = rpc__dup_handle(origin, &status);
    ASSERT_EQ(status, rpc__s_ok);
    EXPECT_EQ(dup->data_offs, RPC_DATA_OFFS);

    auto port_of = [](handle_t h, uint32_t *st) {
        socket__addr_t addr{};
        uint32_t addr_len = 0;
        rpc__inq_binding(h, &addr, &addr_len, st);
        return *st == rpc__s_ok ? ntohs(addr.in4.sin_port) : 0;
    };
    rpc__set_binding(origin, &second, len, &status);
    EXPECT_EQ(port_of(origin, &status), 2222);
    EXPECT_EQ(port_of(dup, &status), 1111);

    rpc__clear_server_binding(origin, &status);
    EXPECT_EQ(port_of(origin, &status), 0);
    EXPECT_EQ(status, rpc__s_not_bound);
    EXPECT_EQ(port_of(dup, &status), 1111);

    // A duplicate of a cleared handle is cleared too; re-pointing binds it.
    handle_t dup_of_cleared = rpc__dup_handle(origin, &status);
    EXPECT_EQ(call(dup_of_cleared, ncsecho::kEcho, "x").fault, rpc__s_not_bound);
    rpc__set_binding(dup_of_cleared, &second, len, &status);
    EXPECT_EQ(port_of(dup_of_cleared, &status), 2222);

    rpc__free_handle(origin, &status);
    EXPECT_EQ(status, rpc__s_ok);
    EXPECT_EQ(port_of(dup, &status), 1111);
    rpc__free_handle(dup, &status);
    rpc__free_handle(dup_of_cleared, &status);
    EXPECT_EQ(status, rpc__s_ok);
}

TEST(Handles, NullFreedAndBadAddressesAreRefused)
{
    uint32_t status = 0;
    EXPECT_EQ(call(nullptr, ncsecho::kEcho, "x").fault, rpc__s_invalid_handle);
    InprocHandle h;
    handle_t dup = rpc__dup_handle(h.handle, &status);
    rpc__free_handle(dup, &status);
    EXPECT_EQ(call(dup, ncsecho::kEcho, "x").fault, rpc__s_invalid_handle);
    rpc__free_handle(dup, &status);
    EXPECT_EQ(status, rpc__s_invalid_handle);
    EXPECT_EQ(rpc__dup_handle(dup, &status), nullptr);
    EXPECT_EQ(status, rpc__s_invalid_handle);

    uint32_t len = 0;
    socket__addr_t addr = ipv4_addr(1, &len);
    EXPECT_EQ(rpc__bind(&uuid__nil, &addr, len - 1, &status), nullptr);
    EXPECT_EQ(status, socket__s_bad_family);
    addr.sa.sa_family = AF_UNIX;
    EXPECT_EQ(rpc__bind(&uuid__nil, &addr, len, &status), nullptr);
    EXPECT_EQ(status, socket__s_bad_family);
    rpc__set_binding(h.handle, &addr, len, &status);
    EXPECT_EQ(status, socket__s_bad_family);
    EXPECT_EQ(rpc__bind(&uuid__nil, nullptr, len, &status), nullptr);
    EXPECT_EQ(status, socket__s_bad_family);
}

TEST_F(InprocCall, BodyAboveTheCarriersLimitIsRefusedBeforeItIsSent)
{
    std::string body = word_body(0xB16B0D1, RPC_MAX_BODY + 1);
    EXPECT_EQ(call(h_.handle, ncsecho::kCount, body).fault, rpc__s_too_big);
    EXPECT_EQ(ncsecho::executions_of(0xB16B0D1), 0u);
}

}  // namespace

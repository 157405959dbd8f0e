// The RPC runtime over both carriers (in-process, TCP on 127.0.0.1): replies,
// faults, binding handles, repeats after cut connections, idle connections,
// stopping and hostile frames.
#include "ncs/frame.h"
#include "ncs/server.h"
#include "ncs_echo.h"
#include "test_support.h"

#include <gtest/gtest.h>

#include <poll.h>
#include <unistd.h>

#include <random>
#include <vector>

namespace {

using namespace ncsecho;

// The process's server for the echo interface, on 127.0.0.1 at a free port.
struct Server {
    Server() : status(register_interface()) { rpc__listen("127.0.0.1", 0, 4, &addr, nullptr, &status); }
    ~Server()
    {
        gate_open = true;
        rpc__stop_listening();
        unregister_interface();
        gate_open = false;
    }
    uint16_t port() const { return ntohs(addr.in4.sin_port); }
    uint32_t status;
    socket__addr_t addr{};
};

socket__addr_t loopback(uint16_t port)
{
    socket__addr_t addr{};
    addr.in4 = {AF_INET, htons(port), {htonl(INADDR_LOOPBACK)}, {}};
    return addr;
}

// A binding handle, freed at the end of the scope.
struct Binding {
    Binding(const socket__addr_t &addr, uint32_t len) : handle(rpc__bind(&uuid__nil, &addr, len, &status)) {}
    explicit Binding(uint16_t port) : Binding(loopback(port), sizeof(sockaddr_in)) {}
    Binding(const Binding &) = delete;
    ~Binding() { rpc__free_handle(handle, &status); }
    uint32_t status = 1;
    handle_t handle;
};

Binding inproc_binding()
{
    socket__addr_t addr;
    uint32_t len = 0;
    socket__inproc_addr(&addr, &len);
    return Binding(addr, len);
}

rpc__server_stats_t stats()
{
    rpc__server_stats_t s;
    rpc__inq_server_stats(&s);
    return s;
}

// Parameter: true for TCP, false for the in-process carrier.
class Carriers : public ::testing::TestWithParam<bool> {
protected:
    void SetUp() override { ASSERT_EQ(h_.status | server_.status, rpc__s_ok); }
    Server server_;
    Binding h_ = GetParam() ? Binding(server_.port()) : inproc_binding();
};

INSTANTIATE_TEST_SUITE_P(Carrier, Carriers, ::testing::Values(false, true),
                         [](const auto &info) { return info.param ? "Tcp" : "InProcess"; });

TEST_P(Carriers, ReplyLandsInTheCallersBufferWhenItFitsElseInAPacket)
{
    const struct { uint32_t op, body_size, reply_buf_size; bool must_free; } cases[] = {
        {kEcho, 1024 - RPC_DATA_OFFS, 1024, false}, {kEcho, 1024 - RPC_DATA_OFFS + 1, 1024, true},
        {kEcho, RPC_MAX_BODY, 1024, true},           {kEchoInPacket, 10, 1024, false},
        {kEchoInPacket, 5000, 1024, true},           {kEcho, 10, 0, true},
        {kEcho, 10, RPC_DATA_OFFS - 1, true},        {kEcho, 0, RPC_DATA_OFFS, false},
    };
    for (const auto &c : cases) {
        std::string body = dpxtest::pattern_bytes(c.body_size, c.body_size);
        Outcome out = call(h_.handle, c.op, body, RPC_OPT_IDEMPOTENT, c.reply_buf_size);
        EXPECT_TRUE(out.fault == 0 && out.body == body) << c.body_size << std::hex << " fault 0x" << out.fault;
        EXPECT_EQ(out.must_free, c.must_free) << c.op << " " << c.body_size << " " << c.reply_buf_size;
    }
}

TEST_P(Carriers, FaultsComeBackAsRaisesWithTheirStatus)
{
    rpc__if_spec_t other_version = kInterface, other_uuid = kInterface;
    other_version.vers += 1;
    other_uuid.id.host[6] ^= 1;
    const struct { uint32_t op; std::string body; const rpc__if_spec_t &ifspec; uint32_t fault; } cases[] = {
        {kRaise, word_body(rpc__s_fault_invalid_bound), kInterface, rpc__s_fault_invalid_bound},
        {kRaise, word_body(rpc__s_comm_failure), kInterface, rpc__s_comm_failure},
        {kRaise, word_body(0), kInterface, rpc__s_fault_unspec},  // a C++ exception of the stub
        {kOpCount, "x", kInterface, rpc__s_op_rng_error},
        {0xFFFFFFFFu, "x", kInterface, rpc__s_op_rng_error},
        {kEcho, "x", other_version, rpc__s_unknown_if},
        {kEcho, "x", other_uuid, rpc__s_unknown_if},
        {kCount, word_body(800) + std::string(RPC_MAX_BODY - 3, 'x'), kInterface, rpc__s_too_big},
    };
    for (const auto &c : cases)
        EXPECT_EQ(call(h_.handle, c.op, c.body, RPC_OPT_IDEMPOTENT, 1024, c.ifspec).fault, c.fault) << c.op;
    EXPECT_EQ(executions[800].load(), 0u);
    // No frame of the thread is left behind, and a later call works.
    EXPECT_EQ(EXC1_Thread()->top, nullptr);
    EXPECT_EQ(call(h_.handle, kEcho, "after").body, "after");
}

// A connection whose reads give up after 5 s.
int connect_to(uint16_t port)
{
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    timeval limit{5, 0};
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    socket__addr_t addr = loopback(port);
    connect(fd, &addr.sa, sizeof(sockaddr_in));
    return fd;
}

// `n` bytes from `fd`, or fewer when the peer closes the connection first.
std::string receive(int fd, size_t n)
{
    std::string bytes(n, '\0');
    bytes.resize(std::max<ssize_t>(recv(fd, bytes.data(), n, MSG_WAITALL), 0));
    return bytes;
}

// A proxy in front of the server, for one connection at a time (the carrier
// holds no more than one to it here). After cut_after(n), n more bytes pass
// (either way), then the connection is closed at both ends; cut_after(-1)
// lets everything pass.
class CutProxy {
public:
    explicit CutProxy(uint16_t target) : target_(target)
    {
        socket__addr_t addr = loopback(0);
        socklen_t len = sizeof(sockaddr_in);
        EXPECT_EQ(bind(listener_, &addr.sa, len), 0);
        listen(listener_, 4);
        getsockname(listener_, &addr.sa, &len);
        port_ = ntohs(addr.in4.sin_port);
        thread_ = std::thread([this] { run(); });
    }
    ~CutProxy()
    {
        stop_ = true;
        shutdown(listener_, SHUT_RDWR);
        thread_.join();
        close(listener_);
    }
    uint16_t port() const { return port_; }
    void cut_after(long bytes) { budget_ = bytes; }

private:
    void run()
    {
        for (int client; !stop_ && (client = accept(listener_, nullptr, nullptr)) >= 0;) {
            pollfd ends[2] = {{client, POLLIN, 0}, {connect_to(target_), POLLIN, 0}};
            for (bool open = true; open && !stop_;) {
                poll(ends, 2, 10);
                for (int i = 0; i < 2 && open; ++i)
                    open = ends[i].revents == 0 || pass(ends[i].fd, ends[1 - i].fd);
            }
            close(ends[0].fd);
            close(ends[1].fd);
        }
    }
    // Moves what arrived at `from` on to `to`; false when the connection ends.
    bool pass(int from, int to)
    {
        char buffer[1 << 16];
        ssize_t n = recv(from, buffer, sizeof buffer, 0);
        if (n <= 0)
            return false;
        long budget = budget_;
        size_t allowed = budget < 0 ? static_cast<size_t>(n) : std::min<size_t>(n, budget);
        bool cut = budget == static_cast<long>(allowed);
        if (budget >= 0)
            budget_ = cut ? -1 : budget - static_cast<long>(allowed);
        return send(to, buffer, allowed, MSG_NOSIGNAL) == static_cast<ssize_t>(allowed) && !cut;
    }

    uint16_t target_;
    uint16_t port_ = 0;
    int listener_ = socket(AF_INET, SOCK_STREAM, 0);
    std::atomic<bool> stop_{false};
    std::atomic<long> budget_{-1};  // changed by the proxy only while a cut call runs
    std::thread thread_;
};

class Tcp : public ::testing::Test {
protected:
    Server server_;
    Binding h_{server_.port()};
};

TEST_F(Tcp, DuplicateKeepsItsBindingWhenItsOriginIsRepointedClearedOrFreed)
{
    uint32_t status = 1;
    const socket__addr_t nowhere = loopback(1);  // nobody listens there
    EXPECT_EQ(rpc__bind(&uuid__nil, &nowhere, sizeof(sockaddr_in) - 1, &status), nullptr);
    EXPECT_EQ(status, socket__s_bad_family);
    handle_t origin = rpc__dup_handle(h_.handle, &status);
    handle_t dup = rpc__dup_handle(origin, &status);
    ASSERT_EQ(status, rpc__s_ok);
    rpc__set_binding(origin, &nowhere, sizeof(sockaddr_in), &status);
    EXPECT_EQ(call(origin, kEcho, "x").fault, rpc__s_connect_refused);
    EXPECT_EQ(call(dup, kEcho, "x").body, "x");
    rpc__clear_server_binding(origin, &status);
    EXPECT_EQ(call(origin, kEcho, "x").fault, rpc__s_not_bound);
    rpc__free_handle(origin, &status);
    EXPECT_EQ(call(dup, kEcho, "x").body, "x");
    rpc__free_handle(dup, &status);
    EXPECT_EQ(status, rpc__s_ok);
    // Freed or null handles are refused, never read through.
    EXPECT_EQ(call(dup, kEcho, "x").fault, rpc__s_invalid_handle);
    EXPECT_EQ(call(nullptr, kEcho, "x").fault, rpc__s_invalid_handle);
    rpc__free_handle(dup, &status);
    EXPECT_EQ(status, rpc__s_invalid_handle);
}

TEST_F(Tcp, CutConnectionRepeatsOnlyAnIdempotentCallAndRunsAnyOtherAtMostOnce)
{
    CutProxy proxy(server_.port());
    Binding via_proxy(proxy.port());
    const uint32_t exchange = 2 * ncs::frame::kHeaderSize + 4 + 4;
    for (uint32_t cut = 0; cut <= exchange; ++cut) {
        for (uint32_t options : {RPC_OPT_AT_MOST_ONCE, RPC_OPT_IDEMPOTENT}) {
            ASSERT_EQ(call(via_proxy.handle, kEcho, "warm").body, "warm");  // a pooled connection
            proxy.cut_after(cut);
            Outcome out = call(via_proxy.handle, kCount, word_body(options * 100 + cut), options);
            proxy.cut_after(-1);
            if (options == RPC_OPT_IDEMPOTENT || cut == exchange)
                EXPECT_EQ(out.fault, 0u) << "cut after " << cut;
            else
                EXPECT_EQ(out.fault & 0xFFFF0000u, RPC_COMM_MODULE) << "cut after " << cut;
        }
    }
    // Once the server has finished what reached it, count.
    while (stats().calls != 0)
        std::this_thread::yield();
    for (uint32_t cut = 0; cut < exchange; ++cut)
        EXPECT_LE(executions[cut].load(), 1u) << "cut after " << cut;
    EXPECT_EQ(executions[exchange].load(), 1u);
}

TEST(TcpIdle, CallAfterTheServerClosedAnIdleConnectionGoesOnANewOne)
{
    dpxtest::ScopedEnv idle("NCS_IDLE_TIMEOUT_S", "1");
    Server server;
    Binding h(server.port());
    ASSERT_EQ(call(h.handle, kEcho, "one").body, "one");
    uint64_t before = stats().accepted;
    while (stats().connections != 0)
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_EQ(call(h.handle, kCount, word_body(900), RPC_OPT_AT_MOST_ONCE).body, word_body(1));
    EXPECT_EQ(stats().accepted, before + 1);
}

TEST_F(Tcp, CallUnderWayFinishesWhileItsInterfaceIsTakenAwayAndTheServerStops)
{
    EXPECT_EQ(register_interface(), rpc__s_already_registered);
    uint32_t entered_before = entered;
    Outcome out;
    std::thread caller([&] { out = call(h_.handle, kGate, "in flight", RPC_OPT_AT_MOST_ONCE); });
    while (entered == entered_before)
        std::this_thread::yield();
    EXPECT_EQ(unregister_interface(), rpc__s_ok);
    EXPECT_EQ(unregister_interface(), rpc__s_not_registered);
    EXPECT_EQ(call(Binding(server_.port()).handle, kEcho, "x").fault, rpc__s_unknown_if);
    std::thread stopper([] { rpc__stop_listening(); });
    // Once the server refuses new connections, its stop is under way.
    while (call(Binding(server_.port()).handle, kEcho, "x").fault != rpc__s_connect_refused)
        std::this_thread::yield();
    gate_open = true;
    stopper.join();
    caller.join();
    EXPECT_EQ(out.body, "in flight");
}

TEST_F(Tcp, MalformedTruncatedAndOversizedFramesCloseOnlyTheirOwnConnection)
{
    ASSERT_EQ(call(h_.handle, kEcho, "before").body, "before");  // pooled from here on
    ncs::frame::Header h{ncs::frame::kRequest, 0, 77, NCS_DREP_LOCAL, kInterface.id, kInterface.vers, kCount, 4, 0};
    ncs::frame::Bytes header;
    ncs::frame::encode(h, header);
    const std::string good = std::string(reinterpret_cast<const char *>(header), sizeof header) + word_body(700);
    std::vector<std::string> bad;
    for (size_t len = 0; len < good.size(); ++len)
        bad.push_back(good.substr(0, len));  // truncated, then the sender stops
    for (auto [offset, value] : {std::pair<size_t, char>{ncs::frame::kVersionOffset + 1, 9},
                                 {ncs::frame::kKindOffset, ncs::frame::kReply}, {ncs::frame::kKindOffset, 0},
                                 {ncs::frame::kBodyLenOffset, char(0xFF)}}) {
        bad.push_back(good);
        bad.back()[offset] = value;
    }
    std::mt19937 random(20240611);
    for (int i = 0; i < 100; ++i) {
        bad.emplace_back(random() % 300, '\0');
        for (char &c : bad.back())
            c = static_cast<char>(random());
    }
    for (const std::string &bytes : bad) {
        int fd = connect_to(server_.port());
        send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL);
        shutdown(fd, SHUT_WR);
        std::string answer = receive(fd, ncs::frame::kHeaderSize);
        close(fd);
        // Nothing comes back, or for an oversized body a fault that closes the connection.
        bool too_big = answer.size() == ncs::frame::kHeaderSize &&
                       ncs::frame::decode(reinterpret_cast<const unsigned char *>(answer.data()), h) &&
                       h.fault == rpc__s_too_big && h.flags == ncs::frame::kClosing;
        EXPECT_TRUE(answer.empty() || too_big);
    }
    EXPECT_EQ(executions[700].load(), 0u);
    EXPECT_EQ(call(h_.handle, kEcho, "after").body, "after");
    int fd = connect_to(server_.port());
    ASSERT_EQ(send(fd, good.data(), good.size(), 0), static_cast<ssize_t>(good.size()));
    EXPECT_EQ(receive(fd, ncs::frame::kHeaderSize + 4).substr(ncs::frame::kHeaderSize), word_body(1));
    close(fd);
}

}  // namespace

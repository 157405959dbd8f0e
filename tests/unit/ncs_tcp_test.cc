// The runtime over TCP on 127.0.0.1: the carrier, its pool and repeat rules,
// and the server, with a cutting proxy, raw frames and a server process.
#include "ncs/frame.h"
#include "ncs/server.h"
#include "ncs_echo.h"
#include "test_support.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <memory>
#include <random>
#include <thread>
#include <vector>

namespace {

using ncsecho::call;
using ncsecho::word_body;

bool comm_status(uint32_t status)
{
    return (status & 0xFFFF0000u) == RPC_COMM_MODULE;
}

// The process's server for the echo interface, on a free port.
class Server {
public:
    explicit Server(uint32_t threads = 4)
    {
        EXPECT_EQ(ncsecho::register_interface(), rpc__s_ok);
        socket__addr_t bound{};
        uint32_t bound_len = 0;
        uint32_t status = 1;
        rpc__listen("127.0.0.1", 0, threads, &bound, &bound_len, &status);
        EXPECT_EQ(status, rpc__s_ok);
        EXPECT_EQ(bound_len, sizeof(sockaddr_in));
        port_ = ntohs(bound.in4.sin_port);
    }
    ~Server()
    {
        ncsecho::gate_open = true;
        rpc__stop_listening();
        ncsecho::unregister_interface();
        ncsecho::gate_open = false;
    }
    uint16_t port() const { return port_; }

private:
    uint16_t port_ = 0;
};

rpc__server_stats_t stats()
{
    rpc__server_stats_t s;
    rpc__inq_server_stats(&s);
    return s;
}

// A handle bound to 127.0.0.1 and a port.
struct TcpHandle {
    explicit TcpHandle(uint16_t port)
    {
        socket__addr_t addr{};
        addr.in4.sin_family = AF_INET;
        addr.in4.sin_port = htons(port);
        addr.in4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        uint32_t status = 1;
        handle = rpc__bind(&uuid__nil, &addr, sizeof(sockaddr_in), &status);
        EXPECT_EQ(status, rpc__s_ok);
    }
    ~TcpHandle()
    {
        uint32_t status;
        rpc__free_handle(handle, &status);
    }
    handle_t handle = nullptr;
};

int connect_to(uint16_t port)
{
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(port);
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (connect(fd, reinterpret_cast<sockaddr *>(&addr), sizeof addr) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

bool send_all(int fd, const void *data, size_t len)
{
    const char *p = static_cast<const char *>(data);
    while (len > 0) {
        ssize_t n = send(fd, p, len, MSG_NOSIGNAL);
        if (n <= 0)
            return false;
        p += n;
        len -= static_cast<size_t>(n);
    }
    return true;
}

// A connection of the test's own to the server, for frames the carrier would
// never send. Reads give up after 5 s.
class RawConnection {
public:
    explicit RawConnection(uint16_t port) : fd_(connect_to(port))
    {
        timeval limit{5, 0};
        setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    }
    ~RawConnection() { close(fd_); }
    RawConnection(const RawConnection &) = delete;
    RawConnection &operator=(const RawConnection &) = delete;

    bool send(const std::string &bytes) { return send_all(fd_, bytes.data(), bytes.size()); }
    void end_sending() { shutdown(fd_, SHUT_WR); }
    // Reads one answer frame's header; false when the server closed instead.
    bool answer(ncs::frame::Header &header)
    {
        ncs::frame::Bytes bytes;
        size_t got = 0;
        while (got < sizeof bytes) {
            ssize_t n = recv(fd_, bytes + got, sizeof bytes - got, 0);
            if (n <= 0)
                return false;
            got += static_cast<size_t>(n);
        }
        return ncs::frame::decode(bytes, header);
    }
    // Whether the server closed the connection (nothing more to read).
    bool closed_by_server()
    {
        char byte;
        return recv(fd_, &byte, 1, 0) <= 0;
    }

private:
    int fd_;
};

std::string request_frame(uint32_t opnum, const std::string &body, uint32_t drep = NCS_DREP_LOCAL,
                          uint32_t body_len_field = UINT32_MAX)
{
    ncs::frame::Header h;
    h.kind = ncs::frame::kRequest;
    h.call_id = 77;
    h.drep = drep;
    h.if_id = ncsecho::kInterface.id;
    h.if_vers = ncsecho::kInterface.vers;
    h.opnum = opnum;
    h.body_len = body_len_field != UINT32_MAX ? body_len_field : static_cast<uint32_t>(body.size());
    ncs::frame::Bytes bytes;
    ncs::frame::encode(h, bytes);
    return std::string(reinterpret_cast<const char *>(bytes), sizeof bytes) + body;
}

// A proxy in front of the server that cuts the connection that carries a
// chosen byte: after cut_after(n), n more bytes pass (either way), then both
// sides of that connection are shut down.
class CutProxy {
public:
    explicit CutProxy(uint16_t target) : target_(target)
    {
        listen_fd_ = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof addr;
        bind(listen_fd_, reinterpret_cast<sockaddr *>(&addr), len);
        listen(listen_fd_, 16);
        getsockname(listen_fd_, reinterpret_cast<sockaddr *>(&addr), &len);
        port_ = ntohs(addr.sin_port);
        acceptor_ = std::thread([this] { accept_loop(); });
    }
    ~CutProxy()
    {
        shutdown(listen_fd_, SHUT_RDWR);
        acceptor_.join();
        {
            std::lock_guard<std::mutex> hold(mutex_);
            for (auto &link : links_)
                link->cut();
        }
        for (auto &thread : threads_)
            thread.join();
        close(listen_fd_);
    }
    uint16_t port() const { return port_; }
    void cut_after(long bytes)
    {
        std::lock_guard<std::mutex> hold(mutex_);
        budget_ = bytes;
    }

private:
    struct Link {
        Link(int client_fd, int server_fd) : client(client_fd), server(server_fd) {}
        Link(const Link &) = delete;
        Link &operator=(const Link &) = delete;
        int client;
        int server;
        bool cut_off = false;  // guarded by CutProxy::mutex_: nothing more passes
        void cut()
        {
            shutdown(client, SHUT_RDWR);
            shutdown(server, SHUT_RDWR);
        }
        ~Link()
        {
            close(client);
            close(server);
        }
    };

    void accept_loop()
    {
        for (;;) {
            int client = accept(listen_fd_, nullptr, nullptr);
            if (client < 0)
                return;
            auto link = std::make_shared<Link>(client, connect_to(target_));
            std::lock_guard<std::mutex> hold(mutex_);
            links_.push_back(link);
            threads_.emplace_back([this, link] { pump(link, link->client, link->server); });
            threads_.emplace_back([this, link] { pump(link, link->server, link->client); });
        }
    }

    // Bytes of `n` on `link` that may pass, and whether the link is cut
    // after them.
    size_t take(Link &link, size_t n, bool &cut)
    {
        std::lock_guard<std::mutex> hold(mutex_);
        cut = link.cut_off;
        if (cut || budget_ < 0)
            return cut ? 0 : n;
        size_t allowed = std::min(n, static_cast<size_t>(budget_));
        budget_ -= static_cast<long>(allowed);
        if (budget_ == 0) {
            cut = link.cut_off = true;
            budget_ = -1;
        }
        return allowed;
    }

    void pump(std::shared_ptr<Link> link, int from, int to)
    {
        std::vector<char> buffer(1 << 16);
        for (;;) {
            ssize_t n = recv(from, buffer.data(), buffer.size(), 0);
            if (n <= 0)
                break;
            bool cut = false;
            size_t allowed = take(*link, static_cast<size_t>(n), cut);
            if (!send_all(to, buffer.data(), allowed) || cut)
                break;
        }
        link->cut();
    }

    uint16_t target_;
    uint16_t port_ = 0;
    int listen_fd_ = -1;
    std::mutex mutex_;  // guards budget_, links_, threads_
    long budget_ = -1;
    std::vector<std::shared_ptr<Link>> links_;
    std::vector<std::thread> threads_;
    std::thread acceptor_;
};

class TcpCall : public ::testing::Test {
protected:
    Server server_;
    TcpHandle h_{server_.port()};
};

TEST_F(TcpCall, BodiesOfEverySizeRoundTripAndLandWhereTheyFit)
{
    for (uint32_t op : {ncsecho::kEcho, ncsecho::kEchoInPacket}) {
        for (size_t size : {size_t{0}, size_t{1}, size_t{992}, size_t{993}, size_t{70000}, size_t{529488}}) {
            SCOPED_TRACE(testing::Message() << "op " << op << " size " << size);
            std::string body = dpxtest::pattern_bytes(size, static_cast<uint32_t>(size));
            ncsecho::Outcome out = call(h_.handle, op, body);
            EXPECT_EQ(out.fault, 0u);
            EXPECT_EQ(out.body, body);
            EXPECT_EQ(out.must_free, size > 1024 - RPC_DATA_OFFS);
            EXPECT_EQ(out.in_reply_buf, !out.must_free);
            EXPECT_EQ(out.drep, static_cast<uint32_t>(NCS_DREP_LOCAL));
        }
    }
}

TEST_F(TcpCall, OneConnectionServesManyCallsOfManyHandles)
{
    uint64_t before = stats().accepted;
    uint32_t status;
    handle_t dup = rpc__dup_handle(h_.handle, &status);
    for (int i = 0; i < 50; ++i) {
        ASSERT_EQ(call(i % 2 ? dup : h_.handle, ncsecho::kEcho, "ping").body, "ping");
        ASSERT_EQ(call(h_.handle, ncsecho::kRaise, word_body(0xF11E0001u)).fault, 0xF11E0001u);
    }
    rpc__free_handle(dup, &status);
    EXPECT_EQ(stats().accepted, before + 1);
}

TEST_F(TcpCall, ServerFaultsComeBackWithTheirStatus)
{
    for (uint32_t status : {rpc__s_fault_invalid_bound, 0xF11E0003u, rpc__s_comm_failure})
        EXPECT_EQ(call(h_.handle, ncsecho::kRaise, word_body(status)).fault, status);
    EXPECT_EQ(call(h_.handle, ncsecho::kThrow, "x").fault, rpc__s_fault_unspec);
    EXPECT_EQ(call(h_.handle, ncsecho::kOpCount, "x").fault, rpc__s_op_rng_error);
    rpc__if_spec_t unknown = ncsecho::kInterface;
    unknown.id.time_high ^= 1;
    EXPECT_EQ(call(h_.handle, 0, "x", RPC_OPT_IDEMPOTENT, 1024, unknown).fault, rpc__s_unknown_if);
}

TEST_F(TcpCall, ServerHandsTheSendersDrepToTheStubAndAnswersWithItsOwn)
{
    const uint32_t foreign = NCS_DREP(NCS_INT_BIG, NCS_CHAR_EBCDIC, 0);
    RawConnection raw(server_.port());
    ASSERT_TRUE(raw.send(request_frame(ncsecho::kDrep, "", foreign)));
    ncs::frame::Header answer;
    ASSERT_TRUE(raw.answer(answer));
    EXPECT_EQ(answer.kind, ncs::frame::kReply);
    EXPECT_EQ(answer.call_id, 77u);
    EXPECT_EQ(answer.drep, static_cast<uint32_t>(NCS_DREP_LOCAL));
    ASSERT_EQ(answer.body_len, 4u);
}

TEST_F(TcpCall, AtMostOnceCallRunsAtMostOnceWhereverItsConnectionIsCut)
{
    CutProxy proxy(server_.port());
    TcpHandle via_proxy(proxy.port());
    const long exchange_bytes = 2 * long{ncs::frame::kHeaderSize} + 8 + 4;
    std::vector<uint32_t> succeeded;
    for (long cut = 0; cut <= exchange_bytes; ++cut) {
        SCOPED_TRACE(testing::Message() << "cut after " << cut);
        ncsecho::Outcome warm = call(via_proxy.handle, ncsecho::kEcho, "warm");  // a pooled connection
        ASSERT_EQ(warm.body, "warm") << std::hex << warm.fault;
        uint32_t id = 5000 + static_cast<uint32_t>(cut);
        proxy.cut_after(cut);
        ncsecho::Outcome out = call(via_proxy.handle, ncsecho::kCount, word_body(id, 8), RPC_OPT_AT_MOST_ONCE);
        proxy.cut_after(-1);
        if (out.fault == 0) {
            EXPECT_EQ(out.body, std::string("\1\0\0\0", 4));
            succeeded.push_back(id);
        } else {
            EXPECT_TRUE(comm_status(out.fault)) << std::hex << out.fault;
        }
    }
    // Cut after its last byte, the exchange is whole.
    EXPECT_EQ(succeeded, std::vector<uint32_t>{5000 + static_cast<uint32_t>(exchange_bytes)});
    // Wait for the server to finish whatever reached it, then count.
    ASSERT_EQ(call(h_.handle, ncsecho::kEcho, "sync").body, "sync");
    while (stats().calls != 0)
        std::this_thread::yield();
    for (long cut = 0; cut <= exchange_bytes; ++cut)
        EXPECT_LE(ncsecho::executions_of(5000 + static_cast<uint32_t>(cut)), 1u) << "cut after " << cut;
}

TEST_F(TcpCall, IdempotentCallSucceedsWhereverItsPooledConnectionIsCut)
{
    CutProxy proxy(server_.port());
    TcpHandle via_proxy(proxy.port());
    const long exchange_bytes = 2 * long{ncs::frame::kHeaderSize} + 8 + 4;
    for (long cut = 0; cut < exchange_bytes; ++cut) {
        SCOPED_TRACE(testing::Message() << "cut after " << cut);
        ncsecho::Outcome warm = call(via_proxy.handle, ncsecho::kEcho, "warm");
        ASSERT_EQ(warm.body, "warm") << std::hex << warm.fault;
        proxy.cut_after(cut);
        ncsecho::Outcome out =
            call(via_proxy.handle, ncsecho::kCount, word_body(9000 + static_cast<uint32_t>(cut), 8));
        proxy.cut_after(-1);
        EXPECT_EQ(out.fault, 0u) << std::hex << out.fault;
    }
}

TEST(TcpIdle, CallAfterTheServerClosedAnIdleConnectionOpensANewOne)
{
    dpxtest::ScopedEnv idle("NCS_IDLE_TIMEOUT_S", "1");
    Server server;
    TcpHandle h(server.port());
    ASSERT_EQ(call(h.handle, ncsecho::kEcho, "one").body, "one");
    uint64_t before = stats().accepted;
    while (stats().connections != 0)
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    ncsecho::Outcome out = call(h.handle, ncsecho::kCount, word_body(12345, 8), RPC_OPT_AT_MOST_ONCE);
    EXPECT_EQ(out.fault, 0u);
    EXPECT_EQ(stats().accepted, before + 1);
}

TEST(TcpServerGone, StoppedServerGivesACommunicationStatus)
{
    auto server = std::make_unique<Server>();
    TcpHandle h(server->port());
    ASSERT_EQ(call(h.handle, ncsecho::kEcho, "x").body, "x");
    server.reset();
    EXPECT_EQ(call(h.handle, ncsecho::kEcho, "x").fault, rpc__s_connect_refused);
    EXPECT_EQ(call(h.handle, ncsecho::kEcho, "x", RPC_OPT_AT_MOST_ONCE).fault, rpc__s_connect_refused);
}

TEST(TcpServerGone, ConnectThatGetsNoAnswerEndsAtItsTimeOut)
{
    dpxtest::ScopedEnv timeout("NCS_CONNECT_TIMEOUT_MS", "200");
    // A listener that never accepts: once its queue is full, the kernel
    // drops further connection requests unanswered.
    int listener = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof addr;
    ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr *>(&addr), len), 0);
    ASSERT_EQ(listen(listener, 0), 0);
    getsockname(listener, reinterpret_cast<sockaddr *>(&addr), &len);
    uint16_t port = ntohs(addr.sin_port);
    std::vector<int> queued;
    for (int i = 0; i < 4; ++i) {
        int fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK, 0);
        connect(fd, reinterpret_cast<sockaddr *>(&addr), len);
        queued.push_back(fd);
    }
    TcpHandle h(port);
    EXPECT_EQ(call(h.handle, ncsecho::kEcho, "x").fault, rpc__s_timeout);
    for (int fd : queued)
        close(fd);
    close(listener);
}

TEST(TcpServerGone, CallThatGetsNoAnswerEndsAtItsTimeOut)
{
    dpxtest::ScopedEnv timeout("NCS_CALL_TIMEOUT_MS", "200");
    Server server;
    TcpHandle h(server.port());
    EXPECT_EQ(call(h.handle, ncsecho::kGate, "x").fault, rpc__s_timeout);
}

TEST(TcpIpv6, CallsReachAServerOnAnIpv6Address)
{
    ASSERT_EQ(ncsecho::register_interface(), rpc__s_ok);
    socket__addr_t bound{};
    uint32_t bound_len = 0;
    uint32_t status = 1;
    rpc__listen("::1", 0, 2, &bound, &bound_len, &status);
    if (status == rpc__s_ok) {
        EXPECT_EQ(bound.sa.sa_family, AF_INET6);
        handle_t h = rpc__bind(&uuid__nil, &bound, bound_len, &status);
        EXPECT_EQ(call(h, ncsecho::kEcho, "six").body, "six");
        rpc__free_handle(h, &status);
        rpc__stop_listening();
    }
    ncsecho::unregister_interface();
    if (status != rpc__s_ok)
        GTEST_SKIP() << "no IPv6 loopback here";
}

TEST(TcpServerStop, OneServerPerProcess)
{
    Server server;
    uint32_t status = 0;
    rpc__listen("127.0.0.1", 0, 1, nullptr, nullptr, &status);
    EXPECT_EQ(status, rpc__s_cant_listen);
    rpc__stop_listening();
    rpc__listen("no-such-host.invalid", 0, 1, nullptr, nullptr, &status);
    EXPECT_EQ(status, rpc__s_unknown_host);
}

TEST(TcpServerStop, CallsUnderWayFinishBeforeTheServerStops)
{
    Server server;
    TcpHandle h(server.port());
    uint32_t entered = ncsecho::entered.load();
    ncsecho::Outcome out;
    std::thread caller([&] { out = call(h.handle, ncsecho::kGate, "in flight", RPC_OPT_AT_MOST_ONCE); });
    while (ncsecho::entered.load() == entered)
        std::this_thread::yield();
    std::thread stopper([] { rpc__stop_listening(); });
    ncsecho::gate_open = true;
    stopper.join();
    caller.join();
    EXPECT_EQ(out.fault, 0u);
    EXPECT_EQ(out.body, "in flight");
    EXPECT_EQ(call(h.handle, ncsecho::kEcho, "x").fault, rpc__s_connect_refused);
}

TEST(TcpServerLimits, CallsRunSideBySideUpToThePoolSize)
{
    Server server(4);
    TcpHandle h(server.port());
    uint32_t entered = ncsecho::entered.load();
    std::vector<std::thread> callers;
    std::vector<ncsecho::Outcome> outs(4);
    for (int i = 0; i < 4; ++i)
        callers.emplace_back([&, i] {
            TcpHandle own(server.port());
            outs[i] = call(own.handle, ncsecho::kGate, std::to_string(i));
        });
    // The stubs hold back until the gate opens, so four inside at once
    // means four threads of the server serve them.
    auto give_up = std::chrono::steady_clock::now() + std::chrono::seconds(8);
    while (ncsecho::entered.load() - entered < 4 && std::chrono::steady_clock::now() < give_up)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    EXPECT_EQ(ncsecho::entered.load() - entered, 4u);
    EXPECT_EQ(stats().calls, 4u);
    ncsecho::gate_open = true;
    for (auto &caller : callers)
        caller.join();
    for (int i = 0; i < 4; ++i)
        EXPECT_EQ(outs[i].body, std::to_string(i));
}

TEST(TcpServerLimits, ConnectionBeyondTheLimitIsRefusedBusy)
{
    dpxtest::ScopedEnv limit("NCS_MAX_CONNECTIONS", "2");
    Server server;
    RawConnection first(server.port());
    RawConnection second(server.port());
    while (stats().connections < 2)
        std::this_thread::yield();
    RawConnection third(server.port());
    ncs::frame::Header answer;
    ASSERT_TRUE(third.answer(answer));
    EXPECT_EQ(answer.kind, ncs::frame::kFault);
    EXPECT_EQ(answer.fault, rpc__s_server_busy);
    EXPECT_EQ(answer.call_id, 0u);
    EXPECT_TRUE(third.closed_by_server());
}

TEST_F(TcpCall, OversizedRequestIsRefusedBeforeItsBodyIsRead)
{
    RawConnection raw(server_.port());
    ASSERT_TRUE(raw.send(request_frame(ncsecho::kEcho, "", NCS_DREP_LOCAL, RPC_MAX_BODY + 1)));
    ncs::frame::Header answer;
    ASSERT_TRUE(raw.answer(answer));
    EXPECT_EQ(answer.kind, ncs::frame::kFault);
    EXPECT_EQ(answer.fault, rpc__s_too_big);
    EXPECT_EQ(answer.flags, ncs::frame::kClosing);
    EXPECT_TRUE(raw.closed_by_server());
    // The largest body that is allowed still goes through.
    std::string body = dpxtest::pattern_bytes(RPC_MAX_BODY, 3);
    EXPECT_EQ(call(h_.handle, ncsecho::kEcho, body).body, body);
}

TEST_F(TcpCall, MalformedAndTruncatedFramesCloseOnlyTheirOwnConnection)
{
    ASSERT_EQ(call(h_.handle, ncsecho::kEcho, "before").body, "before");  // pooled from here on
    std::string good = request_frame(ncsecho::kCount, word_body(424242, 16));
    std::vector<std::string> bad;
    for (size_t len = 0; len < good.size(); ++len)
        bad.push_back(good.substr(0, len));  // truncated, then the sender stops
    std::string wrong = good;
    wrong[0] ^= 0x40;  // magic
    bad.push_back(wrong);
    wrong = good;
    wrong[ncs::frame::kVersionOffset + 1] = 9;  // version
    bad.push_back(wrong);
    for (unsigned char kind : {0, 2, 3, 200}) {
        wrong = good;
        wrong[ncs::frame::kKindOffset] = static_cast<char>(kind);
        bad.push_back(wrong);
    }
    std::mt19937 random(20240611);
    for (int i = 0; i < 100; ++i) {
        std::string noise(random() % 300, '\0');
        for (char &c : noise)
            c = static_cast<char>(random());
        bad.push_back(noise);
    }
    for (const std::string &bytes : bad) {
        RawConnection raw(server_.port());
        raw.send(bytes);
        raw.end_sending();
        ncs::frame::Header answer;
        EXPECT_FALSE(raw.answer(answer) && answer.kind == ncs::frame::kReply);
    }
    EXPECT_EQ(ncsecho::executions_of(424242), 0u);
    EXPECT_EQ(call(h_.handle, ncsecho::kEcho, "after").body, "after");
    RawConnection raw(server_.port());
    ASSERT_TRUE(raw.send(good));
    ncs::frame::Header answer;
    ASSERT_TRUE(raw.answer(answer));
    EXPECT_EQ(answer.kind, ncs::frame::kReply);
    EXPECT_EQ(ncsecho::executions_of(424242), 1u);
}

// The echo server as a process of its own.
class EchoServerProcess {
public:
    EchoServerProcess()
    {
        std::string dir = dpxtest::bin_dir();
        if (dir.empty()) {
            char self[PATH_MAX] = {};
            ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
            dir = std::string(self, n > 0 ? static_cast<size_t>(n) : 0);
            dir = dir.substr(0, dir.rfind('/'));
        }
        std::string program = dir + "/ncs_echo_server";
        int out[2];
        EXPECT_EQ(pipe(out), 0);
        pid_ = fork();
        if (pid_ == 0) {
            dup2(out[1], STDOUT_FILENO);
            close(out[0]);
            close(out[1]);
            execl(program.c_str(), program.c_str(), static_cast<char *>(nullptr));
            _exit(127);
        }
        close(out[1]);
        FILE *lines = fdopen(out[0], "r");
        char line[128] = {};
        unsigned port = 0;
        if (std::fgets(line, sizeof line, lines) != nullptr)
            std::sscanf(line, "listening on 127.0.0.1:%u", &port);
        std::fclose(lines);
        port_ = static_cast<uint16_t>(port);
        EXPECT_NE(port_, 0) << "no \"listening on\" line from " << program;
    }
    ~EchoServerProcess() { stop(SIGKILL); }
    uint16_t port() const { return port_; }
    // Signals the server and waits for it; returns its wait status.
    int stop(int signal)
    {
        int status = 0;
        if (pid_ > 0) {
            kill(pid_, signal);
            waitpid(pid_, &status, 0);
            pid_ = -1;
        }
        return status;
    }

private:
    pid_t pid_ = -1;
    uint16_t port_ = 0;
};

TEST(TcpTwoProcesses, ServerKilledMidCallGivesTheClientACommunicationStatus)
{
    dpxtest::ScopedEnv timeout("NCS_CALL_TIMEOUT_MS", "20000");
    EchoServerProcess server;
    ASSERT_NE(server.port(), 0);
    TcpHandle h(server.port());
    std::string big = dpxtest::pattern_bytes(529488, 9);
    ASSERT_EQ(call(h.handle, ncsecho::kEcho, big).body, big);

    ncsecho::Outcome out;
    std::thread caller([&] { out = call(h.handle, ncsecho::kSlowEcho, word_body(15000, 64), RPC_OPT_AT_MOST_ONCE); });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    server.stop(SIGKILL);
    caller.join();
    EXPECT_TRUE(out.fault == rpc__s_comm_failure || out.fault == rpc__s_connection_reset) << std::hex << out.fault;

    EchoServerProcess restarted;
    TcpHandle again(restarted.port());
    EXPECT_EQ(call(again.handle, ncsecho::kEcho, "back").body, "back");
    int status = restarted.stop(SIGTERM);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

}  // namespace

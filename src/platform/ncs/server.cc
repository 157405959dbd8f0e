// The RPC server: an acceptor and one session per connection on an
// io_context that the server's threads run.
//
// Each thread of the server runs an io_context of its own, and an accepted
// connection belongs to one of them, chosen in turn: no handler ever hands
// work to another thread, so the threads never wake or wait for each other.
// Calls of connections of one thread take turns; calls at once are bounded
// by the threads. The acceptor has a thread of its own, so connections are
// taken while every call thread is busy.
//
// A session reads one request frame at a time, dispatches it on its thread
// and writes the answer before it reads the next frame, so a session has one
// operation outstanding at a time, plus its timer; both run on the session's
// strand.
//
// Every completion that goes through the io_context costs a trip through its
// queue and its epoll. So a session's socket is non-blocking, and a
// body that is already there, or a reply that the socket buffer takes whole,
// moves on the spot; only the rest waits for an asynchronous operation. The
// idle timer isn't re-armed per call either: it fires once per idle period
// and looks at when the session began its present wait for the peer.
//
// Lock order: Server::mutex_ guards the session table and the stop flag and
// is never held while a handler runs or a socket is touched.
#include "ncs/server.h"

#include "ncs/frame.h"
#include "ncs/net.h"
#include "ncs/runtime.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

namespace {

using ncs::net::tcp;

constexpr uint32_t kDefaultThreads = 4;
constexpr uint32_t kMaxThreads = 64;
constexpr uint32_t kDefaultMaxConnections = 256;
constexpr uint32_t kDefaultIdleTimeoutS = 300;
constexpr int kBacklog = 128;
// Room for a reply body that the server offers every call: small replies
// need no packet of their own.
constexpr uint32_t kOfferedReply = 8192;

struct PacketDeleter {
    void operator()(void *pkt) const { rpc__free_pkt(pkt); }
};
using Packet = std::unique_ptr<void, PacketDeleter>;

// A packet with room for `size` body bytes, or null when there is no memory.
Packet allocate_packet(uint32_t size)
{
    try {
        void *pkt = nullptr;
        rpc__alloc_pkt(size, &pkt);
        return Packet(pkt);
    } catch (const exc::Fault &) {
        EXC1_Allow();
        return nullptr;
    }
}

class Server;

class Session : public std::enable_shared_from_this<Session> {
public:
    Session(Server &server, tcp::socket socket)
        : server_(server), socket_(std::move(socket)), timer_(socket_.get_executor())
    {
    }
    ~Session();

    void start()
    {
        asio::error_code ignored;
        socket_.non_blocking(true, ignored);
        touch();
        arm_timer();
        read_header();
    }
    // Runs on the strand: closes the connection unless a call is under way.
    void stop()
    {
        if (!in_call_)
            close();
    }
    // Answers the connection with a fault that names no call, and closes it.
    void refuse(uint32_t status) { send_fault(0, status, true); }
    asio::any_io_executor executor() { return socket_.get_executor(); }

private:
    void read_header();
    void on_header(const asio::error_code &ec);
    void on_body(const asio::error_code &ec);
    void send_fault(uint32_t call_id, uint32_t status, bool closing);
    void send(std::array<asio::const_buffer, 2> buffers, bool closing);
    void on_sent(const asio::error_code &ec, bool closing);
    void touch() { waiting_since_ = asio::steady_timer::clock_type::now(); }
    void arm_timer();
    void close()
    {
        asio::error_code ignored;
        socket_.close(ignored);
        timer_.cancel();
    }

    Server &server_;
    tcp::socket socket_;
    asio::steady_timer timer_;
    asio::steady_timer::time_point waiting_since_;  // start of the present wait for the peer
    ncs::frame::Bytes in_header_;
    ncs::frame::Bytes out_header_;
    ncs::frame::Header request_;
    Packet request_pkt_;
    Packet offered_pkt_;
    Packet reply_pkt_;  // a stub's own reply packet while it is sent
    bool in_call_ = false;
};

class Server {
public:
    Server(uint32_t threads, uint32_t max_connections, std::chrono::seconds idle_timeout)
        : max_connections_(max_connections), idle_timeout_(idle_timeout), contexts_(make_contexts(threads))
    {
    }
    Server(const Server &) = delete;
    Server &operator=(const Server &) = delete;
    ~Server() { stop(); }

    uint32_t listen(const tcp::endpoint &endpoint)
    {
        asio::error_code ec;
        acceptor_.open(endpoint.protocol(), ec);
        if (!ec)
            acceptor_.set_option(asio::socket_base::reuse_address(true), ec);
        if (!ec && endpoint.protocol() == tcp::v6())
            acceptor_.set_option(asio::ip::v6_only(false), ec);
        if (!ec) {
            // Accepted sockets take these over.
            acceptor_.set_option(asio::socket_base::receive_buffer_size(ncs::net::kSocketBuffer), ec);
            acceptor_.set_option(asio::socket_base::send_buffer_size(ncs::net::kSocketBuffer), ec);
            ec.clear();
            acceptor_.bind(endpoint, ec);
        }
        if (!ec)
            acceptor_.listen(kBacklog, ec);
        if (!ec)
            local_ = acceptor_.local_endpoint(ec);
        return ec ? rpc__s_cant_listen : rpc__s_ok;
    }

    void start()
    {
        accept();
        for (auto &context : contexts_)
            busy_.emplace_back(context->get_executor());
        for (auto &context : contexts_)
            threads_.emplace_back([io = context.get()] { run(*io); });
        threads_.emplace_back([this] { run(accept_io_); });
    }

    void stop()
    {
        std::vector<std::shared_ptr<Session>> sessions;
        {
            std::lock_guard<std::mutex> hold(mutex_);
            if (stopping_)
                return;
            stopping_ = true;
            for (auto &[session, weak] : sessions_)
                if (auto strong = weak.lock())
                    sessions.push_back(std::move(strong));
        }
        asio::post(acceptor_strand_, [this] {
            asio::error_code ignored;
            acceptor_.close(ignored);
        });
        for (auto &session : sessions)
            asio::post(session->executor(), [session] { session->stop(); });
        sessions.clear();
        // Each thread ends once its connections are closed.
        busy_.clear();
        for (auto &thread : threads_)
            thread.join();
        threads_.clear();
    }

    const tcp::endpoint &local() const { return local_; }
    std::chrono::seconds idle_timeout() const { return idle_timeout_; }
    bool stopping()
    {
        std::lock_guard<std::mutex> hold(mutex_);
        return stopping_;
    }

    void forget(Session *session)
    {
        std::lock_guard<std::mutex> hold(mutex_);
        sessions_.erase(session);
    }

    rpc__server_stats_t stats()
    {
        std::lock_guard<std::mutex> hold(mutex_);
        return {accepted_, static_cast<uint32_t>(sessions_.size()), calls_.load()};
    }

    void call_begins() { ++calls_; }
    void call_ends() { --calls_; }

private:
    void accept()
    {
        asio::io_context &io = *contexts_[next_context_++ % contexts_.size()];
        acceptor_.async_accept(asio::make_strand(io),
                               asio::bind_executor(acceptor_strand_, [this](const asio::error_code &ec,
                                                                            tcp::socket socket) {
                                   if (ec == asio::error::operation_aborted || !acceptor_.is_open())
                                       return;
                                   if (!ec)
                                       admit(std::move(socket));
                                   accept();
                               }));
    }

    void admit(tcp::socket socket)
    {
        asio::error_code ignored;
        socket.set_option(tcp::no_delay(true), ignored);
        auto session = std::make_shared<Session>(*this, std::move(socket));
        bool refused = false;
        {
            std::lock_guard<std::mutex> hold(mutex_);
            ++accepted_;
            if (stopping_)
                return;
            refused = sessions_.size() >= max_connections_;
            if (!refused)
                sessions_.emplace(session.get(), session);
        }
        asio::post(session->executor(), [session, refused] {
            if (refused)
                session->refuse(rpc__s_server_busy);
            else
                session->start();
        });
    }

    static std::vector<std::unique_ptr<asio::io_context>> make_contexts(uint32_t count)
    {
        std::vector<std::unique_ptr<asio::io_context>> contexts;
        for (uint32_t i = 0; i < count; ++i)
            contexts.push_back(std::make_unique<asio::io_context>(1));
        return contexts;
    }

    static void run(asio::io_context &io)
    {
        // A handler that throws ends only its own session's work.
        for (;;) {
            try {
                io.run();
                return;
            } catch (...) {
            }
        }
    }

    const uint32_t max_connections_;
    const std::chrono::seconds idle_timeout_;

    // Declared before contexts_: sessions that a context still holds when it
    // goes unregister themselves here.
    std::mutex mutex_;  // guards the three members below
    bool stopping_ = false;
    uint64_t accepted_ = 0;
    std::map<Session *, std::weak_ptr<Session>> sessions_;
    std::atomic<uint32_t> calls_{0};

    // One per call thread.
    std::vector<std::unique_ptr<asio::io_context>> contexts_;
    std::vector<asio::executor_work_guard<asio::io_context::executor_type>> busy_;  // till stop
    size_t next_context_ = 0;  // on the acceptor's strand only
    asio::io_context accept_io_{1};
    asio::strand<asio::io_context::executor_type> acceptor_strand_{asio::make_strand(accept_io_)};
    tcp::acceptor acceptor_{acceptor_strand_};
    tcp::endpoint local_;
    std::vector<std::thread> threads_;
};

Session::~Session()
{
    server_.forget(this);
}

// Fires one idle period after the session began to wait for its peer: for
// a request frame since the last reply went out, or for the peer to read a
// reply since it began to go out. A manager's run never counts, since the
// timer's handler can't run on the strand meanwhile. A session that has
// moved on since waits for the rest of its period.
void Session::arm_timer()
{
    timer_.expires_at(waiting_since_ + server_.idle_timeout());
    timer_.async_wait([self = shared_from_this()](const asio::error_code &ec) {
        if (ec || !self->socket_.is_open())
            return;
        if (self->waiting_since_ + self->server_.idle_timeout() <= asio::steady_timer::clock_type::now())
            self->close();
        else
            self->arm_timer();
    });
}

void Session::read_header()
{
    if (server_.stopping()) {
        close();
        return;
    }
    asio::async_read(socket_, asio::buffer(in_header_),
                     [self = shared_from_this()](const asio::error_code &ec, size_t) { self->on_header(ec); });
}

void Session::on_header(const asio::error_code &ec)
{
    if (ec || !ncs::frame::decode(in_header_, request_) || request_.kind != ncs::frame::kRequest) {
        close();
        return;
    }
    if (request_.body_len > RPC_MAX_BODY) {
        send_fault(request_.call_id, rpc__s_too_big, true);
        return;
    }
    request_pkt_ = allocate_packet(request_.body_len);
    if (request_pkt_ == nullptr) {
        send_fault(request_.call_id, rpc__s_no_memory, true);
        return;
    }
    auto *body = static_cast<unsigned char *>(request_pkt_.get()) + RPC_DATA_OFFS;
    // What has arrived is taken now; the rest is waited for.
    asio::error_code now;
    const size_t got = asio::read(socket_, asio::buffer(body, request_.body_len), ncs::net::whole, now);
    if (now != asio::error::would_block) {
        on_body(now);
        return;
    }
    asio::async_read(socket_, asio::buffer(body + got, request_.body_len - got), ncs::net::whole,
                     [self = shared_from_this()](const asio::error_code &ec, size_t) { self->on_body(ec); });
}

void Session::on_body(const asio::error_code &ec)
{
    if (ec) {
        close();
        return;
    }
    if (offered_pkt_ == nullptr)
        offered_pkt_ = allocate_packet(kOfferedReply);
    void *offered = offered_pkt_.get();
    in_call_ = true;
    server_.call_begins();
    ncs::Dispatched outcome =
        ncs::dispatch(request_.if_id, request_.if_vers, request_.opnum, request_.drep, request_pkt_.get(),
                      request_.body_len, offered, offered != nullptr ? kOfferedReply : 0);
    server_.call_ends();
    request_pkt_.reset();
    if (outcome.fault != rpc__s_ok) {
        send_fault(request_.call_id, outcome.fault, false);
        return;
    }
    if (outcome.must_free)
        reply_pkt_.reset(outcome.reply_pkt);

    ncs::frame::Header reply = request_;
    reply.kind = ncs::frame::kReply;
    reply.flags = 0;
    reply.drep = NCS_DREP_LOCAL;
    reply.body_len = outcome.reply_len;
    reply.fault = 0;
    ncs::frame::encode(reply, out_header_);
    send({asio::buffer(out_header_),
          asio::buffer(static_cast<const unsigned char *>(outcome.reply_pkt) + RPC_DATA_OFFS, outcome.reply_len)},
         false);
}

void Session::send_fault(uint32_t call_id, uint32_t status, bool closing)
{
    ncs::frame::Header fault = request_;
    fault.kind = ncs::frame::kFault;
    fault.flags = closing ? ncs::frame::kClosing : 0;
    fault.call_id = call_id;
    fault.drep = NCS_DREP_LOCAL;
    fault.body_len = 0;
    fault.fault = status;
    ncs::frame::encode(fault, out_header_);
    send({asio::buffer(out_header_), asio::const_buffer()}, closing);
}

void Session::send(std::array<asio::const_buffer, 2> buffers, bool closing)
{
    in_call_ = !closing;
    touch();
    // What the socket buffer takes goes now; the rest is waited for.
    asio::error_code now;
    const size_t sent = asio::write(socket_, buffers, ncs::net::whole, now);
    if (now != asio::error::would_block) {
        on_sent(now, closing);
        return;
    }
    const size_t header_sent = std::min(sent, buffers[0].size());
    const std::array<asio::const_buffer, 2> rest = {buffers[0] + header_sent, buffers[1] + (sent - header_sent)};
    asio::async_write(socket_, rest, ncs::net::whole,
                      [self = shared_from_this(), closing](const asio::error_code &ec, size_t) {
                          self->on_sent(ec, closing);
                      });
}

void Session::on_sent(const asio::error_code &ec, bool closing)
{
    in_call_ = false;
    reply_pkt_.reset();
    if (ec || closing) {
        close();
        return;
    }
    touch();
    read_header();
}

std::mutex g_server_mutex;  // guards g_server
std::unique_ptr<Server> g_server;

// The endpoint to listen on: a literal, or the first address of a name.
bool endpoint_for(const char *host, uint32_t port, tcp::endpoint &endpoint)
{
    asio::error_code ec;
    asio::ip::address address = asio::ip::make_address(host, ec);
    if (ec) {
        asio::io_context io;
        tcp::resolver resolver(io);
        auto results = resolver.resolve(host, "", ec);
        if (ec || results.empty())
            return false;
        address = results.begin()->endpoint().address();
    }
    endpoint = tcp::endpoint(address, static_cast<uint16_t>(port));
    return true;
}

}  // namespace

extern "C" {

void rpc__listen(const char *host, uint32_t port, uint32_t threads, socket__addr_t *bound, uint32_t *bound_len,
                 uint32_t *status)
{
    uint32_t result = rpc__s_ok;
    try {
        tcp::endpoint endpoint;
        std::lock_guard<std::mutex> hold(g_server_mutex);
        if (port > 65535 || g_server != nullptr)
            result = rpc__s_cant_listen;
        else if (!endpoint_for(host != nullptr ? host : "127.0.0.1", port, endpoint))
            result = rpc__s_unknown_host;
        if (result == rpc__s_ok) {
            auto server = std::make_unique<Server>(
                std::min(threads > 0 ? threads : kDefaultThreads, kMaxThreads),
                ncs::setting("NCS_MAX_CONNECTIONS", kDefaultMaxConnections),
                std::chrono::seconds(ncs::setting("NCS_IDLE_TIMEOUT_S", kDefaultIdleTimeoutS)));
            result = server->listen(endpoint);
            if (result == rpc__s_ok) {
                server->start();
                socket__addr_t addr;
                uint32_t addr_len = ncs::net::address_of(server->local(), addr);
                if (bound != nullptr)
                    *bound = addr;
                if (bound_len != nullptr)
                    *bound_len = addr_len;
                g_server = std::move(server);
            }
        }
    } catch (const std::exception &) {
        result = rpc__s_cant_listen;
    }
    if (status != nullptr)
        *status = result;
}

void rpc__stop_listening(void)
{
    try {
        std::unique_ptr<Server> server;
        {
            std::lock_guard<std::mutex> hold(g_server_mutex);
            server = std::move(g_server);
        }
        // Stopped outside the lock: a call that runs to its end may still
        // ask for the counters.
        server.reset();
    } catch (...) {
        // Only a failing lock or join can throw; the server is gone either way.
    }
}

void rpc__inq_server_stats(rpc__server_stats_t *stats)
{
    if (stats == nullptr)
        return;
    *stats = rpc__server_stats_t{0, 0, 0};
    try {
        std::lock_guard<std::mutex> hold(g_server_mutex);
        if (g_server != nullptr)
            *stats = g_server->stats();
    } catch (...) {
        // A lock that can't be taken leaves the counters at 0.
    }
}

}  // extern "C"

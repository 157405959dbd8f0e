// The TCP carrier: one call is one request frame and one answer frame on a
// connection to the server's address (see frame.h).
//
// Connections are pooled per address: a call takes an idle connection to its
// address, or opens one, and gives it back after a complete exchange. A
// connection that failed in any way is closed, never pooled.
//
// Each connection owns a small io_context; the calling thread runs it for
// the length of one operation, up to the operation's deadline. A deadline
// that passes closes the connection, which ends the operation. Nothing of a
// connection is shared while a call uses it.
//
// Repeats: a request whose frame didn't leave in full can't have been run by
// the server (it runs only complete frames), so a failed write on a pooled
// connection is repeated once on a new connection, whatever the call. Once
// the frame has left, the request may have run: only an idempotent call is
// repeated then, once, and only after a failure of a pooled connection (the
// server may have closed it as idle). Time-outs are never repeated.
#include "ncs/deadline.h"
#include "ncs/frame.h"
#include "ncs/net.h"
#include "ncs/runtime.h"
#include "ncs/tls.h"

#include <array>
#include <atomic>
#include <chrono>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace {

using ncs::net::tcp;
using Clock = std::chrono::steady_clock;

constexpr uint32_t kDefaultConnectTimeoutMs = 5000;
constexpr uint32_t kDefaultCallTimeoutMs = 120000;
// Idle connections kept, over all addresses; the oldest goes first.
constexpr size_t kMaxIdle = 64;
constexpr uint32_t kDefaultClientIdleS = 60;
// What one read of a TLS connection's socket takes at most.
constexpr size_t kTlsReadChunk = 256 * 1024;

[[noreturn]] void raise(uint32_t status)
{
    EXC1__Raise(EXC1_Thread(), status);
}

// The communication status of a failed socket or TLS operation.
uint32_t status_of(const asio::error_code &ec)
{
    if (ec.category() == asio::error::get_ssl_category() || ec == asio::ssl::error::stream_truncated)
        return ncs::tls::status_of(ec);
    if (ec == asio::error::connection_refused)
        return rpc__s_connect_refused;
    if (ec == asio::error::connection_reset || ec == asio::error::broken_pipe ||
        ec == asio::error::connection_aborted)
        return rpc__s_connection_reset;
    if (ec == asio::error::timed_out)
        return rpc__s_timeout;
    return rpc__s_comm_failure;
}

// The pool's name for an address: family, port and IP address (with the
// scope of an IPv6 one), without the padding of the socket structures.
std::string pool_key(const socket__addr_t &addr)
{
    std::string key;
    auto add = [&key](const void *p, size_t n) { key.append(static_cast<const char *>(p), n); };
    add(&addr.sa.sa_family, sizeof addr.sa.sa_family);
    if (addr.sa.sa_family == AF_INET6) {
        add(&addr.in6.sin6_port, sizeof addr.in6.sin6_port);
        add(&addr.in6.sin6_addr, sizeof addr.in6.sin6_addr);
        add(&addr.in6.sin6_scope_id, sizeof addr.in6.sin6_scope_id);
    } else {
        add(&addr.in4.sin_port, sizeof addr.in4.sin_port);
        add(&addr.in4.sin_addr, sizeof addr.in4.sin_addr);
    }
    return key;
}

class Connection {
public:
    explicit Connection(std::string key) : key_(std::move(key)) {}
    Connection(const Connection &) = delete;
    Connection &operator=(const Connection &) = delete;

    const std::string &key() const { return key_; }
    Clock::time_point idle_since() const { return idle_since_; }
    void mark_idle()
    {
        idle_since_ = Clock::now();
        served_ = true;
    }

    // The status of a failed operation. A TLS 1.3 server checks the client's
    // certificate after the client's handshake is done: its refusal ends the
    // first exchange of a new connection, as an alert or a closed or reset
    // connection, and is reported as the handshake's failure.
    uint32_t failure(const asio::error_code &ec) const
    {
        if (tls_ != nullptr && !served_ && ec != asio::error::timed_out)
            return ncs::tls::status_of(ec);
        return status_of(ec);
    }

    // Connects, and with `tls` shakes hands as its client before the deadline.
    asio::error_code connect(const tcp::endpoint &endpoint, const std::shared_ptr<ncs::tls::Context> &tls,
                             Clock::time_point deadline)
    {
        asio::error_code ec;
        socket_.open(endpoint.protocol(), ec);
        if (ec)
            return ec;
        // Before the connect, so the window scale fits the buffer.
        socket_.set_option(tcp::no_delay(true), ec);
        socket_.set_option(asio::socket_base::send_buffer_size(ncs::net::kSocketBuffer), ec);
        socket_.set_option(asio::socket_base::receive_buffer_size(ncs::net::kSocketBuffer), ec);
        ec = run(deadline, [&](auto done) { socket_.async_connect(endpoint, done); });
        if (ec || tls == nullptr)
            return ec;
        const asio::ip::address server = endpoint.address();
        tls_ = std::make_unique<ncs::tls::Channel>(tls, &server);
        for (;;) {
            const ncs::tls::Channel::Step step = tls_->handshake(ec);
            if (step == ncs::tls::Channel::Step::kFailed)
                return ec;
            if ((ec = flush(deadline)) || step == ncs::tls::Channel::Step::kDone)
                return ec;
            if ((ec = fill(deadline)))
                return ec;
        }
    }

    // Whether an idle connection is still open at the server's end: the
    // server has neither closed it nor sent anything unasked.
    bool alive()
    {
        unsigned char byte;
        asio::error_code ec;
        socket_.non_blocking(true, ec);
        if (ec)
            return false;
        socket_.receive(asio::buffer(&byte, 1), tcp::socket::message_peek, ec);
        return ec == asio::error::would_block;
    }

    asio::error_code write(const std::array<asio::const_buffer, 2> &buffers, Clock::time_point deadline)
    {
        if (tls_ == nullptr)
            return run(deadline, [&](auto done) { asio::async_write(socket_, buffers, ncs::net::whole, done); });
        asio::error_code ec;
        for (const asio::const_buffer &buffer : buffers)
            if (!ec)
                tls_->seal(buffer, ec);
        return ec ? ec : flush(deadline);
    }

    asio::error_code read(asio::mutable_buffer buffer, Clock::time_point deadline)
    {
        if (tls_ == nullptr)
            return run(deadline, [&](auto done) { asio::async_read(socket_, buffer, ncs::net::whole, done); });
        asio::error_code ec;
        while (buffer.size() > 0) {
            buffer += tls_->open(buffer, ec);
            if (ec || (buffer.size() > 0 && (ec = fill(deadline))))
                return ec;
        }
        return ec;
    }

private:
    // Sends the records that the TLS channel made.
    asio::error_code flush(Clock::time_point deadline)
    {
        const asio::const_buffer records = tls_->outgoing();
        if (records.size() == 0)
            return {};
        asio::error_code ec =
            run(deadline, [&](auto done) { asio::async_write(socket_, records, ncs::net::whole, done); });
        if (!ec)
            tls_->sent(records.size());
        return ec;
    }

    // Feeds the TLS channel what the socket has, waiting for some if need be.
    asio::error_code fill(Clock::time_point deadline)
    {
        if (incoming_.empty())
            incoming_.resize(kTlsReadChunk);
        size_t got = 0;
        asio::error_code ec = run(deadline, [&](auto done) {
            socket_.async_read_some(asio::buffer(incoming_), [&got, done](const asio::error_code &ec, size_t n) {
                got = n;
                done(ec);
            });
        });
        tls_->feed(incoming_.data(), got);
        return ec;
    }

    template <class Start>
    asio::error_code run(Clock::time_point deadline, Start start)
    {
        return ncs::run_until(io_, socket_, deadline, start);
    }

    asio::io_context io_{1};
    tcp::socket socket_{io_};
    std::unique_ptr<ncs::tls::Channel> tls_;  // null for plain TCP
    std::vector<unsigned char> incoming_;     // records read for tls_
    std::string key_;
    Clock::time_point idle_since_{};
    bool served_ = false;  // an exchange has gone through since the connect
};

// Idle connections, newest last. A connection idle for longer than the
// client's limit ("NCS_CLIENT_IDLE_S", 60 s by default, well below the
// server's 300 s) is closed rather than reused: a server that closes an idle
// connection just as a call starts on it would fail a call that is not
// repeated, and connections to servers that are gone don't linger.
class Pool {
public:
    // An idle connection to `key` that is still open, or null.
    std::unique_ptr<Connection> take(const std::string &key)
    {
        for (;;) {
            std::unique_ptr<Connection> connection;
            std::deque<std::unique_ptr<Connection>> expired;
            {
                std::lock_guard<std::mutex> hold(mutex_);
                expire(expired);
                for (auto it = idle_.rbegin(); it != idle_.rend(); ++it) {
                    if ((*it)->key() == key) {
                        connection = std::move(*it);
                        idle_.erase(std::next(it).base());
                        break;
                    }
                }
            }
            if (connection == nullptr || connection->alive())
                return connection;
        }
    }

    void give(std::unique_ptr<Connection> connection)
    {
        std::unique_ptr<Connection> dropped;
        std::deque<std::unique_ptr<Connection>> expired;
        connection->mark_idle();
        std::lock_guard<std::mutex> hold(mutex_);
        expire(expired);
        idle_.push_back(std::move(connection));
        if (idle_.size() > kMaxIdle) {
            dropped = std::move(idle_.front());
            idle_.pop_front();
        }
    }

private:
    // Moves the connections idle for too long, the oldest first, to `expired`;
    // they are closed by its destructor, after the lock is released.
    // REQUIRES: mutex_ held.
    void expire(std::deque<std::unique_ptr<Connection>> &expired)
    {
        auto limit = std::chrono::seconds(ncs::setting("NCS_CLIENT_IDLE_S", kDefaultClientIdleS));
        auto now = Clock::now();
        while (!idle_.empty() && now - idle_.front()->idle_since() > limit) {
            expired.push_back(std::move(idle_.front()));
            idle_.pop_front();
        }
    }

    std::mutex mutex_;  // guards idle_; never held during socket operations
    std::deque<std::unique_ptr<Connection>> idle_;
};

Pool &pool()
{
    // Never destroyed: calls may run on threads that outlive static
    // destruction.
    static Pool *instance = new Pool;
    return *instance;
}

uint32_t next_call_id()
{
    static std::atomic<uint32_t> counter{0};
    uint32_t id;
    do
        id = ++counter;
    while (id == 0);  // 0 names no call
    return id;
}

// How one exchange on one connection ended.
enum class Ending {
    kReply,    // a reply, placed in the Reply
    kFault,    // the server's fault status for this call
    kNotSent,  // the request frame didn't leave in full
    kLost,     // the request left; its answer didn't come
    kBroken,   // a time-out or a malformed answer
};

struct Exchange {
    Ending ending;
    uint32_t status = rpc__s_ok;
    bool keep = false;  // the connection can serve another call
};

Exchange exchange(Connection &connection, const std::array<asio::const_buffer, 2> &request, uint32_t call_id,
                  void *reply_buf, uint32_t reply_buf_size, ncs::Reply &reply)
{
    Clock::time_point deadline =
        Clock::now() + std::chrono::milliseconds(ncs::setting("NCS_CALL_TIMEOUT_MS", kDefaultCallTimeoutMs));
    asio::error_code ec = connection.write(request, deadline);
    if (ec)
        return {ec == asio::error::timed_out ? Ending::kBroken : Ending::kNotSent, connection.failure(ec)};

    ncs::frame::Bytes bytes;
    ec = connection.read(asio::buffer(bytes), deadline);
    if (ec)
        return {ec == asio::error::timed_out ? Ending::kBroken : Ending::kLost, connection.failure(ec)};
    ncs::frame::Header header;
    if (!ncs::frame::decode(bytes, header) || header.kind == ncs::frame::kRequest)
        return {Ending::kBroken, rpc__s_protocol_error};
    bool keep = (header.flags & ncs::frame::kClosing) == 0;
    if (header.kind == ncs::frame::kFault) {
        // Call id 0: the server refused the connection before the call.
        if (header.call_id == 0)
            return {Ending::kFault, header.fault, false};
        if (header.call_id != call_id)
            return {Ending::kBroken, rpc__s_protocol_error};
        return {Ending::kFault, header.fault, keep};
    }
    if (header.call_id != call_id)
        return {Ending::kBroken, rpc__s_protocol_error};
    if (header.body_len > RPC_MAX_BODY)
        return {Ending::kBroken, rpc__s_too_big};

    void *body = ncs::place_reply(header.body_len, reply_buf, reply_buf_size, reply);
    ec = connection.read(asio::buffer(body, header.body_len), deadline);
    if (ec) {
        if (reply.must_free)
            rpc__free_pkt(reply.pkt);
        reply = ncs::Reply{};
        return {ec == asio::error::timed_out ? Ending::kBroken : Ending::kLost, connection.failure(ec)};
    }
    reply.drep = header.drep;
    return {Ending::kReply, rpc__s_ok, keep};
}

std::unique_ptr<Connection> open_connection(const std::string &key, const socket__addr_t &addr,
                                            const std::shared_ptr<ncs::tls::Context> &tls)
{
    auto connection = std::make_unique<Connection>(key);
    Clock::time_point deadline =
        Clock::now() + std::chrono::milliseconds(ncs::setting("NCS_CONNECT_TIMEOUT_MS", kDefaultConnectTimeoutMs));
    asio::error_code ec = connection->connect(ncs::net::endpoint_of(addr), tls, deadline);
    if (ec)
        raise(ec == asio::error::timed_out || tls == nullptr ? status_of(ec) : ncs::tls::status_of(ec));
    return connection;
}

class TcpCarrier final : public ncs::Carrier {
public:
    void call(const socket__addr_t &addr, uint32_t, uint32_t options, const rpc__if_spec_t &ifspec,
              uint32_t opnum, void *request_pkt, uint32_t request_len, void *reply_buf, uint32_t reply_buf_size,
              ncs::Reply &reply) override
    {
        ncs::frame::Header header;
        header.kind = ncs::frame::kRequest;
        header.flags = static_cast<uint8_t>(options);  // 0 or RPC_OPT_IDEMPOTENT
        header.call_id = next_call_id();
        header.drep = NCS_DREP_LOCAL;
        header.if_id = ifspec.id;
        header.if_vers = ifspec.vers;
        header.opnum = opnum;
        header.body_len = request_len;
        ncs::frame::Bytes bytes;
        ncs::frame::encode(header, bytes);
        const std::array<asio::const_buffer, 2> request = {
            asio::buffer(bytes), asio::buffer(static_cast<const unsigned char *>(request_pkt) + RPC_DATA_OFFS,
                                              request_len)};
        bool idempotent = (options & RPC_OPT_IDEMPOTENT) != 0;
        uint32_t status;
        std::shared_ptr<ncs::tls::Context> tls = ncs::tls::client_context(status);
        if (status != rpc__s_ok)
            raise(status);
        // Connections of other TLS settings, or none, are not this call's.
        std::string key = pool_key(addr) + std::to_string(reinterpret_cast<uintptr_t>(tls.get()));

        for (bool first = true;; first = false) {
            // A repeat goes on a new connection: the other idle ones may be
            // as stale as the one that failed.
            std::unique_ptr<Connection> connection = first ? pool().take(key) : nullptr;
            bool pooled = connection != nullptr;
            if (!pooled)
                connection = open_connection(key, addr, tls);
            Exchange result = exchange(*connection, request, header.call_id, reply_buf, reply_buf_size, reply);
            switch (result.ending) {
            case Ending::kReply:
            case Ending::kFault:
                if (result.keep)
                    pool().give(std::move(connection));
                if (result.ending == Ending::kFault)
                    raise(result.status);
                return;
            case Ending::kNotSent:
                if (pooled && first)
                    continue;
                raise(result.status);
            case Ending::kLost:
                if (pooled && first && idempotent)
                    continue;
                raise(result.status);
            case Ending::kBroken:
                raise(result.status);
            }
        }
    }
};

TcpCarrier g_tcp_carrier;
// Calls to IPv4 and IPv6 addresses come here from the library's load on.
const bool g_registered = (ncs::set_network_carrier(g_tcp_carrier), true);

}  // namespace

// The RPC server: an acceptor, I/O threads that read requests and write
// replies, and worker threads that run the managers.
//
// Each I/O thread runs an io_context of its own, and an accepted connection
// belongs to one of them, chosen in turn. A session reads one request frame
// at a time and hands the call to an idle worker; the worker runs the server
// stub and the manager, then posts the reply back to the session's thread,
// which writes it before it reads the next frame. A manager that blocks (an
// open of a FIFO, a stalled network mount) holds its worker only: the I/O
// threads go on serving every other connection. When no worker is idle, the
// call is answered at once on the I/O thread, through the busy managers that
// the host registered for the interface (a well-formed reply whose status
// says busy, so the client backs off and tries again) or, without them, with
// the fault rpc__s_server_busy.
//
// Every completion that goes through the io_context costs a trip through its
// queue and its epoll. So a session's socket is non-blocking, and bytes that
// are already there, or a reply that the socket buffer takes whole, move on
// the spot; only the rest waits for an asynchronous operation. The session's
// one timer fires at the earlier of its two deadlines: the idle time since
// the session began its present wait for the peer, and the frame time since
// the first byte of the frame under way arrived.
//
// What a peer can hold is bounded: connections per peer address and in all,
// the time a frame may take to arrive, and the memory of bodies that are
// still arriving, counted as their bytes come in and capped for the server.
//
// Lock order: Server::mutex_ guards the session table, the per-peer counts
// and the stop flag, and is never held while a handler runs or a socket is
// touched. Workers::mutex_ guards the worker queue only.
#include "ncs/server.h"

#include "ncs/frame.h"
#include "ncs/guard.h"
#include "ncs/net.h"
#include "ncs/runtime.h"
#include "ncs/tls.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace {

using ncs::net::tcp;

constexpr uint32_t kDefaultThreads = 4;
constexpr uint32_t kMaxThreads = 64;
constexpr uint32_t kMaxIoThreads = 2;
constexpr uint32_t kDefaultMaxConnections = 256;
constexpr uint32_t kDefaultMaxConnectionsPerPeer = 64;
constexpr uint32_t kDefaultIdleTimeoutS = 300;
constexpr uint32_t kDefaultFrameTimeoutS = 30;
constexpr uint32_t kDefaultMaxPendingBodyMiB = 64;
constexpr int kBacklog = 128;
// An accept that fails (out of descriptors) is tried again after this, not
// at once.
constexpr auto kAcceptRetry = std::chrono::milliseconds(100);
// Room for a reply body that the server offers every call: small replies
// need no packet of their own.
constexpr uint32_t kOfferedReply = 8192;
// What one read of a TLS connection's socket takes at most.
constexpr size_t kTlsReadChunk = 64 * 1024;

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

// What the server allows a peer, from the environment at rpc__listen.
struct Limits {
    uint32_t max_connections;
    uint32_t max_connections_per_peer;
    std::chrono::seconds idle_timeout;
    std::chrono::seconds frame_timeout;
    uint64_t max_pending_body;  // bytes of bodies still arriving, all sessions together

    static Limits from_environment()
    {
        return {ncs::setting("NCS_MAX_CONNECTIONS", kDefaultMaxConnections),
                ncs::setting("NCS_MAX_CONNECTIONS_PER_PEER", kDefaultMaxConnectionsPerPeer),
                std::chrono::seconds(ncs::setting("NCS_IDLE_TIMEOUT_S", kDefaultIdleTimeoutS)),
                std::chrono::seconds(ncs::setting("NCS_FRAME_TIMEOUT_S", kDefaultFrameTimeoutS)),
                uint64_t{ncs::setting("NCS_MAX_PENDING_BODY_MB", kDefaultMaxPendingBodyMiB)} << 20};
    }
};

// The threads that run calls. A call is handed over only to an idle worker,
// so no call ever waits in a queue behind one that blocks.
class Workers {
public:
    explicit Workers(uint32_t count) : idle_(count)
    {
        for (uint32_t i = 0; i < count; ++i)
            threads_.emplace_back([this] { work(); });
    }
    // Runs what was handed over, then joins the threads.
    ~Workers()
    {
        {
            std::lock_guard<std::mutex> hold(mutex_);
            stopping_ = true;
        }
        wake_.notify_all();
        for (auto &thread : threads_)
            thread.join();
    }
    Workers(const Workers &) = delete;
    Workers &operator=(const Workers &) = delete;

    // Runs `job` on an idle worker; false, and `job` untouched, when none is.
    bool try_run(std::function<void()> &job)
    {
        {
            std::lock_guard<std::mutex> hold(mutex_);
            if (idle_ == 0 || stopping_)
                return false;
            --idle_;
            jobs_.push_back(std::move(job));
        }
        wake_.notify_one();
        return true;
    }

private:
    void work()
    {
        for (;;) {
            std::function<void()> job;
            {
                std::unique_lock<std::mutex> hold(mutex_);
                wake_.wait(hold, [this] { return stopping_ || !jobs_.empty(); });
                if (jobs_.empty())
                    return;
                job = std::move(jobs_.front());
                jobs_.pop_front();
            }
            job();
            std::lock_guard<std::mutex> hold(mutex_);
            ++idle_;
        }
    }

    std::mutex mutex_;  // guards the three members below
    std::condition_variable wake_;
    std::deque<std::function<void()>> jobs_;
    uint32_t idle_;
    bool stopping_ = false;
    std::vector<std::thread> threads_;
};

class Session : public std::enable_shared_from_this<Session> {
public:
    Session(Server &server, tcp::socket socket, std::string peer, std::shared_ptr<ncs::tls::Context> tls)
        : server_(server), socket_(std::move(socket)), timer_(socket_.get_executor()), peer_(std::move(peer)),
          tls_context_(std::move(tls))
    {
    }
    ~Session();

    void start()
    {
        asio::error_code ignored;
        socket_.non_blocking(true, ignored);
        touch();
        if (tls_context_ != nullptr) {
            // The handshake is the first frame: it has the frame's time.
            in_frame_ = true;
            frame_started_ = Clock::now();
            arm_timer();
            start_tls();
            return;
        }
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
    void refuse(uint32_t status) { send_fault(0, status); }
    asio::any_io_executor executor() { return socket_.get_executor(); }
    const std::string &peer() const { return peer_; }

private:
    using Clock = asio::steady_timer::clock_type;

    void start_tls();
    void shake_hands();
    // Feeds tls_ what the socket has now, else waits for some; then `done`.
    template <class Done>
    void fill(Done done);
    // Reads some bytes: those already there at once on a plain connection,
    // else when they come. `done` gets the error and the count.
    template <class Done>
    void read_some(asio::mutable_buffer buffer, Done done);
    void read_header();
    void on_header_bytes(const asio::error_code &ec, size_t got);
    void on_header();
    void on_first_body_bytes(const asio::error_code &ec, size_t got);
    void read_body();
    void on_body_bytes(const asio::error_code &ec, size_t got);
    void call();
    void on_called(const ncs::Dispatched &outcome);
    void send_fault(uint32_t call_id, uint32_t status);
    void send(std::array<asio::const_buffer, 2> buffers, bool closing);
    void on_sent(const asio::error_code &ec, bool closing);
    void touch() { waiting_since_ = Clock::now(); }
    const char *client_name() const { return tls_ != nullptr ? client_name_.c_str() : nullptr; }
    void arm_timer();
    void release_body();
    void close()
    {
        asio::error_code ignored;
        socket_.close(ignored);
        timer_.cancel();
        release_body();
    }

    Server &server_;
    tcp::socket socket_;
    asio::steady_timer timer_;
    const std::string peer_;          // the peer's address, which its connection count goes by
    std::shared_ptr<ncs::tls::Context> tls_context_;  // null for plain TCP
    std::unique_ptr<ncs::tls::Channel> tls_;          // once the peer has begun TLS
    std::vector<unsigned char> incoming_;             // records read for tls_
    size_t tls_sending_ = 0;                          // bytes of tls_'s records that a send carries
    std::string client_name_;  // the common name of the TLS client's certificate
    std::array<unsigned char, 4096> first_body_bytes_;
    Clock::time_point waiting_since_;  // start of the present wait for the peer
    Clock::time_point frame_started_;  // first byte of the frame under way
    bool in_frame_ = false;            // a frame has begun to arrive and isn't whole yet
    ncs::frame::Bytes in_header_;
    size_t header_got_ = 0;
    uint32_t body_got_ = 0;
    uint64_t charged_ = 0;  // bytes of this body counted against the server's cap
    ncs::frame::Bytes out_header_;
    ncs::frame::Header request_;
    Packet request_pkt_;
    Packet offered_pkt_;
    Packet reply_pkt_;  // a stub's own reply packet while it is sent
    bool in_call_ = false;
};

class Server {
public:
    Server(uint32_t threads, const Limits &limits)
        : limits_(limits), contexts_(make_contexts(std::min(threads, kMaxIoThreads))), workers_(threads)
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
            accept_retry_.cancel();
        });
        for (auto &session : sessions)
            asio::post(session->executor(), [session] { session->stop(); });
        sessions.clear();
        // Each thread ends once its connections are closed; a call handed to
        // a worker holds its thread until its reply is sent.
        busy_.clear();
        for (auto &thread : threads_)
            thread.join();
        threads_.clear();
    }

    const tcp::endpoint &local() const { return local_; }
    const Limits &limits() const { return limits_; }
    Workers &workers() { return workers_; }
    bool stopping()
    {
        std::lock_guard<std::mutex> hold(mutex_);
        return stopping_;
    }

    void forget(Session *session)
    {
        std::lock_guard<std::mutex> hold(mutex_);
        if (sessions_.erase(session) != 0 && --per_peer_[session->peer()] == 0)
            per_peer_.erase(session->peer());
    }

    // Counts `bytes` of a body that is still arriving; false, and nothing
    // counted, when they would take the bodies under way above their cap.
    bool charge(uint64_t bytes)
    {
        uint64_t held = pending_body_.load();
        do {
            if (held + bytes > limits_.max_pending_body)
                return false;
        } while (!pending_body_.compare_exchange_weak(held, held + bytes));
        return true;
    }
    void discharge(uint64_t bytes) { pending_body_ -= bytes; }

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
                                   if (!ec) {
                                       admit(std::move(socket));
                                       accept();
                                       return;
                                   }
                                   // Out of descriptors or the like: again a little later.
                                   accept_retry_.expires_after(kAcceptRetry);
                                   accept_retry_.async_wait(asio::bind_executor(
                                       acceptor_strand_, [this](const asio::error_code &wait_ec) {
                                           if (!wait_ec && acceptor_.is_open())
                                               accept();
                                       }));
                               }));
    }

    // Takes a connection on, or answers it busy and closes it when the server
    // or its peer's address is at its limit: the newest connection is the
    // one refused.
    void admit(tcp::socket socket)
    {
        asio::error_code ec;
        socket.set_option(tcp::no_delay(true), ec);
        tcp::endpoint remote = socket.remote_endpoint(ec);
        auto session = std::make_shared<Session>(*this, std::move(socket), ec ? "" : remote.address().to_string(),
                                                 ncs::tls::server_context());
        bool refused = false;
        {
            std::lock_guard<std::mutex> hold(mutex_);
            ++accepted_;
            if (stopping_)
                return;
            auto peer = per_peer_.find(session->peer());
            refused = sessions_.size() >= limits_.max_connections ||
                      (peer != per_peer_.end() && peer->second >= limits_.max_connections_per_peer);
            if (!refused) {
                sessions_.emplace(session.get(), session);
                ++per_peer_[session->peer()];
            }
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
        for (uint32_t i = 0; i < std::max(count, 1u); ++i)
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

    const Limits limits_;

    // Declared before contexts_: sessions that a context still holds when it
    // goes unregister themselves here.
    std::mutex mutex_;  // guards the four members below
    bool stopping_ = false;
    uint64_t accepted_ = 0;
    std::map<Session *, std::weak_ptr<Session>> sessions_;
    std::map<std::string, uint32_t> per_peer_;  // open connections per peer address
    std::atomic<uint32_t> calls_{0};
    std::atomic<uint64_t> pending_body_{0};

    // One per I/O thread.
    std::vector<std::unique_ptr<asio::io_context>> contexts_;
    std::vector<asio::executor_work_guard<asio::io_context::executor_type>> busy_;  // till stop
    size_t next_context_ = 0;  // on the acceptor's strand only
    asio::io_context accept_io_{1};
    asio::strand<asio::io_context::executor_type> acceptor_strand_{asio::make_strand(accept_io_)};
    tcp::acceptor acceptor_{acceptor_strand_};
    asio::steady_timer accept_retry_{acceptor_strand_};
    tcp::endpoint local_;
    std::vector<std::thread> threads_;
    // Declared after the contexts: the workers are joined first, so no call
    // posts its reply to a context that is gone.
    Workers workers_;
};

Session::~Session()
{
    release_body();
    server_.forget(this);
}

// Fires at the earlier of the session's deadlines: one idle period after it
// began to wait for its peer (for a request frame since the last reply went
// out, or for the peer to read a reply since it began to go out), and one
// frame time after the first byte of a frame that isn't whole yet. A call
// that a worker runs never counts. A session that has moved on since waits
// for the rest of its period.
void Session::arm_timer()
{
    const Limits &limits = server_.limits();
    Clock::time_point due = waiting_since_ + limits.idle_timeout;
    if (in_frame_)
        due = std::min(due, frame_started_ + limits.frame_timeout);
    timer_.expires_at(due);
    timer_.async_wait([self = shared_from_this()](const asio::error_code &ec) {
        if (ec || !self->socket_.is_open())
            return;
        const Limits &limits = self->server_.limits();
        const Clock::time_point now = Clock::now();
        const bool idle = !self->in_call_ && self->waiting_since_ + limits.idle_timeout <= now;
        const bool late = self->in_frame_ && self->frame_started_ + limits.frame_timeout <= now;
        if (idle || late)
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
    header_got_ = 0;
    read_some(asio::buffer(in_header_), [self = shared_from_this()](const asio::error_code &ec, size_t got) {
        self->on_header_bytes(ec, got);
    });
}

void Session::on_header_bytes(const asio::error_code &ec, size_t got)
{
    if (ec) {
        close();
        return;
    }
    if (header_got_ == 0 && got > 0) {
        in_frame_ = true;
        frame_started_ = Clock::now();
        if (frame_started_ + server_.limits().frame_timeout < timer_.expiry())
            arm_timer();
    }
    header_got_ += got;
    if (header_got_ == sizeof in_header_) {
        on_header();
        return;
    }
    read_some(asio::buffer(in_header_ + header_got_, sizeof in_header_ - header_got_),
              [self = shared_from_this()](const asio::error_code &ec, size_t got) { self->on_header_bytes(ec, got); });
}

void Session::on_header()
{
    if (!ncs::frame::decode(in_header_, request_) || request_.kind != ncs::frame::kRequest) {
        close();
        return;
    }
    if (request_.body_len > RPC_MAX_BODY) {
        send_fault(request_.call_id, rpc__s_too_big);
        return;
    }
    body_got_ = 0;
    if (request_.body_len == 0) {
        request_pkt_ = allocate_packet(0);
        if (request_pkt_ == nullptr)
            send_fault(request_.call_id, rpc__s_no_memory);
        else
            call();
        return;
    }
    // The body's room is taken once its first bytes are in, not on the
    // header's word alone.
    const size_t first = std::min<size_t>(first_body_bytes_.size(), request_.body_len);
    read_some(asio::buffer(first_body_bytes_.data(), first),
              [self = shared_from_this()](const asio::error_code &ec, size_t got) {
                  self->on_first_body_bytes(ec, got);
              });
}

void Session::on_first_body_bytes(const asio::error_code &ec, size_t got)
{
    if (ec) {
        close();
        return;
    }
    request_pkt_ = allocate_packet(request_.body_len);
    if (request_pkt_ == nullptr) {
        send_fault(request_.call_id, rpc__s_no_memory);
        return;
    }
    std::memcpy(static_cast<unsigned char *>(request_pkt_.get()) + RPC_DATA_OFFS, first_body_bytes_.data(), got);
    on_body_bytes(ec, got);
}

// Takes what has arrived of the body now, and waits for the rest. The bytes
// count against the server's cap on bodies under way as they come in.
void Session::read_body()
{
    auto *body = static_cast<unsigned char *>(request_pkt_.get()) + RPC_DATA_OFFS;
    read_some(asio::buffer(body + body_got_, request_.body_len - body_got_),
              [self = shared_from_this()](const asio::error_code &ec, size_t got) { self->on_body_bytes(ec, got); });
}

template <class Done>
void Session::read_some(asio::mutable_buffer buffer, Done done)
{
    if (tls_ != nullptr) {
        asio::error_code ec;
        const size_t got = tls_->open(buffer, ec);
        if (got > 0 || ec) {
            done(ec, got);
            return;
        }
        fill([self = shared_from_this(), buffer, done](const asio::error_code &ec) {
            if (ec)
                done(ec, 0);
            else
                self->read_some(buffer, done);
        });
        return;
    }
    asio::error_code now;
    const size_t got = socket_.read_some(buffer, now);
    if (now == asio::error::would_block)
        socket_.async_read_some(buffer, std::move(done));
    else
        done(now, got);
}

template <class Done>
void Session::fill(Done done)
{
    if (incoming_.empty())
        incoming_.resize(kTlsReadChunk);
    asio::error_code now;
    const size_t got = socket_.read_some(asio::buffer(incoming_), now);
    if (now != asio::error::would_block) {
        tls_->feed(incoming_.data(), got);
        done(now);
        return;
    }
    socket_.async_read_some(asio::buffer(incoming_),
                            [self = shared_from_this(), done](const asio::error_code &ec, size_t got) {
                                self->tls_->feed(self->incoming_.data(), got);
                                done(ec);
                            });
}

// A TLS server speaks TLS only. A client that starts a plain frame (its
// first byte is the frame's, where TLS begins with a handshake record) is
// told so in a plain fault, instead of a handshake it can't read.
void Session::start_tls()
{
    socket_.async_wait(tcp::socket::wait_read, [self = shared_from_this()](const asio::error_code &ec) {
        unsigned char first = 0;
        asio::error_code peek;
        if (ec || self->socket_.receive(asio::buffer(&first, 1), tcp::socket::message_peek, peek) != 1) {
            self->close();
            return;
        }
        if (first == ncs::frame::kMagic >> 24) {
            self->refuse(rpc__s_tls_required);
            return;
        }
        self->tls_ = std::make_unique<ncs::tls::Channel>(self->tls_context_, nullptr);
        self->shake_hands();
    });
}

// One step of the handshake: its records go out (a refusal's alert too, so
// the client learns why), then it waits for the client's.
void Session::shake_hands()
{
    asio::error_code ec;
    const ncs::tls::Channel::Step step = tls_->handshake(ec);
    const asio::const_buffer records = tls_->outgoing();
    asio::async_write(socket_, records, ncs::net::whole,
                      [self = shared_from_this(), step, sent = records.size()](const asio::error_code &ec, size_t) {
                          if (ec || step == ncs::tls::Channel::Step::kFailed) {
                              self->close();
                              return;
                          }
                          self->tls_->sent(sent);
                          if (step == ncs::tls::Channel::Step::kDone) {
                              self->in_frame_ = false;
                              self->client_name_ = self->tls_->peer_name();
                              self->read_header();
                              return;
                          }
                          self->fill([self](const asio::error_code &ec) {
                              if (ec)
                                  self->close();
                              else
                                  self->shake_hands();
                          });
                      });
}

void Session::on_body_bytes(const asio::error_code &ec, size_t got)
{
    if (ec) {
        close();
        return;
    }
    if (!server_.charge(got)) {
        send_fault(request_.call_id, rpc__s_server_busy);
        return;
    }
    charged_ += got;
    body_got_ += static_cast<uint32_t>(got);
    if (body_got_ < request_.body_len)
        read_body();
    else
        call();
}

// Hands the whole request to an idle worker. With none idle, the call is
// answered here through the interface's busy managers.
void Session::call()
{
    in_frame_ = false;
    release_body();
    if (offered_pkt_ == nullptr)
        offered_pkt_ = allocate_packet(kOfferedReply);
    in_call_ = true;
    // The guard keeps the session's thread running until the reply is posted back.
    auto guard = std::make_shared<asio::executor_work_guard<asio::any_io_executor>>(socket_.get_executor());
    std::function<void()> job = [self = shared_from_this(), guard] {
        Session &session = *self;
        session.server_.call_begins();
        ncs::Dispatched outcome = ncs::dispatch(
            session.request_.if_id, session.request_.if_vers, session.request_.opnum, session.request_.drep,
            session.request_pkt_.get(), session.request_.body_len, session.offered_pkt_.get(),
            session.offered_pkt_ != nullptr ? kOfferedReply : 0, false, session.client_name());
        session.server_.call_ends();
        asio::post(session.socket_.get_executor(), [self, outcome] { self->on_called(outcome); });
    };
    if (server_.workers().try_run(job))
        return;
    on_called(ncs::dispatch(request_.if_id, request_.if_vers, request_.opnum, request_.drep, request_pkt_.get(),
                            request_.body_len, offered_pkt_.get(), offered_pkt_ != nullptr ? kOfferedReply : 0,
                            true, client_name()));
}

void Session::on_called(const ncs::Dispatched &outcome)
{
    request_pkt_.reset();
    if (outcome.fault != rpc__s_ok) {
        send_fault(request_.call_id, outcome.fault);
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

// A fault ends the connection: whatever the peer sends after it is not read.
void Session::send_fault(uint32_t call_id, uint32_t status)
{
    in_frame_ = false;
    release_body();
    ncs::frame::Header fault = request_;
    fault.kind = ncs::frame::kFault;
    fault.flags = ncs::frame::kClosing;
    fault.call_id = call_id;
    fault.drep = NCS_DREP_LOCAL;
    fault.body_len = 0;
    fault.fault = status;
    ncs::frame::encode(fault, out_header_);
    send({asio::buffer(out_header_), asio::const_buffer()}, true);
}

void Session::release_body()
{
    server_.discharge(charged_);
    charged_ = 0;
}

void Session::send(std::array<asio::const_buffer, 2> buffers, bool closing)
{
    in_call_ = !closing;
    touch();
    auto sent_all = [self = shared_from_this(), closing](const asio::error_code &ec, size_t) {
        self->on_sent(ec, closing);
    };
    if (tls_ != nullptr) {
        // The frame goes as its records, which then move as plain bytes do.
        asio::error_code ec;
        for (const asio::const_buffer &buffer : buffers)
            if (!ec)
                tls_->seal(buffer, ec);
        if (ec) {
            on_sent(ec, true);
            return;
        }
        buffers = {tls_->outgoing(), asio::const_buffer()};
        tls_sending_ = buffers[0].size();
    }
    // What the socket buffer takes goes now; the rest is waited for.
    asio::error_code now;
    const size_t sent = asio::write(socket_, buffers, ncs::net::whole, now);
    if (now != asio::error::would_block) {
        on_sent(now, closing);
        return;
    }
    const size_t header_sent = std::min(sent, buffers[0].size());
    const std::array<asio::const_buffer, 2> rest = {buffers[0] + header_sent, buffers[1] + (sent - header_sent)};
    asio::async_write(socket_, rest, ncs::net::whole, std::move(sent_all));
}

void Session::on_sent(const asio::error_code &ec, bool closing)
{
    in_call_ = false;
    reply_pkt_.reset();
    if (tls_sending_ > 0 && !ec)
        tls_->sent(tls_sending_);
    tls_sending_ = 0;
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
    ncs::guarded(status, rpc__s_cant_listen, [&] {
        tcp::endpoint endpoint;
        std::lock_guard<std::mutex> hold(g_server_mutex);
        if (port > 65535 || g_server != nullptr)
            return rpc__s_cant_listen;
        if (!endpoint_for(host != nullptr ? host : "127.0.0.1", port, endpoint))
            return rpc__s_unknown_host;
        auto server = std::make_unique<Server>(std::min(threads > 0 ? threads : kDefaultThreads, kMaxThreads),
                                               Limits::from_environment());
        uint32_t result = server->listen(endpoint);
        if (result != rpc__s_ok)
            return result;
        server->start();
        socket__addr_t addr;
        uint32_t addr_len = ncs::net::address_of(server->local(), addr);
        if (bound != nullptr)
            *bound = addr;
        if (bound_len != nullptr)
            *bound_len = addr_len;
        g_server = std::move(server);
        return rpc__s_ok;
    });
}

void rpc__stop_listening(void)
{
    // Only a failing lock or join can throw; the server is gone either way.
    ncs::guarded(nullptr, rpc__s_ok, [] {
        std::unique_ptr<Server> server;
        {
            std::lock_guard<std::mutex> hold(g_server_mutex);
            server = std::move(g_server);
        }
        // Stopped outside the lock: a call that runs to its end may still
        // ask for the counters.
        server.reset();
        return rpc__s_ok;
    });
}

void rpc__inq_server_stats(rpc__server_stats_t *stats)
{
    if (stats == nullptr)
        return;
    *stats = rpc__server_stats_t{0, 0, 0};
    // A lock that can't be taken leaves the counters at 0.
    ncs::guarded(nullptr, rpc__s_ok, [&] {
        std::lock_guard<std::mutex> hold(g_server_mutex);
        if (g_server != nullptr)
            *stats = g_server->stats();
        return rpc__s_ok;
    });
}

}  // extern "C"

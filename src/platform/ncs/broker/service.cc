// The location broker's service on TCP, which each host runs inside a host
// process or as dpx-lbd: sessions that read requests and answer them from
// the database, the registrations of its own host only.
#include "broker.h"
#include "database.h"

#include "ncs/guard.h"
#include "ncs/net.h"
#include "trc/trc1.h"

#include <ifaddrs.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

TRC1_DEFINE_UNIT("broker");

namespace {

namespace wire = ncs::lb;
using asio::ip::tcp;
using ncs::lb::Database;

// Most connections a broker serves at once.
constexpr size_t kMaxConnections = 256;
constexpr auto kAcceptRetry = std::chrono::milliseconds(100);
// Owner of the entries that the host process of a broker registers directly.
constexpr uint64_t kHostProcess = 0;

// True when `peer` is an address of this host: loopback, or an address of
// one of its interfaces (an IPv4 address mapped into IPv6 counts as itself).
bool own_host_address(asio::ip::address peer)
{
    if (peer.is_v6() && peer.to_v6().is_v4_mapped())
        peer = asio::ip::make_address_v4(asio::ip::v4_mapped, peer.to_v6());
    if (peer.is_loopback())
        return true;
    ifaddrs *list = nullptr;
    if (getifaddrs(&list) != 0)
        return false;
    bool own = false;
    for (const ifaddrs *i = list; i != nullptr && !own; i = i->ifa_next) {
        if (i->ifa_addr == nullptr)
            continue;
        if (i->ifa_addr->sa_family == AF_INET && peer.is_v4()) {
            const auto *in = reinterpret_cast<const sockaddr_in *>(i->ifa_addr);
            own = ntohl(in->sin_addr.s_addr) == peer.to_v4().to_uint();
        } else if (i->ifa_addr->sa_family == AF_INET6 && peer.is_v6()) {
            const auto *in6 = reinterpret_cast<const sockaddr_in6 *>(i->ifa_addr);
            own = std::memcmp(in6->sin6_addr.s6_addr, peer.to_v6().to_bytes().data(), 16) == 0;
        }
    }
    freeifaddrs(list);
    return own;
}

class Broker;

// One connection to the broker. It reads a request, answers it, and reads the
// next, until the peer closes or sends something malformed; the entries that
// it registered go with it.
class Session : public std::enable_shared_from_this<Session> {
public:
    Session(Broker &broker, tcp::socket socket, uint64_t owner);
    ~Session();
    Session(const Session &) = delete;
    Session &operator=(const Session &) = delete;

    void read_header();

private:
    void on_header();
    void on_body();

    // Registrations and removals: only from this host, whose processes are
    // the only ones that may name where this host's servers listen.
    uint32_t update(const lb__entry_t &entry);

    Broker &broker_;
    tcp::socket socket_;
    uint64_t owner_;
    std::string peer_;  // the peer's address, for traces
    bool own_host_;     // the peer is a process of this host
    wire::Kind kind_ = wire::Kind::kReply;
    std::array<uint8_t, wire::kHeaderSize> header_{};
    std::array<uint8_t, wire::kMaxRequestBody> body_{};
    std::vector<uint8_t> reply_;
};

// A broker listening at one address, served by a thread of its own.
class Broker {
public:
    // A broker listening at `endpoint`, or null and `status` rpc__s_cant_listen.
    static std::unique_ptr<Broker> start(const tcp::endpoint &endpoint, uint32_t &status);
    // Stops the thread; the connections close with the io_context.
    ~Broker()
    {
        io_.stop();
        if (thread_.joinable())
            thread_.join();
    }
    Broker(const Broker &) = delete;
    Broker &operator=(const Broker &) = delete;

    Database &database() { return database_; }
    const tcp::endpoint &endpoint() const { return endpoint_; }

    // Called by a session as it ends, on the broker's thread or while the
    // io_context is destroyed.
    void closed(uint64_t owner)
    {
        --connections_;
        database_.remove_owner(owner);
    }

private:
    Broker() = default;
    uint32_t listen(const tcp::endpoint &endpoint);
    void accept();
    void admit(tcp::socket socket);
    void run();

    Database database_;
    size_t connections_ = 0;   // broker thread only
    uint64_t next_owner_ = 1;  // broker thread only
    tcp::endpoint endpoint_;
    // Declared after what sessions touch: destroying the io_context destroys
    // the sessions its pending handlers hold.
    asio::io_context io_;
    tcp::acceptor acceptor_{io_};
    asio::steady_timer accept_retry_{io_};
    std::thread thread_;
};

Session::Session(Broker &broker, tcp::socket socket, uint64_t owner)
    : broker_(broker), socket_(std::move(socket)), owner_(owner), own_host_(false)
{
    asio::error_code ec;
    tcp::endpoint peer = socket_.remote_endpoint(ec);
    if (!ec) {
        peer_ = peer.address().to_string();
        own_host_ = own_host_address(peer.address());
    }
}

Session::~Session()
{
    broker_.closed(owner_);
}

void Session::read_header()
{
    asio::async_read(socket_, asio::buffer(header_), [self = shared_from_this()](const asio::error_code &ec, size_t) {
        if (!ec)
            self->on_header();
    });
}

void Session::on_header()
{
    TRC1_FUNCTION();
    wire::Reader reader(header_);
    wire::Header header = wire::get_header(reader);
    size_t size = wire::request_body_size(header.kind);
    if (header.magic != wire::kMagic || header.version != wire::kVersion || size == 0 || header.body_len != size) {
        TRC1_ERROR_MSG("malformed request on connection %llu: closed", static_cast<unsigned long long>(owner_));
        return;
    }
    kind_ = header.kind;
    asio::async_read(socket_, asio::buffer(body_.data(), size),
                     [self = shared_from_this()](const asio::error_code &ec, size_t) {
                         if (!ec)
                             self->on_body();
                     });
}

void Session::on_body()
{
    wire::Reader reader(std::span<const uint8_t>(body_.data(), wire::request_body_size(kind_)));
    wire::ReplyHead head{rpc__s_ok, 0, 0};
    std::vector<lb__entry_t> found;
    if (kind_ == wire::Kind::kLookup) {
        head = broker_.database().lookup(wire::get_query(reader), found);
    } else {
        lb__entry_t entry{};
        head.status = wire::get_entry(reader, entry) ? update(entry) : lb__s_bad_argument;
    }
    uint32_t body_len = static_cast<uint32_t>(wire::kReplyFixedSize + found.size() * wire::kEntrySize);
    reply_.resize(wire::kHeaderSize + body_len);
    wire::Writer writer(reply_);
    wire::put_header(writer, wire::Header{wire::kMagic, wire::kVersion, wire::Kind::kReply, body_len});
    wire::put_reply_head(writer, head);
    for (const lb__entry_t &entry : found)
        wire::put_entry(writer, entry);
    asio::async_write(socket_, asio::buffer(reply_), [self = shared_from_this()](const asio::error_code &ec, size_t) {
        if (!ec)
            self->read_header();
    });
}

uint32_t Session::update(const lb__entry_t &entry)
{
    TRC1_FUNCTION();
    const bool registering = kind_ == wire::Kind::kRegister;
    if (!own_host_) {
        TRC1_ERROR_MSG("%s from %s refused: not this host", registering ? "registration" : "removal",
                       peer_.empty() ? "an unknown peer" : peer_.c_str());
        return lb__s_not_permitted;
    }
    return registering ? broker_.database().add(entry, owner_) : broker_.database().remove(entry);
}

std::unique_ptr<Broker> Broker::start(const tcp::endpoint &endpoint, uint32_t &status)
{
    std::unique_ptr<Broker> broker(new Broker);
    status = broker->listen(endpoint);
    if (status != rpc__s_ok)
        return nullptr;
    broker->accept();
    broker->thread_ = std::thread([b = broker.get()] { b->run(); });
    return broker;
}

uint32_t Broker::listen(const tcp::endpoint &endpoint)
{
    TRC1_FUNCTION();
    asio::error_code ec;
    acceptor_.open(endpoint.protocol(), ec);
    if (!ec)
        acceptor_.set_option(tcp::acceptor::reuse_address(true), ec);
    // The unspecified IPv6 address takes IPv4 connections too.
    if (!ec && endpoint.address().is_v6() && endpoint.address().is_unspecified())
        acceptor_.set_option(asio::ip::v6_only(false), ec);
    if (!ec)
        acceptor_.bind(endpoint, ec);
    if (!ec)
        acceptor_.listen(asio::socket_base::max_listen_connections, ec);
    if (!ec)
        endpoint_ = acceptor_.local_endpoint(ec);
    if (ec) {
        TRC1_ERROR_MSG("can't listen at %s port %u: %s", endpoint.address().to_string().c_str(), endpoint.port(),
                       ec.message().c_str());
        return rpc__s_cant_listen;
    }
    TRC1_FLOW_MSG("broker listening at %s port %u", endpoint_.address().to_string().c_str(), endpoint_.port());
    return rpc__s_ok;
}

void Broker::accept()
{
    acceptor_.async_accept([this](const asio::error_code &ec, tcp::socket socket) {
        if (ec == asio::error::operation_aborted)
            return;
        if (!ec) {
            admit(std::move(socket));
            accept();
            return;
        }
        // Out of descriptors or the like: try again a little later instead of spinning.
        accept_retry_.expires_after(kAcceptRetry);
        accept_retry_.async_wait([this](const asio::error_code &wait_ec) {
            if (!wait_ec)
                accept();
        });
    });
}

void Broker::admit(tcp::socket socket)
{
    TRC1_FUNCTION();
    if (connections_ >= kMaxConnections) {
        TRC1_ERROR_MSG("connection refused: %zu connections already", connections_);
        return;
    }
    ++connections_;
    std::make_shared<Session>(*this, std::move(socket), next_owner_++)->read_header();
}

void Broker::run()
{
    TRC1_FUNCTION();
    // A handler that throws (no memory) loses its connection only.
    for (;;) {
        try {
            io_.run();
            return;
        } catch (const std::exception &e) {
            TRC1_ERROR_MSG("connection dropped: %s", e.what());
        }
    }
}

// The broker that runs in this process, if any. A child made by fork
// inherits the record but not the broker's thread: there it counts as none,
// and it is never stopped or destroyed there.
class Embedded {
public:
    ~Embedded() { drop_inherited(); }

    // Guards everything of the embedded broker. Taken before the database's
    // lock, never under it.
    std::mutex mutex;

    // The broker of this process, or null.
    Broker *running()
    {
        drop_inherited();
        return broker_.get();
    }
    void set(std::unique_ptr<Broker> broker)
    {
        broker_ = std::move(broker);
        pid_ = getpid();
    }
    std::unique_ptr<Broker> take()
    {
        drop_inherited();
        return std::move(broker_);
    }

private:
    void drop_inherited()
    {
        if (broker_ != nullptr && pid_ != getpid())
            inherited_ = broker_.release();
    }

    std::unique_ptr<Broker> broker_;
    pid_t pid_ = 0;
    Broker *inherited_ = nullptr;  // the parent's, in a child made by fork
};

Embedded &embedded()
{
    static Embedded instance;
    return instance;
}

uint32_t start_broker(const char *host)
{
    const char *name = host != nullptr ? host : "127.0.0.1";
    uint16_t port = lb__broker_port();
    socket__addr_t addr;
    uint32_t addr_len = sizeof addr;
    uint32_t status;
    socket__from_name(0, name, static_cast<uint32_t>(strnlen(name, UINT32_MAX)), port, &addr, &addr_len, &status);
    tcp::endpoint endpoint;
    if (status != rpc__s_ok || !ncs::net::endpoint_from(addr, addr_len, port, endpoint))
        return rpc__s_unknown_host;

    Embedded &e = embedded();
    std::lock_guard lock(e.mutex);
    if (e.running() != nullptr)
        return rpc__s_cant_listen;
    std::unique_ptr<Broker> broker = Broker::start(endpoint, status);
    if (broker != nullptr)
        e.set(std::move(broker));
    return status;
}

// Registers or unregisters directly with the broker of this process, or

}  // namespace

namespace ncs::lb {

std::optional<uint32_t> update_embedded(Kind kind, const lb__entry_t &entry)
{
    Embedded &e = embedded();
    std::lock_guard lock(e.mutex);
    Broker *broker = e.running();
    if (broker == nullptr)
        return std::nullopt;
    Database &database = broker->database();
    return kind == Kind::kRegister ? database.add(entry, kHostProcess) : database.remove(entry);
}

}  // namespace ncs::lb

extern "C" {

void lb__start_broker(const char *host, uint32_t *status)
{
    ncs::guarded(status, rpc__s_fault_unspec, [&] { return start_broker(host); });
}

void lb__stop_broker(void)
{
    std::unique_ptr<Broker> stopping;
    {
        Embedded &e = embedded();
        std::lock_guard lock(e.mutex);
        stopping = e.take();
    }
}

void lb__inq_broker(socket__addr_t *addr, uint32_t *addr_len, uint32_t *status)
{
    ncs::guarded(status, rpc__s_fault_unspec, [&]() -> uint32_t {
        if (addr == nullptr || addr_len == nullptr)
            return lb__s_bad_argument;
        Embedded &e = embedded();
        std::lock_guard lock(e.mutex);
        Broker *broker = e.running();
        if (broker == nullptr)
            return lb__s_broker_unreachable;
        const tcp::endpoint &endpoint = broker->endpoint();
        if (endpoint.size() > *addr_len)
            return socket__s_addr_too_small;
        std::memcpy(addr->bytes, endpoint.data(), endpoint.size());
        *addr_len = static_cast<uint32_t>(endpoint.size());
        return rpc__s_ok;
    });
}

}  // extern "C"

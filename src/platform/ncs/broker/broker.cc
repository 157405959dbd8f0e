// The location broker: its database, the service on TCP that each host runs
// (inside a host process or as dpx-lbd), and the client side: lookups and the
// registrations of this process. Messages are those of lb_format.h.
#include "ncs/deadline.h"
#include "ncs/guard.h"
#include "ncs/lb.h"
#include "ncs/lb_format.h"
#include "ncs/net.h"
#include "plt/plt1.h"
#include "trc/trc1.h"

#include <asio.hpp>
#include <ifaddrs.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <climits>
#include <cstring>
#include <memory>
#include <mutex>
#include <new>
#include <optional>
#include <string>
#include <thread>
#include <vector>

TRC1_DEFINE_UNIT("broker");

namespace {

namespace wire = ncs::lb;
using asio::ip::tcp;
using Clock = std::chrono::steady_clock;

constexpr uint16_t kDefaultPort = 135;
// Most entries a broker holds, and most connections it serves at once.
constexpr size_t kMaxEntries = 1024;
constexpr size_t kMaxConnections = 256;
// A host without a broker must fail a lookup quickly; a broker answers from
// memory, so an exchange that takes longer than this has failed.
constexpr auto kConnectTimeout = std::chrono::seconds(2);
constexpr auto kExchangeTimeout = std::chrono::seconds(5);
constexpr auto kAcceptRetry = std::chrono::milliseconds(100);
// Positions are serial numbers of registrations; a walk position is signed.
constexpr uint32_t kMaxSerial = INT32_MAX;
// Owner of the entries that the host process of a broker registers directly.
constexpr uint64_t kHostProcess = 0;

using ncs::set_status;

// Runs `body`, which returns a status, so that nothing throws across the C API.
template <class Body>
void guarded(uint32_t *status, Body &&body)
{
    ncs::guarded(status, rpc__s_fault_unspec, body);
}

bool matches(const uuid__t &wanted, const uuid__t &have)
{
    return uuid__equal(&wanted, &uuid__nil) || uuid__equal(&wanted, &have);
}

// Same object, type, interface and address.
bool same_key(const lb__entry_t &a, const lb__entry_t &b)
{
    return uuid__equal(&a.object, &b.object) && uuid__equal(&a.obj_type, &b.obj_type) &&
           uuid__equal(&a.obj_interface, &b.obj_interface) && a.saddr_len == b.saddr_len &&
           std::memcmp(a.saddr.bytes, b.saddr.bytes, a.saddr_len) == 0;
}


// "interface <uuid> at <host>:<port>", for traces.
std::string describe(const lb__entry_t &entry)
{
    char uuid[37];
    uuid__encode(&entry.obj_interface, uuid);
    char host[64];
    uint32_t host_len = sizeof host;
    uint32_t port = 0;
    uint32_t status;
    socket__to_name(&entry.saddr, entry.saddr_len, host, &host_len, &port, &status);
    if (status != rpc__s_ok)
        return std::string("interface ") + uuid + " at an address of family " + std::to_string(entry.saddr.sa.sa_family);
    return std::string("interface ") + uuid + " at " + host + ":" + std::to_string(port);
}

// ---- The database ----------------------------------------------------------

// The entries of one broker. Every entry has an owner, the connection that
// registered it, and a serial number, higher for newer registrations, that
// walks use as their position. All members are callable from any thread.
class Database {
public:
    // Adds `entry`, replacing one with the same key: rpc__s_ok or
    // lb__s_database_full. The connection that holds the entry already only
    // renews it: the entry keeps its place among the others, so a server
    // that registers again now and then doesn't push newer ones back.
    uint32_t add(const lb__entry_t &entry, uint64_t owner)
    {
        TRC1_FUNCTION();
        lb__entry_t clean{};
        clean.object = entry.object;
        clean.obj_type = entry.obj_type;
        clean.obj_interface = entry.obj_interface;
        clean.flags = entry.flags;
        std::memcpy(clean.annotation, entry.annotation, LB_ANNOTATION_LEN - 1);
        clean.saddr_len = entry.saddr_len;
        std::memcpy(clean.saddr.bytes, entry.saddr.bytes, entry.saddr_len);

        std::lock_guard lock(mutex_);
        auto same = [&](const Record &r) { return same_key(r.entry, clean); };
        auto held = std::find_if(records_.begin(), records_.end(), same);
        if (held != records_.end() && held->owner == owner) {
            held->entry = clean;
            return rpc__s_ok;
        }
        std::erase_if(records_, same);
        if (records_.size() >= kMaxEntries) {
            TRC1_ERROR_MSG("database full: %s refused", describe(clean).c_str());
            return lb__s_database_full;
        }
        if (next_serial_ > kMaxSerial)
            renumber();
        records_.push_back(Record{clean, next_serial_++, owner});
        TRC1_FLOW_MSG("registered %s (connection %llu)", describe(clean).c_str(),
                      static_cast<unsigned long long>(owner));
        return rpc__s_ok;
    }

    // Removes the entry with the key of `entry`: rpc__s_ok or lb__s_not_registered.
    uint32_t remove(const lb__entry_t &entry)
    {
        TRC1_FUNCTION();
        std::lock_guard lock(mutex_);
        if (std::erase_if(records_, [&](const Record &r) { return same_key(r.entry, entry); }) == 0)
            return lb__s_not_registered;
        TRC1_FLOW_MSG("unregistered %s", describe(entry).c_str());
        return rpc__s_ok;
    }

    // Removes every entry of `owner`.
    void remove_owner(uint64_t owner)
    {
        TRC1_FUNCTION();
        std::lock_guard lock(mutex_);
        size_t removed = std::erase_if(records_, [owner](const Record &r) { return r.owner == owner; });
        if (removed > 0)
            TRC1_FLOW_MSG("connection %llu closed: %zu entries removed", static_cast<unsigned long long>(owner),
                          removed);
    }

    // The next entries of a walk, newest first: those that match and are
    // older than `query.position` (0: all). The reply's position is the
    // serial of the last one found, or the query's when none is.
    wire::ReplyHead lookup(const wire::Query &query, std::vector<lb__entry_t> &found) const
    {
        wire::ReplyHead head{lb__s_not_registered, query.position, 0};
        uint32_t max = std::min(query.max_results, wire::kMaxResultsPerReply);
        if (max == 0) {
            head.status = lb__s_bad_argument;
            return head;
        }
        std::lock_guard lock(mutex_);
        for (auto r = records_.rbegin(); r != records_.rend() && found.size() < max; ++r) {
            if (query.position != 0 && r->serial >= query.position)
                continue;
            if (!matches(query.object, r->entry.object) || !matches(query.type, r->entry.obj_type) ||
                !matches(query.interface, r->entry.obj_interface))
                continue;
            found.push_back(r->entry);
            head.position = r->serial;
        }
        head.count = static_cast<uint32_t>(found.size());
        if (head.count > 0)
            head.status = rpc__s_ok;
        return head;
    }

private:
    struct Record {
        lb__entry_t entry;
        uint32_t serial;
        uint64_t owner;
    };

    // Serials 1..n again, in the same order, once they would pass kMaxSerial.
    // A walk under way may see entries twice then; it still ends.
    void renumber()
    {
        next_serial_ = 1;
        for (Record &r : records_)
            r.serial = next_serial_++;
    }

    // Guards the members below. Taken alone: nothing else is locked under it.
    mutable std::mutex mutex_;
    std::vector<Record> records_;  // oldest first: serials ascend
    uint32_t next_serial_ = 1;
};

// ---- The service -------------------------------------------------------------

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

// ---- The client side -------------------------------------------------------

// A file descriptor, closed by its owner.
class Descriptor {
public:
    Descriptor() = default;
    explicit Descriptor(int fd) : fd_(fd) {}
    ~Descriptor()
    {
        if (fd_ >= 0)
            ::close(fd_);
    }
    Descriptor(Descriptor &&other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
    Descriptor &operator=(Descriptor &&other) noexcept
    {
        Descriptor old(std::move(*this));
        fd_ = std::exchange(other.fd_, -1);
        return *this;
    }
    bool valid() const { return fd_ >= 0; }
    int get() const { return fd_; }
    int release() { return std::exchange(fd_, -1); }

private:
    int fd_ = -1;
};

// A connection to a broker for one or more exchanges, each bounded in time.
// Nothing runs between exchanges, so the connection can be given up as a
// plain descriptor and taken up again by another Link, in another process too.
class Link {
public:
    Link() = default;
    Link(const Link &) = delete;
    Link &operator=(const Link &) = delete;

    // Connects within kConnectTimeout.
    bool connect(const tcp::endpoint &endpoint)
    {
        asio::error_code ec = run(Clock::now() + kConnectTimeout,
                                  [&](auto handler) { socket_.async_connect(endpoint, std::move(handler)); });
        if (!ec)
            socket_.set_option(tcp::no_delay(true), ec);
        return !ec;
    }

    // Takes up a connection given up by a Link.
    bool adopt(Descriptor descriptor, const tcp::endpoint &endpoint)
    {
        asio::error_code ec;
        socket_.assign(endpoint.protocol(), descriptor.get(), ec);
        if (ec)
            return false;
        descriptor.release();
        return true;
    }

    Descriptor give_up()
    {
        asio::error_code ec;
        int fd = socket_.release(ec);
        return ec ? Descriptor() : Descriptor(fd);
    }

    // Sends one request and reads its reply's body, within kExchangeTimeout:
    // rpc__s_ok, lb__s_broker_unreachable when the connection fails, or
    // rpc__s_protocol_error for a reply that isn't one. The Link is of no
    // further use after a failure.
    uint32_t exchange(wire::Kind kind, std::span<const uint8_t> body, std::vector<uint8_t> &reply)
    {
        Clock::time_point deadline = Clock::now() + kExchangeTimeout;
        std::vector<uint8_t> request(wire::kHeaderSize + body.size());
        wire::Writer writer(request);
        wire::put_header(writer, wire::Header{wire::kMagic, wire::kVersion, kind, static_cast<uint32_t>(body.size())});
        writer.bytes(body.data(), body.size());
        asio::error_code ec =
            run(deadline, [&](auto handler) { asio::async_write(socket_, asio::buffer(request), std::move(handler)); });
        std::array<uint8_t, wire::kHeaderSize> head{};
        if (!ec)
            ec = run(deadline, [&](auto handler) { asio::async_read(socket_, asio::buffer(head), std::move(handler)); });
        if (ec)
            return lb__s_broker_unreachable;
        wire::Reader reader(head);
        wire::Header header = wire::get_header(reader);
        if (header.magic != wire::kMagic || header.version != wire::kVersion || header.kind != wire::Kind::kReply ||
            header.body_len < wire::kReplyFixedSize || header.body_len > wire::kMaxReplyBody)
            return rpc__s_protocol_error;
        reply.resize(header.body_len);
        ec = run(deadline, [&](auto handler) { asio::async_read(socket_, asio::buffer(reply), std::move(handler)); });
        return ec ? lb__s_broker_unreachable : rpc__s_ok;
    }

private:
    template <class Start>
    asio::error_code run(Clock::time_point deadline, Start &&start)
    {
        return ncs::run_until(io_, socket_, deadline, start);
    }

    asio::io_context io_;
    tcp::socket socket_{io_};
};

// The connection over which this process registers with the broker of its
// host. It stays open between registrations: the broker keeps this process's
// entries while it is open.
class Registrar {
public:
    // Sends a kRegister or kUnregister of `entry` and returns the broker's
    // answer, or the status of a failed exchange.
    uint32_t send(wire::Kind kind, const lb__entry_t &entry)
    {
        std::array<uint8_t, wire::kEntrySize> body{};
        wire::Writer writer(body);
        wire::put_entry(writer, entry);
        tcp::endpoint endpoint(asio::ip::address_v4::loopback(), lb__broker_port());

        std::lock_guard lock(mutex_);
        // A child made by fork must not speak on its parent's connection, and
        // another port means another broker.
        if (pid_ != getpid() || endpoint_ != endpoint)
            connection_ = Descriptor();
        if (connection_.valid()) {
            Link link;
            std::optional<uint32_t> answer;
            if (link.adopt(std::move(connection_), endpoint))
                answer = exchange(link, kind, body);
            // A kept connection that the broker has closed since: once more on a new one.
            if (answer && *answer != lb__s_broker_unreachable)
                return keep(link, endpoint, *answer);
        }
        Link link;
        if (!link.connect(endpoint))
            return lb__s_broker_unreachable;
        return keep(link, endpoint, exchange(link, kind, body));
    }

private:
    static uint32_t exchange(Link &link, wire::Kind kind, std::span<const uint8_t> body)
    {
        std::vector<uint8_t> reply;
        uint32_t status = link.exchange(kind, body, reply);
        if (status != rpc__s_ok)
            return status;
        wire::Reader reader(reply);
        wire::ReplyHead head = wire::get_reply_head(reader);
        if (reply.size() != wire::kReplyFixedSize || head.count != 0)
            return rpc__s_protocol_error;
        return head.status;
    }

    // Keeps the connection of `link` after an exchange that it carried to
    // the end, and returns `answer`.
    uint32_t keep(Link &link, const tcp::endpoint &endpoint, uint32_t answer)
    {
        if (answer != lb__s_broker_unreachable && answer != rpc__s_protocol_error) {
            connection_ = link.give_up();
            pid_ = getpid();
            endpoint_ = endpoint;
        }
        return answer;
    }

    std::mutex mutex_;  // one exchange at a time; guards the members below
    Descriptor connection_;
    pid_t pid_ = 0;             // the process that opened connection_
    tcp::endpoint endpoint_;    // the broker it leads to
};

Registrar &registrar()
{
    static Registrar instance;
    return instance;
}

// The broker to ask for `location`: this host's for none or an in-process
// address; false for an address of another family.
bool broker_endpoint(const socket__addr_t *location, uint32_t location_len, tcp::endpoint &endpoint)
{
    uint16_t port = lb__broker_port();
    if (location == nullptr || location_len == 0 ||
        (location_len >= sizeof(sa_family_t) && location->sa.sa_family == socket__family_inproc)) {
        endpoint = tcp::endpoint(asio::ip::address_v4::loopback(), port);
        return true;
    }
    return ncs::net::endpoint_from(*location, location_len, port, endpoint);
}

uint32_t lookup(const uuid__t *object, const uuid__t *type, const uuid__t *interface,
                const socket__addr_t *location, uint32_t location_len, lb__lookup_handle_t *entry,
                uint32_t max_results, uint32_t *num_results, lb__entry_t results[])
{
    TRC1_FUNCTION();
    if (num_results != nullptr)
        *num_results = 0;
    if (object == nullptr || type == nullptr || interface == nullptr || entry == nullptr || num_results == nullptr ||
        results == nullptr || max_results == 0)
        return lb__s_bad_argument;
    tcp::endpoint endpoint;
    if (!broker_endpoint(location, location_len, endpoint))
        return lb__s_broker_unreachable;

    wire::Query query{*object, *type, *interface, *entry < 0 ? 0u : static_cast<uint32_t>(*entry),
                      std::min(max_results, wire::kMaxResultsPerReply)};
    std::array<uint8_t, wire::kLookupSize> body{};
    wire::Writer writer(body);
    wire::put_query(writer, query);
    Link link;
    if (!link.connect(endpoint)) {
        TRC1_FLOW_MSG("no location broker at %s port %u", endpoint.address().to_string().c_str(), endpoint.port());
        return lb__s_broker_unreachable;
    }
    std::vector<uint8_t> reply;
    uint32_t status = link.exchange(wire::Kind::kLookup, body, reply);
    if (status != rpc__s_ok)
        return status;

    wire::Reader reader(reply);
    wire::ReplyHead head = wire::get_reply_head(reader);
    if (head.count > query.max_results || reply.size() != wire::kReplyFixedSize + head.count * wire::kEntrySize ||
        head.position > kMaxSerial || (head.count > 0) != (head.status == rpc__s_ok))
        return rpc__s_protocol_error;
    for (uint32_t i = 0; i < head.count; ++i) {
        if (!wire::get_entry(reader, results[i]))
            return rpc__s_protocol_error;
    }
    if (head.count > 0)
        *entry = static_cast<lb__lookup_handle_t>(head.position);
    *num_results = head.count;
    return head.status;
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
// over the network with the broker of this host.
uint32_t update(wire::Kind kind, const lb__entry_t *entry)
{
    if (entry == nullptr || entry->saddr_len > wire::kAddrSize)
        return lb__s_bad_argument;
    {
        Embedded &e = embedded();
        std::lock_guard lock(e.mutex);
        if (Broker *broker = e.running()) {
            Database &database = broker->database();
            return kind == wire::Kind::kRegister ? database.add(*entry, kHostProcess) : database.remove(*entry);
        }
    }
    return registrar().send(kind, *entry);
}

}  // namespace

extern "C" {

void lb__lookup_range(const uuid__t *object, const uuid__t *type, const uuid__t *interface, const char *,
                      const socket__addr_t *location, uint32_t location_len, lb__lookup_handle_t *entry,
                      uint32_t max_results, uint32_t *num_results, lb__entry_t results[], uint32_t *status)
{
    guarded(status, [&] {
        return lookup(object, type, interface, location, location_len, entry, max_results, num_results, results);
    });
}

void lb__register(const lb__entry_t *entry, uint32_t *status)
{
    guarded(status, [&] { return update(wire::Kind::kRegister, entry); });
}

void lb__unregister(const lb__entry_t *entry, uint32_t *status)
{
    guarded(status, [&] { return update(wire::Kind::kUnregister, entry); });
}

void lb__start_broker(const char *host, uint32_t *status)
{
    guarded(status, [&] { return start_broker(host); });
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
    guarded(status, [&]() -> uint32_t {
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

uint16_t lb__broker_port(void)
{
    return static_cast<uint16_t>(PLT1_GetEnvNumber("NCS_LB_PORT", 0, 0xFFFF, kDefaultPort));
}

}  // extern "C"

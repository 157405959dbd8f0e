// The location broker's client side: lookups at the broker of any host, and
// the registrations of this process with the broker of its own.
#include "broker.h"

#include "ncs/deadline.h"
#include "ncs/guard.h"
#include "ncs/net.h"
#include "plt/plt1.h"
#include "trc/trc1.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstring>
#include <mutex>
#include <optional>
#include <vector>

TRC1_DEFINE_UNIT("broker client");

namespace {

namespace wire = ncs::lb;
using asio::ip::tcp;
using Clock = std::chrono::steady_clock;

constexpr uint16_t kDefaultPort = 135;
// A host without a broker must fail a lookup quickly; a broker answers from
// memory, so an exchange that takes longer than this has failed.
constexpr auto kConnectTimeout = std::chrono::seconds(2);
constexpr auto kExchangeTimeout = std::chrono::seconds(5);

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
        head.position > ncs::lb::kMaxSerial || (head.count > 0) != (head.status == rpc__s_ok))
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

// Registers or unregisters directly with the broker of this process, or
// over the network with the broker of this host.
uint32_t update(wire::Kind kind, const lb__entry_t *entry)
{
    if (entry == nullptr || entry->saddr_len > wire::kAddrSize)
        return lb__s_bad_argument;
    if (std::optional<uint32_t> direct = ncs::lb::update_embedded(kind, *entry))
        return *direct;
    return registrar().send(kind, *entry);
}

}  // namespace

extern "C" {

void lb__lookup_range(const uuid__t *object, const uuid__t *type, const uuid__t *interface, const char *,
                      const socket__addr_t *location, uint32_t location_len, lb__lookup_handle_t *entry,
                      uint32_t max_results, uint32_t *num_results, lb__entry_t results[], uint32_t *status)
{
    ncs::guarded(status, rpc__s_fault_unspec, [&] {
        return lookup(object, type, interface, location, location_len, entry, max_results, num_results, results);
    });
}

void lb__register(const lb__entry_t *entry, uint32_t *status)
{
    ncs::guarded(status, rpc__s_fault_unspec, [&] { return update(wire::Kind::kRegister, entry); });
}

void lb__unregister(const lb__entry_t *entry, uint32_t *status)
{
    ncs::guarded(status, rpc__s_fault_unspec, [&] { return update(wire::Kind::kUnregister, entry); });
}

uint16_t lb__broker_port(void)
{
    return static_cast<uint16_t>(PLT1_GetEnvNumber("NCS_LB_PORT", 0, 0xFFFF, kDefaultPort));
}

}  // extern "C"

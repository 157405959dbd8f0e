// What the TCP client and server share: Asio, and the conversion between
// the runtime's socket addresses and Asio's endpoints. Private to
// src/platform/ncs.
#ifndef NCS_NET_H
#define NCS_NET_H

#include "ncs/ncs.h"

#include <asio.hpp>

#include <cstring>
#include <limits>

namespace ncs::net {

using asio::ip::tcp;

// Socket buffers of both ends: a whole body of the interface in flight.
constexpr int kSocketBuffer = 1024 * 1024;

// Completion condition of whole reads and writes. Asio's transfer_all hands
// at most 64 KiB to each system call, so a body of half a megabyte took nine
// calls and as many trips through the event loop; this one offers the kernel
// everything that is left.
inline size_t whole(const asio::error_code &ec, size_t)
{
    return ec ? 0 : std::numeric_limits<size_t>::max();
}

// The endpoint of an IPv4 or IPv6 address of a handle (checked when the
// handle was bound).
inline tcp::endpoint endpoint_of(const socket__addr_t &addr)
{
    tcp::endpoint endpoint;
    size_t len = addr.sa.sa_family == AF_INET6 ? sizeof(sockaddr_in6) : sizeof(sockaddr_in);
    std::memcpy(endpoint.data(), &addr, len);
    endpoint.resize(len);
    return endpoint;
}

// The endpoint of an address of `addr_len` bytes that a peer or a caller
// gave, at `port`; false unless it is a whole IPv4 or IPv6 address.
inline bool endpoint_from(const socket__addr_t &addr, uint32_t addr_len, uint16_t port, tcp::endpoint &endpoint)
{
    if (!(addr.sa.sa_family == AF_INET && addr_len >= sizeof addr.in4) &&
        !(addr.sa.sa_family == AF_INET6 && addr_len >= sizeof addr.in6))
        return false;
    endpoint = endpoint_of(addr);
    endpoint.port(port);
    return true;
}

// The runtime's address of an endpoint; returns its length.
inline uint32_t address_of(const tcp::endpoint &endpoint, socket__addr_t &addr)
{
    std::memset(&addr, 0, sizeof addr);
    std::memcpy(&addr, endpoint.data(), endpoint.size());
    return static_cast<uint32_t>(endpoint.size());
}

}  // namespace ncs::net

#endif

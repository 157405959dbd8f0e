// Host names and socket addresses.
#include "ncs/guard.h"
#include "ncs/ncs.h"
#include "ncs/runtime.h"

#include <netdb.h>

#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <string>

namespace {

// Longest host name the resolver is given: a DNS name has at most 253
// characters, an IPv6 literal with a zone index fewer.
constexpr uint32_t kMaxHostName = 255;

struct AddrinfoFree {
    void operator()(addrinfo *list) const { freeaddrinfo(list); }
};
using AddrinfoList = std::unique_ptr<addrinfo, AddrinfoFree>;

using ncs::set_status;

// A host name or address literal holds letters, digits, '-', '.', '_', and
// for IPv6 ':' and '%' (zone). Anything else can't name a host, and goes to no
// resolver.
bool host_name_syntax(const char *host)
{
    for (const char *p = host; *p != '\0'; ++p) {
        char c = *p;
        bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
                  c == '.' || c == '_' || c == ':' || c == '%';
        if (!ok)
            return false;
    }
    return true;
}

// Resolves `host` within `family` (AF_UNSPEC: any); null when it can't be.
AddrinfoList resolve(const char *host, int family)
{
    addrinfo hints{};
    hints.ai_family = family;
    hints.ai_socktype = SOCK_STREAM;
    addrinfo *list = nullptr;
    if (getaddrinfo(host, nullptr, &hints, &list) != 0)
        return nullptr;
    return AddrinfoList(list);
}

// The names that addresses were resolved from, by the address's bytes; a
// bounded few, the oldest key going first when full.
constexpr size_t kMaxNames = 256;
std::mutex g_names_mutex;  // guards g_names
std::map<std::string, std::string> g_names;

std::string address_key(const socket__addr_t &addr)
{
    if (addr.sa.sa_family == AF_INET)
        return std::string(reinterpret_cast<const char *>(&addr.in4.sin_addr), sizeof addr.in4.sin_addr);
    if (addr.sa.sa_family == AF_INET6)
        return std::string(reinterpret_cast<const char *>(&addr.in6.sin6_addr), sizeof addr.in6.sin6_addr);
    return "";
}

void remember_name(const socket__addr_t &addr, const std::string &host)
{
    const std::string key = address_key(addr);
    std::lock_guard<std::mutex> hold(g_names_mutex);
    if (g_names.size() >= kMaxNames && g_names.count(key) == 0)
        g_names.erase(g_names.begin());
    g_names[key] = host;
}

}  // namespace

namespace ncs {

std::string host_name_of(const socket__addr_t &addr)
{
    std::lock_guard<std::mutex> hold(g_names_mutex);
    auto known = g_names.find(address_key(addr));
    return known != g_names.end() ? known->second : "";
}

}  // namespace ncs

extern "C" {

void socket__from_name(uint32_t family, const char *name, uint32_t name_len, uint32_t port, socket__addr_t *addr,
                       uint32_t *addr_len, uint32_t *status)
{
    set_status(status, rpc__s_unknown_host);
    if (name == nullptr || addr == nullptr || addr_len == nullptr || port > 0xFFFF)
        return;
    if (family != 0 && family != AF_INET && family != AF_INET6) {
        set_status(status, socket__s_bad_family);
        return;
    }
    // The name is the first name_len characters, up to a NUL among them.
    size_t length = strnlen(name, name_len);
    if (length == 0 || length > kMaxHostName)
        return;
    char host[kMaxHostName + 1];
    std::memcpy(host, name, length);
    host[length] = '\0';
    if (!host_name_syntax(host))
        return;

    AddrinfoList list = resolve(host, family == 0 ? AF_UNSPEC : static_cast<int>(family));
    if (list == nullptr)
        return;
    const addrinfo &first = *list;
    if (first.ai_addrlen > *addr_len || first.ai_addrlen > sizeof(socket__addr_t)) {
        set_status(status, socket__s_addr_too_small);
        return;
    }
    socket__addr_t result{};
    std::memcpy(result.bytes, first.ai_addr, first.ai_addrlen);
    if (result.sa.sa_family == AF_INET)
        result.in4.sin_port = htons(static_cast<uint16_t>(port));
    else if (result.sa.sa_family == AF_INET6)
        result.in6.sin6_port = htons(static_cast<uint16_t>(port));
    else
        return;
    std::memcpy(addr->bytes, result.bytes, first.ai_addrlen);
    *addr_len = static_cast<uint32_t>(first.ai_addrlen);
    try {
        remember_name(result, host);
    } catch (...) {
        // Without the name, TLS checks the server's certificate against its address.
    }
    set_status(status, rpc__s_ok);
}

void socket__to_name(const socket__addr_t *addr, uint32_t addr_len, char *name, uint32_t *name_len, uint32_t *port,
                     uint32_t *status)
{
    set_status(status, socket__s_bad_family);
    if (addr == nullptr || name == nullptr || name_len == nullptr || port == nullptr || addr_len < sizeof(sa_family_t))
        return;
    socklen_t needed;
    uint16_t net_port;
    if (addr->sa.sa_family == AF_INET) {
        needed = sizeof addr->in4;
        net_port = addr->in4.sin_port;
    } else if (addr->sa.sa_family == AF_INET6) {
        needed = sizeof addr->in6;
        net_port = addr->in6.sin6_port;
    } else {
        return;
    }
    if (addr_len < needed)
        return;
    char host[NI_MAXHOST];
    if (getnameinfo(&addr->sa, needed, host, sizeof host, nullptr, 0, NI_NUMERICHOST) != 0)
        return;
    size_t length = std::strlen(host);
    if (length >= *name_len) {
        set_status(status, socket__s_name_too_long);
        return;
    }
    std::memcpy(name, host, length + 1);
    *name_len = static_cast<uint32_t>(length);
    *port = ntohs(net_port);
    set_status(status, rpc__s_ok);
}

unsigned char socket__valid_family(uint32_t family, uint32_t *status)
{
    bool valid = family == AF_INET || family == AF_INET6 || family == socket__family_inproc;
    set_status(status, valid ? rpc__s_ok : socket__s_bad_family);
    return valid ? 1 : 0;
}

void socket__inproc_addr(socket__addr_t *addr, uint32_t *addr_len)
{
    *addr = socket__addr_t{};
    addr->sa.sa_family = socket__family_inproc;
    *addr_len = sizeof addr->sa.sa_family;
}

}  // extern "C"

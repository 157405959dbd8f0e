// Binding handles.
//
// Every live handle is entered in one process-wide set, so a null, freed or
// foreign pointer is told apart from a handle without reading through it.
// A handle is a plain value (an address and whether it is bound): a duplicate
// is a copy, and nothing ties it to the handle it came from.
#include "ncs/guard.h"
#include "ncs/runtime.h"

#include <cstring>
#include <mutex>
#include <new>
#include <unordered_set>

namespace {

class HandleTable {
public:
    // False when there is no memory to enter it.
    bool add(ncs::Handle *handle)
    {
        std::lock_guard<std::mutex> hold(mutex_);
        try {
            live_.insert(handle);
            return true;
        } catch (const std::bad_alloc &) {
            return false;
        }
    }
    bool contains(const void *handle)
    {
        std::lock_guard<std::mutex> hold(mutex_);
        return live_.count(static_cast<const ncs::Handle *>(handle)) != 0;
    }
    // Takes `handle` out; false if it wasn't live.
    bool remove(const void *handle)
    {
        std::lock_guard<std::mutex> hold(mutex_);
        return live_.erase(static_cast<const ncs::Handle *>(handle)) != 0;
    }

private:
    std::mutex mutex_;  // guards live_
    std::unordered_set<const ncs::Handle *> live_;
};

HandleTable &table()
{
    // Never destroyed: handles may be freed by threads that outlive static
    // destruction.
    static HandleTable *instance = new HandleTable;
    return *instance;
}

using ncs::set_status;

void point_at(ncs::Handle &handle, const socket__addr_t &addr, uint32_t addr_len)
{
    std::memset(&handle.addr, 0, sizeof handle.addr);
    std::memcpy(&handle.addr, &addr, addr_len);
    handle.addr_len = addr_len;
    handle.bound = true;
}

// A new live handle with the value of `value`; null and rpc__s_no_memory
// when there is no memory for it.
handle_t enter(const ncs::Handle &value, uint32_t *status)
{
    auto *handle = new (std::nothrow) ncs::Handle(value);
    if (handle == nullptr || !table().add(handle)) {
        delete handle;
        set_status(status, rpc__s_no_memory);
        return nullptr;
    }
    set_status(status, rpc__s_ok);
    return handle;
}

}  // namespace

namespace ncs {

Handle *handle_of(handle_t handle)
{
    if (handle == nullptr || !table().contains(handle))
        return nullptr;
    return static_cast<Handle *>(handle);
}

uint32_t check_address(const socket__addr_t *addr, uint32_t addr_len)
{
    if (addr == nullptr || addr_len < sizeof(sa_family_t) || addr_len > sizeof(socket__addr_t))
        return socket__s_bad_family;
    switch (addr->sa.sa_family) {
    case AF_INET:
        return addr_len >= sizeof(sockaddr_in) ? rpc__s_ok : socket__s_bad_family;
    case AF_INET6:
        return addr_len >= sizeof(sockaddr_in6) ? rpc__s_ok : socket__s_bad_family;
    case socket__family_inproc:
        return rpc__s_ok;
    default:
        return socket__s_bad_family;
    }
}

}  // namespace ncs

extern "C" {

handle_t rpc__bind(const uuid__t *, const socket__addr_t *addr, uint32_t addr_len, uint32_t *status)
{
    uint32_t checked = ncs::check_address(addr, addr_len);
    if (checked != rpc__s_ok) {
        set_status(status, checked);
        return nullptr;
    }
    ncs::Handle fresh{};
    fresh.data_offs = RPC_DATA_OFFS;
    fresh.magic = ncs::kHandleMagic;
    point_at(fresh, *addr, addr_len);
    return enter(fresh, status);
}

void rpc__set_binding(handle_t handle, const socket__addr_t *addr, uint32_t addr_len, uint32_t *status)
{
    ncs::Handle *h = ncs::handle_of(handle);
    if (h == nullptr) {
        set_status(status, rpc__s_invalid_handle);
        return;
    }
    uint32_t checked = ncs::check_address(addr, addr_len);
    if (checked == rpc__s_ok)
        point_at(*h, *addr, addr_len);
    set_status(status, checked);
}

void rpc__inq_binding(handle_t handle, socket__addr_t *addr, uint32_t *addr_len, uint32_t *status)
{
    ncs::Handle *h = ncs::handle_of(handle);
    if (h == nullptr) {
        set_status(status, rpc__s_invalid_handle);
        return;
    }
    if (!h->bound) {
        set_status(status, rpc__s_not_bound);
        return;
    }
    if (addr != nullptr)
        *addr = h->addr;
    if (addr_len != nullptr)
        *addr_len = h->addr_len;
    set_status(status, rpc__s_ok);
}

handle_t rpc__dup_handle(handle_t handle, uint32_t *status)
{
    ncs::Handle *h = ncs::handle_of(handle);
    if (h == nullptr) {
        set_status(status, rpc__s_invalid_handle);
        return nullptr;
    }
    return enter(*h, status);
}

void rpc__clear_server_binding(handle_t handle, uint32_t *status)
{
    ncs::Handle *h = ncs::handle_of(handle);
    if (h == nullptr) {
        set_status(status, rpc__s_invalid_handle);
        return;
    }
    h->bound = false;
    std::memset(&h->addr, 0, sizeof h->addr);
    h->addr_len = 0;
    set_status(status, rpc__s_ok);
}

void rpc__free_handle(handle_t handle, uint32_t *status)
{
    if (handle == nullptr || !table().remove(handle)) {
        set_status(status, rpc__s_invalid_handle);
        return;
    }
    auto *h = static_cast<ncs::Handle *>(handle);
    h->magic = 0;
    delete h;
    set_status(status, rpc__s_ok);
}

}  // extern "C"

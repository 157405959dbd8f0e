// rpc__sar: the one call of a remote operation, handed to the carrier of the
// handle's address family.
#include "ncs/runtime.h"

#include <atomic>
#include <new>

namespace {

[[noreturn]] void raise(uint32_t status)
{
    EXC1__Raise(EXC1_Thread(), status);
}

std::atomic<ncs::Carrier *> g_network_carrier{nullptr};

}  // namespace

namespace ncs {

Carrier *network_carrier()
{
    return g_network_carrier.load();
}

void set_network_carrier(Carrier &carrier)
{
    g_network_carrier = &carrier;
}

void *place_reply(uint32_t len, void *reply_buf, uint32_t reply_buf_size, Reply &reply)
{
    reply.len = len;
    if (reply_buf != nullptr && reply_buf_size >= RPC_DATA_OFFS && len <= reply_buf_size - RPC_DATA_OFFS) {
        reply.pkt = reply_buf;
        reply.must_free = false;
    } else {
        rpc__alloc_pkt(len, &reply.pkt);
        reply.must_free = true;
    }
    return static_cast<unsigned char *>(reply.pkt) + RPC_DATA_OFFS;
}

}  // namespace ncs

extern "C" {

void rpc__sar(handle_t handle, uint32_t options, const rpc__if_spec_t *ifspec, uint32_t opnum, void *request_pkt,
              uint32_t request_len, void *reply_buf, uint32_t reply_buf_size, void **reply_pkt, uint32_t *reply_len,
              uint32_t *drep, unsigned char *must_free, uint32_t *status)
{
    ncs::Handle *h = ncs::handle_of(handle);
    if (h == nullptr)
        raise(rpc__s_invalid_handle);
    if (!h->bound)
        raise(rpc__s_not_bound);
    if (ifspec == nullptr)
        raise(rpc__s_unknown_if);
    if (request_len > RPC_MAX_BODY)
        raise(rpc__s_too_big);
    // The call works on a copy: the handle may be re-pointed once it returns.
    socket__addr_t addr = h->addr;
    uint32_t addr_len = h->addr_len;
    ncs::Carrier *carrier =
        addr.sa.sa_family == socket__family_inproc ? &ncs::inproc_carrier() : ncs::network_carrier();
    if (carrier == nullptr)
        raise(rpc__s_comm_failure);

    ncs::Reply reply;
    // Raises pass; any other exception of a carrier becomes a raise here, so
    // nothing but exc::Fault leaves this function.
    try {
        carrier->call(addr, addr_len, options, *ifspec, opnum, request_pkt, request_len, reply_buf, reply_buf_size,
                     reply);
    } catch (const exc::Fault &) {
        throw;
    } catch (const std::bad_alloc &) {
        raise(rpc__s_no_memory);
    } catch (...) {
        raise(rpc__s_comm_failure);
    }
    *reply_pkt = reply.pkt;
    *reply_len = reply.len;
    *drep = reply.drep;
    *must_free = reply.must_free ? 1 : 0;
    if (status != nullptr)
        *status = rpc__s_ok;
}

}  // extern "C"

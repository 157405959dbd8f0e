// Inside the runtime: binding handles, carriers and the server's dispatch.
// Private to src/platform/ncs.
#ifndef NCS_RUNTIME_H
#define NCS_RUNTIME_H

#include "ncs/ncs.h"

#include <cstdint>
#include <string>

namespace ncs {

// The record behind handle_t. `data_offs` comes first, as stubs expect.
struct Handle : rpc__handle_rec {
    uint32_t magic;           // kHandleMagic while the handle lives
    bool bound;               // false after rpc__clear_server_binding
    socket__addr_t addr;
    uint32_t addr_len;
    const char *client_name;  // of a server's handle: the TLS client's name, or null
};
constexpr uint32_t kHandleMagic = 0x48414e44;  // "HAND"

// Checks that `handle` is a live handle of this runtime (one of rpc__bind or
// rpc__dup_handle, not yet freed); null otherwise. Never reads through a
// pointer that isn't a live handle.
Handle *handle_of(handle_t handle);

// rpc__s_ok when `addr` of `addr_len` bytes is an address a handle can hold:
// AF_INET, AF_INET6 or socket__family_inproc, long enough for its family and
// no longer than socket__addr_t; else socket__s_bad_family.
uint32_t check_address(const socket__addr_t *addr, uint32_t addr_len);

// A reply as a carrier hands it back to rpc__sar.
struct Reply {
    void *pkt = nullptr;      // reply_buf or a packet of rpc__alloc_pkt
    uint32_t len = 0;         // body length, without RPC_DATA_OFFS
    uint32_t drep = 0;        // the sender's
    bool must_free = false;   // pkt came from rpc__alloc_pkt
};

// Carries one call to the server at an address, under rpc__sar's contract:
// the request body is at request_pkt + RPC_DATA_OFFS; the reply body goes to
// reply_buf + RPC_DATA_OFFS when it fits reply_buf_size, else into a packet of
// rpc__alloc_pkt. Every failure is raised with EXC1__Raise: communication
// failures with a status of RPC_COMM_MODULE, a fault that the server raised
// with its own status.
class Carrier {
public:
    virtual ~Carrier() = default;
    virtual void call(const socket__addr_t &addr, uint32_t addr_len, uint32_t options, const rpc__if_spec_t &ifspec,
                      uint32_t opnum, void *request_pkt, uint32_t request_len, void *reply_buf,
                      uint32_t reply_buf_size, Reply &reply) = 0;
};

// Chooses where a reply body of `len` bytes goes, under rpc__sar's contract:
// reply_buf when RPC_DATA_OFFS + len fit reply_buf_size, else a new packet
// (raises rpc__s_no_memory). Fills reply.pkt, reply.len and reply.must_free
// and returns where the body starts.
void *place_reply(uint32_t len, void *reply_buf, uint32_t reply_buf_size, Reply &reply);

// A setting of the runtime from the environment variable `name`, read at
// every call as PLT1_GetEnvNumber reads numbers: from 1 to 4294967295;
// `dflt` when the variable is unset or holds anything else.
uint32_t setting(const char *name, uint32_t dflt);

// The carrier for the in-process family.
Carrier &inproc_carrier();
// The carrier for IPv4 and IPv6, which the layer above registers as the
// library loads; null before.
Carrier *network_carrier();
void set_network_carrier(Carrier &carrier);

// The host name that socket__from_name resolved to the IP address of
// `addr` (the last such name), or the empty text: what a TLS client checks
// the server's certificate against.
std::string host_name_of(const socket__addr_t &addr);

// The outcome of one dispatched request.
struct Dispatched {
    uint32_t fault = 0;       // 0: a reply; else the status raised (no reply)
    void *reply_pkt = nullptr;
    uint32_t reply_len = 0;
    bool must_free = false;   // reply_pkt is a packet to give back after sending
};

// Runs the server stub registered for (interface UUID, version, operation)
// on the request body at in_pkt + RPC_DATA_OFFS, offering out_pkt with
// out_max bytes of room behind RPC_DATA_OFFS for the reply. `client` is the
// name in the TLS client's certificate, or null. With `busy`, the
// stub calls the interface's busy managers instead of its managers, and an
// interface without them gives the fault rpc__s_server_busy. An unknown
// interface gives fault rpc__s_unknown_if, an operation outside the
// interface's count rpc__s_op_rng_error. Never throws.
Dispatched dispatch(const uuid__t &if_id, uint32_t if_vers, uint32_t opnum, uint32_t drep, void *in_pkt,
                    uint32_t in_len, void *out_pkt, uint32_t out_max, bool busy, const char *client);

}  // namespace ncs

#endif

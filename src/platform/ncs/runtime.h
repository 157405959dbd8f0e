// Inside the runtime: binding handles, carriers and the server's dispatch.
// Private to src/platform/ncs.
#ifndef NCS_RUNTIME_H
#define NCS_RUNTIME_H

#include "ncs/ncs.h"

#include <cstdint>

namespace ncs {

// The record behind handle_t. `data_offs` comes first, as stubs expect.
struct Handle : rpc__handle_rec {
    uint32_t magic;           // kHandleMagic while the handle lives
    bool bound;               // false after rpc__clear_server_binding
    socket__addr_t addr;
    uint32_t addr_len;
};
constexpr uint32_t kHandleMagic = 0x48414e44;  // "HAND"

// Checks that `handle` is a live handle of this runtime; null otherwise.
Handle *handle_of(handle_t handle);

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

// The carrier for the in-process family, and for IPv4 and IPv6.
Carrier &inproc_carrier();
Carrier &tcp_carrier();

// The outcome of one dispatched request.
struct Dispatched {
    uint32_t fault = 0;       // 0: a reply; else the status raised (no reply)
    void *reply_pkt = nullptr;
    uint32_t reply_len = 0;
    bool must_free = false;   // reply_pkt is a packet to give back after sending
};

// Runs the server stub registered for (interface UUID, version, operation)
// on the request body at in_pkt + RPC_DATA_OFFS, offering out_pkt with
// out_max bytes of room behind RPC_DATA_OFFS for the reply. An unknown
// interface gives fault rpc__s_unknown_if, an operation outside the
// interface's count rpc__s_op_rng_error. Never throws.
Dispatched dispatch(const uuid__t &if_id, uint32_t if_vers, uint32_t opnum, uint32_t drep, void *in_pkt,
                    uint32_t in_len, void *out_pkt, uint32_t out_max);

}  // namespace ncs

#endif

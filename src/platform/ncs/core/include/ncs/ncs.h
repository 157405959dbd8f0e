/* NCS RPC runtime: binding handles, the call of a remote operation
 * (rpc__sar), packets, registration and dispatch of interfaces, the location
 * broker, host names and socket addresses, UUIDs and status texts.
 *
 * Every operation that takes a `status` out-argument writes it on every call;
 * 0 (rpc__s_ok) is success. Operations made for stubs (rpc__sar,
 * rpc__alloc_pkt, rpc__malloc) report failures by raising the status with
 * EXC1__Raise instead (see exc/exc1.h). All functions are callable from any
 * thread; a handle is used by one thread at a time. */
#ifndef NCS_NCS_H
#define NCS_NCS_H

#include <netinet/in.h>
#include <stddef.h>
#include <stdint.h>
#include <sys/socket.h>

#include "nrtr/nrtr1.h"

#ifdef __cplusplus
extern "C" {
#endif

#define NCS_API __attribute__((visibility("default")))

/* ---- Statuses ---------------------------------------------------------- */

#define rpc__s_ok 0u
/* Communication module, 0x1C01xxxx: a call that failed on its way. Client
 * stubs store these into the operation's `status` argument. */
#define RPC_COMM_MODULE           0x1C010000u
#define rpc__s_comm_failure       0x1C010001u /* connection lost, peer died */
#define rpc__s_connect_refused    0x1C010002u /* nobody listens at the address */
#define rpc__s_connection_reset   0x1C010003u /* the peer reset the connection */
#define rpc__s_timeout            0x1C010004u /* connect or call time-out */
#define rpc__s_unknown_if         0x1C010005u /* no registration for the interface */
#define rpc__s_op_rng_error       0x1C010006u /* operation number out of range */
#define rpc__s_protocol_error     0x1C010007u /* malformed or unknown frame */
#define rpc__s_too_big            0x1C010008u /* body above the carrier's limit */
#define rpc__s_server_busy        0x1C010009u /* server at its limit of connections or calls */
#define rpc__s_not_bound          0x1C01000Au /* the handle has no server */
#define rpc__s_unknown_host       0x1C01000Bu /* a host name can't be resolved */
#define rpc__s_invalid_handle     0x1C01000Cu /* null or freed handle */
#define rpc__s_cant_listen        0x1C01000Du /* the server can't listen at the address */
#define rpc__s_tls_required       0x1C01000Eu /* a plain client at a server that speaks TLS only */
#define rpc__s_tls_handshake      0x1C01000Fu /* the peer refused our certificate, or speaks no TLS */
#define rpc__s_tls_untrusted      0x1C010010u /* the server's certificate: another CA, or another name */
#define rpc__s_tls_settings       0x1C010011u /* a certificate, key or CA file that can't be used */
#define rpc__s_tls_key_exposed    0x1C010012u /* a key file that others may read */
/* Faults, 0x1C00xxxx: raised by a stub or a manager; not of the
 * communication module, so they pass out of a client stub as raises. */
#define rpc__s_fault_invalid_bound 0x1C000007u
#define rpc__s_no_memory           0x1C000011u
#define rpc__s_fault_unspec        0x1C000012u
/* Registration. */
#define rpc__s_already_registered 0x1C020001u
#define rpc__s_not_registered     0x1C020002u
/* Location broker, 0x1C03xxxx. */
#define lb__s_not_registered      0x1C030001u /* no (further) matching entry */
#define lb__s_broker_unreachable  0x1C030002u
#define lb__s_database_full       0x1C030003u
#define lb__s_bad_argument        0x1C030004u /* an entry or argument the broker can't take */
#define lb__s_not_permitted       0x1C030005u /* a registration or removal from another host */
/* Sockets and UUIDs. */
#define socket__s_bad_family      0x1C040001u
#define socket__s_name_too_long   0x1C040002u /* the text doesn't fit the room given */
#define socket__s_addr_too_small  0x1C040003u /* the address doesn't fit the room given */
#define uuid__s_bad_text          0x1C050001u

/* ---- UUIDs ------------------------------------------------------------- */

/* A UUID of the runtime, 16 bytes, integers in the host's byte order. Its
 * text form is 12 hex digits of time (8 high, 4 low), then the family and
 * the 7 host bytes as dot-separated hex pairs:
 * "684152a852f9.02.c6.d2.2d.fd.00.00.00". */
typedef struct uuid__t {
    uint32_t time_high;
    uint16_t time_low;
    uint16_t reserved;
    uint8_t family;
    uint8_t host[7];
} uuid__t;

NCS_API extern const uuid__t uuid__nil;

/* Parses the text form into `uuid`. */
NCS_API void uuid__decode(const char *text, uuid__t *uuid, uint32_t *status);
/* Writes the text form (37 characters and a NUL) into `text`. */
NCS_API void uuid__encode(const uuid__t *uuid, char text[37]);
NCS_API int uuid__equal(const uuid__t *a, const uuid__t *b);

/* ---- Interfaces -------------------------------------------------------- */

/* The interface record (if_spec), 88 bytes, integers in the host's byte order. */
typedef struct rpc__if_spec_t {
    uint32_t vers;
    uint16_t port[32];       /* well-known port per socket family; 0: none */
    uint16_t opcnt;
    uint16_t gap;
    uuid__t id;
} rpc__if_spec_t;

/* ---- Socket addresses -------------------------------------------------- */

/* A socket address of 104 bytes: an IPv4 or IPv6 address with its port, or
 * an address of the in-process family. */
typedef union socket__addr_t {
    struct sockaddr sa;
    struct sockaddr_in in4;
    struct sockaddr_in6 in6;
    unsigned char bytes[104];
} socket__addr_t;

/* The in-process family: calls on a handle bound to such an address are
 * carried to the dispatch of the same process, with the same contract as the
 * network carrier. Its address holds nothing but the family. */
#define socket__family_inproc 0x7F01u

/* Resolves `name` (its first `name_len` characters, up to a NUL among them:
 * a host name, an IPv4 or IPv6 literal) to an address with `port` (0..65535).
 * `family` 0 takes the first address the resolver gives; AF_INET or AF_INET6
 * only addresses of that family (any other: socket__s_bad_family).
 * `addr_len` is the room in `addr` on entry and the address's length on
 * return (socket__s_addr_too_small when it doesn't fit). A name that can't be
 * resolved, the empty name included, gives rpc__s_unknown_host. `addr` and
 * `addr_len` are unchanged on failure. */
NCS_API void socket__from_name(uint32_t family, const char *name, uint32_t name_len, uint32_t port,
                               socket__addr_t *addr, uint32_t *addr_len, uint32_t *status);
/* Host name (numeric form) and port of an IPv4 or IPv6 address (other
 * families, or an `addr_len` short of the family's address:
 * socket__s_bad_family). `name_len` is the room in `name` on entry, the text
 * with its NUL included, and the length of the text without the NUL on
 * return (socket__s_name_too_long when it doesn't fit: nothing written).
 * `name`, `name_len` and `port` are unchanged on failure. */
NCS_API void socket__to_name(const socket__addr_t *addr, uint32_t addr_len, char *name, uint32_t *name_len,
                             uint32_t *port, uint32_t *status);
/* Whether this process can use the address family: AF_INET, AF_INET6 and
 * socket__family_inproc give 1 and rpc__s_ok; any other 0 and
 * socket__s_bad_family. */
NCS_API unsigned char socket__valid_family(uint32_t family, uint32_t *status);
/* Address of the in-process family: the family alone, `addr_len` 2. */
NCS_API void socket__inproc_addr(socket__addr_t *addr, uint32_t *addr_len);

/* ---- Binding handles --------------------------------------------------- */

/* A binding handle: the stubs read `data_offs` only; the rest of the record
 * is the runtime's. */
struct rpc__handle_rec {
    uint16_t data_offs;  /* bytes kept for the runtime at the start of every packet */
};
typedef struct rpc__handle_rec *handle_t;

/* Bytes in front of every body in a packet buffer; the same for every handle
 * of this runtime. */
#define RPC_DATA_OFFS 32u

/* A new handle bound to the server at `addr`. Null on failure. */
NCS_API handle_t rpc__bind(const uuid__t *object, const socket__addr_t *addr, uint32_t addr_len, uint32_t *status);
/* Points an existing handle at `addr`. */
NCS_API void rpc__set_binding(handle_t handle, const socket__addr_t *addr, uint32_t addr_len, uint32_t *status);
/* The address of a handle; fails with rpc__s_not_bound on a cleared one. */
NCS_API void rpc__inq_binding(handle_t handle, socket__addr_t *addr, uint32_t *addr_len, uint32_t *status);
/* A new handle on the same binding. It stays valid when the handle it came
 * from is cleared, re-pointed or freed. */
NCS_API handle_t rpc__dup_handle(handle_t handle, uint32_t *status);
/* The handle forgets its server; calls on it fail with rpc__s_not_bound. */
NCS_API void rpc__clear_server_binding(handle_t handle, uint32_t *status);
/* Frees one handle. */
NCS_API void rpc__free_handle(handle_t handle, uint32_t *status);

/* ---- Calls, for client stubs ------------------------------------------- */

/* Options word of rpc__sar. */
#define RPC_OPT_AT_MOST_ONCE 0u
#define RPC_OPT_IDEMPOTENT   2u

/* Largest body a carrier takes, either way: the interface's largest body
 * with room to spare. */
#define RPC_MAX_BODY (1024u * 1024u)

/* Sends the request body of `request_len` bytes at request_pkt + data_offs
 * and waits for the reply. Carries the operation number, the interface's
 * UUID and version and this machine's drep. Returns only with a reply:
 * `*reply_pkt` is `reply_buf` (must_free 0) when data_offs plus the reply fit
 * `reply_buf_size`, else a packet of rpc__alloc_pkt (must_free 1); the body
 * starts at data_offs; `*drep` is the sender's. Every failure is raised with
 * EXC1__Raise: communication failures with a status of RPC_COMM_MODULE,
 * faults the server raised with their own status. An idempotent call
 * (RPC_OPT_IDEMPOTENT) may be sent again after a connection failure; any
 * other is sent at most once. `status` is set to 0 on return. */
NCS_API void rpc__sar(handle_t handle, uint32_t options, const rpc__if_spec_t *ifspec, uint32_t opnum,
                      void *request_pkt, uint32_t request_len, void *reply_buf, uint32_t reply_buf_size,
                      void **reply_pkt, uint32_t *reply_len, uint32_t *drep, unsigned char *must_free,
                      uint32_t *status);

/* A packet buffer with room for RPC_DATA_OFFS bytes and then `size` bytes.
 * Never null: a failure is raised (rpc__s_no_memory). */
NCS_API void rpc__alloc_pkt(uint32_t size, void **pkt);
/* Gives back a packet from rpc__alloc_pkt, or from rpc__sar with must_free. */
NCS_API void rpc__free_pkt(void *pkt);
/* Copies `count` bytes; the areas don't overlap. */
NCS_API void rpc__block_copy(const void *source, void *destination, uint32_t count);
/* Memory for a server stub's array; `size` may be 0. Never null for a size
 * above 0: a failure is raised. */
NCS_API void rpc__malloc(uint32_t size, void **ptr);
NCS_API void rpc__free(void *ptr);

/* ---- Registration and dispatch, for servers ---------------------------- */

/* A server stub. The request body lies at in_pkt + data_offs; the stub sets
 * `*reply_pkt` (out_pkt, or a packet of rpc__alloc_pkt with `*must_free`),
 * the reply body's length, and `*st` 0; or it raises. */
typedef void (*rpc__server_stub_t)(handle_t handle, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                                   uint32_t *drep, const void *mgr_epv, void **reply_pkt, uint32_t *reply_len,
                                   unsigned char *must_free, uint32_t *st);

/* Registers an interface's server stubs (indexed by operation number, with
 * ifspec->opcnt entries) and its manager table on this process's server.
 * One registration per interface UUID and version: a second gives
 * rpc__s_already_registered; a null ifspec or server_epv rpc__s_unknown_if.
 * The tables must stay valid until rpc__unregister and the end of the calls
 * under way then. `type` is not used: one manager table serves all objects. */
NCS_API void rpc__register_mgr(const uuid__t *type, const rpc__if_spec_t *ifspec,
                               const rpc__server_stub_t *server_epv, const void *mgr_epv, uint32_t *status);
/* Gives the registered interface of `ifspec` a second manager table, whose
 * managers answer its calls on the TCP server while every worker is busy
 * (see rpc__listen). They run on an I/O thread, so they must answer at once
 * and never block: a status that tells the client to come back later. Null
 * takes the table away: such calls are then answered with the fault
 * rpc__s_server_busy. rpc__s_not_registered without a registration. */
NCS_API void rpc__register_busy_mgr(const rpc__if_spec_t *ifspec, const void *busy_mgr_epv, uint32_t *status);
/* The common name in the certificate of the client whose call a manager
 * runs, from the manager's `handle`, in `name` (cut to size - 1 characters
 * and a NUL); the empty text on a connection without TLS.
 * rpc__s_invalid_handle for a handle that isn't a manager's. */
NCS_API void rpc__inq_client_name(handle_t handle, char *name, size_t size, uint32_t *status);

/* Takes the registration of the interface's UUID and version away; new
 * requests get rpc__s_unknown_if at once. Calls that already run go on to
 * their end on the old registration; the call doesn't wait for them.
 * rpc__s_not_registered when there is none. */
NCS_API void rpc__unregister(const rpc__if_spec_t *ifspec, uint32_t *status);

/* ---- Status texts ------------------------------------------------------ */

/* A text for `status` in `buffer` (at most size - 1 characters and a NUL);
 * returns `buffer`. The empty text for a status without one. */
NCS_API char *error__c_text(uint32_t status, char *buffer, size_t size);

/* ---- Exception frames of the stubs ------------------------------------- */

#define pfm__frame_set 0x03040003u

#ifdef __cplusplus
}

#include "exc/exc1.h"

/* Arms `frame` for the stretch `body` of a stub: returns pfm__frame_set when
 * the body ran to its end, or the status raised inside it (the frame is off
 * the chain by then). */
template <class Body>
inline uint32_t pfm___cleanup(EXC1_FRAME *frame, const char *file, int line, Body &&body)
{
    return exc::guard(frame, file, line, static_cast<Body &&>(body));
}
#endif
#endif

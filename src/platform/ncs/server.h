/* The RPC server of a process: listens on one TCP address and runs the
 * incoming calls of the registered interfaces (rpc__register_mgr) on a pool
 * of the runtime's threads. The managers run on those threads.
 *
 * A process has at most one server. Limits, from the environment at
 * rpc__listen: "NCS_MAX_CONNECTIONS" connections at once (default 256; a
 * connection beyond is answered rpc__s_server_busy and closed), and
 * "NCS_IDLE_TIMEOUT_S" seconds (default 300) that a connection may stay
 * without a complete frame or a read reply before it is closed. Each
 * connection is served by one of the threads, given in turn as connections
 * are accepted: calls at once are bounded by the number of threads, and a
 * call waits while another call of its thread runs. A
 * request above RPC_MAX_BODY is answered rpc__s_too_big before anything is
 * allocated for it; a malformed frame closes its connection only.
 *
 * All functions are callable from any thread but the server's own (a manager
 * must not stop the server it runs on). */
#ifndef NCS_SERVER_H
#define NCS_SERVER_H

#include "ncs/ncs.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Starts the server on `host` (an IPv4 or IPv6 literal or a host name; null:
 * 127.0.0.1; "::" takes IPv4 too) at `port` (0: a free port) with `threads`
 * threads for calls (0: 4; at most 64). On success `*bound` and `*bound_len`,
 * when not null, hold the address listened on with its port. Statuses:
 * rpc__s_unknown_host, rpc__s_cant_listen (the address is taken, or the
 * process already has a server); `bound` is unchanged on failure. */
NCS_API void rpc__listen(const char *host, uint32_t port, uint32_t threads, socket__addr_t *bound,
                         uint32_t *bound_len, uint32_t *status);

/* Stops the server: no further connection is accepted, connections that
 * wait for a request are closed, calls under way run to their end and send
 * their replies, then every thread of the server is joined. Nothing happens
 * without a server. A new rpc__listen may follow. */
NCS_API void rpc__stop_listening(void);

/* Counters of the server, all 0 without one. */
typedef struct rpc__server_stats_t {
    uint64_t accepted;     /* connections accepted since rpc__listen, refused ones included */
    uint32_t connections;  /* connections open now */
    uint32_t calls;        /* calls running now */
} rpc__server_stats_t;

NCS_API void rpc__inq_server_stats(rpc__server_stats_t *stats);

#ifdef __cplusplus
}
#endif
#endif

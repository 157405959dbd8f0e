/* The RPC server of a process: listens on one TCP address, reads requests
 * on a few I/O threads and runs the calls of the registered interfaces
 * (rpc__register_mgr) on a pool of worker threads. The managers run on the
 * workers; a manager that blocks holds its worker only. A call that finds
 * every worker busy is answered at once through the interface's busy
 * managers (rpc__register_busy_mgr), or else with the fault
 * rpc__s_server_busy.
 *
 * A process has at most one server. Limits, from the environment at
 * rpc__listen, each defending against what a peer could otherwise hold:
 * "NCS_MAX_CONNECTIONS" connections at once (default 256) and
 * "NCS_MAX_CONNECTIONS_PER_PEER" from one peer address (default 64): the
 * newest connection beyond either is answered rpc__s_server_busy and
 * closed. "NCS_IDLE_TIMEOUT_S" seconds (default 300) that a connection may
 * wait without a request or with an unread reply. "NCS_FRAME_TIMEOUT_S"
 * seconds (default 30) for a frame to arrive in full once its first byte
 * came. "NCS_MAX_PENDING_BODY_MB" MiB (default 64) of request bodies still
 * arriving, all connections together: a body's room is taken when its first
 * byte arrives and its bytes are counted as they come, and a body that
 * would pass the cap is answered rpc__s_server_busy. A request above
 * RPC_MAX_BODY is answered rpc__s_too_big before anything is allocated for
 * it. A malformed frame closes its connection; so does every fault the
 * server sends. An accept that fails (out of descriptors) is tried again
 * after 100 ms.
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
 * workers, the calls it runs at once (0: 4; at most 64), and up to two I/O
 * threads. On success `*bound` and `*bound_len`,
 * when not null, hold the address listened on with its port. Statuses:
 * rpc__s_unknown_host, rpc__s_cant_listen (the address is taken, or the
 * process already has a server); `bound` is unchanged on failure. */
NCS_API void rpc__listen(const char *host, uint32_t port, uint32_t threads, socket__addr_t *bound,
                         uint32_t *bound_len, uint32_t *status);

/* Turns TLS on for the server's connections: `cert` (a PEM chain), `key`
 * and `ca` (the CA whose certificates clients must present). Called before
 * rpc__listen, and again to reload the files: connections accepted from
 * then on use the new ones, those already open keep theirs. All three null
 * turns TLS off. Statuses: rpc__s_tls_key_exposed (the key file is readable
 * by others), rpc__s_tls_settings (a file is missing or unusable, or not all
 * three are given); the TLS in force is unchanged then. With TLS on, a plain
 * client is answered rpc__s_tls_required and closed. */
NCS_API void rpc__tls_server(const char *cert, const char *key, const char *ca, uint32_t *status);

/* Stops the server: no further connection is accepted, connections that
 * wait for a request are closed, calls under way run to their end and send
 * their replies, then every thread of the server is joined. A call whose
 * manager blocks keeps this waiting: a host that must end anyway ends its
 * process, which closes that call's connection without a reply. Nothing happens
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

/* Location broker: maps object, type and interface UUIDs to the socket
 * addresses of servers. Each host runs one broker at the broker port,
 * "NCS_LB_PORT" (default 135), embedded in a host process or as the program
 * dpx-lbd. */
#ifndef NCS_LB_H
#define NCS_LB_H

#include "ncs/ncs.h"

#ifdef __cplusplus
extern "C" {
#endif

#define LB_ANNOTATION_LEN 64

typedef struct lb__entry_t {
    uuid__t object;
    uuid__t obj_type;
    uuid__t obj_interface;
    uint32_t flags;
    char annotation[LB_ANNOTATION_LEN];
    uint32_t saddr_len;
    socket__addr_t saddr;
} lb__entry_t;

/* Position of a walk through the broker's entries: 0 (or any negative
 * value) at the start. */
typedef int32_t lb__lookup_handle_t;

/* Returns up to `max_results` further entries that match `object`, `type`
 * and `interface` (a nil UUID matches any) from the broker of the host at
 * `location` (its port is ignored: the broker port is used; a `location_len`
 * of 0 or an address of the in-process family: this host). Entries come
 * newest registration first, of any address family; the caller skips those
 * it can't use. `entry` is the walk's position, passed on from call to call;
 * -1 asks from the start. A reply holds at most 32 entries; the walk goes on
 * from the position. With no further entry `*num_results` is 0, the status
 * lb__s_not_registered and the position unchanged, so a walk at its end
 * stays there. An unreachable broker gives lb__s_broker_unreachable (a few
 * seconds at most), a malformed reply rpc__s_protocol_error, null pointers
 * or `max_results` 0 lb__s_bad_argument; `*num_results` is 0 and `*entry`
 * unchanged then. `annotation` is not used for matching. */
NCS_API void lb__lookup_range(const uuid__t *object, const uuid__t *type, const uuid__t *interface,
                              const char *annotation, const socket__addr_t *location, uint32_t location_len,
                              lb__lookup_handle_t *entry, uint32_t max_results, uint32_t *num_results,
                              lb__entry_t results[], uint32_t *status);

/* Registers `entry` with the broker of this host: the broker running in this
 * process, else the one at 127.0.0.1 and the broker port. An entry with the
 * same object, type, interface and address is replaced, and the entry becomes
 * the newest; registered again by the process that holds it, it is renewed
 * in place and keeps its position. An entry registered over the network lives as long as this
 * process's connection to the broker, so the entries of a process that ends
 * go with it; a process made by fork has a connection of its own. Statuses:
 * lb__s_broker_unreachable, lb__s_database_full (the broker holds 1024
 * entries at most), lb__s_bad_argument (null, or `saddr_len` above 104).
 * A broker takes registrations and removals only from its own host (a
 * connection from a loopback address or one of the host's interfaces) and
 * answers any other with lb__s_not_permitted; lookups are open to all.
 * lb__unregister removes the entry with the same object, type, interface
 * and address (lb__s_not_registered when there is none). */
NCS_API void lb__register(const lb__entry_t *entry, uint32_t *status);
NCS_API void lb__unregister(const lb__entry_t *entry, uint32_t *status);

/* Runs the broker inside this process, on a thread of its own, listening on
 * `host` (a name or literal; null: 127.0.0.1; "::" takes IPv4 too) at the
 * broker port (0 picks a free one, see lb__inq_broker), until
 * lb__stop_broker. rpc__s_unknown_host for a host that can't be resolved,
 * rpc__s_cant_listen when the address is taken or a broker already runs in
 * this process. */
NCS_API void lb__start_broker(const char *host, uint32_t *status);
/* Stops the broker of this process, closing all its connections, and waits
 * for its thread. Nothing happens when none runs. */
NCS_API void lb__stop_broker(void);
/* The address, with its port, at which the broker of this process listens;
 * lb__s_broker_unreachable when none runs. `addr_len` as for
 * socket__from_name. */
NCS_API void lb__inq_broker(socket__addr_t *addr, uint32_t *addr_len, uint32_t *status);

/* The broker port in force: "NCS_LB_PORT" (read at every call; a value that
 * isn't a number 0..65535 counts as unset) or 135. */
NCS_API uint16_t lb__broker_port(void);

#ifdef __cplusplus
}
#endif
#endif

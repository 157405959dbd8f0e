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

/* Position of a walk through the broker's entries: 0 at the start. */
typedef int32_t lb__lookup_handle_t;

/* Returns up to `max_results` further entries that match `object`, `type`
 * and `interface` (a nil UUID matches any) from the broker of the host at
 * `location` (its port is ignored: the broker port is used). `entry` is the
 * walk's position, passed on from call to call; -1 asks the local host's
 * broker from its start. With no further entry `*num_results` is 0 and the
 * status lb__s_not_registered; an unreachable broker gives
 * lb__s_broker_unreachable. `annotation` is not used for matching. */
NCS_API void lb__lookup_range(const uuid__t *object, const uuid__t *type, const uuid__t *interface,
                              const char *annotation, const socket__addr_t *location, uint32_t location_len,
                              lb__lookup_handle_t *entry, uint32_t max_results, uint32_t *num_results,
                              lb__entry_t results[], uint32_t *status);

/* Registers `entry` with the broker of this host (replacing an entry with
 * the same object, type, interface and address), and removes it again. */
NCS_API void lb__register(const lb__entry_t *entry, uint32_t *status);
NCS_API void lb__unregister(const lb__entry_t *entry, uint32_t *status);

/* Runs the broker inside this process, listening on `host` (null:
 * 127.0.0.1) at the broker port, until lb__stop_broker. */
NCS_API void lb__start_broker(const char *host, uint32_t *status);
NCS_API void lb__stop_broker(void);

/* The broker port in force: "NCS_LB_PORT" or 135. */
NCS_API uint16_t lb__broker_port(void);

#ifdef __cplusplus
}
#endif
#endif

// Inside the library: the client's retry wrappers and transfer loops.
#ifndef DPX_DPXCLIENT_H
#define DPX_DPXCLIENT_H

#include "dpx/dpx.h"

extern "C" {

// Retry settings: tries of one call while the peer answers DPX_E_BUSY, and
// the first sleep in seconds, doubling after each busy answer. Hold 6 and 3
// from the load of the library; dpx_agent_init reads them from the
// environment. Written once at start, read without a lock.
extern int32_t MAX_DPX_RETRY;
extern int32_t MIN_DPX_RETRY_INTERVAL;

// Invalidates the cached hub binding unless `*status` is DPX_OK, DPX_E_BUSY
// or DPX_E_QUIET.
void check_status(dpx_status *status);

// The four wrappers: one call of the operation through the client stubs,
// repeated while the peer is busy, exceptions turned into DPX_E_RPC_FAILED.
// They never raise; the result is in `status`.
void get_chunks(handle_t handle, dpx_file_desc *desc, uint32_t *peer_crc, uint8_t *state, uint32_t *index,
                int16_t *last, int16_t max, dpx_status *status, dpx_chunk *buffer);
void put_chunks(handle_t handle, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last, int16_t max,
                dpx_status *status, dpx_chunk *buffer);
void agent_query(handle_t handle, dpx_query_text query, dpx_file_desc desc, uint32_t *result, dpx_status *status);
void list_nodes(handle_t handle, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                dpx_node_name *nodes);

// The request for dpx_alloc_xfer_buff that a file of `size` gets: the whole
// file's chunks, plus one for a remainder, as a signed 16-bit value; -2 from
// 0xFFFF chunks on.
int16_t buffer_request(const dpx_file_size *size);

// The transfer loops: the whole file between `file` (open; left open) and
// `path` of `node` in the depot behind the hub.
dpx_status download_file(const char *node, const char *path, cx_os_file_t *file);
dpx_status upload_file(const char *node, const char *path, cx_os_file_t *file, const dpx_file_size *size);

}

#endif

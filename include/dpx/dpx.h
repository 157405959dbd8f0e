/* libdpx: whole files between the processes of the management system, over
 * the RPC interface dpx_transfer version 1, in chunks of 4096 bytes.
 *
 * This header declares everything the library exports. All records have
 * exact widths and offsets, pinned below; integers are in the host's byte
 * order. Unless a comment says otherwise every function is callable from any
 * thread, and returns its result as a dpx_status: DPX_OK or a DPX_E_ code. */
#ifndef DPX_DPX_H
#define DPX_DPX_H

#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <sys/stat.h>

#include "ncs/ncs.h"
#include "plt/plt1.h"

#ifdef __cplusplus
extern "C" {
#endif

#define DPX_API __attribute__((visibility("default")))

/* ======================================================================
 * Transfer records and status codes
 * ====================================================================== */

#define DPX_CHUNK_SIZE 4096

/* One unsigned 32-bit word: 0 is success, anything else a failure. A status
 * of the RPC runtime (0x1C01xxxx) may stand in it too. */
typedef uint32_t dpx_status;

#define DPX_OK               0x00000000u
#define DPX_E_INVALID_PARAM  0xF11E0001u
#define DPX_E_PATH_TOO_LONG  0xF11E0003u
#define DPX_E_FILE_READ      0xF11E0004u
#define DPX_E_FILE_WRITE     0xF11E0005u
#define DPX_E_FILE_SEEK      0xF11E0006u
#define DPX_E_FILE_CHANGED   0xF11E0007u
#define DPX_E_CHECKSUM       0xF11E0008u
#define DPX_E_NO_DEPOT       0xF11E000Au
#define DPX_E_NO_MEMORY      0xF11E000Bu
#define DPX_E_QUIET          0xF11E0011u
#define DPX_E_RPC_FAILED     0xF11E0013u
#define DPX_E_BUSY           0xF11E0014u
#define DPX_E_NO_HUB_HOST    0xF11E0015u

/* Transfer state, one unsigned byte. */
#define DPX_STATE_FIRST  0
#define DPX_STATE_MORE   1
#define DPX_STATE_DONE   2
#define DPX_STATE_FAILED 9

/* One record of a transfer buffer: 4104 bytes. */
typedef struct dpx_chunk {
    uint32_t index;                    /* chunk index in the file */
    uint32_t length;                   /* meaningful bytes of data, 0..4096 */
    unsigned char data[DPX_CHUNK_SIZE];
} dpx_chunk;

/* A file's length: length / 4096 (low 32 bits) and length % 4096. */
typedef struct dpx_file_size {
    uint32_t chunks;
    uint32_t remainder;
} dpx_file_size;

/* A file's modification time in seconds; `high` is always 0. */
typedef struct dpx_file_time {
    uint32_t low;
    uint32_t high;
} dpx_file_time;

#define DPX_NODE_LEN   33
#define DPX_PATH_LEN   4096
#define DPX_QUERY_LEN  1024
#define DPX_FILTER_LEN 16

/* Names the file of a transfer and carries its identity: 4152 bytes. */
typedef struct dpx_file_desc {
    char node[DPX_NODE_LEN];           /* bounded copy, NUL-filled */
    char path[DPX_PATH_LEN];           /* relative to the product's directory */
    dpx_file_size size;                /* identity, taken by the first read call */
    dpx_file_time mtime;
    unsigned char reserved;
} dpx_file_desc;

typedef char dpx_query_text[DPX_QUERY_LEN];
typedef char dpx_node_filter[DPX_FILTER_LEN];
typedef char dpx_node_name[DPX_NODE_LEN];
/* dpx_node_list: an open array of dpx_node_name, counted by highest index. */

/* ======================================================================
 * Portable file services
 * ====================================================================== */

/* Result of every cx_ operation: category '-' and code 0 on success;
 * category 'p' and an errno value on failure. */
typedef struct cx_status {
    char category;
    int32_t code;
} cx_status;

#define CX_CATEGORY_OK    '-'
#define CX_CATEGORY_POSIX 'p'

/* A path held for directory work. Valid while length >= 0. */
#define CX_DIR_PATH_SIZE 256
typedef struct cx_dir_t {
    char path[CX_DIR_PATH_SIZE];
    int32_t length;
    int32_t last_sep;
} cx_dir_t;

/* A file's status record. */
#if defined(__USE_LARGEFILE64)
typedef struct stat64 cx_file_info_t;
#else
typedef struct stat cx_file_info_t;
#endif

/* Handle of an open file, owned by the caller. */
typedef struct cx_os_file_t {
    FILE *stream;
} cx_os_file_t;

/* Open modes: exact values, not flags. */
#define CX_FILE_READ   0x01
#define CX_FILE_WRITE  0x10
#define CX_FILE_APPEND 0x11

/* The debugging log "/dpx-debug.log": ENTER, LEAVE and "... " lines with a
 * process-wide indentation. Each call opens, writes and closes the log; where
 * it can't be opened the call does nothing. */
DPX_API void cxIntlTraceEnter(const char *format, ...) __attribute__((format(printf, 1, 2)));
DPX_API void cxIntlTraceLeave(const char *format, ...) __attribute__((format(printf, 1, 2)));
DPX_API void cxIntlTracePoint(const char *format, ...) __attribute__((format(printf, 1, 2)));

DPX_API cx_status cx_dir_init(cx_dir_t *dir, const char *path);
DPX_API cx_status cx_dir_exists(const cx_dir_t *dir);
DPX_API cx_status cx_dir_mkdirs(const cx_dir_t *dir, uint32_t mode);
DPX_API cx_status cx_dir_parent(const cx_dir_t *dir, cx_dir_t *parent);

DPX_API cx_status cx_named_file_info(const char *path, cx_file_info_t *info);
DPX_API cx_status cx_file_info_size(const cx_file_info_t *info, uint64_t *size);
DPX_API cx_status cx_file_info_last_mod(const cx_file_info_t *info, int32_t *time);

DPX_API cx_status cx_open_file(const char *path, cx_os_file_t *file, int32_t mode);
DPX_API cx_status cx_file_set_pos(cx_os_file_t *file, const uint64_t *position);
DPX_API cx_status cx_file_read_bytes(cx_os_file_t *file, size_t count, size_t *done, void *buffer);
DPX_API cx_status cx_file_write_bytes(cx_os_file_t *file, size_t count, size_t *done, const void *buffer);
DPX_API cx_status cx_close_file(cx_os_file_t *file);

/* `*name` is malloc'ed: the caller frees it, after a failed call too. */
DPX_API cx_status cx_temp_file(const char *directory, char **name, cx_os_file_t *file);
DPX_API cx_status cx_delete_file(const char *path);
DPX_API cx_status cx_move_file(const char *source, const char *destination);
DPX_API cx_status cx_copy_file(const char *source, const char *destination);

/* ======================================================================
 * Transfer core
 * ====================================================================== */

/* A buffer of n records, n = requested clamped to 24..128; `*max` = n - 1.
 * Null and `*max` 0 when memory is short. Free with dpx_free_xfer_buff. */
DPX_API dpx_chunk *dpx_alloc_xfer_buff(int16_t requested, int16_t *max);
DPX_API void dpx_free_xfer_buff(dpx_chunk *buffer);
/* Runs zlib's crc32 on from `*crc` over `length` bytes of data of the
 * records 0 .. count - 1. */
DPX_API void dpx_checksum_xfer_buff(const dpx_chunk *buffer, int16_t count, uint32_t *crc);

/* Fills records from `file` at chunk `*index`, up to max + 1 of them; sets
 * `*last`, `*finished` (1 at the end of the file) and `*index` (the chunk
 * after the last one read). Out-arguments are left alone on failure. */
DPX_API dpx_status dpx_read_xfer_buff(cx_os_file_t *file, uint32_t *index, dpx_chunk *buffer, int16_t *last,
                                      int16_t max, uint8_t *finished);
/* Writes `length` bytes of each record 0 .. last at the file's position. */
DPX_API dpx_status dpx_write_xfer_buff(cx_os_file_t *file, const dpx_chunk *buffer, int16_t last);

DPX_API dpx_status dpx_get_os_file_stats(const char *path, dpx_file_size *size, dpx_file_time *time);
DPX_API dpx_status dpx_init_file_stats(dpx_file_desc *desc, const dpx_file_size *size, const dpx_file_time *time);
DPX_API dpx_status dpx_check_file_stats(const dpx_file_desc *desc, const dpx_file_size *size,
                                        const dpx_file_time *time);

/* The depot root ("DPX_DEPOTROOT", else "VESPERHOME" + "/dpxdepot") and the
 * product name (agent framework), cached on first success; null while
 * unknown. Owned by the library. */
DPX_API const char *dpx_get_depotroot(void);
DPX_API const char *dpx_get_product(void);
/* Cleans a relative path: '/' and '\\' separate, "." and ".." are resolved
 * without climbing above the start, no leading separator. `clean` has room
 * for strlen(rel) + 1. */
DPX_API dpx_status dpx_cleanup_rel_path(const char *rel, char *clean);
/* root "/" product "/" cleaned rel, into `full` of `full_size` bytes. */
DPX_API dpx_status dpx_get_full_path(const char *rel, char *full, size_t full_size);

/* ======================================================================
 * RPC interface dpx_transfer version 1
 * ====================================================================== */

#define DPX_RPC_STACK_PACKET        1024
#define DPX_RPC_FRAME_SET           0x03040003u
#define DPX_RPC_COMM_MODULE         0x1C010000u
#define DPX_RPC_FAULT_INVALID_BOUND 0x1C000007u

typedef void (*dpx_get_chunks_fn)(handle_t handle, dpx_file_desc *desc, uint32_t *crc, uint8_t *state,
                                  uint32_t *index, int16_t *last, int16_t max, dpx_status *status,
                                  dpx_chunk buffer[]);
typedef void (*dpx_put_chunks_fn)(handle_t handle, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last,
                                  int16_t max, dpx_status *status, dpx_chunk buffer[]);
typedef void (*dpx_agent_query_fn)(handle_t handle, dpx_query_text query, dpx_file_desc desc, uint32_t *result,
                                   dpx_status *status);
typedef void (*dpx_list_nodes_fn)(handle_t handle, dpx_node_filter filter, int16_t *last, int16_t max,
                                  dpx_status *status, dpx_node_name nodes[]);

/* Four operations in slot order; the client stubs and the managers share it. */
typedef struct dpx_transfer_v1_epv_t {
    dpx_get_chunks_fn dpx_get_chunks;
    dpx_put_chunks_fn dpx_put_chunks;
    dpx_agent_query_fn dpx_agent_query;
    dpx_list_nodes_fn dpx_list_nodes;
} dpx_transfer_v1_epv_t;

DPX_API extern const rpc__if_spec_t dpx_transfer_v1_if_spec;
DPX_API extern const dpx_transfer_v1_epv_t dpx_transfer_v1_client_epv;
DPX_API const dpx_transfer_v1_epv_t *dpx_transfer_v1_client_epv_locator(void);
/* The server stubs, indexed by operation number. */
DPX_API extern const rpc__server_stub_t *const dpx_transfer_v1_server_epv;
DPX_API const rpc__server_stub_t *dpx_transfer_v1_server_epv_locator(void);
DPX_API extern const dpx_transfer_v1_epv_t dpx_transfer_v1_manager_epv;

/* The managers: the service's side of the four operations. */
DPX_API void dpx_get_chunks(handle_t handle, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index,
                            int16_t *last, int16_t max, dpx_status *status, dpx_chunk buffer[]);
DPX_API void dpx_put_chunks(handle_t handle, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last,
                            int16_t max, dpx_status *status, dpx_chunk buffer[]);
DPX_API void dpx_agent_query(handle_t handle, dpx_query_text query, dpx_file_desc desc, uint32_t *result,
                             dpx_status *status);
DPX_API void dpx_list_nodes(handle_t handle, dpx_node_filter filter, int16_t *last, int16_t max,
                            dpx_status *status, dpx_node_name nodes[]);

/* ======================================================================
 * Agent start and stop
 * ====================================================================== */

/* Sets up the locks, registers the interface with this process's RPC
 * server, reads "DPX_MAX_RETRY" and "DPX_MIN_RETRY_INTERVAL". Always 0. */
DPX_API uint32_t dpx_agent_init(void);
/* Unregisters, releases the cached binding, ends the locks. Always 0.
 * REQUIRES: no client operation under way. */
DPX_API uint32_t dpx_agent_stop(void);
DPX_API uint32_t dpx_register_rpc_mgr(void);
DPX_API uint32_t dpx_rpc_unregister(void);

/* ======================================================================
 * Hub binding
 *
 * HUB_LOCK and BIND_LOCK are never held together and never during a call of
 * the interface: HUB_LOCK guards HUB and the test whether the cached binding
 * is good; BIND_LOCK guards BINDING_HANDLE and BINDING_HANDLE_INVALID and
 * makes a lookup and a duplication exclusive.
 * ====================================================================== */

#define DPX_HUB_LEN 100

/* The interface UUID under which a hub stands in its host's location broker. */
#define DPX_HUB_LB_UUID "684152a852f9.02.c6.d2.2d.fd.00.00.00"

DPX_API extern handle_t BINDING_HANDLE;
DPX_API extern unsigned char BINDING_HANDLE_INVALID;
DPX_API extern char HUB[DPX_HUB_LEN];
DPX_API extern PLT1_LOCK HUB_LOCK;
DPX_API extern PLT1_LOCK BIND_LOCK;

/* A duplicate of the cached binding to the hub in `*handle` (preset to null
 * by the caller), binding first when needed. The caller frees it with
 * free_rpc_handle. */
DPX_API void get_hub_handle(handle_t *handle, dpx_status *status);
/* Walks the broker at `addr` for the hub and binds or re-points `*binding`.
 * REQUIRES: BIND_LOCK held. */
DPX_API void lookup_handle(handle_t *binding, socket__addr_t *addr, uint32_t addr_len, dpx_status *status);
DPX_API void release_hub_handle(void);
DPX_API void invalidate_hub_handle(void);
DPX_API void free_rpc_handle(handle_t handle);

/* ======================================================================
 * Client operations
 * ====================================================================== */

/* Fetches the file `path` of `node` from the depot into `target`, through a
 * temporary file that replaces `target` only when the whole file arrived. */
DPX_API dpx_status GetFile(const char *node, const char *path, const char *target);
/* Appends the local file `source` to `path` of `node` in the depot. */
DPX_API dpx_status PutFile(const char *node, const char *path, const char *source);
/* Sends `query` with `path` to `node` (null: this process's node). */
DPX_API dpx_status Query(const char *node, const char *query, const char *path, uint32_t *result);
/* Asks the hub for node names matching `filter`; `nodes` has max + 1
 * entries; `*last` is the highest in use, -1 for none. */
DPX_API dpx_status ListNodes(const char *filter, int16_t *last, int16_t max, dpx_node_name nodes[]);
DPX_API const char *GetProduct(void);
DPX_API const char *GetRootDepot(void);

#ifdef __cplusplus
}  /* extern "C" */

static_assert(sizeof(dpx_status) == 4, "dpx_status is 4 bytes");
static_assert(sizeof(dpx_chunk) == 4104, "dpx_chunk is 4104 bytes");
static_assert(offsetof(dpx_chunk, index) == 0 && offsetof(dpx_chunk, length) == 4 && offsetof(dpx_chunk, data) == 8,
              "dpx_chunk layout");
static_assert(sizeof(dpx_file_size) == 8 && offsetof(dpx_file_size, remainder) == 4, "dpx_file_size layout");
static_assert(sizeof(dpx_file_time) == 8 && offsetof(dpx_file_time, high) == 4, "dpx_file_time layout");
static_assert(sizeof(dpx_file_desc) == 4152, "dpx_file_desc is 4152 bytes");
static_assert(offsetof(dpx_file_desc, node) == 0, "dpx_file_desc.node");
static_assert(offsetof(dpx_file_desc, path) == 33, "dpx_file_desc.path");
static_assert(offsetof(dpx_file_desc, size) == 4132, "dpx_file_desc.size");
static_assert(offsetof(dpx_file_desc, mtime) == 4140, "dpx_file_desc.mtime");
static_assert(offsetof(dpx_file_desc, reserved) == 4148, "dpx_file_desc.reserved");
static_assert(sizeof(dpx_query_text) == 1024 && sizeof(dpx_node_filter) == 16 && sizeof(dpx_node_name) == 33,
              "fixed texts");
static_assert(sizeof(cx_dir_t) == 264 && offsetof(cx_dir_t, length) == 256 && offsetof(cx_dir_t, last_sep) == 260,
              "cx_dir_t layout");
static_assert(sizeof(rpc__if_spec_t) == 88 && offsetof(rpc__if_spec_t, opcnt) == 68 &&
                  offsetof(rpc__if_spec_t, id) == 72,
              "rpc__if_spec_t layout");
static_assert(sizeof(uuid__t) == 16 && offsetof(uuid__t, family) == 8, "uuid__t layout");
static_assert(sizeof(socket__addr_t) == 104, "socket__addr_t is 104 bytes");
#endif

/* Java natives of com.orvane.quill.flowgauge.core.ft.client.FileTransferClient,
 * declared where jni.h has been included first. */
#ifdef JNI_VERSION_1_2
#ifdef __cplusplus
extern "C" {
#endif
DPX_API jint JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getFile(
    JNIEnv *env, jobject self, jstring node, jstring path, jstring target);
DPX_API jint JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_putFile(
    JNIEnv *env, jobject self, jstring node, jstring path, jstring source);
DPX_API jint JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_query(
    JNIEnv *env, jobject self, jstring node, jstring query, jstring path);
DPX_API jobjectArray JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_listNodes(
    JNIEnv *env, jobject self, jstring filter);
DPX_API jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getRootDepot(
    JNIEnv *env, jobject self);
DPX_API jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getAgentID(
    JNIEnv *env, jobject self);
DPX_API jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getOriginNode(
    JNIEnv *env, jobject self);
DPX_API jstring JNICALL Java_com_orvane_quill_flowgauge_core_ft_client_FileTransferClient_getRPCErrText(
    JNIEnv *env, jobject self, jint status);
#ifdef __cplusplus
}
#endif
#endif

#endif

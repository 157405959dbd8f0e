// The client: calls with retry, the transfer loops, and the operations that
// callers use.
#include "dpxclient.h"

#include "afw/afw.h"
#include "exc/exc1.h"
#include "plt/plt1.h"
#include "trc/trc1.h"

#include <cstdlib>
#include <cstring>
#include <new>

TRC1_DEFINE_UNIT("dpxclient");

int32_t MAX_DPX_RETRY = 6;
int32_t MIN_DPX_RETRY_INTERVAL = 3;

namespace {

constexpr int16_t kFirstBufferRecords = 24;

// One run of a wrapper: `call` makes one try through the client stubs. The
// try is repeated while the peer answers DPX_E_BUSY, within the retry
// settings; the sleep after a busy answer comes before the test of the tries
// left, so the last busy answer is followed by one more sleep. A raise that
// passes out of the stub becomes DPX_E_RPC_FAILED, traced with `failure`.
template <class Call>
void call_with_retry(const trc::Scope &scope, const char *failure, dpx_status *status, Call &&call)
{
    int32_t interval = MIN_DPX_RETRY_INTERVAL;
    // Wider than the setting: a setting of INT32_MIN can't wrap when lowered.
    int64_t tries_left = MAX_DPX_RETRY;
    EXC1_FRAME frame;
    uint32_t outcome;
    try {
        outcome = exc::guard(&frame, __FILE__, __LINE__, [&] {
            do {
                call();
                if (*status == DPX_E_BUSY) {
                    if (interval > 0) {
                        PLT1_Sleep(static_cast<uint32_t>(interval));
                        interval = static_cast<int32_t>(static_cast<uint32_t>(interval) * 2u);
                    }
                    --tries_left;
                }
            } while (*status == DPX_E_BUSY && tries_left > 0);
        });
    } catch (const std::bad_alloc &) {
        outcome = rpc__s_no_memory;
    } catch (...) {
        outcome = rpc__s_fault_unspec;
    }
    if (outcome != EXC1_FRAME_SET) {
        *status = DPX_E_RPC_FAILED;
        if (scope.on(TRC1_ERROR))
            TRC1_Printf(scope.desc(), __LINE__, failure, outcome);
        invalidate_hub_handle();
    }
    check_status(status);
}

// Copies `text` into a fixed field of `width` characters, NUL-filled behind
// it; a text of `width` characters or more keeps no terminator.
void bounded_copy(char *field, const char *text, size_t width)
{
    size_t length = strnlen(text, width);
    std::memcpy(field, text, length);
    std::memset(field + length, 0, width - length);
}

// The start of both transfer loops: the arguments are there, `*handle` is a
// duplicate of the hub's binding, and `*desc` names the file with its other
// fields cleared, since they travel without meaning. Traces with the
// caller's descriptor; anything but DPX_OK is the loop's result, with no
// handle to free.
dpx_status start_transfer(const trc::Scope &scope, bool arguments_given, const char *node, const char *path,
                          handle_t *handle, dpx_file_desc *desc)
{
    if (!arguments_given) {
        if (scope.on(TRC1_ERROR))
            TRC1_Printf(scope.desc(), __LINE__, "invalid parameters");
        return DPX_E_INVALID_PARAM;
    }
    dpx_status status = DPX_OK;
    get_hub_handle(handle, &status);
    if (status != DPX_OK) {
        if (scope.on(TRC1_FLOW))
            TRC1_Printf(scope.desc(), __LINE__, "get_hub_handle call failed rc [0x%x]", status);
        return status;
    }
    std::memset(desc, 0, sizeof *desc);
    bounded_copy(desc->node, node, sizeof desc->node);
    bounded_copy(desc->path, path, sizeof desc->path);
    return DPX_OK;
}

// Steps 5 to 7 of a download, on the present buffer: one call, the checksum
// of what arrived against the service's, and the write to the local file.
// Traces with the loop's `scope`.
void fetch_buffer(const trc::Scope &scope, handle_t handle, dpx_file_desc *desc, uint32_t *peer_crc,
                  uint32_t *local_crc, uint8_t *state, uint32_t *index, int16_t *last, int16_t max,
                  dpx_status *status, dpx_chunk *buffer, cx_os_file_t *file)
{
    uint32_t index_before = *index;
    get_chunks(handle, desc, peer_crc, state, index, last, max, status, buffer);
    // A service that says more follows but delivered nothing would keep the
    // loop going for ever. The loop finds this itself, as it finds a damaged
    // buffer, so the binding stays.
    if (*status == DPX_OK && *state == DPX_STATE_MORE && (*last < 0 || *index <= index_before)) {
        *status = DPX_E_RPC_FAILED;
        if (scope.on(TRC1_ERROR))
            TRC1_Printf(scope.desc(), __LINE__, "more follows, says the service, but index %u didn't move",
                        index_before);
        return;
    }
    if (*status == DPX_OK) {
        dpx_checksum_xfer_buff(buffer, *last, local_crc);
        if (*local_crc != *peer_crc)
            *status = DPX_E_CHECKSUM;
    }
    if (*status == DPX_OK)
        *status = dpx_write_xfer_buff(file, buffer, *last);
}

}  // namespace

extern "C" {

void check_status(dpx_status *status)
{
    TRC1_FUNCTION();
    if (*status != DPX_OK && *status != DPX_E_BUSY && *status != DPX_E_QUIET)
        invalidate_hub_handle();
}

void get_chunks(handle_t handle, dpx_file_desc *desc, uint32_t *peer_crc, uint8_t *state, uint32_t *index,
                int16_t *last, int16_t max, dpx_status *status, dpx_chunk *buffer)
{
    TRC1_FUNCTION();
    call_with_retry(trc1_scope_, "rpc call dpx_get_chunks failed with status 0x%x.", status, [&] {
        dpx_transfer_v1_client_epv.dpx_get_chunks(handle, desc, peer_crc, state, index, last, max, status,
                                                  buffer);
    });
}

void put_chunks(handle_t handle, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last, int16_t max,
                dpx_status *status, dpx_chunk *buffer)
{
    TRC1_FUNCTION();
    call_with_retry(trc1_scope_, "rpc call dpx_put_chunks failed with status 0x%x.", status, [&] {
        dpx_file_desc desc_copy = desc;
        dpx_transfer_v1_client_epv.dpx_put_chunks(handle, desc_copy, crc, state, last, max, status, buffer);
    });
}

void agent_query(handle_t handle, dpx_query_text query, dpx_file_desc desc, uint32_t *result, dpx_status *status)
{
    TRC1_FUNCTION();
    call_with_retry(trc1_scope_, "rpc call dpx_agent_query failed with status 0x%x.", status, [&] {
        dpx_query_text query_copy;
        std::memcpy(query_copy, query, sizeof query_copy);
        dpx_file_desc desc_copy = desc;
        dpx_transfer_v1_client_epv.dpx_agent_query(handle, query_copy, desc_copy, result, status);
    });
}

void list_nodes(handle_t handle, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                dpx_node_name *nodes)
{
    TRC1_FUNCTION();
    call_with_retry(trc1_scope_, "rpc call list_nodes failed with status 0x%x.", status, [&] {
        dpx_node_filter filter_copy;
        std::memcpy(filter_copy, filter, sizeof filter_copy);
        dpx_transfer_v1_client_epv.dpx_list_nodes(handle, filter_copy, last, max, status, nodes);
    });
}

int16_t buffer_request(const dpx_file_size *size)
{
    if (size->chunks >= 0xFFFF)
        return -2;
    uint16_t request = static_cast<uint16_t>(size->chunks & 0xFFFF);
    if (size->remainder > 0)
        request = static_cast<uint16_t>(request + 1);
    return static_cast<int16_t>(request);
}

dpx_status download_file(const char *node, const char *path, cx_os_file_t *file)
{
    TRC1_FUNCTION();
    handle_t handle = nullptr;
    dpx_file_desc desc;
    dpx_status status = start_transfer(trc1_scope_, node != nullptr && path != nullptr && file != nullptr, node,
                                       path, &handle, &desc);
    if (status != DPX_OK)
        return status;
    uint32_t peer_crc = 0;
    uint32_t local_crc = 0;
    uint8_t state = DPX_STATE_FIRST;
    uint32_t index = 0;
    int16_t last = -1;
    int16_t max = 0;

    dpx_chunk *buffer = dpx_alloc_xfer_buff(kFirstBufferRecords, &max);
    if (buffer == nullptr)
        status = DPX_E_NO_MEMORY;
    else
        fetch_buffer(trc1_scope_, handle, &desc, &peer_crc, &local_crc, &state, &index, &last, max, &status, buffer,
                     file);
    dpx_free_xfer_buff(buffer);

    if (status == DPX_OK && state == DPX_STATE_MORE) {
        // Sized from the whole file as the first reply told it; never smaller
        // than the first buffer, so the `last` it carries back still fits.
        buffer = dpx_alloc_xfer_buff(buffer_request(&desc.size), &max);
        if (buffer == nullptr)
            status = DPX_E_NO_MEMORY;
        while (buffer != nullptr && state == DPX_STATE_MORE && status == DPX_OK)
            fetch_buffer(trc1_scope_, handle, &desc, &peer_crc, &local_crc, &state, &index, &last, max, &status, buffer,
                     file);
        dpx_free_xfer_buff(buffer);
    }

    free_rpc_handle(handle);
    return status;
}

dpx_status upload_file(const char *node, const char *path, cx_os_file_t *file, const dpx_file_size *size)
{
    TRC1_FUNCTION();
    handle_t handle = nullptr;
    dpx_file_desc desc;
    dpx_status status = start_transfer(
        trc1_scope_, node != nullptr && path != nullptr && file != nullptr && size != nullptr, node, path, &handle,
        &desc);
    if (status != DPX_OK)
        return status;
    uint8_t finished = 0;
    uint32_t index = 0;
    int16_t last = -1;
    int16_t max = 0;

    int16_t request = size->chunks > static_cast<uint32_t>(kFirstBufferRecords) ? buffer_request(size)
                                                                                : kFirstBufferRecords;
    dpx_chunk *buffer = dpx_alloc_xfer_buff(request, &max);
    uint8_t state = DPX_STATE_MORE;
    if (buffer == nullptr)
        status = DPX_E_NO_MEMORY;
    while (buffer != nullptr && status == DPX_OK && finished == 0) {
        status = dpx_read_xfer_buff(file, &index, buffer, &last, max, &finished);
        if (status != DPX_OK)
            break;
        uint32_t crc = 0;
        dpx_checksum_xfer_buff(buffer, last, &crc);
        if (finished != 0)
            state = DPX_STATE_DONE;
        put_chunks(handle, desc, crc, state, &last, max, &status, buffer);
    }
    dpx_free_xfer_buff(buffer);
    free_rpc_handle(handle);
    return status;
}

dpx_status GetFile(const char *node, const char *path, const char *target)
{
    TRC1_FUNCTION();
    if (node == nullptr || path == nullptr || target == nullptr) {
        TRC1_ERROR_MSG("invalid parameters");
        return DPX_E_INVALID_PARAM;
    }
    dpx_status status = DPX_OK;
    char *temp_name = nullptr;
    cx_os_file_t file;
    cx_status cx = cx_temp_file(nullptr, &temp_name, &file);
    if (cx.category != CX_CATEGORY_OK) {
        TRC1_ERROR_MSG("Failed to open temporary file");
        status = DPX_E_FILE_WRITE;
    } else {
        status = download_file(node, path, &file);
        cx_close_file(&file);
        if (status == DPX_OK) {
            cx = cx_move_file(temp_name, target);
            if (cx.category != CX_CATEGORY_OK) {
                TRC1_ERROR_MSG("Error writing file %s", target);
                status = DPX_E_FILE_WRITE;
                cx_delete_file(temp_name);
            }
        } else {
            if (status != DPX_E_QUIET)
                TRC1_ERROR_MSG("GetFile failed with return code [0x%x]", status);
            cx_delete_file(temp_name);
        }
    }
    std::free(temp_name);
    return status;
}

dpx_status PutFile(const char *node, const char *path, const char *source)
{
    TRC1_FUNCTION();
    if (node == nullptr || path == nullptr || source == nullptr) {
        TRC1_ERROR_MSG("invalid parameters");
        return DPX_E_INVALID_PARAM;
    }
    dpx_file_size size;
    dpx_file_time mtime;
    dpx_status status = dpx_get_os_file_stats(source, &size, &mtime);
    if (status != DPX_OK) {
        TRC1_ERROR_MSG("Could not stat input_file");
        return status;
    }
    cx_os_file_t file;
    cx_status cx = cx_open_file(source, &file, CX_FILE_READ);
    if (cx.category != CX_CATEGORY_OK) {
        TRC1_ERROR_MSG("Could not read input_file");
        return DPX_E_FILE_READ;
    }
    status = upload_file(node, path, &file, &size);
    if (status != DPX_OK && status != DPX_E_QUIET)
        TRC1_ERROR_MSG("PutFile failed with return code [0x%x]", status);
    cx_close_file(&file);
    return status;
}

dpx_status Query(const char *node, const char *query, const char *path, uint32_t *result)
{
    TRC1_FUNCTION();
    if (query == nullptr || path == nullptr) {
        TRC1_ERROR_MSG("invalid parameters");
        return DPX_E_INVALID_PARAM;
    }
    dpx_status status = DPX_OK;
    handle_t handle = nullptr;
    get_hub_handle(&handle, &status);
    if (status != DPX_OK) {
        TRC1_FLOW_MSG("get_hub_handle call failed rc [0x%x]", status);
        return status;
    }
    if (node == nullptr)
        node = AFW_GetOriginnode();
    dpx_file_desc desc;
    std::memset(&desc, 0, sizeof desc);
    bounded_copy(desc.node, node != nullptr ? node : "", sizeof desc.node);
    bounded_copy(desc.path, path, sizeof desc.path);
    dpx_query_text text;
    bounded_copy(text, query, sizeof text);

    agent_query(handle, text, desc, result, &status);
    if (status != DPX_OK && status != DPX_E_QUIET)
        TRC1_ERROR_MSG("Query failed with return code [0x%x]", status);
    free_rpc_handle(handle);
    return status;
}

dpx_status ListNodes(const char *filter, int16_t *last, int16_t max, dpx_node_name nodes[])
{
    TRC1_FUNCTION();
    if (filter == nullptr || last == nullptr || nodes == nullptr) {
        TRC1_ERROR_MSG("invalid parameters");
        return DPX_E_INVALID_PARAM;
    }
    dpx_status status = DPX_OK;
    handle_t handle = nullptr;
    get_hub_handle(&handle, &status);
    if (status != DPX_OK) {
        TRC1_FLOW_MSG("get_hub_handle call failed rc [0x%x]", status);
        return status;
    }
    dpx_node_filter text;
    bounded_copy(text, filter, sizeof text);
    *last = -1;

    list_nodes(handle, text, last, max, &status, nodes);
    if (status != DPX_OK && status != DPX_E_QUIET)
        TRC1_ERROR_MSG("ListNodes failed with return code [0x%x]", status);
    free_rpc_handle(handle);
    return status;
}

const char *GetProduct(void)
{
    TRC1_FUNCTION();
    return dpx_get_product();
}

const char *GetRootDepot(void)
{
    TRC1_FUNCTION();
    return dpx_get_depotroot();
}

}  // extern "C"

// The service side: full paths in the depot, the managers of the interface,
// and the start and stop of the library in its host.
#include "dpxserver.h"

#include "dpxclient.h"

#include "plt/plt1.h"
#include "trc/trc1.h"

#include <algorithm>
#include <cstdio>
#include <cstring>

TRC1_DEFINE_UNIT("dpxserver");

namespace {

constexpr size_t kCleanPathSize = DPX_PATH_LEN;

}  // namespace

extern "C" {

dpx_status dpx_get_full_path(const char *rel, char *full, size_t full_size)
{
    TRC1_FUNCTION();
    const char *root = dpx_get_depotroot();
    const char *product = dpx_get_product();
    if (root == nullptr || product == nullptr)
        return DPX_E_NO_DEPOT;
    if (rel == nullptr || full == nullptr)
        return DPX_E_INVALID_PARAM;
    // The cleaned path is never longer than its input; an input that would
    // not fit the local buffer can't make a full path that fits `full` either.
    size_t rel_length = std::strlen(rel);
    if (rel_length >= kCleanPathSize)
        return DPX_E_PATH_TOO_LONG;
    char clean[kCleanPathSize] = {};
    dpx_status status = dpx_cleanup_rel_path(rel, clean);
    if (status != DPX_OK)
        return status;
    int n = std::snprintf(full, full_size, "%s%c%s%c%s", root, '/', product, '/', clean);
    if (n < 0 || static_cast<size_t>(n) >= full_size)
        return DPX_E_PATH_TOO_LONG;
    return DPX_OK;
}

dpx_status dpx_get_full_path_of_field(const char *field, size_t field_size, char *full, size_t full_size)
{
    TRC1_FUNCTION();
    if (dpx_get_depotroot() == nullptr || dpx_get_product() == nullptr)
        return DPX_E_NO_DEPOT;
    if (field == nullptr || std::memchr(field, '\0', field_size) == nullptr)
        return DPX_E_INVALID_PARAM;
    dpx_status status = dpx_get_full_path(field, full, full_size);
    return status == DPX_OK ? dpx_confine_full_path(full) : status;
}

}  // extern "C"

extern "C" {

void dpx_get_chunks(handle_t, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index, int16_t *last,
                    int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    TRC1_FUNCTION();
    // Without `status` there is no way to answer: nothing is touched.
    if (status == nullptr)
        return;
    if (desc == nullptr || crc == nullptr || state == nullptr || index == nullptr || last == nullptr ||
        buffer == nullptr) {
        *status = DPX_E_INVALID_PARAM;
        return;
    }
    char full[DPX_PATH_LEN];
    dpx_file_size size;
    dpx_file_time time;
    cx_os_file_t file;
    bool open = false;
    uint8_t finished = 0;

    *status = dpx_get_full_path_of_field(desc->path, sizeof desc->path, full, sizeof full);
    if (*status == DPX_OK)
        *status = dpx_get_os_file_stats(full, &size, &time);
    if (*status == DPX_OK) {
        if (*state == DPX_STATE_FIRST)
            *status = dpx_init_file_stats(desc, &size, &time);
        else
            *status = dpx_check_file_stats(desc, &size, &time);
    }
    if (*status == DPX_OK) {
        cx_status cx = cx_open_file(full, &file, CX_FILE_READ);
        if (cx.category != CX_CATEGORY_OK) {
            TRC1_ERROR_MSG("can't read '%s': %c%d\n", full, cx.category, cx.code);
            *status = DPX_E_FILE_READ;
        } else {
            open = true;
        }
    }
    if (*status == DPX_OK && *index != 0) {
        uint64_t position = static_cast<uint64_t>(*index) * DPX_CHUNK_SIZE;
        cx_status cx = cx_file_set_pos(&file, &position);
        if (cx.category != CX_CATEGORY_OK) {
            TRC1_ERROR_MSG("can't seek %ld: %c%d\n", static_cast<long>(*index), cx.category, cx.code);
            *status = DPX_E_FILE_SEEK;
        }
    }
    if (*status == DPX_OK)
        *status = dpx_read_xfer_buff(&file, index, buffer, last, max, &finished);
    if (open)
        cx_close_file(&file);
    if (*status == DPX_OK)
        dpx_checksum_xfer_buff(buffer, *last, crc);

    if (*status == DPX_OK) {
        *state = finished != 0 ? DPX_STATE_DONE : DPX_STATE_MORE;
    } else {
        *state = DPX_STATE_FAILED;
        *last = -1;
    }
}

void dpx_put_chunks(handle_t, dpx_file_desc desc, uint32_t crc, uint8_t, int16_t *last, int16_t, dpx_status *status,
                    dpx_chunk buffer[])
{
    TRC1_FUNCTION();
    if (status == nullptr)
        return;
    if (last == nullptr || buffer == nullptr) {
        *status = DPX_E_INVALID_PARAM;
        return;
    }
    char full[DPX_PATH_LEN];
    *status = dpx_get_full_path_of_field(desc.path, sizeof desc.path, full, sizeof full);
    if (*status != DPX_OK)
        return;

    // Opened before the checksum is compared: a bad buffer still leaves the
    // target's directories and the file as opened.
    cx_os_file_t file;
    bool open = false;
    cx_status cx = cx_open_file(full, &file, CX_FILE_APPEND);
    if (cx.category != CX_CATEGORY_OK) {
        TRC1_ERROR_MSG("can't open '%s': %c%d\n", full, cx.category, cx.code);
        *status = DPX_E_FILE_WRITE;
    } else {
        open = true;
    }
    uint32_t arrived = 0;
    dpx_checksum_xfer_buff(buffer, *last, &arrived);
    if (arrived != crc)
        *status = DPX_E_CHECKSUM;
    if (*status == DPX_OK)
        *status = dpx_write_xfer_buff(&file, buffer, *last);
    if (open)
        cx_close_file(&file);
}

void dpx_agent_query(handle_t, dpx_query_text, dpx_file_desc, uint32_t *, dpx_status *status)
{
    TRC1_FUNCTION();
    if (status != nullptr)
        *status = DPX_E_INVALID_PARAM;
}

void dpx_list_nodes(handle_t, dpx_node_filter, int16_t *, int16_t, dpx_status *status, dpx_node_name[])
{
    TRC1_FUNCTION();
    if (status != nullptr)
        *status = DPX_E_INVALID_PARAM;
}

const dpx_transfer_v1_epv_t dpx_transfer_v1_manager_epv = {dpx_get_chunks, dpx_put_chunks, dpx_agent_query,
                                                           dpx_list_nodes};

uint32_t dpx_register_rpc_mgr(void)
{
    TRC1_FUNCTION();
    uint32_t status = rpc__s_ok;
    rpc__register_mgr(&uuid__nil, &dpx_transfer_v1_if_spec, dpx_transfer_v1_server_epv,
                      &dpx_transfer_v1_manager_epv, &status);
    if (status != rpc__s_ok)
        TRC1_ERROR_MSG("rpc__register_mgr call failed with return code [0x%x]", status);
    return 0;
}

uint32_t dpx_rpc_unregister(void)
{
    TRC1_FUNCTION();
    uint32_t status = rpc__s_ok;
    rpc__unregister(&dpx_transfer_v1_if_spec, &status);
    if (status != rpc__s_ok)
        TRC1_ERROR_MSG("dpx_rpc_unregister call failed with return code [0x%x]", status);
    return 0;
}

}  // extern "C"

namespace {

// Reads one retry setting: the default when the variable is unset or holds no
// number; a number as sscanf takes it otherwise (12x gives 12).
void read_setting(const trc::Scope &scope, const char *variable, int32_t *value, int32_t fallback)
{
    const char *text = PLT1_GetEnv(variable, nullptr);
    long long wide = 0;
    if (text == nullptr) {
        *value = fallback;
        if (scope.on(TRC1_FLOW))
            TRC1_Printf(scope.desc(), __LINE__, "No %s env", variable);
    } else if (std::sscanf(text, "%lld", &wide) != 1) {
        *value = fallback;
        if (scope.on(TRC1_FLOW))
            TRC1_Printf(scope.desc(), __LINE__, "Bad %s env: %s", variable, text);
    } else {
        // A long of the interface is 32 bits: its conversion gives the limit
        // for a number beyond it.
        *value = static_cast<int32_t>(std::clamp<long long>(wide, INT32_MIN, INT32_MAX));
    }
}

}  // namespace

extern "C" {

uint32_t dpx_agent_init(void)
{
    TRC1_FUNCTION();
    PLT1_InitializeLock(&BIND_LOCK);
    PLT1_InitializeLock(&HUB_LOCK);
    uint32_t result = dpx_register_rpc_mgr();

    read_setting(trc1_scope_, "DPX_MAX_RETRY", &MAX_DPX_RETRY, 6);
    TRC1_FLOW_MSG("Set MAX_DPX_RETRY %d", MAX_DPX_RETRY);
    read_setting(trc1_scope_, "DPX_MIN_RETRY_INTERVAL", &MIN_DPX_RETRY_INTERVAL, 3);
    TRC1_FLOW_MSG("Set MIN_DPX_RETRY_INTERVAL %d seconds", MIN_DPX_RETRY_INTERVAL);
    return result;
}

uint32_t dpx_agent_stop(void)
{
    TRC1_FUNCTION();
    uint32_t result = dpx_rpc_unregister();
    release_hub_handle();
    PLT1_DestroyLock(&BIND_LOCK);
    PLT1_DestroyLock(&HUB_LOCK);
    return result;
}

}  // extern "C"

// The service side: full paths in the depot.
#include "dpxserver.h"

#include "trc/trc1.h"

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
    return dpx_get_full_path(field, full, full_size);
}

}  // extern "C"

// Confinement of the service's paths to the product's directory by their
// real location, for hosts that want it ("DPX_CONFINE" set to 1).
//
// The cleaned relative path can't climb above the product's directory, but
// the file layer follows symbolic links, so a link inside the depot that
// points elsewhere leads a request out of it. With confinement on, a full
// path is served only when its real location, links resolved as far as its
// levels exist, lies in the product directory's real location; a level that
// exists but resolves to nothing, such as a link to a missing file, is
// refused as well, since a write would create its target. The check and the
// open that follows are two steps: the depot's layout is the operator's, and
// a client can't make links through the interface.
#include "dpxserver.h"

#include "cxfile.h"

#include "plt/plt1.h"
#include "trc/trc1.h"

#include <cstdio>
#include <cstring>

TRC1_DEFINE_UNIT("dpxconfine");

namespace {

// Read once: the setting of the host, which doesn't change while it serves.
bool confine_enabled()
{
    static const bool enabled = [] {
        const char *value = PLT1_GetEnv("DPX_CONFINE", nullptr);
        return value != nullptr && std::strcmp(value, "1") == 0;
    }();
    return enabled;
}

// True when `real` is `dir` or lies below it.
bool within(const char *real, const char *dir)
{
    size_t length = std::strlen(dir);
    if (std::strncmp(real, dir, length) != 0)
        return false;
    return real[length] == '\0' || real[length] == '/' || (length > 0 && dir[length - 1] == '/');
}

}  // namespace

extern "C" {

dpx_status dpx_confine_full_path(const char *full)
{
    TRC1_FUNCTION();
    if (!confine_enabled())
        return DPX_OK;
    char dir[DPX_PATH_LEN];
    char real_dir[DPX_PATH_LEN];
    char real[DPX_PATH_LEN];
    int n = std::snprintf(dir, sizeof dir, "%s/%s", dpx_get_depotroot(), dpx_get_product());
    bool inside = n > 0 && static_cast<size_t>(n) < sizeof dir &&
                  cx_succeeded(cx_real_path(dir, real_dir, sizeof real_dir)) &&
                  cx_succeeded(cx_real_path(full, real, sizeof real)) && within(real, real_dir);
    if (inside)
        return DPX_OK;
    TRC1_ERROR_MSG("path leaves the depot: '%s'\n", full);
    return DPX_E_INVALID_PARAM;
}

}  // extern "C"

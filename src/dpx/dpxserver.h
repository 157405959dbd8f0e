// Inside the library: what the service side shares between its files.
#ifndef DPX_DPXSERVER_H
#define DPX_DPXSERVER_H

#include "dpx/dpx.h"

extern "C" {

// Builds the full path of a fixed-width path field of a request, such as
// dpx_file_desc.path, into `full` of `full_size` bytes. A field that holds no
// NUL within its `field_size` bytes is refused with DPX_E_INVALID_PARAM and
// never read past; otherwise as dpx_get_full_path, and a full path that
// dpx_confine_full_path refuses gives its DPX_E_INVALID_PARAM.
dpx_status dpx_get_full_path_of_field(const char *field, size_t field_size, char *full, size_t full_size);

// DPX_OK when confinement is off (the default), or when the real location of
// the full path `full` lies in the product directory's real location:
// symbolic links resolved as far as the path's levels exist, the missing
// levels taken as they stand. Otherwise DPX_E_INVALID_PARAM, traced at the
// error level. Confinement is on when "DPX_CONFINE" holds 1 at the first
// call (dpx-agentd --confine sets it); it then stays so.
dpx_status dpx_confine_full_path(const char *full);

}

#endif

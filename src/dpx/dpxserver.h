// Inside the library: what the service side shares between its files.
#ifndef DPX_DPXSERVER_H
#define DPX_DPXSERVER_H

#include "dpx/dpx.h"

extern "C" {

// Builds the full path of a fixed-width path field of a request, such as
// dpx_file_desc.path, into `full` of `full_size` bytes. A field that holds no
// NUL within its `field_size` bytes is refused with DPX_E_INVALID_PARAM and
// never read past; otherwise as dpx_get_full_path.
dpx_status dpx_get_full_path_of_field(const char *field, size_t field_size, char *full, size_t full_size);

}

#endif

// Path cleaning and full paths in the depot. The cleaned path never holds a
// ".." segment or a backslash, never starts with a separator and is never
// longer than its input; a full path, from a text or from a request's fixed
// field, never leaves the product's directory.
#include "fuzz_common.h"

#include "dpxserver.h"

#include <string>
#include <vector>

namespace {

void check_clean(const std::string &rel)
{
    std::vector<char> clean(rel.size() + 1, 'X');
    if (dpx_cleanup_rel_path(rel.c_str(), clean.data()) != DPX_OK)
        std::abort();
    const std::string out = clean.data();
    if (out.size() > rel.size() || out[0] == '/' || out.find('\\') != std::string::npos ||
        ("/" + out + "/").find("/../") != std::string::npos)
        std::abort();
}

void check_full(const std::string &rel)
{
    char full[DPX_PATH_LEN];
    dpx_status status = dpx_get_full_path(rel.c_str(), full, sizeof full);
    if (status == DPX_OK ? !dpxfuzz::inside_product(full) : status != DPX_E_PATH_TOO_LONG)
        std::abort();
}

// The request's fixed field: the input's first 4096 bytes, NUL-filled.
void check_field(const uint8_t *data, size_t size)
{
    char field[DPX_PATH_LEN] = {};
    std::memcpy(field, data, size < sizeof field ? size : sizeof field);
    char full[DPX_PATH_LEN];
    dpx_status status = dpx_get_full_path_of_field(field, sizeof field, full, sizeof full);
    bool terminated = std::memchr(field, '\0', sizeof field) != nullptr;
    if (status == DPX_OK ? !dpxfuzz::inside_product(full) : (status == DPX_E_INVALID_PARAM) == terminated)
        std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    dpxfuzz::set_depot();
    // The text up to the first NUL, as a C caller would pass it.
    std::string rel(reinterpret_cast<const char *>(data), size);
    rel.resize(std::strlen(rel.c_str()));
    check_clean(rel);
    check_full(rel);
    check_field(data, size);
    return 0;
}

// Transfer buffers and their checksum.
#include "dpx/dpx.h"

#include "trc/trc1.h"

#include <cstdlib>
#include <zlib.h>

TRC1_DEFINE_UNIT("dpxbuff");

namespace {

constexpr int16_t kMinRecords = 24;
constexpr int16_t kMaxRecords = 128;

}  // namespace

extern "C" {

dpx_chunk *dpx_alloc_xfer_buff(int16_t requested, int16_t *max)
{
    TRC1_FUNCTION();
    int16_t n = requested;
    if (n > kMaxRecords)
        n = kMaxRecords;
    if (n < kMinRecords)
        n = kMinRecords;
    auto *buffer = static_cast<dpx_chunk *>(std::malloc(static_cast<size_t>(n) * sizeof(dpx_chunk)));
    if (max != nullptr)
        *max = buffer != nullptr ? static_cast<int16_t>(n - 1) : 0;
    return buffer;
}

void dpx_free_xfer_buff(dpx_chunk *buffer)
{
    TRC1_FUNCTION();
    std::free(buffer);
}

void dpx_checksum_xfer_buff(const dpx_chunk *buffer, int16_t count, uint32_t *crc)
{
    TRC1_FUNCTION();
    if (buffer == nullptr || crc == nullptr)
        return;
    uLong value = *crc;
    for (int16_t i = 0; i < count; ++i) {
        // A record from the wire may claim more than it holds: never read
        // past its data.
        uint32_t length = buffer[i].length <= DPX_CHUNK_SIZE ? buffer[i].length : DPX_CHUNK_SIZE;
        value = crc32(value, buffer[i].data, length);
    }
    *crc = static_cast<uint32_t>(value);
}

}  // extern "C"

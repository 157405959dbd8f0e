// The TCP carrier's reading of frames, as a connection delivers them: one
// header after another, each followed by its body. A header that is taken
// must say exactly what its bytes say (it encodes back to them), a fault
// never has a body, and a body above the carrier's limit is never taken.
#include "ncs/frame.h"

#include <cstdlib>
#include <cstring>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    using namespace ncs::frame;
    size_t at = 0;
    while (size - at >= kHeaderSize) {
        Bytes bytes;
        std::memcpy(bytes, data + at, kHeaderSize);
        Header header;
        if (!decode(bytes, header))
            return 0;
        Bytes again;
        encode(header, again);
        if (std::memcmp(bytes, again, kHeaderSize) != 0 || (header.kind == kFault && header.body_len != 0))
            std::abort();
        at += kHeaderSize;
        // The reader refuses a body above the limit before taking room for it.
        if (header.body_len > RPC_MAX_BODY || header.body_len > size - at)
            return 0;
        at += header.body_len;
    }
    return 0;
}

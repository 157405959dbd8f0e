// Packets of the stubs and the carriers, and the memory of server stubs'
// arrays.
//
// A packet carries a small header in front of the pointer handed out, which
// records its capacity class. Packets of the usual sizes (4 KiB to 2 MiB,
// powers of two) go back to a short free list per class when given back, so
// a stream of large calls doesn't map and unmap half a megabyte each time.
// Builds with AddressSanitizer keep no free list: every packet is a fresh
// allocation, so a packet used after it was given back is caught.
#include "ncs/runtime.h"

#include <array>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>
#include <vector>

namespace {

#if defined(__SANITIZE_ADDRESS__)
constexpr size_t kCachedPerClass = 0;
#else
constexpr size_t kCachedPerClass = 4;
#endif

constexpr size_t kSmallestClass = 4096;
constexpr size_t kClassCount = 10;  // 4 KiB .. 2 MiB
constexpr uint32_t kUncached = UINT32_MAX;
constexpr uint32_t kLiveMagic = 0x504b4c56;  // "PKLV"
constexpr uint32_t kFreeMagic = 0x504b4652;  // "PKFR"

// Sits right in front of the pointer a caller gets; 16 bytes keep the packet
// aligned as malloc's memory is.
struct alignas(16) PacketHeader {
    uint32_t magic;
    uint32_t size_class;  // kUncached for packets above the largest class
};
static_assert(sizeof(PacketHeader) == 16);

class PacketCache {
public:
    ~PacketCache()
    {
        for (auto &list : free_)
            for (void *block : list)
                std::free(block);
    }

    // A block of at least `bytes` (header included) and its class.
    void *take(size_t bytes, uint32_t &size_class)
    {
        size_class = class_of(bytes);
        if (size_class == kUncached)
            return std::malloc(bytes);
        if (kCachedPerClass > 0) {
            std::lock_guard<std::mutex> hold(mutex_);
            auto &list = free_[size_class];
            if (!list.empty()) {
                void *block = list.back();
                list.pop_back();
                return block;
            }
        }
        return std::malloc(kSmallestClass << size_class);
    }

    void give(void *block, uint32_t size_class)
    {
        if (size_class != kUncached && kCachedPerClass > 0) {
            std::lock_guard<std::mutex> hold(mutex_);
            auto &list = free_[size_class];
            if (list.size() < kCachedPerClass) {
                list.push_back(block);
                return;
            }
        }
        std::free(block);
    }

private:
    static uint32_t class_of(size_t bytes)
    {
        for (uint32_t c = 0; c < kClassCount; ++c)
            if (bytes <= kSmallestClass << c)
                return c;
        return kUncached;
    }

    std::mutex mutex_;  // guards free_
    std::array<std::vector<void *>, kClassCount> free_;
};

PacketCache &cache()
{
    // Never destroyed: packets may be given back by threads that outlive
    // static destruction.
    static PacketCache *instance = new PacketCache;
    return *instance;
}

[[noreturn]] void raise_no_memory()
{
    EXC1__Raise(EXC1_Thread(), rpc__s_no_memory);
}

}  // namespace

extern "C" {

void rpc__alloc_pkt(uint32_t size, void **pkt)
{
    size_t bytes = sizeof(PacketHeader) + RPC_DATA_OFFS + size_t{size};
    uint32_t size_class = kUncached;
    void *block = cache().take(bytes, size_class);
    if (block == nullptr)
        raise_no_memory();
    auto *header = static_cast<PacketHeader *>(block);
    header->magic = kLiveMagic;
    header->size_class = size_class;
    *pkt = header + 1;
}

void rpc__free_pkt(void *pkt)
{
    if (pkt == nullptr)
        return;
    auto *header = static_cast<PacketHeader *>(pkt) - 1;
    // A packet given back twice would sit twice on a free list and later be
    // handed to two owners: stop here instead.
    if (header->magic != kLiveMagic)
        std::abort();
    header->magic = kFreeMagic;
    cache().give(header, header->size_class);
}

void rpc__block_copy(const void *source, void *destination, uint32_t count)
{
    if (count > 0)
        std::memcpy(destination, source, count);
}

void rpc__malloc(uint32_t size, void **ptr)
{
    void *memory = std::malloc(size > 0 ? size : 1);
    if (memory == nullptr)
        raise_no_memory();
    *ptr = memory;
}

void rpc__free(void *ptr)
{
    std::free(ptr);
}

}  // extern "C"

// The depot root and the product name, each found once and then held for
// the life of the process.
#include "dpx/dpx.h"

#include "afw/afw.h"
#include "plt/plt1.h"
#include "trc/trc1.h"

#include <atomic>
#include <cstdlib>
#include <cstring>

TRC1_DEFINE_UNIT("dpxutil");

namespace {

// The cached texts. Null until a source gave a value; then set once and never
// freed. Threads that race at the first use each make a copy and publish it
// with a compare-and-swap: the first copy stays, the others are dropped, so no
// thread ever sees a text that another is still writing.
std::atomic<char *> g_depotroot{nullptr};
std::atomic<char *> g_product{nullptr};

const char kDepotSuffix[] = "/dpxdepot";

char *publish(std::atomic<char *> &slot, char *copy)
{
    char *expected = nullptr;
    if (slot.compare_exchange_strong(expected, copy, std::memory_order_acq_rel))
        return copy;
    std::free(copy);
    return expected;
}

}  // namespace

extern "C" {

const char *dpx_get_depotroot(void)
{
    TRC1_FUNCTION();
    if (char *cached = g_depotroot.load(std::memory_order_acquire))
        return cached;
    if (const char *root = PLT1_GetEnv("DPX_DEPOTROOT", nullptr)) {
        size_t length = std::strlen(root);
        auto *copy = static_cast<char *>(std::malloc(length + 1));
        if (copy == nullptr) {
            TRC1_ERROR_MSG("malloc 1 for DPX_DEPOTROOT failed\n");
            return nullptr;
        }
        std::memcpy(copy, root, length + 1);
        return publish(g_depotroot, copy);
    }
    if (const char *home = PLT1_GetEnv("VESPERHOME", nullptr)) {
        size_t length = std::strlen(home);
        auto *copy = static_cast<char *>(std::malloc(length + sizeof kDepotSuffix));
        if (copy == nullptr) {
            TRC1_ERROR_MSG("malloc 2 for DPX_DEPOTROOT failed\n");
            return nullptr;
        }
        std::memcpy(copy, home, length);
        std::memcpy(copy + length, kDepotSuffix, sizeof kDepotSuffix);
        return publish(g_depotroot, copy);
    }
    return nullptr;
}

const char *dpx_get_product(void)
{
    TRC1_FUNCTION();
    if (char *cached = g_product.load(std::memory_order_acquire))
        return cached;
    const char *product = AFW_GetProductName();
    if (product == nullptr)
        return nullptr;
    size_t length = std::strlen(product);
    auto *copy = static_cast<char *>(std::malloc(length + 1));
    if (copy == nullptr) {
        TRC1_ERROR_MSG("malloc for DPX_PRODUCT failed\n");
        return nullptr;
    }
    std::memcpy(copy, product, length + 1);
    return publish(g_product, copy);
}

}  // extern "C"

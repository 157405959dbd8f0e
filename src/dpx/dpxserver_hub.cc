// The binding to the hub: one cached master binding for the process, handed
// out as duplicates, looked up again through the location broker when it was
// invalidated or the hub's name changed.
#include "dpx/dpx.h"

#include "afw/afw.h"
#include "ncs/lb.h"
#include "plt/plt1.h"
#include "trc/trc1.h"

#include <cstring>

TRC1_DEFINE_UNIT("dpxserver");

// The two locks are never held together, and neither is held during a call of
// the interface. HUB_LOCK guards HUB and the test whether the cached binding
// is good; BIND_LOCK guards BINDING_HANDLE and BINDING_HANDLE_INVALID and
// makes a lookup and a duplication exclusive. Both are usable from their
// initial state, so a process that never runs dpx_agent_init can bind.
handle_t BINDING_HANDLE = nullptr;              // guarded by BIND_LOCK
unsigned char BINDING_HANDLE_INVALID = 1;       // guarded by BIND_LOCK
char HUB[DPX_HUB_LEN] = "";                     // guarded by HUB_LOCK
PLT1_LOCK HUB_LOCK = PLT1_LOCK_INITIALIZER;
PLT1_LOCK BIND_LOCK = PLT1_LOCK_INITIALIZER;

namespace {

constexpr uint32_t kAddrSize = sizeof(socket__addr_t);  // 104
// Entries of a broker walk looked at before giving up: a broker that never
// ends its list can't keep a client here for ever.
constexpr int kMaxBrokerEntries = 4096;

// The test of a good binding reads the two variables without BIND_LOCK; they
// are accessed atomically so that such a read is merely stale, never torn.
handle_t load_binding()
{
    return __atomic_load_n(&BINDING_HANDLE, __ATOMIC_ACQUIRE);
}

void store_binding(handle_t handle)
{
    __atomic_store_n(&BINDING_HANDLE, handle, __ATOMIC_RELEASE);
}

unsigned char load_invalid()
{
    return __atomic_load_n(&BINDING_HANDLE_INVALID, __ATOMIC_ACQUIRE);
}

void store_invalid(unsigned char value)
{
    __atomic_store_n(&BINDING_HANDLE_INVALID, value, __ATOMIC_RELEASE);
}

}  // namespace

extern "C" {

void free_rpc_handle(handle_t handle)
{
    TRC1_FUNCTION();
    if (handle == nullptr)
        return;
    uint32_t status = rpc__s_ok;
    rpc__free_handle(handle, &status);
    if (status != rpc__s_ok)
        TRC1_ERROR_MSG("rpc__free_handle failed with status [0x%x]", status);
}

void release_hub_handle(void)
{
    TRC1_FUNCTION();
    PLT1_GetLock(&BIND_LOCK);
    handle_t master = load_binding();
    if (master != nullptr) {
        free_rpc_handle(master);
        store_binding(nullptr);
    }
    PLT1_ReleaseLock(&BIND_LOCK);
}

void invalidate_hub_handle(void)
{
    TRC1_FUNCTION();
    uint32_t status = DPX_OK;
    PLT1_GetLock(&BIND_LOCK);
    store_invalid(1);
    handle_t master = load_binding();
    if (master != nullptr)
        rpc__clear_server_binding(master, &status);
    PLT1_ReleaseLock(&BIND_LOCK);
    if (status != DPX_OK)
        release_hub_handle();
}

void lookup_handle(handle_t *binding, socket__addr_t *addr, uint32_t addr_len, dpx_status *status)
{
    TRC1_FUNCTION();
    lb__lookup_handle_t entry = 0;
    uuid__t if_uuid;
    uuid__decode(DPX_HUB_LB_UUID, &if_uuid, status);
    if (addr_len == 0)
        entry = -1;

    uint32_t found = 0;
    lb__entry_t result;
    std::memset(&result, 0, sizeof result);
    for (int walked = 0;; ++walked) {
        if (walked == kMaxBrokerEntries) {
            found = 0;
            *status = lb__s_not_registered;
        } else {
            lb__lookup_range(&uuid__nil, &uuid__nil, &if_uuid, "", addr, addr_len, &entry, 1, &found, &result,
                             status);
        }
        if (found < 1) {
            TRC1_ERROR_MSG("no interface found in lb__lookup_range");
            break;
        }
        uint32_t family_status = rpc__s_ok;
        if (socket__valid_family(result.saddr.sa.sa_family, &family_status))
            break;
    }
    if (found == 0)
        return;

    if (*binding == nullptr)
        *binding = rpc__bind(&uuid__nil, &result.saddr, result.saddr_len, status);
    else
        rpc__set_binding(*binding, &result.saddr, result.saddr_len, status);
    if (*status != DPX_OK) {
        TRC1_ERROR_MSG("rpc__bind call failed with return code [0x%x]", *status);
        return;
    }

    // For the trace only: where the binding now points.
    if (trc1_scope_.on(TRC1_FLOW)) {
        uint32_t inq_status = rpc__s_ok;
        uint32_t inq_len = kAddrSize;
        rpc__inq_binding(*binding, addr, &inq_len, &inq_status);
        if (inq_status == rpc__s_ok) {
            char name[DPX_HUB_LEN] = "";
            uint32_t name_len = sizeof name;
            uint32_t port = 0;
            socket__to_name(addr, inq_len, name, &name_len, &port, &inq_status);
            if (inq_status == rpc__s_ok)
                TRC1_FLOW_MSG("bound to port %ld at host %s\n", static_cast<long>(port), name);
        }
    }
}

void get_hub_handle(handle_t *handle, dpx_status *status)
{
    TRC1_FUNCTION();
    socket__addr_t addr;
    std::memset(&addr, 0, sizeof addr);
    uint32_t addr_len = kAddrSize;
    const char *env = PLT1_GetEnv("DPX_HUBHOST", nullptr);

    // Cleared first: the fallback below needs an empty buffer whatever a
    // failing framework leaves in it.
    char host[DPX_HUB_LEN];
    std::memset(host, 0, sizeof host);
    int rc = AFW_GetCurrentHUBHost(host, sizeof host);
    if (rc != 0 && env == nullptr) {
        TRC1_FLOW_MSG("AFW_GetCurrentHUBHost call failed with return code [%d]", rc);
        *status = DPX_E_NO_HUB_HOST;
        return;
    }
    if (env != nullptr && host[0] == '\0') {
        // A name that doesn't fit is refused, never cut to another host's name.
        if (std::strlen(env) >= sizeof host) {
            TRC1_ERROR_MSG("DPX_HUBHOST is longer than %d characters", DPX_HUB_LEN - 1);
            *status = DPX_E_NO_HUB_HOST;
            return;
        }
        std::strcpy(host, env);
    }

    PLT1_GetLock(&HUB_LOCK);
    bool good = load_invalid() == 0 && load_binding() != nullptr && std::strncmp(host, HUB, sizeof host) == 0;
    if (good) {
        PLT1_ReleaseLock(&HUB_LOCK);
    } else {
        size_t name_len = std::strlen(host);
        char name[DPX_HUB_LEN];
        std::memcpy(name, host, name_len);
        std::memcpy(HUB, host, sizeof HUB);
        PLT1_ReleaseLock(&HUB_LOCK);

        socket__from_name(0, name, static_cast<uint32_t>(name_len), 0, &addr, &addr_len, status);
        if (*status != DPX_OK) {
            TRC1_ERROR_MSG("socket__from_name call failed with return code [0x%x]", *status);
        } else {
            TRC1_FLOW_MSG("binding to %s ...", host);
            PLT1_GetLock(&BIND_LOCK);
            handle_t master = load_binding();
            lookup_handle(&master, &addr, addr_len, status);
            store_binding(master);
            store_invalid(0);
            if (*status != DPX_OK) {
                store_invalid(1);
                TRC1_FLOW_MSG("lookup_handle call failed with return code [0x%x]", *status);
            }
            PLT1_ReleaseLock(&BIND_LOCK);
        }
    }

    PLT1_GetLock(&BIND_LOCK);
    handle_t master = load_binding();
    if (master != nullptr) {
        *handle = rpc__dup_handle(master, status);
        store_invalid(0);
        if (*status != DPX_OK) {
            store_invalid(1);
            TRC1_ERROR_MSG("rpc__dup_handle call failed with return code [0x%x]", *status);
        }
    } else {
        store_invalid(1);
        *status = DPX_E_INVALID_PARAM;
        TRC1_ERROR_MSG("binding handle is null");
    }
    PLT1_ReleaseLock(&BIND_LOCK);
}

}  // extern "C"

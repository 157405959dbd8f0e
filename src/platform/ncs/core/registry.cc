// Registrations of interfaces on this process's server, and the dispatch of
// one request to its server stub.
//
// The registry maps (interface UUID, version) to a registration held by a
// shared pointer. A dispatch takes its own reference before it runs the stub,
// so an interface unregistered while its calls run is gone for new calls at
// once, and the calls under way finish on the registration they started with.
#include "ncs/guard.h"
#include "ncs/runtime.h"

#include <array>
#include <atomic>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <shared_mutex>
#include <utility>
#include <vector>

namespace {

struct Registration {
    rpc__if_spec_t ifspec;
    std::vector<rpc__server_stub_t> stubs;  // ifspec.opcnt entries
    const void *mgr_epv;
    std::atomic<const void *> busy_mgr_epv{nullptr};  // answers calls while every worker is busy
};

// An interface as the registry orders it: the UUID's 16 bytes and the version.
using Key = std::pair<std::array<unsigned char, sizeof(uuid__t)>, uint32_t>;
static_assert(sizeof(uuid__t) == 16, "a UUID has no padding");

Key key_of(const uuid__t &id, uint32_t vers)
{
    Key key{{}, vers};
    std::memcpy(key.first.data(), &id, sizeof id);
    return key;
}

class Registry {
public:
    uint32_t add(const rpc__if_spec_t &ifspec, const rpc__server_stub_t *stubs, const void *mgr_epv)
    {
        auto registration = std::make_shared<Registration>();
        registration->ifspec = ifspec;
        registration->stubs.assign(stubs, stubs + ifspec.opcnt);
        registration->mgr_epv = mgr_epv;
        std::unique_lock<std::shared_mutex> hold(mutex_);
        auto [where, added] = entries_.try_emplace(key_of(ifspec.id, ifspec.vers), std::move(registration));
        return added ? rpc__s_ok : rpc__s_already_registered;
    }

    uint32_t remove(const rpc__if_spec_t &ifspec)
    {
        std::unique_lock<std::shared_mutex> hold(mutex_);
        return entries_.erase(key_of(ifspec.id, ifspec.vers)) != 0 ? rpc__s_ok : rpc__s_not_registered;
    }

    std::shared_ptr<Registration> find(const uuid__t &id, uint32_t vers)
    {
        std::shared_lock<std::shared_mutex> hold(mutex_);
        auto where = entries_.find(key_of(id, vers));
        return where != entries_.end() ? where->second : nullptr;
    }

private:
    std::shared_mutex mutex_;  // guards entries_; never held while a stub runs
    std::map<Key, std::shared_ptr<Registration>> entries_;
};

Registry &registry()
{
    // Never destroyed: server threads may dispatch during static destruction.
    static Registry *instance = new Registry;
    return *instance;
}

using ncs::set_status;

// Gives back a reply packet that a stub took before it raised.
void drop_reply(const ncs::Dispatched &outcome)
{
    if (outcome.must_free)
        rpc__free_pkt(outcome.reply_pkt);
}

}  // namespace

namespace ncs {

Dispatched dispatch(const uuid__t &if_id, uint32_t if_vers, uint32_t opnum, uint32_t drep, void *in_pkt,
                    uint32_t in_len, void *out_pkt, uint32_t out_max, bool busy, const char *client)
{
    Dispatched outcome;
    std::shared_ptr<const Registration> registration = registry().find(if_id, if_vers);
    if (registration == nullptr) {
        outcome.fault = rpc__s_unknown_if;
        return outcome;
    }
    if (opnum >= registration->stubs.size() || registration->stubs[opnum] == nullptr) {
        outcome.fault = rpc__s_op_rng_error;
        return outcome;
    }
    const void *managers = busy ? registration->busy_mgr_epv.load() : registration->mgr_epv;
    if (busy && managers == nullptr) {
        outcome.fault = rpc__s_server_busy;
        return outcome;
    }

    // The binding the stub sees: the stubs read data_offs, the managers
    // nothing of it.
    Handle server_handle{};
    server_handle.data_offs = RPC_DATA_OFFS;
    server_handle.magic = kHandleMagic;
    server_handle.client_name = client;

    uint32_t call_drep = drep;
    unsigned char must_free = 0;
    uint32_t st = rpc__s_ok;
    EXC1_FRAME frame;
    uint32_t raised = EXC1_FRAME_SET;
    try {
        raised = exc::guard(&frame, __FILE__, __LINE__, [&] {
            registration->stubs[opnum](&server_handle, in_pkt, in_len, out_pkt, out_max, &call_drep,
                                       managers, &outcome.reply_pkt, &outcome.reply_len, &must_free,
                                       &st);
        });
    } catch (...) {
        raised = rpc__s_fault_unspec;
    }
    // The offered buffer is the carrier's: it is never a packet to give back.
    outcome.must_free = must_free != 0 && outcome.reply_pkt != out_pkt;

    if (raised == EXC1_FRAME_SET && st != rpc__s_ok)
        raised = st;
    if (raised == EXC1_FRAME_SET) {
        // A reply the carrier couldn't send safely is a fault of the stub.
        if (outcome.reply_pkt == nullptr || outcome.reply_len > RPC_MAX_BODY ||
            (outcome.reply_pkt == out_pkt && outcome.reply_len > out_max))
            raised = rpc__s_fault_unspec;
    }
    if (raised != EXC1_FRAME_SET) {
        EXC1_Allow();
        drop_reply(outcome);
        outcome = Dispatched{};
        outcome.fault = raised;
    }
    return outcome;
}

}  // namespace ncs

extern "C" {

void rpc__register_mgr(const uuid__t *, const rpc__if_spec_t *ifspec, const rpc__server_stub_t *server_epv,
                       const void *mgr_epv, uint32_t *status)
{
    if (ifspec == nullptr || server_epv == nullptr) {
        set_status(status, rpc__s_unknown_if);
        return;
    }
    ncs::guarded(status, rpc__s_no_memory, [&] { return registry().add(*ifspec, server_epv, mgr_epv); });
}

void rpc__register_busy_mgr(const rpc__if_spec_t *ifspec, const void *busy_mgr_epv, uint32_t *status)
{
    std::shared_ptr<Registration> registration =
        ifspec != nullptr ? registry().find(ifspec->id, ifspec->vers) : nullptr;
    if (registration == nullptr) {
        set_status(status, rpc__s_not_registered);
        return;
    }
    registration->busy_mgr_epv = busy_mgr_epv;
    set_status(status, rpc__s_ok);
}

void rpc__inq_client_name(handle_t handle, char *name, size_t size, uint32_t *status)
{
    const auto *h = reinterpret_cast<const ncs::Handle *>(handle);
    if (h == nullptr || h->magic != ncs::kHandleMagic || name == nullptr || size == 0) {
        set_status(status, rpc__s_invalid_handle);
        return;
    }
    const char *client = h->client_name != nullptr ? h->client_name : "";
    std::snprintf(name, size, "%s", client);
    set_status(status, rpc__s_ok);
}

void rpc__unregister(const rpc__if_spec_t *ifspec, uint32_t *status)
{
    if (ifspec == nullptr) {
        set_status(status, rpc__s_not_registered);
        return;
    }
    set_status(status, registry().remove(*ifspec));
}

}  // extern "C"

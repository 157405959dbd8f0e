// The in-process carrier: a call on a handle of the in-process family runs
// the registered server stub on the caller's thread, under the same contract
// as a call over the network.
#include "ncs/runtime.h"

#include <cstring>

namespace {

class InprocCarrier final : public ncs::Carrier {
public:
    void call(const socket__addr_t &, uint32_t, uint32_t, const rpc__if_spec_t &ifspec, uint32_t opnum,
              void *request_pkt, uint32_t request_len, void *reply_buf, uint32_t reply_buf_size,
              ncs::Reply &reply) override
    {
        // The caller's reply buffer is what the server stub is offered, so a
        // small reply is written where the caller reads it.
        bool offer = reply_buf != nullptr && reply_buf_size >= RPC_DATA_OFFS;
        void *out_pkt = offer ? reply_buf : nullptr;
        uint32_t out_max = offer ? reply_buf_size - RPC_DATA_OFFS : 0;
        ncs::Dispatched outcome = ncs::dispatch(ifspec.id, ifspec.vers, opnum, NCS_DREP_LOCAL, request_pkt,
                                                request_len, out_pkt, out_max, false, nullptr);
        if (outcome.fault != rpc__s_ok)
            EXC1__Raise(EXC1_Thread(), outcome.fault);

        reply.drep = NCS_DREP_LOCAL;
        if (outcome.reply_pkt == out_pkt) {
            reply.pkt = out_pkt;
            reply.len = outcome.reply_len;
            reply.must_free = false;
            return;
        }
        if (outcome.must_free && !(offer && outcome.reply_len <= out_max)) {
            // The stub's own packet is handed over as it stands.
            reply.pkt = outcome.reply_pkt;
            reply.len = outcome.reply_len;
            reply.must_free = true;
            return;
        }
        const auto *body = static_cast<const unsigned char *>(outcome.reply_pkt) + RPC_DATA_OFFS;
        try {
            void *into = ncs::place_reply(outcome.reply_len, reply_buf, reply_buf_size, reply);
            std::memcpy(into, body, outcome.reply_len);
        } catch (...) {
            if (outcome.must_free)
                rpc__free_pkt(outcome.reply_pkt);
            throw;
        }
        if (outcome.must_free)
            rpc__free_pkt(outcome.reply_pkt);
    }
};

}  // namespace

namespace ncs {

Carrier &inproc_carrier()
{
    static InprocCarrier carrier;
    return carrier;
}

}  // namespace ncs

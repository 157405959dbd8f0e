// An RPC interface of the tests' own, whose server stubs echo, count, raise
// or wait, and one call of it with rpc__sar. Header-only: the benchmark uses it too.
#ifndef DPX_TEST_NCS_ECHO_H
#define DPX_TEST_NCS_ECHO_H

#include "ncs/ncs.h"

#include <atomic>
#include <chrono>
#include <cstring>
#include <stdexcept>
#include <string>
#include <thread>

namespace ncsecho {

// kEcho answers the request, in the offered buffer when it fits; kEchoInPacket
// too, but always in a packet of its own; kCount counts the executions of the
// call id (0..1023) in the request's first 4 bytes and answers the count;
// kRaise raises the status in the first 4 bytes, or throws a C++ exception
// for 0; kGate waits until gate_open (10 s at most), then echoes.
enum Op : uint32_t { kEcho, kEchoInPacket, kCount, kRaise, kGate, kOpCount };

inline const rpc__if_spec_t kInterface = {
    3, {0}, kOpCount, 0, {0x5eca11edu, 0x0001, 0, 0x22, {0x07, 0x00, 0x00, 0x01, 0x7f, 0x00, 0x01}}};

// What the stubs saw in this process.
inline std::atomic<uint32_t> executions[1024];  // of kCount, by call id
inline std::atomic<uint32_t> entered{0};         // of kGate
inline std::atomic<bool> gate_open{false};

template <Op op>
void stub(handle_t, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max, uint32_t *, const void *,
          void **reply_pkt, uint32_t *reply_len, unsigned char *must_free, uint32_t *st)
{
    const unsigned char *body = static_cast<unsigned char *>(in_pkt) + RPC_DATA_OFFS;
    uint32_t word = 0;
    std::memcpy(&word, body, in_len < 4 ? in_len : 4);
    if (op == kRaise && word == 0)
        throw std::runtime_error("not a raise");
    if (op == kRaise)
        EXC1__Raise(EXC1_Thread(), word);
    entered += op == kGate;
    for (int ms = 0; op == kGate && !gate_open && ms < 10000; ++ms)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    uint32_t count = op == kCount ? ++executions[word % 1024] : 0;
    uint32_t len = op == kCount ? 4 : in_len;
    *must_free = op == kEchoInPacket || len > out_max;
    if (*must_free)
        rpc__alloc_pkt(len, reply_pkt);
    else
        *reply_pkt = out_pkt;
    const void *answer = op == kCount ? static_cast<const void *>(&count) : body;
    rpc__block_copy(answer, static_cast<unsigned char *>(*reply_pkt) + RPC_DATA_OFFS, len);
    *reply_len = len;
    *st = 0;
}

inline const rpc__server_stub_t kServerStubs[kOpCount] = {stub<kEcho>, stub<kEchoInPacket>, stub<kCount>,
                                                           stub<kRaise>, stub<kGate>};

inline uint32_t register_interface()
{
    uint32_t status = 1;
    return rpc__register_mgr(&uuid__nil, &kInterface, kServerStubs, nullptr, &status), status;
}

inline uint32_t unregister_interface()
{
    uint32_t status = 1;
    return rpc__unregister(&kInterface, &status), status;
}

struct Outcome {
    uint32_t fault = 0;      // the status raised, 0 for a reply
    std::string body;
    bool must_free = false;  // the reply came in a packet, not in the caller's buffer
};

// One call of `op` with `body`, offering a reply buffer of `reply_buf_size`
// bytes (0: none). A raise is caught and reported in `fault`.
inline Outcome call(handle_t handle, uint32_t op, const std::string &body, uint32_t options = RPC_OPT_IDEMPOTENT,
                    uint32_t reply_buf_size = 1024, const rpc__if_spec_t &ifspec = kInterface)
{
    Outcome out;
    void *request = nullptr, *reply = nullptr;
    unsigned char must_free = 0;
    std::string reply_buf(reply_buf_size, '\0');
    EXC1_FRAME frame;
    out.fault = exc::guard(&frame, __FILE__, __LINE__, [&] {
        const auto len = static_cast<uint32_t>(body.size());
        rpc__alloc_pkt(len, &request);
        std::memcpy(static_cast<char *>(request) + RPC_DATA_OFFS, body.data(), len);
        uint32_t reply_len = 0, drep = 0, status = 1;
        rpc__sar(handle, options, &ifspec, op, request, len, reply_buf_size > 0 ? reply_buf.data() : nullptr,
                 reply_buf_size, &reply, &reply_len, &drep, &must_free, &status);
        out.body.assign(static_cast<const char *>(reply) + RPC_DATA_OFFS, reply_len);
    });
    out.must_free = must_free != 0;
    if (must_free)
        rpc__free_pkt(reply);
    rpc__free_pkt(request);
    if (out.fault == EXC1_FRAME_SET)
        out.fault = 0;
    else
        EXC1_Allow();
    return out;
}

// A body of 4 bytes: `word` as this machine holds it.
inline std::string word_body(uint32_t word)
{
    return std::string(reinterpret_cast<const char *>(&word), 4);
}

}  // namespace ncsecho

#endif

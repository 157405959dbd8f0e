// A small RPC interface of the tests' own, with server stubs that echo or
// transform bodies, and a client helper that makes one call with rpc__sar.
// Header-only so that test programs outside the test-support library (the
// echo server) use the very same interface.
#ifndef DPX_TEST_NCS_ECHO_H
#define DPX_TEST_NCS_ECHO_H

#include "ncs/ncs.h"

#include <atomic>
#include <chrono>
#include <cstring>
#include <map>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>

namespace ncsecho {

// Operations of the echo interface.
enum Op : uint32_t {
    kEcho = 0,         // reply = request
    kCount = 1,        // counts executions of the call id in the request's first 4 bytes; reply = the count
    kRaise = 2,        // raises the status in the request's first 4 bytes
    kThrow = 3,        // throws a C++ exception that isn't a raise
    kSlowEcho = 4,     // sleeps the milliseconds in the first 4 bytes, then echoes
    kEchoInPacket = 5, // echoes, always into a packet of its own
    kGate = 6,         // waits until the gate opens (10 s at most), then echoes
    kDrep = 7,         // reply = the drep the stub was given, 4 bytes
    kOpCount = 8,
};

inline const rpc__if_spec_t kInterface = {
    3, {0}, kOpCount, 0, {0x5eca11edu, 0x0001, 0, 0x22, {0x07, 0x00, 0x00, 0x01, 0x7f, 0x00, 0x01}}};

// What the stubs saw in this process.
inline std::mutex executions_mutex;
inline std::map<uint32_t, uint32_t> executions;  // kCount: call id -> executions
inline std::atomic<uint32_t> entered{0};         // entries into kSlowEcho and kGate
inline std::atomic<bool> gate_open{false};

inline uint32_t executions_of(uint32_t call_id)
{
    std::lock_guard<std::mutex> hold(executions_mutex);
    auto it = executions.find(call_id);
    return it != executions.end() ? it->second : 0;
}

// Places a reply body of `len` bytes: in the offered buffer when it fits and
// `own_packet` is false, else in a new packet.
inline unsigned char *reply_area(void *out_pkt, uint32_t out_max, uint32_t len, bool own_packet, void **reply_pkt,
                                 unsigned char *must_free)
{
    *must_free = own_packet || len > out_max;
    if (*must_free)
        rpc__alloc_pkt(len, reply_pkt);
    else
        *reply_pkt = out_pkt;
    return static_cast<unsigned char *>(*reply_pkt) + RPC_DATA_OFFS;
}

inline uint32_t first_word(const void *in_pkt, uint32_t in_len)
{
    uint32_t word = 0;
    if (in_len >= 4)
        std::memcpy(&word, static_cast<const unsigned char *>(in_pkt) + RPC_DATA_OFFS, 4);
    return word;
}

inline void echo_into(void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max, bool own_packet,
                      void **reply_pkt, uint32_t *reply_len, unsigned char *must_free)
{
    unsigned char *body = reply_area(out_pkt, out_max, in_len, own_packet, reply_pkt, must_free);
    rpc__block_copy(static_cast<unsigned char *>(in_pkt) + RPC_DATA_OFFS, body, in_len);
    *reply_len = in_len;
}

inline void echo_ssr(handle_t, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max, uint32_t *,
                     const void *, void **reply_pkt, uint32_t *reply_len, unsigned char *must_free, uint32_t *st)
{
    echo_into(in_pkt, in_len, out_pkt, out_max, false, reply_pkt, reply_len, must_free);
    *st = 0;
}

inline void count_ssr(handle_t, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max, uint32_t *,
                      const void *, void **reply_pkt, uint32_t *reply_len, unsigned char *must_free, uint32_t *st)
{
    uint32_t count = 0;
    {
        std::lock_guard<std::mutex> hold(executions_mutex);
        count = ++executions[first_word(in_pkt, in_len)];
    }
    std::memcpy(reply_area(out_pkt, out_max, 4, false, reply_pkt, must_free), &count, 4);
    *reply_len = 4;
    *st = 0;
}

inline void raise_ssr(handle_t, void *in_pkt, uint32_t in_len, void *, uint32_t, uint32_t *, const void *, void **,
                      uint32_t *, unsigned char *, uint32_t *)
{
    EXC1__Raise(EXC1_Thread(), first_word(in_pkt, in_len));
}

inline void throw_ssr(handle_t, void *, uint32_t, void *, uint32_t, uint32_t *, const void *, void **, uint32_t *,
                      unsigned char *, uint32_t *)
{
    throw std::runtime_error("not a raise");
}

inline void slow_echo_ssr(handle_t, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max, uint32_t *,
                          const void *, void **reply_pkt, uint32_t *reply_len, unsigned char *must_free,
                          uint32_t *st)
{
    ++entered;
    std::this_thread::sleep_for(std::chrono::milliseconds(first_word(in_pkt, in_len)));
    echo_into(in_pkt, in_len, out_pkt, out_max, false, reply_pkt, reply_len, must_free);
    *st = 0;
}

inline void echo_in_packet_ssr(handle_t, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max,
                               uint32_t *, const void *, void **reply_pkt, uint32_t *reply_len,
                               unsigned char *must_free, uint32_t *st)
{
    echo_into(in_pkt, in_len, out_pkt, out_max, true, reply_pkt, reply_len, must_free);
    *st = 0;
}

inline void gate_ssr(handle_t, void *in_pkt, uint32_t in_len, void *out_pkt, uint32_t out_max, uint32_t *,
                     const void *, void **reply_pkt, uint32_t *reply_len, unsigned char *must_free, uint32_t *st)
{
    ++entered;
    auto give_up = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!gate_open.load() && std::chrono::steady_clock::now() < give_up)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    echo_into(in_pkt, in_len, out_pkt, out_max, false, reply_pkt, reply_len, must_free);
    *st = 0;
}

inline void drep_ssr(handle_t, void *, uint32_t, void *out_pkt, uint32_t out_max, uint32_t *drep, const void *,
                     void **reply_pkt, uint32_t *reply_len, unsigned char *must_free, uint32_t *st)
{
    std::memcpy(reply_area(out_pkt, out_max, 4, false, reply_pkt, must_free), drep, 4);
    *reply_len = 4;
    *st = 0;
}

inline const rpc__server_stub_t kServerStubs[kOpCount] = {echo_ssr,  count_ssr,          raise_ssr, throw_ssr,
                                                           slow_echo_ssr, echo_in_packet_ssr, gate_ssr,  drep_ssr};

inline uint32_t register_interface()
{
    uint32_t status = 0;
    rpc__register_mgr(&uuid__nil, &kInterface, kServerStubs, nullptr, &status);
    return status;
}

inline uint32_t unregister_interface()
{
    uint32_t status = 0;
    rpc__unregister(&kInterface, &status);
    return status;
}

// What one call gave back.
struct Outcome {
    uint32_t fault = 0;        // the raised status, 0 for a reply
    std::string body;          // the reply body
    bool must_free = false;    // the reply came in a packet
    bool in_reply_buf = false; // the reply came in the caller's buffer
    uint32_t drep = 0;
};

// One call of `op` with `body`, offering a reply buffer of `reply_buf_size`
// bytes (0: none). A raise is caught and reported in `fault`.
inline Outcome call(handle_t handle, uint32_t op, const std::string &body, uint32_t options = RPC_OPT_IDEMPOTENT,
                    uint32_t reply_buf_size = 1024, const rpc__if_spec_t &ifspec = kInterface)
{
    Outcome outcome;
    void *request = nullptr;
    void *reply_pkt = nullptr;
    unsigned char must_free = 0;
    std::string reply_buf(reply_buf_size, '\0');
    EXC1_FRAME frame;
    uint32_t raised = exc::guard(&frame, __FILE__, __LINE__, [&] {
        rpc__alloc_pkt(static_cast<uint32_t>(body.size()), &request);
        std::memcpy(static_cast<char *>(request) + RPC_DATA_OFFS, body.data(), body.size());
        uint32_t reply_len = 0;
        uint32_t status = 1;
        rpc__sar(handle, options, &ifspec, op, request, static_cast<uint32_t>(body.size()),
                 reply_buf_size > 0 ? reply_buf.data() : nullptr, reply_buf_size, &reply_pkt, &reply_len,
                 &outcome.drep, &must_free, &status);
        outcome.body.assign(static_cast<const char *>(reply_pkt) + RPC_DATA_OFFS, reply_len);
        outcome.must_free = must_free != 0;
        outcome.in_reply_buf = reply_pkt == reply_buf.data();
    });
    if (raised != EXC1_FRAME_SET) {
        outcome.fault = raised;
        EXC1_Allow();
    }
    if (must_free)
        rpc__free_pkt(reply_pkt);
    rpc__free_pkt(request);
    return outcome;
}

// A request body for kCount, kRaise or kSlowEcho: the word, then `size` - 4
// pattern bytes.
inline std::string word_body(uint32_t word, size_t size = 4)
{
    std::string body(size < 4 ? 4 : size, '\0');
    std::memcpy(body.data(), &word, 4);
    for (size_t i = 4; i < body.size(); ++i)
        body[i] = static_cast<char>(i * 31 + 7);
    return body;
}

}  // namespace ncsecho

#endif

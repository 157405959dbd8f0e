// Calls of the runtime per second and body throughput, in-process and over
// TCP on 127.0.0.1, through the tests' echo interface.
//
//   rpc_bench --benchmark_counters_tabular=true
//
// Round trips: an 8-byte body each way. Bodies: 529,488 bytes each way, the
// largest reply of the transfer interface; bytes_per_second counts both ways.
#include "../tests/support/ncs_echo.h"
#include "ncs/server.h"

#include <benchmark/benchmark.h>

#include <cstdlib>
#include <cstring>

namespace {

// The echo interface registered and served on a free port, once per process.
uint16_t server_port()
{
    static const uint16_t port = [] {
        ncsecho::register_interface();
        socket__addr_t bound{};
        uint32_t bound_len = 0;
        uint32_t status = 0;
        rpc__listen("127.0.0.1", 0, 4, &bound, &bound_len, &status);
        if (status != rpc__s_ok)
            std::abort();
        return ntohs(bound.in4.sin_port);
    }();
    return port;
}

handle_t bind_handle(bool tcp)
{
    socket__addr_t addr{};
    uint32_t len = sizeof(sa_family_t);
    addr.sa.sa_family = socket__family_inproc;
    if (tcp) {
        addr.in4.sin_family = AF_INET;
        addr.in4.sin_port = htons(server_port());
        addr.in4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        len = sizeof(sockaddr_in);
    } else {
        server_port();  // registers the interface
    }
    uint32_t status = 0;
    return rpc__bind(&uuid__nil, &addr, len, &status);
}

// Echoes a body of `size` bytes per iteration; arg 0 is in-process, 1 TCP.
void echo(benchmark::State &state, uint32_t size)
{
    handle_t handle = bind_handle(state.range(0) == 1);
    void *request = nullptr;
    EXC1_FRAME frame;
    exc::guard(&frame, __FILE__, __LINE__, [&] { rpc__alloc_pkt(size, &request); });
    std::memset(static_cast<char *>(request) + RPC_DATA_OFFS, 0x5A, size);
    unsigned char reply_buf[1024];
    for (auto _ : state) {
        void *reply = nullptr;
        unsigned char must_free = 0;
        uint32_t raised = exc::guard(&frame, __FILE__, __LINE__, [&] {
            uint32_t reply_len = 0, drep = 0, status = 0;
            rpc__sar(handle, RPC_OPT_IDEMPOTENT, &ncsecho::kInterface, ncsecho::kEcho, request, size, reply_buf,
                     sizeof reply_buf, &reply, &reply_len, &drep, &must_free, &status);
        });
        if (raised != EXC1_FRAME_SET) {
            state.SkipWithError("call failed");
            break;
        }
        if (must_free)
            rpc__free_pkt(reply);
    }
    state.SetLabel(state.range(0) == 1 ? "tcp" : "in-process");
    state.SetItemsProcessed(state.iterations());
    state.SetBytesProcessed(state.iterations() * int64_t{size} * 2);
    rpc__free_pkt(request);
    uint32_t status = 0;
    rpc__free_handle(handle, &status);
}

void BM_RoundTrip(benchmark::State &state)
{
    echo(state, 8);
}
BENCHMARK(BM_RoundTrip)->Arg(0)->Arg(1)->UseRealTime();

void BM_LargeBody(benchmark::State &state)
{
    echo(state, 529488);
}
BENCHMARK(BM_LargeBody)->Arg(0)->Arg(1)->UseRealTime();

}  // namespace

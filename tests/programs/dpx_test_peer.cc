// A hub for tests: serves the interface with the library's own managers, but
// can answer as peers outside this library do: busy a number of times, quiet,
// with a list of node names or a query result, with a damaged checksum, or
// with a file that grows during a download. Prints "listening on HOST:PORT",
// then one line per call: "call OP 0xSTATUS" (agent_query first prints
// "query node=NODE").
//
// usage: dpx_test_peer --depot DIR --product NAME [--hub] [--broker]
//            [--busy K] [--quiet] [--nodes A,B,C] [--query-result N]
//            [--corrupt-get N] [--grow-after-get N]
#include "dpx/dpx.h"

#include "afw/afw.h"
#include "ncs/lb.h"
#include "ncs/server.h"

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <pthread.h>
#include <sstream>
#include <string>
#include <vector>

namespace {

std::atomic<int> g_busy_left{0};
bool g_quiet = false;
std::vector<std::string> g_nodes;
bool g_has_nodes = false;
int g_corrupt_call = 0;          // get_chunks call (1-based) whose checksum is damaged
int g_grow_call = 0;             // get_chunks call (1-based) after which the file grows
std::atomic<int> g_get_calls{0};
bool g_has_query_result = false;
uint32_t g_query_result = 0;
std::mutex g_out_mutex;

void report(const char *op, dpx_status status)
{
    std::lock_guard<std::mutex> hold(g_out_mutex);
    std::printf("call %s 0x%08X\n", op, status);
    std::fflush(stdout);
}

// True when this call is answered by the peer's own rule, with `*status` set.
bool answered_by_rule(dpx_status *status)
{
    int busy_left = g_busy_left.load();
    while (busy_left > 0 && !g_busy_left.compare_exchange_weak(busy_left, busy_left - 1)) {
    }
    if (busy_left > 0) {
        *status = DPX_E_BUSY;
        return true;
    }
    if (g_quiet) {
        *status = DPX_E_QUIET;
        return true;
    }
    return false;
}

// Appends a byte to the depot file of `path`, so that its identity changes.
void grow(const char *path)
{
    char full[DPX_PATH_LEN];
    if (dpx_get_full_path(path, full, sizeof full) != DPX_OK)
        return;
    std::ofstream(full, std::ios::binary | std::ios::app) << '+';
}

void peer_get_chunks(handle_t h, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index, int16_t *last,
                     int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    if (!answered_by_rule(status)) {
        dpx_get_chunks(h, desc, crc, state, index, last, max, status, buffer);
        int call = ++g_get_calls;
        if (call == g_corrupt_call)
            *crc ^= 0x5A5A5A5A;
        if (call == g_grow_call && *status == DPX_OK)
            grow(desc->path);
    }
    report("get_chunks", *status);
}

void peer_put_chunks(handle_t h, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last, int16_t max,
                     dpx_status *status, dpx_chunk buffer[])
{
    if (!answered_by_rule(status))
        dpx_put_chunks(h, desc, crc, state, last, max, status, buffer);
    report("put_chunks", *status);
}

void peer_agent_query(handle_t h, dpx_query_text query, dpx_file_desc desc, uint32_t *result, dpx_status *status)
{
    if (!answered_by_rule(status)) {
        char node[DPX_NODE_LEN + 1] = {};
        std::memcpy(node, desc.node, DPX_NODE_LEN);
        {
            std::lock_guard<std::mutex> hold(g_out_mutex);
            std::printf("query node=%s\n", node);
        }
        if (g_has_query_result) {
            *result = g_query_result;
            *status = DPX_OK;
        } else {
            dpx_agent_query(h, query, desc, result, status);
        }
    }
    report("agent_query", *status);
}

void peer_list_nodes(handle_t h, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                     dpx_node_name nodes[])
{
    if (!answered_by_rule(status)) {
        if (g_has_nodes) {
            int16_t n = 0;
            for (const auto &name : g_nodes) {
                if (n > max)
                    break;
                std::strncpy(nodes[n], name.c_str(), DPX_NODE_LEN);
                ++n;
            }
            *last = static_cast<int16_t>(n - 1);
            *status = DPX_OK;
        } else {
            dpx_list_nodes(h, filter, last, max, status, nodes);
        }
    }
    report("list_nodes", *status);
}

const dpx_transfer_v1_epv_t kPeerManagers = {peer_get_chunks, peer_put_chunks, peer_agent_query, peer_list_nodes};

}  // namespace

int main(int argc, char **argv)
{
    std::string depot, product, host = "127.0.0.1";
    bool hub = false, broker = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        auto next = [&]() -> std::string { return i + 1 < argc ? argv[++i] : ""; };
        if (arg == "--depot")
            depot = next();
        else if (arg == "--product")
            product = next();
        else if (arg == "--hub")
            hub = true;
        else if (arg == "--broker")
            broker = true;
        else if (arg == "--busy")
            g_busy_left = std::atoi(next().c_str());
        else if (arg == "--quiet")
            g_quiet = true;
        else if (arg == "--corrupt-get")
            g_corrupt_call = std::atoi(next().c_str());
        else if (arg == "--grow-after-get")
            g_grow_call = std::atoi(next().c_str());
        else if (arg == "--query-result") {
            g_has_query_result = true;
            g_query_result = static_cast<uint32_t>(std::strtoul(next().c_str(), nullptr, 0));
        }
        else if (arg == "--nodes") {
            g_has_nodes = true;
            std::stringstream list(next());
            std::string name;
            while (std::getline(list, name, ','))
                g_nodes.push_back(name);
        } else {
            std::fprintf(stderr, "dpx_test_peer: unknown argument %s\n", arg.c_str());
            return 2;
        }
    }
    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGTERM);
    sigaddset(&stop, SIGINT);
    pthread_sigmask(SIG_BLOCK, &stop, nullptr);

    if (!depot.empty())
        setenv("DPX_DEPOTROOT", depot.c_str(), 1);
    if (!product.empty())
        AFW_SetProductName(product.c_str());
    uint32_t status = rpc__s_ok;
    if (broker)
        lb__start_broker(host.c_str(), &status);
    socket__addr_t bound;
    uint32_t bound_len = sizeof bound;
    if (status == rpc__s_ok)
        rpc__listen(host.c_str(), 0, 8, &bound, &bound_len, &status);
    if (status == rpc__s_ok)
        rpc__register_mgr(&uuid__nil, &dpx_transfer_v1_if_spec, dpx_transfer_v1_server_epv, &kPeerManagers,
                          &status);
    lb__entry_t entry;
    std::memset(&entry, 0, sizeof entry);
    if (status == rpc__s_ok && hub) {
        uuid__decode(DPX_HUB_LB_UUID, &entry.obj_interface, &status);
        entry.saddr = bound;
        entry.saddr_len = bound_len;
        lb__register(&entry, &status);
    }
    if (status != rpc__s_ok) {
        std::fprintf(stderr, "dpx_test_peer: start failed 0x%08X\n", status);
        return 1;
    }
    char name[128] = "";
    uint32_t name_len = sizeof name;
    uint32_t port = 0;
    socket__to_name(&bound, bound_len, name, &name_len, &port, &status);
    std::printf("listening on %s:%u\n", name, port);
    std::fflush(stdout);

    int signo = 0;
    sigwait(&stop, &signo);
    rpc__unregister(&dpx_transfer_v1_if_spec, &status);
    rpc__stop_listening();
    if (broker)
        lb__stop_broker();
    return 0;
}

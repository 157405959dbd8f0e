// A hub for tests: the library's own managers, but answering as peers outside
// this library may: busy K times, quiet, with node names or a query result of
// its own, with a damaged checksum on the Nth get_chunks, with the file
// grown after the Nth, or saying on the Nth that more follows without
// delivering any. Prints "listening on HOST:PORT", then a line per call:
// "call OP 0xSTATUS", agent_query first "query node=NODE".
//
// usage: dpx_test_peer [--depot DIR] [--product NAME] [--hub] [--broker] [--busy K]
//            [--quiet] [--nodes A,B,C] [--query-result N] [--corrupt-get N] [--grow-after-get N]
//            [--stall-get N]
#include "dpx/dpx.h"

#include "afw/afw.h"
#include "ncs/lb.h"
#include "ncs/server.h"

#include <algorithm>
#include <arpa/inet.h>
#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

namespace {

std::atomic<int> g_busy_left{0}, g_get_calls{0};
bool g_quiet = false;
std::optional<std::vector<std::string>> g_nodes;
std::optional<uint32_t> g_query_result;
int g_corrupt_call = 0, g_grow_call = 0, g_stall_call = 0;
std::mutex g_out;

void report(const char *op, dpx_status status)
{
    std::lock_guard<std::mutex> hold(g_out);
    std::printf("call %s 0x%08X\n", op, status);
    std::fflush(stdout);
}

// True when the call is answered busy or quiet, with `*status` set.
bool answered_by_rule(dpx_status *status)
{
    bool busy = g_busy_left.fetch_sub(1) > 0;
    if (busy || g_quiet)
        *status = busy ? DPX_E_BUSY : DPX_E_QUIET;
    return busy || g_quiet;
}

void peer_get_chunks(handle_t h, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index, int16_t *last,
                     int16_t max, dpx_status *status, dpx_chunk buffer[])
{
    if (!answered_by_rule(status)) {
        const uint32_t asked = *index;
        dpx_get_chunks(h, desc, crc, state, index, last, max, status, buffer);
        int call = ++g_get_calls;
        if (call == g_stall_call) {
            *state = DPX_STATE_MORE;
            *index = asked;
            *last = -1;
        }
        char full[DPX_PATH_LEN];
        if (call == g_corrupt_call)
            *crc ^= 0x5A5A5A5A;
        if (call == g_grow_call && *status == DPX_OK && dpx_get_full_path(desc->path, full, sizeof full) == DPX_OK)
            std::ofstream(full, std::ios::binary | std::ios::app) << '+';
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
        {
            std::lock_guard<std::mutex> hold(g_out);
            std::printf("query node=%.*s\n", DPX_NODE_LEN, desc.node);
        }
        if (g_query_result) {
            *result = *g_query_result;
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
    bool ruled = answered_by_rule(status);
    if (!ruled && !g_nodes) {
        dpx_list_nodes(h, filter, last, max, status, nodes);
    } else if (!ruled) {
        *last = static_cast<int16_t>(std::min(static_cast<int>(g_nodes->size()), max + 1) - 1);
        for (int i = 0; i <= *last; ++i)
            std::strncpy(nodes[i], (*g_nodes)[static_cast<size_t>(i)].c_str(), DPX_NODE_LEN);
        *status = DPX_OK;
    }
    report("list_nodes", *status);
}

const dpx_transfer_v1_epv_t kPeerManagers = {peer_get_chunks, peer_put_chunks, peer_agent_query, peer_list_nodes};

}  // namespace

int main(int argc, char **argv)
{
    bool hub = false, broker = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        std::string value = i + 1 < argc ? argv[i + 1] : "";
        if (arg == "--hub" || arg == "--broker" || arg == "--quiet") {
            (arg == "--hub" ? hub : arg == "--broker" ? broker : g_quiet) = true;
            continue;
        }
        ++i;
        if (arg == "--depot")
            setenv("DPX_DEPOTROOT", value.c_str(), 1);
        else if (arg == "--product")
            AFW_SetProductName(value.c_str());
        else if (arg == "--busy")
            g_busy_left = std::atoi(value.c_str());
        else if (arg == "--corrupt-get")
            g_corrupt_call = std::atoi(value.c_str());
        else if (arg == "--grow-after-get")
            g_grow_call = std::atoi(value.c_str());
        else if (arg == "--stall-get")
            g_stall_call = std::atoi(value.c_str());
        else if (arg == "--query-result")
            g_query_result = static_cast<uint32_t>(std::strtoul(value.c_str(), nullptr, 0));
        else if (arg == "--nodes")
            for (std::stringstream list((g_nodes.emplace(), value)); std::getline(list, value, ',');)
                g_nodes->push_back(value);
        else
            return std::fprintf(stderr, "dpx_test_peer: unknown argument %s\n", arg.c_str()), 2;
    }
    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGTERM);
    sigaddset(&stop, SIGINT);
    pthread_sigmask(SIG_BLOCK, &stop, nullptr);

    uint32_t status = rpc__s_ok;
    if (broker)
        lb__start_broker("127.0.0.1", &status);
    socket__addr_t bound;
    uint32_t bound_len = sizeof bound;
    if (status == rpc__s_ok)
        rpc__listen("127.0.0.1", 0, 8, &bound, &bound_len, &status);
    if (status == rpc__s_ok)
        rpc__register_mgr(&uuid__nil, &dpx_transfer_v1_if_spec, dpx_transfer_v1_server_epv, &kPeerManagers, &status);
    lb__entry_t entry{};
    if (status == rpc__s_ok && hub) {
        uuid__decode(DPX_HUB_LB_UUID, &entry.obj_interface, &status);
        entry.saddr = bound;
        entry.saddr_len = bound_len;
        lb__register(&entry, &status);
    }
    if (status != rpc__s_ok)
        return std::fprintf(stderr, "dpx_test_peer: start failed 0x%08X\n", status), 1;
    std::printf("listening on 127.0.0.1:%u\n", ntohs(bound.in4.sin_port));
    std::fflush(stdout);

    int signo = 0;
    sigwait(&stop, &signo);
    if (hub)
        lb__unregister(&entry, &status);
    rpc__unregister(&dpx_transfer_v1_if_spec, &status);
    rpc__stop_listening();
    if (broker)
        lb__stop_broker();
    return 0;
}

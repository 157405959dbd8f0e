// dpx-agentd: hosts libdpx as a service. Brings up the RPC server on an
// address, starts the library, serves the depot until SIGTERM or SIGINT.
#include "dpx/dpx.h"
#include "rights.h"

#include "afw/afw.h"
#include "ncs/lb.h"
#include "ncs/server.h"

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <future>
#include <optional>
#include <pthread.h>
#include <systemd/sd-daemon.h>
#include <string>
#include <thread>

namespace {

const char kUsage[] =
    "usage: dpx-agentd --depot DIR --product NAME [--listen HOST:PORT] [--threads N] [--hub]\n"
    "                  [--advertise HOST:PORT] [--renew SECONDS] [--broker] [--confine]\n"
    "                  [--read-only] [--tls-cert FILE --tls-key FILE --tls-ca FILE [--rights FILE]]\n"
    "\n"
    "Serves the depot DIR/NAME to clients of the file transfer interface.\n"
    "\n"
    "  --depot DIR         depot root (sets DPX_DEPOTROOT for the library)\n"
    "  --product NAME      product name; files are served below DIR/NAME\n"
    "  --listen HOST:PORT  address to listen on (default 127.0.0.1 and a free port)\n"
    "  --threads N         calls run at once, 1 to 64 (default 32); a call that finds them\n"
    "                      all busy is answered busy (0xF11E0014) and the client retries\n"
    "  --hub               register this server in the host's location broker as the hub,\n"
    "                      so that clients whose hub is this host find it\n"
    "  --advertise HOST:PORT  the address registered with --hub, when clients reach this\n"
    "                      server elsewhere than where it listens (a wildcard --listen,\n"
    "                      a relay or a forwarded port); default: the address listened on\n"
    "  --renew SECONDS     with --hub and a broker in another process (dpx-lbd): register\n"
    "                      again this often, so that a broker that was restarted, and\n"
    "                      lost its entries, learns of this server again (default 10;\n"
    "                      0: never)\n"
    "  --broker            run the location broker inside this process, on the broker port\n"
    "  --confine           refuse (0xF11E0001) a path whose real location, symbolic links\n"
    "                      resolved, leaves DIR/NAME; off by default, when links in the\n"
    "                      depot are followed wherever they point (sets DPX_CONFINE=1)\n"
    "  --read-only         refuse every put (0xF11E0011, request declined by the peer)\n"
    "  --tls-cert FILE     TLS 1.3 on every connection, with this certificate (PEM chain),\n"
    "  --tls-key FILE      its key (refused when others may read it),\n"
    "  --tls-ca FILE       and the CA whose certificates clients must present; plain\n"
    "                      clients are refused. SIGHUP reloads the three files: new\n"
    "                      connections use them, open ones keep theirs\n"
    "  --rights FILE       with TLS: what each client may do, by its certificate's name:\n"
    "                      lines \"NAME read|write|read,write NODES PATHS\" (see the README);\n"
    "                      a call beyond them is declined (0xF11E0011)\n"
    "  --help              this text\n"
    "\n"
    "When ready it prints one line \"listening on HOST:PORT\" on standard output.\n"
    "It logs to standard error. SIGTERM or SIGINT stop it: calls under way finish,\n"
    "and it exits 0; calls still blocked after 5 seconds (a file whose open never\n"
    "returns) are abandoned, their connections closed with no reply. It exits 1\n"
    "when it can't listen, 2 on a usage error.\n"
    "\n"
    "Environment:\n"
    "  NCS_LB_PORT             port of the location broker (default 135)\n"
    "  NCS_MAX_CONNECTIONS     connections served at once (default 256)\n"
    "  NCS_MAX_CONNECTIONS_PER_PEER  connections from one address (default 64)\n"
    "  NCS_IDLE_TIMEOUT_S      idle connections are closed after this (default 300)\n"
    "  NCS_FRAME_TIMEOUT_S     a request must arrive whole this long after its first\n"
    "                          byte (default 30)\n"
    "  NCS_MAX_PENDING_BODY_MB request bodies still arriving, all together (default 64)\n"
    "  NCS_CALL_TIMEOUT_MS     time-out of one call on a connection (default 120000)\n"
    "  DPX_MAX_RETRY           tries of a call on a busy peer (default 6)\n"
    "  DPX_MIN_RETRY_INTERVAL  first sleep in seconds after a busy answer (default 3)\n"
    "  TRC1_FLAGS, TRC1_FILE   tracing: flag mask (0x01 flow, 0x40 entry/exit, 0x80 errors)\n"
    "                          and the file to append to (default standard error)\n";

struct Options {
    std::string depot;
    std::string product;
    std::string host = "127.0.0.1";
    uint32_t port = 0;
    std::string advertise_host;  // empty: register the address listened on
    uint32_t advertise_port = 0;
    uint32_t threads = 32;
    uint32_t renew_s = 10;
    bool hub = false;
    bool broker = false;
    bool confine = false;
    bool read_only = false;
    std::string tls_cert, tls_key, tls_ca;  // all empty: plain TCP
    std::string rights;                     // empty: every client may do everything
};

// The managers that answer while every thread that runs calls is busy: busy,
// and nothing else touched, so the client's retry sends the same call again.
void busy_get_chunks(handle_t, dpx_file_desc *, uint32_t *, uint8_t *, uint32_t *, int16_t *, int16_t,
                     dpx_status *status, dpx_chunk *)
{
    *status = DPX_E_BUSY;
}
void busy_put_chunks(handle_t, dpx_file_desc, uint32_t, uint8_t, int16_t *, int16_t, dpx_status *status,
                     dpx_chunk *)
{
    *status = DPX_E_BUSY;
}
void busy_agent_query(handle_t, dpx_query_text, dpx_file_desc, uint32_t *, dpx_status *status)
{
    *status = DPX_E_BUSY;
}
void busy_list_nodes(handle_t, dpx_node_filter, int16_t *, int16_t, dpx_status *status, dpx_node_name *)
{
    *status = DPX_E_BUSY;
}
const dpx_transfer_v1_epv_t kBusyManagers = {busy_get_chunks, busy_put_chunks, busy_agent_query, busy_list_nodes};

// The managers the daemon registers: the library's, behind its rights. A
// refused call is answered "request declined" (DPX_E_QUIET): the client
// neither retries it nor drops its binding. Both are set once, before the
// server takes calls.
bool g_read_only = false;
std::optional<dpxtools::Rights> g_rights;

// Whether the client of `handle` may have `access` to `desc` (null: to no
// file); a refusal is logged with the client's name.
bool allowed(handle_t handle, int access, const dpx_file_desc *desc, const char *operation)
{
    const bool writing = (access & dpxtools::Rights::kWrite) != 0;
    char name[256] = "";
    uint32_t status;
    rpc__inq_client_name(handle, name, sizeof name, &status);
    const char *why = nullptr;
    if (writing && g_read_only)
        why = "read-only";
    else if (g_rights && !g_rights->allows(name, access, desc != nullptr ? desc->node : nullptr, sizeof desc->node,
                                           desc != nullptr ? desc->path : nullptr, sizeof desc->path))
        why = "not in the rights";
    if (why == nullptr)
        return true;
    std::fprintf(stderr, "dpx-agentd: %s of \"%.*s\" on \"%.*s\" by \"%s\" refused: %s\n", operation,
                 desc != nullptr ? static_cast<int>(strnlen(desc->path, sizeof desc->path)) : 0,
                 desc != nullptr ? desc->path : "", desc != nullptr ? static_cast<int>(strnlen(desc->node, sizeof desc->node)) : 0,
                 desc != nullptr ? desc->node : "", name, why);
    return false;
}

void guarded_get_chunks(handle_t handle, dpx_file_desc *desc, uint32_t *crc, uint8_t *state, uint32_t *index,
                        int16_t *last, int16_t max, dpx_status *status, dpx_chunk *buffer)
{
    if (allowed(handle, dpxtools::Rights::kRead, desc, "get"))
        dpx_get_chunks(handle, desc, crc, state, index, last, max, status, buffer);
    else
        *status = DPX_E_QUIET;
}
void guarded_put_chunks(handle_t handle, dpx_file_desc desc, uint32_t crc, uint8_t state, int16_t *last,
                        int16_t max, dpx_status *status, dpx_chunk *buffer)
{
    if (allowed(handle, dpxtools::Rights::kWrite, &desc, "put"))
        dpx_put_chunks(handle, desc, crc, state, last, max, status, buffer);
    else
        *status = DPX_E_QUIET;
}
void guarded_agent_query(handle_t handle, dpx_query_text query, dpx_file_desc desc, uint32_t *result,
                         dpx_status *status)
{
    if (allowed(handle, dpxtools::Rights::kRead, &desc, "query"))
        dpx_agent_query(handle, query, desc, result, status);
    else
        *status = DPX_E_QUIET;
}
void guarded_list_nodes(handle_t handle, dpx_node_filter filter, int16_t *last, int16_t max, dpx_status *status,
                        dpx_node_name *nodes)
{
    if (allowed(handle, dpxtools::Rights::kRead, nullptr, "list"))
        dpx_list_nodes(handle, filter, last, max, status, nodes);
    else
        *status = DPX_E_QUIET;
}
const dpx_transfer_v1_epv_t kGuardedManagers = {guarded_get_chunks, guarded_put_chunks, guarded_agent_query,
                                                guarded_list_nodes};

// How long a stop waits for calls under way before the process ends without them.
constexpr auto kStopGrace = std::chrono::seconds(5);

int usage_error(const char *message)
{
    std::fprintf(stderr, "dpx-agentd: %s\n%s", message, kUsage);
    return 2;
}

bool parse_address(const std::string &text, std::string &host_out, uint32_t &port_out)
{
    size_t colon = text.rfind(':');
    if (colon == std::string::npos)
        return false;
    std::string host = text.substr(0, colon);
    if (host.size() >= 2 && host.front() == '[' && host.back() == ']')
        host = host.substr(1, host.size() - 2);
    char *end = nullptr;
    unsigned long port = std::strtoul(text.c_str() + colon + 1, &end, 10);
    if (host.empty() || end == text.c_str() + colon + 1 || *end != '\0' || port > 65535)
        return false;
    host_out = host;
    port_out = static_cast<uint32_t>(port);
    return true;
}

void log_line(const char *what, uint32_t status)
{
    char text[256];
    error__c_text(status, text, sizeof text);
    std::fprintf(stderr, "dpx-agentd: %s: 0x%08x %s\n", what, status, text);
}

}  // namespace

int main(int argc, char **argv)
{
    Options options;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        auto value = [&](const char *name) -> const char * {
            if (i + 1 >= argc) {
                std::fprintf(stderr, "dpx-agentd: %s needs a value\n", name);
                return nullptr;
            }
            return argv[++i];
        };
        if (arg == "--help" || arg == "-h") {
            std::fputs(kUsage, stdout);
            return 0;
        } else if (arg == "--depot") {
            const char *v = value("--depot");
            if (v == nullptr)
                return 2;
            options.depot = v;
        } else if (arg == "--product") {
            const char *v = value("--product");
            if (v == nullptr)
                return 2;
            options.product = v;
        } else if (arg == "--listen") {
            const char *v = value("--listen");
            if (v == nullptr || !parse_address(v, options.host, options.port))
                return usage_error("--listen wants HOST:PORT");
        } else if (arg == "--advertise") {
            const char *v = value("--advertise");
            if (v == nullptr || !parse_address(v, options.advertise_host, options.advertise_port))
                return usage_error("--advertise wants HOST:PORT");
        } else if (arg == "--threads") {
            const char *v = value("--threads");
            char *end = nullptr;
            unsigned long n = v != nullptr ? std::strtoul(v, &end, 10) : 0;
            if (v == nullptr || *end != '\0' || n == 0 || n > 64)
                return usage_error("--threads wants a number from 1 to 64");
            options.threads = static_cast<uint32_t>(n);
        } else if (arg == "--renew") {
            const char *v = value("--renew");
            char *end = nullptr;
            unsigned long n = v != nullptr ? std::strtoul(v, &end, 10) : 0;
            if (v == nullptr || *end != '\0' || n > 86400)
                return usage_error("--renew wants a number of seconds from 0 to 86400");
            options.renew_s = static_cast<uint32_t>(n);
        } else if (arg == "--hub") {
            options.hub = true;
        } else if (arg == "--broker") {
            options.broker = true;
        } else if (arg == "--confine") {
            options.confine = true;
        } else if (arg == "--read-only") {
            options.read_only = true;
        } else if (arg == "--tls-cert" || arg == "--tls-key" || arg == "--tls-ca" || arg == "--rights") {
            const char *v = value(arg.c_str());
            if (v == nullptr)
                return 2;
            (arg == "--tls-cert" ? options.tls_cert
             : arg == "--tls-key" ? options.tls_key
             : arg == "--tls-ca"  ? options.tls_ca
                                  : options.rights) = v;
        } else {
            return usage_error(("unknown argument " + arg).c_str());
        }
    }
    if (options.depot.empty() || options.product.empty())
        return usage_error("--depot and --product are required");
    if (!options.advertise_host.empty() && !options.hub)
        return usage_error("--advertise goes with --hub");
    const bool tls = !options.tls_cert.empty() || !options.tls_key.empty() || !options.tls_ca.empty();
    if (tls && (options.tls_cert.empty() || options.tls_key.empty() || options.tls_ca.empty()))
        return usage_error("--tls-cert, --tls-key and --tls-ca go together");
    if (!options.rights.empty()) {
        if (!tls)
            return usage_error("--rights goes with TLS: clients are known by their certificates");
        std::string error;
        g_rights = dpxtools::Rights::load(options.rights, error);
        if (!g_rights) {
            std::fprintf(stderr, "dpx-agentd: %s\n", error.c_str());
            return 1;
        }
    }

    // The signals are taken by the wait below; every thread inherits the mask.
    sigset_t stop_signals;
    sigemptyset(&stop_signals);
    sigaddset(&stop_signals, SIGTERM);
    sigaddset(&stop_signals, SIGINT);
    sigaddset(&stop_signals, SIGHUP);
    pthread_sigmask(SIG_BLOCK, &stop_signals, nullptr);
    std::signal(SIGPIPE, SIG_IGN);

    setenv("DPX_DEPOTROOT", options.depot.c_str(), 1);
    if (options.confine)
        setenv("DPX_CONFINE", "1", 1);
    AFW_SetProductName(options.product.c_str());

    uint32_t status = rpc__s_ok;
    socket__addr_t advertised;
    uint32_t advertised_len = 0;
    if (!options.advertise_host.empty()) {
        advertised_len = sizeof advertised;
        socket__from_name(0, options.advertise_host.c_str(), static_cast<uint32_t>(options.advertise_host.size()),
                          options.advertise_port, &advertised, &advertised_len, &status);
        if (status != rpc__s_ok) {
            log_line("cannot resolve the --advertise address", status);
            return 1;
        }
    }
    if (options.broker) {
        lb__start_broker(options.host.c_str(), &status);
        if (status != rpc__s_ok) {
            log_line("cannot start the location broker", status);
            return 1;
        }
    }
    if (tls) {
        rpc__tls_server(options.tls_cert.c_str(), options.tls_key.c_str(), options.tls_ca.c_str(), &status);
        if (status != rpc__s_ok) {
            log_line("cannot use the TLS files", status);
            if (options.broker)
                lb__stop_broker();
            return 1;
        }
    }
    socket__addr_t bound;
    uint32_t bound_len = sizeof bound;
    rpc__listen(options.host.c_str(), options.port, options.threads, &bound, &bound_len, &status);
    if (status != rpc__s_ok) {
        log_line("cannot listen", status);
        if (options.broker)
            lb__stop_broker();
        return 1;
    }
    dpx_agent_init();
    // The library's managers, behind the daemon's rights.
    dpx_rpc_unregister();
    g_read_only = options.read_only;
    rpc__register_mgr(&uuid__nil, &dpx_transfer_v1_if_spec, dpx_transfer_v1_server_epv, &kGuardedManagers, &status);
    rpc__register_busy_mgr(&dpx_transfer_v1_if_spec, &kBusyManagers, &status);

    lb__entry_t entry;
    std::memset(&entry, 0, sizeof entry);
    bool registered = false;
    if (options.hub) {
        uuid__decode(DPX_HUB_LB_UUID, &entry.obj_interface, &status);
        std::snprintf(entry.annotation, sizeof entry.annotation, "dpx hub %s", options.product.c_str());
        entry.saddr = advertised_len != 0 ? advertised : bound;
        entry.saddr_len = advertised_len != 0 ? advertised_len : bound_len;
        lb__register(&entry, &status);
        registered = status == rpc__s_ok;
        if (!registered)
            log_line("cannot register in the location broker", status);
    }

    char name[128] = "";
    uint32_t name_len = sizeof name;
    uint32_t port = 0;
    socket__to_name(&bound, bound_len, name, &name_len, &port, &status);
    bool v6 = std::strchr(name, ':') != nullptr;
    std::printf("listening on %s%s%s:%u\n", v6 ? "[" : "", name, v6 ? "]" : "", port);
    std::fflush(stdout);
    // Ready for a service manager that waits for it (Type=notify).
    sd_notify(0, "READY=1");
    std::fprintf(stderr, "dpx-agentd: serving %s/%s with %u threads%s%s%s%s\n", options.depot.c_str(),
                 options.product.c_str(), options.threads, options.hub ? ", hub" : "",
                 options.broker ? ", broker" : "", tls ? ", TLS" : "", options.read_only ? ", read-only" : "");

    // Registering again renews the entry, in its place, at a broker that has
    // it, and makes it anew at one that was restarted. The embedded broker goes and comes
    // with this process: nothing to renew.
    const bool renew = options.hub && !options.broker && options.renew_s > 0;
    int signal_number = -1;
    for (;;) {
        if (!renew) {
            sigwait(&stop_signals, &signal_number);
        } else {
            const timespec wait = {static_cast<time_t>(options.renew_s), 0};
            signal_number = sigtimedwait(&stop_signals, nullptr, &wait);
        }
        if (signal_number == SIGHUP) {
            sd_notify(0, "RELOADING=1");
            if (tls) {
                rpc__tls_server(options.tls_cert.c_str(), options.tls_key.c_str(), options.tls_ca.c_str(), &status);
                if (status == rpc__s_ok)
                    std::fprintf(stderr, "dpx-agentd: TLS files reloaded\n");
                else
                    log_line("cannot reload the TLS files, the old ones stay", status);
            }
            sd_notify(0, "READY=1");
            continue;
        }
        if (signal_number >= 0)
            break;
        lb__register(&entry, &status);
        // Only changes are logged: a broker that stays down is one line.
        if ((status == rpc__s_ok) != registered) {
            if (status == rpc__s_ok)
                std::fprintf(stderr, "dpx-agentd: registered in the location broker again\n");
            else
                log_line("cannot register in the location broker", status);
            registered = status == rpc__s_ok;
        }
    }
    std::fprintf(stderr, "dpx-agentd: signal %d, stopping\n", signal_number);
    sd_notify(0, "STOPPING=1");

    // Out of the broker first, so that no client finds this server any more;
    // then the calls under way run to their end before the library stops.
    if (options.hub)
        lb__unregister(&entry, &status);
    // A call whose manager never returns (a FIFO's open) would hold the stop
    // for ever: past the grace, the process ends and the kernel closes the
    // connections of such calls.
    std::packaged_task<void()> stopping([] {
        rpc__stop_listening();
        dpx_agent_stop();
    });
    std::future<void> stopped = stopping.get_future();
    std::thread(std::move(stopping)).detach();
    if (stopped.wait_for(kStopGrace) != std::future_status::ready) {
        std::fprintf(stderr, "dpx-agentd: calls still blocked after %lld s, abandoned\n",
                     static_cast<long long>(kStopGrace.count()));
        std::fflush(stderr);
        std::_Exit(0);
    }
    if (options.broker)
        lb__stop_broker();
    std::fprintf(stderr, "dpx-agentd: stopped\n");
    return 0;
}

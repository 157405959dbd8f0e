// dpx-lbd: the location broker of a host as a program of its own.
#include "ncs/lb.h"
#include "ncs/ncs.h"
#include "plt/plt1.h"
#include "trc/trc1.h"

#include <pthread.h>
#include <systemd/sd-daemon.h>

#include <csignal>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

namespace {

constexpr const char kUsage[] =
    "usage: dpx-lbd [--listen HOST]\n"
    "       dpx-lbd --help\n"
    "\n"
    "Runs the location broker of this host: servers register the addresses of\n"
    "their interfaces with it, and clients on any host look them up there.\n"
    "The entries of a server go when its connection to the broker closes, as\n"
    "when it ends; the broker keeps nothing on disk.\n"
    "\n"
    "Options:\n"
    "  --listen HOST  host name or address to listen on (default 127.0.0.1);\n"
    "                 0.0.0.0 for every IPv4 address, :: for every address\n"
    "  --help         print this text and exit\n"
    "\n"
    "Environment:\n"
    "  NCS_LB_PORT    port to listen on (default 135); 0 takes a free port,\n"
    "                 which the line below then names\n"
    "  TRC1_FLAGS     trace flags: 0x01 registrations and removals, 0x80 errors\n"
    "                 (default 0x81 here)\n"
    "  TRC1_FILE      file that traces are appended to (default standard error)\n"
    "\n"
    "When it listens it prints \"listening on HOST:PORT\" on standard output\n"
    "(an IPv6 host in brackets). It logs to standard error. It exits with 0 on\n"
    "SIGTERM or SIGINT, with 1 when it can't listen, with 2 on a usage error.\n";

// The embedded broker of this process, stopped when it goes.
class BrokerRun {
public:
    explicit BrokerRun(const char *host) { lb__start_broker(host, &status_); }
    ~BrokerRun()
    {
        if (status_ == rpc__s_ok)
            lb__stop_broker();
    }
    BrokerRun(const BrokerRun &) = delete;
    BrokerRun &operator=(const BrokerRun &) = delete;
    uint32_t status() const { return status_; }

private:
    uint32_t status_ = rpc__s_ok;
};

std::string status_text(uint32_t status)
{
    char text[256];
    return error__c_text(status, text, sizeof text);
}

// "HOST:PORT" of the broker of this process, an IPv6 host in brackets.
std::string listen_address()
{
    socket__addr_t addr;
    uint32_t addr_len = sizeof addr;
    uint32_t status;
    lb__inq_broker(&addr, &addr_len, &status);
    char host[64];
    uint32_t host_len = sizeof host;
    uint32_t port = 0;
    if (status == rpc__s_ok)
        socket__to_name(&addr, addr_len, host, &host_len, &port, &status);
    if (status != rpc__s_ok)
        return "?";
    std::string name = addr.sa.sa_family == AF_INET6 ? "[" + std::string(host) + "]" : std::string(host);
    return name + ":" + std::to_string(port);
}

}  // namespace

int main(int argc, char **argv)
{
    const char *host = "127.0.0.1";
    for (int i = 1; i < argc; ++i) {
        std::string_view arg = argv[i];
        if (arg == "--help") {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (arg == "--listen" && i + 1 < argc) {
            host = argv[++i];
            continue;
        }
        std::fprintf(stderr, "dpx-lbd: unexpected argument '%s'\n%s", argv[i], kUsage);
        return 2;
    }

    // The signals wait for sigwait below; the broker's thread inherits the mask.
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);

    if (PLT1_GetEnv("TRC1_FLAGS", nullptr) == nullptr)
        TRC1_Configure(TRC1_FLOW | TRC1_ERROR, PLT1_GetEnv("TRC1_FILE", nullptr));

    BrokerRun broker(host);
    if (broker.status() != rpc__s_ok) {
        std::fprintf(stderr, "dpx-lbd: can't run the broker at %s port %u: %s (0x%x)\n", host, lb__broker_port(),
                     status_text(broker.status()).c_str(), broker.status());
        return 1;
    }
    std::string address = listen_address();
    std::printf("listening on %s\n", address.c_str());
    std::fflush(stdout);
    std::fprintf(stderr, "dpx-lbd: broker running on %s\n", address.c_str());
    // Ready for a service manager that waits for it (Type=notify).
    sd_notify(0, "READY=1");

    int signal = 0;
    sigwait(&signals, &signal);
    std::fprintf(stderr, "dpx-lbd: stopping on signal %d (%s)\n", signal, strsignal(signal));
    sd_notify(0, "STOPPING=1");
    return 0;
}

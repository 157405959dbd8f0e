// A server of the tests' echo interface in a process of its own: listens on
// 127.0.0.1 at a free port, prints "listening on HOST:PORT" and serves until
// SIGTERM or SIGINT.
#include "ncs/server.h"
#include "ncs_echo.h"

#include <csignal>
#include <cstdio>

int main()
{
    sigset_t stop_signals;
    sigemptyset(&stop_signals);
    sigaddset(&stop_signals, SIGTERM);
    sigaddset(&stop_signals, SIGINT);
    // Blocked before the server's threads start, so they inherit the mask.
    pthread_sigmask(SIG_BLOCK, &stop_signals, nullptr);

    if (ncsecho::register_interface() != rpc__s_ok) {
        std::fprintf(stderr, "ncs_echo_server: can't register the interface\n");
        return 1;
    }
    socket__addr_t bound{};
    uint32_t bound_len = 0;
    uint32_t status = 0;
    rpc__listen("127.0.0.1", 0, 4, &bound, &bound_len, &status);
    if (status != rpc__s_ok) {
        std::fprintf(stderr, "ncs_echo_server: can't listen: 0x%x\n", status);
        return 1;
    }
    std::printf("listening on 127.0.0.1:%u\n", ntohs(bound.in4.sin_port));
    std::fflush(stdout);

    int signal = 0;
    sigwait(&stop_signals, &signal);
    rpc__stop_listening();
    ncsecho::unregister_interface();
    return 0;
}

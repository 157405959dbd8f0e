// No peer can starve the daemon: not one that holds hundreds of connections
// with bodies that never come, not calls whose file blocks on open, not a
// process out of descriptors.
#include "hub.h"

#include "dpxagt.h"
#include "ncs/frame.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using namespace dpxtest;
using Clock = std::chrono::steady_clock;

// A connection from `source` to the daemon on 127.0.0.1; -1 if it failed.
int connect_from(const char *source, uint16_t port)
{
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in from{AF_INET, 0, {inet_addr(source)}, {}}, to{AF_INET, htons(port), {htonl(INADDR_LOOPBACK)}, {}};
    if (bind(fd, reinterpret_cast<sockaddr *>(&from), sizeof from) != 0 ||
        connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof to) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// CPU seconds that process `pid` has used.
double cpu_seconds(pid_t pid)
{
    std::string stat = read_file("/proc/" + std::to_string(pid) + "/stat");
    std::istringstream fields(stat.substr(stat.rfind(')') + 2));
    std::string skip;
    for (int i = 3; i < 14; ++i)
        fields >> skip;
    double user = 0, system = 0;
    fields >> user >> system;
    return (user + system) / double(sysconf(_SC_CLK_TCK));
}

TEST(Starvation, APeerHoldingThreeHundredConnectionsLeavesAnotherClientServed)
{
    Hub hub;
    write_file(hub.depot_file("big.bin"), pattern_bytes(1 << 20, 5));
    // A quarter of them promise a body of 1 MiB and fall silent.
    std::vector<int> held;
    for (int i = 0; i < 300; ++i) {
        int fd = connect_from("127.0.0.2", hub.port);
        ASSERT_GE(fd, 0);
        held.push_back(fd);
        if (i % 4 != 0)
            continue;
        ncs::frame::Header h{.kind = ncs::frame::kRequest, .call_id = 1, .drep = NCS_DREP_LOCAL,
                             .if_id = dpx_transfer_v1_if_spec.id, .if_vers = 1, .opnum = DPX_OP_PUT_CHUNKS,
                             .body_len = RPC_MAX_BODY};
        ncs::frame::Bytes bytes;
        ncs::frame::encode(h, bytes);
        send(fd, bytes, sizeof bytes, MSG_NOSIGNAL);
    }
    auto started = Clock::now();
    EXPECT_EQ(GetFile("node1", "big.bin", (hub / "copy.bin").c_str()), DPX_OK);
    EXPECT_LT(Clock::now() - started, std::chrono::seconds(15));
    EXPECT_TRUE(same_files(hub.depot_file("big.bin"), hub / "copy.bin"));
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
    // A sanitizer's shadow memory would count here too.
    EXPECT_LT(resources_of(hub.daemon->pid()).rss_kib, 64u * 1024);
#endif
    for (int fd : held)
        close(fd);
}

TEST(Starvation, GetsBlockedOnAFifoHoldOnlyTheirWorkersAndSigtermStillEndsTheDaemon)
{
    Hub hub;
    ASSERT_EQ(mkfifo(hub.depot_file("pipe").c_str(), 0644), 0);
    write_file(hub.depot_file("ok.bin"), pattern_bytes(300000, 6));
    std::vector<std::unique_ptr<Process>> blocked;
    for (int i = 0; i < 10; ++i)
        blocked.push_back(std::make_unique<Process>(
            std::vector<std::string>{bin_dir() + "/dpx", "--quiet", "get", "node1", "pipe", hub / std::to_string(i)}));
    std::this_thread::sleep_for(std::chrono::seconds(1));

    auto started = Clock::now();
    EXPECT_EQ(GetFile("node1", "ok.bin", (hub / "ok.bin").c_str()), DPX_OK);
    EXPECT_LT(Clock::now() - started, std::chrono::seconds(15));
    EXPECT_TRUE(same_files(hub.depot_file("ok.bin"), hub / "ok.bin"));

    started = Clock::now();
    hub.daemon->signal(SIGTERM);
    EXPECT_TRUE(exited_with(hub.daemon->wait(std::chrono::seconds(15)), 0));
    EXPECT_LT(Clock::now() - started, std::chrono::seconds(15));
}

TEST(Starvation, ADaemonOutOfDescriptorsWaitsForThemWithoutSpinningAndServesAgain)
{
    Hub hub;
    hub.daemon->signal(SIGTERM);
    hub.daemon->wait();
    hub.daemon = std::make_unique<Process>(std::vector<std::string>{
        "/bin/sh", "-c", "ulimit -n 48; exec \"$0\" --depot \"$1\" --product prod --hub", bin_dir() + "/dpx-agentd",
        hub.depot});
    hub.port = listening_port(*hub.daemon);
    ASSERT_NE(hub.port, 0);
    std::vector<int> held;
    for (int i = 0; i < 60; ++i)
        held.push_back(connect_from("127.0.0.1", hub.port));
    double before = cpu_seconds(hub.daemon->pid());
    std::this_thread::sleep_for(std::chrono::seconds(2));
    EXPECT_LT(cpu_seconds(hub.daemon->pid()) - before, 0.5);
    for (int fd : held)
        close(fd);
    write_file(hub.depot_file("after.bin"), "served again");
    EXPECT_EQ(GetFile("node1", "after.bin", (hub / "after.bin").c_str()), DPX_OK);
}

}  // namespace

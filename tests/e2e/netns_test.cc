// The hub and a client on two hosts of their own: network namespaces joined
// by a veth pair, addresses in 10.200.0.0/16 that exist only inside them.
// The link loses 1 % of the packets each way (dropped on arrival, so TCP
// recovers as from a lossy wire) and delays every byte 50 ms each way: this
// kernel has no delaying queueing discipline, so the hub is reached through a
// relay in its namespace that holds the bytes, and the daemon advertises the
// relay. The client is the dpx program. Skipped where namespaces can't be made.
#include "hub.h"

#include <unistd.h>

namespace {

using namespace dpxtest;

const char kIp[] = "/usr/sbin/ip";
const char kNft[] = "/usr/sbin/nft";
constexpr int kDelayMs = 50, kRelayPort = 7000, kBrokerPort = 1350;

// Two namespaces, "hub" and "client", and the lossy link between them,
// removed at the end with everything in them.
class TwoHosts {
public:
    TwoHosts()
    {
        if (access(kIp, X_OK) != 0 || access(kNft, X_OK) != 0) {
            reason = "needs ip (iproute2) and nft (nftables)";
            return;
        }
        if (!(made_ = ok({kIp, "netns", "add", hub}))) {
            reason = "cannot make a network namespace: needs CAP_SYS_ADMIN and CAP_NET_ADMIN";
            return;
        }
        std::vector<std::vector<std::string>> steps = {
            {kIp, "netns", "add", client},
            {kIp, "link", "add", hub_link, "netns", hub, "type", "veth", "peer", "name", client_link, "netns", client}};
        for (const auto &[ns, link, host] : {std::tuple{hub, hub_link, "1"}, std::tuple{client, client_link, "2"}}) {
            steps.push_back({kIp, "-n", ns, "addr", "add", subnet + host + "/24", "dev", link});
            steps.push_back({kIp, "-n", ns, "link", "set", "lo", "up"});
            steps.push_back({kIp, "-n", ns, "link", "set", link, "up"});
            // One packet in a hundred that arrive over the link is dropped.
            steps.push_back(in(ns, {kNft, "add table inet dpxloss; add chain inet dpxloss in { type filter hook input "
                                          "priority 0; }; add rule inet dpxloss in iifname " + link +
                                          " numgen random mod 100 == 0 counter drop"}));
        }
        for (const auto &step : steps)
            if (reason.empty() && !ok(step))
                reason = "cannot set up the hosts (needs veth and nf_tables): " + step[1] + " " + step[2];
    }
    ~TwoHosts()
    {
        if (made_) {
            ok({kIp, "netns", "del", client});
            ok({kIp, "netns", "del", hub});
        }
    }

    static bool ok(const std::vector<std::string> &argv) { return exited_with(run(argv).wstatus, 0); }

    // argv run inside namespace `ns`.
    static std::vector<std::string> in(const std::string &ns, std::vector<std::string> argv)
    {
        argv.insert(argv.begin(), {kIp, "netns", "exec", ns});
        return argv;
    }

    // Packets the loss has dropped on arrival in `ns` so far.
    long dropped(const std::string &ns) const
    {
        for (const auto &line : run(in(ns, {kNft, "list", "chain", "inet", "dpxloss", "in"})).out)
            if (line.find("iifname") != std::string::npos && line.find("packets ") != std::string::npos)
                return std::atol(line.c_str() + line.find("packets ") + 8);
        return -1;
    }

    std::string reason;  // empty when the hosts are ready
    const std::string tag = std::to_string(getpid() % 100000), hub = "dpxh" + tag, client = "dpxc" + tag;
    const std::string subnet = "10.200." + std::to_string(getpid() % 250) + ".", hub_address = subnet + "1";
    const std::string client_address = subnet + "2";
    const std::string hub_link = "vh" + tag, client_link = "vc" + tag;

private:
    bool made_ = false;
};

TEST(TwoHosts, AFileCrossesALossySlowLinkWholeAndACutLinkFailsTheTransferCleanly)
{
    TwoHosts hosts;
    if (!hosts.reason.empty())
        GTEST_SKIP() << hosts.reason;
    TempDir dir;
    made_dir(dir / "depot/prod");
    made_dir(dir / "tmp");
    // Under the sanitizers a smaller file crosses.
    size_t size = slow_skipped() ? (8u << 20) : (100u << 20);
    write_file(dir / "source.bin", pattern_bytes(size, 21));

    Process daemon(hosts.in(hosts.hub, {bin_dir() + "/dpx-agentd", "--depot", dir / "depot", "--product", "prod",
                                        "--listen", hosts.hub_address + ":0", "--hub", "--advertise",
                                        hosts.hub_address + ":" + std::to_string(kRelayPort), "--broker"}),
                   {{"NCS_LB_PORT", std::to_string(kBrokerPort)}});
    uint16_t port = listening_port(daemon);
    ASSERT_NE(port, 0);
    Process delay(hosts.in(hosts.hub, {bin_dir() + "/dpx_test_delay", hosts.hub_address, std::to_string(kRelayPort),
                                       hosts.hub_address, std::to_string(port), std::to_string(kDelayMs)}));
    ASSERT_NE(listening_port(delay, "relaying on "), 0);
    auto dpx = [&](std::vector<std::string> args) {
        args.insert(args.begin(), {bin_dir() + "/dpx", "--quiet"});
        return run(hosts.in(hosts.client, args),
                   {{"AFW_HUB_HOST", std::nullopt}, {"DPX_HUBHOST", hosts.hub_address},
                    {"NCS_LB_PORT", std::to_string(kBrokerPort)}, {"NCS_CALL_TIMEOUT_MS", "10000"},
                    {"TMPDIR", dir / "tmp"}},
                   std::chrono::minutes(14));
    };

    auto started = std::chrono::steady_clock::now();
    Ran put = dpx({"put", "node1", "big.bin", dir / "source.bin"});
    EXPECT_TRUE(exited_with(put.wstatus, 0)) << put.err;
    Ran get = dpx({"get", "node1", "big.bin", dir / "target.bin"});
    EXPECT_TRUE(exited_with(get.wstatus, 0)) << get.err;
    EXPECT_TRUE(same_files(dir / "source.bin", dir / "depot/prod/big.bin"));
    EXPECT_TRUE(same_files(dir / "source.bin", dir / "target.bin"));
    long dropped_up = hosts.dropped(hosts.hub), dropped_down = hosts.dropped(hosts.client);
    std::printf("%zu bytes up and down a link with %d ms delay each way in %.1f s; packets lost: %ld up, %ld down\n",
                size, kDelayMs, std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count(),
                dropped_up, dropped_down);
    EXPECT_GT(dropped_up, 0);
    EXPECT_GT(dropped_down, 0);

    // The link goes down once a download has begun to arrive: the client
    // fails at its call's time-out and leaves neither a target nor a
    // temporary file.
    write_file(dir / "depot/prod/cut.bin", pattern_bytes(64u << 20, 22));
    std::thread cut([&] {
        auto begun = [&] {
            for (const auto &name : files_with_prefix(dir / "tmp", "cxp")) {
                std::error_code ec;
                if (std::filesystem::file_size(name, ec) > 0 && !ec)
                    return true;
            }
            return false;
        };
        for (int i = 0; i < 60000 && !begun(); ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        TwoHosts::ok(hosts.in(hosts.hub, {kIp, "link", "set", hosts.hub_link, "down"}));
    });
    auto cut_at = std::chrono::steady_clock::now();
    Ran lost = dpx({"get", "node1", "cut.bin", dir / "lost.bin"});
    cut.join();
    // The call's time-out (10 s here) bounds the wait: a time-out is never
    // repeated. The rest is room for a busy machine.
    EXPECT_LT(std::chrono::steady_clock::now() - cut_at, std::chrono::seconds(40));
    EXPECT_TRUE(exited_with(lost.wstatus, 1)) << lost.err;
    EXPECT_EQ(lost.err.rfind("0x1C01", 0), 0u) << "not a communication failure: " << lost.err;
    EXPECT_FALSE(file_exists(dir / "lost.bin"));
    EXPECT_TRUE(files_with_prefix(dir / "tmp", "cxp").empty());

    delay.signal(SIGKILL);
    daemon.signal(SIGTERM);
    EXPECT_TRUE(exited_with(daemon.wait(), 0));
}

// A broker reachable from another host takes lookups from there, but no
// registration: a stranger can't point the host's clients elsewhere.
TEST(TwoHosts, TheBrokerRefusesRegistrationsFromAnotherHostAndStillAnswersItsLookups)
{
    TwoHosts hosts;
    if (!hosts.reason.empty())
        GTEST_SKIP() << hosts.reason;
    TempDir dir;
    made_dir(dir / "depot/prod");
    Process daemon(hosts.in(hosts.hub, {bin_dir() + "/dpx-agentd", "--depot", dir / "depot", "--product", "prod",
                                        "--listen", hosts.hub_address + ":0", "--hub", "--broker"}),
                   {{"NCS_LB_PORT", std::to_string(kBrokerPort)}, {"TRC1_FLAGS", "0x80"},
                    {"TRC1_FILE", dir / "trace"}});
    uint16_t port = listening_port(daemon);
    ASSERT_NE(port, 0);
    const std::vector<std::string> tries = {bin_dir() + "/dpx_test_register", hosts.hub_address};
    const std::string hub = hosts.hub_address + ":" + std::to_string(port);
    Ran stranger = run(hosts.in(hosts.client, tries), {{"NCS_LB_PORT", std::to_string(kBrokerPort)}});
    ASSERT_EQ(stranger.out.size(), 2u) << stranger.err;
    EXPECT_EQ(stranger.out[0], "register 0x1C030005");
    EXPECT_EQ(stranger.out[1], "lookup 0x00000000 1 " + hub);
    EXPECT_NE(read_file(dir / "trace").find("registration from " + hosts.client_address + " refused"),
              std::string::npos);
    // The same message from the broker's own host is taken (and goes with
    // its connection, before the lookup).
    Ran own = run(hosts.in(hosts.hub, tries), {{"NCS_LB_PORT", std::to_string(kBrokerPort)}});
    ASSERT_EQ(own.out.size(), 2u) << own.err;
    EXPECT_EQ(own.out[0], "register 0x00000000");
    daemon.signal(SIGTERM);
    EXPECT_TRUE(exited_with(daemon.wait(), 0));
}

}  // namespace

// The hub and a client on two hosts of their own: network namespaces made by
// the test, joined by a veth pair, addresses in 10.200.0.0/16 that exist only
// inside them. The link loses 1 % of the packets each way (the kernel drops
// them on arrival, so TCP recovers as from a lossy wire) and delays every
// byte 50 ms each way: this kernel has no delaying queueing discipline, so
// the hub is reached through a relay in its namespace that holds the bytes,
// and the daemon advertises the relay. The client is the dpx program, run in
// its namespace. Skipped where namespaces can't be made.
#include "client_hub.h"

#include <cstdlib>
#include <unistd.h>

using dpxtest::exited_with;
using dpxtest::Process;
using dpxtest::TempDir;

namespace {

const char kIp[] = "/usr/sbin/ip";
const char kNft[] = "/usr/sbin/nft";
constexpr int kDelayMs = 50;
constexpr int kRelayPort = 7000;

int run(const std::vector<std::string> &argv)
{
    Process process(argv, {}, "/dev/null");
    return process.wait(std::chrono::seconds(30));
}

// Two namespaces, "hub" and "client", and the lossy link between them,
// removed at the end with everything in them.
class TwoHosts {
public:
    TwoHosts()
        : tag_(std::to_string(getpid() % 100000)),
          hub("dpxh" + tag_),
          client("dpxc" + tag_),
          subnet("10.200." + std::to_string(getpid() % 250) + "."),
          hub_address(subnet + "1"),
          hub_link("vh" + tag_)
    {
        if (access(kIp, X_OK) != 0 || access(kNft, X_OK) != 0) {
            reason = "needs ip (iproute2) and nft (nftables)";
            return;
        }
        if (!exited_with(run({kIp, "netns", "add", hub}), 0)) {
            reason = "cannot make a network namespace: needs CAP_SYS_ADMIN and CAP_NET_ADMIN";
            return;
        }
        made_ = true;
        std::string client_link = "vc" + tag_;
        const std::vector<std::vector<std::string>> steps = {
            {kIp, "netns", "add", client},
            {kIp, "link", "add", hub_link, "netns", hub, "type", "veth", "peer", "name", client_link, "netns", client},
            {kIp, "-n", hub, "addr", "add", subnet + "1/24", "dev", hub_link},
            {kIp, "-n", client, "addr", "add", subnet + "2/24", "dev", client_link},
            {kIp, "-n", hub, "link", "set", "lo", "up"},
            {kIp, "-n", client, "link", "set", "lo", "up"},
            {kIp, "-n", hub, "link", "set", hub_link, "up"},
            {kIp, "-n", client, "link", "set", client_link, "up"},
        };
        for (const auto &step : steps) {
            if (!exited_with(run(step), 0)) {
                reason = "cannot set up the link: " + step[1] + " " + step[2] + " " + step[3];
                return;
            }
        }
        for (const auto &[ns, link] : {std::pair{hub, hub_link}, std::pair{client, client_link}}) {
            if (!lossy(ns, link)) {
                reason = "cannot add packet loss with nft: needs nf_tables";
                return;
            }
        }
    }
    ~TwoHosts()
    {
        if (made_) {
            run({kIp, "netns", "del", client});
            run({kIp, "netns", "del", hub});
        }
    }
    TwoHosts(const TwoHosts &) = delete;
    TwoHosts &operator=(const TwoHosts &) = delete;

    // argv run inside namespace `ns`.
    std::vector<std::string> in(const std::string &ns, std::vector<std::string> argv) const
    {
        argv.insert(argv.begin(), {kIp, "netns", "exec", ns});
        return argv;
    }

    // Packets the loss has dropped on arrival in `ns` so far.
    long dropped(const std::string &ns) const
    {
        Process list(in(ns, {kNft, "list", "chain", "inet", "dpxloss", "in"}), {}, "/dev/null");
        auto line = list.wait_line("\t\tiifname");
        list.wait();
        size_t at = line ? line->find("packets ") : std::string::npos;
        return at == std::string::npos ? -1 : std::atol(line->c_str() + at + 8);
    }

    std::string reason;  // empty when the hosts are ready

private:
    // One packet in a hundred that arrive over `link` in `ns` is dropped.
    bool lossy(const std::string &ns, const std::string &link) const
    {
        const std::vector<std::vector<std::string>> steps = {
            {kNft, "add", "table", "inet", "dpxloss"},
            {kNft, "add", "chain", "inet", "dpxloss", "in", "{ type filter hook input priority 0; }"},
            {kNft, "add", "rule", "inet", "dpxloss", "in", "iifname", link, "numgen", "random", "mod", "100", "==",
             "0", "counter", "drop"},
        };
        for (const auto &step : steps) {
            if (!exited_with(run(in(ns, step)), 0))
                return false;
        }
        return true;
    }

    std::string tag_;
    bool made_ = false;

public:
    const std::string hub, client, subnet, hub_address, hub_link;
};

constexpr int kBrokerPort = 1350;

// The dpx program on the client host; its exit status and standard error.
std::pair<int, std::string> dpx(const TwoHosts &hosts, const TempDir &dir, std::vector<std::string> args)
{
    args.insert(args.begin(), {dpxtest::bin_dir() + "/dpx", "--quiet"});
    Process process(hosts.in(hosts.client, args),
                    {{"AFW_HUB_HOST", std::nullopt},
                     {"DPX_HUBHOST", hosts.hub_address},
                     {"NCS_LB_PORT", std::to_string(kBrokerPort)},
                     {"NCS_CALL_TIMEOUT_MS", "10000"},
                     {"TMPDIR", dir / "tmp"}},
                    dir / "stderr");
    int wstatus = process.wait(std::chrono::minutes(14));
    return {wstatus, dpxtest::read_file(dir / "stderr")};
}

TEST(TwoHosts, AFileCrossesALossySlowLinkWholeAndACutLinkFailsTheTransferCleanly)
{
    TwoHosts hosts;
    if (!hosts.reason.empty())
        GTEST_SKIP() << hosts.reason;
    TempDir dir;
    std::filesystem::create_directories(dir / "depot/prod");
    std::filesystem::create_directories(dir / "tmp");
    // Under the sanitizers a smaller file crosses.
    size_t size = std::getenv("DPX_SKIP_SLOW") != nullptr ? (8u << 20) : (100u << 20);
    dpxtest::write_file(dir / "source.bin", dpxtest::pattern_bytes(size, 21));

    const std::string relay = hosts.hub_address + ":" + std::to_string(kRelayPort);
    Process daemon(hosts.in(hosts.hub, {dpxtest::bin_dir() + "/dpx-agentd", "--depot", dir / "depot", "--product",
                                        "prod", "--listen", hosts.hub_address + ":0", "--hub", "--advertise", relay,
                                        "--broker"}),
                   {{"NCS_LB_PORT", std::to_string(kBrokerPort)}});
    auto listening = daemon.wait_line("listening on ");
    ASSERT_TRUE(listening.has_value());
    std::string port = listening->substr(listening->rfind(':') + 1);
    Process delay(hosts.in(hosts.hub, {dpxtest::bin_dir() + "/dpx_test_delay", hosts.hub_address,
                                       std::to_string(kRelayPort), hosts.hub_address, port,
                                       std::to_string(kDelayMs)}));
    ASSERT_TRUE(delay.wait_line("relaying on ").has_value());

    auto started = std::chrono::steady_clock::now();
    auto [put, put_err] = dpx(hosts, dir, {"put", "node1", "big.bin", dir / "source.bin"});
    EXPECT_TRUE(exited_with(put, 0)) << put_err;
    auto [get, get_err] = dpx(hosts, dir, {"get", "node1", "big.bin", dir / "target.bin"});
    EXPECT_TRUE(exited_with(get, 0)) << get_err;
    EXPECT_EQ(dpxtest::compare_files(dir / "source.bin", dir / "depot/prod/big.bin"), "");
    EXPECT_EQ(dpxtest::compare_files(dir / "source.bin", dir / "target.bin"), "");
    long dropped_up = hosts.dropped(hosts.hub), dropped_down = hosts.dropped(hosts.client);
    std::printf("%zu bytes up and down a link with %d ms delay each way in %.1f s; packets lost: %ld up, %ld down\n",
                size, kDelayMs, std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count(),
                dropped_up, dropped_down);
    EXPECT_GT(dropped_up, 0);
    EXPECT_GT(dropped_down, 0);

    // The link goes down once a download has begun to arrive: the client
    // fails at its call's time-out and leaves neither a target nor a
    // temporary file.
    dpxtest::write_file(dir / "depot/prod/cut.bin", dpxtest::pattern_bytes(64u << 20, 22));
    std::thread cut([&] {
        auto begun = [&] {
            for (const auto &name : dpxtest::files_with_prefix(dir / "tmp", "cxp")) {
                std::error_code ec;
                if (std::filesystem::file_size(name, ec) > 0 && !ec)
                    return true;
            }
            return false;
        };
        for (int i = 0; i < 60000 && !begun(); ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        run(hosts.in(hosts.hub, {kIp, "link", "set", hosts.hub_link, "down"}));
    });
    auto cut_at = std::chrono::steady_clock::now();
    auto [lost, lost_err] = dpx(hosts, dir, {"get", "node1", "cut.bin", dir / "lost.bin"});
    cut.join();
    // The call's time-out (10 s here) bounds the wait: a time-out is never
    // repeated. The rest is room for a busy machine.
    EXPECT_LT(std::chrono::steady_clock::now() - cut_at, std::chrono::seconds(40));
    EXPECT_TRUE(exited_with(lost, 1)) << lost_err;
    EXPECT_EQ(lost_err.rfind("0x1C01", 0), 0u) << "not a communication failure: " << lost_err;
    EXPECT_FALSE(dpxtest::file_exists(dir / "lost.bin"));
    EXPECT_TRUE(dpxtest::files_with_prefix(dir / "tmp", "cxp").empty());

    delay.signal(SIGKILL);
    daemon.signal(SIGTERM);
    EXPECT_TRUE(exited_with(daemon.wait(), 0));
}

}  // namespace

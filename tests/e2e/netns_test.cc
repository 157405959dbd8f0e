// The hub and a client on two hosts of their own: network namespaces made by
// the test, joined by a veth pair with delay and loss (netem) on the link,
// addresses in 10.200.0.0/16 that exist only inside them. The client is the
// dpx program, run in its namespace. Skipped where namespaces can't be made.
#include "client_hub.h"

#include <cstdlib>
#include <unistd.h>

using dpxtest::exited_with;
using dpxtest::Process;
using dpxtest::TempDir;

namespace {

const char kIp[] = "/usr/sbin/ip";
const char kTc[] = "/usr/sbin/tc";

int run(const std::vector<std::string> &argv)
{
    Process process(argv, {}, "/dev/null");
    return process.wait(std::chrono::seconds(30));
}

// Two namespaces, "hub" and "client", and the link between them, removed at
// the end with everything in them.
class TwoHosts {
public:
    TwoHosts()
        : tag_(std::to_string(getpid() % 100000)),
          hub("dpxh" + tag_),
          client("dpxc" + tag_),
          subnet("10.200." + std::to_string(getpid() % 250) + "."),
          hub_address(subnet + "1")
    {
        if (access(kIp, X_OK) != 0 || access(kTc, X_OK) != 0) {
            reason = "needs ip and tc (iproute2)";
            return;
        }
        if (!exited_with(run({kIp, "netns", "add", hub}), 0)) {
            reason = "cannot make a network namespace: needs CAP_SYS_ADMIN and CAP_NET_ADMIN";
            return;
        }
        made_ = true;
        std::string hub_end = "vh" + tag_, client_end = "vc" + tag_;
        const std::vector<std::vector<std::string>> steps = {
            {kIp, "netns", "add", client},
            {kIp, "link", "add", hub_end, "netns", hub, "type", "veth", "peer", "name", client_end, "netns", client},
            {kIp, "-n", hub, "addr", "add", subnet + "1/24", "dev", hub_end},
            {kIp, "-n", client, "addr", "add", subnet + "2/24", "dev", client_end},
            {kIp, "-n", hub, "link", "set", "lo", "up"},
            {kIp, "-n", client, "link", "set", "lo", "up"},
            {kIp, "-n", hub, "link", "set", hub_end, "up"},
            {kIp, "-n", client, "link", "set", client_end, "up"},
        };
        for (const auto &step : steps) {
            if (!exited_with(run(step), 0)) {
                reason = "cannot set up the link: " + step[1] + " " + step[2] + " " + step[3];
                return;
            }
        }
        hub_link = hub_end;
        // 50 ms and 1 % loss on the way from the hub, where a download's data
        // go. A kernel without netem still gets the rest of the test.
        impaired = exited_with(run({kIp, "netns", "exec", hub, kTc, "qdisc", "add", "dev", hub_end, "root", "netem",
                                    "delay", "50ms", "loss", "1%"}),
                               0);
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

    std::string reason;     // empty when the hosts are ready
    bool impaired = false;  // the link has its delay and loss

private:
    std::string tag_;
    bool made_ = false;

public:
    const std::string hub, client, subnet, hub_address;
    std::string hub_link;
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
    // 100 MiB takes minutes at 1 % loss: a smaller file unless asked for.
    size_t size = std::getenv("DPX_NETNS_FULL") != nullptr ? (100u << 20)
                  : std::getenv("DPX_SKIP_SLOW") != nullptr ? (2u << 20)
                                                             : (8u << 20);
    dpxtest::write_file(dir / "source.bin", dpxtest::pattern_bytes(size, 21));
    std::printf("%zu bytes over a link %s\n", size,
                hosts.impaired ? "with 50 ms delay and 1 %% loss" : "without delay or loss: this kernel has no netem");

    Process daemon(hosts.in(hosts.hub, {dpxtest::bin_dir() + "/dpx-agentd", "--depot", dir / "depot", "--product",
                                        "prod", "--listen", hosts.hub_address + ":0", "--hub", "--broker"}),
                   {{"NCS_LB_PORT", std::to_string(kBrokerPort)}});
    ASSERT_TRUE(daemon.wait_line("listening on ").has_value());

    auto [put, put_err] = dpx(hosts, dir, {"put", "node1", "big.bin", dir / "source.bin"});
    EXPECT_TRUE(exited_with(put, 0)) << put_err;
    auto [get, get_err] = dpx(hosts, dir, {"get", "node1", "big.bin", dir / "target.bin"});
    EXPECT_TRUE(exited_with(get, 0)) << get_err;
    EXPECT_EQ(dpxtest::compare_files(dir / "source.bin", dir / "depot/prod/big.bin"), "");
    EXPECT_EQ(dpxtest::compare_files(dir / "source.bin", dir / "target.bin"), "");

    // The link goes down once a download has begun to arrive: the client
    // fails at its call's time-out and leaves neither a target nor a
    // temporary file.
    dpxtest::write_file(dir / "depot/prod/cut.bin", dpxtest::pattern_bytes(size * 8, 22));
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
    auto [lost, lost_err] = dpx(hosts, dir, {"get", "node1", "cut.bin", dir / "lost.bin"});
    cut.join();
    EXPECT_TRUE(exited_with(lost, 1)) << lost_err;
    EXPECT_EQ(lost_err.rfind("0x1C01", 0), 0u) << "not a communication failure: " << lost_err;
    EXPECT_FALSE(dpxtest::file_exists(dir / "lost.bin"));
    EXPECT_TRUE(dpxtest::files_with_prefix(dir / "tmp", "cxp").empty());

    daemon.signal(SIGTERM);
    EXPECT_TRUE(exited_with(daemon.wait(), 0));
}

}  // namespace

// The client CLI and the host daemon as programs: exit statuses, what they
// print, and a file moved by the CLI through a running daemon.
#include "client_hub.h"

#include <csignal>
#include <regex>

using dpxtest::Daemon;
using dpxtest::exited_with;
using dpxtest::Process;
using dpxtest::TempDir;

namespace {

struct Outcome {
    int wstatus;
    std::vector<std::string> out;
    std::string err;
};

// Runs `dpx` with `args` as a client of the hub behind `daemon` (if any).
Outcome dpx(const std::vector<std::string> &args, const Daemon *daemon = nullptr)
{
    TempDir dir;
    std::vector<std::string> argv = {dpxtest::bin_dir() + "/dpx"};
    argv.insert(argv.end(), args.begin(), args.end());
    std::map<std::string, std::optional<std::string>> env = {{"AFW_HUB_HOST", std::nullopt},
                                                             {"AFW_ORIGIN_NODE", "here"}};
    if (daemon != nullptr) {
        env["DPX_HUBHOST"] = "127.0.0.1";
        env["NCS_LB_PORT"] = std::to_string(daemon->lb_port);
    }
    Process process(argv, env, dir / "stderr");
    int wstatus = process.wait();
    return {wstatus, process.lines(), dpxtest::read_file(dir / "stderr")};
}

TEST(Programs, TheCliMovesFilesThroughTheDaemonAndReportsAFailureInOneLine)
{
    TempDir dir;
    Daemon daemon(dir / "depot", "prod");
    std::string source = dir / "source.bin", target = dir / "target.bin";
    dpxtest::write_file(source, dpxtest::pattern_bytes(300000));

    Outcome put = dpx({"put", "node1", "a/b.bin", source}, &daemon);
    EXPECT_TRUE(exited_with(put.wstatus, 0)) << put.err;
    EXPECT_EQ(dpxtest::compare_files(source, dir / "depot/prod/a/b.bin"), "");
    Outcome get = dpx({"--quiet", "get", "node1", "a/b.bin", target}, &daemon);
    EXPECT_TRUE(exited_with(get.wstatus, 0)) << get.err;
    EXPECT_EQ(dpxtest::compare_files(source, target), "");
    EXPECT_TRUE(put.out.empty() && get.out.empty() && put.err.empty() && get.err.empty());

    Outcome missing = dpx({"get", "node1", "a/none.bin", dir / "none.bin"}, &daemon);
    EXPECT_TRUE(exited_with(missing.wstatus, 1));
    EXPECT_TRUE(std::regex_match(missing.err, std::regex("0xF11E0004 [^\n]+\n"))) << missing.err;
    EXPECT_FALSE(dpxtest::file_exists(dir / "none.bin"));

    EXPECT_TRUE(exited_with(daemon.stop(), 0));
}

TEST(Programs, TheCliListsNodesAndQueriesForThisNode)
{
    TempDir dir;
    Daemon peer(dir / "depot", "prod", {"--nodes", "alpha,beta,gamma", "--query-result", "42"}, "dpx_test_peer");

    Outcome list = dpx({"list"}, &peer);
    EXPECT_TRUE(exited_with(list.wstatus, 0)) << list.err;
    EXPECT_EQ(list.out, (std::vector<std::string>{"alpha", "beta", "gamma"}));
    Outcome query = dpx({"query", "-", "size", "a/b.bin"}, &peer);
    EXPECT_TRUE(exited_with(query.wstatus, 0)) << query.err;
    EXPECT_EQ(query.out, std::vector<std::string>{"42"});
    peer.stop();
    EXPECT_EQ(peer.process->count_lines("query node=here"), 1u);
}

TEST(Programs, TheCliTellsTheTextOfAStatusAndRefusesWrongUse)
{
    Outcome status = dpx({"status", "0xF11E0004"});
    EXPECT_TRUE(exited_with(status.wstatus, 0));
    ASSERT_EQ(status.out.size(), 1u);
    EXPECT_TRUE(std::regex_match(status.out[0], std::regex("0xF11E0004 \\w.*"))) << status.out[0];

    const std::vector<std::string> wrong[] = {
        {}, {"get", "node1", "a"}, {"put", "node1", "a", "b", "c"}, {"fetch"},
        {"status"}, {"status", "0xZZ"}, {"--bogus", "list"}, {"list", "a", "b"},
    };
    for (const auto &args : wrong) {
        Outcome run = dpx(args);
        EXPECT_TRUE(exited_with(run.wstatus, 2)) << testing::PrintToString(args);
        EXPECT_NE(run.err.find("usage: dpx"), std::string::npos);
    }
}

TEST(Programs, TheDaemonStopsWithExitStatus0OnSigtermAndSigint)
{
    for (int signo : {SIGTERM, SIGINT}) {
        TempDir dir;
        Daemon daemon(dir / "depot", "prod");
        ASSERT_NE(daemon.port, 0);
        daemon.process->signal(signo);
        EXPECT_TRUE(exited_with(daemon.process->wait(), 0)) << signo;
    }
    TempDir dir;
    Process no_depot({dpxtest::bin_dir() + "/dpx-agentd", "--product", "prod"}, {}, dir / "stderr");
    EXPECT_TRUE(exited_with(no_depot.wait(), 2));
}

}  // namespace

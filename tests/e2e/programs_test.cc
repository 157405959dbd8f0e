// The client CLI and the host daemon as programs: files moved by the CLI
// through a daemon, what both print and how they end, and no path of a
// request reaching outside the product's directory but through a link.
#include "hub.h"

#include <cctype>

namespace {

using namespace dpxtest;

Ran dpx(std::vector<std::string> args, const Env &env = {})
{
    args.insert(args.begin(), bin_dir() + "/dpx");
    return run(args, env);
}

TEST(Programs, TheCliMovesFilesThroughTheDaemonAndReportsAFailureInOneLine)
{
    Hub hub;
    std::string source = hub / "source.bin", target = hub / "target.bin";
    write_file(source, pattern_bytes(300000));

    Ran put = dpx({"put", "node1", "a/b.bin", source});
    EXPECT_TRUE(exited_with(put.wstatus, 0)) << put.err;
    EXPECT_TRUE(same_files(source, hub.depot_file("a/b.bin")));
    Ran get = dpx({"--quiet", "get", "node1", "a/b.bin", target});
    EXPECT_TRUE(exited_with(get.wstatus, 0)) << get.err;
    EXPECT_TRUE(same_files(source, target));
    EXPECT_TRUE(put.out.empty() && get.out.empty() && put.err.empty() && get.err.empty());

    Ran missing = dpx({"get", "node1", "a/none.bin", hub / "none.bin"});
    EXPECT_TRUE(exited_with(missing.wstatus, 1));
    // One line: the status and its text.
    EXPECT_TRUE(missing.err.rfind("0xF11E0004 ", 0) == 0 && missing.err.find('\n') == missing.err.size() - 1 &&
                missing.err.size() > 12)
        << missing.err;
    EXPECT_FALSE(file_exists(hub / "none.bin"));
    EXPECT_TRUE(exited_with(hub.stop(), 0));
}

TEST(Programs, TheCliListsNodesAndQueriesForThisNode)
{
    Hub peer({"--nodes", "alpha,beta,gamma", "--query-result", "42"}, "dpx_test_peer");
    Ran list = dpx({"list"});
    EXPECT_TRUE(exited_with(list.wstatus, 0)) << list.err;
    EXPECT_EQ(list.out, (std::vector<std::string>{"alpha", "beta", "gamma"}));
    Ran query = dpx({"query", "-", "size", "a/b.bin"}, {{"AFW_ORIGIN_NODE", "here"}});
    EXPECT_TRUE(exited_with(query.wstatus, 0)) << query.err;
    EXPECT_EQ(query.out, std::vector<std::string>{"42"});
    EXPECT_EQ(peer.peer_lines("query node=here"), 1u);
}

TEST(Programs, TheCliTellsTheTextOfAStatusAndRefusesWrongUse)
{
    Ran status = dpx({"status", "0xF11E0004"});
    EXPECT_TRUE(exited_with(status.wstatus, 0));
    ASSERT_EQ(status.out.size(), 1u);
    EXPECT_TRUE(status.out[0].rfind("0xF11E0004 ", 0) == 0 && std::isalnum(status.out[0][11] & 0xFF)) << status.out[0];
    const std::vector<std::string> wrong[] = {
        {}, {"get", "node1", "a"}, {"put", "node1", "a", "b", "c"}, {"fetch"},
        {"status"}, {"status", "0xZZ"}, {"--bogus", "list"}, {"list", "a", "b"},
    };
    for (const auto &args : wrong) {
        Ran run = dpx(args);
        EXPECT_TRUE(exited_with(run.wstatus, 2)) << testing::PrintToString(args);
        EXPECT_NE(run.err.find("usage: dpx"), std::string::npos);
    }
}

TEST(Programs, TheDaemonStopsWithExitStatus0OnSigtermAndSigint)
{
    Hub hub;
    for (int signo : {SIGTERM, SIGINT}) {
        ASSERT_NE(hub.port, 0);
        hub.daemon->signal(signo);
        EXPECT_TRUE(exited_with(hub.daemon->wait(), 0)) << signo;
        hub.start();
    }
    EXPECT_TRUE(exited_with(run({bin_dir() + "/dpx-agentd", "--product", "prod"}).wstatus, 2));
}

// A depot whose product "prod" sits beside files that no request may reach.
struct Outside : Hub {
    const std::string outside = made_dir(dir / "outside"), source = dir / "source.bin";
    Outside()
    {
        write_file(outside + "/secret", "secret outside");
        write_file(depot + "/secret", "secret in the root");
        write_file(source, pattern_bytes(10000, 5));
    }
};

TEST(Programs, HostilePathsStayInsideTheProductsDirectory)
{
    Outside d;
    // A put of each lands at the cleaned path below prod.
    for (const auto &[path, lands] : std::vector<std::pair<std::string, std::string>>{
             {"../../escaped.bin", "escaped.bin"},
             {"..\\..\\outside\\win.bin", "outside/win.bin"},
             {"/abs/x.bin", "abs/x.bin"},
             {"a/../../../b.bin", "b.bin"},
         }) {
        SCOPED_TRACE(path);
        Ran put = dpx({"--quiet", "put", "node1", path, d.source});
        EXPECT_TRUE(exited_with(put.wstatus, 0)) << put.err;
        EXPECT_TRUE(same_files(d.depot_file(lands), d.source));
    }
    // A get that aims at the files outside finds nothing below prod.
    for (const char *path : {"../secret", "../../outside/secret", "..\\..\\outside\\secret", "/../secret"}) {
        SCOPED_TRACE(path);
        Ran get = dpx({"--quiet", "get", "node1", path, d / "got.bin"});
        EXPECT_TRUE(exited_with(get.wstatus, 1));
        EXPECT_EQ(get.err.rfind("0xF11E0004", 0), 0u) << get.err;
        EXPECT_FALSE(file_exists(d / "got.bin"));
    }
    EXPECT_EQ(files_with_prefix(d.outside, "").size(), 1u);
    EXPECT_FALSE(file_exists(d / "escaped.bin"));
    EXPECT_TRUE(exited_with(d.stop(), 0));
}

TEST(Programs, LinksOutOfTheDepotAreFollowedByDefaultAndRefusedWithConfine)
{
    Outside d;
    std::filesystem::create_directory_symlink(d.outside, d.depot_file("out"));
    std::filesystem::create_symlink(d / "nowhere.bin", d.depot_file("dangling"));
    write_file(made_dir(d.depot_file("real")) + "/inside.bin", "inside");
    std::filesystem::create_directory_symlink(d.depot_file("real"), d.depot_file("alias"));
    std::string target = d / "got.bin";
    Ran followed = dpx({"--quiet", "get", "node1", "out/secret", target});
    EXPECT_TRUE(exited_with(followed.wstatus, 0)) << followed.err;
    EXPECT_EQ(read_file(target), "secret outside");
    std::filesystem::remove(target);

    EXPECT_TRUE(exited_with(d.stop(), 0));
    d.start({"--confine"});
    for (const std::vector<std::string> &args : std::vector<std::vector<std::string>>{
             {"get", "node1", "out/secret", target},
             {"put", "node1", "out/new.bin", d.source},
             {"put", "node1", "out/deeper/new.bin", d.source},
             {"put", "node1", "dangling", d.source},
         }) {
        SCOPED_TRACE(args[0] + " " + args[2]);
        Ran refused = dpx(args);
        EXPECT_TRUE(exited_with(refused.wstatus, 1));
        EXPECT_EQ(refused.err.rfind("0xF11E0001", 0), 0u) << refused.err;
    }
    for (const std::string &path : {target, d.outside + "/new.bin", d.outside + "/deeper", d / "nowhere.bin"})
        EXPECT_FALSE(file_exists(path)) << path;

    // Links that stay inside, and new files, are served as before.
    Ran inside = dpx({"get", "node1", "alias/inside.bin", target});
    EXPECT_TRUE(exited_with(inside.wstatus, 0)) << inside.err;
    EXPECT_EQ(read_file(target), "inside");
    Ran fresh = dpx({"put", "node1", "new/dir/f.bin", d.source});
    EXPECT_TRUE(exited_with(fresh.wstatus, 0)) << fresh.err;
    EXPECT_TRUE(same_files(d.depot_file("new/dir/f.bin"), d.source));
    EXPECT_TRUE(exited_with(d.stop(), 0));
}

}  // namespace

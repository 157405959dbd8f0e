// No request reads or writes outside the product's directory through a path,
// end to end: the CLI against a daemon. Symbolic links in the depot are
// followed unless the daemon runs with --confine, which refuses a path whose
// real location leaves the product's directory.
#include "client_hub.h"

using dpxtest::Daemon;
using dpxtest::exited_with;
using dpxtest::Process;
using dpxtest::TempDir;

namespace {

struct CliRun {
    bool ok;
    std::string err;
};

CliRun dpx(const Daemon &daemon, const std::vector<std::string> &args)
{
    TempDir dir;
    std::vector<std::string> argv = {dpxtest::bin_dir() + "/dpx", "--quiet"};
    argv.insert(argv.end(), args.begin(), args.end());
    Process process(argv,
                    {{"AFW_HUB_HOST", std::nullopt},
                     {"DPX_HUBHOST", "127.0.0.1"},
                     {"NCS_LB_PORT", std::to_string(daemon.lb_port)},
                     {"TMPDIR", dir.path()}},
                    dir / "stderr");
    int wstatus = process.wait();
    return {exited_with(wstatus, 0), dpxtest::read_file(dir / "stderr")};
}

// A depot whose product "prod" sits beside files that no request may reach.
struct Depot {
    TempDir dir;
    std::string depot = dpxtest::made_dir(dir / "depot");
    std::string prod = dpxtest::made_dir(depot + "/prod");
    std::string outside = dpxtest::made_dir(dir / "outside");
    std::string source = dir / "source.bin";
    Depot()
    {
        dpxtest::write_file(outside + "/secret", "secret outside");
        dpxtest::write_file(depot + "/secret", "secret in the root");
        dpxtest::write_file(source, dpxtest::pattern_bytes(10000, 5));
    }
};

TEST(DepotSafety, HostilePathsStayInsideTheProductsDirectory)
{
    Depot d;
    Daemon daemon(d.depot, "prod");
    // A put of each lands at the cleaned path below prod.
    const std::pair<const char *, const char *> puts[] = {
        {"../../escaped.bin", "escaped.bin"},
        {"..\\..\\outside\\win.bin", "outside/win.bin"},
        {"/abs/x.bin", "abs/x.bin"},
        {"a/../../../b.bin", "b.bin"},
    };
    for (const auto &[path, lands] : puts) {
        SCOPED_TRACE(path);
        CliRun put = dpx(daemon, {"put", "node1", path, d.source});
        EXPECT_TRUE(put.ok) << put.err;
        EXPECT_EQ(dpxtest::read_file(d.prod + "/" + lands), dpxtest::read_file(d.source));
    }
    // A get that aims at the files outside finds nothing below prod.
    for (const char *path : {"../secret", "../../outside/secret", "..\\..\\outside\\secret", "/../secret"}) {
        SCOPED_TRACE(path);
        std::string target = d.dir / "got.bin";
        CliRun get = dpx(daemon, {"get", "node1", path, target});
        EXPECT_FALSE(get.ok);
        EXPECT_EQ(get.err.rfind("0xF11E0004", 0), 0u) << get.err;
        EXPECT_FALSE(dpxtest::file_exists(target));
    }
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(d.outside), std::filesystem::directory_iterator()), 1);
    EXPECT_FALSE(dpxtest::file_exists(d.dir / "escaped.bin"));
    EXPECT_TRUE(exited_with(daemon.stop(), 0));
}

TEST(DepotSafety, LinksOutOfTheDepotAreFollowedByDefaultAndRefusedWithConfine)
{
    Depot d;
    std::filesystem::create_directory_symlink(d.outside, d.prod + "/out");
    std::filesystem::create_symlink(d.dir / "nowhere.bin", d.prod + "/dangling");
    std::filesystem::create_directories(d.prod + "/real");
    dpxtest::write_file(d.prod + "/real/inside.bin", "inside");
    std::filesystem::create_directory_symlink(d.prod + "/real", d.prod + "/alias");
    std::string target = d.dir / "got.bin";
    {
        Daemon daemon(d.depot, "prod");
        CliRun get = dpx(daemon, {"get", "node1", "out/secret", target});
        EXPECT_TRUE(get.ok) << get.err;
        EXPECT_EQ(dpxtest::read_file(target), "secret outside");
        EXPECT_TRUE(exited_with(daemon.stop(), 0));
    }
    std::filesystem::remove(target);

    Daemon confined(d.depot, "prod", {"--confine"});
    for (const std::vector<std::string> &args : std::vector<std::vector<std::string>>{
             {"get", "node1", "out/secret", target},
             {"put", "node1", "out/new.bin", d.source},
             {"put", "node1", "out/deeper/new.bin", d.source},
             {"put", "node1", "dangling", d.source},
         }) {
        SCOPED_TRACE(args[0] + " " + args[2]);
        CliRun run = dpx(confined, args);
        EXPECT_FALSE(run.ok);
        EXPECT_EQ(run.err.rfind("0xF11E0001", 0), 0u) << run.err;
    }
    EXPECT_FALSE(dpxtest::file_exists(target));
    EXPECT_FALSE(dpxtest::file_exists(d.outside + "/new.bin"));
    EXPECT_FALSE(dpxtest::file_exists(d.outside + "/deeper"));
    EXPECT_FALSE(dpxtest::file_exists(d.dir / "nowhere.bin"));

    // Links that stay inside, and new files, are served as before.
    CliRun inside = dpx(confined, {"get", "node1", "alias/inside.bin", target});
    EXPECT_TRUE(inside.ok) << inside.err;
    EXPECT_EQ(dpxtest::read_file(target), "inside");
    CliRun fresh = dpx(confined, {"put", "node1", "new/dir/f.bin", d.source});
    EXPECT_TRUE(fresh.ok) << fresh.err;
    EXPECT_EQ(dpxtest::read_file(d.prod + "/new/dir/f.bin"), dpxtest::read_file(d.source));
    EXPECT_TRUE(exited_with(confined.stop(), 0));
}

}  // namespace

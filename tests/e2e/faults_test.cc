// Faults around whole transfers: the daemon killed at random points,
// connections cut mid-body, a daemon that stops answering, the broker down,
// the depot's disk full, the source changed during a download, a target that
// can't be written. After each: the status, no temporary file, the target of
// a failed get as it was, an upload's target a prefix of its source, no
// descriptor left behind in either process, and the daemon serving again.
#include "hub.h"

#include "ncs/lb.h"

#include <cerrno>
#include <cstring>
#include <future>
#include <random>
#include <sys/mount.h>

namespace {

using namespace dpxtest;

// A file large enough that a fault lands inside its transfer.
size_t big_size()
{
    return slow_skipped() ? (8u << 20) : (48u << 20);
}

bool comm_failure(dpx_status status)
{
    return (status & 0xFFFF0000u) == RPC_COMM_MODULE;
}

struct Tally {
    int faults = 0, verified = 0, lost = 0;
    uint64_t bytes = 0;
} g_tally;

struct Summary : testing::Environment {
    void TearDown() override
    {
        std::printf("faults tried %d, transfers verified %d, bytes moved %llu, %s\n", g_tally.faults,
                    g_tally.verified, static_cast<unsigned long long>(g_tally.bytes),
                    g_tally.lost == 0 ? "nothing lost" : (std::to_string(g_tally.lost) + " LOST").c_str());
    }
};
testing::Environment *const g_summary = testing::AddGlobalTestEnvironment(new Summary);

struct Rig {
    Hub hub{{"--renew", "1"}};
    Resources client_before, daemon_before;
    std::mt19937 random{20240611};

    Rig()
    {
        // A first round trip: the binding is cached and the connection pooled.
        verify_round_trip();
        client_before = resources_of(0);
        daemon_before = resources_of(hub.daemon->pid());
    }
    ~Rig() { EXPECT_TRUE(exited_with(hub.stop(), 0)) << "the daemon did not end cleanly"; }

    void restart_daemon()
    {
        hub.daemon->signal(SIGKILL);
        hub.daemon->wait();
        hub.start();
        daemon_before = Resources{};
    }

    void verify_round_trip()
    {
        static int n = 0;
        std::string name = "verify/" + std::to_string(++n);
        std::string content = pattern_bytes(200000 + static_cast<size_t>(n), static_cast<uint32_t>(n));
        EXPECT_EQ(checked(true, name, {content}), DPX_OK);
        EXPECT_EQ(checked(false, name, {content}), DPX_OK);
    }

    // The client may keep a pooled connection to each daemon it has known.
    void check_after_fault(int daemons_known = 1)
    {
        ++g_tally.faults;
        EXPECT_TRUE(hub.temp_files().empty()) << "a temporary file was left";
        verify_round_trip();
        Resources client = resources_of(0);
        EXPECT_EQ(client.files, client_before.files) << "descriptors leaked in the client";
        EXPECT_LE(client.sockets, client_before.sockets + static_cast<size_t>(daemons_known));
        if (daemon_before.files == 0)
            return;  // a daemon started since: nothing to compare with
        Resources daemon;
        EXPECT_TRUE(eventually([&] {
            daemon = resources_of(hub.daemon->pid());
            return daemon.files == daemon_before.files && daemon.sockets <= daemon_before.sockets;
        })) << "the daemon holds " << daemon.files << " files and " << daemon.sockets << " sockets, "
            << daemon_before.files << " and " << daemon_before.sockets << " before";
    }

    // A transfer with `fault` while it runs. A get goes into a target that
    // holds other content: a success delivers one of `versions` whole (or,
    // with `cut_short`, whole records from the start of versions[0]), a
    // failure leaves the old content. A put sends versions[0] to a new `name`:
    // the depot's file is all of it after a success, a prefix after a failure.
    dpx_status checked(bool put, const std::string &name, const std::vector<std::string> &versions,
                       const std::function<void()> &fault = [] {}, bool cut_short = false)
    {
        std::string local = hub / (put ? "source.bin" : "target.bin"), stored = hub.depot_file(name);
        write_file(local, put ? versions[0] : "old content");
        auto call = std::async(std::launch::async, [&] {
            return put ? PutFile("node1", name.c_str(), local.c_str()) : GetFile("node1", name.c_str(), local.c_str());
        });
        fault();
        EXPECT_EQ(call.wait_for(std::chrono::seconds(120)), std::future_status::ready) << "the transfer did not end";
        dpx_status status = call.get();
        std::string got = !put ? read_file(local) : file_exists(stored) ? read_file(stored) : "";
        const bool prefix = versions[0].compare(0, got.size(), got) == 0;
        bool sound = status == DPX_OK ? std::find(versions.begin(), versions.end(), got) != versions.end() ||
                                            (cut_short && prefix && got.size() % DPX_CHUNK_SIZE == 0)
                     : put            ? prefix
                                      : got == "old content";
        EXPECT_TRUE(sound) << "status " << status << " with " << got.size() << " bytes of no version";
        g_tally.lost += !sound;
        g_tally.verified += status == DPX_OK && sound;
        g_tally.bytes += status == DPX_OK && sound ? got.size() : 0;
        return status;
    }

    void sleep_random_ms(int up_to)
    {
        std::this_thread::sleep_for(std::chrono::milliseconds(std::uniform_int_distribution<int>(0, up_to)(random)));
    }
};

TEST(Faults, ADaemonKilledAtRandomPointsOfTransfersFailsThemCleanlyAndServesAgainOnceRestarted)
{
    Rig rig;
    std::string content = pattern_bytes(big_size(), 11);
    write_file(rig.hub.depot_file("big.bin"), content);
    for (int round = 0; round < 6; ++round) {
        SCOPED_TRACE(round);
        auto kill = [&] {
            rig.sleep_random_ms(300);
            rig.hub.daemon->signal(SIGKILL);
        };
        dpx_status status = rig.checked(round % 2 == 1, round % 2 ? "up/" + std::to_string(round) : "big.bin",
                                        {content}, kill);
        EXPECT_TRUE(status == DPX_OK || comm_failure(status)) << std::hex << status;
        rig.restart_daemon();
        // A transfer that ended before the kill leaves a binding to the dead
        // daemon, as the next call would learn.
        if (status == DPX_OK)
            invalidate_hub_handle();
        rig.check_after_fault(round + 2);
    }
}

// Stands in the broker as the hub at `port` of 127.0.0.1, ahead of the daemon.
struct HubEntry {
    explicit HubEntry(uint16_t port)
    {
        uint32_t status = 0;
        uuid__decode(DPX_HUB_LB_UUID, &entry.obj_interface, &status);
        entry.saddr_len = sizeof entry.saddr;
        socket__from_name(AF_INET, "127.0.0.1", 9, port, &entry.saddr, &entry.saddr_len, &status);
        lb__register(&entry, &status);
        EXPECT_EQ(status, rpc__s_ok);
    }
    ~HubEntry()
    {
        uint32_t status = 0;
        lb__unregister(&entry, &status);
    }
    lb__entry_t entry{};
};

TEST(Faults, AConnectionCutMidBodyFailsTheTransferOrIsRepeatedWhole)
{
    Rig rig;
    std::string content = pattern_bytes(big_size() / 4, 12);
    write_file(rig.hub.depot_file("cut.bin"), content);
    int round = 0;
    // One cut: a get is idempotent and repeated on a new connection, and so is
    // an upload's frame that didn't leave whole, so either may succeed. Every
    // connection cut before a buffer of 128 records has passed: the one repeat
    // is cut too, and the transfer fails.
    for (int cuts : {1, 1000}) {
        for (bool upload : {false, true}) {
            SCOPED_TRACE(std::to_string(cuts) + (upload ? " cuts of an upload" : " cuts of a download"));
            uint64_t most = cuts == 1 ? content.size() : 400000;
            uint64_t limit = std::uniform_int_distribution<uint64_t>(100, most)(rig.random);
            dpx_status status;
            {
                // A relay without delay that cuts the first `cuts` connections.
                Process proxy({bin_dir() + "/dpx_test_delay", "127.0.0.1", "0", "127.0.0.1",
                               std::to_string(rig.hub.port), "0", upload ? "up" : "down", std::to_string(limit),
                               std::to_string(cuts)});
                HubEntry entry(listening_port(proxy, "relaying on "));
                invalidate_hub_handle();  // the next call looks up the proxy
                ++round;
                status = rig.checked(upload, upload ? "cut/" + std::to_string(round) : "cut.bin", {content});
                EXPECT_TRUE(proxy.wait_line("cut").has_value());
            }
            invalidate_hub_handle();
            EXPECT_TRUE(status == DPX_OK || comm_failure(status)) << std::hex << status;
            EXPECT_TRUE(cuts == 1 || status != DPX_OK) << "a transfer cut on every connection succeeded";
            rig.check_after_fault(round + 1);
        }
    }
}

TEST(Faults, ADaemonThatStopsAnsweringFailsTheCallAtItsTimeOut)
{
    Rig rig;
    ScopedEnv timeout("NCS_CALL_TIMEOUT_MS", "1500");
    std::string content = pattern_bytes(1 << 20, 13);
    write_file(rig.hub.depot_file("stopped.bin"), content);
    for (bool upload : {false, true}) {
        SCOPED_TRACE(upload ? "upload" : "download");
        rig.hub.daemon->signal(SIGSTOP);
        dpx_status status = rig.checked(upload, upload ? "stopped/up.bin" : "stopped.bin", {content});
        rig.hub.daemon->signal(SIGCONT);
        EXPECT_EQ(status, rpc__s_timeout) << std::hex << status;
        rig.check_after_fault();
    }
}

TEST(Faults, WithTheBrokerDownACachedBindingServesANewOneFailsAndTheDaemonRegistersAgainOnceItIsBack)
{
    Rig rig;
    rig.hub.broker.reset();
    rig.verify_round_trip();

    // A failed lookup leaves the cleared binding in place: the first call on it fails.
    invalidate_hub_handle();
    std::string content = pattern_bytes(50000, 14);
    write_file(rig.hub.depot_file("b.bin"), content);
    EXPECT_EQ(rig.checked(false, "b.bin", {content}), rpc__s_not_bound);

    // A broker back on its port knows nothing until the daemon renews its
    // registration (every second here).
    rig.hub.broker = std::make_unique<Process>(std::vector<std::string>{bin_dir() + "/dpx-lbd"});
    ASSERT_NE(listening_port(*rig.hub.broker), 0);
    EXPECT_TRUE(eventually([&] {
        invalidate_hub_handle();
        return GetFile("node1", "b.bin", (rig.hub / "b.bin").c_str()) == DPX_OK;
    })) << "the daemon did not register again";
    EXPECT_EQ(read_file(rig.hub / "b.bin"), content);
    rig.check_after_fault();
}

TEST(Faults, AnUploadToAFullDiskFailsWithAWriteErrorAndKeepsWhatFitted)
{
    Rig rig;
    std::string disk = made_dir(rig.hub.depot_file("full"));
    if (mount("dpxtest", disk.c_str(), "tmpfs", 0, "size=1m") != 0)
        GTEST_SKIP() << "cannot mount a small tmpfs here (" << std::strerror(errno) << "): needs CAP_SYS_ADMIN";
    struct Unmount {
        std::string dir;
        ~Unmount() { umount2(dir.c_str(), MNT_DETACH); }
    } unmount{disk};
    EXPECT_EQ(rig.checked(true, "full/big.bin", {pattern_bytes(3 << 20, 15)}), DPX_E_FILE_WRITE);
    std::filesystem::remove(rig.hub.depot_file("full/big.bin"));
    EXPECT_EQ(rig.checked(true, "full/small.bin", {pattern_bytes(100000, 16)}), DPX_OK);
    rig.check_after_fault();
}

TEST(Faults, ASourceChangedDuringADownloadFailsItArrivesAsOneVersionOrEndsEarlyWhenTruncated)
{
    Rig rig;
    std::string path = rig.hub.depot_file("changing.bin"), old_content = pattern_bytes(big_size() / 2, 17);
    // A file is checked at the start of each call. One truncated between that
    // check and the read ends in a short read, which is the end of a file:
    // the download then completes with the records read before it.
    const std::tuple<const char *, std::function<void()>, bool> changes[] = {
        {"grown", [&] { std::ofstream(path, std::ios::binary | std::ios::app) << "tail"; }, false},
        {"truncated", [&] { std::filesystem::resize_file(path, 1000); }, true},
        {"replaced", [&] {
             write_file(path + ".new", pattern_bytes(300000, 18));
             std::filesystem::rename(path + ".new", path);
         }, false},
    };
    for (const auto &[what, change, cut_short] : changes) {
        for (int round = 0; round < 2; ++round) {
            SCOPED_TRACE(std::string(what) + " " + std::to_string(round));
            write_file(path, old_content);
            std::vector<std::string> versions = {old_content};
            dpx_status status = rig.checked(false, "changing.bin", versions, [&] {
                rig.sleep_random_ms(round == 0 ? 0 : 150);
                change();
                versions.push_back(read_file(path));
            }, cut_short);
            EXPECT_TRUE(status == DPX_OK || status == DPX_E_FILE_CHANGED) << std::hex << status;
            rig.check_after_fault();
        }
    }
}

TEST(Faults, AGetIntoATargetBelowARegularFileFailsAndLeavesNothing)
{
    Rig rig;
    write_file(rig.hub.depot_file("p.bin"), pattern_bytes(70000, 19));
    write_file(rig.hub / "plain", "plain");
    EXPECT_EQ(GetFile("node1", "p.bin", (rig.hub / "plain/sub/target.bin").c_str()), DPX_E_FILE_WRITE);
    EXPECT_EQ(read_file(rig.hub / "plain"), "plain");
    rig.check_after_fault();
}

}  // namespace

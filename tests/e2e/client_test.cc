// This process as the client of a hub daemon: whole files of every buffer
// shape, the target of a get, calls on a busy or quiet peer, and the cached
// binding.
#include "hub.h"

#include <atomic>
#include <fcntl.h>
#include <sys/statvfs.h>
#include <unistd.h>

namespace {

using namespace dpxtest;

TEST(Client, ThreadsAtOnceOnOneBindingMoveFilesOfEveryBufferShapeUnchanged)
{
    Hub hub;
    write_file(hub / "seed", "x");
    ASSERT_EQ(PutFile("node1", "seed", (hub / "seed").c_str()), DPX_OK);
    made_dir(hub.depot_file("sizes"));  // racing mkdirs of one directory fail by design
    TraceCapture trace(TRC1_FLOW);
    // Empty; one byte; one chunk; 23 chunks and a remainder (one call); 24
    // chunks (a second call of one empty record); 256 chunks (24, 128 and 105
    // records); 25600 chunks (128-record buffers). Each size twice at once.
    const size_t sizes[] = {0, 1, 4096, 98303, 98304, 1 << 20, 100 << 20};
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 14; ++t) {
        threads.emplace_back([&, t] {
            size_t size = sizes[t / 2];
            std::string name = "sizes/" + std::to_string(t), source = hub / (name.substr(6) + ".src");
            write_file(source, pattern_bytes(size, static_cast<uint32_t>(t)));
            std::string target = hub / (name.substr(6) + ".dst");
            failures += PutFile("node1", name.c_str(), source.c_str()) != DPX_OK ||
                        GetFile("node1", name.c_str(), target.c_str()) != DPX_OK ||
                        !same_files(source, hub.depot_file(name)) || !same_files(source, target);
        });
    }
    for (auto &thread : threads)
        thread.join();
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(trace.count("binding to "), 0u);
    EXPECT_EQ(BINDING_HANDLE_INVALID, 0);
    EXPECT_TRUE(hub.temp_files().empty());
}

TEST(Client, AFileJustAbove4GiBMakesTheRoundTrip)
{
    if (slow_skipped())
        GTEST_SKIP() << "slow: skipped while DPX_SKIP_SLOW is set";
    Hub hub;
    struct statvfs fs;
    ASSERT_EQ(statvfs(hub.dir.path().c_str(), &fs), 0);
    if (static_cast<uint64_t>(fs.f_bavail) * fs.f_frsize < 10'000'000'000ull)
        GTEST_SKIP() << "needs 10 GB of free disk space for the depot's copy and the fetched one";
    // Sparse, with data at the start, across the 4 GiB mark and at the end.
    const uint64_t size = (4ull << 30) + 5000;
    std::string source = hub / "big.bin", target = hub / "big-copy.bin", bytes = pattern_bytes(12000, 7);
    int fd = open(source.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    for (uint64_t offset : {uint64_t{0}, uint64_t{(4ull << 30) - 6000}, size - bytes.size()})
        EXPECT_EQ(pwrite(fd, bytes.data(), bytes.size(), static_cast<off_t>(offset)), 12000);
    ASSERT_EQ(close(fd), 0);

    EXPECT_EQ(PutFile("node1", "big.bin", source.c_str()), DPX_OK);
    EXPECT_EQ(GetFile("node1", "big.bin", target.c_str()), DPX_OK);
    EXPECT_TRUE(same_files(source, target));
}

// A failure that the transfer loop finds itself (a damaged buffer, a service
// that says more follows and delivers nothing) leaves the binding; one that
// a reply carries drops it.
TEST(Client, AGetReplacesItsTargetWholeOnSuccessOnlyAndLeavesNoTemporaryFile)
{
    const struct {
        const char *what, *program;
        std::vector<std::string> peer_args;
        bool remote_exists, hub_down;
        dpx_status expected;
        bool binding_kept;
    } cases[] = {
        {"success", "dpx-agentd", {}, true, false, DPX_OK, true},
        {"missing remote file", "dpx-agentd", {}, false, false, DPX_E_FILE_READ, false},
        {"hub down: no binding", "dpx-agentd", {}, true, true, DPX_E_INVALID_PARAM, false},
        {"file changed", "dpx_test_peer", {"--grow-after-get", "1"}, true, false, DPX_E_FILE_CHANGED, false},
        {"checksum failure", "dpx_test_peer", {"--corrupt-get", "2"}, true, false, DPX_E_CHECKSUM, true},
        {"more without moving", "dpx_test_peer", {"--stall-get", "2"}, true, false, DPX_E_RPC_FAILED, true},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.what);
        Hub hub(c.peer_args, c.program);
        std::string content = pattern_bytes(300000, 3), old_content = pattern_bytes(400000, 4);
        if (c.remote_exists)
            write_file(hub.depot_file("remote.bin"), content);
        write_file(hub / "target.bin", old_content);
        if (c.hub_down)
            hub.stop();

        TraceCapture trace(TRC1_ERROR);
        EXPECT_EQ(GetFile("node1", "remote.bin", (hub / "target.bin").c_str()), c.expected);
        EXPECT_TRUE(read_file(hub / "target.bin") == (c.expected == DPX_OK ? content : old_content));
        EXPECT_TRUE(hub.temp_files().empty());
        EXPECT_EQ(BINDING_HANDLE_INVALID == 0, c.binding_kept);
        EXPECT_TRUE(c.expected != DPX_E_RPC_FAILED || trace.contains("more follows")) << trace.text();
    }
}

TEST(Client, APutOfAMissingSourceFailsBeforeTheHubIsAsked)
{
    Hub hub({}, "dpx_test_peer");
    TraceCapture trace(TRC1_FLOW | TRC1_ERROR);
    EXPECT_EQ(PutFile("node1", "x.bin", (hub / "no-such-file").c_str()), DPX_E_FILE_READ);
    EXPECT_TRUE(trace.contains("Could not stat input_file"));
    EXPECT_FALSE(trace.contains("binding to"));
    EXPECT_EQ(hub.peer_lines("call "), 0u);
}

TEST(Client, ABusyPeerIsTriedAndSleptOnAsTheScheduleSays)
{
    const struct {
        std::optional<std::string> max_retry, interval;  // nullopt: unset (6 and 3)
        int busy;                                        // busy answers before the peer serves
        uint64_t tries, sleeps, seconds;
        dpx_status expected;
    } cases[] = {
        {std::nullopt, std::nullopt, 100, 6, 6, 3 + 6 + 12 + 24 + 48 + 96, DPX_E_BUSY},
        {std::nullopt, "1", 2, 3, 2, 1 + 2, DPX_OK},
        // The first try always runs, and the last busy answer gets its sleep.
        {"1", "1", 100, 1, 1, 1, DPX_E_BUSY},
        {"0", "1", 100, 1, 1, 1, DPX_E_BUSY},
        {"-1", "1", 100, 1, 1, 1, DPX_E_BUSY},
        {"-2147483648", "1", 100, 1, 1, 1, DPX_E_BUSY},
        {std::nullopt, "0", 100, 6, 0, 0, DPX_E_BUSY},
        {std::nullopt, "0", 5, 6, 0, 0, DPX_OK},
        {"3", "-5", 100, 3, 0, 0, DPX_E_BUSY},
        // The interval doubles in 32 bits: once negative it ends the sleeping, not the tries.
        {"4", "805306368", 100, 4, 2, 805306368ull + 1610612736ull, DPX_E_BUSY},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(testing::Message() << c.max_retry.value_or("unset") << " " << c.interval.value_or("unset"));
        // A second lasts a millisecond; a schedule of years is only counted.
        ScopedEnv unit("PLT1_SLEEP_UNIT_MS", c.seconds < 1000 ? "1" : "0");
        ScopedEnv max_retry("DPX_MAX_RETRY", c.max_retry), interval("DPX_MIN_RETRY_INTERVAL", c.interval);
        Hub hub({"--busy", std::to_string(c.busy)}, "dpx_test_peer");
        write_file(hub.depot_file("f.txt"), "content");
        PLT1_ResetSleepCount();

        EXPECT_EQ(GetFile("node1", "f.txt", (hub / "f.txt").c_str()), c.expected);
        EXPECT_EQ(PLT1_SleepCount(), c.sleeps);
        EXPECT_EQ(PLT1_SleepSeconds(), c.seconds);
        EXPECT_EQ(BINDING_HANDLE_INVALID, 0) << "busy must leave the binding alone";
        EXPECT_EQ(hub.peer_lines("call get_chunks "), c.tries);
        EXPECT_EQ(file_exists(hub / "f.txt"), c.expected == DPX_OK);
    }
}

TEST(Client, BusyAtTheEndIsReportedAndTheNextOperationReusesTheBinding)
{
    ScopedEnv max_retry("DPX_MAX_RETRY", "1"), interval("DPX_MIN_RETRY_INTERVAL", "0");
    Hub hub({"--busy", "1"}, "dpx_test_peer");
    write_file(hub.depot_file("f.txt"), "content");
    TraceCapture trace(TRC1_FLOW | TRC1_ERROR);

    EXPECT_EQ(GetFile("node1", "f.txt", (hub / "f.txt").c_str()), DPX_E_BUSY);
    EXPECT_TRUE(trace.contains("GetFile failed with return code [0xf11e0014]"));
    EXPECT_EQ(GetFile("node1", "f.txt", (hub / "f.txt").c_str()), DPX_OK);
    EXPECT_EQ(trace.count("binding to "), 1u);
    EXPECT_EQ(hub.peer_lines("call get_chunks "), 2u);
}

TEST(Client, AQuietAnswerIsNeitherRetriedNorTracedAndLeavesTheBinding)
{
    ScopedEnv interval("DPX_MIN_RETRY_INTERVAL", "0");
    Hub hub({"--quiet"}, "dpx_test_peer");
    write_file(hub / "source.txt", "content");
    TraceCapture trace(TRC1_FLOW | TRC1_ERROR);
    uint32_t result = 0;
    int16_t last = 5;
    dpx_node_name nodes[4];

    EXPECT_EQ(GetFile("node1", "f.txt", (hub / "f.txt").c_str()), DPX_E_QUIET);
    EXPECT_EQ(PutFile("node1", "f.txt", (hub / "source.txt").c_str()), DPX_E_QUIET);
    EXPECT_EQ(Query("node1", "q", "f.txt", &result), DPX_E_QUIET);
    EXPECT_EQ(ListNodes("", &last, 3, nodes), DPX_E_QUIET);
    EXPECT_EQ(hub.peer_lines("call "), 4u);
    EXPECT_EQ(BINDING_HANDLE_INVALID, 0);
    EXPECT_EQ(trace.count("binding to "), 1u);
    EXPECT_FALSE(trace.contains("failed")) << trace.text();
    EXPECT_TRUE(hub.temp_files().empty());
}

TEST(Client, OnlyTheFirstOperationAndTheOneAfterAFailedCallLookTheHubUp)
{
    Hub hub;
    std::string source = hub / "source.bin", target = hub / "target.bin";
    write_file(source, pattern_bytes(200000));
    TraceCapture trace(TRC1_FLOW);
    const struct {
        bool put;
        const char *path;
        dpx_status expected;
        size_t lookups;  // so far
    } steps[] = {
        {false, "missing.bin", DPX_E_FILE_READ, 1},  // the first
        {false, "f.bin", DPX_E_FILE_READ, 2},        // after a failed call
        {true, "f.bin", DPX_OK, 3},                  // after a failed call
        {false, "f.bin", DPX_OK, 3},
        {true, "g.bin", DPX_OK, 3},
    };
    for (const auto &step : steps) {
        SCOPED_TRACE(step.lookups);
        EXPECT_EQ(step.put ? PutFile("node1", step.path, source.c_str()) : GetFile("node1", step.path, target.c_str()),
                  step.expected);
        EXPECT_EQ(BINDING_HANDLE_INVALID, step.expected == DPX_OK ? 0 : 1);
        EXPECT_EQ(trace.count("binding to 127.0.0.1 ..."), step.lookups);
    }
    EXPECT_TRUE(same_files(source, target));

    // Restarted, the hub listens on another port: the first call on the
    // cached binding fails, and its failure sends the next one to the broker.
    uint16_t old_port = hub.port;
    ASSERT_TRUE(exited_with(hub.stop(), 0));
    hub.start();
    ASSERT_NE(hub.port, old_port);
    dpx_status first = GetFile("node1", "f.bin", target.c_str());
    EXPECT_EQ(first & 0xFFFF0000u, DPX_RPC_COMM_MODULE) << std::hex << first;
    EXPECT_EQ(GetFile("node1", "f.bin", target.c_str()), DPX_OK);
    EXPECT_EQ(trace.count("binding to 127.0.0.1 ..."), 4u);
}

}  // namespace

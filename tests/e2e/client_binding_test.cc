// The cached binding to a hub that runs as a separate process: when it is
// reused, when it is looked up again, and many threads on it at once.
#include "client_hub.h"

#include <atomic>
#include <thread>

using dpxtest::ClientOfHub;

namespace {

TEST(ClientBinding, OnlyTheFirstOperationAndTheOneAfterAFailedCallLookTheHubUp)
{
    ClientOfHub hub;
    std::string source = hub.dir / "source.bin", target = hub.dir / "target.bin";
    dpxtest::write_file(source, dpxtest::pattern_bytes(200000));
    dpxtest::TraceCapture trace(TRC1_FLOW);
    struct Step {
        const char *what;
        bool put;
        const char *path;
        dpx_status expected;
        size_t lookups;   // so far
    } steps[] = {
        {"first get", false, "missing.bin", DPX_E_FILE_READ, 1},
        {"get after a failed call", false, "f.bin", DPX_E_FILE_READ, 2},
        {"put after a failed call", true, "f.bin", DPX_OK, 3},
        {"get with the same hub", false, "f.bin", DPX_OK, 3},
        {"put with the same hub", true, "g.bin", DPX_OK, 3},
    };
    for (const auto &step : steps) {
        SCOPED_TRACE(step.what);
        EXPECT_EQ(step.put ? PutFile("node1", step.path, source.c_str()) : GetFile("node1", step.path, target.c_str()),
                  step.expected);
        EXPECT_EQ(BINDING_HANDLE_INVALID, step.expected == DPX_OK ? 0 : 1);
        EXPECT_EQ(trace.count("binding to 127.0.0.1 ..."), step.lookups);
    }
    EXPECT_EQ(dpxtest::compare_files(source, target), "");
}

TEST(ClientBinding, AHubRestartedOnAnotherPortIsFoundAgainThroughTheBroker)
{
    dpxtest::Process broker({dpxtest::bin_dir() + "/dpx-lbd"}, {{"NCS_LB_PORT", "0"}});
    auto line = broker.wait_line("listening on ");
    ASSERT_TRUE(line.has_value());
    auto broker_port = static_cast<uint16_t>(std::stoi(line->substr(line->rfind(':') + 1)));
    ClientOfHub hub({}, "dpx-agentd", broker_port);
    std::string source = hub.dir / "source.bin", target = hub.dir / "target.bin";
    dpxtest::write_file(source, dpxtest::pattern_bytes(5000));
    ASSERT_EQ(PutFile("node1", "f.bin", source.c_str()), DPX_OK);
    uint16_t old_port = hub.daemon->port;

    hub.restart();
    ASSERT_NE(hub.daemon->port, old_port);
    // The cached binding still points at the old port: the first call is the
    // test of the connection, and its failure sends the next one to the broker.
    dpx_status first = GetFile("node1", "f.bin", target.c_str());
    EXPECT_EQ(first & 0xFFFF0000u, DPX_RPC_COMM_MODULE) << std::hex << first;
    EXPECT_EQ(GetFile("node1", "f.bin", target.c_str()), DPX_OK);
    EXPECT_EQ(dpxtest::compare_files(source, target), "");
}

TEST(ClientBinding, ManyThreadsTransferAtOnceOnOneBinding)
{
    ClientOfHub hub;
    std::string seed = hub.dir / "seed.bin";
    dpxtest::write_file(seed, "x");
    ASSERT_EQ(PutFile("node1", "seed.bin", seed.c_str()), DPX_OK);
    dpxtest::TraceCapture trace(TRC1_FLOW);

    constexpr int kThreads = 8, kRounds = 4;
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            for (int round = 0; round < kRounds; ++round) {
                std::string name = "t" + std::to_string(t) + "-" + std::to_string(round);
                std::string source = hub.dir / (name + ".src"), target = hub.dir / (name + ".dst");
                std::ofstream(source, std::ios::binary)
                    << dpxtest::pattern_bytes(150000 + 4096 * round, static_cast<uint32_t>(t * 100 + round));
                if (PutFile("node1", name.c_str(), source.c_str()) != DPX_OK ||
                    GetFile("node1", name.c_str(), target.c_str()) != DPX_OK ||
                    !dpxtest::compare_files(source, target).empty())
                    ++failures;
            }
        });
    }
    for (auto &thread : threads)
        thread.join();

    EXPECT_EQ(failures, 0);
    EXPECT_EQ(trace.count("binding to "), 0u);
    EXPECT_EQ(BINDING_HANDLE_INVALID, 0);
    EXPECT_TRUE(hub.temp_files().empty());
}

}  // namespace

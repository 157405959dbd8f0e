// Calls on a busy or quiet hub: the test peer answers DPX_E_BUSY a number of
// times, or DPX_E_QUIET, and prints a line per call it gets.
#include "client_hub.h"

#include <optional>

using dpxtest::ClientOfHub;
using dpxtest::ScopedEnv;

namespace {

struct RetryCase {
    std::optional<std::string> max_retry;   // DPX_MAX_RETRY; nullopt: unset (6)
    std::optional<std::string> interval;    // DPX_MIN_RETRY_INTERVAL; nullopt: unset (3)
    int busy;                               // busy answers before the peer serves
    uint64_t tries, sleeps, seconds;
    dpx_status expected;
};

TEST(ClientRetry, ABusyPeerIsTriedAndSleptOnAsTheScheduleSays)
{
    const RetryCase cases[] = {
        // The default schedule: 6 tries, sleeps of 3, 6, 12, 24, 48 and 96.
        {std::nullopt, std::nullopt, 100, 6, 6, 189, DPX_E_BUSY},
        {std::nullopt, "1", 2, 3, 2, 1 + 2, DPX_OK},
        // The first try always runs, and the last busy answer gets its sleep.
        {"1", "1", 100, 1, 1, 1, DPX_E_BUSY},
        {"0", "1", 100, 1, 1, 1, DPX_E_BUSY},
        {"-1", "1", 100, 1, 1, 1, DPX_E_BUSY},
        {"-2147483648", "1", 100, 1, 1, 1, DPX_E_BUSY},
        // No interval: the tries follow at once.
        {std::nullopt, "0", 100, 6, 0, 0, DPX_E_BUSY},
        {std::nullopt, "0", 5, 6, 0, 0, DPX_OK},
        {"3", "-5", 100, 3, 0, 0, DPX_E_BUSY},
        // The interval doubles in 32 bits: once negative it ends the sleeping,
        // not the tries.
        {"4", "805306368", 100, 4, 2, 805306368ull + 1610612736ull, DPX_E_BUSY},
    };
    for (const auto &c : cases) {
        // A second lasts a millisecond; a schedule of years is only counted.
        ScopedEnv unit("PLT1_SLEEP_UNIT_MS", c.seconds < 1000 ? "1" : "0");
        SCOPED_TRACE(testing::Message() << "max " << c.max_retry.value_or("unset") << ", interval "
                                        << c.interval.value_or("unset") << ", busy " << c.busy);
        ScopedEnv max_retry("DPX_MAX_RETRY", c.max_retry);
        ScopedEnv interval("DPX_MIN_RETRY_INTERVAL", c.interval);
        ClientOfHub hub({"--busy", std::to_string(c.busy)}, "dpx_test_peer");
        std::filesystem::create_directories(hub.depot + "/prod");
        dpxtest::write_file(hub.depot_file("f.txt"), "content");
        std::string target = hub.dir / "f.txt";
        PLT1_ResetSleepCount();

        EXPECT_EQ(GetFile("node1", "f.txt", target.c_str()), c.expected);
        EXPECT_EQ(PLT1_SleepCount(), c.sleeps);
        EXPECT_EQ(PLT1_SleepSeconds(), c.seconds);
        EXPECT_EQ(BINDING_HANDLE_INVALID, 0) << "busy must leave the binding alone";
        EXPECT_EQ(hub.peer_lines("call get_chunks "), c.tries);
        EXPECT_EQ(dpxtest::file_exists(target), c.expected == DPX_OK);
    }
}

TEST(ClientRetry, BusyAtTheEndIsReportedAndTheNextOperationReusesTheBinding)
{
    ScopedEnv max_retry("DPX_MAX_RETRY", "1");
    ScopedEnv interval("DPX_MIN_RETRY_INTERVAL", "0");
    ClientOfHub hub({"--busy", "1"}, "dpx_test_peer");
    std::filesystem::create_directories(hub.depot + "/prod");
    dpxtest::write_file(hub.depot_file("f.txt"), "content");
    std::string target = hub.dir / "f.txt";
    dpxtest::TraceCapture trace(TRC1_FLOW | TRC1_ERROR);

    EXPECT_EQ(GetFile("node1", "f.txt", target.c_str()), DPX_E_BUSY);
    EXPECT_TRUE(trace.contains("GetFile failed with return code [0xf11e0014]"));
    EXPECT_EQ(GetFile("node1", "f.txt", target.c_str()), DPX_OK);
    EXPECT_EQ(trace.count("binding to "), 1u);
    EXPECT_EQ(hub.peer_lines("call get_chunks "), 2u);
}

TEST(ClientRetry, AQuietAnswerIsNeitherRetriedNorTracedAndLeavesTheBinding)
{
    ScopedEnv interval("DPX_MIN_RETRY_INTERVAL", "0");
    ClientOfHub hub({"--quiet"}, "dpx_test_peer");
    std::string source = hub.dir / "source.txt";
    dpxtest::write_file(source, "content");
    dpxtest::TraceCapture trace(TRC1_FLOW | TRC1_ERROR);
    uint32_t result = 0;
    int16_t last = 5;
    dpx_node_name nodes[4];

    EXPECT_EQ(GetFile("node1", "f.txt", (hub.dir / "f.txt").c_str()), DPX_E_QUIET);
    EXPECT_EQ(PutFile("node1", "f.txt", source.c_str()), DPX_E_QUIET);
    EXPECT_EQ(Query("node1", "q", "f.txt", &result), DPX_E_QUIET);
    EXPECT_EQ(ListNodes("", &last, 3, nodes), DPX_E_QUIET);

    EXPECT_EQ(hub.peer_lines("call "), 4u);
    EXPECT_EQ(BINDING_HANDLE_INVALID, 0);
    EXPECT_EQ(trace.count("binding to "), 1u);
    EXPECT_FALSE(trace.contains("failed")) << trace.text();
    EXPECT_TRUE(hub.temp_files().empty());
}

}  // namespace

// What a client takes from its surroundings before any call: the retry
// settings read by the start of the library, the hub's name, and the size of
// the buffers a file gets.
#include "dpxclient.h"

#include "process.h"
#include "test_support.h"

#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstring>
#include <optional>

using dpxtest::ScopedEnv;
using dpxtest::TraceCapture;

namespace {

TEST(ClientSetup, TheStartReadsTheRetrySettingsFromTheEnvironment)
{
    // The same value goes into both variables; `complaint` is the traced line about DPX_MAX_RETRY, or null.
    const struct { std::optional<std::string> value; int32_t max_retry, interval; const char *complaint; } cases[] = {
        {std::nullopt, 6, 3, "No DPX_MAX_RETRY env"},
        {"abc", 6, 3, "Bad DPX_MAX_RETRY env: abc"},
        {"", 6, 3, "Bad DPX_MAX_RETRY env: \n"},
        {"12x", 12, 12, nullptr},
        {"0", 0, 0, nullptr},
        {"-1", -1, -1, nullptr},
        // Beyond 32 bits, the conversion's limits, as a 32-bit long has them.
        {"2147483648", INT32_MAX, INT32_MAX, nullptr},
        {"-2147483649", INT32_MIN, INT32_MIN, nullptr},
        {"99999999999999999999", INT32_MAX, INT32_MAX, nullptr},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.value.value_or("unset"));
        ScopedEnv max_retry("DPX_MAX_RETRY", c.value);
        ScopedEnv interval("DPX_MIN_RETRY_INTERVAL", c.value);
        TraceCapture trace(TRC1_FLOW);
        EXPECT_EQ(dpx_agent_init(), 0u);
        EXPECT_EQ(MAX_DPX_RETRY, c.max_retry);
        EXPECT_EQ(MIN_DPX_RETRY_INTERVAL, c.interval);
        EXPECT_EQ(trace.count("env"), c.complaint != nullptr ? 2u : 0u) << trace.text();
        EXPECT_TRUE(c.complaint == nullptr || trace.contains(c.complaint)) << trace.text();
        EXPECT_TRUE(trace.contains("Set MAX_DPX_RETRY " + std::to_string(c.max_retry) + "\n"));
        EXPECT_TRUE(trace.contains("Set MIN_DPX_RETRY_INTERVAL " + std::to_string(c.interval) + " seconds\n"));
        EXPECT_EQ(dpx_agent_stop(), 0u);
    }
}

TEST(ClientSetup, AFailedRegistrationOrUnregistrationShowsInTheTraceOnly)
{
    TraceCapture trace(TRC1_ERROR);
    EXPECT_EQ(dpx_agent_init(), 0u);
    EXPECT_EQ(dpx_agent_init(), 0u);   // registers a second time
    EXPECT_TRUE(trace.contains("rpc__register_mgr call failed with return code [0x1c020001]"));
    EXPECT_EQ(dpx_agent_stop(), 0u);
    EXPECT_EQ(dpx_agent_stop(), 0u);   // nothing left to unregister
    EXPECT_TRUE(trace.contains("dpx_rpc_unregister call failed with return code [0x1c020002]"));
}

TEST(ClientSetup, TheFrameworksHubNameComesFirstAndTheEnvironmentsIsRefusedWhenTooLong)
{
    // Nothing listens at the broker port: a name that is used costs a refused
    // connection and leaves the attempt in HUB.
    ScopedEnv lb_port("NCS_LB_PORT", std::to_string(dpxtest::free_port()));
    const std::string too_long(100, 'h');
    // `hub` is HUB afterwards; null: as before.
    const struct { std::optional<std::string> framework, environment; dpx_status expected; const char *hub; }
        cases[] = {
        {std::nullopt, std::nullopt, DPX_E_NO_HUB_HOST, nullptr},
        {std::nullopt, too_long, DPX_E_NO_HUB_HOST, nullptr},
        {std::nullopt, "127.0.0.3", DPX_E_INVALID_PARAM, "127.0.0.3"},
        {"127.0.0.2", "127.0.0.3", DPX_E_INVALID_PARAM, "127.0.0.2"},
        {too_long, "127.0.0.4", DPX_E_INVALID_PARAM, "127.0.0.4"},
        {too_long, std::nullopt, DPX_E_NO_HUB_HOST, nullptr},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(testing::Message() << c.framework.value_or("unset").substr(0, 12) << " / "
                                        << c.environment.value_or("unset").substr(0, 12));
        ScopedEnv framework("AFW_HUB_HOST", c.framework);
        ScopedEnv environment("DPX_HUBHOST", c.environment);
        std::strcpy(HUB, "before");
        handle_t handle = nullptr;
        dpx_status status = DPX_OK;
        get_hub_handle(&handle, &status);
        EXPECT_EQ(status, c.expected);
        EXPECT_EQ(handle, nullptr);
        EXPECT_STREQ(HUB, c.hub != nullptr ? c.hub : "before");
        EXPECT_EQ(BINDING_HANDLE, nullptr);
    }
}

TEST(ClientSetup, AFileGetsBuffersSizedByItsWholeLength)
{
    const struct { uint32_t chunks, remainder; int16_t records; } cases[] = {
        {0, 0, 24}, {23, 4095, 24}, {24, 0, 24}, {24, 1, 25}, {30, 5, 31}, {128, 0, 128}, {128, 1, 128},
        {256, 0, 128}, {0x7FFF, 0, 128}, {0x7FFF, 1, 24}, {0x8000, 0, 24}, {0xFFFE, 1, 24}, {0xFFFF, 0, 24},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(testing::Message() << c.chunks << " chunks + " << c.remainder);
        dpx_file_size size = {c.chunks, c.remainder};
        int16_t max = 0;
        dpx_chunk *buffer = dpx_alloc_xfer_buff(buffer_request(&size), &max);
        EXPECT_EQ(max + 1, c.records);
        dpx_free_xfer_buff(buffer);
    }
}

}  // namespace

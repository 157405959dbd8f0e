// Tracing: flags gate what is written, cached flags are taken afresh when the
// configuration changes, lines carry their origin, and tracing changes no
// result.
#include "child.h"
#include "test_support.h"

#include "dpx/dpx.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <string>

TRC1_DEFINE_UNIT("trace_test");

namespace {

using dpxtest::TraceCapture;

int traced_function(int value)
{
    TRC1_FUNCTION();
    TRC1_FLOW_MSG("flow message %d", value);
    TRC1_ERROR_MSG("error message %d\n", value);
    return value * 2;
}

TEST(Trace, WritesNothingWithFlagsZero)
{
    TraceCapture capture(0);
    EXPECT_EQ(traced_function(3), 6);
    EXPECT_EQ(capture.text(), "");
}

TEST(Trace, FlowFlagGatesFlowMessagesOnly)
{
    TraceCapture capture(TRC1_FLOW);
    traced_function(4);
    EXPECT_TRUE(capture.contains("flow message 4"));
    EXPECT_FALSE(capture.contains("error message"));
    EXPECT_FALSE(capture.contains("ENTER"));
}

TEST(Trace, ErrorFlagGatesErrorMessagesOnly)
{
    TraceCapture capture(TRC1_ERROR);
    traced_function(5);
    EXPECT_TRUE(capture.contains("error message 5"));
    EXPECT_FALSE(capture.contains("flow message"));
    // A trailing newline of a message is not doubled.
    EXPECT_FALSE(capture.contains("error message 5\n\n"));
}

TEST(Trace, EntryFlagWritesEntryAndExitEventsOfLibraryFunctions)
{
    TraceCapture capture(TRC1_ENTRY);
    int16_t max = 0;
    dpx_free_xfer_buff(dpx_alloc_xfer_buff(24, &max));
    EXPECT_EQ(capture.count("dpx_alloc_xfer_buff:"), 2u);
    EXPECT_TRUE(capture.contains("dpxbuff dpx_alloc_xfer_buff:"));
    EXPECT_TRUE(capture.contains("ENTER"));
    EXPECT_TRUE(capture.contains("EXIT"));
}

TEST(Trace, LinesCarryTimeProcessThreadUnitFunctionAndLine)
{
    TraceCapture capture(TRC1_FLOW);
    traced_function(6);
    std::string text = capture.text();
    // 2026-11-22T23:59:01.123456Z pid 1 tid 2 trace_test traced_function:27 flow message 6
    EXPECT_NE(text.find("Z pid "), std::string::npos) << text;
    EXPECT_NE(text.find(" tid "), std::string::npos) << text;
    EXPECT_NE(text.find(" trace_test traced_function:"), std::string::npos) << text;
}

TEST(Trace, CachedFlagsAreTakenAfreshAfterAChange)
{
    {
        TraceCapture quiet(0);
        traced_function(1);  // caches flags 0 in the descriptor
        EXPECT_EQ(quiet.text(), "");
    }
    TraceCapture loud(TRC1_ERROR);
    traced_function(2);
    EXPECT_TRUE(loud.contains("error message 2"));
}

TEST(Trace, FlagsAndFileComeFromTheEnvironment)
{
    dpxtest::TempDir dir;
    std::string file = dir / "env.log";
    EXPECT_EQ(dpxtest::in_child([&]() -> std::string {
                  setenv("TRC1_FLAGS", "0x80", 1);
                  setenv("TRC1_FILE", file.c_str(), 1);
                  TRC1_Reload();
                  traced_function(9);
                  return TRC1_Flags() == 0x80 ? "" : "flags not parsed";
              }),
              "");
    std::string text = dpxtest::read_file(file);
    EXPECT_NE(text.find("error message 9"), std::string::npos);
    EXPECT_EQ(text.find("flow message"), std::string::npos);
}

}  // namespace

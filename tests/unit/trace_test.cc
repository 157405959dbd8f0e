// Tracing: each flag gates its own lines, cached flags are taken afresh when
// the configuration changes, lines carry their origin, and tracing changes no
// result.
#include "child.h"
#include "test_support.h"

#include "dpx/dpx.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <tuple>
#include <unistd.h>

TRC1_DEFINE_UNIT("trace_test");

namespace {

int traced_function(int value)
{
    TRC1_FUNCTION();
    TRC1_FLOW_MSG("flow message %d", value);
    TRC1_ERROR_MSG("error message %d\n", value);
    return value * 2;
}

// The rows change the flags under one descriptor, whose cached flags must
// be taken afresh each time.
TEST(Trace, EachFlagGatesItsOwnLinesAndTracingChangesNoResult)
{
    const struct { uint32_t flags; size_t flow, error, events; } rows[] = {
        {0, 0, 0, 0}, {TRC1_FLOW, 1, 0, 0}, {TRC1_ERROR, 0, 1, 0}, {0, 0, 0, 0}, {TRC1_ENTRY, 0, 0, 2},
        {TRC1_FLOW | TRC1_ERROR | TRC1_ENTRY, 1, 1, 2}};
    for (const auto &row : rows) {
        dpxtest::TraceCapture capture(row.flags);
        EXPECT_EQ(traced_function(3), 6);
        // Each line once, with no line besides them and no newline doubled.
        EXPECT_EQ(std::tuple(capture.count(" flow message 3\n"), capture.count(" error message 3\n"),
                             capture.count(" ENTER\n") + capture.count(" EXIT\n"), capture.count("\n")),
                  std::tuple(row.flow, row.error, row.events, row.flow + row.error + row.events))
            << row.flags << "\n" << capture.text();
    }
}

TEST(Trace, LibraryLinesCarryTimeProcessThreadUnitFunctionAndLine)
{
    dpxtest::TraceCapture capture(TRC1_ENTRY);
    dpx_free_xfer_buff(nullptr);
    unsigned pid = 0, line = 0;
    // 2026-11-22T23:59:01.123456Z pid 1 tid 2 dpxbuff dpx_free_xfer_buff:40 ENTER
    const char *format = "%*4u-%*2u-%*2uT%*2u:%*2u:%*2u.%*6uZ pid %u tid %*u dpxbuff dpx_free_xfer_buff:%u ENTER";
    EXPECT_EQ(std::sscanf(capture.text().c_str(), format, &pid, &line), 2) << capture.text();
    EXPECT_TRUE(pid == unsigned(getpid()) && line > 0) << capture.text();
}

TEST(Trace, FlagsAndFileComeFromTheEnvironment)
{
    dpxtest::TempDir dir;
    EXPECT_EQ(dpxtest::in_child([&]() -> std::string {
                  setenv("TRC1_FLAGS", "0x80", 1);
                  setenv("TRC1_FILE", (dir / "env.log").c_str(), 1);
                  TRC1_Reload();
                  traced_function(9);
                  return TRC1_Flags() == 0x80 ? "" : "flags not parsed";
              }), "");
    const std::string text = dpxtest::read_file(dir / "env.log");
    EXPECT_TRUE(text.find(" trace_test traced_function:") != std::string::npos &&
                text.find("error message 9") != std::string::npos && text.find("flow") == std::string::npos)
        << text;
}

}  // namespace

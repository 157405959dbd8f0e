// The file layer's own debugging log "/dpx-debug.log". The log's place is
// fixed, so the suite writes the real one where it may, and cuts it back to
// what it held before.
#include <gtest/gtest.h>

#include "dpx/dpx.h"

#include <fstream>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

constexpr const char *kLog = "/dpx-debug.log";

// Remembers the log as it is and puts it back at the end of the scope:
// removed if it didn't exist, else cut to its old size.
class LogSnapshot {
public:
    LogSnapshot()
    {
        struct stat st {};
        existed_ = stat(kLog, &st) == 0;
        size_ = existed_ ? st.st_size : 0;
    }
    ~LogSnapshot()
    {
        if (existed_)
            EXPECT_EQ(truncate(kLog, size_), 0);
        else
            unlink(kLog);
    }
    LogSnapshot(const LogSnapshot &) = delete;
    LogSnapshot &operator=(const LogSnapshot &) = delete;

    std::string appended() const
    {
        std::ifstream in(kLog, std::ios::binary);
        in.seekg(size_);
        std::ostringstream text;
        text << in.rdbuf();
        return text.str();
    }

private:
    bool existed_ = false;
    off_t size_ = 0;
};

}  // namespace

TEST(CxTraceLog, IndentsBetweenEnterAndLeaveAndCountsOnBelowZero)
{
    if (access("/", W_OK) != 0 && access(kLog, W_OK) != 0)
        GTEST_SKIP() << kLog << " can't be written by this process";
    LogSnapshot log;
    cxIntlTraceEnter("outer %d\n", 1);
    cxIntlTracePoint("step\n");
    cxIntlTraceEnter("inner\n");
    cxIntlTracePoint("no newline ");
    cxIntlTracePoint("%s\n", "same line");
    cxIntlTraceLeave("inner\n");
    cxIntlTraceLeave("outer\n");
    cxIntlTraceLeave("unbalanced\n");
    cxIntlTraceEnter("back at %s\n", "zero");
    cxIntlTracePoint("level\n");
    EXPECT_EQ(log.appended(),
              "ENTER outer 1\n"
              "   ... step\n"
              "   ENTER inner\n"
              "      ... no newline       ... same line\n"
              "   LEAVE inner\n"
              "LEAVE outer\n"
              "LEAVE unbalanced\n"
              "ENTER back at zero\n"
              "... level\n");
}

// As root the child gives up its rights first, so the calls meet a log they
// can't open, as in a process without write permission in the root.
TEST(CxTraceLog, WithoutAWritableLogTheCallsDoNothingAndReturn)
{
    enum { kDone = 0, kNoSetuid = 2, kWritable = 3 };
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0))
            _exit(kNoSetuid);
        if (access("/", W_OK) == 0 || access(kLog, W_OK) == 0)
            _exit(kWritable);
        cxIntlTraceEnter("enter %s\n", "x");
        cxIntlTracePoint("point\n");
        cxIntlTraceLeave("leave\n");
        _exit(kDone);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status)) << "the child died, signal " << (WIFSIGNALED(status) ? WTERMSIG(status) : 0);
    if (WEXITSTATUS(status) == kNoSetuid)
        GTEST_SKIP() << "can't drop root rights here";
    if (WEXITSTATUS(status) == kWritable)
        GTEST_SKIP() << kLog << " stays writable without root rights";
    EXPECT_EQ(WEXITSTATUS(status), kDone);
}

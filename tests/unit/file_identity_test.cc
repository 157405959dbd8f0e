// The identity of a file across the calls of a transfer: size in chunks and
// remainder, and modification time in seconds, taken from real files.
#include "test_support.h"

#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

using dpxtest::TempDir;

namespace {

void set_mtime(const std::string &path, time_t seconds, long nanoseconds)
{
    const struct timespec times[2] = {{seconds, 0}, {seconds, nanoseconds}};
    ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

// Takes the identity of `path` into a fresh record, as a first read call does.
dpx_file_desc first_call(const std::string &path)
{
    dpx_file_desc desc{};
    dpx_file_size size{};
    dpx_file_time time{};
    EXPECT_EQ(dpx_get_os_file_stats(path.c_str(), &size, &time), DPX_OK);
    EXPECT_EQ(dpx_init_file_stats(&desc, &size, &time), DPX_OK);
    return desc;
}

// Takes the identity again and compares it, as every later call does.
dpx_status later_call(const std::string &path, const dpx_file_desc &desc)
{
    dpx_file_size size{};
    dpx_file_time time{};
    dpx_status status = dpx_get_os_file_stats(path.c_str(), &size, &time);
    return status == DPX_OK ? dpx_check_file_stats(&desc, &size, &time) : status;
}

}  // namespace

TEST(FileIdentity, SplitsTheSixtyFourBitLengthIntoChunksAndRemainder)
{
    TempDir tmp;
    struct Case {
        uint64_t length;
        uint32_t chunks;
        uint32_t remainder;
    };
    const Case cases[] = {
        {0, 0, 0}, {8192, 2, 0}, {8193, 2, 1}, {1ull << 33, 2097152, 0}, {(1ull << 32) + 5, 1u << 20, 5},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.length);
        const std::string path = tmp / "f";
        int fd = open(path.c_str(), O_CREAT | O_WRONLY | O_TRUNC, 0600);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(ftruncate(fd, static_cast<off_t>(c.length)), 0);
        close(fd);
        set_mtime(path, 1234567890, 0);
        dpx_file_size size{};
        dpx_file_time time{7, 7};
        ASSERT_EQ(dpx_get_os_file_stats(path.c_str(), &size, &time), DPX_OK);
        EXPECT_EQ(size.chunks, c.chunks);
        EXPECT_EQ(size.remainder, c.remainder);
        EXPECT_EQ(time.low, 1234567890u);
        EXPECT_EQ(time.high, 0u);
    }
}

TEST(FileIdentity, AFileThatCantBeExaminedGivesFileReadAndWritesNothing)
{
    TempDir tmp;
    dpx_file_size size{11, 12};
    dpx_file_time time{13, 14};
    EXPECT_EQ(dpx_get_os_file_stats((tmp / "missing").c_str(), &size, &time), DPX_E_FILE_READ);
    EXPECT_EQ(size.chunks, 11u);
    EXPECT_EQ(size.remainder, 12u);
    EXPECT_EQ(time.low, 13u);
    EXPECT_EQ(time.high, 14u);
    EXPECT_EQ(dpx_get_os_file_stats(nullptr, &size, &time), DPX_E_INVALID_PARAM);
    EXPECT_EQ(dpx_check_file_stats(nullptr, &size, &time), DPX_E_INVALID_PARAM);
}

TEST(FileIdentity, ATouchOrAGrowthBetweenCallsIsNoticedButASameSecondRewriteIsNot)
{
    TempDir tmp;
    const std::string path = tmp / "f";
    dpxtest::write_file(path, "0123456789");
    set_mtime(path, 1600000000, 100);
    const dpx_file_desc desc = first_call(path);
    EXPECT_EQ(later_call(path, desc), DPX_OK);

    // Same length, new content, later within the same second.
    dpxtest::write_file(path, "abcdefghij");
    set_mtime(path, 1600000000, 999999999);
    EXPECT_EQ(later_call(path, desc), DPX_OK);

    set_mtime(path, 1600000001, 0);
    EXPECT_EQ(later_call(path, desc), DPX_E_FILE_CHANGED) << "touched";

    dpxtest::write_file(path, "abcdefghijk");
    set_mtime(path, 1600000000, 0);
    EXPECT_EQ(later_call(path, desc), DPX_E_FILE_CHANGED) << "grown by one byte";
}

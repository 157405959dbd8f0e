// Reading a file into transfer buffers and writing buffers back, and the
// identity of a file across the calls of a transfer, on real files (reads
// beyond 4 GiB go through the read service's sparse-file test).
#include "cx_test_file.h"
#include "test_support.h"
#include "trc/trc1.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <tuple>
#include <unistd.h>
#include <vector>

using namespace dpxtest;

namespace {

// What one read call reports: last, finished and index.
using Call = std::tuple<int, int, uint32_t>;

// One read call from `index`. The out-arguments start as a sentinel that no read gives.
Call read_call(CxFile &file, uint32_t index, std::vector<dpx_chunk> &buffer, int16_t max, dpx_status *status)
{
    int16_t last = -7;
    uint8_t finished = 0x5A;
    *status = dpx_read_xfer_buff(file.get(), &index, buffer.data(), &last, max, &finished);
    return {last, finished, index};
}

// Makes `path` a (sparse) file of `length` bytes, modified at this time.
void make_file(const std::string &path, uint64_t length, time_t seconds, long nanoseconds)
{
    const struct timespec times[2] = {{seconds, 0}, {seconds, nanoseconds}};
    close(open(path.c_str(), O_CREAT | O_WRONLY, 0600));
    EXPECT_TRUE(truncate(path.c_str(), off_t(length)) == 0 && utimensat(AT_FDCWD, path.c_str(), times, 0) == 0);
}

TEST(XferRead, FillsRecordsFromTheIndexAndFindsTheEndOnlyByAShortRead)
{
    const struct { size_t size; uint32_t index; int16_t max; std::vector<Call> calls; } cases[] = {
        {0, 0, 23, {{0, 1, 1}}}, {4095, 0, 23, {{0, 1, 1}}}, {4096, 0, 23, {{1, 1, 2}}}, {5000, 0, 23, {{1, 1, 2}}},
        {24 * 4096, 0, 23, {{23, 0, 24}, {0, 1, 25}}}, {5000, 10, 23, {{0, 1, 11}}}, {5000, 1, -1, {{-1, 0, 1}}}};
    for (const auto &c : cases) {
        SCOPED_TRACE(testing::Message() << c.size << " bytes from chunk " << c.index << ", max " << c.max);
        TempDir tmp;
        const std::string content = pattern_bytes(c.size);
        write_file(tmp / "f", content);
        CxFile file;
        ASSERT_TRUE(cx_ok(file.open(tmp / "f", CX_FILE_READ)));
        std::vector<dpx_chunk> buffer(24);
        uint32_t index = c.index;
        for (const Call &expected : c.calls) {
            dpx_status status = DPX_E_QUIET;
            ASSERT_EQ(read_call(file, index, buffer, c.max, &status), expected);
            ASSERT_EQ(status, DPX_OK);
            for (int i = 0; i <= std::get<0>(expected); ++i, ++index) {
                EXPECT_EQ(buffer[i].index, index);
                EXPECT_EQ(std::string(reinterpret_cast<const char *>(buffer[i].data), buffer[i].length),
                          content.substr(std::min<size_t>(size_t{index} * 4096, c.size), 4096));
            }
        }
    }
}

TEST(XferRead, AFailedSeekOrReadLeavesTheOutArgumentsAsTheyWere)
{
    TempDir tmp;
    int pipe_ends[2];
    ASSERT_EQ(pipe(pipe_ends), 0);
    CxFile pipe_reader(fdopen(pipe_ends[0], "rb"));
    close(pipe_ends[1]);
    CxFile write_only;
    ASSERT_TRUE(cx_ok(write_only.open(tmp / "w", CX_FILE_WRITE)));
    const struct { CxFile *file; uint32_t index; dpx_status status; const char *trace; } cases[] = {
        {&pipe_reader, 3, DPX_E_FILE_SEEK, "Can't seek file pos\n"},
        {&write_only, 0, DPX_E_FILE_READ, "Can't read file\n"}};
    std::vector<dpx_chunk> buffer(24);
    for (const auto &c : cases) {
        TraceCapture trace(TRC1_ERROR);
        dpx_status status = DPX_OK;
        EXPECT_EQ(read_call(*c.file, c.index, buffer, 23, &status), Call(-7, 0x5A, c.index));
        EXPECT_EQ(status, c.status);
        EXPECT_EQ(trace.count(c.trace), 1u) << trace.text();
    }
}

TEST(XferWrite, WritesRecordsZeroToLastInOrderOrNothingWhenOneClaimsMoreThanAChunk)
{
    TempDir tmp;
    const std::string texts[] = {"abc", "", std::string(4096, 'z'), "long"};
    std::vector<dpx_chunk> buffer(4);
    for (size_t i = 0; i < 4; ++i)
        buffer[i].length = static_cast<uint32_t>(texts[i].copy(reinterpret_cast<char *>(buffer[i].data), 4096));
    buffer[3].length = DPX_CHUNK_SIZE + 1;
    const struct { int16_t last; dpx_status status; std::string content; } rows[] = {
        {-1, DPX_OK, ""}, {0, DPX_OK, "abc"}, {2, DPX_OK, "abc" + texts[2]}, {3, DPX_E_INVALID_PARAM, ""}};
    for (const auto &row : rows) {
        CxFile file;
        ASSERT_TRUE(cx_ok(file.open(tmp / "out", CX_FILE_WRITE)));
        EXPECT_EQ(dpx_write_xfer_buff(file.get(), buffer.data(), row.last), row.status) << row.last;
        ASSERT_TRUE(cx_ok(file.close()));
        EXPECT_EQ(read_file(tmp / "out"), row.content) << row.last;
    }
    CxFile read_only;
    ASSERT_TRUE(cx_ok(read_only.open(tmp / "out", CX_FILE_READ)));
    TraceCapture trace(TRC1_ERROR);
    EXPECT_EQ(dpx_write_xfer_buff(read_only.get(), buffer.data(), 0), DPX_E_FILE_WRITE);
    EXPECT_EQ(trace.count("Can't write file\n"), 1u) << trace.text();
}

TEST(FileIdentity, SplitsTheSixtyFourBitLengthIntoChunksAndRemainderAndTakesTheSeconds)
{
    TempDir tmp;
    dpx_file_size size{11, 12};
    dpx_file_time time{13, 14};
    EXPECT_EQ(dpx_get_os_file_stats((tmp / "f").c_str(), &size, &time), DPX_E_FILE_READ);
    EXPECT_TRUE(size.chunks == 11 && size.remainder == 12 && time.low == 13 && time.high == 14) << "written";
    const struct { uint64_t length; uint32_t chunks, remainder; } rows[] = {
        {0, 0, 0}, {8192, 2, 0}, {8193, 2, 1}, {1ull << 33, 2097152, 0}, {(1ull << 32) + 5, 1u << 20, 5}};
    for (const auto &row : rows) {
        make_file(tmp / "f", row.length, 1234567890, 5);
        ASSERT_EQ(dpx_get_os_file_stats((tmp / "f").c_str(), &size, &time), DPX_OK);
        EXPECT_TRUE(size.chunks == row.chunks && size.remainder == row.remainder) << row.length;
        EXPECT_TRUE(time.low == 1234567890 && time.high == 0) << row.length;
    }
}

TEST(FileIdentity, ATouchOrAGrowthBetweenCallsIsNoticedButASameSecondRewriteIsNot)
{
    TempDir tmp;
    const std::string path = tmp / "f";
    dpx_file_desc desc{};
    // The identity goes into the record on the first call, as the read
    // service does it, and is compared with it on every call. The steps:
    // unchanged, the same length rewritten within the second, touched, grown
    // by a byte.
    const struct { std::string content; time_t seconds; long nanoseconds; dpx_status status; } steps[] = {
        {"0123456789", 1600000000, 100, DPX_OK}, {"abcdefghij", 1600000000, 999999999, DPX_OK},
        {"abcdefghij", 1600000001, 0, DPX_E_FILE_CHANGED}, {"abcdefghijk", 1600000000, 0, DPX_E_FILE_CHANGED}};
    for (const auto &step : steps) {
        write_file(path, step.content);
        make_file(path, step.content.size(), step.seconds, step.nanoseconds);
        dpx_file_size size{};
        dpx_file_time time{};
        ASSERT_EQ(dpx_get_os_file_stats(path.c_str(), &size, &time), DPX_OK);
        ASSERT_EQ(&step == steps ? dpx_init_file_stats(&desc, &size, &time) : DPX_OK, DPX_OK);
        EXPECT_EQ(dpx_check_file_stats(&desc, &size, &time), step.status) << step.content << " at " << step.seconds;
    }
}

}  // namespace

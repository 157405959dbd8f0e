// Reading a file into transfer buffers and writing buffers back, on real
// files, sparse ones of more than 4 GiB included.
#include "cx_test_file.h"
#include "test_support.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

using dpxtest::cx_ok;
using dpxtest::CxFile;
using dpxtest::TempDir;

namespace {

constexpr int16_t kMax = 23;
constexpr uint32_t kChunk = DPX_CHUNK_SIZE;

// What one read call reports.
struct Call {
    int16_t last;
    uint8_t finished;
    uint32_t index;
    bool operator==(const Call &) const = default;
};

std::ostream &operator<<(std::ostream &out, const Call &call)
{
    return out << "{last " << call.last << ", finished " << int{call.finished} << ", index " << call.index << "}";
}

// A sentinel that no read reports, to see that nothing was written.
constexpr Call kUntouched = {-7, 0x5A, 0xDEADBEEF};

Call read_call(cx_os_file_t *file, uint32_t index, std::vector<dpx_chunk> &buffer, int16_t max, dpx_status *status)
{
    Call call = kUntouched;
    call.index = index;
    *status = dpx_read_xfer_buff(file, &call.index, buffer.data(), &call.last, max, &call.finished);
    return call;
}

dpx_chunk record_of(const std::string &bytes)
{
    dpx_chunk record{};
    record.length = static_cast<uint32_t>(bytes.size());
    bytes.copy(reinterpret_cast<char *>(record.data), bytes.size());
    return record;
}

}  // namespace

TEST(XferRead, ReadsWholeFilesIntoRecordsAndFindsTheEndOnlyByAShortRead)
{
    struct Case {
        size_t size;
        std::vector<Call> calls;
    };
    const Case cases[] = {
        {0, {{0, 1, 1}}},
        {4095, {{0, 1, 1}}},
        {4096, {{1, 1, 2}}},
        {5000, {{1, 1, 2}}},
        {24 * 4096, {{23, 0, 24}, {0, 1, 25}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.size);
        TempDir tmp;
        const std::string content = dpxtest::pattern_bytes(c.size);
        dpxtest::write_file(tmp / "f", content);
        CxFile file;
        ASSERT_TRUE(cx_ok(file.open(tmp / "f", CX_FILE_READ)));
        std::vector<dpx_chunk> buffer(kMax + 1);
        std::string got;
        uint32_t index = 0;
        for (const Call &expected : c.calls) {
            dpx_status status = DPX_E_QUIET;
            Call call = read_call(file.get(), index, buffer, kMax, &status);
            ASSERT_EQ(status, DPX_OK);
            ASSERT_EQ(call, expected);
            for (int16_t i = 0; i <= call.last; ++i) {
                EXPECT_EQ(buffer[i].index, index + static_cast<uint32_t>(i));
                size_t offset = size_t{buffer[i].index} * kChunk;
                EXPECT_EQ(buffer[i].length, std::min<size_t>(kChunk, c.size - offset));
                got.append(reinterpret_cast<const char *>(buffer[i].data), buffer[i].length);
            }
            index = call.index;
        }
        EXPECT_EQ(got, content);
    }
}

TEST(XferRead, AnIndexPastTheEndGivesOneEmptyRecordAndMaxMinusOneReadsNothing)
{
    TempDir tmp;
    dpxtest::write_file(tmp / "f", std::string(5000, 'x'));
    CxFile file;
    ASSERT_TRUE(cx_ok(file.open(tmp / "f", CX_FILE_READ)));
    std::vector<dpx_chunk> buffer(kMax + 1);
    dpx_status status = DPX_E_QUIET;
    EXPECT_EQ(read_call(file.get(), 10, buffer, kMax, &status), (Call{0, 1, 11}));
    EXPECT_EQ(status, DPX_OK);
    EXPECT_EQ(buffer[0].index, 10u);
    EXPECT_EQ(buffer[0].length, 0u);
    EXPECT_EQ(read_call(file.get(), 1, buffer, -1, &status), (Call{-1, 0, 1}));
    EXPECT_EQ(status, DPX_OK);
    uint32_t index = 0;
    int16_t last = 0;
    EXPECT_EQ(dpx_read_xfer_buff(file.get(), &index, buffer.data(), &last, kMax, nullptr), DPX_E_INVALID_PARAM);
}

TEST(XferRead, AFailedSeekOrReadLeavesTheOutArgumentsAsTheyWere)
{
    TempDir tmp;
    ASSERT_EQ(mkdir((tmp / "dir").c_str(), 0700), 0);
    int pipe_ends[2];
    ASSERT_EQ(pipe(pipe_ends), 0);
    CxFile pipe_reader(fdopen(pipe_ends[0], "rb"));
    close(pipe_ends[1]);
    CxFile write_only;
    ASSERT_TRUE(cx_ok(write_only.open(tmp / "w", CX_FILE_WRITE)));
    CxFile directory;
    ASSERT_TRUE(cx_ok(directory.open(tmp / "dir", CX_FILE_READ)));
    struct Case {
        const char *what;
        CxFile *file;
        uint32_t index;
        dpx_status status;
        const char *trace;
    };
    const Case cases[] = {
        {"pipe", &pipe_reader, 3, DPX_E_FILE_SEEK, "Can't seek file pos"},
        {"write-only file", &write_only, 0, DPX_E_FILE_READ, "Can't read file"},
        {"directory", &directory, 0, DPX_E_FILE_READ, "Can't read file"},
    };
    std::vector<dpx_chunk> buffer(kMax + 1);
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        dpxtest::TraceCapture trace(TRC1_ERROR);
        Call call = kUntouched;
        call.index = c.index;
        EXPECT_EQ(dpx_read_xfer_buff(c.file->get(), &call.index, buffer.data(), &call.last, kMax, &call.finished),
                  c.status);
        EXPECT_EQ(call, (Call{kUntouched.last, kUntouched.finished, c.index}));
        EXPECT_EQ(trace.count(c.trace), 1u);
    }
}

TEST(XferRead, ChunksOnBothSidesOfTheTwoAndFourGiBBoundariesComeFromTheirPlace)
{
    TempDir tmp;
    const std::string path = tmp / "sparse";
    const uint32_t below_2g = (1u << 19) - 1;
    const uint32_t below_4g = (1u << 20) - 1;
    const uint64_t size = (uint64_t{below_4g} + 3) * kChunk + 100;
    int fd = open(path.c_str(), O_CREAT | O_WRONLY, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, static_cast<off_t>(size)), 0);
    for (uint32_t chunk : {below_2g, below_2g + 1, below_4g, below_4g + 1, below_4g + 3}) {
        std::string mark = "chunk " + std::to_string(chunk);
        ASSERT_EQ(pwrite(fd, mark.data(), mark.size(), static_cast<off_t>(uint64_t{chunk} * kChunk)),
                  static_cast<ssize_t>(mark.size()));
    }
    close(fd);

    CxFile file;
    ASSERT_TRUE(cx_ok(file.open(path, CX_FILE_READ)));
    std::vector<dpx_chunk> buffer(2);
    auto text_of = [](const dpx_chunk &record) { return std::string(reinterpret_cast<const char *>(record.data)); };
    dpx_status status = DPX_E_QUIET;
    for (uint32_t first : {below_2g, below_4g}) {
        SCOPED_TRACE(first);
        EXPECT_EQ(read_call(file.get(), first, buffer, 1, &status), (Call{1, 0, first + 2}));
        EXPECT_EQ(status, DPX_OK);
        EXPECT_EQ(text_of(buffer[0]), "chunk " + std::to_string(first));
        EXPECT_EQ(text_of(buffer[1]), "chunk " + std::to_string(first + 1));
        EXPECT_EQ(buffer[1].index, first + 1);
    }
    EXPECT_EQ(read_call(file.get(), below_4g + 3, buffer, 1, &status), (Call{0, 1, below_4g + 4}));
    EXPECT_EQ(buffer[0].length, 100u);
    EXPECT_EQ(text_of(buffer[0]), "chunk " + std::to_string(below_4g + 3));
}

TEST(XferWrite, WritesRecordsZeroToLastInOrderAndNothingForMinusOne)
{
    TempDir tmp;
    const std::vector<dpx_chunk> buffer = {record_of("abc"), record_of(""), record_of(std::string(4096, 'z')),
                                           record_of("never")};
    for (int16_t last : {-1, 0, 2}) {
        SCOPED_TRACE(last);
        CxFile file;
        ASSERT_TRUE(cx_ok(file.open(tmp / "out", CX_FILE_WRITE)));
        EXPECT_EQ(dpx_write_xfer_buff(file.get(), buffer.data(), last), DPX_OK);
        ASSERT_TRUE(cx_ok(file.close()));
        const std::string expected[] = {"", "abc", "abc" + std::string(4096, 'z')};
        EXPECT_EQ(dpxtest::read_file(tmp / "out"), expected[last == -1 ? 0 : last == 0 ? 1 : 2]);
    }
}

TEST(XferWrite, ARecordLongerThanAChunkIsRefusedBeforeAnythingIsWritten)
{
    TempDir tmp;
    std::vector<dpx_chunk> buffer = {record_of("first"), record_of("second")};
    buffer[1].length = kChunk + 1;
    CxFile file;
    ASSERT_TRUE(cx_ok(file.open(tmp / "out", CX_FILE_WRITE)));
    EXPECT_EQ(dpx_write_xfer_buff(file.get(), buffer.data(), 1), DPX_E_INVALID_PARAM);
    EXPECT_EQ(dpx_write_xfer_buff(nullptr, buffer.data(), 0), DPX_E_INVALID_PARAM);
    ASSERT_TRUE(cx_ok(file.close()));
    EXPECT_EQ(dpxtest::read_file(tmp / "out"), "");
}

TEST(XferWrite, AFailedWriteIsTracedAndReported)
{
    TempDir tmp;
    dpxtest::write_file(tmp / "f", "content");
    CxFile read_only;
    ASSERT_TRUE(cx_ok(read_only.open(tmp / "f", CX_FILE_READ)));
    const std::vector<dpx_chunk> buffer = {record_of(std::string(4096, 'w'))};
    dpxtest::TraceCapture trace(TRC1_ERROR);
    EXPECT_EQ(dpx_write_xfer_buff(read_only.get(), buffer.data(), 0), DPX_E_FILE_WRITE);
    EXPECT_EQ(trace.count("Can't write file"), 1u);
    EXPECT_EQ(dpxtest::read_file(tmp / "f"), "content");
}

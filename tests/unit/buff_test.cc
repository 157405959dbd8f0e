// Transfer buffers: the clamp of the allocator and what the checksum covers.
#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <cstring>
#include <zlib.h>

namespace {

struct ClampRow {
    int16_t requested;
    int16_t max;
};

class AllocClamp : public ::testing::TestWithParam<ClampRow> {};

TEST_P(AllocClamp, GivesRecordsBetween24And128WithAllRecordsUsable)
{
    int16_t max = -99;
    dpx_chunk *buffer = dpx_alloc_xfer_buff(GetParam().requested, &max);
    ASSERT_NE(buffer, nullptr);
    EXPECT_EQ(max, GetParam().max);
    // Every record up to max is ours to write (ASan checks the bounds).
    std::memset(buffer, 0xA5, sizeof(dpx_chunk) * static_cast<size_t>(max + 1));
    dpx_free_xfer_buff(buffer);
}

INSTANTIATE_TEST_SUITE_P(Requests, AllocClamp,
                         ::testing::Values(ClampRow{24, 23}, ClampRow{25, 24}, ClampRow{100, 99},
                                           ClampRow{128, 127}, ClampRow{129, 127}, ClampRow{1000, 127},
                                           ClampRow{32767, 127}, ClampRow{23, 23}, ClampRow{0, 23},
                                           ClampRow{-1, 23}, ClampRow{-2, 23}, ClampRow{-32768, 23}));

TEST(FreeXferBuff, IgnoresNull)
{
    dpx_free_xfer_buff(nullptr);
}

dpx_chunk make_chunk(uint32_t length, char fill)
{
    dpx_chunk c;
    std::memset(&c, 0, sizeof c);
    c.length = length;
    std::memset(c.data, fill, sizeof c.data);
    return c;
}

uint32_t zlib_crc(uint32_t start, const dpx_chunk &c, uint32_t length)
{
    return static_cast<uint32_t>(crc32(start, c.data, length));
}

TEST(Checksum, CoversTheFirstCountRecordsOverTheirLengthOnly)
{
    dpx_chunk buf[3] = {make_chunk(4096, 'a'), make_chunk(10, 'b'), make_chunk(4096, 'c')};
    uint32_t crc = 0;
    dpx_checksum_xfer_buff(buf, 2, &crc);
    uint32_t expected = zlib_crc(zlib_crc(0, buf[0], 4096), buf[1], 10);
    EXPECT_EQ(crc, expected);
}

TEST(Checksum, IgnoresTheRecordAtCountWhateverItHolds)
{
    dpx_chunk a[3] = {make_chunk(100, 'a'), make_chunk(100, 'b'), make_chunk(100, 'c')};
    dpx_chunk b[3] = {make_chunk(100, 'a'), make_chunk(100, 'b'), make_chunk(4000, 'z')};
    uint32_t crc_a = 0, crc_b = 0;
    dpx_checksum_xfer_buff(a, 2, &crc_a);
    dpx_checksum_xfer_buff(b, 2, &crc_b);
    EXPECT_EQ(crc_a, crc_b);
}

TEST(Checksum, IgnoresBytesBehindLengthAndTheIndexAndLengthFields)
{
    dpx_chunk a = make_chunk(5, 'x');
    dpx_chunk b = make_chunk(5, 'x');
    b.index = 77;
    std::memset(b.data + 5, 'q', sizeof b.data - 5);
    dpx_chunk two_a[2] = {a, a};
    dpx_chunk two_b[2] = {b, b};
    uint32_t crc_a = 0, crc_b = 0;
    dpx_checksum_xfer_buff(two_a, 1, &crc_a);
    dpx_checksum_xfer_buff(two_b, 1, &crc_b);
    EXPECT_EQ(crc_a, crc_b);
    EXPECT_NE(crc_a, 0u);
}

TEST(Checksum, ContinuesFromTheValueItIsGiven)
{
    dpx_chunk buf[2] = {make_chunk(300, 'k'), make_chunk(0, 0)};
    uint32_t crc = 0x12345678;
    dpx_checksum_xfer_buff(buf, 1, &crc);
    EXPECT_EQ(crc, zlib_crc(0x12345678, buf[0], 300));
}

TEST(Checksum, LeavesTheValueAloneForCountZeroNegativeOrEmptyRecords)
{
    dpx_chunk buf[2] = {make_chunk(0, 'a'), make_chunk(4096, 'b')};
    for (int16_t count : {int16_t{0}, int16_t{-1}, int16_t{-32768}, int16_t{1}}) {
        uint32_t crc = 0xCAFEBABE;
        dpx_checksum_xfer_buff(buf, count, &crc);
        EXPECT_EQ(crc, 0xCAFEBABEu) << "count " << count;
    }
}

TEST(Checksum, DoesNothingWithNullArguments)
{
    dpx_chunk c = make_chunk(10, 'a');
    uint32_t crc = 7;
    dpx_checksum_xfer_buff(nullptr, 1, &crc);
    EXPECT_EQ(crc, 7u);
    dpx_checksum_xfer_buff(&c, 1, nullptr);
}

TEST(Checksum, NeverReadsPastARecordThatClaimsMoreThan4096Bytes)
{
    // Two adjacent records: the first claims 8000 bytes. Only its own 4096
    // data bytes may count, never the second record's header or data.
    dpx_chunk buf[2] = {make_chunk(4096, 'a'), make_chunk(4096, 'b')};
    buf[0].length = 8000;
    uint32_t crc = 0;
    dpx_checksum_xfer_buff(buf, 1, &crc);
    EXPECT_EQ(crc, zlib_crc(0, buf[0], 4096));
}

}  // namespace

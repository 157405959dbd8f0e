// Transfer buffers: the clamp of the allocator and what the checksum covers.
#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <cstring>
#include <zlib.h>

namespace {

TEST(XferBuff, TheAllocatorGivesBetween24And128RecordsAllOfThemUsable)
{
    const struct { int16_t requested, max; } rows[] = {{24, 23}, {25, 24},  {128, 127}, {129, 127},
        {1000, 127}, {32767, 127}, {23, 23}, {0, 23}, {-1, 23}, {-2, 23}, {-32768, 23}};
    for (const auto &row : rows) {
        int16_t max = -99;
        dpx_chunk *buffer = dpx_alloc_xfer_buff(row.requested, &max);
        ASSERT_NE(buffer, nullptr);
        EXPECT_EQ(max, row.max) << row.requested;
        // Every record up to max is ours to write (ASan checks the bounds).
        std::memset(buffer, 0xA5, sizeof(dpx_chunk) * static_cast<size_t>(max + 1));
        dpx_free_xfer_buff(buffer);
    }
}

TEST(XferBuff, TheChecksumRunsOnFromItsValueOverTheLengthBytesOfTheRecordsBelowCount)
{
    dpx_chunk buffer[3];
    std::memset(buffer, 'a', sizeof buffer);
    buffer[1].data[0] = 'b';
    buffer[0].length = 4096;
    buffer[1].length = 10;
    const auto checksum = [&buffer](int16_t count, uint32_t crc) {
        dpx_checksum_xfer_buff(buffer, count, &crc);
        return crc;
    };
    const uint32_t expected = crc32(crc32(0x1234, buffer[0].data, 4096), buffer[1].data, 10);
    EXPECT_EQ(checksum(2, 0x1234), expected);
    // Neither index, nor the bytes behind length, nor the record at count.
    buffer[1].index = 77;
    std::memset(buffer[1].data + 10, 'q', sizeof buffer[1].data - 10);
    std::memset(&buffer[2], 'z', sizeof buffer[2]);
    EXPECT_EQ(checksum(2, 0x1234), expected);
    // A record that claims more than it holds counts with its own 4096 bytes.
    buffer[0].length = 8000;
    EXPECT_EQ(checksum(1, 0), crc32(0, buffer[0].data, 4096));
    for (int16_t count : {0, -1, -32768})
        EXPECT_EQ(checksum(count, 7), 7u) << count;
}

}  // namespace

// The chunk read service, called as the server stub calls it: whole downloads
// run the way the client runs them, the first call's edge cases, files that
// change between calls, failures with their traces, hostile paths, and many
// threads at once.
#include "child.h"
#include "dpxclient.h"
#include "service_depot.h"
#include "test_support.h"

#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>
#include <utime.h>
#include <zlib.h>

using namespace dpxtest;

namespace {

constexpr uint32_t kChunk = DPX_CHUNK_SIZE;

// The in-out arguments of get_chunks as a client keeps them across a transfer.
struct Transfer {
    dpx_file_desc desc;
    uint32_t crc = 0;
    uint8_t state = DPX_STATE_FIRST;
    uint32_t index = 0;
    int16_t last = -1;
    dpx_status status = DPX_E_QUIET;

    explicit Transfer(const std::string &path) : desc(desc_for(path)) {}
    void call(dpx_chunk *buffer, int16_t max)
    {
        dpx_get_chunks(nullptr, &desc, &crc, &state, &index, &last, max, &status, buffer);
    }
};

// Records 0 .. last of a buffer, end to end.
std::string bytes_of(const dpx_chunk *buffer, int16_t last)
{
    std::string bytes;
    for (int16_t i = 0; i <= last; ++i)
        bytes.append(reinterpret_cast<const char *>(buffer[i].data), buffer[i].length);
    return bytes;
}

// The bytes of chunks first .. first + count - 1 of `content`.
std::string chunks_of(const std::string &content, uint64_t first, uint64_t count)
{
    uint64_t from = std::min<uint64_t>(content.size(), first * kChunk);
    uint64_t to = std::min<uint64_t>(content.size(), (first + count) * kChunk);
    return content.substr(from, to - from);
}

uint32_t crc_of(uint32_t crc, const std::string &bytes)
{
    return static_cast<uint32_t>(crc32(crc, reinterpret_cast<const Bytef *>(bytes.data()), bytes.size()));
}

struct Download {
    dpx_status status = DPX_OK;
    std::string bytes;
    uint32_t crc = 0;
    bool indexes_in_order = true;
    // First chunk index and `last` of each call.
    std::vector<std::pair<uint32_t, int16_t>> calls;
};

// Allocates as the client does, and frees at the end of the scope.
struct Buffer {
    int16_t max = 0;
    std::unique_ptr<dpx_chunk, decltype(&dpx_free_xfer_buff)> records;
    explicit Buffer(int16_t requested) : records(dpx_alloc_xfer_buff(requested, &max), &dpx_free_xfer_buff) {}
};

// A whole download the way the client runs it: a first buffer of 24 records,
// then one sized from the file's length; `last` and the running checksum go
// from call to call.
Download download(const std::string &path)
{
    Download result;
    Transfer t(path);
    Buffer buffer(24);
    for (;;) {
        const uint32_t first = t.index;
        t.call(buffer.records.get(), buffer.max);
        result.status = t.status;
        if (t.status != DPX_OK)
            break;
        result.calls.emplace_back(first, t.last);
        for (int16_t i = 0; i <= t.last; ++i)
            result.indexes_in_order &= buffer.records.get()[i].index == first + static_cast<uint32_t>(i);
        result.bytes += bytes_of(buffer.records.get(), t.last);
        if (t.state != DPX_STATE_MORE)
            break;
        if (result.calls.size() == 1)
            buffer = Buffer(buffer_request(&t.desc.size));
    }
    result.crc = t.crc;
    return result;
}

// A download that delivered `content` in order, with the running checksum
// that a client works out over records 0 .. last - 1 of each call, taken here
// from the file's own bytes.
testing::AssertionResult delivered(const Download &d, const std::string &content)
{
    uint32_t crc = 0;
    for (const auto &[first, last] : d.calls)
        crc = crc_of(crc, chunks_of(content, first, static_cast<uint64_t>(std::max<int16_t>(last, 0))));
    if (d.status != DPX_OK || d.bytes != content || !d.indexes_in_order || d.crc != crc)
        return testing::AssertionFailure() << "status 0x" << std::hex << d.status << std::dec << ", "
                                           << d.bytes.size() << " of " << content.size() << " bytes"
                                           << (d.bytes == content ? " equal" : " differing") << ", crc 0x"
                                           << std::hex << d.crc << " for 0x" << crc;
    return testing::AssertionSuccess();
}

uint32_t mtime_of(const std::string &path)
{
    struct stat st {};
    EXPECT_EQ(stat(path.c_str(), &st), 0) << path;
    return static_cast<uint32_t>(st.st_mtime);
}

void set_mtime(const std::string &path, uint32_t seconds)
{
    struct utimbuf times = {seconds, static_cast<time_t>(seconds)};
    ASSERT_EQ(utime(path.c_str(), &times), 0) << path;
}

bool same_desc(const dpx_file_desc &a, const dpx_file_desc &b)
{
    return std::memcmp(&a, &b, sizeof a) == 0;
}

}  // namespace

// Runs first: later tests cache the depot for the life of this process.
TEST(ServiceWithoutDepot, BothManagersAnswerNoDepotAndFailTheReadWithNothingElseTouched)
{
    if (depot_cached())
        GTEST_SKIP() << "another test in this process has already cached the depot";
    EXPECT_EQ(in_child([]() -> std::string {
                  unsetenv("DPX_DEPOTROOT");
                  unsetenv("VESPERHOME");
                  unsetenv("AFW_PRODUCT");
                  AFW_SetProductName(nullptr);
                  Transfer t("a");
                  t.crc = 7;
                  t.index = 3;
                  dpx_chunk buffer[24];
                  t.call(buffer, 23);
                  if (t.status != DPX_E_NO_DEPOT || t.state != DPX_STATE_FAILED || t.last != -1)
                      return "read answered wrongly without a depot";
                  if (t.crc != 7 || t.index != 3 || !same_desc(t.desc, desc_for("a")))
                      return "read touched its out-arguments";
                  int16_t last = 0;
                  dpx_status status = DPX_OK;
                  dpx_put_chunks(nullptr, desc_for("a"), 0, DPX_STATE_DONE, &last, 23, &status, buffer);
                  if (status != DPX_E_NO_DEPOT || last != 0)
                      return "write answered wrongly without a depot";
                  return "";
              }),
              "");
}

class ServiceRead : public DepotTest {};

TEST_F(ServiceRead, ServesWholeDownloadsTheWayTheClientAsksForThem)
{
    struct Case {
        size_t size;
        size_t calls;
    };
    // 24 records fit the first call up to 98,303 bytes; at 98,304 the empty
    // record that marks the end needs a second call; 1 MiB takes 24 + 128 +
    // 105 records.
    const Case cases[] = {{0, 1},      {1, 1},      {4095, 1},      {4096, 1},
                          {10000, 1},  {98303, 1},  {98304, 2},     {1 << 20, 3}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.size);
        const std::string path = rel("f" + std::to_string(c.size));
        const std::string content = pattern_bytes(c.size, static_cast<uint32_t>(c.size));
        plant(path, content);
        Download d = download(path);
        EXPECT_TRUE(delivered(d, content));
        EXPECT_EQ(d.calls.size(), c.calls);
    }
}

TEST_F(ServiceRead, TheFirstCallDeliversFromItsIndexUpToTheBufferOrTheEnd)
{
    struct Case {
        size_t size;
        uint32_t start;
        int16_t last;
        uint8_t state;
        uint32_t index;
    };
    const Case cases[] = {
        {10000, 0, 2, DPX_STATE_DONE, 3},
        {0, 0, 0, DPX_STATE_DONE, 1},
        {4096, 0, 1, DPX_STATE_DONE, 2},
        {24 * kChunk, 0, 23, DPX_STATE_MORE, 24},
        {24 * kChunk, 24, 0, DPX_STATE_DONE, 25},
        {100 * kChunk, 5, 23, DPX_STATE_MORE, 29},
        // Nothing compares the index with the file's length.
        {10000, 50, 0, DPX_STATE_DONE, 51},
    };
    // A start value that isn't 0 shows that the checksum runs on.
    const uint32_t start_crc = 0xC0FFEE;
    for (const Case &c : cases) {
        SCOPED_TRACE(testing::Message() << c.size << " bytes from chunk " << c.start);
        const std::string path = rel("f" + std::to_string(c.size));
        const std::string content = pattern_bytes(c.size, 3);
        plant(path, content);
        Transfer t(path);
        t.crc = start_crc;
        t.index = c.start;
        dpx_chunk buffer[24];
        t.call(buffer, 23);
        ASSERT_EQ(t.status, DPX_OK);
        EXPECT_EQ(t.last, c.last);
        EXPECT_EQ(t.state, c.state);
        EXPECT_EQ(t.index, c.index);
        EXPECT_EQ(t.desc.size.chunks, c.size / kChunk);
        EXPECT_EQ(t.desc.size.remainder, c.size % kChunk);
        EXPECT_EQ(t.desc.mtime.low, mtime_of(full(path)));
        EXPECT_EQ(t.desc.mtime.high, 0u);
        for (int16_t i = 0; i <= t.last; ++i)
            EXPECT_EQ(buffer[i].index, c.start + static_cast<uint32_t>(i));
        EXPECT_TRUE(bytes_of(buffer, t.last) == chunks_of(content, c.start, static_cast<uint64_t>(t.last) + 1));
        EXPECT_EQ(t.crc, crc_of(start_crc, chunks_of(content, c.start, static_cast<uint64_t>(t.last))));
    }
}

TEST_F(ServiceRead, DeliversTheRightBytesOnBothSidesOfFourGibibytesInASparseFile)
{
    const uint32_t boundary = static_cast<uint32_t>((uint64_t{1} << 32) / kChunk);  // first chunk at 4 GiB
    const uint64_t size = uint64_t{boundary + 2} * kChunk + 100;
    const std::string path = rel("sparse");
    plant(path, "");
    std::filesystem::resize_file(full(path), size);
    // Content from the chunk below the boundary to the end; zeros before it.
    const std::string tail = pattern_bytes(size - uint64_t{boundary - 1} * kChunk, 4);
    {
        std::fstream out(full(path), std::ios::in | std::ios::out | std::ios::binary);
        out.seekp(static_cast<std::streamoff>(uint64_t{boundary - 1} * kChunk));
        out.write(tail.data(), static_cast<std::streamsize>(tail.size()));
        ASSERT_TRUE(out.good());
    }
    Transfer t(path);
    for (uint32_t start : {boundary - 1, boundary, boundary + 1, boundary + 2}) {
        SCOPED_TRACE(start);
        t.index = start;
        dpx_chunk buffer[24];
        t.call(buffer, 23);
        ASSERT_EQ(t.status, DPX_OK);
        EXPECT_EQ(t.desc.size.chunks, boundary + 2);
        EXPECT_EQ(t.desc.size.remainder, 100u);
        EXPECT_EQ(t.state, DPX_STATE_DONE);
        EXPECT_EQ(t.index, boundary + 3);
        EXPECT_EQ(buffer[0].index, start);
        EXPECT_TRUE(bytes_of(buffer, t.last) == tail.substr(uint64_t{start - (boundary - 1)} * kChunk));
        // Later calls compare the identity that the first one took.
        t.state = DPX_STATE_MORE;
    }
}

TEST_F(ServiceRead, AFileTouchedGrownOrRemovedBetweenTwoCallsFailsTheLaterOne)
{
    struct Case {
        const char *what;
        void (*change)(const std::string &full_path);
        dpx_status status;
    };
    const Case cases[] = {
        {"touched", [](const std::string &p) { set_mtime(p, mtime_of(p) + 7); }, DPX_E_FILE_CHANGED},
        {"grown by one byte, same time",
         [](const std::string &p) {
             uint32_t before = mtime_of(p);
             std::ofstream(p, std::ios::app | std::ios::binary) << 'x';
             set_mtime(p, before);
         },
         DPX_E_FILE_CHANGED},
        {"removed", [](const std::string &p) { std::filesystem::remove(p); }, DPX_E_FILE_READ},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        const std::string path = rel(c.what);
        plant(path, pattern_bytes(30 * kChunk));
        Transfer t(path);
        dpx_chunk buffer[24];
        t.call(buffer, 23);
        ASSERT_EQ(t.status, DPX_OK);
        ASSERT_EQ(t.state, DPX_STATE_MORE);
        const Transfer before = t;
        c.change(full(path));
        t.call(buffer, 23);
        EXPECT_EQ(t.status, c.status);
        EXPECT_EQ(t.state, DPX_STATE_FAILED);
        EXPECT_EQ(t.last, -1);
        EXPECT_EQ(t.index, before.index);
        EXPECT_EQ(t.crc, before.crc);
        EXPECT_TRUE(same_desc(t.desc, before.desc));
    }
}

TEST_F(ServiceRead, AFailedOpenSeekOrReadIsTracedAndKeepsTheIdentityOfTheFirstCall)
{
    // A socket can be examined but not opened; a pipe opened but not
    // positioned; a directory opened but not read.
    const std::string sock = rel("sock");
    const std::string fifo = rel("fifo");
    plant(rel("x"), "");
    // Bound by a relative name: the full path is longer than a socket address holds.
    int s = socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, "sock");
    const auto cwd = std::filesystem::current_path();
    std::filesystem::current_path(full(rel("")));
    int bound = bind(s, reinterpret_cast<sockaddr *>(&address), sizeof address);
    std::filesystem::current_path(cwd);
    ASSERT_EQ(bound, 0);
    ASSERT_EQ(mkfifo(full(fifo).c_str(), 0600), 0);
    // Held open for reading and writing, the pipe has a writer, so the
    // service's open doesn't wait.
    int fifo_holder = open(full(fifo).c_str(), O_RDWR);
    ASSERT_GE(fifo_holder, 0);

    struct Case {
        std::string path;
        uint32_t index;
        dpx_status status;
        std::string trace;
    };
    const Case cases[] = {
        {sock, 0, DPX_E_FILE_READ, "can't read '" + full(sock) + "': p" + std::to_string(ENXIO) + "\n"},
        {fifo, 5, DPX_E_FILE_SEEK, "can't seek 5: p" + std::to_string(ESPIPE) + "\n"},
        {rel(""), 0, DPX_E_FILE_READ, "Can't read file\n"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.path);
        TraceCapture trace(TRC1_ERROR);
        Transfer t(c.path);
        t.crc = 11;
        t.index = c.index;
        dpx_chunk buffer[24];
        t.call(buffer, 23);
        EXPECT_EQ(t.status, c.status);
        EXPECT_EQ(t.state, DPX_STATE_FAILED);
        EXPECT_EQ(t.last, -1);
        EXPECT_EQ(t.index, c.index);
        EXPECT_EQ(t.crc, 11u);
        EXPECT_EQ(t.desc.mtime.low, mtime_of(full(c.path)));
        EXPECT_EQ(trace.count(c.trace), 1u) << trace.text();
    }
    close(fifo_holder);
    close(s);
}

TEST_F(ServiceRead, NeverReadsOutsideTheProductsDirectory)
{
    plant("secret", "inside: secret");
    plant("outside", "inside: outside");
    for (const HostilePath &row : hostile_paths()) {
        SCOPED_TRACE(row.path.substr(0, 80));
        Transfer t("");
        t.desc = desc_for(row);
        dpx_chunk buffer[24];
        t.call(buffer, 23);
        EXPECT_EQ(t.status, row.read);
        if (row.read == DPX_OK) {
            EXPECT_EQ(bytes_of(buffer, t.last), "inside: " + row.lands);
        } else {
            EXPECT_EQ(t.state, DPX_STATE_FAILED);
            EXPECT_EQ(t.last, -1);
        }
    }
}

TEST_F(ServiceRead, ServesManyThreadsAtOnceForTheSameFileAndForDifferentOnes)
{
    constexpr size_t kThreads = 8;
    // Path and content of the file that all threads read, then one for each.
    std::vector<std::pair<std::string, std::string>> files;
    for (size_t n = 0; n <= kThreads; ++n) {
        files.emplace_back(rel("f" + std::to_string(n)), pattern_bytes(40000 * n + 150000, static_cast<uint32_t>(n)));
        plant(files[n].first, files[n].second);
    }
    std::vector<std::vector<Download>> results(kThreads);
    std::vector<std::thread> threads;
    for (size_t n = 0; n < kThreads; ++n) {
        threads.emplace_back([&, n] {
            for (int round = 0; round < 3; ++round) {
                results[n].push_back(download(files[0].first));
                results[n].push_back(download(files[n + 1].first));
            }
        });
    }
    for (auto &thread : threads)
        thread.join();
    for (size_t n = 0; n < kThreads; ++n) {
        for (size_t k = 0; k < results[n].size(); ++k)
            EXPECT_TRUE(delivered(results[n][k], files[k % 2 == 0 ? 0 : n + 1].second)) << n << "/" << k;
    }
}

TEST_F(ServiceRead, ANullArgumentIsRefusedAndNothingChanges)
{
    const std::string path = rel("f");
    plant(path, "data");
    for (int missing = 0; missing < 7; ++missing) {
        SCOPED_TRACE(missing);
        Transfer t(path);
        t.state = DPX_STATE_MORE;
        t.last = 5;
        t.index = 7;
        t.crc = 9;
        dpx_chunk buffer[24];
        dpx_get_chunks(nullptr, missing == 0 ? nullptr : &t.desc, missing == 1 ? nullptr : &t.crc,
                       missing == 2 ? nullptr : &t.state, missing == 3 ? nullptr : &t.index,
                       missing == 4 ? nullptr : &t.last, 23, missing == 5 ? nullptr : &t.status,
                       missing == 6 ? nullptr : buffer);
        EXPECT_EQ(t.status, missing == 5 ? DPX_E_QUIET : DPX_E_INVALID_PARAM);
        EXPECT_EQ(t.state, DPX_STATE_MORE);
        EXPECT_EQ(t.last, 5);
        EXPECT_EQ(t.index, 7u);
        EXPECT_EQ(t.crc, 9u);
        EXPECT_TRUE(same_desc(t.desc, desc_for(path)));
    }
}

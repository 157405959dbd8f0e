// The chunk services, called as the server stub calls them: whole downloads
// and uploads run the way the client runs them, calls that fail, hostile
// paths and many threads at once; and the two managers that answer every
// request with DPX_E_INVALID_PARAM.
//
// The library caches its depot root and product name on first use, so the
// process has one depot, made at the first use and removed at exit:
// <tmp>/depot with the product "prod", and two files that no request may
// reach, <tmp>/depot/secret ("../secret" from the product's directory) and
// <tmp>/outside ("../../outside"). Each test keeps to a directory of its own.
#include "child.h"
#include "dpxclient.h"
#include "test_support.h"

#include "afw/afw.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <memory>
#include <optional>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>
#include <zlib.h>

using namespace dpxtest;
namespace fs = std::filesystem;

namespace {

constexpr uint32_t kChunk = DPX_CHUNK_SIZE;

// `rel_path` in the product's directory, or with ".." above it.
std::string full(const std::string &rel_path)
{
    static const TempDir tmp;
    static const std::string product = [] {
        fs::create_directories(tmp / "depot/prod");
        write_file(tmp / "depot/secret", "depot secret");
        write_file(tmp / "outside", "outside the depot");
        setenv("DPX_DEPOTROOT", (tmp / "depot").c_str(), 1);
        AFW_SetProductName("prod");
        return tmp / "depot/prod";
    }();
    return product + "/" + rel_path;
}

// `name` in the running test's own directory, relative to the product's directory.
std::string rel(const std::string &name)
{
    const auto *info = testing::UnitTest::GetInstance()->current_test_info();
    return std::string(info->test_suite_name()) + "." + info->name() + "/" + name;
}

void plant(const std::string &rel_path, const std::string &bytes)
{
    fs::create_directories(fs::path(full(rel_path)).parent_path());
    write_file(full(rel_path), bytes);
}

// A request's file record as the client fills it: the path NUL-filled, the
// rest cleared. A path of 4096 characters fills the field with no NUL.
dpx_file_desc desc_for(const std::string &path)
{
    dpx_file_desc desc{};
    path.copy(desc.path, sizeof desc.path);
    return desc;
}

// The in-out arguments of get_chunks as a client keeps them across a
// transfer, a buffer allocated as the client allocates it, and what the calls
// delivered.
struct Transfer {
    dpx_file_desc desc;
    uint32_t crc = 0;
    uint8_t state = DPX_STATE_FIRST;
    uint32_t index = 0;
    int16_t last = -1;
    dpx_status status = DPX_E_QUIET;
    int16_t max = 0;
    std::unique_ptr<dpx_chunk, decltype(&dpx_free_xfer_buff)> buffer{dpx_alloc_xfer_buff(24, &max),
                                                                     &dpx_free_xfer_buff};
    size_t calls = 0;
    std::string bytes;
    // The running checksum over records 0 .. last - 1 of each call, worked out here.
    uint32_t expected_crc = 0;

    explicit Transfer(const std::string &path) : desc(desc_for(path)) {}
    void call()
    {
        ++calls;
        dpx_get_chunks(nullptr, &desc, &crc, &state, &index, &last, max, &status, buffer.get());
        for (int16_t i = 0; i <= last; ++i) {
            const dpx_chunk &record = buffer.get()[i];
            bytes.append(reinterpret_cast<const char *>(record.data), record.length);
            if (i < last)
                expected_crc = static_cast<uint32_t>(crc32(expected_crc, record.data, record.length));
        }
    }
};

// A whole download the way the client runs it: a first buffer of 24 records,
// then one sized from the file's length; the checksum runs from call to call.
Transfer download(const std::string &path)
{
    Transfer t(path);
    do {
        if (t.calls == 1)
            t.buffer.reset(dpx_alloc_xfer_buff(buffer_request(&t.desc.size), &t.max));
        t.call();
    } while (t.status == DPX_OK && t.state == DPX_STATE_MORE);
    return t;
}

void expect_delivered(const Transfer &t, const std::string &content)
{
    EXPECT_EQ(t.status, DPX_OK);
    EXPECT_TRUE(t.bytes == content) << t.bytes.size() << " of " << content.size() << " bytes";
    EXPECT_EQ(t.crc, t.expected_crc);
}

// One put_chunks call with records of the given contents and the checksum
// that the client works out, or `crc`. `last` must come back as it went.
dpx_status put(const std::string &path, const std::vector<std::string> &records, std::optional<uint32_t> crc = {})
{
    std::vector<dpx_chunk> buffer(std::max<size_t>(1, records.size()));
    for (size_t i = 0; i < records.size(); ++i) {
        buffer[i].length = static_cast<uint32_t>(records[i].size());
        records[i].copy(reinterpret_cast<char *>(buffer[i].data), kChunk);
    }
    int16_t last = static_cast<int16_t>(records.size() - 1);
    uint32_t right = 0;
    dpx_checksum_xfer_buff(buffer.data(), last, &right);
    dpx_status status = DPX_E_QUIET;
    dpx_put_chunks(nullptr, desc_for(path), crc.value_or(right), DPX_STATE_DONE, &last,
                   static_cast<int16_t>(buffer.size() - 1), &status, buffer.data());
    EXPECT_EQ(last, static_cast<int16_t>(records.size() - 1));
    return status;
}

// A whole upload as the client sends it: records of 4096 bytes and a last
// one that is short or empty, 128 to a call.
dpx_status upload(const std::string &path, const std::string &content)
{
    std::vector<std::string> records;
    for (size_t at = 0; at <= content.size(); at += kChunk)
        records.push_back(content.substr(at, kChunk));
    dpx_status status = DPX_OK;
    for (size_t at = 0; at < records.size() && status == DPX_OK; at += 128)
        status = put(path, {records.begin() + at, records.begin() + std::min(records.size(), at + 128)});
    return status;
}

}  // namespace

// Runs first: the other tests leave the depot cached for the life of the process.
TEST(ServiceWithoutDepot, BothManagersAnswerNoDepotAndTheReadKeepsItsIndexAndChecksum)
{
    const std::string outcome = in_child([]() -> std::string {
        unsetenv("DPX_DEPOTROOT");
        unsetenv("VESPERHOME");
        if (dpx_get_depotroot() != nullptr)
            return "cached";
        Transfer t("a");
        t.crc = 7;
        t.index = 3;
        t.call();
        if (t.status != DPX_E_NO_DEPOT || t.state != DPX_STATE_FAILED || t.last != -1 || t.crc != 7 || t.index != 3)
            return "read answered wrongly without a depot";
        return put("a", {"x"}) == DPX_E_NO_DEPOT ? "" : "write answered wrongly without a depot";
    });
    if (outcome == "cached")
        GTEST_SKIP() << "an earlier test in this process has cached the depot";
    EXPECT_EQ(outcome, "");
}

TEST(ServiceRead, ServesWholeDownloadsTheWayTheClientAsksForThem)
{
    // 24 records fit the first call up to 98,303 bytes; at 98,304 the empty
    // record that marks the end needs a second call; 1 MiB takes 24 + 128 +
    // 105 records.
    const std::pair<size_t, size_t> sizes_and_calls[] = {{0, 1},     {1, 1},     {4095, 1},  {4096, 1},
                                                         {10000, 1}, {98303, 1}, {98304, 2}, {1 << 20, 3}};
    for (const auto &[size, calls] : sizes_and_calls) {
        SCOPED_TRACE(size);
        const std::string content = pattern_bytes(size, static_cast<uint32_t>(size));
        plant(rel(std::to_string(size)), content);
        const Transfer t = download(rel(std::to_string(size)));
        expect_delivered(t, content);
        EXPECT_EQ(t.calls, calls);
    }
}

TEST(ServiceRead, DeliversTheRightBytesOnBothSidesOfFourGibibytesInASparseFile)
{
    const uint32_t boundary = static_cast<uint32_t>((uint64_t{1} << 32) / kChunk);  // the chunk at 4 GiB
    // Zeros up to the chunk below the boundary, content from there to the end.
    const std::string tail = pattern_bytes(3 * kChunk + 100, 4);
    plant(rel("sparse"), "");
    const int fd = open(full(rel("sparse")).c_str(), O_WRONLY);
    ASSERT_EQ(pwrite(fd, tail.data(), tail.size(), off_t{boundary - 1} * kChunk), static_cast<ssize_t>(tail.size()));
    close(fd);
    // The state is never 0 again after the first call: the later ones
    // compare the identity that it took.
    Transfer t(rel("sparse"));
    for (uint32_t start : {boundary - 1, boundary, boundary + 2}) {
        SCOPED_TRACE(start);
        t.index = start;
        t.bytes.clear();
        t.call();
        ASSERT_EQ(t.status, DPX_OK);
        EXPECT_EQ(t.desc.size.chunks, boundary + 2);
        EXPECT_EQ(t.desc.size.remainder, 100u);
        EXPECT_EQ(t.index, boundary + 3);
        EXPECT_TRUE(t.bytes == tail.substr(uint64_t{start - (boundary - 1)} * kChunk));
    }
}

TEST(ServiceRead, AFailedCallEndsTheTransferWithItsTraceAndKeepsIndexChecksumAndIdentity)
{
    // A socket can be examined but not opened; a pipe opened but not
    // positioned; a directory opened but not read.
    const std::string dir = full(rel(""));
    fs::create_directories(dir);
    // Bound by its relative name: the full path may be longer than an address holds.
    const int sock = socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un address{AF_UNIX, "sock"};
    const fs::path cwd = fs::current_path();
    fs::current_path(dir);
    const int bound = bind(sock, reinterpret_cast<sockaddr *>(&address), sizeof address);
    fs::current_path(cwd);
    ASSERT_EQ(bound, 0);
    ASSERT_EQ(mkfifo((dir + "fifo").c_str(), 0600), 0);
    // Held open for reading and writing, the pipe has a writer: the service's open doesn't wait.
    const int fifo = open((dir + "fifo").c_str(), O_RDWR);
    ASSERT_GE(fifo, 0);

    // Or a file of 30 chunks changes between a first call and a later one.
    struct Case {
        std::string path;
        uint32_t index;
        void (*change)(const std::string &);
        dpx_status status;
        std::string trace;
    };
    const Case cases[] = {
        {rel("sock"), 0, nullptr, DPX_E_FILE_READ, "can't read '" + dir + "sock': p" + std::to_string(ENXIO) + "\n"},
        {rel("fifo"), 5, nullptr, DPX_E_FILE_SEEK, "can't seek 5: p" + std::to_string(ESPIPE) + "\n"},
        {rel(""), 0, nullptr, DPX_E_FILE_READ, "Can't read file\n"},
        {rel("touched"), 0,
         [](const std::string &p) { fs::last_write_time(p, fs::last_write_time(p) + std::chrono::seconds(7)); },
         DPX_E_FILE_CHANGED, ""},
        {rel("grown"), 0,
         [](const std::string &p) {
             const auto before = fs::last_write_time(p);
             fs::resize_file(p, 30 * kChunk + 1);
             fs::last_write_time(p, before);
         },
         DPX_E_FILE_CHANGED, ""},
        {rel("removed"), 0, [](const std::string &p) { fs::remove(p); }, DPX_E_FILE_READ, ""},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.path);
        Transfer t(c.path);
        t.crc = 11;
        t.index = c.index;
        if (c.change != nullptr) {
            plant(c.path, pattern_bytes(30 * kChunk));
            t.call();
            ASSERT_EQ(t.state, DPX_STATE_MORE);
        }
        const auto [index, crc] = std::pair(t.index, t.crc);
        const auto identity = std::chrono::file_clock::to_sys(fs::last_write_time(full(c.path)));
        if (c.change != nullptr)
            c.change(full(c.path));
        TraceCapture trace(TRC1_ERROR);
        t.call();
        EXPECT_EQ(t.status, c.status);
        EXPECT_EQ(t.state, DPX_STATE_FAILED);
        EXPECT_EQ(t.last, -1);
        EXPECT_EQ(t.index, index);
        EXPECT_EQ(t.crc, crc);
        EXPECT_EQ(t.desc.mtime.low, std::chrono::system_clock::to_time_t(identity));
        EXPECT_TRUE(c.trace.empty() ? trace.text().empty() : trace.count(c.trace) == 1) << trace.text();
    }
    close(fifo);
    close(sock);
}

TEST(ServiceWrite, OpensBeforeItComparesTheChecksumAndTracesAFailedOpen)
{
    const std::string a(kChunk, 'a');
    // The file layer opens paths of up to 254 characters for writing.
    const size_t room = 254 - full(rel("")).size();
    const std::string longest = rel(std::string(room, 'x'));
    const std::string too_long = rel(std::string(room + 1, 'x'));
    const std::string dir = rel("dir");
    fs::create_directories(full(dir));
    const auto open_trace = [](const std::string &path, int error) {
        return "can't open '" + full(path) + "': p" + std::to_string(error) + "\n";
    };
    struct Case {
        std::string path;
        std::vector<std::string> records;
        std::optional<uint32_t> crc;
        dpx_status status;
        std::optional<std::string> content;
        std::string trace;
    };
    const Case cases[] = {
        {rel("last -1/missing/f"), {}, {}, DPX_OK, "", ""},
        {rel("wrong checksum/missing/f"), {a, "b"}, 1, DPX_E_CHECKSUM, "", ""},
        {rel("record too long/f"), {a + "overflow", "b"}, {}, DPX_E_INVALID_PARAM, "", ""},
        {longest, {"abc", "d"}, {}, DPX_OK, "abcd", ""},
        {too_long, {"abc"}, {}, DPX_E_FILE_WRITE, {}, open_trace(too_long, ENAMETOOLONG)},
        {dir, {"abc"}, {}, DPX_E_FILE_WRITE, {}, open_trace(dir, EISDIR)},
        {dir, {"abc"}, 1, DPX_E_CHECKSUM, {}, open_trace(dir, EISDIR)},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.path);
        TraceCapture trace(TRC1_ERROR);
        EXPECT_EQ(put(c.path, c.records, c.crc), c.status);
        EXPECT_TRUE(!c.content.has_value() || read_file(full(c.path)) == *c.content);
        EXPECT_TRUE(c.trace.empty() ? trace.text().empty() : trace.count(c.trace) == 1) << trace.text();
    }
    EXPECT_FALSE(file_exists(full(too_long)));
}

TEST(ServiceWrite, AFailedWriteIsTracedAndLeavesTheRecordsWrittenBeforeIt)
{
    plant(rel("limited"), "");
    EXPECT_EQ(in_child([path = rel("limited")]() -> std::string {
                  // The file may grow to two chunks. 128 records, 512 KiB,
                  // are more than the stream's buffer holds, so the failure
                  // shows before the close, whose result isn't looked at.
                  std::signal(SIGXFSZ, SIG_IGN);
                  rlimit limit = {2 * kChunk, 2 * kChunk};
                  if (setrlimit(RLIMIT_FSIZE, &limit) != 0)
                      return "setrlimit failed";
                  TraceCapture trace(TRC1_ERROR);
                  if (put(path, std::vector<std::string>(128, std::string(kChunk, 'w'))) != DPX_E_FILE_WRITE)
                      return "write failure not reported";
                  return trace.count("Can't write file\n") == 1 ? "" : "no trace: " + trace.text();
              }),
              "");
    EXPECT_EQ(fs::file_size(full(rel("limited"))), 2 * kChunk);
}

TEST(Service, ServesManyThreadsAtOnceForTheSameFileAndForDifferentOnes)
{
    // Each thread uploads a file of its own twice, reads it back and reads
    // the file that all threads read.
    const std::string shared = pattern_bytes(300000, 9);
    plant(rel("shared"), shared);
    std::vector<std::thread> threads;
    for (size_t size : {0u, 1u, 4096u, 10000u, 98304u, 524288u, (1u << 20) + 5}) {
        threads.emplace_back([size, &shared, path = rel(std::to_string(size)), shared_path = rel("shared")] {
            const std::string content = pattern_bytes(size, static_cast<uint32_t>(size));
            for (int round = 0; round < 2; ++round) {
                EXPECT_EQ(upload(path, content), DPX_OK) << size;
                expect_delivered(download(shared_path), shared);
            }
            EXPECT_TRUE(read_file(full(path)) == content + content) << size;
            expect_delivered(download(path), content + content);
        });
    }
    for (auto &thread : threads)
        thread.join();
}

TEST(Service, NeverReadsOrWritesOutsideTheProductsDirectory)
{
    std::string climb;
    while (climb.size() + 3 + 6 <= 4095)
        climb += "../";
    const std::string outside = fs::path(full("../../outside")).lexically_normal();
    // The statuses of a read and a write, and the cleaned path inside the
    // product's directory where a call that succeeds lands.
    struct Case {
        std::string path;
        dpx_status read;
        dpx_status write;
        std::string lands;
    };
    const Case cases[] = {
        {"../secret", DPX_OK, DPX_OK, "secret"},
        {"../../outside", DPX_OK, DPX_OK, "outside"},
        {"a/b/../../../../secret", DPX_OK, DPX_OK, "secret"},
        {"a\\b\\..\\..\\..\\secret", DPX_OK, DPX_OK, "secret"},
        {"/secret", DPX_OK, DPX_OK, "secret"},
        {"C:\\..\\..\\outside", DPX_OK, DPX_OK, "outside"},
        // The absolute path of a planted file becomes a path below the
        // product, where nothing is to be read but a write may land.
        {outside, DPX_E_FILE_READ, DPX_OK, outside.substr(1)},
        // Nothing left but the product's directory, or a file as a directory.
        {"..", DPX_E_FILE_READ, DPX_E_FILE_WRITE, ""},
        {"../secret/.", DPX_E_FILE_READ, DPX_E_FILE_WRITE, ""},
        // 4095 characters that clean short, 4095 that don't, a field with no
        // NUL, and a name longer than the platform takes.
        {climb + "secret", DPX_OK, DPX_OK, "secret"},
        {std::string(4095, 'a'), DPX_E_PATH_TOO_LONG, DPX_E_PATH_TOO_LONG, ""},
        {std::string(4096, '.'), DPX_E_INVALID_PARAM, DPX_E_INVALID_PARAM, ""},
        {"../" + std::string(300, 'b'), DPX_E_FILE_READ, DPX_E_FILE_WRITE, ""},
    };
    plant("secret", "inside: secret");
    plant("outside", "inside: outside");
    for (const Case &c : cases) {
        SCOPED_TRACE(c.path.substr(0, 80));
        // What earlier rows wrote follows the planted content after a '+'.
        const Transfer t = download(c.path);
        EXPECT_EQ(t.status, c.read);
        EXPECT_EQ(t.bytes.substr(0, t.bytes.find('+')), c.read == DPX_OK ? "inside: " + c.lands : "");
        const std::string marker = "+" + c.path.substr(0, 40);
        EXPECT_EQ(put(c.path, {marker}), c.write);
        EXPECT_TRUE(c.write != DPX_OK || read_file(full(c.lands)).find(marker) != std::string::npos);
    }
    EXPECT_EQ(read_file(full("../secret")), "depot secret");
    EXPECT_EQ(read_file(full("../../outside")), "outside the depot");
}

TEST(Service, NullArgumentsAndTheRequestsWithNoServiceAreRefusedWithInvalidParamTouchingNothing)
{
    Transfer t(rel("f"));
    t.state = DPX_STATE_MORE;
    t.last = 5;
    for (int missing = 0; missing < 6; ++missing) {
        t.status = DPX_E_QUIET;
        dpx_get_chunks(nullptr, missing == 0 ? nullptr : &t.desc, missing == 1 ? nullptr : &t.crc,
                       missing == 2 ? nullptr : &t.state, missing == 3 ? nullptr : &t.index,
                       missing == 4 ? nullptr : &t.last, t.max, &t.status, missing == 5 ? nullptr : t.buffer.get());
        EXPECT_EQ(t.status, DPX_E_INVALID_PARAM) << missing;
    }
    EXPECT_EQ(t.state, DPX_STATE_MORE);
    dpx_status status[4] = {};
    dpx_put_chunks(nullptr, t.desc, 0, DPX_STATE_DONE, nullptr, 0, &status[0], t.buffer.get());
    dpx_put_chunks(nullptr, t.desc, 0, DPX_STATE_DONE, &t.last, 0, &status[1], nullptr);
    dpx_query_text query = "anything";
    uint32_t result = 42;
    dpx_agent_query(nullptr, query, t.desc, &result, &status[2]);
    dpx_node_filter filter = "*";
    dpx_node_name nodes[2] = {"n0", "n1"};
    dpx_list_nodes(nullptr, filter, &t.last, 1, &status[3], nodes);
    for (dpx_status s : status)
        EXPECT_EQ(s, DPX_E_INVALID_PARAM);
    EXPECT_EQ(result, 42u);
    EXPECT_EQ(t.last, 5);
    EXPECT_EQ(std::string(nodes[0]) + nodes[1], "n0n1");
    EXPECT_FALSE(file_exists(full(rel("f"))));
}

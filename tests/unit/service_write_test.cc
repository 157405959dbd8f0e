// The chunk write service, called as the server stub calls it: whole uploads
// run the way the client runs them, single calls with their checksums and
// failures, hostile paths, many threads at once; and the two managers that
// answer every request with DPX_E_INVALID_PARAM.
#include "child.h"
#include "cx_test_file.h"
#include "dpxclient.h"
#include "service_depot.h"
#include "test_support.h"

#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <sys/resource.h>
#include <thread>

using namespace dpxtest;

namespace {

constexpr uint32_t kChunk = DPX_CHUNK_SIZE;

// An upload of the local file `source` the way the client runs it: buffers
// read with dpx_read_xfer_buff, each with its own checksum from 0 over
// records 0 .. last - 1. `last` must come back as it went.
dpx_status upload(const std::string &source, const std::string &path)
{
    dpx_file_size size;
    dpx_file_time time;
    EXPECT_EQ(dpx_get_os_file_stats(source.c_str(), &size, &time), DPX_OK);
    CxFile file;
    EXPECT_TRUE(cx_ok(file.open(source, CX_FILE_READ)));
    int16_t max = 0;
    std::unique_ptr<dpx_chunk, decltype(&dpx_free_xfer_buff)> buffer(
        dpx_alloc_xfer_buff(size.chunks > 24 ? buffer_request(&size) : 24, &max), &dpx_free_xfer_buff);
    uint32_t index = 0;
    uint8_t finished = 0;
    dpx_status status = DPX_OK;
    while (status == DPX_OK && finished == 0) {
        int16_t last = -1;
        status = dpx_read_xfer_buff(file.get(), &index, buffer.get(), &last, max, &finished);
        if (status != DPX_OK)
            break;
        uint32_t crc = 0;
        dpx_checksum_xfer_buff(buffer.get(), last, &crc);
        const int16_t sent = last;
        dpx_put_chunks(nullptr, desc_for(path), crc, finished != 0 ? DPX_STATE_DONE : DPX_STATE_MORE, &last, max,
                       &status, buffer.get());
        EXPECT_EQ(last, sent);
    }
    return status;
}

// One put_chunks call with records of the given contents; `crc` null means
// the right checksum.
dpx_status put(const dpx_file_desc &desc, const std::vector<std::string> &records, const uint32_t *crc = nullptr)
{
    std::vector<dpx_chunk> buffer(std::max<size_t>(24, records.size()));
    for (size_t i = 0; i < records.size(); ++i) {
        buffer[i].length = static_cast<uint32_t>(records[i].size());
        records[i].copy(reinterpret_cast<char *>(buffer[i].data), kChunk);
    }
    int16_t last = static_cast<int16_t>(records.size()) - 1;
    uint32_t right = 0;
    dpx_checksum_xfer_buff(buffer.data(), last, &right);
    dpx_status status = DPX_E_QUIET;
    dpx_put_chunks(nullptr, desc, crc != nullptr ? *crc : right, DPX_STATE_DONE, &last,
                   static_cast<int16_t>(buffer.size() - 1), &status, buffer.data());
    EXPECT_EQ(last, static_cast<int16_t>(records.size()) - 1);
    return status;
}

// A relative path whose full path has exactly `length` characters.
std::string path_of_full_length(const std::string &prefix, size_t length)
{
    std::string path = prefix;
    const size_t base = product_dir().size() + 1;
    while (base + path.size() < length)
        path += (path.size() - prefix.size()) % 60 == 59 ? '/' : 'x';
    if (path.back() == '/')
        path.back() = 'x';
    return path;
}

}  // namespace

class ServiceWrite : public DepotTest {};

TEST_F(ServiceWrite, AWholeUploadReproducesTheFileAndASecondOneAppendsItAgain)
{
    TempDir local;
    for (size_t size : {size_t{0}, size_t{1}, size_t{4095}, size_t{4096}, size_t{10000}, size_t{98304},
                        size_t{(1 << 20) + 5}}) {
        SCOPED_TRACE(size);
        const std::string content = pattern_bytes(size, static_cast<uint32_t>(size));
        const std::string source = local / std::to_string(size);
        write_file(source, content);
        const std::string path = rel("new/dirs/" + std::to_string(size));
        ASSERT_EQ(upload(source, path), DPX_OK);
        EXPECT_TRUE(read_file(full(path)) == content);
        ASSERT_EQ(upload(source, path), DPX_OK);
        EXPECT_TRUE(read_file(full(path)) == content + content);
    }
}

TEST_F(ServiceWrite, OneCallMakesTheDirectoriesAndWritesOnlyABufferWhoseChecksumPasses)
{
    const std::string a(kChunk, 'a');
    const uint32_t wrong = 1;
    struct Case {
        const char *what;
        std::vector<std::string> records;
        const uint32_t *crc;
        dpx_status status;
        std::string content;
    };
    const Case cases[] = {
        {"last -1", {}, nullptr, DPX_OK, ""},
        {"last 0 has the checksum 0", {"only"}, nullptr, DPX_OK, "only"},
        {"the last record isn't covered", {a, "b", "c"}, nullptr, DPX_OK, a + "bc"},
        {"an empty record at the end", {a, ""}, nullptr, DPX_OK, a},
        {"a wrong checksum", {a, "b", "c"}, &wrong, DPX_E_CHECKSUM, ""},
        {"a record longer than its data", {a + "overflow", "b"}, nullptr, DPX_E_INVALID_PARAM, ""},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        const std::string path = rel(std::string(c.what) + "/missing/dir/f");
        EXPECT_EQ(put(desc_for(path), c.records, c.crc), c.status);
        ASSERT_TRUE(file_exists(full(path)));
        EXPECT_TRUE(read_file(full(path)) == c.content);
    }
    // The checksum covers records 0 .. last - 1: a third record that changes
    // after the checksum was taken passes.
    std::vector<dpx_chunk> buffer(3);
    for (dpx_chunk &record : buffer) {
        record.length = 1;
        record.data[0] = 'x';
    }
    uint32_t crc = 0;
    dpx_checksum_xfer_buff(buffer.data(), 2, &crc);
    buffer[2].data[0] = 'y';
    int16_t last = 2;
    dpx_status status = DPX_E_QUIET;
    dpx_put_chunks(nullptr, desc_for(rel("third")), crc, DPX_STATE_DONE, &last, 2, &status, buffer.data());
    EXPECT_EQ(status, DPX_OK);
    EXPECT_EQ(read_file(full(rel("third"))), "xxy");
}

TEST_F(ServiceWrite, TheNodeSizeAndTimeOfTheRecordHaveNoEffect)
{
    dpx_file_desc odd = desc_for(rel("odd"));
    std::memset(odd.node, 'n', sizeof odd.node);
    odd.size = {0xFFFFFFFF, 4095};
    odd.mtime = {1, 2};
    odd.reserved = 0xFF;
    EXPECT_EQ(put(odd, {"same", "bytes"}), DPX_OK);
    EXPECT_EQ(put(desc_for(rel("plain")), {"same", "bytes"}), DPX_OK);
    EXPECT_EQ(read_file(full(rel("odd"))), "samebytes");
    EXPECT_EQ(read_file(full(rel("plain"))), "samebytes");
}

TEST_F(ServiceWrite, AFailedOpenIsTracedAndAWrongChecksumStillTakesPrecedence)
{
    std::filesystem::create_directories(full(rel("dir")));
    // The file layer opens paths of up to 254 characters for writing.
    const std::string longest = path_of_full_length(rel(""), 254);
    const std::string too_long = path_of_full_length(rel(""), 255);
    ASSERT_EQ(full(too_long).size(), 255u);
    const uint32_t wrong = 1;
    struct Case {
        std::string path;
        const uint32_t *crc;
        dpx_status status;
        std::string trace;
    };
    const Case cases[] = {
        {longest, nullptr, DPX_OK, ""},
        {rel("dir"), nullptr, DPX_E_FILE_WRITE,
         "can't open '" + full(rel("dir")) + "': p" + std::to_string(EISDIR) + "\n"},
        {rel("dir"), &wrong, DPX_E_CHECKSUM, "can't open '" + full(rel("dir")) + "': p"},
        {too_long, nullptr, DPX_E_FILE_WRITE,
         "can't open '" + full(too_long) + "': p" + std::to_string(ENAMETOOLONG) + "\n"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.path);
        TraceCapture trace(TRC1_ERROR);
        EXPECT_EQ(put(desc_for(c.path), {"abc", "d"}, c.crc), c.status);
        if (c.trace.empty())
            EXPECT_EQ(trace.text(), "");
        else
            EXPECT_EQ(trace.count(c.trace), 1u) << trace.text();
    }
    EXPECT_EQ(read_file(full(longest)), "abcd");
    EXPECT_FALSE(file_exists(full(too_long)));
}

TEST_F(ServiceWrite, AFailedWriteLeavesTheRecordsWrittenBeforeIt)
{
    const std::string path = rel("limited");
    plant(path, "");
    EXPECT_EQ(in_child([&]() -> std::string {
                  // The file may grow to two chunks. The largest buffer of
                  // records is more than the stream holds, so the failure
                  // shows before the close, whose result isn't looked at.
                  std::signal(SIGXFSZ, SIG_IGN);
                  rlimit limit = {2 * kChunk, 2 * kChunk};
                  if (setrlimit(RLIMIT_FSIZE, &limit) != 0)
                      return "setrlimit failed";
                  TraceCapture trace(TRC1_ERROR);
                  if (put(desc_for(path), std::vector<std::string>(128, std::string(kChunk, 'w'))) != DPX_E_FILE_WRITE)
                      return "write failure not reported";
                  return trace.count("Can't write file\n") == 1 ? "" : "no trace: " + trace.text();
              }),
              "");
    EXPECT_EQ(std::filesystem::file_size(full(path)), 2 * kChunk);
}

TEST_F(ServiceWrite, NeverWritesOutsideTheProductsDirectory)
{
    const auto outside_before = files_outside_product();
    ASSERT_EQ(outside_before.size(), 2u);
    for (const HostilePath &row : hostile_paths()) {
        SCOPED_TRACE(row.path.substr(0, 80));
        const std::string marker = "from " + row.path.substr(0, 40) + "\n";
        EXPECT_EQ(put(desc_for(row), {marker}), row.write);
        if (row.write == DPX_OK) {
            EXPECT_NE(read_file(product_dir() + "/" + row.lands).find(marker), std::string::npos);
        }
    }
    EXPECT_EQ(files_outside_product(), outside_before);
}

TEST_F(ServiceWrite, ManyThreadsUploadToDifferentFilesAtOnce)
{
    constexpr int kThreads = 8;
    TempDir local;
    std::vector<std::string> contents(kThreads), sources(kThreads), targets(kThreads);
    std::vector<dpx_status> results(kThreads, DPX_E_QUIET);
    std::vector<std::thread> threads;
    for (size_t n = 0; n < kThreads; ++n) {
        contents[n] = pattern_bytes(50000 * n + 3, static_cast<uint32_t>(n));
        sources[n] = local / std::to_string(n);
        targets[n] = rel("t" + std::to_string(n));
        write_file(sources[n], contents[n]);
        threads.emplace_back([&, n] {
            results[n] = upload(sources[n], targets[n]);
            if (results[n] == DPX_OK)
                results[n] = upload(sources[n], targets[n]);
        });
    }
    for (auto &thread : threads)
        thread.join();
    for (size_t n = 0; n < kThreads; ++n) {
        EXPECT_EQ(results[n], DPX_OK);
        EXPECT_TRUE(read_file(full(targets[n])) == contents[n] + contents[n]) << n;
    }
}

TEST_F(ServiceWrite, ANullArgumentIsRefusedAndNoFileIsMade)
{
    const std::string path = rel("never");
    dpx_chunk buffer[1] = {};
    int16_t last = 0;
    dpx_status status = DPX_E_QUIET;
    dpx_put_chunks(nullptr, desc_for(path), 0, DPX_STATE_DONE, nullptr, 0, &status, buffer);
    EXPECT_EQ(status, DPX_E_INVALID_PARAM);
    status = DPX_E_QUIET;
    dpx_put_chunks(nullptr, desc_for(path), 0, DPX_STATE_DONE, &last, 0, &status, nullptr);
    EXPECT_EQ(status, DPX_E_INVALID_PARAM);
    dpx_put_chunks(nullptr, desc_for(path), 0, DPX_STATE_DONE, &last, 0, nullptr, buffer);
    EXPECT_EQ(last, 0);
    EXPECT_FALSE(file_exists(full(path)));
}

TEST_F(ServiceWrite, QueryAndListNodesAnswerInvalidParamAndTouchNothingElse)
{
    dpx_query_text query = "anything";
    uint32_t result = 42;
    dpx_status status = DPX_OK;
    dpx_agent_query(nullptr, query, desc_for(rel("q")), &result, &status);
    EXPECT_EQ(status, DPX_E_INVALID_PARAM);
    EXPECT_EQ(result, 42u);

    dpx_node_filter filter = "*";
    dpx_node_name nodes[4] = {"n0", "n1", "n2", "n3"};
    int16_t last = 2;
    status = DPX_OK;
    dpx_list_nodes(nullptr, filter, &last, 3, &status, nodes);
    EXPECT_EQ(status, DPX_E_INVALID_PARAM);
    EXPECT_EQ(last, 2);
    for (int i = 0; i < 4; ++i)
        EXPECT_EQ(std::string(nodes[i]), "n" + std::to_string(i));
    // Null pointers are never written through.
    dpx_agent_query(nullptr, query, desc_for("q"), nullptr, nullptr);
    dpx_list_nodes(nullptr, filter, nullptr, 3, nullptr, nullptr);
    EXPECT_FALSE(file_exists(full(rel("q"))));
}

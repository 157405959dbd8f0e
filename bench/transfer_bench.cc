// The costs of one buffer of a transfer, piece by piece:
//
//   transfer_bench --benchmark_counters_tabular=true
//
// - the checksum of a 128-record buffer;
// - a 128-record get_chunks reply written by the server stub's path, and
//   read by the client stub's reader from this machine's representation and
//   from one of the other byte order;
// - the read manager filling one 128-record buffer from a file in the page
//   cache (stat, open, seek, 128 reads, close, checksum);
// - a whole get_chunks call of 24 or 128 records through the client stub,
//   the runtime and the server stub, in-process and over TCP on 127.0.0.1.
//
// bytes_per_second counts the records' 4096-byte data, 524,288 bytes in a
// buffer of 128.
#include "afw/afw.h"
#include "dpxagt.h"
#include "ncs/server.h"

#include <benchmark/benchmark.h>

#include <algorithm>
#include <arpa/inet.h>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <unistd.h>
#include <vector>

namespace {

constexpr int16_t kMax = 127;
constexpr uint32_t kRecords = kMax + 1;
constexpr int64_t kDataBytes = int64_t{kRecords} * DPX_CHUNK_SIZE;

std::vector<dpx_chunk> full_records()
{
    std::vector<dpx_chunk> records(kRecords);
    for (uint32_t i = 0; i < kRecords; ++i) {
        records[i].index = i;
        records[i].length = DPX_CHUNK_SIZE;
        for (uint32_t j = 0; j < DPX_CHUNK_SIZE; ++j)
            records[i].data[j] = static_cast<unsigned char>(i * 31 + j);
    }
    return records;
}

void count_data(benchmark::State &state)
{
    state.SetBytesProcessed(state.iterations() * kDataBytes);
}

void BM_Checksum(benchmark::State &state)
{
    std::vector<dpx_chunk> records = full_records();
    for (auto _ : state) {
        uint32_t crc = 0;
        dpx_checksum_xfer_buff(records.data(), kRecords, &crc);
        benchmark::DoNotOptimize(crc);
    }
    count_data(state);
}
BENCHMARK(BM_Checksum);

// A depot of one product with a file of 200 chunks below a temporary
// directory, made on first use and removed at exit.
class Depot {
public:
    Depot()
    {
        char root[] = "/tmp/dpx-bench-XXXXXX";
        if (mkdtemp(root) == nullptr)
            std::abort();
        root_ = root;
        const std::string command = "mkdir -p " + root_ + "/bench && head -c " +
                                    std::to_string(200 * DPX_CHUNK_SIZE) + " /dev/urandom > " + root_ +
                                    "/bench/file";
        if (std::system(command.c_str()) != 0)
            std::abort();
        setenv("DPX_DEPOTROOT", root_.c_str(), 1);
        AFW_SetProductName("bench");
    }
    ~Depot()
    {
        std::error_code ignored;
        std::filesystem::remove_all(root_, ignored);
    }
    Depot(const Depot &) = delete;
    Depot &operator=(const Depot &) = delete;

private:
    std::string root_;
};

// The depot's file, relative to the product's directory.
const char *depot_file()
{
    static Depot depot;
    return "file";
}

// A manager that leaves the buffer as it came and delivers it whole, so that
// the stub's reading and writing is all that is measured.
void echo_get_chunks(handle_t, dpx_file_desc *, uint32_t *, uint8_t *, uint32_t *, int16_t *last, int16_t max,
                     dpx_status *status, dpx_chunk[])
{
    *last = max;
    *status = DPX_OK;
}
const dpx_transfer_v1_epv_t kEchoManagers = {echo_get_chunks, nullptr, nullptr, nullptr};

// A get_chunks request of 128 records, in a packet, as the client stub of a
// later call of a download writes it.
std::vector<unsigned char> get_request()
{
    std::vector<dpx_chunk> records = full_records();
    std::vector<unsigned char> packet(RPC_DATA_OFFS + dpx_get_request_bound(kMax));
    ncs::ndr::Writer writer(packet.data() + RPC_DATA_OFFS);
    dpx_file_desc desc{};
    std::snprintf(desc.path, sizeof desc.path, "file");
    dpx_put_file_block(writer, desc);
    writer.put_u32(0);
    writer.put_u8(DPX_STATE_MORE);
    writer.put_u32(0);
    writer.put_u16(static_cast<uint16_t>(kMax));
    writer.put_u16(static_cast<uint16_t>(kMax));
    dpx_put_array_words(writer, kMax, kMax);
    dpx_put_chunk_elements(writer, records.data(), kRecords);
    packet.resize(RPC_DATA_OFFS + writer.length());
    return packet;
}

// The server stub of get_chunks on a 128-record request: reads it into its
// array, runs the manager, writes the 128-record reply into a packet.
void BM_GetChunksServerStub(benchmark::State &state)
{
    std::vector<unsigned char> request = get_request();
    rpc__handle_rec handle{RPC_DATA_OFFS};
    unsigned char offered[RPC_DATA_OFFS + 8192];
    uint32_t drep = NCS_DREP_LOCAL;
    for (auto _ : state) {
        void *reply = nullptr;
        uint32_t reply_len = 0, st = 1;
        unsigned char must_free = 0;
        dpx_get_chunks_ssr(&handle, request.data(), static_cast<uint32_t>(request.size() - RPC_DATA_OFFS), offered,
                           sizeof offered - RPC_DATA_OFFS, &drep, &kEchoManagers, &reply, &reply_len, &must_free,
                           &st);
        if (must_free)
            rpc__free_pkt(reply);
    }
    count_data(state);
}
BENCHMARK(BM_GetChunksServerStub);

// The 128-record reply that BM_GetChunksServerStub's stub writes, as a body.
std::vector<unsigned char> get_reply()
{
    std::vector<unsigned char> request = get_request();
    rpc__handle_rec handle{RPC_DATA_OFFS};
    uint32_t drep = NCS_DREP_LOCAL;
    void *reply = nullptr;
    uint32_t reply_len = 0, st = 1;
    unsigned char must_free = 0;
    dpx_get_chunks_ssr(&handle, request.data(), static_cast<uint32_t>(request.size() - RPC_DATA_OFFS), nullptr, 0,
                       &drep, &kEchoManagers, &reply, &reply_len, &must_free, &st);
    const auto *body = static_cast<unsigned char *>(reply) + RPC_DATA_OFFS;
    std::vector<unsigned char> bytes(body, body + reply_len);
    rpc__free_pkt(reply);
    return bytes;
}

void swap32_at(std::vector<unsigned char> &body, size_t offset)
{
    std::reverse(body.begin() + static_cast<long>(offset), body.begin() + static_cast<long>(offset) + 4);
}
void swap16_at(std::vector<unsigned char> &body, size_t offset)
{
    std::swap(body[offset], body[offset + 1]);
}

// The same reply as a machine of the other byte order writes it: every
// integer of the file block, the scalars, the array words and each record's
// index and length reversed.
std::vector<unsigned char> foreign_reply(std::vector<unsigned char> body)
{
    for (size_t offset : {4132u, 4136u, 4140u, 4144u, 4152u, 4160u, 4168u})
        swap32_at(body, offset);
    for (size_t offset : {4164u, 4172u, 4174u})
        swap16_at(body, offset);
    for (size_t i = 0; i < kRecords; ++i) {
        swap32_at(body, 4176 + i * DPX_WIRE_CHUNK);
        swap32_at(body, 4176 + i * DPX_WIRE_CHUNK + 4);
    }
    return body;
}

// The client stub's reader of a 128-record get_chunks reply; arg 0 reads
// this machine's representation, 1 the other byte order.
void BM_GetChunksReplyRead(benchmark::State &state)
{
    const bool foreign = state.range(0) == 1;
    std::vector<unsigned char> body = get_reply();
    if (foreign)
        body = foreign_reply(std::move(body));
    const uint32_t local = NCS_DREP_LOCAL;
    const uint32_t sender =
        foreign ? NCS_DREP(NCS_DREP_INT(local) == NCS_INT_LITTLE ? NCS_INT_BIG : NCS_INT_LITTLE, NCS_CHAR_ASCII, 0)
                : local;
    std::vector<dpx_chunk> buffer(kRecords);
    for (auto _ : state) {
        ncs::ndr::Reader reader(body.data(), static_cast<uint32_t>(body.size()), sender, local, nullptr, nullptr);
        dpx_file_desc desc;
        uint32_t crc = 0, index = 0;
        uint8_t st = 0;
        int16_t last = kMax;
        dpx_status status = 0;
        dpx_read_get_chunks_reply(reader, &desc, &crc, &st, &index, &last, kMax, &status, buffer.data());
        if (last != kMax || buffer[kMax].length != DPX_CHUNK_SIZE)
            state.SkipWithError("reply read wrongly");
    }
    state.SetLabel(foreign ? "other byte order" : "this machine's");
    count_data(state);
}
BENCHMARK(BM_GetChunksReplyRead)->Arg(0)->Arg(1);

// The read manager serving one buffer of 128 records from a file in the
// page cache: a later call of a download, at chunk 64.
void BM_ReadManager(benchmark::State &state)
{
    const char *path = depot_file();
    std::vector<dpx_chunk> buffer(kRecords);
    dpx_file_desc desc{};
    std::snprintf(desc.path, sizeof desc.path, "%s", path);
    uint32_t crc = 0, index = 0;
    uint8_t st = DPX_STATE_FIRST;
    int16_t last = -1;
    dpx_status status = 0;
    dpx_get_chunks(nullptr, &desc, &crc, &st, &index, &last, kMax, &status, buffer.data());
    for (auto _ : state) {
        crc = 0;
        index = 64;
        st = DPX_STATE_MORE;
        dpx_get_chunks(nullptr, &desc, &crc, &st, &index, &last, kMax, &status, buffer.data());
        if (status != DPX_OK || last != kMax)
            state.SkipWithError("read manager failed");
    }
    count_data(state);
}
BENCHMARK(BM_ReadManager);

// The library registered and served on a free port, once per process.
uint16_t server_port()
{
    static const uint16_t port = [] {
        depot_file();
        dpx_agent_init();
        socket__addr_t bound{};
        uint32_t bound_len = 0, status = 0;
        rpc__listen("127.0.0.1", 0, 4, &bound, &bound_len, &status);
        if (status != rpc__s_ok)
            std::abort();
        return ntohs(bound.in4.sin_port);
    }();
    return port;
}

// A whole get_chunks call through the client stub, as a later call of a
// download makes it (the previous buffer goes out in the request): arg 0 is
// in-process, 1 TCP; arg 1 the records, 128 (files of 129 to 32767 chunks) or
// 24 (smaller files, and files of 32768 chunks, 128 MiB, and more).
void BM_GetChunksCall(benchmark::State &state)
{
    const bool tcp = state.range(0) == 1;
    const auto max = static_cast<int16_t>(state.range(1) - 1);
    socket__addr_t addr{};
    uint32_t addr_len = sizeof(sa_family_t);
    addr.sa.sa_family = socket__family_inproc;
    const uint16_t port = server_port();
    if (tcp) {
        addr.in4.sin_family = AF_INET;
        addr.in4.sin_port = htons(port);
        addr.in4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        addr_len = sizeof(sockaddr_in);
    }
    uint32_t bind_status = 0;
    handle_t handle = rpc__bind(&uuid__nil, &addr, addr_len, &bind_status);
    std::vector<dpx_chunk> buffer(kRecords);
    dpx_file_desc desc{};
    std::snprintf(desc.path, sizeof desc.path, "%s", depot_file());
    uint32_t crc = 0, index = 0;
    uint8_t st = DPX_STATE_FIRST;
    int16_t last = -1;
    dpx_status status = 0;
    dpx_transfer_v1_client_epv.dpx_get_chunks(handle, &desc, &crc, &st, &index, &last, max, &status,
                                              buffer.data());
    for (auto _ : state) {
        crc = 0;
        index = 64;
        st = DPX_STATE_MORE;
        dpx_transfer_v1_client_epv.dpx_get_chunks(handle, &desc, &crc, &st, &index, &last, max, &status,
                                                  buffer.data());
        if (status != DPX_OK || last != max) {
            state.SkipWithError("call failed");
            break;
        }
    }
    state.SetLabel(tcp ? "tcp" : "in-process");
    state.SetBytesProcessed(state.iterations() * state.range(1) * DPX_CHUNK_SIZE);
    uint32_t free_status = 0;
    rpc__free_handle(handle, &free_status);
}
BENCHMARK(BM_GetChunksCall)->ArgsProduct({{0, 1}, {24, 128}})->UseRealTime();

}  // namespace

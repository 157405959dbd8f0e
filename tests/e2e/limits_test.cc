// The daemon's limits on what a peer sends, from a raw socket that speaks the
// carrier's frames. Each refused request ends on its own and the daemon goes
// on serving.
#include "foreign_body.h"
#include "hub.h"

#include "dpxagt.h"
#include "ncs/frame.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <unistd.h>

namespace {

using namespace dpxtest;
namespace frame = ncs::frame;

// A connection to the daemon; every read gives up after 10 s.
class RawPeer {
public:
    explicit RawPeer(uint16_t port)
    {
        sockaddr_in addr{AF_INET, htons(port), {htonl(INADDR_LOOPBACK)}, {}};
        EXPECT_EQ(connect(fd_, reinterpret_cast<sockaddr *>(&addr), sizeof addr), 0);
        timeval limit{10, 0};
        setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    }
    ~RawPeer() { close(fd_); }

    void send_bytes(const void *bytes, size_t n) { EXPECT_EQ(send(fd_, bytes, n, MSG_NOSIGNAL), ssize_t(n)); }

    // A request whose header announces `announced` bytes of body.
    void send_request(uint32_t opnum, const std::vector<unsigned char> &body, size_t announced)
    {
        frame::Header h{.kind = frame::kRequest, .call_id = 1, .drep = NCS_DREP_LOCAL,
                        .if_id = dpx_transfer_v1_if_spec.id, .if_vers = 1, .opnum = opnum,
                        .body_len = static_cast<uint32_t>(announced)};
        frame::Bytes bytes;
        frame::encode(h, bytes);
        send_bytes(bytes, sizeof bytes);
        send_bytes(body.data(), body.size());
    }

    // The next answer; its kind is 0 when the daemon closed the connection
    // or nothing came.
    std::pair<frame::Header, std::vector<unsigned char>> answer()
    {
        frame::Bytes bytes;
        frame::Header h{};
        if (!receive(bytes, sizeof bytes) || !frame::decode(bytes, h))
            return {};
        std::vector<unsigned char> body(h.body_len);
        return receive(body.data(), body.size()) ? std::make_pair(h, body) : std::make_pair(frame::Header{}, body);
    }

    bool closed()
    {
        char byte;
        return recv(fd_, &byte, 1, 0) == 0;
    }

private:
    bool receive(void *into, size_t n) { return n == 0 || recv(fd_, into, n, MSG_WAITALL) == ssize_t(n); }
    int fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
};

TEST(Limits, EachRefusedRequestEndsOnItsOwnAndTheDaemonServesOn)
{
    ScopedEnv frame_time("NCS_FRAME_TIMEOUT_S", "1"), connections("NCS_MAX_CONNECTIONS", "4");
    Hub hub;
    {
        SCOPED_TRACE("a body above the limit");
        RawPeer peer(hub.port);
        peer.send_request(DPX_OP_GET_CHUNKS, {}, RPC_MAX_BODY + 1);
        EXPECT_EQ(peer.answer().first.fault, rpc__s_too_big);
        EXPECT_TRUE(peer.closed());
    }
    {
        SCOPED_TRACE("a frame whose body never comes, closed at the frame time-out");
        RawPeer peer(hub.port);
        peer.send_request(DPX_OP_PUT_CHUNKS, std::vector<unsigned char>(1000, 0), RPC_MAX_BODY);
        EXPECT_TRUE(peer.closed());
    }
    {
        SCOPED_TRACE("a malformed header");
        RawPeer peer(hub.port);
        peer.send_bytes(std::string(frame::kHeaderSize, 'Z').data(), frame::kHeaderSize);
        EXPECT_TRUE(peer.closed());
    }
    pid_t daemon = hub.daemon->pid();
    size_t at_rest = resources_of(daemon).sockets;
    {
        SCOPED_TRACE("connections beyond the limit");
        std::vector<std::unique_ptr<RawPeer>> held;
        for (int i = 0; i < 4; ++i)
            held.push_back(std::make_unique<RawPeer>(hub.port));
        EXPECT_EQ(RawPeer(hub.port).answer().first.fault, rpc__s_server_busy);
    }
    EXPECT_TRUE(eventually([&] { return resources_of(daemon).sockets <= at_rest; }));

    // Refused bodies: a fault, which closes its connection, or a reply with a
    // status, after which the connection serves on.
    auto request = [](uint16_t max, int16_t last, std::vector<dpx_chunk> chunks) {
        Message m;
        m.desc = sample_desc("limits/" + std::to_string(max) + "-" + std::to_string(last));
        m.max = static_cast<int16_t>(max);
        m.last = last;
        m.chunks = std::move(chunks);
        dpx_checksum_xfer_buff(m.chunks.data(), m.last, &m.crc);
        return m;
    };
    Message too_many = request(DPX_RPC_MAX_ELEMENTS, -1, {}), miscounted = request(23, -1, {});
    miscounted.count_word = 5;
    Message no_nul = request(23, 0, sample_chunks(1, 0)), too_long = request(23, 1, sample_chunks(2, 0));
    std::memset(no_nul.desc.path, 'a', sizeof no_nul.desc.path);
    too_long.chunks[1].length = DPX_CHUNK_SIZE + 1;
    const struct {
        const char *what;
        uint32_t opnum;
        Message message;
        uint32_t fault;
        dpx_status status;
    } refused[] = {
        {"an array above its limit", DPX_OP_GET_CHUNKS, too_many, DPX_RPC_FAULT_INVALID_BOUND, 0},
        {"a count word other than last + 1", DPX_OP_GET_CHUNKS, miscounted, DPX_RPC_FAULT_INVALID_BOUND, 0},
        {"a path field without NUL", DPX_OP_PUT_CHUNKS, no_nul, 0, DPX_E_INVALID_PARAM},
        {"a record longer than a chunk", DPX_OP_PUT_CHUNKS, too_long, 0, DPX_E_INVALID_PARAM},
    };
    auto peer = std::make_unique<RawPeer>(hub.port);
    for (const auto &r : refused) {
        SCOPED_TRACE(r.what);
        bool get = r.opnum == DPX_OP_GET_CHUNKS;
        std::vector<unsigned char> body = encode(get ? kGetChunksRequest : kPutChunksRequest, r.message, local_rep());
        peer->send_request(r.opnum, body, body.size());
        auto [header, reply] = peer->answer();
        ASSERT_EQ(header.kind, r.fault != 0 ? frame::kFault : frame::kReply);
        EXPECT_EQ(header.fault, r.fault);
        if (r.fault != 0) {
            EXPECT_TRUE(peer->closed());
            peer = std::make_unique<RawPeer>(hub.port);
        }
        Message answer = r.fault == 0 ? decode(get ? kGetChunksReply : kPutChunksReply, reply, local_rep()) : Message{};
        EXPECT_EQ(answer.status, r.status);
    }
    std::string written = hub.depot_file("limits/23-1");
    EXPECT_TRUE(!file_exists(written) || std::filesystem::file_size(written) == 0) << "a refused record was written";

    write_file(hub / "ok.bin", pattern_bytes(100000, 31));
    EXPECT_EQ(PutFile("node1", "limits/ok.bin", (hub / "ok.bin").c_str()), DPX_OK);
    EXPECT_TRUE(same_files(hub / "ok.bin", hub.depot_file("limits/ok.bin")));
    EXPECT_TRUE(exited_with(hub.stop(), 0));
}

}  // namespace

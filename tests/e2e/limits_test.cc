// The daemon's limits on what a peer sends, from a raw socket that speaks the
// carrier's frames: a body above the limit, a frame that never ends, a
// malformed header, connections beyond the limit, arrays beyond theirs,
// records that claim more than a chunk. Each is refused on its own and the
// daemon goes on serving.
#include "fault_kit.h"
#include "foreign_body.h"

#include "dpxagt.h"
#include "ncs/frame.h"

namespace {

using namespace dpxtest;

// A connection to the daemon that sends frames and reads answers, each step
// bounded by a time-out of a few seconds.
class RawPeer {
public:
    explicit RawPeer(uint16_t port)
    {
        fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        addr.sin_port = htons(port);
        EXPECT_EQ(connect(fd_, reinterpret_cast<sockaddr *>(&addr), sizeof addr), 0);
        timeval limit{10, 0};
        setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    }
    ~RawPeer() { close(fd_); }
    RawPeer(const RawPeer &) = delete;
    RawPeer &operator=(const RawPeer &) = delete;

    void send_bytes(const void *bytes, size_t n) { EXPECT_EQ(send(fd_, bytes, n, MSG_NOSIGNAL), static_cast<ssize_t>(n)); }

    void send_request(uint32_t opnum, const std::vector<unsigned char> &body, uint32_t announced)
    {
        ncs::frame::Header h;
        h.kind = ncs::frame::kRequest;
        h.call_id = 1;
        h.drep = NCS_DREP_LOCAL;
        h.if_id = dpx_transfer_v1_if_spec.id;
        h.if_vers = 1;
        h.opnum = opnum;
        h.body_len = announced;
        ncs::frame::Bytes bytes;
        ncs::frame::encode(h, bytes);
        send_bytes(bytes, sizeof bytes);
        if (!body.empty())
            send_bytes(body.data(), body.size());
    }

    // The next answer's header and body; nullopt when the daemon closed the
    // connection (or nothing came within the time-out).
    std::optional<std::pair<ncs::frame::Header, std::vector<unsigned char>>> answer()
    {
        ncs::frame::Bytes bytes;
        ncs::frame::Header h;
        if (!receive(bytes, sizeof bytes) || !ncs::frame::decode(bytes, h))
            return std::nullopt;
        std::vector<unsigned char> body(h.body_len);
        if (!receive(body.data(), body.size()))
            return std::nullopt;
        return std::make_pair(h, body);
    }

    // True when the daemon closed the connection.
    bool closed()
    {
        char byte;
        return recv(fd_, &byte, 1, 0) == 0;
    }

private:
    bool receive(void *into, size_t n)
    {
        auto *p = static_cast<unsigned char *>(into);
        for (size_t got = 0; got < n;) {
            ssize_t r = recv(fd_, p + got, n - got, 0);
            if (r <= 0)
                return false;
            got += static_cast<size_t>(r);
        }
        return true;
    }
    int fd_ = -1;
};

uint32_t fault_of(const std::optional<std::pair<ncs::frame::Header, std::vector<unsigned char>>> &answer)
{
    return answer && answer->first.kind == ncs::frame::kFault ? answer->first.fault : 0;
}

TEST(Limits, EachRefusedRequestEndsOnItsOwnAndTheDaemonServesOn)
{
    ScopedEnv idle("NCS_IDLE_TIMEOUT_S", "1");
    ScopedEnv connections("NCS_MAX_CONNECTIONS", "4");
    ClientOfHub hub;
    uint16_t port = hub.daemon->port;

    {
        SCOPED_TRACE("a body above the limit");
        RawPeer peer(port);
        peer.send_request(DPX_OP_GET_CHUNKS, {}, RPC_MAX_BODY + 1);
        EXPECT_EQ(fault_of(peer.answer()), rpc__s_too_big);
        EXPECT_TRUE(peer.closed());
    }
    {
        SCOPED_TRACE("a frame whose body never comes");
        RawPeer peer(port);
        peer.send_request(DPX_OP_PUT_CHUNKS, std::vector<unsigned char>(1000, 0), RPC_MAX_BODY);
        EXPECT_TRUE(peer.closed()) << "not closed at the idle time-out";
    }
    {
        SCOPED_TRACE("a malformed header");
        RawPeer peer(port);
        std::vector<unsigned char> junk(ncs::frame::kHeaderSize, 0x5A);
        peer.send_bytes(junk.data(), junk.size());
        EXPECT_TRUE(peer.closed());
    }
    pid_t daemon = hub.daemon->process->pid();
    size_t at_rest = resources_of(daemon).sockets;
    {
        SCOPED_TRACE("connections beyond the limit");
        std::vector<std::unique_ptr<RawPeer>> held;
        for (int i = 0; i < 4; ++i)
            held.push_back(std::make_unique<RawPeer>(port));
        RawPeer extra(port);
        EXPECT_EQ(fault_of(extra.answer()), rpc__s_server_busy);
    }
    EXPECT_TRUE(eventually([&] { return resources_of(daemon).sockets <= at_rest; }));
    {
        SCOPED_TRACE("an array above its limit, then records longer than a chunk");
        RawPeer peer(port);
        Message big;
        big.desc = sample_desc("limits/big.bin");
        big.max = DPX_RPC_MAX_ELEMENTS;  // size word 1025
        std::vector<unsigned char> request = encode(kGetChunksRequest, big, local_rep());
        peer.send_request(DPX_OP_GET_CHUNKS, request, static_cast<uint32_t>(request.size()));
        EXPECT_EQ(fault_of(peer.answer()), DPX_RPC_FAULT_INVALID_BOUND);

        Message put;
        put.desc = sample_desc("limits/long.bin");
        put.max = 23;
        put.last = 1;
        put.chunks = sample_chunks(2, 0);
        put.chunks[1].length = DPX_CHUNK_SIZE + 1;
        dpx_checksum_xfer_buff(put.chunks.data(), put.last, &put.crc);
        std::vector<unsigned char> body = encode(kPutChunksRequest, put, local_rep());
        peer.send_request(DPX_OP_PUT_CHUNKS, body, static_cast<uint32_t>(body.size()));
        auto reply = peer.answer();
        ASSERT_TRUE(reply.has_value());
        ASSERT_EQ(reply->first.kind, ncs::frame::kReply);
        Message answer = decode(kPutChunksReply, reply->second, local_rep());
        EXPECT_EQ(answer.status, DPX_E_INVALID_PARAM);
        EXPECT_EQ(read_file(hub.depot_file("limits/long.bin")), "") << "a record was written";
    }
    std::string source = hub.dir / "ok.bin";
    write_file(source, pattern_bytes(100000, 31));
    EXPECT_EQ(PutFile("node1", "limits/ok.bin", source.c_str()), DPX_OK);
    EXPECT_EQ(read_file(hub.depot_file("limits/ok.bin")), read_file(source));
    EXPECT_TRUE(exited_with(hub.daemon->stop(), 0));
}

}  // namespace

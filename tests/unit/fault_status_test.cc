// A peer that answers every request with a fault of its choosing: no value it
// sends may make a failed call look like one that ran to its end.
#include "dpxclient.h"
#include "ncs/frame.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <sys/socket.h>
#include <unistd.h>

#include <thread>

namespace {

namespace frame = ncs::frame;

// Listens on 127.0.0.1 and answers the first request of each connection
// with a fault frame carrying `status`, then closes the connection.
class FaultingPeer {
public:
    explicit FaultingPeer(uint32_t status) : status_(status)
    {
        sockaddr_in addr{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
        socklen_t len = sizeof addr;
        EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr *>(&addr), len), 0);
        EXPECT_EQ(listen(listener_, 4), 0);
        getsockname(listener_, reinterpret_cast<sockaddr *>(&addr), &len);
        address_.in4 = addr;
        thread_ = std::thread([this] { serve(); });
    }
    ~FaultingPeer()
    {
        shutdown(listener_, SHUT_RDWR);
        thread_.join();
        close(listener_);
    }
    const socket__addr_t &address() const { return address_; }

private:
    void serve()
    {
        for (int fd; (fd = accept(listener_, nullptr, nullptr)) >= 0; close(fd)) {
            frame::Bytes bytes;
            frame::Header h;
            if (recv(fd, bytes, sizeof bytes, MSG_WAITALL) != ssize_t(sizeof bytes) || !frame::decode(bytes, h))
                continue;
            std::vector<unsigned char> body(h.body_len);
            if (h.body_len > 0 && recv(fd, body.data(), body.size(), MSG_WAITALL) != ssize_t(body.size()))
                continue;
            h.kind = frame::kFault;
            h.flags = frame::kClosing;
            h.body_len = 0;
            h.fault = status_;
            frame::encode(h, bytes);
            send(fd, bytes, sizeof bytes, MSG_NOSIGNAL);
        }
    }

    uint32_t status_;
    int listener_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    socket__addr_t address_{};
    std::thread thread_;
};

TEST(FaultStatus, NoFaultStatusReadsAsACallThatRanToItsEnd)
{
    const struct { uint32_t sent; dpx_status status; } cases[] = {
        {EXC1_FRAME_SET, rpc__s_protocol_error},
        {rpc__s_ok, rpc__s_protocol_error},
        {EXC1_FRAME_SET - 1, DPX_E_RPC_FAILED},
        {EXC1_FRAME_SET + 1, DPX_E_RPC_FAILED},
        {EXC1_S_FRAME_SET_RAISED, DPX_E_RPC_FAILED},
        {rpc__s_comm_failure, rpc__s_comm_failure},
    };
    for (const auto &c : cases) {
        FaultingPeer peer(c.sent);
        uint32_t st;
        handle_t handle = rpc__bind(&uuid__nil, &peer.address(), sizeof(sockaddr_in), &st);
        ASSERT_EQ(st, rpc__s_ok);
        dpx_file_desc desc{};
        std::strcpy(desc.path, "a/file");
        dpx_chunk chunk{};
        int16_t last = 0;
        dpx_status status = DPX_OK;
        put_chunks(handle, desc, 0, DPX_STATE_FIRST, &last, 0, &status, &chunk);
        EXPECT_EQ(status, c.status) << std::hex << "fault 0x" << c.sent;
        rpc__free_handle(handle, &st);
    }
}

TEST(FaultStatus, ARaiseOfTheNoFaultValueCarriesAStatusOfItsOwn)
{
    EXC1_FRAME frame;
    EXPECT_EQ(exc::guard(&frame, __FILE__, __LINE__, [] { EXC1__Raise(EXC1_Thread(), EXC1_FRAME_SET); }),
              EXC1_S_FRAME_SET_RAISED);
    EXC1_Allow();
}

}  // namespace

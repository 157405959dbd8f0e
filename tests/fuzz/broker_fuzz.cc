// The location broker's reading of requests, as a stranger's connection
// delivers them: the input goes to a broker running in this process over
// loopback, and the target waits until the broker has answered or closed.
// Whatever the bytes, the broker must stay up, answer only with whole
// replies, and never take an entry from a request it refused.
#include "ncs/lb.h"
#include "ncs/lb_format.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

namespace {

namespace wire = ncs::lb;

sockaddr_in broker()
{
    static const sockaddr_in address = [] {
        setenv("NCS_LB_PORT", "0", 1);
        uint32_t status;
        lb__start_broker("127.0.0.1", &status);
        socket__addr_t addr;
        uint32_t len = sizeof addr;
        lb__inq_broker(&addr, &len, &status);
        if (status != rpc__s_ok)
            std::abort();
        setenv("NCS_LB_PORT", std::to_string(ntohs(addr.in4.sin_port)).c_str(), 1);
        return addr.in4;
    }();
    return address;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    sockaddr_in to = broker();
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof to) != 0)
        std::abort();
    send(fd, data, size, MSG_NOSIGNAL);
    shutdown(fd, SHUT_WR);
    // Every answer is a whole reply: a header of its kind, then its body.
    std::vector<uint8_t> answer;
    uint8_t chunk[8192];
    for (ssize_t n; (n = recv(fd, chunk, sizeof chunk, 0)) > 0;)
        answer.insert(answer.end(), chunk, chunk + n);
    close(fd);
    for (size_t at = 0; at < answer.size();) {
        if (answer.size() - at < wire::kHeaderSize)
            std::abort();
        wire::Reader reader(std::span<const uint8_t>(answer).subspan(at));
        wire::Header header = wire::get_header(reader);
        if (header.magic != wire::kMagic || header.kind != wire::Kind::kReply ||
            header.body_len > wire::kMaxReplyBody || answer.size() - at - wire::kHeaderSize < header.body_len)
            std::abort();
        at += wire::kHeaderSize + header.body_len;
    }
    // A stranger over loopback is of this host: what it registered goes
    // with its connection, so the broker holds nothing afterwards.
    lb__lookup_handle_t position = -1;
    lb__entry_t found[4];
    uint32_t count = 0, status;
    socket__addr_t here{};
    here.in4 = to;
    for (int i = 0; i < 100; ++i) {
        lb__lookup_range(&uuid__nil, &uuid__nil, &uuid__nil, nullptr, &here, sizeof to, &position, 4, &count, found,
                         &status);
        if (count == 0)
            return 0;
        position = -1;
        usleep(1000);
    }
    std::abort();
}

// Tries, from wherever it runs, what a stranger to a host may try with its
// location broker: sends the broker at HOST (port NCS_LB_PORT) a
// registration of the hub at 10.9.9.9:9 in the broker's own
// message format, then looks the hub up there as any client does.
// Prints "register 0xSTATUS" and "lookup 0xSTATUS N ADDRESS...".
//
// usage: dpx_test_register HOST
#include "dpx/dpx.h"

#include "ncs/lb.h"
#include "ncs/lb_format.h"

#include <arpa/inet.h>
#include <netdb.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <vector>

namespace wire = ncs::lb;

namespace {

uuid__t hub_uuid()
{
    uuid__t id;
    uint32_t status;
    uuid__decode(DPX_HUB_LB_UUID, &id, &status);
    return id;
}

lb__entry_t forged_entry()
{
    lb__entry_t entry{};
    entry.obj_interface = hub_uuid();
    entry.saddr.in4 = {AF_INET, htons(9), {inet_addr("10.9.9.9")}, {}};
    entry.saddr_len = sizeof(sockaddr_in);
    return entry;
}

uint32_t send_registration(const char *host)
{
    sockaddr_in broker{AF_INET, htons(lb__broker_port()), {inet_addr(host)}, {}};
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (connect(fd, reinterpret_cast<sockaddr *>(&broker), sizeof broker) != 0) {
        close(fd);
        return lb__s_broker_unreachable;
    }
    std::vector<uint8_t> request(wire::kHeaderSize + wire::kEntrySize);
    wire::Writer writer(request);
    wire::put_header(writer, {wire::kMagic, wire::kVersion, wire::Kind::kRegister, wire::kEntrySize});
    wire::put_entry(writer, forged_entry());
    std::vector<uint8_t> reply(wire::kHeaderSize + wire::kReplyFixedSize);
    uint32_t status = rpc__s_protocol_error;
    if (send(fd, request.data(), request.size(), MSG_NOSIGNAL) == ssize_t(request.size()) &&
        recv(fd, reply.data(), reply.size(), MSG_WAITALL) == ssize_t(reply.size())) {
        wire::Reader reader(std::span<const uint8_t>(reply).subspan(wire::kHeaderSize));
        status = wire::get_reply_head(reader).status;
    }
    close(fd);
    return status;
}

}  // namespace

int main(int argc, char **argv)
{
    if (argc != 2) {
        std::fprintf(stderr, "usage: dpx_test_register HOST\n");
        return 2;
    }
    std::printf("register 0x%08X\n", send_registration(argv[1]));

    socket__addr_t location{};
    location.in4 = {AF_INET, 0, {inet_addr(argv[1])}, {}};
    lb__lookup_handle_t position = -1;
    lb__entry_t found[32];
    uint32_t count = 0, status;
    const uuid__t hub = hub_uuid();
    lb__lookup_range(&uuid__nil, &uuid__nil, &hub, nullptr, &location, sizeof(sockaddr_in),
                     &position, 32, &count, found, &status);
    std::printf("lookup 0x%08X %u", status, count);
    for (uint32_t i = 0; i < count; ++i) {
        char name[INET_ADDRSTRLEN] = "?";
        inet_ntop(AF_INET, &found[i].saddr.in4.sin_addr, name, sizeof name);
        std::printf(" %s:%u", name, ntohs(found[i].saddr.in4.sin_port));
    }
    std::printf("\n");
    return 0;
}

// Tools of the fault and load suites: a location broker of its own, a proxy
// that cuts connections mid-body, and the resources of a process as /proc
// tells them.
#ifndef DPX_TEST_FAULT_KIT_H
#define DPX_TEST_FAULT_KIT_H

#include "client_hub.h"

#include "ncs/lb.h"

#include <arpa/inet.h>
#include <atomic>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

namespace dpxtest {

// What a process holds: descriptors of files and pipes, sockets, threads,
// resident memory.
struct Resources {
    size_t files = 0;
    size_t sockets = 0;
    size_t threads = 0;
    size_t rss_kib = 0;
};

inline Resources resources_of(const std::string &pid)
{
    namespace fs = std::filesystem;
    Resources r;
    std::error_code ec;
    for (const auto &entry : fs::directory_iterator("/proc/" + pid + "/fd", ec)) {
        std::error_code link_ec;
        std::string target = fs::read_symlink(entry.path(), link_ec).string();
        // The event objects of a connection's io_context go with its socket.
        if (target.rfind("socket:", 0) == 0)
            ++r.sockets;
        else if (target.rfind("anon_inode:", 0) != 0)
            ++r.files;
    }
    for (auto it = fs::directory_iterator("/proc/" + pid + "/task", ec); !ec && it != fs::directory_iterator(); ++it)
        ++r.threads;
    std::ifstream status("/proc/" + pid + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmRSS:", 0) == 0)
            r.rss_kib = std::stoul(line.substr(6));
    return r;
}

inline Resources resources_of(pid_t pid)
{
    return resources_of(std::to_string(pid));
}

// Polls until `done` holds or about `seconds` have passed; the result of the
// last try. For things another process finishes in its own time.
template <class Done>
bool eventually(Done done, int seconds = 10)
{
    for (int i = 0; i < seconds * 20; ++i) {
        if (done())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return done();
}

// A dpx-lbd on a free port of 127.0.0.1.
struct Broker {
    Broker()
    {
        process = std::make_unique<Process>(std::vector<std::string>{bin_dir() + "/dpx-lbd"},
                                            std::map<std::string, std::optional<std::string>>{{"NCS_LB_PORT", "0"}});
        auto line = process->wait_line("listening on ");
        EXPECT_TRUE(line.has_value()) << "dpx-lbd did not start";
        if (line)
            port = static_cast<uint16_t>(std::stoi(line->substr(line->rfind(':') + 1)));
    }
    std::unique_ptr<Process> process;
    uint16_t port = 0;
};

// Forwards connections from a port of 127.0.0.1 to `target_port`. The first
// `cuts` connections are closed, both ways, once `limit` bytes have gone in
// the direction `upstream` (client to server) or the other; later ones pass
// whole. One connection at a time.
class CuttingProxy {
public:
    CuttingProxy(uint16_t target_port, bool upstream, uint64_t limit, int cuts)
        : target_port_(target_port), upstream_(upstream), limit_(limit), cuts_left_(cuts)
    {
        listener_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in addr = loopback(0);
        socklen_t len = sizeof addr;
        bool ok = bind(listener_, reinterpret_cast<sockaddr *>(&addr), sizeof addr) == 0 && listen(listener_, 16) == 0 &&
                  getsockname(listener_, reinterpret_cast<sockaddr *>(&addr), &len) == 0;
        EXPECT_TRUE(ok) << "proxy cannot listen";
        port = ntohs(addr.sin_port);
        thread_ = std::thread([this] { serve(); });
    }
    ~CuttingProxy()
    {
        stop_ = true;
        thread_.join();
        close(listener_);
    }
    CuttingProxy(const CuttingProxy &) = delete;
    CuttingProxy &operator=(const CuttingProxy &) = delete;

    uint16_t port = 0;
    std::atomic<int> cut{0};  // connections cut so far

private:
    static sockaddr_in loopback(uint16_t port)
    {
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        addr.sin_port = htons(port);
        return addr;
    }

    // Waits up to 100 ms for `fd` to be readable; false at the time-out.
    bool readable(int fd)
    {
        pollfd p{fd, POLLIN, 0};
        return poll(&p, 1, 100) > 0;
    }

    void serve()
    {
        while (!stop_) {
            if (!readable(listener_))
                continue;
            int client = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
            if (client < 0)
                continue;
            int server = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
            sockaddr_in addr = loopback(target_port_);
            if (connect(server, reinterpret_cast<sockaddr *>(&addr), sizeof addr) == 0)
                forward(client, server, cuts_left_-- > 0);
            close(server);
            close(client);
        }
    }

    void forward(int client, int server, bool cutting)
    {
        uint64_t counted = 0;
        char buffer[65536];
        while (!stop_) {
            pollfd p[2] = {{client, POLLIN, 0}, {server, POLLIN, 0}};
            if (poll(p, 2, 100) <= 0)
                continue;
            for (int i = 0; i < 2; ++i) {
                if ((p[i].revents & (POLLIN | POLLHUP | POLLERR)) == 0)
                    continue;
                bool up = i == 0;
                size_t room = sizeof buffer;
                if (cutting && up == upstream_)
                    room = static_cast<size_t>(std::min<uint64_t>(room, limit_ - counted));
                ssize_t n = room > 0 ? read(p[i].fd, buffer, room) : 0;
                if (n <= 0 || send(up ? server : client, buffer, static_cast<size_t>(n), MSG_NOSIGNAL) != n)
                    return;
                if (cutting && up == upstream_ && (counted += static_cast<uint64_t>(n)) >= limit_) {
                    ++cut;
                    return;
                }
            }
        }
    }

    uint16_t target_port_;
    bool upstream_;
    uint64_t limit_;
    int cuts_left_;
    int listener_ = -1;
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

// Registers the address 127.0.0.1:`port` as the hub in the broker at the
// broker port, ahead of the entries there (the newest comes first), for as
// long as it lives.
class HubEntry {
public:
    explicit HubEntry(uint16_t port)
    {
        uint32_t status = 0;
        uuid__decode(DPX_HUB_LB_UUID, &entry_.obj_interface, &status);
        std::snprintf(entry_.annotation, sizeof entry_.annotation, "proxy");
        entry_.saddr_len = sizeof entry_.saddr;
        socket__from_name(AF_INET, "127.0.0.1", 9, port, &entry_.saddr, &entry_.saddr_len, &status);
        lb__register(&entry_, &status);
        EXPECT_EQ(status, rpc__s_ok);
    }
    ~HubEntry()
    {
        uint32_t status = 0;
        lb__unregister(&entry_, &status);
    }
    HubEntry(const HubEntry &) = delete;
    HubEntry &operator=(const HubEntry &) = delete;

private:
    lb__entry_t entry_{};
};

}  // namespace dpxtest

#endif

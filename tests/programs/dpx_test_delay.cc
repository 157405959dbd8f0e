// A TCP relay that holds every byte DELAY_MS in each direction: the delay of
// a long link, for kernels without a delaying queueing discipline. Accepts on
// HOST:PORT and connects each client to TARGET:TPORT; an end's close reaches
// the other end after the bytes before it. With "up" or "down", the first
// CUTS connections are cut both ways once LIMIT bytes have passed upstream
// (client to target) or downstream, and "cut" is printed. Prints "relaying on
// HOST:PORT" when ready; runs until killed.
//
// usage: dpx_test_delay HOST PORT TARGET TPORT DELAY_MS [up|down LIMIT CUTS]
#include <algorithm>
#include <arpa/inet.h>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <mutex>
#include <netinet/tcp.h>
#include <string>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

struct Fd {
    explicit Fd(int fd) : fd(fd) {}
    ~Fd() { close(fd); }
    Fd(const Fd &) = delete;
    const int fd;
};

sockaddr_in address_of(const char *host, const char *port)
{
    sockaddr_in a{AF_INET, htons(static_cast<uint16_t>(std::atoi(port))), {}, {}};
    if (inet_pton(AF_INET, host, &a.sin_addr) != 1) {
        std::fprintf(stderr, "dpx_test_delay: not an IPv4 address: %s\n", host);
        std::exit(2);
    }
    return a;
}

// Bytes in flight from one socket to another: the reader stamps what it
// receives, the writer sends each piece once its time has come. An empty
// piece is the end: the sender's close, or the cut after `budget` bytes.
class Direction {
public:
    Direction(int from, int to, std::chrono::milliseconds delay, uint64_t budget)
        : from_(from), to_(to), delay_(delay), budget_(budget)
    {
    }

    void run()
    {
        std::thread writer([this] { write_loop(); });
        std::vector<char> piece(64 * 1024);
        for (bool more = true; more;) {
            ssize_t n = recv(from_, piece.data(), std::min<uint64_t>(piece.size(), budget_), 0);
            if (n < 0 && errno == EINTR)
                continue;
            budget_ -= n > 0 ? static_cast<uint64_t>(n) : 0;
            more = n > 0 && budget_ > 0;
            std::lock_guard<std::mutex> hold(mutex_);
            if (n > 0)
                queue_.push_back({Clock::now() + delay_, std::string(piece.data(), static_cast<size_t>(n))});
            if (!more)
                queue_.push_back({Clock::now() + delay_, std::string()});
            ready_.notify_one();
        }
        writer.join();
    }

private:
    struct Piece {
        Clock::time_point due;
        std::string bytes;
    };

    void write_loop()
    {
        for (;;) {
            Piece piece;
            {
                std::unique_lock<std::mutex> hold(mutex_);
                ready_.wait(hold, [this] { return !queue_.empty(); });
                piece = std::move(queue_.front());
                queue_.pop_front();
            }
            std::this_thread::sleep_until(piece.due);
            if (piece.bytes.empty()) {
                if (budget_ == 0)
                    std::printf("cut\n"), std::fflush(stdout), shutdown(from_, SHUT_RDWR);
                shutdown(to_, budget_ == 0 ? SHUT_RDWR : SHUT_WR);
                return;
            }
            for (size_t sent = 0; sent < piece.bytes.size();) {
                ssize_t n = send(to_, piece.bytes.data() + sent, piece.bytes.size() - sent, MSG_NOSIGNAL);
                if (n < 0 && errno == EINTR)
                    continue;
                if (n <= 0) {
                    // The receiving end is gone: stop the sending end too.
                    shutdown(from_, SHUT_RDWR);
                    return;
                }
                sent += static_cast<size_t>(n);
            }
        }
    }

    int from_, to_;
    std::chrono::milliseconds delay_;
    std::atomic<uint64_t> budget_;
    std::mutex mutex_;
    std::condition_variable ready_;
    std::deque<Piece> queue_;
};

void relay(int client_fd, sockaddr_in target, std::chrono::milliseconds delay, uint64_t up_budget,
           uint64_t down_budget)
{
    Fd client(client_fd), server(socket(AF_INET, SOCK_STREAM, 0));
    if (connect(server.fd, reinterpret_cast<sockaddr *>(&target), sizeof target) != 0)
        return;
    int one = 1;
    setsockopt(client.fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    setsockopt(server.fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    Direction up(client.fd, server.fd, delay, up_budget), down(server.fd, client.fd, delay, down_budget);
    std::thread upstream([&] { up.run(); });
    down.run();
    upstream.join();
}

}  // namespace

int main(int argc, char **argv)
{
    if (argc != 6 && argc != 9) {
        std::fprintf(stderr, "usage: dpx_test_delay HOST PORT TARGET TPORT DELAY_MS [up|down LIMIT CUTS]\n");
        return 2;
    }
    std::signal(SIGPIPE, SIG_IGN);
    sockaddr_in listen_at = address_of(argv[1], argv[2]), target = address_of(argv[3], argv[4]);
    std::chrono::milliseconds delay(std::atoi(argv[5]));
    bool cut_up = argc == 9 && std::strcmp(argv[6], "up") == 0;
    uint64_t limit = argc == 9 ? std::strtoull(argv[7], nullptr, 10) : UINT64_MAX;
    int cuts_left = argc == 9 ? std::atoi(argv[8]) : 0;

    Fd listener(socket(AF_INET, SOCK_STREAM, 0));
    int one = 1;
    setsockopt(listener.fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    socklen_t len = sizeof listen_at;
    if (bind(listener.fd, reinterpret_cast<sockaddr *>(&listen_at), sizeof listen_at) != 0 ||
        listen(listener.fd, 64) != 0 || getsockname(listener.fd, reinterpret_cast<sockaddr *>(&listen_at), &len) != 0) {
        std::perror("dpx_test_delay: listen");
        return 1;
    }
    std::printf("relaying on %s:%u\n", argv[1], ntohs(listen_at.sin_port));
    std::fflush(stdout);
    for (;;) {
        int fd = accept(listener.fd, nullptr, nullptr);
        if (fd < 0 && errno != EINTR && errno != ECONNABORTED) {
            std::perror("dpx_test_delay: accept");
            return 1;
        }
        bool cutting = fd >= 0 && cuts_left-- > 0;
        if (fd >= 0)
            std::thread(relay, fd, target, delay, cutting && cut_up ? limit : UINT64_MAX,
                        cutting && !cut_up ? limit : UINT64_MAX)
                .detach();
    }
}

// A TCP relay that holds every byte for a fixed time in each direction: the
// delay of a long link, for kernels without a queueing discipline that
// delays. Accepts on HOST:PORT, connects each client to TARGET:TPORT, and
// passes what either side sends on DELAY_MS later, in order. An end's close
// reaches the other end after the bytes before it. Prints "relaying on
// HOST:PORT" when ready; runs until killed.
//
// usage: dpx_test_delay HOST PORT TARGET TPORT DELAY_MS
#include <arpa/inet.h>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <memory>
#include <mutex>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

class Fd {
public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    ~Fd()
    {
        if (fd_ >= 0)
            close(fd_);
    }
    Fd(const Fd &) = delete;
    Fd &operator=(const Fd &) = delete;
    int get() const { return fd_; }

private:
    int fd_;
};

sockaddr_in address_of(const char *host, const char *port)
{
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_port = htons(static_cast<uint16_t>(std::atoi(port)));
    if (inet_pton(AF_INET, host, &a.sin_addr) != 1) {
        std::fprintf(stderr, "dpx_test_delay: not an IPv4 address: %s\n", host);
        std::exit(2);
    }
    return a;
}

// Bytes in flight from one socket to another: a reader stamps what it
// receives, a writer sends each piece once its time has come. An empty piece
// is the sender's end.
class Direction {
public:
    Direction(int from, int to, std::chrono::milliseconds delay) : from_(from), to_(to), delay_(delay) {}

    void run()
    {
        std::thread writer([this] { write_loop(); });
        std::vector<char> piece(64 * 1024);
        for (;;) {
            ssize_t n = recv(from_, piece.data(), piece.size(), 0);
            if (n < 0 && errno == EINTR)
                continue;
            std::lock_guard<std::mutex> hold(mutex_);
            queue_.push_back({Clock::now() + delay_, std::string(piece.data(), n > 0 ? static_cast<size_t>(n) : 0)});
            ready_.notify_one();
            if (n <= 0)
                break;
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
                shutdown(to_, SHUT_WR);
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
    std::mutex mutex_;
    std::condition_variable ready_;
    std::deque<Piece> queue_;
};

void relay(std::shared_ptr<Fd> client, sockaddr_in target, std::chrono::milliseconds delay)
{
    auto server = std::make_shared<Fd>(socket(AF_INET, SOCK_STREAM, 0));
    if (connect(server->get(), reinterpret_cast<sockaddr *>(&target), sizeof target) != 0)
        return;
    int one = 1;
    setsockopt(client->get(), IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    setsockopt(server->get(), IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    Direction up(client->get(), server->get(), delay), down(server->get(), client->get(), delay);
    std::thread upstream([&] { up.run(); });
    down.run();
    upstream.join();
}

}  // namespace

int main(int argc, char **argv)
{
    if (argc != 6) {
        std::fprintf(stderr, "usage: dpx_test_delay HOST PORT TARGET TPORT DELAY_MS\n");
        return 2;
    }
    std::signal(SIGPIPE, SIG_IGN);
    sockaddr_in listen_at = address_of(argv[1], argv[2]);
    sockaddr_in target = address_of(argv[3], argv[4]);
    std::chrono::milliseconds delay(std::atoi(argv[5]));

    Fd listener(socket(AF_INET, SOCK_STREAM, 0));
    int one = 1;
    setsockopt(listener.get(), SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    socklen_t len = sizeof listen_at;
    if (bind(listener.get(), reinterpret_cast<sockaddr *>(&listen_at), sizeof listen_at) != 0 ||
        listen(listener.get(), 64) != 0 ||
        getsockname(listener.get(), reinterpret_cast<sockaddr *>(&listen_at), &len) != 0) {
        std::perror("dpx_test_delay: listen");
        return 1;
    }
    std::printf("relaying on %s:%u\n", argv[1], ntohs(listen_at.sin_port));
    std::fflush(stdout);
    for (;;) {
        int fd = accept(listener.get(), nullptr, nullptr);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            std::perror("dpx_test_delay: accept");
            return 1;
        }
        std::thread(relay, std::make_shared<Fd>(fd), target, delay).detach();
    }
}

// Running one asynchronous operation of a socket to its end or a deadline,
// on an io_context that only the calling thread runs: the clients of the
// carrier and of the broker wait so. Private to src/platform/ncs.
#ifndef NCS_DEADLINE_H
#define NCS_DEADLINE_H

#include <asio.hpp>

#include <chrono>
#include <optional>

namespace ncs {

// Starts the operation with `start(handler)` and runs `io` until it
// completes or `deadline` passes; a late operation is cut off by closing
// `socket` and ends with asio::error::timed_out.
template <class Socket, class Start>
asio::error_code run_until(asio::io_context &io, Socket &socket, std::chrono::steady_clock::time_point deadline,
                           Start &&start)
{
    std::optional<asio::error_code> result;
    start([&result](const asio::error_code &ec, auto &&...) { result = ec; });
    io.restart();
    io.run_until(deadline);
    if (result)
        return *result;
    // Closing cancels the operation; its handler still has to run.
    asio::error_code ignored;
    socket.close(ignored);
    io.restart();
    io.run();
    return asio::error::timed_out;
}

}  // namespace ncs

#endif

// The service side of the stub tests: managers that record their arguments
// and answer as the test scripts them, and a registration of dpx_transfer
// version 1 on this process's server, reached through the in-process
// carrier, whose server stubs record each request before the library's
// server stubs run it. One test at a time; not for concurrent calls.
#ifndef DPX_STUB_PEER_H
#define DPX_STUB_PEER_H

#include "foreign_body.h"

#include "dpx/dpx.h"

#include <functional>
#include <optional>
#include <vector>

namespace dpxtest {

// What the test managers saw, and how they answer.
struct ManagerScript {
    int calls = 0;
    Message seen;  // arguments on entry, the array's elements 0 .. last
    // Changes the arguments before they go back (null: back as they came).
    // Array elements go back up to max + 1 of them.
    std::function<void(Message &)> answer;
    std::optional<uint32_t> raise;  // raised once the arguments are recorded
};
ManagerScript &manager_script();

// The four test managers, by slot.
extern const dpx_transfer_v1_epv_t kTestManagers;

class StubPeer {
public:
    // Registers the recording stubs with kTestManagers (or `stubs` and
    // `managers`), resets manager_script() and binds an in-process handle.
    StubPeer();
    StubPeer(const rpc__server_stub_t *stubs, const dpx_transfer_v1_epv_t *managers);
    ~StubPeer();
    StubPeer(const StubPeer &) = delete;
    StubPeer &operator=(const StubPeer &) = delete;

    handle_t handle() const { return handle_; }

    // Requests that reached the recording stubs, the last one's body.
    int requests = 0;
    uint32_t request_opnum = 0;
    std::vector<unsigned char> request;
    // When set, the recording stubs raise it instead of answering.
    std::optional<uint32_t> raise;
    // When set, the recording stubs answer with this body, not the server stub.
    std::optional<std::vector<unsigned char>> canned_reply;

private:
    handle_t handle_ = nullptr;
};

// Calls a server stub directly with a request body written as `rep` writes
// it, offering an out_pkt with `out_max` bytes of room. The reply body is
// copied out and the reply packet given back.
struct ServerReply {
    std::vector<unsigned char> body;
    bool must_free = false;
};
ServerReply call_server_stub(rpc__server_stub_t stub, const std::vector<unsigned char> &request, Rep rep,
                             uint32_t out_max = 992);

// The status that `call` raised (exc::Fault), 0 when it returned.
uint32_t raised_status(const std::function<void()> &call);

}  // namespace dpxtest

#endif

// Texts of the statuses this system can meet: the runtime's own and those of
// the file transfer library (0xF11E00xx), which the library returns as plain
// numbers through the same status words.
#include "ncs/ncs.h"

#include <algorithm>
#include <cstring>
#include <iterator>

namespace {

struct StatusText {
    uint32_t status;
    const char *text;
};

constexpr StatusText kTexts[] = {
    {rpc__s_ok, "successful completion"},
    // Communication.
    {rpc__s_comm_failure, "communications failure: the connection to the server was lost"},
    {rpc__s_connect_refused, "connection refused: no server listens at the address"},
    {rpc__s_connection_reset, "connection reset by the peer"},
    {rpc__s_timeout, "remote call timed out"},
    {rpc__s_unknown_if, "unknown interface: the server has no registration for it"},
    {rpc__s_op_rng_error, "operation number out of range for the interface"},
    {rpc__s_protocol_error, "protocol error: malformed or unknown message"},
    {rpc__s_too_big, "message body too big for the carrier"},
    {rpc__s_server_busy, "server busy: at its limit of connections or calls"},
    {rpc__s_not_bound, "binding handle not bound to a server"},
    {rpc__s_unknown_host, "unknown host"},
    {rpc__s_invalid_handle, "invalid binding handle"},
    {rpc__s_cant_listen, "cannot listen at the address"},
    {rpc__s_tls_required, "the server speaks TLS only: set NCS_TLS_CERT, NCS_TLS_KEY and NCS_TLS_CA"},
    {rpc__s_tls_handshake, "TLS handshake failed: the peer refused this certificate, or does not speak TLS"},
    {rpc__s_tls_untrusted, "TLS: the server's certificate is not from the CA, has expired, or names another host"},
    {rpc__s_tls_settings, "TLS settings unusable: a certificate, key or CA file can't be read or used"},
    {rpc__s_tls_key_exposed, "TLS key file readable by others: refused (chmod o-rwx)"},
    // Faults.
    {rpc__s_fault_invalid_bound, "array bound out of range"},
    {rpc__s_no_memory, "out of memory in the RPC runtime"},
    {rpc__s_fault_unspec, "unspecified fault in the remote procedure"},
    {EXC1_S_FRAME_SET_RAISED, "a fault raised with the value that means no fault"},
    // Registration.
    {rpc__s_already_registered, "interface already registered"},
    {rpc__s_not_registered, "interface not registered"},
    // Location broker.
    {lb__s_not_registered, "no (further) matching entry in the location broker"},
    {lb__s_broker_unreachable, "location broker unreachable"},
    {lb__s_database_full, "location broker database full"},
    {lb__s_bad_argument, "entry or argument not accepted by the location broker"},
    {lb__s_not_permitted, "the location broker takes registrations from its own host only"},
    // Sockets and UUIDs.
    {socket__s_bad_family, "address family not supported"},
    {socket__s_name_too_long, "name too long for its buffer"},
    {socket__s_addr_too_small, "address too long for its buffer"},
    {uuid__s_bad_text, "malformed UUID text"},
    // The file transfer library.
    {0xF11E0001u, "invalid parameters"},
    {0xF11E0003u, "path too long"},
    {0xF11E0004u, "cannot read file"},
    {0xF11E0005u, "cannot write file"},
    {0xF11E0006u, "cannot set file position"},
    {0xF11E0007u, "file changed during the transfer"},
    {0xF11E0008u, "checksum mismatch"},
    {0xF11E000Au, "depot root or product name unknown"},
    {0xF11E000Bu, "out of memory for a transfer buffer"},
    {0xF11E0011u, "request declined by the peer"},
    {0xF11E0013u, "remote procedure call failed"},
    {0xF11E0014u, "peer busy"},
    {0xF11E0015u, "no hub host known"},
};

constexpr bool all_distinct()
{
    for (auto a = std::begin(kTexts); a != std::end(kTexts); ++a)
        for (auto b = a + 1; b != std::end(kTexts); ++b)
            if (a->status == b->status)
                return false;
    return true;
}
static_assert(all_distinct(), "a status has two texts");

}  // namespace

extern "C" char *error__c_text(uint32_t status, char *buffer, size_t size)
{
    if (buffer == nullptr || size == 0)
        return buffer;
    auto found = std::find_if(std::begin(kTexts), std::end(kTexts),
                              [status](const StatusText &t) { return t.status == status; });
    const char *text = found != std::end(kTexts) ? found->text : "";
    size_t length = std::min(std::strlen(text), size - 1);
    std::memcpy(buffer, text, length);
    buffer[length] = '\0';
    return buffer;
}

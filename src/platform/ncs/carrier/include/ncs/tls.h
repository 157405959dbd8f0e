// TLS on the carrier: the contexts of both ends and what the client checks
// of the server. Private to src/platform/ncs.
//
// TLS 1.3 only, mutual: both ends present a certificate signed by the CA
// the operator names, and a server refuses a client without one. The client
// takes its files from "NCS_TLS_CERT", "NCS_TLS_KEY" and "NCS_TLS_CA"; with
// none of them set it speaks plain TCP, with the CA alone TLS without a
// certificate of its own. It checks the server's certificate
// against the name by which the server's host was looked up
// (socket__from_name), or against its IP address when no name is known, as
// curl does. The server's files are given by its host (rpc__tls_server).
//
// Servers send no session tickets: a TLS 1.3 ticket arrives after the
// handshake, and an idle pooled connection must hold no unasked bytes.
#ifndef NCS_TLS_H
#define NCS_TLS_H

#include "ncs/ncs.h"

#include <asio.hpp>
#include <asio/ssl.hpp>

#include <memory>
#include <string>

namespace ncs::tls {

using Context = asio::ssl::context;

// The client's context for the environment's settings, made anew when they
// change; null with TLS off. rpc__s_tls_settings, and null, when a file
// can't be used.
std::shared_ptr<Context> client_context(uint32_t &status);

// The server's context of the files given by the host: null with TLS off.
std::shared_ptr<Context> server_context();

// One end of a TLS connection over a socket that its owner reads and
// writes. Records are made and taken in memory, so that a body of any size
// crosses the socket in as few reads and writes as over plain TCP (a stream
// that writes each 16 KiB record on its own costs a system call and an
// event-loop trip per record). Not shared between threads.
class Channel {
public:
    enum class Step { kDone, kNeedInput, kFailed };

    // A client's end checks the server's certificate against `server`.
    Channel(const std::shared_ptr<Context> &context, const asio::ip::address *server);
    ~Channel();
    Channel(const Channel &) = delete;
    Channel &operator=(const Channel &) = delete;

    // Takes the handshake as far as the bytes fed so far allow; the
    // records it makes wait in outgoing(). `ec` says why it failed.
    Step handshake(asio::error_code &ec);
    // Turns `bytes` into records, which wait in outgoing().
    void seal(asio::const_buffer bytes, asio::error_code &ec);
    // The records to send; sent(n) once n bytes of them have gone.
    asio::const_buffer outgoing();
    void sent(size_t n);
    // Bytes read from the socket.
    void feed(const void *bytes, size_t n);
    // Fills `buffer` with what the records fed so far hold: the count, 0
    // when more input is needed. End of the stream or a bad record: `ec`.
    size_t open(asio::mutable_buffer buffer, asio::error_code &ec);
    // The common name of the peer's certificate; empty without one.
    std::string peer_name() const;

private:
    asio::error_code failure(int result) const;

    std::shared_ptr<Context> context_;  // outlives ssl_
    SSL *ssl_;
    BIO *in_;   // records fed, owned by ssl_
    BIO *out_;  // records made, owned by ssl_
    size_t out_sent_ = 0;
};

// The communication status of a TLS failure.
uint32_t status_of(const asio::error_code &ec);

}  // namespace ncs::tls

#endif

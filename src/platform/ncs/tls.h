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

// Sets up `stream` to check the certificate of the server at `address`.
void expect_server(asio::ssl::stream<asio::ip::tcp::socket &> &stream, const asio::ip::address &address);

// The common name in the certificate of the peer of `stream`, after its
// handshake; empty without one.
std::string client_name(asio::ssl::stream<asio::ip::tcp::socket &> &stream);

// Notes that `host` was looked up and gave the IPv4 or IPv6 `addr`, for the
// check above.
void remember_name(const socket__addr_t &addr, const std::string &host);

// The communication status of a TLS failure.
uint32_t status_of(const asio::error_code &ec);

}  // namespace ncs::tls

#endif

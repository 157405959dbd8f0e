// What a stranger's bytes do to a daemon that speaks TLS only: the input
// goes over loopback to the server of this process, with TLS on and the
// library's managers registered. The first byte chooses how: the rest as
// the connection's first bytes (a handshake to parse, or a plain frame to
// refuse); as frames inside a TLS session of a client the CA signed; or as
// records of their own after such a handshake. The target waits until the
// server has answered or closed; the server must stay up and serve the
// next input.
#include "fuzz_common.h"

#include "ncs/server.h"

#include <arpa/inet.h>
#include <csignal>
#include <openssl/ssl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

namespace {

struct Setup {
    sockaddr_in server{};
    SSL_CTX *client = nullptr;
};

// A CA-signed pair of certificates made once with openssl, the server
// listening with them, and a client context that presents the other.
const Setup &setup()
{
    static const Setup made = [] {
        char dir[] = "/tmp/dpx-tls-fuzz.XXXXXX";
        if (mkdtemp(dir) == nullptr)
            std::abort();
        const std::string d = dir;
        const std::string script =
            "cd " + d + " && openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -keyout ca.key "
            "-out ca.pem -days 2 -subj /CN=ca && for n in server client; do openssl req -newkey ec -pkeyopt "
            "ec_paramgen_curve:P-256 -nodes -keyout $n.key -out $n.csr -subj /CN=$n && openssl x509 -req -in "
            "$n.csr -CA ca.pem -CAkey ca.key -CAcreateserial -days 2 -out $n.pem; done && chmod 600 *.key";
        if (std::system(("{ " + script + "; } >/dev/null 2>&1").c_str()) != 0)
            std::abort();
        // The server may close while this writes: that is an answer, not a crash.
        signal(SIGPIPE, SIG_IGN);
        Setup s;
        uint32_t status;
        rpc__tls_server((d + "/server.pem").c_str(), (d + "/server.key").c_str(), (d + "/ca.pem").c_str(), &status);
        socket__addr_t bound;
        uint32_t bound_len = sizeof bound;
        rpc__listen("127.0.0.1", 0, 2, &bound, &bound_len, &status);
        if (status != rpc__s_ok)
            std::abort();
        dpxfuzz::set_depot();
        dpx_agent_init();
        s.server = bound.in4;
        s.client = SSL_CTX_new(TLS_client_method());
        SSL_CTX_use_certificate_chain_file(s.client, (d + "/client.pem").c_str());
        SSL_CTX_use_PrivateKey_file(s.client, (d + "/client.key").c_str(), SSL_FILETYPE_PEM);
        return s;
    }();
    return made;
}

void drain(int fd)
{
    shutdown(fd, SHUT_WR);
    char chunk[8192];
    while (recv(fd, chunk, sizeof chunk, 0) > 0) {
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size == 0)
        return 0;
    const Setup &s = setup();
    const uint8_t mode = data[0] % 3;
    ++data;
    --size;
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    timeval limit{5, 0};
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    if (connect(fd, reinterpret_cast<const sockaddr *>(&s.server), sizeof s.server) != 0)
        std::abort();
    if (mode == 0) {
        send(fd, data, size, MSG_NOSIGNAL);
        drain(fd);
        close(fd);
        return 0;
    }
    SSL *ssl = SSL_new(s.client);
    SSL_set_fd(ssl, fd);
    if (SSL_connect(ssl) != 1)
        std::abort();  // the server refused a good client
    if (mode == 1) {
        SSL_write(ssl, data, static_cast<int>(size));
        shutdown(fd, SHUT_WR);
        char chunk[8192];
        while (SSL_read(ssl, chunk, sizeof chunk) > 0) {
        }
    } else {
        send(fd, data, size, MSG_NOSIGNAL);
        drain(fd);
    }
    SSL_free(ssl);
    close(fd);
    return 0;
}

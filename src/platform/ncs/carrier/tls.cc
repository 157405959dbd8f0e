// TLS contexts of the carrier's two ends, and the names the client checks.
#include "ncs/tls.h"

#include "ncs/guard.h"
#include "ncs/net.h"
#include "ncs/runtime.h"
#include "ncs/server.h"
#include "plt/plt1.h"
#include "trc/trc1.h"

#include <openssl/ssl.h>
#include <sys/stat.h>

#include <map>
#include <mutex>

TRC1_DEFINE_UNIT("tls");

namespace ncs::tls {

namespace {


struct Files {
    std::string cert, key, ca;
    bool operator==(const Files &) const = default;
    bool off() const { return cert.empty() && key.empty() && ca.empty(); }
};

// A context of `files` for one end, or null with `error` saying why.
// A client may go without a certificate of its own (a server that wants one
// refuses it then); a server may not.
std::shared_ptr<Context> make_context(const Files &files, bool server, std::string &error, bool &exposed)
{
    exposed = false;
    const bool own = !files.cert.empty() || !files.key.empty();
    if (files.ca.empty() || files.cert.empty() != files.key.empty() || (server && !own)) {
        error = server ? "TLS needs a certificate, its key and a CA, all three"
                       : "TLS needs a CA, and a certificate with its key or neither";
        return nullptr;
    }
    auto context = std::make_shared<Context>(server ? Context::tls_server : Context::tls_client);
    SSL_CTX *native = context->native_handle();
    SSL_CTX_set_min_proto_version(native, TLS1_3_VERSION);
    // AES-128-GCM first: the fastest of the three where the processor has AES
    // instructions, and as strong as this use needs.
    SSL_CTX_set_ciphersuites(native, "TLS_AES_128_GCM_SHA256:TLS_AES_256_GCM_SHA384:TLS_CHACHA20_POLY1305_SHA256");
    if (server)
        SSL_CTX_set_num_tickets(native, 0);
    asio::error_code ec;
    context->load_verify_file(files.ca, ec);
    if (!ec)
        context->set_verify_mode(asio::ssl::verify_peer | asio::ssl::verify_fail_if_no_peer_cert, ec);
    if (ec) {
        error = "can't use the CA file " + files.ca + ": " + ec.message();
        return nullptr;
    }
    if (!own)
        return context;
    struct stat key_stat;
    if (::stat(files.key.c_str(), &key_stat) != 0) {
        error = "can't read the key file " + files.key;
        return nullptr;
    }
    if ((key_stat.st_mode & (S_IROTH | S_IWOTH)) != 0) {
        error = "the key file " + files.key + " is readable by others (chmod o-rwx)";
        exposed = true;
        return nullptr;
    }
    std::string file = files.cert;
    context->use_certificate_chain_file(files.cert, ec);
    if (!ec) {
        file = files.key;
        context->use_private_key_file(files.key, Context::pem, ec);
    }
    if (ec) {
        error = "can't use " + file + ": " + ec.message();
        return nullptr;
    }
    return context;
}

std::mutex g_mutex;  // guards the members below
Files g_client_files;
std::shared_ptr<Context> g_client;
std::shared_ptr<Context> g_server;

}  // namespace

std::shared_ptr<Context> client_context(uint32_t &status)
{
    TRC1_FUNCTION();
    Files files{PLT1_GetEnv("NCS_TLS_CERT", ""), PLT1_GetEnv("NCS_TLS_KEY", ""), PLT1_GetEnv("NCS_TLS_CA", "")};
    status = rpc__s_ok;
    if (files.off())
        return nullptr;
    std::lock_guard<std::mutex> hold(g_mutex);
    if (g_client != nullptr && files == g_client_files)
        return g_client;
    std::string error;
    bool exposed;
    std::shared_ptr<Context> context = make_context(files, false, error, exposed);
    if (context == nullptr) {
        TRC1_ERROR_MSG("TLS settings of the client refused: %s", error.c_str());
        status = exposed ? rpc__s_tls_key_exposed : rpc__s_tls_settings;
        return nullptr;
    }
    g_client_files = files;
    g_client = context;
    return context;
}

std::shared_ptr<Context> server_context()
{
    std::lock_guard<std::mutex> hold(g_mutex);
    return g_server;
}

Channel::Channel(const std::shared_ptr<Context> &context, const asio::ip::address *server)
    : context_(context), ssl_(SSL_new(context->native_handle())), in_(BIO_new(BIO_s_mem())),
      out_(BIO_new(BIO_s_mem()))
{
    if (ssl_ == nullptr || in_ == nullptr || out_ == nullptr) {
        BIO_free(in_);
        BIO_free(out_);
        SSL_free(ssl_);
        throw std::bad_alloc();
    }
    // An empty input is "more to come", not the end.
    BIO_set_mem_eof_return(in_, -1);
    SSL_set_bio(ssl_, in_, out_);
    if (server == nullptr) {
        SSL_set_accept_state(ssl_);
        return;
    }
    SSL_set_connect_state(ssl_);
    socket__addr_t addr;
    net::address_of(asio::ip::tcp::endpoint(*server, 0), addr);
    std::string name = host_name_of(addr);
    if (name.empty())
        name = server->to_string();
    asio::error_code literal;
    asio::ip::make_address(name, literal);
    if (literal) {
        SSL_set_tlsext_host_name(ssl_, name.c_str());
        SSL_set1_host(ssl_, name.c_str());
    } else {
        X509_VERIFY_PARAM_set1_ip_asc(SSL_get0_param(ssl_), name.c_str());
    }
}

Channel::~Channel()
{
    SSL_free(ssl_);
}

asio::error_code Channel::failure(int result) const
{
    const int kind = SSL_get_error(ssl_, result);
    if (kind == SSL_ERROR_ZERO_RETURN)
        return asio::error::eof;
    const unsigned long error = ERR_get_error();
    ERR_clear_error();
    if (error == 0)
        return asio::error::connection_reset;
    return asio::error_code(static_cast<int>(error), asio::error::get_ssl_category());
}

Channel::Step Channel::handshake(asio::error_code &ec)
{
    const int result = SSL_do_handshake(ssl_);
    if (result == 1)
        return Step::kDone;
    const int kind = SSL_get_error(ssl_, result);
    if (kind == SSL_ERROR_WANT_READ || kind == SSL_ERROR_WANT_WRITE)
        return Step::kNeedInput;
    ec = failure(result);
    return Step::kFailed;
}

void Channel::seal(asio::const_buffer bytes, asio::error_code &ec)
{
    size_t written = 0;
    if (bytes.size() > 0 && SSL_write_ex(ssl_, bytes.data(), bytes.size(), &written) != 1)
        ec = failure(0);
}

asio::const_buffer Channel::outgoing()
{
    char *data = nullptr;
    const long size = BIO_get_mem_data(out_, &data);
    return asio::buffer(data + out_sent_, static_cast<size_t>(size) - out_sent_);
}

void Channel::sent(size_t n)
{
    out_sent_ += n;
    if (out_sent_ == static_cast<size_t>(BIO_ctrl_pending(out_))) {
        BIO_reset(out_);
        out_sent_ = 0;
    }
}

void Channel::feed(const void *bytes, size_t n)
{
    if (n > 0)
        BIO_write(in_, bytes, static_cast<int>(n));
}

size_t Channel::open(asio::mutable_buffer buffer, asio::error_code &ec)
{
    auto *at = static_cast<unsigned char *>(buffer.data());
    size_t total = 0;
    while (total < buffer.size()) {
        size_t got = 0;
        if (SSL_read_ex(ssl_, at + total, buffer.size() - total, &got) != 1) {
            // A failure after some bytes comes back with the next call.
            if (total == 0 && SSL_get_error(ssl_, 0) != SSL_ERROR_WANT_READ)
                ec = failure(0);
            break;
        }
        total += got;
    }
    return total;
}

std::string Channel::peer_name() const
{
    X509 *certificate = SSL_get1_peer_certificate(ssl_);
    if (certificate == nullptr)
        return "";
    char name[256] = "";
    X509_NAME_get_text_by_NID(X509_get_subject_name(certificate), NID_commonName, name, sizeof name);
    X509_free(certificate);
    return name;
}


uint32_t status_of(const asio::error_code &ec)
{
    if (ec.category() == asio::error::get_ssl_category() &&
        ERR_GET_REASON(static_cast<unsigned long>(ec.value())) == SSL_R_CERTIFICATE_VERIFY_FAILED)
        return rpc__s_tls_untrusted;
    return rpc__s_tls_handshake;
}

}  // namespace ncs::tls

extern "C" {

void rpc__tls_server(const char *cert, const char *key, const char *ca, uint32_t *status)
{
    TRC1_FUNCTION();
    ncs::guarded(status, rpc__s_tls_settings, [&] {
        ncs::tls::Files files{cert != nullptr ? cert : "", key != nullptr ? key : "", ca != nullptr ? ca : ""};
        std::shared_ptr<ncs::tls::Context> context;
        std::string error;
        bool exposed = false;
        if (!files.off() && (context = ncs::tls::make_context(files, true, error, exposed)) == nullptr) {
            TRC1_ERROR_MSG("TLS settings of the server refused: %s", error.c_str());
            return exposed ? rpc__s_tls_key_exposed : rpc__s_tls_settings;
        }
        std::lock_guard<std::mutex> hold(ncs::tls::g_mutex);
        ncs::tls::g_server = std::move(context);
        return rpc__s_ok;
    });
}

}  // extern "C"

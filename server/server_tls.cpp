#include "server/server_tls.h"

#include <openssl/x509v3.h>

namespace
{

struct x509_deleter {
    void operator()(X509 *certificate) const { X509_free(certificate); }
};
using x509 = std::unique_ptr<X509, x509_deleter>;

x509 peer_certificate(const SSL *session)
{
    return x509{session != nullptr ? SSL_get_peer_certificate(session) : nullptr};
}

} // namespace

bool tls_endpoint::load(const std::string &cert, const std::string &key, const std::string &ca, std::string &why)
{
    tls_context context{SSL_CTX_new(TLS_server_method())};
    if (!context) {
        why = "cannot begin with TLS: " + tls_last_error("no reason given");
        return false;
    }
    SSL_CTX_set_verify(context.get(), SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT, nullptr);
    SSL_CTX_set_min_proto_version(context.get(), TLS1_2_VERSION);
    /* Thousands of callers say nothing most of the time, and none comes back soon enough for a session to be kept. The
     * chain that we show is the file's: to find one for every caller is a sixth of a handshake. */
    SSL_CTX_set_mode(context.get(), SSL_MODE_RELEASE_BUFFERS | SSL_MODE_ENABLE_PARTIAL_WRITE |
                                        SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER | SSL_MODE_NO_AUTO_CHAIN);
    SSL_CTX_set_read_ahead(context.get(), 1); /* a record with one call */
    SSL_CTX_set_session_cache_mode(context.get(), SSL_SESS_CACHE_OFF);
    SSL_CTX_set_num_tickets(context.get(), 0);
    SSL_CTX_set_options(context.get(), SSL_OP_NO_RENEGOTIATION);
    if (SSL_CTX_use_certificate_chain_file(context.get(), cert.c_str()) != 1)
        why = "cannot use the certificate " + cert;
    else if (SSL_CTX_use_PrivateKey_file(context.get(), key.c_str(), SSL_FILETYPE_PEM) != 1 ||
             SSL_CTX_check_private_key(context.get()) != 1)
        why = "cannot use the key " + key;
    else if (SSL_CTX_load_verify_locations(context.get(), ca.c_str(), nullptr) != 1)
        why = "cannot use the CA certificate " + ca;
    else {
        context_ = std::move(context);
        return true;
    }
    why += ": " + tls_last_error("no reason given");
    return false;
}

ssl_session tls_endpoint::session() const
{
    ssl_session session{SSL_new(context_.get())};
    if (session)
        SSL_set_accept_state(session.get());
    return session;
}

int tls_endpoint::days_left() const
{
    int days = 0;
    int seconds = 0;
    ASN1_TIME_diff(&days, &seconds, nullptr, X509_get0_notAfter(SSL_CTX_get0_certificate(context_.get())));
    return days;
}

std::string peer_name(const SSL *session)
{
    const x509 certificate = peer_certificate(session);
    char name[256];
    const int len = certificate ? X509_NAME_get_text_by_NID(X509_get_subject_name(certificate.get()), NID_commonName,
                                                            name, sizeof name)
                                : 0;
    return len > 0 ? std::string(name, static_cast<std::size_t>(len)) : "";
}

std::string peer_fingerprint(const SSL *session)
{
    const x509 certificate = peer_certificate(session);
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned len = 0;
    if (!certificate || X509_digest(certificate.get(), EVP_sha256(), digest, &len) != 1)
        return "";
    return {reinterpret_cast<const char *>(digest), len};
}

bool peer_is_named(const SSL *session, const std::string &name)
{
    const x509 certificate = peer_certificate(session);
    return certificate &&
           (peer_name(session) == name ||
            X509_check_host(certificate.get(), name.data(), name.size(),
                            X509_CHECK_FLAG_NO_WILDCARDS | X509_CHECK_FLAG_NEVER_CHECK_SUBJECT, nullptr) == 1);
}

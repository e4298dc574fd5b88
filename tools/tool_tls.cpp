#include "tools/tool_tls.h"

#include <cerrno>
#include <openssl/err.h>
#include <openssl/x509v3.h>

namespace
{

/* Why there is no session with a caller. */
std::string handshake_error(const SSL *session)
{
    if (const long verified = SSL_get_verify_result(session); verified != X509_V_OK)
        return std::string("its certificate is not accepted: ") + X509_verify_cert_error_string(verified) +
               ". Is it signed by --ca?";
    const int reason = ERR_GET_REASON(ERR_peek_last_error());
    std::string text = "TLS handshake failed: " + tls_last_error("the peer has hung up");
    if (reason == SSL_R_WRONG_VERSION_NUMBER || reason == SSL_R_HTTP_REQUEST)
        text += ". It does not seem to speak TLS; one without is served with --plain";
    return text;
}

/* A context that demands the other side's certificate. */
tls_context make_context(const SSL_METHOD *method, const std::string &cert, const std::string &key,
                         const std::string &ca, std::string &why)
{
    tls_context context{SSL_CTX_new(method)};
    if (!context) {
        why = "cannot begin with TLS: " + tls_last_error("the peer has hung up");
        return nullptr;
    }
    SSL_CTX_set_verify(context.get(), SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT, nullptr);
    SSL_CTX_set_min_proto_version(context.get(), TLS1_2_VERSION);
    if (SSL_CTX_use_certificate_chain_file(context.get(), cert.c_str()) != 1)
        why = "cannot use the certificate " + cert;
    else if (SSL_CTX_use_PrivateKey_file(context.get(), key.c_str(), SSL_FILETYPE_PEM) != 1 ||
             SSL_CTX_check_private_key(context.get()) != 1)
        why = "cannot use the key " + key;
    else if (SSL_CTX_load_verify_locations(context.get(), ca.c_str(), nullptr) != 1)
        why = "cannot use the CA certificate " + ca;
    else
        return context;
    why += ": " + tls_last_error("the peer has hung up");
    return nullptr;
}

/* Shakes hands by the library's own procedure for one side. */
tls_session shake_hands(tls_session session, int fd, int (*step)(SSL *), tool_clock::time_point end, std::string &why)
{
    if (!session || SSL_set_fd(session.get(), fd) != 1) {
        why = "TLS handshake failed: " + tls_last_error("the peer has hung up");
        return nullptr;
    }
    for (;;) {
        ERR_clear_error();
        errno = 0;
        short wanted = 0;
        if (tool_tls_result(session.get(), step(session.get()), wanted) > 0)
            return session;
        pollfd entry{fd, wanted, 0};
        if (wanted == 0)
            why = handshake_error(session.get());
        else if (const tool_wait event = tool_wait_for({&entry, 1}, end); event != tool_wait::ready)
            why = event == tool_wait::interrupted
                      ? "interrupted"
                      : "TLS handshake failed: it did not go on for the time of --connect-timeout";
        else
            continue;
        return nullptr;
    }
}

} // namespace

tls_context tool_tls_client(const std::string &cert, const std::string &key, const std::string &ca, std::string &why)
{
    return make_context(TLS_client_method(), cert, key, ca, why);
}

tls_context tool_tls_server(const std::string &cert, const std::string &key, const std::string &ca, std::string &why)
{
    return make_context(TLS_server_method(), cert, key, ca, why);
}

tls_session tool_tls_connect(SSL_CTX *context, int fd, const std::string &host, tool_clock::time_point end,
                             std::string &why)
{
    tls_session session{SSL_new(context)};
    if (session && X509_VERIFY_PARAM_set1_ip_asc(SSL_get0_param(session.get()), host.c_str()) != 1)
        SSL_set1_host(session.get(), host.c_str());
    return shake_hands(std::move(session), fd, SSL_connect, end, why);
}

tls_session tool_tls_accept(SSL_CTX *context, int fd, tool_clock::time_point end, std::string &why)
{
    return shake_hands(tls_session{SSL_new(context)}, fd, SSL_accept, end, why);
}

ssize_t tool_tls_result(SSL *session, int result, short &wanted)
{
    wanted = 0;
    if (result > 0)
        return result;
    const int error = SSL_get_error(session, result);
    if (error == SSL_ERROR_ZERO_RETURN)
        return 0;
    if (error == SSL_ERROR_WANT_READ)
        wanted = POLLIN;
    else if (error == SSL_ERROR_WANT_WRITE)
        wanted = POLLOUT;
    errno = wanted != 0 ? EAGAIN : errno != 0 ? errno : ECONNRESET;
    return -1;
}

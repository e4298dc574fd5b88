#include "tools/tool_tls.h"

#include <cerrno>
#include <openssl/err.h>

namespace
{

/* What the library found wrong first. */
std::string first_error()
{
    char text[256] = "the peer has hung up";
    if (const unsigned long error = ERR_get_error(); error != 0)
        ERR_error_string_n(error, text, sizeof text);
    ERR_clear_error();
    return text;
}

} // namespace

tls_context tool_tls_server(const std::string &cert, const std::string &key, const std::string &ca, std::string &why)
{
    tls_context context{SSL_CTX_new(TLS_server_method())};
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
    why += ": " + first_error();
    return nullptr;
}

tls_session tool_tls_accept(SSL_CTX *context, int fd, tool_clock::time_point end, std::string &why)
{
    tls_session session{SSL_new(context)};
    SSL_set_fd(session.get(), fd);
    for (;;) {
        short wanted = 0;
        if (tool_tls_result(session.get(), SSL_accept(session.get()), wanted) > 0)
            return session;
        pollfd entry{fd, wanted, 0};
        if (wanted == 0)
            why = "TLS handshake failed: " + first_error();
        else if (const tool_wait event = tool_wait_for({&entry, 1}, end); event != tool_wait::ready)
            why = event == tool_wait::interrupted ? "interrupted" : "TLS handshake failed: the time has come";
        else
            continue;
        return nullptr;
    }
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

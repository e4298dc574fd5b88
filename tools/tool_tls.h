/* TLS: the tool's, which shows an operator's certificate to a log server. */
#ifndef TOOLS_TOOL_TLS_H
#define TOOLS_TOOL_TLS_H

#include "tools/tls_context.h"
#include "tools/tool_wait.h"

#include <memory>
#include <openssl/ssl.h>
#include <string>
#include <sys/types.h>

struct tls_session_deleter {
    void operator()(SSL *session) const
    {
        SSL_shutdown(session); /* says good-bye, as far as the socket takes it at once */
        SSL_free(session);
    }
};

using tls_session = std::unique_ptr<SSL, tls_session_deleter>;

/* A context from PEM files: our certificate and key, and the certificate that the other side's must be signed by. None,
 * and why, when they cannot be used. */
tls_context tool_tls_client(const std::string &cert, const std::string &key, const std::string &ca, std::string &why);
tls_context tool_tls_server(const std::string &cert, const std::string &key, const std::string &ca, std::string &why);

/* Shakes hands on a connected, non-blocking socket until `end`: with a server, whose certificate must be for `host`, or
 * with a client. None, and why, when that fails. */
tls_session tool_tls_connect(SSL_CTX *context, int fd, const std::string &host, tool_clock::time_point end,
                             std::string &why);
tls_session tool_tls_accept(SSL_CTX *context, int fd, tool_clock::time_point end, std::string &why);

/* A result as recv() and send() have it: bytes, 0 at the end, -1 with errno, EAGAIN when the socket is to be waited
 * for, for `wanted`. */
ssize_t tool_tls_result(SSL *session, int result, short &wanted);

#endif

/* What every use of TLS has in common here: who frees a context, and what the library found wrong. */
#ifndef TOOLS_TLS_CONTEXT_H
#define TOOLS_TLS_CONTEXT_H

#include <memory>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <string>

struct tls_context_deleter {
    void operator()(SSL_CTX *context) const { SSL_CTX_free(context); }
};
using tls_context = std::unique_ptr<SSL_CTX, tls_context_deleter>;

/* What the library found wrong in this thread, or `otherwise` when it has nothing to say; it forgets it. */
inline std::string tls_last_error(const char *otherwise)
{
    const char *const reason = ERR_reason_error_string(ERR_peek_last_error());
    ERR_clear_error();
    return reason != nullptr ? reason : otherwise;
}

#endif

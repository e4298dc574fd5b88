#include "client/log_tls.h"

#include "client/tls_library.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_lock.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <new>
#include <poll.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr char kCaFile[] = "/usr/vex/vex_conf/logcert/logca_cert.crt";
constexpr char kCertFile[] = "/usr/vex/vex_conf/logcert/logclient_cert.crt";
constexpr char kKeyFile[] = "/usr/vex/vex_conf/logcert/logkey.pem";

using clock_type = std::chrono::steady_clock;

constexpr auto kHandshakeMax = std::chrono::seconds(30);
constexpr auto kForEver = clock_type::time_point::max();
/* What a call waits for, another thread's call on the session may have taken off the socket: a wait for the direction
 * that is not the call's own is looked at again. */
constexpr auto kLookAgain = std::chrono::milliseconds(100);

/* Guards the pointer to the context, which is given up while a data link may be opening a session. */
log_mutex g_context_lock;
SSL_CTX *g_ssl_ctx LOG_GUARDED_BY(g_context_lock);

/* What a session carries with it. */
struct session_extra {
    log_mutex lock; /* held across one library call */
};

session_extra *extra_of(SSL *session)
{
    return static_cast<session_extra *>(g_tls.SSL_get_ex_data(session, 0));
}

void free_session(SSL *session)
{
    session_extra *const extra = extra_of(session);
    g_tls.SSL_free(session);
    delete extra;
}

/* Waits until the socket is ready, or the time has come: then false. */
bool wait_for(int fd, short events, clock_type::time_point end)
{
    pollfd entry{fd, events, 0};
    int ms = -1;
    if (end != kForEver) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - clock_type::now()).count();
        ms = static_cast<int>(std::clamp<decltype(left)>(left, 0, INT_MAX));
    }
    return poll(&entry, 1, ms) != 0;
}

enum class session_direction {
    none, /* a handshake: whatever it wants, nobody else is at it */
    reads,
    writes,
};

/* Runs a library call on the session until it has a result above 0, the session has ended or the time has come. */
template <typename Call>
int run(SSL *session, session_direction direction, clock_type::time_point end, const Call &call)
{
    for (;;) {
        int result = 0;
        int wanted = SSL_ERROR_NONE;
        {
            const log_lock hold{extra_of(session)->lock};
            g_tls.ERR_clear_error();
            errno = 0;
            result = call();
            wanted = result > 0 ? SSL_ERROR_NONE : g_tls.SSL_get_error(session, result);
        }
        if (result > 0)
            return result;
        if (wanted != SSL_ERROR_WANT_READ && wanted != SSL_ERROR_WANT_WRITE)
            return wanted == SSL_ERROR_ZERO_RETURN ? 0 : -1;
        const bool to_read = wanted == SSL_ERROR_WANT_READ;
        const bool crossed = direction == (to_read ? session_direction::writes : session_direction::reads);
        const bool ready = wait_for(g_tls.SSL_get_fd(session), to_read ? POLLIN : POLLOUT,
                                    crossed ? clock_type::now() + kLookAgain : end);
        if (!ready && !crossed) {
            errno = ETIMEDOUT;
            return -1;
        }
    }
}

/* As SSL_read(), but it waits: 0 at the session's end, -1 on failure. */
int read_session(SSL *session, void *bytes, int len)
{
    const int n = run(session, session_direction::reads, kForEver, [&] { return g_tls.SSL_read(session, bytes, len); });
    if (n == -1 && (errno == 0 || errno == EINTR))
        errno = EPROTO; /* it is the session that has failed, not the read */
    return n;
}

/* As SSL_write(), but it waits. */
int write_session(SSL *session, const void *bytes, int len)
{
    return run(session, session_direction::writes, kForEver, [&] { return g_tls.SSL_write(session, bytes, len); });
}

/* Logs a name of the certificate as one line. */
void log_name(const char *what, const X509_NAME *name)
{
    char *const line = g_tls.X509_NAME_oneline(name, nullptr, 0);
    LOG_NOTE("[%s]: certification %s is '%s'", "log_cert_check", what, line != nullptr ? line : "");
    g_tls.CRYPTO_free(line, __FILE__, __LINE__);
}

/* Loads the device's certificates; false, after the log line of what is wrong. */
bool load_files(SSL_CTX *context)
{
    if (g_tls.SSL_CTX_load_verify_locations(context, kCaFile, nullptr) != 1) {
        LOG_FAULT("Failed to load CA file %s", kCaFile);
        return false;
    }
    if (g_tls.SSL_CTX_set_default_verify_paths(context) != 1) {
        LOG_FAULT("Call to SSL_CTX_set_default_verify_paths failed");
        return false;
    }
    if (g_tls.SSL_CTX_use_certificate_file(context, kCertFile, SSL_FILETYPE_PEM) <= 0) {
        LOG_FAULT("Failed to load user certificate file %s", kCertFile);
    } else if (g_tls.SSL_CTX_use_PrivateKey_file(context, kKeyFile, SSL_FILETYPE_PEM) <= 0) {
        LOG_FAULT("[ERROR]use private key fail!");
    } else if (g_tls.SSL_CTX_check_private_key(context) == 0) {
        LOG_FAULT("SSL_CTX_check_private_key failed");
    } else {
        return true;
    }
    g_tls.ERR_print_errors_fp(stdout);
    return false;
}

/* A session that nobody uses yet; null without a context or memory. */
SSL *new_session()
{
    std::unique_ptr<session_extra> extra{new (std::nothrow) session_extra};
    SSL *session = nullptr;
    {
        const log_lock hold{g_context_lock};
        if (g_ssl_ctx != nullptr && extra)
            session = g_tls.SSL_new(g_ssl_ctx);
    }
    if (session != nullptr)
        g_tls.SSL_set_ex_data(session, 0, extra.release());
    return session;
}

/* A session on the socket that has shaken hands with the server; null when it has not (logged). */
SSL *shake_hands(int fd)
{
    SSL *const session = new_session();
    bool done = false;
    errno = 0;
    if (session != nullptr) {
        fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
        g_tls.SSL_set_fd(session, fd);
        done = run(session, session_direction::none, clock_type::now() + kHandshakeMax,
                   [session] { return g_tls.SSL_connect(session); }) == 1;
    }
    if (done)
        return session;
    const int error = errno;
    if (session != nullptr) {
        g_tls.SSL_shutdown(session);
        free_session(session);
    }
    LOG_FAULT("%s: SSL connect error %s errno: %d\n", "vex_open_ssl", std::strerror(error), error);
    return nullptr;
}

} // namespace

log_tls_result log_tls_start()
{
    g_daemon.use_ssl = 1;
    g_daemon.ssl_read = read_session;
    g_daemon.ssl_write = write_session;
    g_daemon.close_ssl = vex_close_ssl;
    if (!tls_library_load())
        return log_tls_result::no_context;
    g_tls.OPENSSL_init_ssl(0, nullptr);
    g_tls.OPENSSL_init_crypto(OPENSSL_INIT_ADD_ALL_CIPHERS | OPENSSL_INIT_ADD_ALL_DIGESTS, nullptr);
    g_tls.OPENSSL_init_ssl(OPENSSL_INIT_LOAD_SSL_STRINGS | OPENSSL_INIT_LOAD_CRYPTO_STRINGS, nullptr);
    SSL_CTX *const context = g_tls.SSL_CTX_new(g_tls.TLS_client_method());
    if (context == nullptr) {
        LOG_FAULT("**SOCKET: Create SSL_CTX error...\n");
        g_tls.ERR_print_errors_fp(stderr);
        return log_tls_result::no_context;
    }
    g_tls.SSL_CTX_set_verify(context, SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT, nullptr);
    if (!load_files(context)) {
        g_tls.SSL_CTX_free(context);
        return log_tls_result::bad_files;
    }
    const log_lock hold{g_context_lock};
    g_ssl_ctx = context;
    return log_tls_result::ready;
}

int vex_open_ssl(int fd, SSL **session)
{
    if (g_daemon.use_ssl != 1)
        return 1;
    *session = shake_hands(fd);
    if (*session == nullptr)
        return 0;
    LOG_NOTE("Connected with %s encryption!!!", g_tls.SSL_CIPHER_get_name(g_tls.SSL_get_current_cipher(*session)));
    if (log_cert_check(*session) == 0) {
        g_tls.SSL_shutdown(*session);
        free_session(*session);
        *session = nullptr;
        return 0;
    }
    LOG_NOTE("very good ,log_server check ok \n");
    return 1;
}

int log_cert_check(SSL *session)
{
    const long result = g_tls.SSL_get_verify_result(session);
    const int code = static_cast<int>(result);
    LOG_NOTE("[%s]:certificate verify return code %d", __func__, code);
    if (result != X509_V_OK) {
        if (result == X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT || result == X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN)
            LOG_FAULT("[%s]:Self Signed Certificate doesn't verify (error %d)", __func__, code);
        LOG_FAULT("[%s]:Certificate doesn't verify (error %d)", __func__, code);
        return 0;
    }
    LOG_FAULT("[%s]:certificate ok", __func__);
    const std::unique_ptr<X509, decltype(g_tls.X509_free)> certificate{g_tls.SSL_get_peer_certificate(session),
                                                                       g_tls.X509_free};
    if (!certificate) {
        LOG_FAULT("[%s]: NO certification info!!!!", __func__);
        return 0;
    }
    char peer_name[256] = {};
    X509_NAME *const subject = g_tls.X509_get_subject_name(certificate.get());
    g_tls.X509_NAME_get_text_by_NID(subject, NID_commonName, peer_name, sizeof peer_name);
    LOG_NOTE("[%s]: peerCN is '%s'", __func__, peer_name);
    log_name("subject", subject);
    log_name("issuer", g_tls.X509_get_issuer_name(certificate.get()));
    return 1;
}

void vex_close_ssl(SSL *session, int free_context)
{
    if (g_daemon.use_ssl != 1)
        return;
    if (session != nullptr) {
        g_tls.SSL_shutdown(session);
        free_session(session);
        LOG_NOTE("**SOCKET: server_ssl free return\n");
    }
    if (free_context != 1)
        return;
    SSL_CTX *context = nullptr;
    {
        const log_lock hold{g_context_lock};
        std::swap(context, g_ssl_ctx);
    }
    if (context == nullptr)
        return;
    g_tls.SSL_CTX_free(context);
    LOG_NOTE("**SOCKET: SSL_CTX_free return\n");
}

#include "client/log_tls.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_tls_library.h"
#include "core/log_tools.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr char kCaFile[] = "/usr/vex/vex_conf/logcert/logca_cert.crt";
constexpr char kCertFile[] = "/usr/vex/vex_conf/logcert/logclient_cert.crt";
constexpr char kKeyFile[] = "/usr/vex/vex_conf/logcert/logkey.pem";

constexpr char kCiphers[] = "ECDHE+AESGCM:ECDHE+CHACHA20:AESGCM:CHACHA20:!aNULL:!PSK:!SRP"; /* AEAD, all */

constexpr auto kHandshakeMax = std::chrono::seconds(30);

/* Logs a name of the certificate as one line. */
void log_name(const char *what, const X509_NAME *name)
{
    char *const line = g_tls.X509_NAME_oneline(name, nullptr, 0);
    LOG_NOTE("[%s]: certification %s is '%s'", "log_cert_check", what, line != nullptr ? line : "");
    g_tls.CRYPTO_free(line, "log_tls.cpp", __LINE__);
}

/* The name or address that the server's certificate must be for; empty: any. */
struct server_name {
    char text[256] = {}; /* names have up to 253 characters */
};

server_name read_server_name()
{
    server_name name;
    vex_get_nv_item("log_server_name", name.text, sizeof name.text);
    return name;
}

/* The server's certificate was refused in the handshake: why. */
void log_refusal(long verified)
{
    LOG_FAULT("%s: the server's certificate is refused: %s\n", "vex_open_ssl",
              g_tls.X509_verify_cert_error_string(verified));
    if (verified == X509_V_ERR_HOSTNAME_MISMATCH || verified == X509_V_ERR_IP_ADDRESS_MISMATCH)
        LOG_FAULT("%s: log_server_name demands a certificate for '%s'\n", "vex_open_ssl", read_server_name().text);
}

/* What no session does without, whatever the library's own configuration says; false, after the log line of what cannot
 * be had. */
bool set_demands(SSL_CTX *context)
{
    g_tls.SSL_CTX_set_verify(context, SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT, nullptr);
    /* A TLS 1.2 server may not renegotiate: a write of one thread would have to take part in what another reads. */
    g_tls.SSL_CTX_set_options(context, SSL_OP_NO_RENEGOTIATION);
    /* A read comes back after each record: else it would answer requests for new keys, without bound, for as long as they
     * come. */
    g_tls.SSL_CTX_ctrl(context, SSL_CTRL_CLEAR_MODE, SSL_MODE_AUTO_RETRY, nullptr);
    if (g_tls.SSL_CTX_ctrl(context, SSL_CTRL_SET_MIN_PROTO_VERSION, TLS1_2_VERSION, nullptr) != 1 ||
        g_tls.SSL_CTX_set_cipher_list(context, kCiphers) != 1) {
        LOG_FAULT("the TLS library has no TLS 1.2 with %s\n", kCiphers);
        return false;
    }
    const server_name name = read_server_name();
    X509_VERIFY_PARAM *const param = g_tls.SSL_CTX_get0_param(context);
    const bool demanded = *name.text == '\0' || g_tls.X509_VERIFY_PARAM_set1_ip_asc(param, name.text) == 1 ||
                          g_tls.X509_VERIFY_PARAM_set1_host(param, name.text, 0) == 1;
    g_tls.ERR_clear_error(); /* a name is no IP address */
    if (demanded)
        return true;
    LOG_FAULT("log_server_name cannot be demanded of a certificate: '%s'\n", name.text);
    return false;
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

/* A session on the socket; null without a context or memory. */
std::unique_ptr<log_tls_session> new_session(int fd, int stop_fd)
{
    const log_lock hold{g_daemon.ssl_ctx_lock};
    return g_daemon.ssl_ctx != nullptr ? log_tls_session::open(g_daemon.ssl_ctx, fd, stop_fd) : nullptr;
}

/* A session on the socket that has shaken hands with the server; null when it has not (logged). */
std::unique_ptr<log_tls_session> shake_hands(int fd, int stop_fd)
{
    errno = 0;
    std::unique_ptr<log_tls_session> session = new_session(fd, stop_fd);
    if (session && session->connect(log_clock::now() + kHandshakeMax))
        return session;
    const int error = errno;
    const long verified = session ? g_tls.SSL_get_verify_result(session->handle()) : X509_V_OK;
    if (session)
        session->close(log_clock::now());
    LOG_FAULT("%s: SSL connect error %s errno: %d\n", "vex_open_ssl", std::strerror(error), error);
    if (verified != X509_V_OK)
        log_refusal(verified);
    return nullptr;
}

} // namespace

log_tls_result log_tls_start()
{
    g_daemon.use_ssl = 1;
    std::string why;
    if (!log_tls_library_load(why)) {
        LOG_FAULT("%s", why.c_str());
        return log_tls_result::no_context;
    }
    g_tls.OPENSSL_init_ssl(0, nullptr);
    g_tls.OPENSSL_init_crypto(OPENSSL_INIT_ADD_ALL_CIPHERS | OPENSSL_INIT_ADD_ALL_DIGESTS, nullptr);
    g_tls.OPENSSL_init_ssl(OPENSSL_INIT_LOAD_SSL_STRINGS | OPENSSL_INIT_LOAD_CRYPTO_STRINGS, nullptr);
    SSL_CTX *const context = g_tls.SSL_CTX_new(g_tls.TLS_client_method());
    if (context == nullptr) {
        LOG_FAULT("**SOCKET: Create SSL_CTX error...\n");
        g_tls.ERR_print_errors_fp(stderr);
        return log_tls_result::no_context;
    }
    if (!set_demands(context)) {
        g_tls.SSL_CTX_free(context);
        return log_tls_result::no_context;
    }
    if (!load_files(context)) {
        g_tls.SSL_CTX_free(context);
        return log_tls_result::bad_files;
    }
    log_tls_library_settle();
    const log_lock hold{g_daemon.ssl_ctx_lock};
    g_daemon.ssl_ctx = context;
    return log_tls_result::ready;
}

int vex_open_ssl(int fd, std::unique_ptr<log_tls_session> *session, int stop_fd)
{
    if (g_daemon.use_ssl != 1)
        return 1;
    *session = shake_hands(fd, stop_fd);
    if (*session == nullptr)
        return 0;
    const SSL_CIPHER *const cipher = g_tls.SSL_get_current_cipher((*session)->handle());
    LOG_NOTE("Connected with %s encryption!!!", g_tls.SSL_CIPHER_get_name(cipher));
    if (log_cert_check(**session) == 0) {
        (*session)->close(log_clock::now());
        session->reset();
        return 0;
    }
    LOG_NOTE("very good ,log_server check ok \n");
    return 1;
}

int log_cert_check(const log_tls_session &session)
{
    const long result = g_tls.SSL_get_verify_result(session.handle());
    const int code = static_cast<int>(result);
    LOG_NOTE("[%s]:certificate verify return code %d", __func__, code);
    if (result != X509_V_OK) {
        if (result == X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT || result == X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN)
            LOG_FAULT("[%s]:Self Signed Certificate doesn't verify (error %d)", __func__, code);
        LOG_FAULT("[%s]:Certificate doesn't verify (error %d)", __func__, code);
        return 0;
    }
    LOG_FAULT("[%s]:certificate ok", __func__);
    const std::unique_ptr<X509, decltype(g_tls.X509_free)> certificate{g_tls.SSL_get_peer_certificate(session.handle()),
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
    g_tls.ERR_clear_error(); /* a name without a common name is no failure */
    return 1;
}

void vex_close_ssl(log_tls_session *session, int free_context, log_clock::time_point end)
{
    if (g_daemon.use_ssl != 1)
        return;
    if (session != nullptr) {
        session->close(end);
        LOG_NOTE("**SOCKET: server_ssl free return\n");
    }
    if (free_context != 1)
        return;
    SSL_CTX *context = nullptr;
    {
        const log_lock hold{g_daemon.ssl_ctx_lock};
        std::swap(context, g_daemon.ssl_ctx);
    }
    if (context == nullptr)
        return;
    g_tls.SSL_CTX_free(context);
    LOG_NOTE("**SOCKET: SSL_CTX_free return\n");
}

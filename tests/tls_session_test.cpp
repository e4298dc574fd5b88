#include "client/log_tls.h"
#include "client/tls_library.h"
#include "client/tls_session.h"
#include "core/daemon_state.h"
#include "platform/unique_fd.h"
#include "tests/memory_platform.h"

#include <csignal>
#include <cstdlib>
#include <cstring>
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/x509.h>
#include <sys/socket.h>
#include <thread>
#include <vector>

/* The call of the library that always returns 0. */
static const char *g_failing = "";

extern "C" {
void *__real_dlsym(void *library, const char *name);
void *__wrap_dlsym(void *library, const char *name)
{
    int (*const fails)() = [] { return 0; };
    return std::strcmp(name, g_failing) == 0 ? reinterpret_cast<void *>(fails) : __real_dlsym(library, name);
}
}

namespace
{

constexpr std::size_t kTotal = 8 << 20; /* bytes each way */

/* A server's context, with a key and a certificate that nobody looks at. */
SSL_CTX *server_context()
{
    SSL_CTX *const context = SSL_CTX_new(TLS_server_method());
    EVP_PKEY *const key = EVP_EC_gen("P-256");
    X509 *const certificate = X509_new();
    X509_gmtime_adj(X509_getm_notBefore(certificate), 0);
    X509_gmtime_adj(X509_getm_notAfter(certificate), 3600);
    X509_set_pubkey(certificate, key);
    X509_sign(certificate, key, EVP_sha256());
    SSL_CTX_use_certificate(context, certificate);
    SSL_CTX_use_PrivateKey(context, key);
    X509_free(certificate);
    EVP_PKEY_free(key);
    return context;
}

/* The byte at a place of either stream. */
unsigned char byte_at(std::size_t at)
{
    return static_cast<unsigned char>(at * 31 + at / 251);
}

std::vector<unsigned char> bytes_from(std::size_t at, std::size_t len)
{
    std::vector<unsigned char> bytes(len);
    for (std::size_t i = 0; i < len; ++i)
        bytes[i] = byte_at(at + i);
    return bytes;
}

/* Reads by `read` until kTotal bytes were as they should be, and tells `progress` how many there are. */
template <typename Read, typename Progress> std::size_t check_stream(const Read &read, const Progress &progress)
{
    std::vector<unsigned char> piece(2000);
    for (std::size_t at = 0; at < kTotal; progress(at)) {
        const int n = read(piece.data(), static_cast<int>(piece.size()));
        for (int i = 0; i < n; ++i)
            if (piece[static_cast<std::size_t>(i)] != byte_at(at++))
                return at;
        if (n <= 0)
            return at;
    }
    return kTotal;
}

/* What the server does: it reads the one stream, writes the other a piece for each piece it reads, and again and again
 * has keys changed, its own and the peer's, while its peer's writer waits. */
std::size_t serve(SSL *session)
{
    if (SSL_accept(session) != 1)
        return 0;
    std::size_t sent = 0;
    std::size_t update_at = 0;
    return check_stream([session](void *bytes, int len) { return SSL_read(session, bytes, len); },
                        [&](std::size_t got) {
                            if (got >= update_at) {
                                SSL_key_update(session, SSL_KEY_UPDATE_REQUESTED);
                                update_at = got + kTotal / 50;
                            }
                            const std::vector<unsigned char> piece = bytes_from(sent, got - sent);
                            sent += piece.size();
                            SSL_write(session, piece.data(), static_cast<int>(piece.size()));
                        });
}

TEST(TlsSession, IsReadAndWrittenWhileKeysChange)
{
    ASSERT_TRUE(tls_library_load());
    ASSERT_TRUE(tls_session_prepare());
    SSL_CTX *const ours = SSL_CTX_new(TLS_client_method());
    SSL_CTX *const theirs = server_context();
    for (const std::size_t write_size : {std::size_t{2000}, std::size_t{51282}}) {
        int ends[2];
        ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
        const unique_fd fd{ends[0]};
        const unique_fd server_fd{ends[1]};
        const int small = 4096; /* so that the socket is full all the time */
        setsockopt(fd.get(), SOL_SOCKET, SO_SNDBUF, &small, sizeof small);
        SSL *const server_session = SSL_new(theirs);
        SSL_set_fd(server_session, server_fd.get());
        std::size_t server_got = 0;
        std::thread server([&] { server_got = serve(server_session); });

        SSL *const session = tls_session_new(ours, fd.get());
        ASSERT_TRUE(tls_session_connect(session, tls_clock::now() + std::chrono::seconds(30)));
        std::thread writer([&] {
            for (std::size_t at = 0; at < kTotal;) {
                const std::vector<unsigned char> bytes = bytes_from(at, std::min(write_size, kTotal - at));
                ASSERT_EQ(static_cast<int>(bytes.size()),
                          tls_session_write(session, bytes.data(), static_cast<int>(bytes.size())));
                at += bytes.size();
            }
        });
        EXPECT_EQ(kTotal,
                  check_stream([session](void *bytes, int len) { return tls_session_read(session, bytes, len); },
                               [](std::size_t) {}));
        writer.join();
        server.join();
        EXPECT_EQ(kTotal, server_got);
        SSL_free(server_session);
        tls_session_free(session);
    }
    SSL_CTX_free(ours);
    SSL_CTX_free(theirs);
}

/* What vex_open_ssl comes to with a server that has the right certificate; no session is left of a failure. */
int open_session(SSL **session)
{
    int ends[2];
    EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
    const unique_fd fd{ends[0]};
    const unique_fd server_fd{ends[1]};
    SSL_CTX *const context = SSL_CTX_new(TLS_server_method());
    EXPECT_EQ(1, SSL_CTX_use_certificate_file(context, "/tmp/c/server.crt", SSL_FILETYPE_PEM));
    EXPECT_EQ(1, SSL_CTX_use_PrivateKey_file(context, "/tmp/c/server.key", SSL_FILETYPE_PEM));
    SSL *const server_session = SSL_new(context);
    SSL_set_fd(server_session, server_fd.get());
    std::thread server([server_session] { SSL_accept(server_session); });
    const int result = vex_open_ssl(fd.get(), session);
    shutdown(fd.get(), SHUT_RDWR);
    server.join();
    SSL_free(server_session);
    SSL_CTX_free(context);
    return result;
}

TEST(TlsSession, IsOpenedByACertificateThatIsThereAndVerifies)
{
    std::signal(SIGPIPE, SIG_IGN); /* a server's last word may come too late */
    ASSERT_EQ(0, std::system(SOURCE_DIR "/device/certificates /tmp/c"));
    const struct {
        const char *call;
        log_tls_result result;
        const char *words;
    } starts[] = {
        {"SSL_CTX_new", log_tls_result::no_context, "**SOCKET: Create SSL_CTX error...$"},
        {"SSL_CTX_set_default_verify_paths", log_tls_result::bad_files, "Call to SSL_CTX_set_default_verify_paths"},
        {"SSL_CTX_check_private_key", log_tls_result::bad_files, "SSL_CTX_check_private_key failed"},
        {"", log_tls_result::ready, ""},
    };
    for (const auto &s : starts) {
        g_failing = s.call;
        EXPECT_EQ(s.result, log_tls_start()) << s.call;
        EXPECT_TRUE(g_platform.logged(s.words)) << s.call;
    }
    SSL *session = nullptr;
    ASSERT_EQ(1, open_session(&session));
    EXPECT_TRUE(g_platform.logged("peerCN is 'log server'")) << g_platform.log;
    vex_close_ssl(session, 0);
    const auto refused = [&session](const char *words) {
        session = reinterpret_cast<SSL *>(&session); /* anything */
        EXPECT_EQ(0, open_session(&session));
        EXPECT_EQ(nullptr, session);
        EXPECT_TRUE(g_platform.logged(words)) << g_platform.take_log();
    };
    g_tls.SSL_get_peer_certificate = [](const SSL *) -> X509 * { return nullptr; };
    refused("0 vex_log_manage [log_cert_check]: NO certification info!!!!|");
    g_tls.SSL_get_verify_result = [](const SSL *) { return 18L; };
    refused("|0 vex_log_manage [log_cert_check]:Self Signed Certificate doesn't verify (error 18)|0 vex_log_manage "
            "[log_cert_check]:Certificate doesn't verify (error 18)|");
    g_platform.take_log();
    vex_close_ssl(nullptr, 1);
    vex_close_ssl(nullptr, 1); /* it is gone */
    EXPECT_EQ("6 vex_log_manage **SOCKET: SSL_CTX_free return$|", g_platform.log);
    refused("0 vex_log_manage vex_open_ssl: SSL connect error Success errno: 0$|");
}

} // namespace

#include "client/log_tls.h"
#include "client/tls_library.h"
#include "core/daemon_state.h"
#include "platform/unique_fd.h"
#include "tests/memory_platform.h"

#include <csignal>
#include <cstdlib>
#include <cstring>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <thread>
#include <tuple>

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
    for (const auto &[call, result, words] : {
             std::tuple{"SSL_CTX_new", log_tls_result::no_context, "**SOCKET: Create SSL_CTX error...$"},
             {"SSL_CTX_set_default_verify_paths", log_tls_result::bad_files,
              "Call to SSL_CTX_set_default_verify_paths"},
             {"SSL_CTX_check_private_key", log_tls_result::bad_files, "SSL_CTX_check_private_key failed"},
             {"", log_tls_result::ready, ""},
         }) {
        g_failing = call;
        EXPECT_EQ(result, log_tls_start()) << call;
        EXPECT_TRUE(g_platform.logged(words)) << call;
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

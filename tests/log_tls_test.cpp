#include "client/log_tls.h"
#include "core/daemon_state.h"
#include "core/log_tls_library.h"
#include "platform/unique_fd.h"
#include "tests/memory_platform.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <gtest/gtest.h>
#include <string>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <thread>
#include <tuple>
#include <utility>

/* The call of the library that fails whenever it is made. */
static const char *g_failing = "";

/* What it is replaced by: calls that fail, of the right types. */
static SSL_CTX *no_context(const SSL_METHOD * /*method*/)
{
    return nullptr;
}
static int fail_with(SSL_CTX * /*context*/)
{
    return 0;
}
static int fail_check(const SSL_CTX * /*context*/)
{
    return 0;
}

extern "C" {
void *__real_dlsym(void *library, const char *name);
/* A sanitizer that is linked in calls it, too, before it is ready for anything that it watches. */
__attribute__((no_sanitize("address", "undefined"))) void *__wrap_dlsym(void *library, const char *name)
{
    if (*g_failing == '\0' || std::strcmp(name, g_failing) != 0)
        return __real_dlsym(library, name);
    if (std::strcmp(name, "SSL_CTX_new") == 0)
        return reinterpret_cast<void *>(no_context);
    return std::strcmp(name, "SSL_CTX_check_private_key") == 0 ? reinterpret_cast<void *>(fail_check)
                                                               : reinterpret_cast<void *>(fail_with);
}
}

namespace
{

/* A session of ours with a server that has the right certificate. */
struct tls_pair {
    explicit tls_pair(int stop_fd = -1)
    {
        int ends[2];
        EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
        fd.reset(ends[0]);
        server_fd.reset(ends[1]);
        EXPECT_EQ(1, SSL_CTX_use_certificate_file(context.get(), "/tmp/c/server.crt", SSL_FILETYPE_PEM));
        EXPECT_EQ(1, SSL_CTX_use_PrivateKey_file(context.get(), "/tmp/c/server.key", SSL_FILETYPE_PEM));
        server.reset(SSL_new(context.get()));
        SSL_set_fd(server.get(), server_fd.get());
        std::thread accepting([this] { SSL_accept(server.get()); });
        result = vex_open_ssl(fd.get(), &session, stop_fd);
        if (result != 1)
            shutdown(fd.get(), SHUT_RDWR);
        accepting.join();
        ERR_clear_error();
    }
    /* What the server reads next, and how that ends: SSL_ERROR_NONE while it does not. */
    std::pair<std::string, int> server_reads()
    {
        char bytes[100];
        const int n = SSL_read(server.get(), bytes, sizeof bytes);
        return {std::string(bytes, static_cast<std::size_t>(std::max(n, 0))), SSL_get_error(server.get(), n)};
    }

    using ssl_context = std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)>;
    using ssl_session = std::unique_ptr<SSL, decltype(&SSL_free)>;

    unique_fd fd;
    unique_fd server_fd;
    ssl_context context{SSL_CTX_new(TLS_server_method()), SSL_CTX_free};
    ssl_session server{nullptr, SSL_free};
    std::unique_ptr<log_tls_session> session;
    int result = -1;
};

class TlsSession : public testing::Test
{
protected:
    static void SetUpTestSuite()
    {
        std::signal(SIGPIPE, SIG_IGN); /* a server's last word may come too late */
        ASSERT_EQ(0, std::system(SOURCE_DIR "/device/certificates /tmp/c"));
    }
    void SetUp() override { g_platform = {}; }
    void TearDown() override { vex_close_ssl(nullptr, 1, {}); }
};

TEST_F(TlsSession, IsNotOpenedByALibraryThatFails)
{
    if (VEX_TLS_LINKED)
        GTEST_SKIP() << "calls of a library that is linked are not looked up";
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
}

TEST_F(TlsSession, IsOpenedByACertificateThatIsThereAndVerifies)
{
    ASSERT_EQ(log_tls_result::ready, log_tls_start());
    ASSERT_EQ(1, tls_pair().result);
    EXPECT_TRUE(g_platform.logged("peerCN is 'log server'")) << g_platform.log;
    const auto refused = [](const char *words) {
        const tls_pair pair;
        EXPECT_EQ(0, pair.result);
        EXPECT_EQ(nullptr, pair.session);
        EXPECT_TRUE(g_platform.logged(words)) << g_platform.take_log();
    };
    g_tls.SSL_get_peer_certificate = [](const SSL *) -> X509 * { return nullptr; };
    refused("0 vex_log_manage [log_cert_check]: NO certification info!!!!|");
    g_tls.SSL_get_verify_result = [](const SSL *) { return 18L; };
    refused("|0 vex_log_manage [log_cert_check]:Self Signed Certificate doesn't verify (error 18)|0 vex_log_manage "
            "[log_cert_check]:Certificate doesn't verify (error 18)|");
    g_platform.take_log();
    vex_close_ssl(nullptr, 1, {});
    vex_close_ssl(nullptr, 1, {}); /* it is gone */
    EXPECT_EQ("6 vex_log_manage **SOCKET: SSL_CTX_free return$|", g_platform.log);
    refused("0 vex_log_manage vex_open_ssl: SSL connect error Success errno: 0$|");
}

TEST_F(TlsSession, EndsWithAGoodByeOnceWhatWasWrittenIsSent)
{
    ASSERT_EQ(log_tls_result::ready, log_tls_start());
    const unique_fd stop{eventfd(0, EFD_CLOEXEC)};
    tls_pair pair(stop.get());
    ASSERT_EQ(1, pair.result);
    std::thread reader([&pair] {
        char byte = 0;
        EXPECT_EQ(0, pair.session->read(&byte, 1)) << "a read that was stopped is an end";
        vex_close_ssl(pair.session.get(), 0, log_clock::now() + std::chrono::seconds(30));
    });
    EXPECT_EQ(5, pair.session->write("bytes", 5));
    eventfd_write(stop.get(), 1);
    reader.join();
    EXPECT_EQ(-1, pair.session->write("more", 4));
    EXPECT_EQ(EPIPE, errno);
    EXPECT_EQ(std::pair(std::string("bytes"), SSL_ERROR_NONE), pair.server_reads());
    EXPECT_EQ(SSL_ERROR_ZERO_RETURN, pair.server_reads().second);
}

TEST_F(TlsSession, IsOverWithAWriteThatLosesARecordButStillReadsWhatHasArrived)
{
    ASSERT_EQ(log_tls_result::ready, log_tls_start());
    tls_pair pair;
    ASSERT_EQ(1, pair.result);
    EXPECT_EQ(8, SSL_write(pair.server.get(), "commands", 8));
    const auto write = g_tls.SSL_write;
    g_tls.SSL_write = [](SSL *, const void *, int) { return -1; }; /* without memory */
    EXPECT_EQ(-1, pair.session->write("lost", 4));
    g_tls.SSL_write = write;
    EXPECT_EQ(-1, pair.session->write("lost", 4)) << "the stream would go on without a record";
    char bytes[100];
    EXPECT_EQ(8, pair.session->read(bytes, sizeof bytes));
    EXPECT_GE(0, pair.session->read(bytes, sizeof bytes));
    EXPECT_EQ(SSL_ERROR_SSL, pair.server_reads().second) << "no good-bye, and nothing that was lost";
}

} // namespace

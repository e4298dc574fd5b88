#include "client/tls_library.h"
#include "client/tls_session.h"
#include "platform/unique_fd.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/x509.h>
#include <sys/socket.h>
#include <thread>
#include <vector>

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

} // namespace

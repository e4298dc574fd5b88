/*
 * The floors of client mode: each calls a log server over TLS with the device's certificates, and then does with
 * blocking calls, one after the other, what it is there for.
 *
 *   floor_client archive PORT FILE    sends a file as frames of 51200 bytes for each command that it reads
 *   floor_client relay PORT PATH      sends on what a program writes to a local socket
 */
#include "bench/archive_frames.h"

#include <cstdlib>
#include <cstring>
#include <netinet/in.h>
#include <openssl/ssl.h>
#include <sys/socket.h>
#include <sys/un.h>

namespace
{

constexpr std::size_t kReadSize = 2000;

#define CERTS "/usr/vex/vex_conf/logcert/"

/* A session with the server on this machine; null when there is none. */
SSL *call(std::uint16_t port)
{
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(port);
    to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (connect(fd, reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0)
        return nullptr;
    SSL_CTX *const context = SSL_CTX_new(TLS_client_method());
    SSL_CTX_set_verify(context, SSL_VERIFY_PEER, nullptr);
    SSL_CTX_load_verify_locations(context, CERTS "logca_cert.crt", nullptr);
    SSL_CTX_use_certificate_file(context, CERTS "logclient_cert.crt", SSL_FILETYPE_PEM);
    SSL_CTX_use_PrivateKey_file(context, CERTS "logkey.pem", SSL_FILETYPE_PEM);
    SSL *const session = SSL_new(context);
    SSL_set_fd(session, fd);
    return SSL_connect(session) == 1 ? session : nullptr;
}

int send_archive(SSL *session, const char *path)
{
    char command[kReadSize];
    while (SSL_read(session, command, sizeof command) > 0)
        if (!send_archive_file(path, [session](const char *bytes, std::size_t len) {
                return SSL_write(session, bytes, static_cast<int>(len)) > 0;
            }))
            return 1;
    return 0;
}

int relay(SSL *session, const char *path)
{
    sockaddr_un at{};
    at.sun_family = AF_UNIX;
    std::strncpy(at.sun_path, path, sizeof at.sun_path - 1);
    const unique_fd listener{socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    unlink(path);
    if (bind(listener.get(), reinterpret_cast<const sockaddr *>(&at), sizeof at) != 0 || listen(listener.get(), 1) != 0)
        return 1;
    const unique_fd program{accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC)};
    char piece[kReadSize];
    for (ssize_t n = 0; (n = recv(program.get(), piece, sizeof piece, 0)) > 0;)
        if (SSL_write(session, piece, static_cast<int>(n)) <= 0)
            return 1;
    return 0;
}

} // namespace

int main(int argc, char **argv)
{
    if (argc != 4)
        return 2;
    SSL *const session = call(static_cast<std::uint16_t>(std::atoi(argv[2])));
    if (session == nullptr)
        return 1;
    if (std::strcmp(argv[1], "archive") == 0)
        return send_archive(session, argv[3]);
    if (std::strcmp(argv[1], "relay") == 0)
        return relay(session, argv[3]);
    return 2;
}

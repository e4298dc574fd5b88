/* Sessions without TLS, in place of the daemon's, for a target that needs no server. */
#include "core/log_tls_session.h"

#include <sys/socket.h>

std::unique_ptr<log_tls_session> log_tls_session::open(SSL_CTX * /*context*/, int fd, int stop_fd)
{
    return std::unique_ptr<log_tls_session>{new log_tls_session(nullptr, nullptr, fd, stop_fd)};
}

log_tls_session::log_tls_session(SSL *ssl, BIO *outbox, int fd, int stop_fd)
    : fd_(fd), stop_fd_(stop_fd), ssl_(ssl), outbox_(outbox)
{
}

log_tls_session::~log_tls_session() = default;

bool log_tls_session::connect(log_clock::time_point /*end*/)
{
    return true;
}

int log_tls_session::read(void *bytes, int len)
{
    return static_cast<int>(recv(fd_, bytes, static_cast<std::size_t>(len), 0));
}

int log_tls_session::write(const void *bytes, int len)
{
    return static_cast<int>(send(fd_, bytes, static_cast<std::size_t>(len), 0));
}

void log_tls_session::close(log_clock::time_point /*end*/) {}

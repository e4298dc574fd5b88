#include "core/log_tls_session.h"

#include "core/log_tls_library.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <new>
#include <poll.h>
#include <sys/socket.h>

namespace
{

constexpr auto kForEver = log_clock::time_point::max();
/* What a writer waits to read, the reader may have taken off the socket: it looks again that often. */
constexpr auto kLookAgain = std::chrono::milliseconds(100);
constexpr std::size_t kOutboxMax = 65536; /* with more in it nothing is begun, so that a peer cannot make it grow */

/* Milliseconds until then, for poll(). */
int milliseconds_until(log_clock::time_point end)
{
    if (end == kForEver)
        return -1;
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - log_clock::now()).count();
    return static_cast<int>(std::clamp<decltype(left)>(left, 0, INT_MAX));
}

/* A result whose errno tells of the session where it says nothing of the socket. */
int explained(int result)
{
    if (result < 0 && (errno == 0 || errno == EINTR))
        errno = EPROTO;
    return result;
}

} // namespace

std::unique_ptr<log_tls_session> log_tls_session::open(SSL_CTX *context, int fd, int stop_fd)
{
    SSL *const ssl = g_tls.SSL_new(context);
    BIO *const outbox = g_tls.BIO_new(g_tls.BIO_s_mem());
    if (ssl != nullptr && outbox != nullptr && g_tls.SSL_set_rfd(ssl, fd) == 1) {
        g_tls.SSL_set0_wbio(ssl, outbox);
        std::unique_ptr<log_tls_session> session{new (std::nothrow) log_tls_session(ssl, outbox, fd, stop_fd)};
        if (session)
            fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
        else
            g_tls.SSL_free(ssl);
        return session;
    }
    g_tls.SSL_free(ssl); /* these two take null as well */
    g_tls.BIO_free(outbox);
    return nullptr;
}

log_tls_session::log_tls_session(SSL *ssl, BIO *outbox, int fd, int stop_fd)
    : fd_(fd), stop_fd_(stop_fd), ssl_(ssl), outbox_(outbox)
{
}

log_tls_session::~log_tls_session()
{
    g_tls.SSL_free(ssl_);
    g_tls.ERR_clear_error();
}

bool log_tls_session::connect(log_clock::time_point end)
{
    g_tls.ERR_clear_error(); /* whatever else the thread has used the library for */
    return run(step::shake_hands, nullptr, 0, end) == 1;
}

int log_tls_session::read(void *bytes, int len)
{
    return explained(run(step::read, bytes, len, kForEver));
}

int log_tls_session::write(const void *bytes, int len)
{
    return explained(run(step::write, const_cast<void *>(bytes), len, kForEver));
}

void log_tls_session::close(log_clock::time_point end)
{
    {
        const log_lock hold{lock_};
        closing_ = true;
    }
    run(step::say_good_bye, nullptr, 0, end);
    {
        const log_lock hold{lock_};
        fail(EPIPE);
    }
    g_tls.ERR_clear_error();
}

int log_tls_session::call(step what, void *bytes, int len)
{
    switch (what) {
    case step::shake_hands:
        return g_tls.SSL_connect(ssl_);
    case step::read:
        return g_tls.SSL_read(ssl_, bytes, len);
    case step::write:
        return g_tls.SSL_write(ssl_, bytes, len);
    case step::say_good_bye:
        return g_tls.SSL_shutdown(ssl_) >= 0 ? 1 : -1; /* the answer is not waited for */
    }
    return -1;
}

/* What a call that had no result waits for, or why it failed. The thread's error queue, by which the library tells
 * that, is empty before and after: to empty it before each call would cost more than all else that is done here. */
int log_tls_session::what_is_wanted(int result)
{
    const int error = errno;
    const int wanted = g_tls.SSL_get_error(ssl_, result);
    g_tls.ERR_clear_error();
    errno = error;
    return wanted;
}

std::size_t log_tls_session::waiting()
{
    return static_cast<std::size_t>(g_tls.BIO_ctrl(outbox_, BIO_CTRL_PENDING, 0, nullptr));
}

/* Whoever reads or waits learns of it; what has arrived before can still be read. */
void log_tls_session::fail(int error)
{
    if (failure_ == 0)
        failure_ = error;
    shutdown(fd_, SHUT_RDWR);
}

/* Sends what waits, as far as the socket takes it; false, and errno, when the session has failed. */
bool log_tls_session::pass_on()
{
    char *bytes = nullptr;
    const auto len = static_cast<std::size_t>(g_tls.BIO_ctrl(outbox_, BIO_CTRL_INFO, 0, &bytes));
    if (failure_ == 0 && len > 0) {
        const ssize_t n = send(fd_, bytes, len, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n > 0)
            sent(static_cast<std::size_t>(n));
        else if (errno != EAGAIN && errno != EINTR)
            fail(errno);
    }
    if (failure_ != 0)
        errno = failure_;
    return failure_ == 0;
}

/* Takes the first bytes out of the outbox. */
void log_tls_session::sent(std::size_t count)
{
    sent_ += count;
    if (count == waiting()) {
        g_tls.BIO_ctrl(outbox_, BIO_CTRL_RESET, 0, nullptr);
        return;
    }
    char passed[4096];
    for (int n = 0; count > 0 && n >= 0; count -= static_cast<std::size_t>(n))
        n = g_tls.BIO_read(outbox_, passed, static_cast<int>(std::min(count, sizeof passed)));
}

/* Waits until the socket is ready or the time has come; false when it has, or the session was stopped meanwhile. What
 * is written is finished all the same. */
bool log_tls_session::wait(step what, short events, log_clock::time_point end) const
{
    const bool stoppable = what == step::read || what == step::shake_hands;
    pollfd entries[] = {{fd_, events, 0}, {stoppable ? stop_fd_ : -1, POLLIN, 0}};
    poll(entries, 2, milliseconds_until(end));
    if (entries[1].revents != 0)
        errno = ECANCELED;
    else if (end != kForEver && log_clock::now() >= end)
        errno = ETIMEDOUT;
    else
        return true;
    return false;
}

/* Runs a library call on the session until it has a result above 0 and, but for a read, what it wrote is sent; until
 * the session has ended or was stopped, which is 0 for a read; or until it has failed or the time has come: -1. */
int log_tls_session::run(step what, void *bytes, int len, log_clock::time_point end)
{
    int result = 0;
    std::uint64_t written = 0; /* all that is to be sent until then */
    for (;;) {
        int wanted = SSL_ERROR_WANT_READ;
        std::size_t left = 0;
        {
            const log_lock hold{lock_};
            if (!pass_on() && what != step::read)
                return -1;
            if (what == step::write && result <= 0 && closing_) {
                errno = EPIPE;
                return -1;
            }
            if (result <= 0 && (waiting() < kOutboxMax || failure_ != 0)) {
                errno = 0;
                result = call(what, bytes, len);
                wanted = result > 0 ? SSL_ERROR_NONE : what_is_wanted(result);
                written = sent_ + waiting();
                if (what == step::write && result <= 0 && wanted != SSL_ERROR_WANT_READ)
                    fail(ENOBUFS); /* a record is lost */
                if (!pass_on() && what != step::read)
                    return -1;
            }
            if (result > 0 && (what == step::read || sent_ >= written))
                return result;
            left = failure_ == 0 ? waiting() : 0;
        }
        if (result <= 0 && wanted != SSL_ERROR_WANT_READ)
            return wanted == SSL_ERROR_ZERO_RETURN ? 0 : -1;
        const bool reads = result <= 0 && left < kOutboxMax;
        const bool crossed = reads && what == step::write;
        const short events = static_cast<short>((reads ? POLLIN : 0) | (left > 0 ? POLLOUT : 0));
        if (!wait(what, events, crossed ? log_clock::now() + kLookAgain : end) && !crossed)
            return what == step::read && errno == ECANCELED ? 0 : -1;
    }
}

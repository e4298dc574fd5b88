#include "client/tls_session.h"

#include "client/tls_library.h"
#include "core/log_lock.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <new>
#include <poll.h>
#include <sys/socket.h>
#include <utility>

namespace
{

constexpr auto kForEver = tls_clock::time_point::max();
/* What a writer waits to read, the reader may have taken off the socket: it looks again that often. */
constexpr auto kLookAgain = std::chrono::milliseconds(100);
constexpr std::size_t kHoldMax = 16384;   /* bytes that may wait for more to come */
constexpr std::size_t kOutboxMax = 65536; /* with more in it nothing is begun, so that a peer cannot make it grow */

struct malloc_deleter {
    void operator()(unsigned char *bytes) const { std::free(bytes); }
};

/* What a session carries with it. */
struct session_extra {
    log_mutex lock; /* held across one library call */
    int fd = -1;
    /* The outbox: what the socket has not taken yet. */
    std::unique_ptr<unsigned char, malloc_deleter> held;
    std::size_t room = 0;
    std::size_t from = 0;
    std::size_t to = 0;
    bool holding = false;
    int failure = 0; /* errno of the send that failed; what it left behind is never sent */

    std::size_t waiting() const { return to - from; }
    /* Whether what waits may go on waiting for more. */
    bool held_back() const { return holding && waiting() < kHoldMax; }
};

BIO_METHOD *g_outbox_method;

session_extra *extra_of(SSL *session)
{
    return static_cast<session_extra *>(g_tls.SSL_get_ex_data(session, 0));
}

/* Puts bytes behind those that wait; false without memory. */
bool keep(session_extra &extra, const char *bytes, std::size_t len)
{
    if (extra.to + len > extra.room && extra.from > 0) {
        std::memmove(extra.held.get(), extra.held.get() + extra.from, extra.waiting());
        extra.to -= std::exchange(extra.from, 0);
    }
    if (extra.to + len > extra.room) {
        const std::size_t room = std::max(2 * extra.room, extra.to + len);
        void *const more = std::realloc(extra.held.get(), room);
        if (more == nullptr)
            return false;
        [[maybe_unused]] const void *const moved = extra.held.release();
        extra.held.reset(static_cast<unsigned char *>(more));
        extra.room = room;
    }
    std::memcpy(extra.held.get() + extra.to, bytes, len);
    extra.to += len;
    return true;
}

/* A writer whose call fails may write the same once more, so its records must not go out after all. Whoever reads or
 * waits learns of it, too. */
bool fail(session_extra &extra)
{
    extra.failure = errno;
    shutdown(extra.fd, SHUT_RDWR);
    errno = extra.failure;
    return false;
}

/* Sends what waits, as far as the socket takes it; false, and errno, when the socket has failed. */
bool pass_on(session_extra &extra)
{
    if (extra.failure != 0) {
        errno = extra.failure;
        return false;
    }
    if (extra.waiting() == 0 || extra.held_back())
        return true;
    const ssize_t n = send(extra.fd, extra.held.get() + extra.from, extra.waiting(), MSG_DONTWAIT | MSG_NOSIGNAL);
    if (n < 0)
        return errno == EAGAIN || errno == EINTR || fail(extra);
    extra.from += static_cast<std::size_t>(n);
    if (extra.waiting() == 0)
        extra.from = extra.to = 0;
    return true;
}

/* The library's write: takes everything, or fails. */
int write_outbox(BIO *outbox, const char *bytes, int len)
{
    session_extra &extra = *static_cast<session_extra *>(g_tls.BIO_get_data(outbox));
    return keep(extra, bytes, static_cast<std::size_t>(len)) ? len : -1;
}

long control_outbox(BIO *, int command, long, void *)
{
    return command == BIO_CTRL_FLUSH ? 1 : 0; /* bytes are passed on when the call is over */
}

/* Waits until the socket is ready, or the time has come. */
void wait_for(int fd, short events, tls_clock::time_point end)
{
    pollfd entry{fd, events, 0};
    int ms = -1;
    if (end != kForEver) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - tls_clock::now()).count();
        ms = static_cast<int>(std::clamp<decltype(left)>(left, 0, INT_MAX));
    }
    poll(&entry, 1, ms);
}

enum class session_wait {
    for_bytes,   /* of the peer */
    until_sent,  /* then for the outbox to be empty */
    until_shaken /* hands: nobody else uses the session yet */
};

/* What a call that had no result waits for, or why it failed. The thread's error queue, by which the library tells
 * that, is empty before and after: to empty it before each call would cost more than all else that is done here. */
int what_is_wanted(SSL *session, int result)
{
    const int error = errno;
    const int wanted = g_tls.SSL_get_error(session, result);
    g_tls.ERR_clear_error();
    errno = error;
    return wanted;
}

/* Runs a library call on the session until it has a result above 0, the session has ended or the time has come. */
template <typename Call> int run(SSL *session, session_wait kind, tls_clock::time_point end, const Call &call)
{
    session_extra &extra = *extra_of(session);
    int result = 0;
    for (;;) {
        int wanted = SSL_ERROR_WANT_READ;
        std::size_t waiting = 0;
        {
            const log_lock hold{extra.lock};
            errno = 0;
            if (!pass_on(extra))
                return -1;
            if (result <= 0 && extra.waiting() < kOutboxMax) {
                errno = 0;
                result = call();
                wanted = result > 0 ? SSL_ERROR_NONE : what_is_wanted(session, result);
                if (!pass_on(extra) &&
                    (result <= 0 || kind != session_wait::for_bytes)) /* bytes are not lost for that */
                    return -1;
            }
            waiting = extra.held_back() ? 0 : extra.waiting();
        }
        if (result > 0 && (kind != session_wait::until_sent || waiting == 0))
            return result;
        if (result <= 0 && wanted != SSL_ERROR_WANT_READ)
            return wanted == SSL_ERROR_ZERO_RETURN ? 0 : -1;
        const bool reads = result <= 0 && waiting < kOutboxMax;
        const bool crossed = reads && kind == session_wait::until_sent;
        wait_for(extra.fd, static_cast<short>((reads ? POLLIN : 0) | (waiting > 0 ? POLLOUT : 0)),
                 crossed ? tls_clock::now() + kLookAgain : end);
        if (end != kForEver && tls_clock::now() >= end) {
            errno = ETIMEDOUT;
            return -1;
        }
    }
}

/* A result whose errno tells of the session where it says nothing of the socket. */
int explained(int result)
{
    if (result < 0 && (errno == 0 || errno == EINTR))
        errno = EPROTO;
    return result;
}

} // namespace

bool tls_session_prepare()
{
    if (g_outbox_method == nullptr) /* there is one for all contexts */
        g_outbox_method = g_tls.BIO_meth_new(g_tls.BIO_get_new_index() | BIO_TYPE_SOURCE_SINK, "outbox");
    return g_outbox_method != nullptr && g_tls.BIO_meth_set_write(g_outbox_method, write_outbox) == 1 &&
           g_tls.BIO_meth_set_ctrl(g_outbox_method, control_outbox) == 1;
}

SSL *tls_session_new(SSL_CTX *context, int fd)
{
    std::unique_ptr<session_extra> extra{new (std::nothrow) session_extra};
    SSL *const session = g_tls.SSL_new(context);
    BIO *const outbox = g_tls.BIO_new(g_outbox_method);
    if (!extra || session == nullptr || outbox == nullptr || g_tls.SSL_set_ex_data(session, 0, extra.get()) != 1 ||
        g_tls.SSL_set_rfd(session, fd) != 1) {
        g_tls.SSL_free(session); /* these two take null as well */
        g_tls.BIO_free(outbox);
        return nullptr;
    }
    extra->fd = fd;
    g_tls.BIO_set_data(outbox, extra.release());
    g_tls.BIO_set_init(outbox, 1);
    g_tls.SSL_set0_wbio(session, outbox); /* the session's from now on */
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
    return session;
}

bool tls_session_connect(SSL *session, tls_clock::time_point end)
{
    g_tls.ERR_clear_error(); /* whatever else the thread has used the library for */
    return run(session, session_wait::until_shaken, end, [session] { return g_tls.SSL_connect(session); }) == 1;
}

int tls_session_read(SSL *session, void *bytes, int len)
{
    return explained(run(session, session_wait::for_bytes, kForEver,
                         [session, bytes, len] { return g_tls.SSL_read(session, bytes, len); }));
}

int tls_session_write(SSL *session, const void *bytes, int len)
{
    return explained(run(session, session_wait::until_sent, kForEver,
                         [session, bytes, len] { return g_tls.SSL_write(session, bytes, len); }));
}

void tls_session_hold(SSL *session, bool on)
{
    session_extra &extra = *extra_of(session);
    {
        const log_lock hold{extra.lock};
        extra.holding = on;
    }
    if (!on)
        run(session, session_wait::until_sent, kForEver, [] { return 1; });
}

void tls_session_free(SSL *session)
{
    const std::unique_ptr<session_extra> extra{extra_of(session)};
    g_tls.SSL_shutdown(session);
    extra->holding = false;
    pass_on(*extra);
    g_tls.SSL_free(session);
    g_tls.ERR_clear_error();
}

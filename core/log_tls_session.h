/*
 * A TLS session that one thread reads while others write. It knows nothing of the daemon but its way to the TLS
 * library. A lock of its own is held across one library call at a time; all waiting is done without it, so that a reader
 * who waits never holds up a writer, nor the other way round.
 *
 * The library writes to memory, the outbox. When the call is over, its bytes go to the socket, all records of a write
 * together, and what the socket does not take waits there. So no call ever leaves a record half written, which is what
 * the library could not bear: its reader may have a record of its own to send (the answer to a key update) before the
 * writer comes back to finish.
 */
#ifndef CORE_LOG_TLS_SESSION_H
#define CORE_LOG_TLS_SESSION_H

#include "core/log_lock.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <openssl/ossl_typ.h>

class log_tls_session
{
public:
    /*
     * A session on the connected socket `fd`, which becomes non-blocking and stays the caller's; null without memory.
     * The caller keeps `context` and both descriptors for as long as the session lives.
     *   stop_fd  is readable once the session is no longer wanted: then its handshake and its reads end at once;
     *            -1: nothing ends them
     */
    static std::unique_ptr<log_tls_session> open(SSL_CTX *context, int fd, int stop_fd);

    ~log_tls_session(); /* nobody uses it any more */
    log_tls_session(const log_tls_session &) = delete;
    log_tls_session &operator=(const log_tls_session &) = delete;

    /* Shakes hands with the server. False, and errno, when that fails, is stopped or is not done at `end`. Nobody else
     * uses the session yet. */
    bool connect(log_clock::time_point end);

    /* Waits for bytes and reads up to `len`: their number; 0 when the session has ended or was stopped; -1 and errno on
     * failure. One thread reads. What has arrived is read although nothing can be written any more. */
    int read(void *bytes, int len);

    /* Writes all `len` bytes, more than 0, and waits until the socket has taken them: `len`; -1 and errno on failure,
     * after which the session is over: the socket is shut down and nothing more is sent. Any thread; what several
     * threads write stays in one piece each. */
    int write(const void *bytes, int len);

    /* Ends the session: begins no further write, waits until what was begun is sent, says good-bye (close_notify), and
     * shuts the socket down; at `end` in any case, which fails writes that still wait. By the thread that reads, when it
     * will read no more. */
    void close(log_clock::time_point end);

    /* For what else the library can tell of the session, before anybody else uses it. */
    SSL *handle() const { return ssl_; }

private:
    enum class step { shake_hands, read, write, say_good_bye };

    log_tls_session(SSL *ssl, BIO *outbox, int fd, int stop_fd);

    int run(step what, void *bytes, int len, log_clock::time_point end);
    int call(step what, void *bytes, int len) LOG_REQUIRES(lock_);
    int what_is_wanted(int result) LOG_REQUIRES(lock_);
    std::size_t waiting() LOG_REQUIRES(lock_);
    bool pass_on() LOG_REQUIRES(lock_);
    void sent(std::size_t count) LOG_REQUIRES(lock_);
    void fail(int error) LOG_REQUIRES(lock_);
    bool wait(step what, short events, log_clock::time_point end) const;

    log_mutex lock_; /* held across one library call */
    const int fd_;
    const int stop_fd_;
    SSL *const ssl_ LOG_POINTEE_GUARDED_BY(lock_);
    BIO *const outbox_ LOG_POINTEE_GUARDED_BY(lock_); /* the session's */
    std::uint64_t sent_ LOG_GUARDED_BY(lock_) = 0;    /* bytes that the socket has taken */
    bool closing_ LOG_GUARDED_BY(lock_) = false;      /* no write is begun any more */
    int failure_ LOG_GUARDED_BY(lock_) = 0;           /* errno; with it nothing is sent any more */
};

#endif

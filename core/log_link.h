/*
 * A link: one connection that the daemon reads and writes, be it a log tool, the control link or a data link.
 *
 * A link has one owner, the thread that reads it, which alone ends it. Others may hold it to send on it; its descriptor
 * is closed and its session freed when the last of them lets it go, so neither can ever mean another connection.
 */
#ifndef CORE_LOG_LINK_H
#define CORE_LOG_LINK_H

#include "core/log_lock.h"
#include "core/log_tls_session.h"
#include "platform/unique_fd.h"

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <new>
#include <sys/types.h>
#include <utility>

constexpr std::size_t kClientIpSize = 64;

constexpr std::size_t kLogPieceMax = 2000;         /* bytes that are read at a time */
constexpr useconds_t kLogInterruptedPause = 20000; /* microseconds after a read that was interrupted */

struct log_link {
    log_link(unique_fd socket, std::unique_ptr<log_tls_session> session, const char *ip = "");

    /* Reads up to `len` bytes: their number; 0 when the link has ended or was taken away; -1 and errno on failure. For
     * its owner. */
    ssize_t read(void *bytes, std::size_t len);

    const unique_fd fd;
    const std::unique_ptr<log_tls_session> tls; /* null without TLS */
    char client_ip[kClientIpSize];              /* address of the log tool at its other end; empty in client mode */

    log_mutex sending; /* one frame at a time */

    /* Its owner must do nothing more for it but end it: see log_link_take_away(). */
    std::atomic<bool> taken{false};

    /* Whether nobody has waited for what it asked for in the last 10 seconds, as its tool was replaced, or its server has
     * hung up: what still runs for it is ended, and nothing more is run. For its owner. */
    bool is_given_up();

    /* Whether the peer has left bytes unanswered for 100 seconds. One that only does not read is not meant: it answers, by
     * saying so. Asked every few seconds, by one thread. */
    bool has_vanished();

    /* Whether the peer has taken nothing of what waits for it for 60 seconds. Asked every few seconds, by one thread. */
    bool has_stalled();

private:
    bool is_lost() const;

    log_clock::time_point lost_since_ = log_clock::time_point::max();
    log_clock::time_point unanswered_since_ = log_clock::time_point::max();
    std::uint64_t acknowledged_ = 0; /* bytes, at the last look */
    log_clock::time_point acknowledged_at_ = log_clock::now();
};

/* Ends the connection of a peer that has vanished (logged): its reader and whoever sends on it learn of it at once. Called
 * every few seconds, by one thread. Keepalive finds only those that owe no answer. */
void log_link_look_after(log_link &link);

/* A shared object; null without memory. */
template <typename Type, typename... Arguments> std::shared_ptr<Type> log_make_shared(Arguments &&...arguments)
{
    try {
        return std::make_shared<Type>(std::forward<Arguments>(arguments)...);
    } catch (const std::bad_alloc &) {
        return nullptr;
    }
}

/* Gives a thread its share of an object, as its argument: null without memory. The thread takes it once. */
template <typename Type> void *log_give_share(const std::shared_ptr<Type> &object)
{
    return new (std::nothrow) std::shared_ptr<Type>(object);
}
template <typename Type> std::shared_ptr<Type> log_take_share(void *argument)
{
    const std::unique_ptr<std::shared_ptr<Type>> share{static_cast<std::shared_ptr<Type> *>(argument)};
    return std::move(*share);
}

/* Waits, -1 milliseconds: for ever, until `fd` has one of the events or `stop_fd`, where it is not -1, is readable; what
 * `fd` has, 0 when it has none. Interrupted waits go on. */
short log_wait_ready(int fd, short events, int stop_fd, int milliseconds);

/* Hands over what `read` brings, piece by piece, until there is no more: then 0, or the errno of the read that failed. */
template <typename Read, typename Take> int log_read_pieces(const Read &read, const Take &take)
{
    for (;;) {
        const ssize_t n = read();
        if (n > 0)
            take(static_cast<std::size_t>(n));
        else if (n == -1 && errno == EINTR)
            usleep(kLogInterruptedPause);
        else
            return n == 0 ? 0 : errno;
    }
}

#endif

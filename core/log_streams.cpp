#include "core/log_streams.h"

#include "core/daemon_state.h"

#include <atomic>
#include <cstring>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

log_target syslog_target;
log_target qxdm_target;
int syslog_local_fd = -1;
int qxdm_local_fd = -1;

namespace
{

/* What a stream has beside the fields that have names of their own. */
struct stream_state {
    log_mutex producer_lock;
    log_mutex send_lock; /* one send at a time on the data link */

    unsigned starts LOG_GUARDED_BY(g_registry_lock) = 0;         /* so many there have been */
    unsigned wanted LOG_GUARDED_BY(g_registry_lock) = 0;         /* the latest start; 0 once it was stopped */
    unsigned link_start LOG_GUARDED_BY(g_registry_lock) = 0;     /* of the link that stands; 0: none */
    unsigned producer_start LOG_GUARDED_BY(g_registry_lock) = 0; /* of the link that the latest producer was for */
    int intakes_starting LOG_GUARDED_BY(g_registry_lock) = 0;
    unsigned intake_start LOG_GUARDED_BY(g_registry_lock) = 0; /* of the intake that waits for its producer, */
    int intake_fd LOG_GUARDED_BY(g_registry_lock) = -1;        /* and where it does */

    std::atomic<int> sending_fd{-1}; /* the link, or one before, that a send is under way on */
};

struct stream_fields {
    int log_sock_fd::*fd;
    SSL *log_sock_fd::*ssl;
    int *local_fd;
    log_target *target;
};

constexpr stream_fields kFields[] = {
    {&log_sock_fd::syslog_fd, &log_sock_fd::syslog_ssl, &syslog_local_fd, &syslog_target},
    {&log_sock_fd::qxdm_fd, &log_sock_fd::qxdm_ssl, &qxdm_local_fd, &qxdm_target},
};

stream_state g_streams[2];
pthread_cond_t g_intake_change = PTHREAD_COND_INITIALIZER; /* an intake has come up, or failed to */

stream_state &state_of(log_stream stream)
{
    return g_streams[static_cast<std::size_t>(stream)];
}

const stream_fields &fields_of(log_stream stream)
{
    return kFields[static_cast<std::size_t>(stream)];
}

int &link_fd(log_stream stream) LOG_REQUIRES(g_registry_lock)
{
    return g_sock_fd.*fields_of(stream).fd;
}

SSL *&link_ssl(log_stream stream) LOG_REQUIRES(g_registry_lock)
{
    return g_sock_fd.*fields_of(stream).ssl;
}

/* Takes the link that stands, if any, away from its owner, which wakes up. The number stays taken until the owner is
 * done. What is still to be sent goes out: it is the owner who knows whether a sender is to be woken, too. */
void take_away(log_stream stream) LOG_REQUIRES(g_registry_lock)
{
    state_of(stream).link_start = 0;
    link_ssl(stream) = nullptr;
    if (const int fd = std::exchange(link_fd(stream), -1); fd != -1)
        shutdown(fd, SHUT_RD);
}

void send_intake_home(log_stream stream) LOG_REQUIRES(g_registry_lock)
{
    if (const int fd = std::exchange(state_of(stream).intake_fd, -1); fd != -1)
        shutdown(fd, SHUT_RDWR);
}

void close_local(log_stream stream) LOG_REQUIRES(g_registry_lock)
{
    if (const int fd = std::exchange(*fields_of(stream).local_fd, -1); fd != -1)
        close(fd);
}

thread_local const log_link *t_served; /* the data link that this thread serves */

} // namespace

log_producer_turn::log_producer_turn(log_stream stream) : hold_(state_of(stream).producer_lock) {}

log_producer_turn::~log_producer_turn() = default;

unsigned log_stream_start(log_stream stream, const char *ip, int port)
{
    const log_lock hold{g_registry_lock};
    log_target &target = *fields_of(stream).target;
    std::strncpy(target.ip, ip, sizeof target.ip - 1); /* clears the rest */
    target.port = port;
    return state_of(stream).wanted = ++state_of(stream).starts;
}

void log_stream_stop(log_stream stream)
{
    const log_lock hold{g_registry_lock};
    state_of(stream).wanted = 0;
    take_away(stream);
    close_local(stream);
    send_intake_home(stream);
}

void log_stream_taken_elsewhere(log_stream stream)
{
    const log_lock hold{g_registry_lock};
    state_of(stream).producer_start = state_of(stream).starts + 1;
}

void log_streams_shut_down()
{
    const log_lock hold{g_registry_lock};
    for (const log_stream stream : {log_stream::syslog, log_stream::qxdm})
        if (link_fd(stream) != -1)
            shutdown(link_fd(stream), SHUT_RDWR);
}

bool log_link_begin(log_link &link)
{
    const log_lock hold{g_registry_lock};
    link.target = *fields_of(link.stream).target;
    return state_of(link.stream).wanted == link.start;
}

bool log_link_wanted(const log_link &link)
{
    const log_lock hold{g_registry_lock};
    return state_of(link.stream).wanted == link.start;
}

bool log_link_record_session(const log_link &link)
{
    const log_lock hold{g_registry_lock};
    if (state_of(link.stream).wanted != link.start)
        return false;
    take_away(link.stream);
    link_ssl(link.stream) = link.ssl;
    state_of(link.stream).link_start = link.start;
    return true;
}

bool log_link_record(const log_link &link)
{
    const log_lock hold{g_registry_lock};
    if (state_of(link.stream).wanted != link.start)
        return false;
    link_fd(link.stream) = link.fd;
    return true;
}

void log_link_serve(const log_link &link)
{
    t_served = &link;
}

bool log_link_stands()
{
    const log_lock hold{g_registry_lock};
    return t_served == nullptr || state_of(t_served->stream).link_start == t_served->start;
}

void log_link_close(const log_link &link)
{
    stream_state &state = state_of(link.stream);
    {
        const log_lock hold{g_registry_lock};
        if (state.link_start == link.start) {
            state.link_start = 0;
            link_fd(link.stream) = -1;
            link_ssl(link.stream) = nullptr;
            close_local(link.stream);
        }
    }
    if (state.sending_fd == link.fd) {
        shutdown(link.fd, SHUT_RDWR); /* wakes a sender that a stalled server blocks */
        state.sending_fd.wait(link.fd);
    }
    if (g_daemon.use_ssl == 1)
        g_daemon.close_ssl(link.ssl, 0);
    shutdown(link.fd, SHUT_RDWR); /* the server sees the end although a program may still have a copy */
    close(link.fd);
}

bool log_link_is_latest(const log_link &link)
{
    const log_lock hold{g_registry_lock};
    return state_of(link.stream).producer_start <= link.start;
}

void log_link_end(const log_link &link)
{
    const log_lock hold{g_registry_lock};
    if (state_of(link.stream).intake_start == link.start)
        send_intake_home(link.stream);
}

int log_link_for_producer(log_stream stream)
{
    const log_lock hold{g_registry_lock};
    if (link_fd(stream) != -1)
        state_of(stream).producer_start = state_of(stream).link_start;
    return link_fd(stream);
}

void log_local_record(log_stream stream, int fd)
{
    const log_lock hold{g_registry_lock};
    close_local(stream);
    *fields_of(stream).local_fd = fd;
}

log_link_use::log_link_use(log_stream stream) : stream_(stream), sending_(state_of(stream).send_lock)
{
    const log_lock hold{g_registry_lock};
    fd_ = link_fd(stream);
    state_of(stream).sending_fd = fd_;
    ssl_ = link_ssl(stream);
}

log_link_use::~log_link_use()
{
    state_of(stream_).sending_fd = -1;
    state_of(stream_).sending_fd.notify_all(); /* the owner, who may be waiting to close the link */
}

void log_intake_starting(log_stream stream)
{
    const log_lock hold{g_registry_lock};
    ++state_of(stream).intakes_starting;
}

void log_intake_await(log_stream stream)
{
    const log_lock hold{g_registry_lock};
    while (state_of(stream).intakes_starting > 0)
        g_registry_lock.wait(g_intake_change);
}

bool log_intake_listens(log_stream stream, int fd)
{
    bool wanted = false;
    {
        const log_lock hold{g_registry_lock};
        stream_state &state = state_of(stream);
        send_intake_home(stream); /* nobody can reach it any more: the path is another's now */
        wanted = fd != -1 && state.wanted != 0;
        state.intake_fd = wanted ? fd : -1;
        state.intake_start = state.wanted;
        --state.intakes_starting;
    }
    pthread_cond_broadcast(&g_intake_change);
    return wanted;
}

bool log_intake_done_waiting(log_stream stream, int fd)
{
    const log_lock hold{g_registry_lock};
    if (state_of(stream).intake_fd != fd)
        return false;
    state_of(stream).intake_fd = -1;
    return true;
}

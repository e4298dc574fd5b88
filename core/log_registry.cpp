#include "core/log_registry.h"

#include "core/daemon_state.h"

#include <cstring>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

log_mutex g_takeover_lock;
log_mutex g_cmd_send_lock;
log_mutex g_registry_lock;
log_mutex g_block_lock;

log_sock_fd g_sock_fd;
char client_ip[kClientIpSize];
pthread_t recv_thread_id;

namespace
{

bool g_cmd_owned LOG_GUARDED_BY(g_registry_lock);      /* whether cmd_fd has an owner */
int g_sending_fd LOG_GUARDED_BY(g_registry_lock) = -1; /* what a frame is being sent on, as cmd_fd or before */
bool g_turn_taken LOG_GUARDED_BY(g_registry_lock);
pthread_cond_t g_turn_change = PTHREAD_COND_INITIALIZER; /* a turn has ended, or a connection was taken away */

thread_local int t_served_fd = -1; /* the command connection that this thread owns */
thread_local char t_served_ip[kClientIpSize];

bool stands() LOG_REQUIRES(g_registry_lock)
{
    return t_served_fd == -1 || t_served_fd == g_sock_fd.cmd_fd;
}

} // namespace

int log_cmd_fd()
{
    const log_lock hold{g_registry_lock};
    return g_sock_fd.cmd_fd;
}

log_cmd_taken log_cmd_take_away()
{
    log_cmd_taken taken{-1, 0};
    bool owned = false;
    {
        const log_lock hold{g_registry_lock};
        taken.fd = std::exchange(g_sock_fd.cmd_fd, -1);
        taken.reader = std::exchange(recv_thread_id, 0);
        g_sock_fd.cmd_ssl = nullptr;
        owned = g_cmd_owned;
        /* Under the lock, as its owner can neither close it nor end meanwhile. */
        if (taken.reader != 0)
            pthread_cancel(taken.reader);
        if (taken.fd != -1 && owned)
            shutdown(taken.fd, SHUT_RDWR);
    }
    pthread_cond_broadcast(&g_turn_change);
    if (taken.fd != -1 && !owned)
        close(taken.fd);
    return taken;
}

void log_cmd_record(int fd, const char *ip)
{
    const log_lock hold{g_registry_lock};
    g_sock_fd.cmd_fd = fd;
    g_cmd_owned = true;
    std::strncpy(client_ip, ip, sizeof client_ip - 1); /* clears the rest */
}

void log_cmd_disown()
{
    const log_lock hold{g_registry_lock};
    g_cmd_owned = false;
}

void log_cmd_record_session(SSL *session)
{
    const log_lock hold{g_registry_lock};
    g_sock_fd.cmd_ssl = session;
}

void log_cmd_record_link(int fd)
{
    const log_lock hold{g_registry_lock};
    g_sock_fd.cmd_fd = fd;
    g_cmd_owned = true;
}

SSL *log_cmd_session()
{
    const log_lock hold{g_registry_lock};
    return g_sock_fd.cmd_ssl;
}

const char *log_cmd_client_ip()
{
    return t_served_ip;
}

void log_cmd_serve(int fd)
{
    t_served_fd = fd;
    const log_lock hold{g_registry_lock};
    if (!stands())
        return;
    recv_thread_id = pthread_self();
    std::memcpy(t_served_ip, client_ip, sizeof t_served_ip);
}

bool log_cmd_stands()
{
    const log_lock hold{g_registry_lock};
    return stands();
}

void log_cmd_close(int fd)
{
    SSL *session = nullptr;
    bool sending = false;
    {
        const log_lock hold{g_registry_lock};
        if (g_sock_fd.cmd_fd == fd) {
            g_sock_fd.cmd_fd = -1;
            session = std::exchange(g_sock_fd.cmd_ssl, nullptr);
        }
        if (pthread_equal(recv_thread_id, pthread_self()) != 0)
            recv_thread_id = 0;
        sending = g_sending_fd == fd;
    }
    if (sending) {
        shutdown(fd, SHUT_RDWR); /* wakes a sender that a stalled peer blocks */
        const log_lock until_sent{g_cmd_send_lock};
    }
    if (g_daemon.use_ssl == 1)
        g_daemon.close_ssl(session, 1);
    close(fd);
}

log_cmd_use::log_cmd_use() : sending_(g_cmd_send_lock)
{
    const log_lock hold{g_registry_lock};
    if (!stands())
        return;
    fd_ = g_sending_fd = g_sock_fd.cmd_fd;
    ssl_ = g_sock_fd.cmd_ssl;
}

log_cmd_use::~log_cmd_use()
{
    const log_lock hold{g_registry_lock};
    g_sending_fd = -1;
}

log_cmd_turn::log_cmd_turn(bool beside_others)
{
    const log_lock hold{g_registry_lock};
    while (!beside_others && g_turn_taken && stands())
        g_registry_lock.wait(g_turn_change);
    granted_ = stands();
    taken_ = granted_ && !beside_others;
    if (taken_)
        g_turn_taken = true;
}

log_cmd_turn::~log_cmd_turn()
{
    if (!taken_)
        return;
    {
        const log_lock hold{g_registry_lock};
        g_turn_taken = false;
    }
    pthread_cond_broadcast(&g_turn_change);
}

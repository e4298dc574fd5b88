#include "core/log_registry.h"

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

int log_cmd_take_away()
{
    int fd = -1;
    {
        const log_lock hold{g_registry_lock};
        fd = std::exchange(g_sock_fd.cmd_fd, -1);
        g_sock_fd.cmd_ssl = nullptr;
    }
    pthread_cond_broadcast(&g_turn_change);
    if (fd == -1)
        return -1;
    if (recv_thread_id == 0)
        close(fd);
    else
        shutdown(fd, SHUT_RDWR);
    return fd;
}

void log_cmd_record(int fd, const char *ip)
{
    const log_lock hold{g_registry_lock};
    g_sock_fd.cmd_fd = fd;
    std::strncpy(client_ip, ip, sizeof client_ip - 1); /* clears the rest */
}

const char *log_cmd_client_ip()
{
    return t_served_ip;
}

void log_cmd_serve(int fd)
{
    t_served_fd = fd;
    const log_lock hold{g_registry_lock};
    if (stands())
        std::memcpy(t_served_ip, client_ip, sizeof t_served_ip);
}

bool log_cmd_stands()
{
    const log_lock hold{g_registry_lock};
    return stands();
}

void log_cmd_close(int fd)
{
    {
        const log_lock turn{g_takeover_lock};
        const log_lock hold{g_registry_lock};
        if (g_sock_fd.cmd_fd == fd) {
            g_sock_fd.cmd_fd = -1;
            g_sock_fd.cmd_ssl = nullptr;
            recv_thread_id = 0;
        }
    }
    if (!g_cmd_send_lock.try_acquire()) {
        shutdown(fd, SHUT_RDWR); /* wakes a sender that a stalled peer blocks */
        g_cmd_send_lock.acquire();
    }
    close(fd);
    g_cmd_send_lock.release();
}

log_cmd_use::log_cmd_use() : sending_(g_cmd_send_lock)
{
    const log_lock hold{g_registry_lock};
    if (!stands())
        return;
    fd_ = g_sock_fd.cmd_fd;
    ssl_ = g_sock_fd.cmd_ssl;
}

log_cmd_turn::log_cmd_turn()
{
    if (t_served_fd == -1) {
        granted_ = true;
        return;
    }
    const log_lock hold{g_registry_lock};
    while (g_turn_taken && stands())
        g_registry_lock.wait(g_turn_change);
    granted_ = taken_ = stands();
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

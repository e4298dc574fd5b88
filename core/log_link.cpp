#include "core/log_link.h"

#include "core/daemon_state.h"

#include <cstring>
#include <poll.h>
#include <sys/socket.h>

log_link::log_link(unique_fd socket, std::unique_ptr<log_tls_session> session, const char *ip)
    : fd(std::move(socket)), tls(std::move(session))
{
    std::strncpy(client_ip, ip, sizeof client_ip - 1); /* clears the rest */
    client_ip[sizeof client_ip - 1] = '\0';
}

short log_wait_ready(int fd, short events, int stop_fd, int milliseconds)
{
    pollfd entries[] = {{fd, events, 0}, {stop_fd, POLLIN, 0}};
    while (poll(entries, 2, milliseconds) == -1 && errno == EINTR) {
    }
    return entries[0].revents;
}

ssize_t log_link::read(void *bytes, std::size_t len)
{
    if (g_daemon.use_ssl == 1)
        return tls != nullptr && !taken ? tls->read(bytes, static_cast<int>(len)) : 0;
    return recv(fd.get(), bytes, len, 0);
}

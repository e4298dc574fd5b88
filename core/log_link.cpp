#include "core/log_link.h"

#include "core/daemon_state.h"
#include "core/log_line.h"

#include <cstring>
#include <poll.h>
#include <sys/socket.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr auto kGraceMax = std::chrono::seconds(10); /* for what runs for a peer that is gone */

} // namespace

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

/* In server mode a tool that has hung up may still read; it is gone when another takes over. */
bool log_link::is_lost() const
{
    return taken || (g_daemon.run_mode != 0 && log_wait_ready(fd.get(), POLLRDHUP, -1, 0) != 0);
}

bool log_link::is_given_up()
{
    if (!is_lost())
        return false;
    if (lost_since_ == log_clock::time_point::max()) {
        lost_since_ = log_clock::now();
        LOG_NOTE("nobody waits any more for what fd[%d] asked for: its command gets %d seconds\n", fd.get(),
                 static_cast<int>(kGraceMax.count()));
    }
    return log_clock::now() >= lost_since_ + kGraceMax;
}

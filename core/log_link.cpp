#include "core/log_link.h"

#include "core/daemon_state.h"
#include "core/log_line.h"

#include <algorithm>
#include <cstring>
#include <linux/sockios.h>
#include <linux/tcp.h> /* knows more than netinet/tcp.h */
#include <netinet/in.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr auto kGraceMax = std::chrono::seconds(10); /* for what runs for a peer that is gone */
constexpr auto kUnansweredMax = std::chrono::seconds(100);
constexpr auto kStalledMax = std::chrono::seconds(60);

/* What the kernel knows of a connection; false when that is less than is asked for here. */
bool read_tcp_info(int fd, tcp_info &info)
{
    socklen_t len = sizeof info;
    return getsockopt(fd, IPPROTO_TCP, TCP_INFO, &info, &len) == 0 &&
           len >= offsetof(tcp_info, tcpi_bytes_acked) + sizeof info.tcpi_bytes_acked;
}

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

bool log_link::has_vanished()
{
    tcp_info info{};
    if (!read_tcp_info(fd.get(), info) || (info.tcpi_unacked == 0 && info.tcpi_probes == 0)) {
        unanswered_since_ = log_clock::time_point::max();
        return false;
    }
    const auto now = log_clock::now();
    const auto answered = now - std::chrono::milliseconds(info.tcpi_last_ack_recv);
    unanswered_since_ = std::max(std::min(unanswered_since_, now), answered);
    return now >= unanswered_since_ + kUnansweredMax;
}

bool log_link::has_stalled()
{
    tcp_info info{};
    int waiting = 0;
    const auto now = log_clock::now();
    if (!read_tcp_info(fd.get(), info) || ioctl(fd.get(), SIOCOUTQ, &waiting) != 0)
        return false;
    if (waiting == 0 || info.tcpi_bytes_acked != acknowledged_)
        acknowledged_at_ = now;
    acknowledged_ = info.tcpi_bytes_acked;
    return now >= acknowledged_at_ + kStalledMax;
}

void log_link_look_after(log_link &link)
{
    if (link.taken || !link.has_vanished())
        return;
    LOG_NOTE("the peer of fd[%d] has answered nothing for %d seconds, its connection ends\n", link.fd.get(),
             static_cast<int>(kUnansweredMax.count()));
    shutdown(link.fd.get(), SHUT_RDWR);
}

#include "platform/host/log_sink.h"

#include "platform/unique_fd.h"

#include <atomic>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <fcntl.h>
#include <iterator>
#include <mutex>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

namespace
{

struct log_file {
    int fd;               /* -1: none, the lines go to the system's log */
    std::size_t line_max; /* a pipe takes so many bytes in one piece, or none */
};

std::atomic<unsigned long> g_lost{0}; /* lines, since the last that was written */
std::atomic<bool> g_cut{false};       /* whether the last was written in part */

std::atomic<bool> g_reopen{false}; /* its file, which has been moved away */

/* Its socket, which several threads may open again. Never destroyed: threads may log while the process exits. */
std::mutex g_socket_lock;
int g_socket = -1;

/* A FIFO is opened for reading, too, when it has no reader yet. */
int open_path(const char *path)
{
    constexpr int kFlags = O_APPEND | O_NONBLOCK | O_CLOEXEC;
    const int fd = open(path, O_WRONLY | O_CREAT | kFlags, 0644);
    return fd == -1 && errno == ENXIO ? open(path, O_RDWR | kFlags) : fd;
}

void on_hangup(int /*signal*/)
{
    g_reopen = true;
}

/* Unless it is ignored, as by nohup. */
void reopen_on_hangup()
{
    struct sigaction action {
    };
    sigaction(SIGHUP, nullptr, &action);
    if (action.sa_handler == SIG_IGN)
        return;
    action.sa_handler = on_hangup;
    action.sa_flags = SA_RESTART;
    sigaction(SIGHUP, &action, nullptr);
}

log_file open_file()
{
    const char *path = std::getenv("VEX_LOG_FILE");
    const int fd = path != nullptr && *path != '\0' ? open_path(path) : -1;
    struct stat status {
    };
    if (fd != -1)
        reopen_on_hangup();
    const bool pipe = fd != -1 && fstat(fd, &status) == 0 && S_ISFIFO(status.st_mode);
    return {fd, pipe ? std::size_t{PIPE_BUF} : std::size_t{INT_MAX}};
}

const log_file &file()
{
    static const log_file opened = open_file();
    return opened;
}

/* Goes on in a new file under the old name, and the same descriptor: other threads may be writing to that. */
void reopen()
{
    const unique_fd again{open_path(std::getenv("VEX_LOG_FILE"))};
    if (again)
        dup3(again.get(), file().fd, O_CLOEXEC);
}

bool write_to_file(std::string_view line)
{
    if (g_reopen.load(std::memory_order_relaxed) && g_reopen.exchange(false))
        reopen();
    if (line.size() > file().line_max)
        return false;
    const ssize_t n = write(file().fd, line.data(), line.size());
    if (n > 0 && static_cast<std::size_t>(n) < line.size())
        g_cut = true;
    return n == static_cast<ssize_t>(line.size());
}

/* Connects to the log daemon, again after it was started again. Under its lock. */
void connect_socket()
{
    if (g_socket != -1)
        close(g_socket);
    constexpr sockaddr_un kTo{AF_UNIX, "/dev/log"};
    unique_fd sock{socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)};
    const bool connected = sock && connect(sock.get(), reinterpret_cast<const sockaddr *>(&kTo), sizeof kTo) == 0;
    g_socket = connected ? sock.release() : -1;
}

/* As syslog(3) would, but that it does not wait. */
bool send_to_daemon(int level, std::string_view line)
{
    char stamp[32];
    const time_t now = time(nullptr);
    tm local{};
    localtime_r(&now, &local);
    std::strftime(stamp, sizeof stamp, "%h %e %T", &local);
    char head[64];
    const int head_len = std::snprintf(
        head, sizeof head, "<%d>%s vex_log_manage: ", LOG_DAEMON | (level == 0 ? LOG_ERR : LOG_INFO), stamp);
    line.remove_suffix(1); /* the newline */
    iovec parts[] = {{head, static_cast<std::size_t>(head_len)}, {const_cast<char *>(line.data()), line.size()}};
    msghdr message{};
    message.msg_iov = parts;
    message.msg_iovlen = std::size(parts);
    const std::lock_guard hold{g_socket_lock};
    for (int i = 0; i < 2; ++i) {
        if (g_socket != -1 && sendmsg(g_socket, &message, MSG_DONTWAIT | MSG_NOSIGNAL) != -1)
            return true;
        if (g_socket != -1 && errno == EAGAIN)
            return false;
        connect_socket();
    }
    return false;
}

bool pass_on(int level, std::string_view line)
{
    return file().fd != -1 ? write_to_file(line) : send_to_daemon(level, line);
}

/* Says how many lines were lost; false when that is lost, too. */
bool tell_lost()
{
    const unsigned long lost = g_lost.exchange(0);
    char line[80];
    const int len = std::snprintf(line, sizeof line, "%slog: %lu lines before this one were lost\n",
                                  g_cut.exchange(false) ? "\n" : "", lost);
    if (pass_on(0, {line, static_cast<std::size_t>(len)}))
        return true;
    g_lost += lost;
    return false;
}

} // namespace

bool log_sink_is_file()
{
    return file().fd != -1;
}

void log_sink_write(int level, std::string_view line)
{
    if ((g_lost.load(std::memory_order_relaxed) != 0 && !tell_lost()) || !pass_on(level, line))
        ++g_lost;
}

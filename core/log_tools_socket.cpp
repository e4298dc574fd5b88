#include "core/log_tools.h"

#include "core/log_line.h"
#include "platform/unique_fd.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <sys/un.h>

constexpr char kLogSource[] = "log_tools";

void log_set_keepalive(int fd)
{
    const struct {
        int level;
        int option;
        int value;
    } settings[] = {{SOL_SOCKET, SO_KEEPALIVE, 1},
                    {IPPROTO_TCP, TCP_KEEPIDLE, 60},
                    {IPPROTO_TCP, TCP_KEEPINTVL, 10},
                    {IPPROTO_TCP, TCP_KEEPCNT, 3}};
    for (const auto &setting : settings)
        setsockopt(fd, setting.level, setting.option, &setting.value, sizeof setting.value);
}

bool log_peer_is_ours(int fd)
{
    ucred peer{};
    socklen_t len = sizeof peer;
    return getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &len) == 0 && peer.uid == geteuid();
}

int log_connect_unix_socket(const char *path)
{
    unique_fd sock{socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_FAULT("create socket error, errno: %d, pid=%d", errno, static_cast<int>(getpid()));
        return -1;
    }
    fcntl(sock.get(), F_SETFL, O_NONBLOCK);
    sockaddr_un to{};
    to.sun_family = AF_UNIX;
    std::memcpy(to.sun_path, path, strnlen(path, sizeof to.sun_path));
    if (connect(sock.get(), reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0) {
        LOG_FAULT("can not connect to:%s, errno: %d, pid=%d", path, errno, static_cast<int>(getpid()));
        return -1;
    }
    if (!log_peer_is_ours(sock.get())) {
        LOG_FAULT("another user listens at:%s, pid=%d", path, static_cast<int>(getpid()));
        return -1;
    }
    const timeval send_timeout{3, 0};
    setsockopt(sock.get(), SOL_SOCKET, SO_SNDTIMEO, &send_timeout, sizeof send_timeout);
    LOG_NOTE("connect[%s]------clientfd=[%d]\n", path, sock.get());
    return sock.release();
}

#include "transport/log_intake.h"

#include "core/log_filemgr.h"
#include "core/log_line.h"
#include "core/log_link.h"
#include "core/log_tools.h"

#include <cerrno>
#include <cstring>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>
#include <utility>

constexpr char kLogSource[] = "vex_log_manage";

constexpr int kBacklog = 1;
constexpr int kBindMax = 10; /* somebody else may be quicker at the path */

namespace
{

/* Puts the socket at the path, whatever is there; only our own user may connect to it. */
int bind_alone(int sock, const char *path)
{
    sockaddr_un at{};
    at.sun_family = AF_UNIX;
    std::memcpy(at.sun_path, path, strnlen(path, sizeof at.sun_path - 1));
    fchmod(sock, 0600);
    for (int i = 0; i < kBindMax; ++i) {
        log_clear_path(path); /* what an earlier intake left behind */
        if (bind(sock, reinterpret_cast<const sockaddr *>(&at), sizeof at) == 0)
            return 0;
    }
    return -1;
}

} // namespace

int vex_create_unix_server_socket(const char *path, unique_fd *listener)
{
    LOG_NOTE("%s enter\n", __func__);
    if (path == nullptr || listener == nullptr) {
        LOG_FAULT("socket_fd or vex_server_path is null");
        return -1;
    }
    unique_fd sock{socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_FAULT("can not create socket. errno: %d", errno);
        return -1;
    }
    if (bind_alone(sock.get(), path) != 0) {
        LOG_FAULT("can not bind socket :%s, errno: %d", path, errno);
        return -1;
    }
    if (listen(sock.get(), kBacklog) != 0) {
        LOG_FAULT("can not listen socket :%s, errno: %d", path, errno);
        return -1;
    }
    *listener = std::move(sock);
    LOG_NOTE("vex_create_unix_server_socket OK \n");
    return 0;
}

void log_server_handle_realtimelog(unique_fd listener, int log_type, int stop_fd, log_stream &stream)
{
    LOG_NOTE("%s enter ", __func__);
    if (log_wait_ready(listener.get(), POLLIN, stop_fd, -1) == 0) {
        LOG_NOTE("%s: log_type[%d] is not wanted any more\n", __func__, log_type);
        return;
    }
    const unique_fd program{accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC)};
    if (!program) {
        LOG_FAULT("can not accept client, errno: %d", errno);
        return;
    }
    if (!log_peer_is_ours(program.get())) {
        LOG_FAULT("%s: log_type[%d] refuses another user's program\n", __func__, log_type);
        return;
    }
    LOG_NOTE("%s: client fd=[%d] log_type[%d] connect", __func__, program.get(), log_type);
    unsigned char piece[kLogPieceMax] = {};
    const int error = log_read_pieces([&] { return recv(program.get(), piece, sizeof piece, 0); },
                                      [&](std::size_t len) { log_stream_send(stream, piece, static_cast<int>(len)); });
    if (error != 0)
        LOG_NOTE("%s:recvfrom error,errno msg=%s\n", __func__, std::strerror(error));
    else
        LOG_NOTE("%s:recvcount=0,client close log_type=[%d]\n", __func__, log_type);
}

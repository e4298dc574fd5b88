#include "protocol/log_recv.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_registry.h"
#include "protocol/log_reassembly.h"

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";
constexpr char kName[] = "log_recv_tcp_msg"; /* the routine that the log lines speak of */

constexpr useconds_t kInterruptedPause = 20000; /* microseconds */

/* Serves the connection for as long as it lives, and closes it whichever way its thread ends. */
struct cmd_owner {
    explicit cmd_owner(int connection) : fd(connection) { log_cmd_serve(fd); }
    ~cmd_owner() { log_cmd_close(fd); }
    cmd_owner(const cmd_owner &) = delete;
    cmd_owner &operator=(const cmd_owner &) = delete;
    const int fd;
};

/* The blocking read, the one place where the thread can be cancelled. Nobody cancels one that reads a TLS session. */
ssize_t read_piece(int fd, unsigned char *piece)
{
    if (g_daemon.use_ssl == 1) {
        SSL *const session = log_cmd_session();
        return session != nullptr ? g_daemon.ssl_read(session, piece, kLogPieceMax) : 0;
    }
    pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, nullptr);
    const ssize_t n = recv(fd, piece, kLogPieceMax, 0);
    pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
    return n;
}

/* Logs why the peer's bytes have ended: an error, or 0. One that was replaced did not end them. */
void log_end(int error)
{
    if (!log_cmd_stands())
        return;
    if (error != 0)
        LOG_NOTE("%s:recvfrom error,errno msg=%s\n", kName, std::strerror(error));
    else
        LOG_NOTE("%s:recvcount=0,client close\n", kName);
}

/* Reads and handles pieces until the connection has ended. */
void receive(int fd)
{
    log_reassembly state;
    unsigned char first[kLogPieceMax];
    for (;;) {
        unsigned char *const room = log_reassembly_room(state);
        unsigned char *const piece = room != nullptr ? room : first;
        const ssize_t n = read_piece(fd, piece);
        if (n == -1 && errno == EINTR) {
            usleep(kInterruptedPause);
            continue;
        }
        if (n <= 0) {
            log_end(n == -1 ? errno : 0);
            return;
        }
        LOG_NOTE("%s:===========recv data len =%d===================\n", kName, static_cast<int>(n));
        log_proc_tcp_pkg(state, {piece, static_cast<std::size_t>(n)});
        LOG_NOTE("%s:===========waiting recv data ==================\n", kName);
    }
}

} // namespace

void *log_recv_argument(int fd)
{
    return reinterpret_cast<void *>(static_cast<std::intptr_t>(fd));
}

void *log_recv_tcp_msg(void *connection)
{
    pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
    const int fd = static_cast<int>(reinterpret_cast<std::intptr_t>(connection));
    {
        const cmd_owner owner{fd};
        LOG_NOTE("enter %s: fd=[%d]\n", __func__, fd);
        receive(fd);
    }
    LOG_NOTE("exit %s: fd=[%d]\n", __func__, fd);
    return nullptr;
}

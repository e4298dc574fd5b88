#include "transport/log_intake.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_streams.h"
#include "core/log_threads.h"
#include "core/log_tools.h"
#include "platform/unique_fd.h"

#include <cerrno>
#include <cstring>
#include <sched.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>
#include <utility>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr int kBacklog = 1;
constexpr int kPieceMax = 2000;                 /* bytes that are taken, and sent on, at a time */
constexpr useconds_t kInterruptedPause = 20000; /* microseconds */

/* Stores a socket that listens at the path; -1 on failure (logged), and nothing is stored. */
int vex_create_unix_server_socket(const char *path, int *out_fd)
{
    LOG_NOTE("%s enter\n", __func__);
    if (path == nullptr || out_fd == nullptr) {
        LOG_FAULT("socket_fd or vex_server_path is null");
        return -1;
    }
    unique_fd sock{socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    if (!sock) {
        LOG_FAULT("can not create socket. errno: %d", errno);
        return -1;
    }
    sockaddr_un at{};
    at.sun_family = AF_UNIX;
    std::memcpy(at.sun_path, path, strnlen(path, sizeof at.sun_path - 1));
    unlink(path); /* what an earlier intake left behind */
    if (bind(sock.get(), reinterpret_cast<const sockaddr *>(&at), sizeof at) != 0) {
        LOG_FAULT("can not bind socket :%s, errno: %d", path, errno);
        return -1;
    }
    if (listen(sock.get(), kBacklog) != 0) {
        LOG_FAULT("can not listen socket :%s, errno: %d", path, errno);
        return -1;
    }
    *out_fd = sock.release();
    LOG_NOTE("vex_create_unix_server_socket OK \n");
    return 0;
}

/* Logs why the program's bytes have ended: an error, or 0. */
void log_end(int error, int log_type)
{
    constexpr char kName[] = "log_server_handle_realtimelog";
    if (error != 0)
        LOG_NOTE("%s:recvfrom error,errno msg=%s\n", kName, std::strerror(error));
    else
        LOG_NOTE("%s:recvcount=0,client close log_type=[%d]\n", kName, log_type);
}

/*
 * Sends pieces on as they come. While they come full, there is more behind them, and the network need not have each by
 * itself: then the link's session may hold them back, until there is nothing more to read.
 */
class log_forwarder
{
public:
    explicit log_forwarder(log_stream stream) : stream_(stream) {}

    /* How to receive the next piece: while something may be held back, without waiting. */
    int receive_flags() const { return holding_ != nullptr ? MSG_DONTWAIT : 0; }

    /* Without a link that takes them, bytes are lost. */
    void send(const unsigned char *piece, int len)
    {
        const log_link_use link{stream_};
        if (len == kPieceMax && link.ssl() != holding_) {
            holding_ = link.ssl();
            if (holding_ != nullptr)
                g_daemon.ssl_hold(holding_, true);
        }
        log_send_packet(link.fd(), link.ssl(), piece, len);
    }

    /* Has what is held back sent. */
    void let_go()
    {
        const log_link_use link{stream_};
        SSL *const held = std::exchange(holding_, nullptr);
        if (held != nullptr && held == link.ssl()) /* else it went with its link */
            g_daemon.ssl_hold(held, false);
    }

private:
    const log_stream stream_;
    SSL *holding_ = nullptr;
};

/* Sends on what the program writes until it has closed its end. */
void forward(int fd, log_stream stream, int log_type)
{
    unsigned char piece[kPieceMax] = {};
    log_forwarder forwarder{stream};
    for (bool yielded = false;;) {
        const ssize_t n = recv(fd, piece, sizeof piece, forwarder.receive_flags());
        if (n > 0) {
            forwarder.send(piece, static_cast<int>(n));
            yielded = false;
        } else if (n == -1 && errno == EINTR) {
            usleep(kInterruptedPause);
        } else if (n == -1 && errno == EAGAIN) {
            if (yielded)
                forwarder.let_go();
            else
                sched_yield(); /* a program that floods gets to write more than the few bytes that would wake us */
            yielded = true;
        } else {
            log_end(n == -1 ? errno : 0, log_type);
            forwarder.let_go();
            return;
        }
    }
}

/* Serves one program at a listening socket, which is closed then. */
void log_server_handle_realtimelog(int listen_fd, log_stream stream)
{
    const unique_fd listener{listen_fd};
    const int log_type = static_cast<int>(stream);
    LOG_NOTE("%s enter ", __func__);
    const unique_fd program{accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC)};
    const int error = errno;
    if (!log_intake_done_waiting(stream, listener.get())) {
        LOG_NOTE("%s: log_type[%d] is not wanted any more\n", __func__, log_type);
    } else if (!program) {
        LOG_FAULT("can not accept client, errno: %d", error);
    } else {
        LOG_NOTE("%s: client fd=[%d] log_type[%d] connect", __func__, program.get(), log_type);
        forward(program.get(), stream, log_type);
    }
}

void run_intake(const char *body, const char *path, log_stream stream)
{
    LOG_NOTE("enter %s.\n", body);
    int listen_fd = -1;
    vex_create_unix_server_socket(path, &listen_fd);
    if (log_intake_listens(stream, listen_fd))
        log_server_handle_realtimelog(listen_fd, stream);
    else if (listen_fd != -1)
        close(listen_fd);
}

void *log_recv_syslog_thread_proc(void *)
{
    run_intake(__func__, kSyslogIntake, log_stream::syslog);
    return nullptr;
}

void *log_recv_qxdm_thread_proc(void *)
{
    run_intake(__func__, kQxdmIntake, log_stream::qxdm);
    return nullptr;
}

int start(const char *starter, void *(*body)(void *), log_stream stream)
{
    log_intake_starting(stream);
    const int result = log_start_thread(starter, body);
    if (result != 0)
        log_intake_listens(stream, -1);
    log_intake_await(stream);
    return result;
}

} // namespace

int vex_log_recv_syslog_thread()
{
    return start(__func__, log_recv_syslog_thread_proc, log_stream::syslog);
}

int vex_log_recv_qxdm_thread()
{
    return start(__func__, log_recv_qxdm_thread_proc, log_stream::qxdm);
}

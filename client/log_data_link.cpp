#include "client/log_data_link.h"

#include "client/log_connect.h"
#include "client/log_identity.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_local_syslog.h"
#include "core/log_streams.h"
#include "core/log_threads.h"
#include "core/log_tools.h"
#include "protocol/log_pkg_send.h"
#include "protocol/log_reassembly.h"

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr int kAnnounceMax = 3;                 /* sends of the announcement until one succeeds */
constexpr useconds_t kInterruptedPause = 20000; /* microseconds */

/* Tells the server which stream of which device the link is for. */
int announce(const char *body, const log_link &link)
{
    const log_identity device = log_read_identity();
    char text[1024];
    std::snprintf(text, sizeof text,
                  "{\"msgid\":\"10\",\"DataLink\":{\"VersionInfo\":\"%s\",\"projectName\":\"%s\",\"imei\":\"%s\","
                  "\"modem_msn\":\"%s\",\"ConnectType\":\"%s\"},\"Result\":\"\"}",
                  device.version, device.model, device.imei, device.msn,
                  link.stream == log_stream::syslog ? "syslog_connect" : "modemlog_connect");
    /* Nobody else sends on the link before its socket is recorded. */
    int result = log_send_pkg_msg(link.fd, link.ssl, text, "", 0);
    for (int i = 1; result != 0 && i < kAnnounceMax; ++i) {
        LOG_NOTE("%s :try send pkg msg \n", body);
        result = log_send_pkg_msg(link.fd, link.ssl, text, "", 0);
    }
    return result;
}

ssize_t read_piece(const log_link &link, unsigned char *piece)
{
    if (g_daemon.use_ssl != 1)
        return recv(link.fd, piece, kLogPieceMax, 0);
    return link.ssl != nullptr ? g_daemon.ssl_read(link.ssl, piece, kLogPieceMax) : 0;
}

/* Reads and handles pieces until the link has ended. */
void receive(const char *name, const log_link &link)
{
    log_reassembly state;
    unsigned char piece[kLogPieceMax];
    for (;;) {
        const ssize_t n = read_piece(link, piece);
        if (n == -1 && errno == EINTR) {
            usleep(kInterruptedPause);
            continue;
        }
        if (n < 0) {
            LOG_NOTE("%s:recvfrom error,errno msg=%s\n", name, std::strerror(errno));
            return;
        }
        if (n == 0) {
            LOG_NOTE("%s:recvcount=0,client close fd[%d]\n", name, link.fd);
            return;
        }
        if (!log_link_stands()) {
            LOG_NOTE("%s: the stream was stopped or started anew, what fd[%d] brought is dropped\n", name, link.fd);
            return;
        }
        LOG_NOTE("%s:recvbuf=%.*s\n", name, static_cast<int>(n), reinterpret_cast<const char *>(piece));
        log_proc_tcp_pkg(state, {piece, static_cast<std::size_t>(n)});
    }
}

/* Back to the device's local logging, unless the stream has been taken up again on another link. */
void log_locally(const log_link &link)
{
    if (!log_link_is_latest(link))
        return;
    if (link.stream == log_stream::syslog)
        log_restart_local_syslog();
    else
        log_exec_cmd("diag_mdlog -k ");
}

/* Reads the link until it ends, and closes it. */
void log_recv_server_msg(const log_link &link)
{
    LOG_NOTE("enter %s: fd=[%d]\n", __func__, link.fd);
    log_link_serve(link);
    receive(__func__, link);
    {
        const log_producer_turn turn{link.stream};
        log_link_close(link);
        log_locally(link);
    }
    LOG_NOTE("exit %s: fd=[%d]\n", __func__, link.fd);
}

/* A link that is not used after all. */
void give_up(const log_link &link)
{
    const log_producer_turn turn{link.stream};
    log_link_close(link);
}

/* Announces a link that has just been connected, and serves it. */
void serve(const char *body, const log_link &link)
{
    const bool wanted = log_link_record_session(link);
    const int announced = wanted ? announce(body, link) : -1;
    if (wanted && link.stream == log_stream::syslog)
        LOG_NOTE("g_sock_fd.syslog_ssl = [%p]\n", static_cast<void *>(link.ssl));
    if (announced == 0 && log_link_record(link)) {
        log_recv_server_msg(link);
        return;
    }
    if (wanted && announced != 0)
        LOG_NOTE("%s :close(%d) syslog connect \n", body, link.fd);
    else
        LOG_NOTE("%s: the stream was stopped or started anew, close(%d)\n", body, link.fd);
    give_up(link);
}

void run_link(const char *body, log_stream stream, const void *argument)
{
    LOG_NOTE("enter %s.\n", body);
    log_link link{.stream = stream, .start = static_cast<unsigned>(reinterpret_cast<std::uintptr_t>(argument))};
    if (log_link_begin(link))
        link.fd = log_connect_server(link.target.ip, link.target.port, &link.ssl, &link);
    if (link.fd != -1)
        serve(body, link);
    log_link_end(link);
}

void *log_client_syslog_thread_proc(void *start)
{
    run_link(__func__, log_stream::syslog, start);
    return nullptr;
}

void *log_client_qxdm_thread_proc(void *start)
{
    run_link(__func__, log_stream::qxdm, start);
    return nullptr;
}

int start_link(const char *starter, void *(*body)(void *), log_stream stream, unsigned start)
{
    const int result = log_start_thread(starter, body, reinterpret_cast<void *>(std::uintptr_t{start}));
    if (result != 0)
        log_link_end({.stream = stream, .start = start});
    return result;
}

} // namespace

int vex_log_client_syslog_thread(unsigned start)
{
    return start_link(__func__, log_client_syslog_thread_proc, log_stream::syslog, start);
}

int vex_log_client_qxdm_thread(unsigned start)
{
    return start_link(__func__, log_client_qxdm_thread_proc, log_stream::qxdm, start);
}

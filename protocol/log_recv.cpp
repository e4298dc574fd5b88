#include "protocol/log_recv.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_registry.h"

#include <cstring>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";
constexpr char kName[] = "log_recv_tcp_msg"; /* the routine that the log lines speak of */

bool take_piece(log_link &link, log_reassembly &state, std::span<const unsigned char> piece)
{
    if (g_daemon.run_mode == 0 && log_take_request_line(state.opening, piece)) {
        LOG_NOTE("%s: fd=[%d] sends an HTTP request, closed\n", kName, link.fd.get());
        return false;
    }
    if (!state.is_silent())
        LOG_NOTE("%s:===========recv data len =%d===================\n", kName, static_cast<int>(piece.size()));
    log_proc_tcp_pkg(state, piece);
    if (!state.is_silent())
        LOG_NOTE("%s:===========waiting recv data ==================\n", kName);
    return true;
}

/* Logs why the peer's bytes have ended: an error, or 0. One that was replaced or refused did not end them. */
void log_end(const log_link &link, int error)
{
    if (link.taken || error == -1)
        return;
    if (error != 0)
        LOG_NOTE("%s:recvfrom error,errno msg=%s\n", kName, std::strerror(error));
    else
        LOG_NOTE("%s:recvcount=0,client close\n", kName);
}

} // namespace

int log_recv_link(log_link &link, log_take_piece take)
{
    log_reassembly state;
    unsigned char piece[kLogPieceMax];
    bool wanted = true;
    const int error = log_read_pieces([&] { return wanted ? link.read(piece, sizeof piece) : 0; },
                                      [&](std::size_t len) {
                                          wanted = take(link, state, {piece, len});
                                      });
    return wanted ? error : -1;
}

void log_recv_tcp_msg(log_link &link, void (*close)(log_link &link))
{
    const int fd = link.fd.get();
    {
        const log_serving serving{link};
        LOG_NOTE("enter %s: fd=[%d]\n", __func__, fd);
        log_end(link, log_recv_link(link, take_piece));
        log_cmd_forget(link);
        close(link);
    }
    LOG_NOTE("exit %s: fd=[%d]\n", __func__, fd);
}

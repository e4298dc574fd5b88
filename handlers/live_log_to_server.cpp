#include "client/log_data_link.h"
#include "core/daemon_state.h"
#include "core/log_local_syslog.h"
#include "core/log_streams.h"
#include "core/log_tools.h"
#include "handlers/live_log.h"
#include "transport/log_intake.h"

namespace
{

/* Opens the data link; over TLS, the intake first, so that it listens before the server can confirm the link. */
void open_link(log_stream stream, const live_log_request &request, int (*start_intake)(), int (*start_link)(unsigned))
{
    const int port = log_text_to_int(request.port);
    const unsigned start = log_stream_start(stream, request.ip, port);
    if (g_daemon.use_ssl == 1)
        start_intake();
    start_link(start);
    live_log_reply({"tcp", port, request.ip});
}

void start_syslog(const live_log_request &request)
{
    g_daemon.syslog_realtime_on = 1;
    open_link(log_stream::syslog, request, vex_log_recv_syslog_thread, vex_log_client_syslog_thread);
}

void end_syslog()
{
    {
        const log_producer_turn turn{log_stream::syslog};
        log_exec_cmd("killall -9 syslogd");
        log_stream_stop(log_stream::syslog);
        g_daemon.syslog_realtime_on = 0;
        log_restart_local_syslog();
    }
    live_log_reply({"tcp", 0, ""});
}

void start_modem(const live_log_request &request)
{
    {
        const log_producer_turn turn{log_stream::qxdm};
        if (!live_log_prepare_modem()) {
            log_stream_taken_elsewhere(log_stream::qxdm);
            return;
        }
    }
    open_link(log_stream::qxdm, request, vex_log_recv_qxdm_thread, vex_log_client_qxdm_thread);
}

void end_modem()
{
    {
        const log_producer_turn turn{log_stream::qxdm};
        log_exec_cmd("diag_mdlog -k");
        log_stream_stop(log_stream::qxdm);
    }
    live_log_reply({"tcp", 0, ""});
}

} // namespace

bool live_log_serve_server(const live_log_request &request)
{
    if (request.asks("syslog", "start"))
        start_syslog(request);
    else if (request.asks("syslog", "end"))
        end_syslog();
    else if (request.asks("qxdm", "start"))
        start_modem(request);
    else if (request.asks("qxdm", "end"))
        end_modem();
    else
        return false;
    return true;
}

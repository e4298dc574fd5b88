#include "client/log_client_ctl.h"

#include "client/log_connect.h"
#include "client/log_identity.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_registry.h"
#include "core/log_threads.h"
#include "core/log_tools.h"
#include "protocol/log_pkg_send.h"
#include "protocol/log_recv.h"

#include <cstdio>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

/* Tells the server which device calls. Whether it hears it shows by what it does next. */
void announce(int fd, SSL *session)
{
    const log_identity device = log_read_identity();
    char text[1024];
    std::snprintf(text, sizeof text,
                  "{\"msgid\":\"9\",\"ControlLink\":{\"VersionInfo\":\"%s\",\"projectName\":\"%s\",\"imei\":\"%s\","
                  "\"modem_msn\":\"%s\"},\"Result\":\"\"}",
                  device.version, device.model, device.imei, device.msn);
    LOG_NOTE("%s:%s\n", "log_client_ctl_thread_proc", text);
    log_send_pkg_msg(fd, session, text, "", 0); /* nobody else knows the link yet */
}

/* Serves the link until it ends; then it is closed. */
void log_client_handle_tcp_msg(int fd)
{
    LOG_NOTE("%s enter ", __func__);
    log_cmd_record_link(fd);
    log_recv_tcp_msg(log_recv_argument(fd));
}

void serve_link()
{
    char host[64] = {};
    char port[16] = {};
    vex_get_nv_item("log_server_addr", host, sizeof host);
    vex_get_nv_item("log_server_port", port, sizeof port);
    SSL *session = nullptr;
    const int fd = log_connect_server(host, log_text_to_int(port), &session);
    if (fd == -1)
        return;
    log_cmd_record_session(session);
    announce(fd, session);
    log_client_handle_tcp_msg(fd);
}

void *log_client_ctl_thread_proc(void *)
{
    LOG_NOTE("enter %s.\n", __func__);
    serve_link();
    LOG_NOTE("vex_log_manage exit \n");
    g_daemon.exit_flag = 1; /* last: the process may end before this thread does anything more */
    return nullptr;
}

} // namespace

int vex_log_client_ctl_thread()
{
    return log_start_thread(__func__, log_client_ctl_thread_proc);
}

#include "client/log_client_ctl.h"

#include "client/log_announce.h"
#include "client/log_connect.h"
#include "client/log_tls.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_registry.h"
#include "core/log_tools.h"
#include "protocol/log_pkg_send.h"
#include "protocol/log_recv.h"

#include <sys/socket.h>

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

constexpr auto kGoodByeMax = std::chrono::seconds(2); /* for replies that are on their way when the link ends */

/* Tells the server which device calls. Whether it hears it shows by what it does next. */
void announce(const log_link &link)
{
    char text[kAnnouncementSize];
    log_print_announcement(text, "9", "ControlLink", nullptr);
    LOG_NOTE("%s:%s\n", "log_client_ctl_thread_proc", text);
    log_send_pkg_msg(link.fd.get(), link.tls.get(), text, "", 0); /* nobody else knows the link yet */
}

void close_link(log_link &link)
{
    vex_close_ssl(link.tls.get(), 1, log_clock::now() + kGoodByeMax);
    shutdown(link.fd.get(), SHUT_RDWR); /* a handler that still runs may hold the link */
}

/* Serves the link until it ends; then it is closed. */
void log_client_handle_tcp_msg(const std::shared_ptr<log_link> &link)
{
    LOG_NOTE("%s enter ", __func__);
    log_cmd_record(link);
    log_recv_tcp_msg(*link, close_link);
}

void serve_link()
{
    char host[64] = {};
    char port[16] = {};
    vex_get_nv_item("log_server_addr", host, sizeof host);
    vex_get_nv_item("log_server_port", port, sizeof port);
    std::unique_ptr<log_tls_session> session;
    unique_fd fd{log_connect_server(host, log_text_to_int(port), &session)};
    if (!fd)
        return;
    const auto link = log_make_shared<log_link>(std::move(fd), std::move(session));
    if (!link)
        return;
    announce(*link);
    log_client_handle_tcp_msg(link);
}

void *log_client_ctl_thread_proc(void *)
{
    LOG_NOTE("enter %s.\n", __func__);
    serve_link();
    LOG_NOTE("vex_log_manage exit \n");
    log_end_process(0);
    return nullptr;
}

} // namespace

int vex_log_client_ctl_thread()
{
    return log_start_thread(__func__, log_client_ctl_thread_proc);
}

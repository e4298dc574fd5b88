#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_local_syslog.h"
#include "core/log_streams.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/live_log.h"
#include "transport/log_intake.h"

namespace
{

/* Whether the server means this device. */
bool is_for_this_device(const cJSON *link)
{
    const char *const imei = log_member_text(link, "imei", "K_Imei");
    if (imei == nullptr)
        return false;
    LOG_NOTE("imei = %s\n", imei);
    char own[64] = {};
    vex_get_nv_item("imei", own, sizeof own);
    if (std::strcmp(imei, own) == 0)
        return true;
    LOG_NOTE("imei = [%s] is incorrect\n", imei);
    return false;
}

/* Whether the data link that brought the confirmation still stands: else it would have a program started for the stream
 * that comes after. What the control link brings is for whatever link there is. */
bool came_in_time()
{
    if (log_link_stands())
        return true;
    LOG_NOTE("the data link was stopped before it was confirmed\n");
    return false;
}

/* The socket that the stream's log program is to write to: over TLS, one that is connected to the stream's intake;
 * else the data link, which may be -1. -1 when there is no connection to the intake (logged). */
int producer_socket(log_stream stream, int link_fd, const char *intake)
{
    if (g_daemon.use_ssl != 1)
        return link_fd;
    const int fd = log_connect_unix_socket(intake);
    log_local_record(stream, fd);
    return fd;
}

void start_syslog()
{
    const log_producer_turn turn{log_stream::syslog};
    if (!came_in_time())
        return;
    const int link_fd = log_link_for_producer(log_stream::syslog);
    if (link_fd == -1)
        return;
    const int fd = producer_socket(log_stream::syslog, link_fd, kSyslogIntake);
    if (fd == -1)
        return;
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "syslogd -R tcp_fd=%d &", fd);
    LOG_NOTE("cmd=[%s]\n", cmd);
    log_break_off_local_syslog();
    log_exec_cmd("killall -9 syslogd");
    log_exec_cmd_with(cmd, fd);
}

void start_modem()
{
    const log_producer_turn turn{log_stream::qxdm};
    if (!came_in_time())
        return;
    log_exec_cmd("killall -9 diag_mdlog");
    if (!live_log_has_config())
        return;
    log_exec_cmd("echo 3 > /proc/sys/vm/drop_caches");
    log_exec_cmd("rm /tmp/diag_logs");
    const int fd = producer_socket(log_stream::qxdm, log_link_for_producer(log_stream::qxdm), kQxdmIntake);
    if (fd == -1 && g_daemon.use_ssl == 1)
        return;
    char cmd[256];
    if (live_log_has_config2())
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -m %s -o /tmp/diag_logs\t-n 2 -s 10 -R tcp_fd=%d &",
                      kModemConfig, kModemConfig2, fd);
    else
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -o /tmp/diag_logs -n 2 -s 10 -R tcp_fd=%d &", kModemConfig,
                      fd);
    log_exec_cmd_with(cmd, fd);
}

} // namespace

int log_msg_confirm_channel(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    const json_tree tree = log_handler_take(__func__, control, data);
    if (!tree)
        return -1;
    const cJSON *link = log_member_object(tree.get(), "DataLink", "K_DataLink");
    if (link == nullptr)
        return -1;
    const bool accepted = is_for_this_device(link);
    const char *const type = log_member_text(link, "ConnectType", "K_ConnectType");
    if (type == nullptr)
        return -1;
    LOG_NOTE("ConnectType = %s\n", type);
    if (!accepted)
        return -1;
    if (std::strcmp(type, "syslog_connect") == 0) {
        start_syslog();
    } else if (std::strcmp(type, "modemlog_connect") == 0) {
        start_modem();
    } else {
        LOG_FAULT("unknow ConnectType = [%s]\n", type);
        return -1;
    }
    return 0;
}

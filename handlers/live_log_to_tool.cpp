#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_local_syslog.h"
#include "core/log_registry.h"
#include "core/log_tools.h"
#include "handlers/live_log.h"

namespace
{

constexpr int kSyslogPort = 1514; /* UDP, on the log tool */

/* The two ends as they address each other. A tool on the LAN is told the LAN address, any other the WAN address of its
 * family. */
struct stream_ends {
    stream_ends();

    const char *client_ip = log_cmd_client_ip();
    int peer_class = log_isValidIpOrUrl(client_ip); /* 1 IPv4, 2 IPv6, 0 neither */
    char lan_ipaddr[32] = {};
    char server_ip[64] = {}; /* the device's address that the tool can reach */
};

stream_ends::stream_ends()
{
    vex_get_nv_item("lan_ipaddr", lan_ipaddr, sizeof lan_ipaddr);
    if (peer_class == 2) {
        vex_get_nv_item("ipv6_wan_ipaddr", server_ip, sizeof server_ip);
    } else {
        char lan_netmask[32] = {};
        vex_get_nv_item("lan_netmask", lan_netmask, sizeof lan_netmask);
        if (ip_in_subnet(lan_ipaddr, client_ip, lan_netmask) == 1)
            log_keep_text(server_ip, lan_ipaddr);
        else
            vex_get_nv_item("wan_ipaddr", server_ip, 32);
    }
    LOG_NOTE("server_ip is [%s]\n", server_ip);
}

/* The system log goes to the tool, line by line, and no longer to the device's own file. */
void start_syslog(const stream_ends &ends)
{
    g_daemon.syslog_realtime_on = 1;
    log_break_off_local_syslog();
    log_exec_cmd("killall -9 syslogd");
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, ends.peer_class == 2 ? "syslogd -R [%s]:%d &" : "syslogd -R %s:%d &", ends.client_ip,
                  kSyslogPort);
    log_exec_cmd(cmd);
    live_log_reply({"udp", kSyslogPort, ends.server_ip});
}

void end_syslog()
{
    log_exec_cmd("killall -9 syslogd");
    g_daemon.syslog_realtime_on = 0;
    log_restart_local_syslog();
    live_log_reply({"udp", 0, ""});
}

void start_modem(const stream_ends &ends)
{
    if (!live_log_prepare_modem())
        return;
    char cmd[256];
    if (live_log_has_config2())
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -m %s -o /tmp/diag_logs\t-n 2 -s 10 -R %s -P %d &",
                      kModemConfig, kModemConfig2, ends.lan_ipaddr, kModemPort);
    else
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -o /tmp/diag_logs  -n 2 -s 10 -R %s -P %d &", kModemConfig,
                      ends.lan_ipaddr, kModemPort);
    live_log_run_modem(cmd);
    live_log_reply({"tcp", kModemPort, ends.server_ip});
}

void end_modem()
{
    log_exec_cmd("killall -9 diag_mdlog");
    live_log_reply({"tcp", 0, ""});
}

} // namespace

bool live_log_serve_tool(const live_log_request &request)
{
    const stream_ends ends;
    if (request.asks("syslog", "start"))
        start_syslog(ends);
    else if (request.asks("syslog", "end"))
        end_syslog();
    else if (request.asks("qxdm", "start"))
        start_modem(ends);
    else if (request.asks("qxdm", "end"))
        end_modem();
    else
        return false;
    return true;
}

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_local_syslog.h"
#include "core/log_registry.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

#include <cstring>
#include <unistd.h>

namespace
{

constexpr int kSyslogPort = 1514;   /* UDP, on the log tool */
constexpr int kModemPort = 25555;   /* TCP, on the device */
constexpr unsigned kModemStart = 2; /* seconds until the modem log program can be connected to */

constexpr char kUsbAddress[] = "192.168.255.1"; /* the device, for a PC on its USB port */
constexpr char kUsbInterface[] = "/sys/class/net/usb0";
constexpr char kModemConfig[] = "/logfs/logconf/Diag.cfg";
constexpr char kModemConfig2[] = "/logfs/logconf/Diag.cfg2";

struct realtime_request {
    char log_type[32] = {};
    char action[32] = {};
};

/* Where the log tool finds a stream. */
struct stream_place {
    const char *protocol;
    int port;
    const char *ip;
};

/* The two ends as they address each other. */
struct stream_ends {
    int peer_class = 0; /* of the tool's address: 1 IPv4, 2 IPv6, 0 neither */
    const char *client_ip = log_cmd_client_ip();
    char lan_ipaddr[32] = {};
    char server_ip[64] = {}; /* the device's address that the tool can reach */
};

void reply(const stream_place &place, const char *result = kSuccess)
{
    log_reply("{\"msgid\":\"6\",\"realtimeLog\":{\"LogType\":\"\",\"Action\":\"\",\"protocol\":\"%s\",\"port\":\"%d\","
              "\"ip\":\"%s\"},\"Result\":\"%s\"}",
              place.protocol, place.port, place.ip, result);
}

/* Reads the request; false, after a log line, when it is not complete. */
bool read_request(const cJSON *tree, realtime_request *request)
{
    const cJSON *realtime = log_member_object(tree, "realtimeLog", "K_realtimeLog");
    if (realtime == nullptr)
        return false;
    const char *log_type = log_member_text(realtime, "LogType", "K_LogType");
    if (log_type != nullptr)
        LOG_NOTE("LogType = %s\n", log_type);
    const char *action = log_member_text(realtime, "Action", "K_Action");
    if (action != nullptr)
        LOG_NOTE("Action = %s\n", action);
    if (log_type == nullptr || action == nullptr)
        return false;
    log_keep_text(request->log_type, log_type);
    log_keep_text(request->action, action);
    return true;
}

/* A tool on the LAN is told the LAN address, any other the WAN address of its family. */
void find_ends(stream_ends *ends)
{
    ends->peer_class = log_isValidIpOrUrl(ends->client_ip);
    vex_get_nv_item("lan_ipaddr", ends->lan_ipaddr, sizeof ends->lan_ipaddr);
    if (ends->peer_class == 2) {
        vex_get_nv_item("ipv6_wan_ipaddr", ends->server_ip, sizeof ends->server_ip);
    } else {
        char lan_netmask[32] = {};
        vex_get_nv_item("lan_netmask", lan_netmask, sizeof lan_netmask);
        if (ip_in_subnet(ends->lan_ipaddr, ends->client_ip, lan_netmask) == 1)
            log_keep_text(ends->server_ip, ends->lan_ipaddr);
        else
            vex_get_nv_item("wan_ipaddr", ends->server_ip, 32);
    }
    LOG_NOTE("server_ip is [%s]\n", ends->server_ip);
}

/* The system log goes to the tool, line by line, and no longer to the device's own file. */
void start_syslog(const stream_ends &ends)
{
    g_daemon.syslog_realtime_on = 1;
    log_exec_cmd("killall -9 syslogd");
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, ends.peer_class == 2 ? "syslogd -R [%s]:%d &" : "syslogd -R %s:%d &", ends.client_ip,
                  kSyslogPort);
    log_exec_cmd(cmd);
    reply({"udp", kSyslogPort, ends.server_ip});
}

void end_syslog()
{
    log_exec_cmd("killall -9 syslogd");
    g_daemon.syslog_realtime_on = 0;
    log_restart_local_syslog();
    reply({"udp", 0, ""});
}

/* Whether this is a plug-in module in a PC, which reaches it by USB only. */
bool is_usb_module()
{
    char product_type[16] = {};
    vex_get_nv_item("product_type", product_type, sizeof product_type);
    return std::strcmp(product_type, "MODULE") == 0 && access(kUsbInterface, F_OK) == 0;
}

/* Runs the modem log program, which then listens at the address. */
void run_modem_log(const char *cmd)
{
    log_exec_cmd(cmd);
    sleep(kModemStart);
}

void start_modem_log_on_usb()
{
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "diag_mdlog -o /tmp/diag_logs -f %s -n 2 -s 10 -R %s -P %d &", kModemConfig,
                  kUsbAddress, kModemPort);
    run_modem_log(cmd);
    reply({"tcp", kModemPort, kUsbAddress});
}

void start_modem_log_on_lan(const stream_ends &ends)
{
    char cmd[256];
    if (access("/logfs/logconf//Diag.cfg2", F_OK) == 0)
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -m %s -o /tmp/diag_logs\t-n 2 -s 10 -R %s -P %d &",
                      kModemConfig, kModemConfig2, ends.lan_ipaddr, kModemPort);
    else
        std::snprintf(cmd, sizeof cmd, "diag_mdlog -f %s -o /tmp/diag_logs  -n 2 -s 10 -R %s -P %d &", kModemConfig,
                      ends.lan_ipaddr, kModemPort);
    run_modem_log(cmd);
    reply({"tcp", kModemPort, ends.server_ip});
}

void start_modem_log(const stream_ends &ends)
{
    log_exec_cmd("killall -9 diag_mdlog");
    log_exec_cmd("killall -9 diag_socket_log");
    if (access("/logfs/logconf//Diag.cfg", F_OK) != 0) {
        LOG_NOTE("qxdm Diag.cfg is not exisit\n");
        reply({"", 0, ""}, "Fail:Modem file is not exisit");
        return;
    }
    if (is_usb_module()) {
        start_modem_log_on_usb();
        return;
    }
    log_exec_cmd("echo 3 > /proc/sys/vm/drop_caches &");
    log_exec_cmd("rm /tmp/diag_logs &");
    start_modem_log_on_lan(ends);
}

void end_modem_log()
{
    log_exec_cmd("killall -9 diag_mdlog");
    reply({"tcp", 0, ""});
}

void serve(const realtime_request &request)
{
    stream_ends ends;
    find_ends(&ends);
    const auto asks = [&request](const char *log_type, const char *action) {
        return std::strcmp(request.log_type, log_type) == 0 && std::strcmp(request.action, action) == 0;
    };
    if (asks("syslog", "start"))
        start_syslog(ends);
    else if (asks("syslog", "end"))
        end_syslog();
    else if (asks("qxdm", "start"))
        start_modem_log(ends);
    else if (asks("qxdm", "end"))
        end_modem_log();
    else
        log_reply_text(""); /* refused */
}

} // namespace

int log_msg_set_realtime_log(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    if (!log_handler_entered(__func__, control, data))
        return -1;
    const json_tree tree = log_handler_parse(control);
    if (!tree)
        return -1;
    log_handler_received(__func__, control);
    realtime_request request;
    if (!read_request(tree.get(), &request)) {
        reply({"", 0, ""}, kInternalError);
    } else if (g_daemon.run_mode != 0) {
        LOG_FAULT("live logs in client mode are not part of this build\n");
        reply({"", 0, ""}, kInternalError);
    } else {
        serve(request);
    }
    return 0;
}

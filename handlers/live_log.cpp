#include "handlers/live_log.h"

#include "client/log_stream.h"
#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_programs.h"
#include "core/log_registry.h"
#include "core/log_tools.h"

namespace
{

live_log_answer answer(const char *protocol, int port, const char *ip)
{
    live_log_answer made{.protocol = protocol, .port = port};
    log_keep_text(made.ip, ip);
    return made;
}

/* The two ends as they address each other. A tool on the LAN is told the LAN address, any other the WAN address of its
 * family. */
struct stream_ends {
    stream_ends();

    const log_link *const tool = log_served();
    const char *client_ip = tool != nullptr ? tool->client_ip : "";
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
live_log_answer start_syslog(const stream_ends &ends)
{
    g_daemon.syslog_realtime_on = 1;
    log_program_change change{log_kind::syslog};
    log_send_syslog_to_tool(change, ends.client_ip, ends.peer_class);
    return answer("udp", kLogSyslogPort, ends.server_ip);
}

live_log_answer end_syslog()
{
    log_program_change change{log_kind::syslog};
    log_end_syslog(change);
    g_daemon.syslog_realtime_on = 0;
    log_restart_local_syslog(change, log_read_syslog_items(32));
    return answer("udp", 0, "");
}

/* Ends the modem's log and makes ready for a new one; the answer when there will be none, or it has been started
 * already. */
std::optional<live_log_answer> prepare_modem(log_program_change &change)
{
    switch (log_prepare_modem(change)) {
    case log_modem_start::no_config:
        return live_log_answer{.result = "Fail:Modem file is not exisit"};
    case log_modem_start::on_usb:
        return answer("tcp", kLogModemPort, kLogModemUsbAddress);
    case log_modem_start::ready:
        break;
    }
    return std::nullopt;
}

live_log_answer start_modem(const stream_ends &ends)
{
    log_program_change change{log_kind::qxdm};
    if (const auto other = prepare_modem(change))
        return *other;
    log_offer_modem_at(change, ends.lan_ipaddr);
    return answer("tcp", kLogModemPort, ends.server_ip);
}

live_log_answer end_modem()
{
    log_program_change change{log_kind::qxdm};
    change.end_by("killall -9 diag_mdlog");
    return answer("tcp", 0, "");
}

/* Opens the data link of a stream. */
live_log_answer open_link(log_kind kind, const live_log_request &request)
{
    const int port = log_text_to_int(request.port);
    log_stream_start(kind, request.ip, port);
    return answer("tcp", port, request.ip);
}

live_log_answer start_modem_link(const live_log_request &request)
{
    log_stream_own_program(log_kind::qxdm, false); /* should the log go to USB, the end of a link leaves it alone */
    std::optional<live_log_answer> other;
    {
        log_program_change change{log_kind::qxdm};
        other = prepare_modem(change);
    }
    if (other && std::strcmp(other->result, kSuccess) == 0)
        return *other;
    log_stream_own_program(log_kind::qxdm, true);
    return other ? *other : open_link(log_kind::qxdm, request);
}

live_log_answer close_link(log_kind kind)
{
    log_stream_end(kind);
    return answer("tcp", 0, "");
}

} // namespace

std::optional<live_log_answer> live_log_serve_tool(const live_log_request &request)
{
    const stream_ends ends;
    if (request.asks("syslog", "start"))
        return start_syslog(ends);
    if (request.asks("syslog", "end"))
        return end_syslog();
    if (request.asks("qxdm", "start"))
        return start_modem(ends);
    if (request.asks("qxdm", "end"))
        return end_modem();
    return std::nullopt;
}

std::optional<live_log_answer> live_log_serve_server(const live_log_request &request)
{
    if (request.asks("syslog", "start")) {
        g_daemon.syslog_realtime_on = 1;
        return open_link(log_kind::syslog, request);
    }
    if (request.asks("syslog", "end"))
        return close_link(log_kind::syslog);
    if (request.asks("qxdm", "start"))
        return start_modem_link(request);
    if (request.asks("qxdm", "end"))
        return close_link(log_kind::qxdm);
    return std::nullopt;
}

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "handlers/handlers.h"
#include "handlers/live_log.h"

namespace
{

/* Whether an address is kept, and goes into the reply, as it is. */
bool can_be_replied(const char *ip)
{
    std::size_t len = 0;
    for (; ip[len] != '\0'; ++len)
        if (static_cast<unsigned char>(ip[len]) < ' ' || ip[len] == 0x7f || std::strchr("\"'\\", ip[len]) != nullptr)
            return false;
    return len < sizeof live_log_request::ip;
}

/* The address to which a start wants the log; one that cannot be replied is none. Any other request may have any text. */
const char *read_ip(const cJSON *realtime, bool starts)
{
    const char *const ip = log_member_told(realtime, "ip", "K_ip", "server IP = [%s]\n");
    if (ip == nullptr || !starts || can_be_replied(ip))
        return ip;
    LOG_NOTE("this IP cannot be used\n");
    return nullptr;
}

/* Reads the server's address, which a request has in client mode only. */
bool read_server(const cJSON *realtime, bool starts, live_log_request *request)
{
    const char *const ip = read_ip(realtime, starts);
    const char *const port = log_member_told(realtime, "port", "K_port", "server Port = [%s]\n");
    if (ip == nullptr || port == nullptr)
        return false;
    log_keep_text(request->ip, ip);
    log_keep_text(request->port, port);
    return true;
}

/* Reads the request; false, after a log line, when it is not complete. */
bool read_request(const cJSON *tree, live_log_request *request)
{
    const cJSON *realtime = log_member_object(tree, "realtimeLog", "K_realtimeLog");
    if (realtime == nullptr)
        return false;
    const char *const log_type = log_member_told(realtime, "LogType", "K_LogType", "LogType = %s\n");
    const char *const action = log_member_told(realtime, "Action", "K_Action", "Action = %s\n");
    const bool has_server = g_daemon.run_mode != 1 ||
                            read_server(realtime, action != nullptr && std::strcmp(action, "start") == 0, request);
    if (log_type == nullptr || action == nullptr || !has_server)
        return false;
    log_keep_text(request->log_type, log_type);
    log_keep_text(request->action, action);
    return true;
}

void reply(const live_log_answer &answer)
{
    log_reply("{\"msgid\":\"6\",\"realtimeLog\":{\"LogType\":\"\",\"Action\":\"\",\"protocol\":\"%s\",\"port\":\"%d\","
              "\"ip\":\"%s\"},\"Result\":\"%s\"}",
              answer.protocol, answer.port, answer.ip, answer.result);
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
    live_log_request request;
    if (!read_request(tree.get(), &request))
        reply({.result = kInternalError});
    else if (const auto answer = g_daemon.run_mode == 0 ? live_log_serve_tool(request) : live_log_serve_server(request))
        reply(*answer);
    else
        log_reply("%s", ""); /* refused */
    return 0;
}

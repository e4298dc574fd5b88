#include "core/log_line.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

#include <cstring>

namespace
{

constexpr int kCapturesMax = 4;      /* interfaces captured at once */
constexpr int kSnapshotLength = 128; /* bytes kept of a packet where the request does not say */

struct capture_request {
    char interfaces[128] = {};
    char action[32] = {};
    int snapshot_length = kSnapshotLength;
};

/* Reads the request; false, after a log line, when it is not complete. */
bool read_request(const cJSON *request, capture_request *capture)
{
    const cJSON *tcpdump = log_member_object(request, "tcpdump", "K_tcpdump");
    if (tcpdump == nullptr)
        return false;
    const char *interfaces = log_member_told(tcpdump, "InterfaceName", "K_InterfaceName", "InterfaceName = %s\n");
    const char *action = log_member_told(tcpdump, "Action", "K_Action", "Action = %s\n");
    /* The one member that may be missing without a word. */
    if (const char *length = cJSON_GetStringValue(cJSON_GetObjectItem(tcpdump, "TcpdumpLen")); length != nullptr) {
        LOG_NOTE("TcpdumpLen = %s\n", length);
        capture->snapshot_length = log_text_to_int(length);
    }
    if (interfaces == nullptr || action == nullptr)
        return false;
    log_keep_text(capture->interfaces, interfaces);
    log_keep_text(capture->action, action);
    return true;
}

void stop_captures()
{
    log_exec_cmd("killall tcpdump");
}

/* Starts one capture in the background; its file has the interface's name. */
void start_capture(const char *ifname, int snapshot_length, const char *path)
{
    char interface[32] = {};
    if (std::strcmp(ifname, "wan") == 0)
        vex_get_nv_item("current_wan_interface", interface, sizeof interface);
    else
        log_keep_text(interface, std::strcmp(ifname, "lan") == 0 ? "bridge0" : ifname);
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "tcpdump -i %s -s %d -w %s/%s.pcap &", interface, snapshot_length, path, interface);
    log_exec_cmd(cmd);
}

/* Replaces all captures, and their files, by new ones. */
void start_captures(const capture_request &capture)
{
    stop_captures();
    char path[32] = {};
    vex_get_nv_item("syslog_path", path, sizeof path);
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "rm -rf %s/*.pcap", path);
    log_exec_cmd(cmd);
    LOG_NOTE("interfaceName = [%s]\n", capture.interfaces);
    for (int i = 0; i < kCapturesMax; ++i) {
        char ifname[16] = {};
        if (getNthValueSafe(i, capture.interfaces, ',', ifname, sizeof ifname) != 0)
            continue;
        LOG_NOTE("ifname = [%s]\n", ifname);
        start_capture(ifname, capture.snapshot_length, path);
    }
}

} // namespace

int log_msg_set_tcpdump_log(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    const json_tree request = log_handler_take(__func__, control, data);
    if (!request)
        return -1;
    capture_request capture;
    const bool complete = read_request(request.get(), &capture);
    if (complete && std::strcmp(capture.action, "end") == 0)
        stop_captures();
    else if (complete && std::strcmp(capture.action, "start") == 0)
        start_captures(capture);
    log_reply("{\"msgid\":\"5\",\"tcpdump\":{\"interfaceName\":\"\",\"Action\":\"\"},\"Result\":\"%s\"}",
              complete ? kSuccess : kInternalError);
    return 0;
}

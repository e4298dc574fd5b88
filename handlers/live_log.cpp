#include "handlers/live_log.h"

#include "core/log_line.h"
#include "core/log_tools.h"

#include <unistd.h>

namespace
{

constexpr unsigned kModemStart = 2; /* seconds until the modem log program can be connected to */

constexpr char kUsbAddress[] = "192.168.255.1"; /* the device, for a PC on its USB port */
constexpr char kUsbInterface[] = "/sys/class/net/usb0";

/* Whether this is a plug-in module in a PC, which reaches it by USB only. */
bool is_usb_module()
{
    char product_type[16] = {};
    vex_get_nv_item("product_type", product_type, sizeof product_type);
    return std::strcmp(product_type, "MODULE") == 0 && access(kUsbInterface, F_OK) == 0;
}

void start_on_usb()
{
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "diag_mdlog -o /tmp/diag_logs -f %s -n 2 -s 10 -R %s -P %d &", kModemConfig,
                  kUsbAddress, kModemPort);
    live_log_run_modem(cmd);
    live_log_reply({"tcp", kModemPort, kUsbAddress});
}

} // namespace

bool live_log_has_config()
{
    if (access("/logfs/logconf//Diag.cfg", F_OK) == 0)
        return true;
    LOG_NOTE("qxdm Diag.cfg is not exisit\n");
    return false;
}

bool live_log_has_config2()
{
    return access("/logfs/logconf//Diag.cfg2", F_OK) == 0;
}

void live_log_reply(const stream_place &place, const char *result)
{
    log_reply("{\"msgid\":\"6\",\"realtimeLog\":{\"LogType\":\"\",\"Action\":\"\",\"protocol\":\"%s\",\"port\":\"%d\","
              "\"ip\":\"%s\"},\"Result\":\"%s\"}",
              place.protocol, place.port, place.ip, result);
}

void live_log_run_modem(const char *cmd)
{
    log_exec_cmd(cmd);
    sleep(kModemStart);
}

bool live_log_prepare_modem()
{
    log_exec_cmd("killall -9 diag_mdlog");
    log_exec_cmd("killall -9 diag_socket_log");
    if (!live_log_has_config()) {
        live_log_reply({"", 0, ""}, "Fail:Modem file is not exisit");
        return false;
    }
    if (is_usb_module()) {
        start_on_usb();
        return false;
    }
    log_exec_cmd("echo 3 > /proc/sys/vm/drop_caches &");
    log_exec_cmd("rm /tmp/diag_logs &");
    return true;
}

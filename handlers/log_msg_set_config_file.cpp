#include "core/daemon_state.h"
#include "core/log_filemgr.h"
#include "core/log_line.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

#include <unistd.h>

namespace
{

constexpr char kPackage[] = "/logfs/logconf.tar";
constexpr char kConfigDir[] = "/logfs/logconf/";
constexpr char kSetUpScript[] = "/logfs/logconf//vex_config_sys.sh";

constexpr std::size_t kCmdSize = 128;

/* Answers the frame; the handler's result. */
int reply(bool done)
{
    log_reply("{\"msgid\":\"1\",\"conf_file\":{\"totalLength\":\"\"},\"Result\":\"%s\"}",
              done ? kSuccess : kInternalError);
    return done ? 0 : -1;
}

/* Moves the files of the package's top folder, when it has one, up into the configuration folder. */
void flatten()
{
    constexpr char kFindTop[] = "cd /logfs/logconf/ && ls -lp | grep root | awk '{print $9}' | grep /";
    char top[64] = {};
    const int found = vex_popen(kFindTop, top, sizeof top);
    LOG_NOTE("cmd=[%s],result=[%s]\n", kFindTop, top);
    if (found != 1)
        return;
    char cmd[kCmdSize];
    std::snprintf(cmd, sizeof cmd, "cd /logfs/logconf/%s && cp * /logfs/logconf/", top);
    log_exec_cmd(cmd);
    std::snprintf(cmd, sizeof cmd, "rm -rf /logfs/logconf/%s", top);
    log_exec_cmd(cmd);
}

/* Unpacks the package of `total` bytes and starts its set-up script. What fails here is in the log only. */
void complete(FILE *package, int total)
{
    LOG_NOTE("logconf file recv all,write complete\n");
    log_sync_file(package);
    if (const std::int32_t size = log_get_file_size(kPackage); size > total)
        LOG_NOTE("logconf file has %d bytes, %d were announced: an earlier one is in front of it\n", size, total);
    log_exec_cmd("rm -rf /logfs/logconf/");
    log_exec_cmd("mkdir /logfs/logconf/");
    log_exec_cmd("cd /logfs/logconf/ && tar -xf /logfs/logconf.tar");
    flatten();
    log_exec_cmd("rm -rf /logfs/logconf.tar");
    g_daemon.conf_recv_len = 0;
    if (access(kSetUpScript, F_OK) == 0)
        log_exec_cmd("sh /logfs/logconf//vex_config_sys.sh &");
}

/* Appends a piece to the package of `total` bytes, which may complete it. False when not all of it was written. */
bool append(const unsigned char *data, std::int32_t dataLen, int total)
{
    FILE *package = log_open_file(kPackage, kFileAppendReadBinary);
    if (package == nullptr) {
        LOG_NOTE("logconf file open fail\n");
        return false;
    }
    const std::int32_t written = log_write_file_full(package, data, dataLen);
    if (written < dataLen)
        LOG_NOTE("write fail,wrCount=%d,dataLen=%d\n", written, dataLen);
    if ((g_daemon.conf_recv_len += written) == total && total != 0)
        complete(package, total);
    log_sync_file(package);
    log_close_file(package);
    return written == dataLen;
}

/* The text of conf_file.totalLength; null, after a log line, when there is none. */
const char *total_length(const cJSON *request)
{
    const cJSON *conf_file = log_member_object(request, "conf_file", "conf_file");
    if (conf_file == nullptr)
        return nullptr;
    const char *total = log_member_text(conf_file, "totalLength", "totalLength");
    if (total != nullptr)
        LOG_NOTE("totalLength=%s\n", total);
    return total;
}

} // namespace

int log_msg_set_config_file(const char *control, const unsigned char *data, std::int32_t dataLen)
{
    if (!log_handler_entered(__func__, control, data))
        return -1;
    LOG_NOTE("set_config_file:recv jsonstr=[%s],dataLen=%d ", control, dataLen);
    const json_tree request = log_handler_parse(control);
    if (!request)
        return -1;
    const char *total_text = total_length(request.get());
    if (total_text == nullptr)
        return reply(false);
    const int total = log_text_to_int(total_text);
    if (dataLen > 0)
        return reply(append(data, dataLen, total));
    if (total == 0) {
        pel_remove_file(kConfigDir);
        g_daemon.conf_recv_len = 0;
    }
    return reply(true);
}

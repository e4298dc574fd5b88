#include "core/log_line.h"
#include "core/log_local_syslog.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

#include <cstdio>
#include <cstdlib>

namespace
{

constexpr std::size_t kValueSize = 256;
constexpr std::size_t kReplySize = 2048;

void add_text(cJSON *object, const char *name, const char *value)
{
    cJSON_AddItemToObject(object, name, cJSON_CreateString(value));
}

void add_nv_item(cJSON *object, const char *name, const char *item)
{
    char value[kValueSize] = {};
    vex_get_nv_item(item, value, sizeof value);
    add_text(object, name, value);
}

void fill_version_info(cJSON *info)
{
    add_nv_item(info, "projectName", "model_name");
    add_nv_item(info, "VersionNum", "integrate_version");
    add_nv_item(info, "imei", "imei");

    char value[kValueSize] = {};
    vex_popen("cat /proc/version | cut -d '#' -f 2", value, sizeof value);
    add_text(info, "CompileTime", value);

    const int size_max = log_syslog_size_max();
    LOG_NOTE("%s:syslogsizeMax = [%d]\n", "log_msg_get_version_info", size_max);
    std::snprintf(value, sizeof value, "%d", size_max);
    add_text(info, "syslogsizeMax", value);
}

/* Sends the tree unformatted, cut at the size of a version reply. Without memory to print it, nothing is
 * sent. */
void reply_tree(const cJSON *root)
{
    char *printed = cJSON_PrintUnformatted(root);
    if (printed == nullptr)
        return;
    char reply[kReplySize];
    std::snprintf(reply, sizeof reply, "%s", printed);
    log_reply_text(reply);
    cJSON_free(printed);
}

} // namespace

int log_msg_get_version_info(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    if (!log_handler_entered(__func__, control, data))
        return -1;
    log_handler_received(__func__, control);
    const json_tree root{cJSON_CreateObject()};
    if (!root) {
        LOG_NOTE("cjson create root fail\n");
        return -1;
    }
    add_text(root.get(), "msgid", "3");
    cJSON *info = cJSON_CreateObject();
    if (info == nullptr) {
        LOG_NOTE("cjson create pVersionInfo fail\n");
        return -1;
    }
    cJSON_AddItemToObject(root.get(), "VersionInfo", info);
    fill_version_info(info);
    add_text(root.get(), "Result", kSuccess);
    reply_tree(root.get());
    return 0;
}

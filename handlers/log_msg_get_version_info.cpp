#include "core/log_line.h"
#include "core/log_programs.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"
#include "protocol/log_pkg_send.h"

#include <cstdio>
#include <utility>

namespace
{

constexpr std::size_t kValueSize = 256;
constexpr std::size_t kReplySize = 2048;

/* Adds an item, which is null without memory, to an object; false, and the item is gone, when it cannot be added. */
bool add(cJSON *object, const char *name, json_tree item)
{
    if (!cJSON_AddItemToObject(object, name, item.get()))
        return false;
    [[maybe_unused]] const cJSON *const owned_by_object = item.release();
    return true;
}

bool add_text(cJSON *object, const char *name, const char *value)
{
    return add(object, name, json_tree{cJSON_CreateString(value)});
}

bool add_nv_item(cJSON *object, const char *name, const char *item)
{
    char value[kValueSize] = {};
    vex_get_nv_item(item, value, sizeof value);
    return add_text(object, name, value);
}

bool add_kernel(cJSON *info)
{
    char value[kValueSize] = {};
    vex_popen("cat /proc/version | cut -d '#' -f 2", value, sizeof value);
    return add_text(info, "CompileTime", value);
}

bool add_size_max(cJSON *info)
{
    const int size_max = log_syslog_size_max();
    LOG_NOTE("%s:syslogsizeMax = [%d]\n", "log_msg_get_version_info", size_max);
    char value[kValueSize];
    std::snprintf(value, sizeof value, "%d", size_max);
    return add_text(info, "syslogsizeMax", value);
}

bool fill_version_info(cJSON *info)
{
    return add_nv_item(info, "projectName", "model_name") && add_nv_item(info, "VersionNum", "integrate_version") &&
           add_nv_item(info, "imei", "imei") && add_kernel(info) && add_size_max(info);
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
    log_cmd_send_msg(reply);
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
    json_tree info{cJSON_CreateObject()};
    if (!info) {
        LOG_NOTE("cjson create pVersionInfo fail\n");
        return -1;
    }
    cJSON *const members = info.get();
    if (!add_text(root.get(), "msgid", "3") || !add(root.get(), "VersionInfo", std::move(info)) ||
        !fill_version_info(members) || !add_text(root.get(), "Result", kSuccess)) {
        LOG_NOTE("%s: no memory for the reply\n", __func__);
        return -1;
    }
    reply_tree(root.get());
    return 0;
}

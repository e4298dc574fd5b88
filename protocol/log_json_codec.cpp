#include "protocol/log_json_codec.h"

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_registry.h"
#include "core/log_tools.h"

#include <algorithm>
#include <cstring>

namespace
{

constexpr char kLogSource[] = "log_json_codec";

/* The message id of a parsed text; -1 when the member is missing or no string. */
int msgid_of(const cJSON *tree)
{
    const cJSON *msgid = cJSON_GetObjectItem(tree, "msgid");
    if (!cJSON_IsString(msgid)) {
        LOG_NOTE("cannot find %s item\n", "msgid");
        return -1;
    }
    LOG_NOTE("msgid=%s\n", msgid->valuestring);
    return log_text_to_int(msgid->valuestring);
}

} // namespace

json_tree log_json_parse(const char *control)
{
    for (const char *at = control; (at = std::strchr(at, '\\')) != nullptr && at[1] != '\0'; at += 2)
        if (std::strncmp(at, "\\u0000", 6) == 0)
            return nullptr;
    return json_tree{cJSON_Parse(control)};
}

int log_json_get_msgid(const char *control)
{
    if (control == nullptr) {
        LOG_NOTE("%s para null error\n", __func__);
        return -1;
    }
    if (*control == '\0') {
        LOG_NOTE("%s para len error\n", __func__);
        return -1;
    }
    const json_tree tree = log_json_parse(control);
    if (!tree) {
        LOG_NOTE("cJSON_Parse error\n");
        return -1;
    }
    const int msgid = msgid_of(tree.get());
    LOG_NOTE("%s return msgid=%d.\n", __func__, msgid);
    return msgid;
}

int log_dl_msg_handle_cmd(const char *control, const unsigned char *data, std::int32_t dataLen)
{
    LOG_NOTE("enter %s.\n", __func__);
    const int msgid = log_json_get_msgid(control);
    if (msgid == -1) {
        LOG_NOTE("%s:error msgid=-1.\n", __func__);
        return -1;
    }
    const auto entry = std::find_if(log_msg_handler_table.begin(), log_msg_handler_table.end(),
                                    [msgid](const log_msg_handler_entry &e) { return e.msgid == msgid; });
    if (entry == log_msg_handler_table.end()) {
        LOG_NOTE("%s,unknown msgid %d,pls check.\n", __func__, msgid);
        return -1;
    }
    if (entry->handler == nullptr) {
        LOG_NOTE("%s,msgid %d hander is null\n", __func__, msgid);
        return 0;
    }
    const log_cmd_turn turn{g_daemon.run_mode == 0 || entry->alone};
    if (!turn.granted()) {
        LOG_NOTE("%s: another tool has taken over, command dropped\n", __func__);
        return -1;
    }
    entry->handler(control, data, dataLen);
    return 0;
}

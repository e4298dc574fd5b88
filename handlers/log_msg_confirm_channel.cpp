#include "client/log_stream.h"
#include "core/log_line.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

namespace
{

/* Whether the server means this device. */
bool is_for_this_device(const cJSON *link)
{
    const char *const imei = log_member_told(link, "imei", "K_Imei", "imei = %s\n");
    if (imei == nullptr)
        return false;
    char own[64] = {};
    vex_get_nv_item("imei", own, sizeof own);
    if (std::strcmp(imei, own) == 0)
        return true;
    LOG_NOTE("imei = [%s] is incorrect\n", imei);
    return false;
}

} // namespace

int log_msg_confirm_channel(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    const json_tree tree = log_handler_take(__func__, control, data);
    if (!tree)
        return -1;
    const cJSON *link = log_member_object(tree.get(), "DataLink", "K_DataLink");
    if (link == nullptr)
        return -1;
    const bool accepted = is_for_this_device(link);
    const char *const type = log_member_told(link, "ConnectType", "K_ConnectType", "ConnectType = %s\n");
    if (type == nullptr || !accepted)
        return -1;
    if (std::strcmp(type, "syslog_connect") == 0) {
        log_stream_confirm(log_kind::syslog);
    } else if (std::strcmp(type, "modemlog_connect") == 0) {
        log_stream_confirm(log_kind::qxdm);
    } else {
        LOG_FAULT("unknow ConnectType = [%s]\n", type);
        return -1;
    }
    return 0;
}

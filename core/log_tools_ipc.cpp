#include "core/log_tools.h"

#include "core/log_line.h"

#include <cstring>

constexpr char kLogSource[] = "log_tools";

int log_send_msg(int dst_module, int msg_cmd, const void *payload, int len)
{
    if (msg_cmd > kMsgCmdMax) {
        LOG_FAULT("log_send_msg: Msg cmd is >= MSG_CMD_SERVICE_REG, return!");
        return 0;
    }
    if (len < 0 || len > kMsgDataMax) {
        LOG_FAULT("%s: a payload of %d bytes does not fit a message\n", __func__, len);
        return 0;
    }
    log_ipc_msg msg{};
    msg.msg_cmd = static_cast<std::uint16_t>(msg_cmd);
    msg.dst_module = static_cast<std::uint16_t>(dst_module);
    msg.src_module = kMsgSelf;
    msg.data_len = static_cast<std::uint16_t>(len);
    if (payload != nullptr)
        std::memcpy(msg.data, payload, static_cast<std::size_t>(len));
    if (vex_msg_send(&msg) == 0)
        return 1;
    LOG_FAULT("%s: vex_msg_send err!", __func__);
    return 0;
}

#include "core/log_line.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

#include <cstring>

namespace
{

constexpr int kModemModule = 23; /* the service that owns the modem's operating mode */
constexpr int kCmdLpm = 305;
constexpr int kCmdOnline = 306;

void reply(const char *mode, const char *result)
{
    log_reply("{\"msgid\":\"11\",\"mode_lpm_online\":\"%s\",\"Result\":\"%s\"}", mode, result);
}

void reply_mode()
{
    char operate_mode[32] = {};
    vex_get_nv_item("operate_mode", operate_mode, sizeof operate_mode);
    reply(std::strcmp(operate_mode, "ONLINE") == 0 ? "online" : "lpm", kSuccess);
}

/* Asks the modem's owner for a mode. The answer says that it was asked, not that the mode is reached. */
void switch_mode(const char *mode, int command)
{
    log_send_msg(kModemModule, command, nullptr, 0);
    reply(mode, kSuccess);
}

} // namespace

int log_msg_mode_lpm_online(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    const json_tree request = log_handler_take(__func__, control, data);
    if (!request)
        return -1;
    const char *mode = log_member_text(request.get(), "mode_lpm_online", "mode_lpm_online");
    if (mode == nullptr) {
        reply("", kInternalError);
        return -1;
    }
    LOG_NOTE("modem mode = %s\n", mode);
    if (*mode == '\0')
        reply_mode();
    else if (std::strcmp(mode, "lpm") == 0)
        switch_mode("lpm", kCmdLpm);
    else if (std::strcmp(mode, "online") == 0)
        switch_mode("online", kCmdOnline);
    else
        reply("", kParameterError);
    return 0;
}

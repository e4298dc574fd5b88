#include "core/log_line.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

namespace
{

void reply(const char *result)
{
    log_reply("{\"msgid\":\"7\",\"CleanLocalLog\":\"\",\"Result\":\"%s\"}", result);
}

} // namespace

int log_msg_clean_local_log(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    const json_tree request = log_handler_take(__func__, control, data);
    if (!request)
        return -1;
    const char *value = log_member_text(request.get(), "CleanLocalLog", "CleanLocalLog");
    if (value == nullptr) {
        reply(kInternalError);
        return -1;
    }
    LOG_NOTE("leanLocalLog = %s\n", value);
    log_exec_cmd("rm -rf /logfs/*");
    reply(kSuccess);
    return 0;
}

#include "handlers/log_handler.h"

#include "core/log_line.h"
#include "protocol/log_json_codec.h"
#include "protocol/log_pkg_send.h"

#include <cstdarg>
#include <cstdio>

namespace
{

constexpr std::size_t kReplySize = 1024;

} // namespace

bool log_handler_entered(const char *name, const char *control, const unsigned char *data)
{
    if (control == nullptr || data == nullptr) {
        LOG_NOTE("%s para null error\n", name);
        return false;
    }
    if (*control == '\0') {
        LOG_NOTE("%s para len error\n", name);
        return false;
    }
    return true;
}

void log_handler_received(const char *name, const char *control)
{
    LOG_NOTE("%s:recv jsonstr = %s", name, control);
}

json_tree log_handler_parse(const char *control)
{
    json_tree request = log_json_parse(control);
    if (!request)
        LOG_NOTE("cJSON_Parse error\n");
    return request;
}

json_tree log_handler_take(const char *name, const char *control, const unsigned char *data)
{
    if (!log_handler_entered(name, control, data))
        return nullptr;
    log_handler_received(name, control);
    return log_handler_parse(control);
}

const char *log_member_text(const cJSON *object, const char *name, const char *what)
{
    const char *text = cJSON_GetStringValue(cJSON_GetObjectItem(object, name));
    if (text == nullptr)
        LOG_NOTE("cannot find %s item\n", what);
    return text;
}

const char *log_member_told(const cJSON *object, const char *name, const char *what, const char *found)
{
    const char *const text = log_member_text(object, name, what);
    if (text != nullptr)
        LOG_NOTE(found, text);
    return text;
}

const cJSON *log_member_object(const cJSON *object, const char *name, const char *what)
{
    const cJSON *member = cJSON_GetObjectItem(object, name);
    if (cJSON_IsObject(member))
        return member;
    LOG_NOTE("cannot find %s item\n", what);
    return nullptr;
}

void log_reply(const char *format, ...)
{
    char reply[kReplySize];
    va_list args;
    va_start(args, format);
    std::vsnprintf(reply, sizeof reply, format, args);
    va_end(args);
    log_cmd_send_msg(reply);
}

#include "core/daemon_state.h"
#include "core/log_line.h"
#include "core/log_programs.h"
#include "core/log_tools.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

#include <cstring>

namespace
{

constexpr std::size_t kFieldSize = 16; /* a level or a size with its NUL */

struct syslog_para {
    char level[kFieldSize] = {};
    char size[kFieldSize] = {};
};

void reply(const char *level, const char *size, const char *result)
{
    log_reply("{\"msgid\":\"4\",\"syslogParaSet\":{\"sysloglevel\":\"%s\",\"syslogsize\":\"%s\"},\"Result\":\"%s\"}",
              level, size, result);
}

/* Takes a value into its field; false when it is too long, which would make another value of it, or when the shell would
 * make something of it. */
bool take(char (&field)[kFieldSize], const char *value, const char *name)
{
    if (std::strlen(value) >= kFieldSize) {
        LOG_NOTE("%s is longer than %d characters, refused\n", name, static_cast<int>(kFieldSize - 1));
        return false;
    }
    if (!log_is_plain_word(value)) {
        LOG_NOTE("%s has a character that the shell would interpret, refused\n", name);
        return false;
    }
    log_keep_text(field, value);
    return true;
}

/* Reads the request; false, after a log line, when it is not complete. */
bool read_request(const cJSON *request, syslog_para *para)
{
    const cJSON *set = log_member_object(request, "syslogParaSet", "K_syslogParaSet");
    if (set == nullptr)
        return false;
    const char *level = log_member_told(set, "sysloglevel", "K_sysloglevel", "sysloglevel = %s\n");
    const char *size = log_member_told(set, "syslogsize", "K_syslogsize", "syslogsize = %s\n");
    return level != nullptr && size != nullptr && take(para->level, level, "sysloglevel") &&
           take(para->size, size, "syslogsize");
}

/* The local system log is started again with the values; while it is streamed, it is when the stream ends. */
void apply(const syslog_para &para)
{
    if (g_daemon.syslog_realtime_on == 1) {
        vex_set_nv_item("syslog_level", para.level, kFieldSize);
        vex_set_nv_item("syslog_size", para.size, kFieldSize);
        return;
    }
    log_program_change change{log_kind::syslog};
    log_syslog_items items;
    vex_get_nv_item("syslog_path", items.path, 16);
    log_keep_text(items.level, para.level);
    log_keep_text(items.size, para.size);
    log_restart_local_syslog(change, items);
}

void reply_stored()
{
    syslog_para stored;
    vex_get_nv_item("syslog_level", stored.level, kFieldSize);
    vex_get_nv_item("syslog_size", stored.size, kFieldSize);
    const int size_max = log_syslog_size_max();
    LOG_NOTE("%s:syslogsizeMax = [%d]\n", "log_msg_set_syslog_para", size_max);
    log_reply("{\"msgid\":\"4\",\"syslogParaSet\":{\"sysloglevel\":\"%s\",\"syslogsize\":\"%s\","
              "\"syslogsizeMax\":\"%d\"},\"Result\":\"%s\"}",
              stored.level, stored.size, size_max, kSuccess);
}

} // namespace

int log_msg_set_syslog_para(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    const json_tree request = log_handler_take(__func__, control, data);
    if (!request)
        return -1;
    syslog_para para;
    if (!read_request(request.get(), &para)) {
        reply("", "", kInternalError);
    } else if (*para.level != '\0' && *para.size != '\0') {
        apply(para);
        reply(para.level, para.size, kSuccess);
    } else {
        reply_stored();
    }
    return 0;
}

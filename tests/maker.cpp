/* A maker's libraries, such as a device build links: one for the log, one for NV items and messages. */
#include "platform/vex_platform.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <mutex>
#include <string>

#ifdef MAKER_LOG

void vex_syslog_append(int level, const char *source, int /*line*/, int module, const char *format, ...)
{
    std::FILE *const file = std::fopen(std::getenv("VEX_LOG_FILE"), "ae");
    va_list args;
    va_start(args, format);
    std::fprintf(file, "maker %d %d %s ", level, module, source);
    std::vfprintf(file, format, args);
    va_end(args);
    std::fclose(file);
}

#else

namespace
{

std::mutex g_lock;
std::map<std::string, std::string> g_items = {{"log_manage_switch", "1"}, {"imei", "356938035643809"}};

} // namespace

int vex_nvconfig_read(const char *name, char *value, int max_len)
{
    const std::lock_guard hold{g_lock};
    if (g_items.count(name) == 0)
        return 0;
    std::snprintf(value, static_cast<std::size_t>(max_len), "%s", g_items[name].c_str());
    return 1;
}

int vex_nvconfig_write(const char *name, const char *value, int len)
{
    const std::lock_guard hold{g_lock};
    g_items[name].assign(value, static_cast<std::size_t>(len));
    return 1;
}

int cfg_save()
{
    return 0;
}

int vex_msg_send(const void * /*record*/)
{
    return 0;
}

#endif

#include "tests/memory_platform.h"

#include "platform/vex_platform.h"

#include <cstdio>
#include <cstring>

memory_platform g_platform;

namespace
{

void keep_line(int level, const char *source, int module, const char *format, va_list args)
{
    char text[8192];
    std::vsnprintf(text, sizeof text, format, args);
    std::string line = std::to_string(level) + ' ' + source + ' ' + text + (module == 84 ? "|" : "(module!)|");
    if (const std::size_t newline = line.find("\n|"); newline != std::string::npos)
        line[newline] = '$';
    g_platform.log += line;
}

} // namespace

void vex_syslog_append(int level, const char *source, int /*line*/, int module, const char *format, ...)
{
    va_list args;
    va_start(args, format);
    if (g_platform.takes_line != nullptr)
        g_platform.takes_line(source, format, args);
    else
        keep_line(level, source, module, format, args);
    va_end(args);
}

int vex_nvconfig_read(const char *name, char *value, int max_len)
{
    const auto item = g_platform.items.find(name);
    if (item == g_platform.items.end())
        return 0;
    item->second.copy(value, static_cast<std::size_t>(max_len));
    return 1;
}

int vex_nvconfig_write(const char *name, const char *value, int len)
{
    if (!g_platform.fails)
        g_platform.items[name] = std::string(value, strnlen(value, static_cast<std::size_t>(len)));
    return g_platform.fails ? 0 : 1;
}

int cfg_save()
{
    return g_platform.saves++;
}

int vex_msg_send(const void *record)
{
    g_platform.messages.emplace_back(static_cast<const char *>(record), 1036);
    return g_platform.fails ? -1 : 0;
}

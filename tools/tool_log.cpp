#include "tools/tool_log.h"

#include "platform/vex_platform.h"

#include <cstdarg>
#include <cstdio>

namespace
{

bool g_shown = false;

} // namespace

void tool_log_show()
{
    g_shown = true;
}

void vex_syslog_append(int level, const char *source, int line, int /*module*/, const char *format, ...)
{
    if (!g_shown)
        return;
    char text[4096];
    va_list args;
    va_start(args, format);
    std::vsnprintf(text, sizeof text, format, args);
    va_end(args);
    std::fprintf(stderr, "%d %s:%d %s\n", level, source, line, text);
}

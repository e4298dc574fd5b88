#include "tools/tool_log.h"

#include "platform/vex_platform.h"
#include "tools/tool_answer.h"

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

void tool_log_frame(const char *what, const std::string &control, std::size_t data_len)
{
    if (g_shown)
        std::fprintf(stderr, "%s %s and %zu bytes of data\n", what, tool_printable(control).c_str(), data_len);
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
    std::string shown = text;
    if (shown.ends_with('\n'))
        shown.pop_back();
    std::fprintf(stderr, "%d %s:%d %s\n", level, source, line, tool_printable(shown).c_str());
}

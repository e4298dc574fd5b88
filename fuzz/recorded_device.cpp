#include "fuzz/recorded_device.h"

#include "core/log_tools.h"
#include "fuzz/fuzz.h"

#include <cerrno>
#include <cstring>
#include <pthread.h>

device_traits g_device{0};
std::string g_output;

namespace
{

constexpr std::size_t kCommandMax = 254; /* one less than the buffers of command lines hold */

void check_command(std::string_view command)
{
    promise(command.size() <= kCommandMax, "a command line has room in its buffer");
}

} // namespace

void check_line(const char *source, const char *format, va_list args)
{
    char text[8192];
    std::vsnprintf(text, sizeof text, format, args);
    constexpr std::string_view kBegin = "cmdStr[";
    constexpr std::string_view kEnd = "]\n";
    const std::string_view line = text;
    if (std::strcmp(source, "log_tools") == 0 && line.starts_with(kBegin))
        check_command(line.substr(kBegin.size(), line.size() - kBegin.size() - kEnd.size()));
}

extern "C" {
int __wrap_system(const char *command)
{
    check_command(command);
    return g_device.commands_fail ? 1 << 8 : 0;
}
FILE *__wrap_popen(const char *command, const char *)
{
    check_command(command);
    return g_output.empty() ? fopen("/dev/null", "r") : fmemopen(g_output.data(), g_output.size(), "r");
}
int __wrap_pclose(FILE *stream)
{
    return fclose(stream);
}
int __wrap_access(const char *path, int)
{
    return (std::string_view(path).ends_with("/Diag.cfg") ? g_device.has_config : g_device.has_more) ? 0 : -1;
}
int __wrap_fork()
{
    return -1;
}
unsigned __wrap_sleep(unsigned)
{
    return 0;
}
void __wrap_sync() {}
int __wrap_pthread_create(pthread_t *, const pthread_attr_t *, void *(*)(void *), void *)
{
    return EAGAIN;
}
}

/* A start of a live log gets no threads: one of these two takes the place of what would make them. */
int refuse_thread(log_thread_task *task, void *argument) __asm__("__wrap__Z17log_thread_createP15log_thread_taskPv");
int refuse_thread(log_thread_task *, void *)
{
    return -1;
}

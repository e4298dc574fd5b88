#include "fuzz/recorded_device.h"

#include "core/log_tools.h"
#include "fuzz/fuzz.h"

#include <algorithm>
#include <cerrno>
#include <fstream>
#include <spawn.h>
#include <string_view>
#include <unistd.h>

device_traits g_device{0};
std::string g_output;
std::string g_archive;

namespace
{

constexpr std::size_t kCommandMax = 254; /* one less than the buffers of command lines hold */

constexpr std::size_t kOutputMax = 4096; /* has room in a pipe */

} // namespace

extern "C" {
int __wrap_posix_spawn(pid_t *child, const char *, const posix_spawn_file_actions_t *, const posix_spawnattr_t *,
                       char *const *words, char *const *)
{
    constexpr std::string_view kTakesItsPlace = "exec ";
    std::string_view line = words[2];
    if (line.starts_with(kTakesItsPlace))
        line.remove_prefix(kTakesItsPlace.size());
    promise(line.size() <= kCommandMax, "a command line has room in its buffer");
    if (line.starts_with("tar -czvf "))
        std::ofstream("/tmp/MBBlogfs.tar.gz", std::ios::binary) << g_archive;
    *child = 1;
    return 0;
}
pid_t __wrap_waitpid(pid_t child, int *status, int)
{
    if (status != nullptr)
        *status = g_device.commands_fail ? 1 << 8 : 0;
    return child;
}
int __real_pipe2(int *ends, int flags);
/* A command's output, which is there before the command is. */
int __wrap_pipe2(int *ends, int flags)
{
    const int result = __real_pipe2(ends, flags);
    promise(result == 0 && write(ends[1], g_output.data(), std::min(g_output.size(), kOutputMax)) != -1, "a pipe");
    return result;
}
int __wrap_access(const char *path, int)
{
    return (std::string_view(path).ends_with("/Diag.cfg") ? g_device.has_config : g_device.has_more) ? 0 : -1;
}
unsigned __wrap_sleep(unsigned)
{
    return 0;
}
void __wrap_sync() {}
}

/* A start of a live log gets no threads. A fuzzer has some of its own. */
int refuse_thread(log_thread_task *task, void *argument) __asm__("__wrap__Z17log_thread_createP15log_thread_taskPv");
int refuse_thread(log_thread_task *, void *)
{
    return -1;
}

int refuse_start(const char *starter, void *(*entry)(void *),
                 void *argument) __asm__("__wrap__Z16log_start_threadPKcPFPvS1_ES1_");
int refuse_start(const char *, void *(*)(void *), void *)
{
    return -1;
}

#include "core/log_stdout.h"

#include "core/log_link.h"
#include "core/log_lock.h"

#include <climits>
#include <cstdio>
#include <cstring>
#include <poll.h>
#include <unistd.h>

namespace
{

constexpr std::size_t kHeldMax = PIPE_BUF; /* a pipe that takes anything takes that much */

log_mutex g_print_lock;
char g_held[kHeldMax] LOG_GUARDED_BY(g_print_lock);
std::size_t g_held_len LOG_GUARDED_BY(g_print_lock);

bool takes_more()
{
    return log_wait_ready(STDOUT_FILENO, POLLOUT, -1, 0) != 0;
}

void show() LOG_REQUIRES(g_print_lock)
{
    if (takes_more()) [[maybe_unused]]
        const ssize_t written = write(STDOUT_FILENO, g_held, g_held_len);
    g_held_len = 0;
}

} // namespace

void log_print(std::string_view line)
{
    static const bool at_once = isatty(STDOUT_FILENO) == 1;
    const log_lock hold{g_print_lock};
    if (line.size() > kHeldMax - g_held_len)
        show();
    std::memcpy(g_held + g_held_len, line.data(), line.size());
    g_held_len += line.size();
    if (at_once)
        show();
}

void log_print_flush()
{
    const log_lock hold{g_print_lock};
    show();
    if (takes_more())
        std::fflush(stdout); /* this one only: others may be locked by threads that read from programs */
}

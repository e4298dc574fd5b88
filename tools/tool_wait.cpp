#include "tools/tool_wait.h"

#include "platform/unique_fd.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <sys/signalfd.h>
#include <vector>

namespace
{

unique_fd g_interrupts; /* readable, and never read, once a signal has come */

sigset_t interrupt_signals()
{
    sigset_t set;
    sigemptyset(&set);
    for (const int signal : {SIGINT, SIGTERM, SIGHUP})
        sigaddset(&set, signal);
    return set;
}

} // namespace

void tool_catch_interrupts()
{
    const sigset_t set = interrupt_signals();
    sigprocmask(SIG_BLOCK, &set, nullptr);
    g_interrupts.reset(signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK));
}

void tool_release_interrupts()
{
    const sigset_t set = interrupt_signals();
    signalfd_siginfo taken;
    while (read(g_interrupts.get(), &taken, sizeof taken) > 0)
        continue;
    g_interrupts.reset();
    sigprocmask(SIG_UNBLOCK, &set, nullptr);
}

tool_wait tool_wait_for(std::span<pollfd> sockets, tool_clock::time_point end)
{
    std::vector<pollfd> all(sockets.begin(), sockets.end());
    all.push_back({g_interrupts.get(), POLLIN, 0}); /* poll passes over -1 */
    for (;;) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - tool_clock::now());
        const auto ms = std::clamp<std::chrono::milliseconds::rep>(left.count(), 0, INT_MAX);
        const int n = poll(all.data(), all.size(), static_cast<int>(ms));
        if ((n < 0 && errno == EINTR) || (n == 0 && ms == INT_MAX))
            continue;
        if (n <= 0)
            return tool_wait::timeout;
        std::copy(all.begin(), all.end() - 1, sockets.begin());
        return all.back().revents != 0 ? tool_wait::interrupted : tool_wait::ready;
    }
}

std::string tool_seconds(std::chrono::milliseconds limit)
{
    const auto ms = limit.count();
    std::string text = std::to_string(ms / 1000);
    if (ms % 1000 != 0)
        text += '.' + std::to_string(ms % 1000 + 1000).substr(1);
    return text + " s";
}

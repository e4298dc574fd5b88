#include "tools/tool_wait.h"

#include "platform/unique_fd.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <initializer_list>
#include <sys/signalfd.h>
#include <vector>

namespace
{

unique_fd g_interrupts; /* readable, and never read, once a signal has come */

/* Blocks the signals and makes them readable. */
void listen_for(std::initializer_list<int> signals)
{
    sigset_t set;
    sigemptyset(&set);
    for (const int signal : signals)
        sigaddset(&set, signal);
    sigprocmask(SIG_BLOCK, &set, nullptr);
    g_interrupts.reset(signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK));
}

} // namespace

void tool_catch_interrupts()
{
    struct sigaction hangup {
    };
    sigaction(SIGHUP, nullptr, &hangup);
    if (hangup.sa_handler == SIG_IGN)
        listen_for({SIGINT, SIGTERM});
    else
        listen_for({SIGINT, SIGTERM, SIGHUP});
}

void tool_forget_interrupts()
{
    signalfd_siginfo taken;
    while (read(g_interrupts.get(), &taken, sizeof taken) > 0)
        continue;
    listen_for({SIGINT, SIGTERM});
}

bool tool_interrupted()
{
    return tool_wait_for({}, tool_clock::now()) == tool_wait::interrupted;
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

/* Waiting for sockets, with a limit and an ear for Ctrl-C. */
#ifndef TOOLS_TOOL_WAIT_H
#define TOOLS_TOOL_WAIT_H

#include <chrono>
#include <poll.h>
#include <span>
#include <string>

using tool_clock = std::chrono::steady_clock;

enum class tool_wait {
    ready,       /* at least one of them is; `revents` says which */
    timeout,     /* the time has come */
    interrupted, /* the user wants to end, and from now on every wait says so */
};

/* From now on SIGINT, SIGTERM and SIGHUP (unless it is ignored) no longer kill the tool but end its waits, so that
 * it can tidy up. */
void tool_catch_interrupts();

/* Takes back that the user wanted to end, for the last words to the device: only Ctrl-C or SIGTERM, given again, end
 * waits now. */
void tool_forget_interrupts();

tool_wait tool_wait_for(std::span<pollfd> sockets, tool_clock::time_point end);

/* Whether the user wants to end, for work that waits for nothing. */
bool tool_interrupted();

/* A limit as text, such as "0.200 s". */
std::string tool_seconds(std::chrono::milliseconds limit);

#endif

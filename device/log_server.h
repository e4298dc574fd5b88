/* A log server as small as can be, for tests and benchmarks: the place at which it is called by devices. */
#ifndef DEVICE_LOG_SERVER_H
#define DEVICE_LOG_SERVER_H

#include "protocol/json_tree.h"
#include "tools/tool_link.h"

#include <optional>
#include <string>

struct tool_listener {
    unique_fd fd;
    tls_context context; /* none: callers are served without TLS */
    std::string port;
};

/* Listens on a port of every address that this machine has; false, and why, when that cannot be. */
bool tool_listen(tool_listener &listener, std::string &why);

struct tool_call {
    tool_link link;
    json_tree announcement;
    std::string msgid;
};

/* Takes a call that is there, shakes hands and receives the frame by which a caller begins, all before `end`. None, and
 * why, when there is no talking to the caller. */
std::optional<tool_call> tool_take_call(const tool_listener &listener, const tool_limits &limits,
                                        tool_clock::time_point end, std::string &why);

/* The link that a device has made to us, on its accepted, non-blocking socket. */
tool_link tool_called_link(unique_fd fd, const tool_limits &limits);

/* The printable text of a member of the object `group` in what a caller announced. */
std::string tool_announced(const tool_call &call, const char *group, const char *name);

#endif

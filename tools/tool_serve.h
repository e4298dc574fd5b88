/* The log server's side, for a device in client mode. */
#ifndef TOOLS_TOOL_SERVE_H
#define TOOLS_TOOL_SERVE_H

#include "tools/tool_device.h"

#include <functional>

struct tool_serve_options {
    std::string port = "48888";
    bool plain = false; /* else TLS, with these PEM files */
    std::string cert;
    std::string key;
    std::string ca;
};

/* Runs the commands that the user types for the device that has called: one line each. */
using tool_run_line = std::function<int(tool_device &, const std::string &)>;

/* Waits for a device to call, says who it is and runs the lines of standard input for it, until there are no more: the
 * status of the last one. When the device hangs up, the next one is waited for. */
int tool_serve(tool_device &device, const tool_serve_options &options, const tool_run_line &run_line);

#endif

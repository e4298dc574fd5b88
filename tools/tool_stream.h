/* Shows a live log. */
#ifndef TOOLS_TOOL_STREAM_H
#define TOOLS_TOOL_STREAM_H

#include "tools/tool_device.h"

struct tool_stream_options {
    std::string log;                     /* "syslog" or "qxdm", the modem log */
    std::string output;                  /* a file to append to; empty: standard output */
    std::chrono::milliseconds length{0}; /* 0: until the user ends it */
    bool stop = false;                   /* only have the device stop, whoever started it */
};

/* Has the device send the log, and passes on what comes until the user ends it, the time has come or another tool takes
 * the device over. Then has the device stop, unless it is no longer ours. */
int tool_stream(tool_device &device, const tool_stream_options &options);

#endif

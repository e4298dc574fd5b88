/* What goes over the wire, for whoever looks for a fault. */
#ifndef TOOLS_TOOL_LOG_H
#define TOOLS_TOOL_LOG_H

#include <cstddef>
#include <string>

/* Shows it on standard error from now on, with the log lines of the code that the tool has in common with the daemon;
 * without it all that is dropped. */
void tool_log_show();

/* A frame that was "sent" or "received". */
void tool_log_frame(const char *what, const std::string &control, std::size_t data_len);

#endif

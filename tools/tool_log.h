/* The log lines of the code that the tool has in common with the daemon. */
#ifndef TOOLS_TOOL_LOG_H
#define TOOLS_TOOL_LOG_H

/* Shows them on standard error from now on; without it they are dropped. */
void tool_log_show();

#endif

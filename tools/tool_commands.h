/* The commands that are one request and one reply. */
#ifndef TOOLS_TOOL_COMMANDS_H
#define TOOLS_TOOL_COMMANDS_H

#include "tools/tool_device.h"

int tool_version(tool_device &device);

/* Any control text, as it is. */
int tool_raw(tool_device &device, const std::string &command);

/* Sets level and size (KB) of the local system log; tells them when both are empty. */
int tool_syslog(tool_device &device, const std::string &level, const std::string &size);

/* Captures on a list of interfaces, "wan" and "lan" among them, keeping `length` bytes of each packet; empty: the
 * device's own choice. */
int tool_capture_start(tool_device &device, const std::string &interfaces, const std::string &length);
int tool_capture_stop(tool_device &device);

/* Deletes everything in the device's log partition. */
int tool_clean(tool_device &device);

/* Sets the log level of a kernel module; tells it when `level` is empty. */
int tool_bsp(tool_device &device, const std::string &module, const std::string &level);

/* Switches the modem to "lpm" or "online"; tells which it is when `mode` is empty. */
int tool_modem(tool_device &device, const std::string &mode);

#endif

/* Pushes a configuration package. */
#ifndef TOOLS_TOOL_CONFIG_H
#define TOOLS_TOOL_CONFIG_H

#include "tools/tool_device.h"

/* Sends the tar `file` in pieces, each after the device has taken the one before. */
int tool_config(tool_device &device, const std::string &file);

#endif

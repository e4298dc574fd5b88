/* The same for many devices behind a log server. */
#ifndef TOOLS_TOOL_MANY_H
#define TOOLS_TOOL_MANY_H

#include "tools/tool_device.h"

#include <functional>
#include <string>
#include <vector>

/* Does a job for each of the devices, at most `parallel` at a time, each in a process of its own, and prints a table of what
 * came of it, or with device.json a line of JSON each. The exit status of the worst. */
int tool_for_many(tool_device &device, const std::vector<std::string> &imeis, unsigned parallel,
                  const std::function<int(tool_device &)> &job);

/* The same for every device that is connected. */
int tool_for_all(tool_device &device, unsigned parallel, const std::function<int(tool_device &)> &job);

#endif

/* Fetches the device's log archive. */
#ifndef TOOLS_TOOL_ARCHIVE_H
#define TOOLS_TOOL_ARCHIVE_H

#include "tools/tool_device.h"

/* Has the device pack its logs and stores the archive as `file`, which is there only when it is whole and a
 * readable gzip tar. `tries`: how often the device may fail to pack because a log changed meanwhile. */
int tool_archive(tool_device &device, const std::string &file, int tries);

#endif

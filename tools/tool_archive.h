/* Fetches the device's log archive. */
#ifndef TOOLS_TOOL_ARCHIVE_H
#define TOOLS_TOOL_ARCHIVE_H

#include "tools/tool_device.h"

/* Has the device pack its logs and stores the archive as the file `place`, or in that folder as IMEI-DATE.tgz where the
 * same is asked of other devices; it is there only when it is whole and a readable gzip tar. `tries`: how often the device
 * may fail to pack because a log changed meanwhile. */
int tool_archive(tool_device &device, const std::string &place, int tries);

#endif

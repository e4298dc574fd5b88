/* Tar archives as the tool looks at them: whole, piece by piece. */
#ifndef TOOLS_TOOL_TAR_H
#define TOOLS_TOOL_TAR_H

#include <string>

enum class tool_packing {
    plain,
    gzip,
};

/* Reads the tar in `fd` from its start to its end. False, and why, when it is not readable, not packed that way, or the
 * user wants to end. `contents` tells its files, and its packet captures by name, in lines for a person. */
bool tool_check_tar(int fd, tool_packing packing, std::string &contents, std::string &why);

#endif

#include "handlers/syslog_size.h"

#include "core/log_tools.h"

#include <algorithm>
#include <climits>
#include <cstdio>

int log_syslog_size_max()
{
    char path[16] = {};
    vex_get_nv_item("syslog_path", path, sizeof path);
    char cmd[128];
    std::snprintf(cmd, sizeof cmd, "df -h | grep %s |awk '{print $2}' | cut -d 'M' -f 1", path);
    char size[128] = {};
    vex_popen(cmd, size, sizeof size);
    return std::clamp(log_text_to_int(size), 0, INT_MAX / 1024) * 1024;
}

#include "core/log_local_syslog.h"

#include "core/log_tools.h"

#include <algorithm>
#include <climits>
#include <cstdio>

void log_run_syslog_script(const char *path, const char *level, const char *size, log_script_wait wait)
{
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o %s -l %s -s %s %s", path, level,
                  size, wait == log_script_wait::no ? "&" : "");
    log_exec_cmd(cmd);
}

void log_restart_local_syslog()
{
    char path[32] = {};
    char level[32] = {};
    char size[32] = {};
    vex_get_nv_item("syslog_path", path, sizeof path);
    vex_get_nv_item("syslog_level", level, sizeof level);
    vex_get_nv_item("syslog_size", size, sizeof size);
    log_run_syslog_script(path, level, size, log_script_wait::no);
}

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

#include "core/log_local_syslog.h"

#include "core/log_lock.h"
#include "core/log_tools.h"

#include <algorithm>
#include <chrono>
#include <climits>
#include <csignal>
#include <cstdio>
#include <utility>

namespace
{

using restart_clock = std::chrono::steady_clock;

/* A script runs for a moment only; after that its group's number may be somebody else's. */
constexpr auto kRestartMax = std::chrono::seconds(10);

/* The latest restart in the background. */
struct syslog_restart {
    pid_t group = 0;
    restart_clock::time_point began;
};

log_mutex g_restart_lock;
syslog_restart g_restart LOG_GUARDED_BY(g_restart_lock);

} // namespace

void log_run_syslog_script(const char *path, const char *level, const char *size, log_script_wait wait)
{
    char cmd[256];
    std::snprintf(cmd, sizeof cmd, "sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o %s -l %s -s %s %s", path, level,
                  size, wait == log_script_wait::no ? "&" : "");
    if (wait == log_script_wait::yes) {
        log_exec_cmd(cmd);
        return;
    }
    log_break_off_local_syslog(); /* this one does all that again */
    const pid_t group = log_exec_cmd_apart(cmd);
    const log_lock hold{g_restart_lock};
    g_restart = {group, restart_clock::now()};
}

void log_break_off_local_syslog()
{
    const log_lock hold{g_restart_lock};
    const pid_t group = std::exchange(g_restart.group, 0);
    if (group > 0 && restart_clock::now() - g_restart.began < kRestartMax)
        kill(-group, SIGKILL);
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

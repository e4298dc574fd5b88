#include "core/daemon_state.h"

log_daemon_state g_daemon;

void log_end_process(int status)
{
    {
        const log_lock hold{g_daemon.exit_lock};
        g_daemon.exit_flag = 1;
        g_daemon.exit_status = status;
    }
    g_daemon.exit_change.notify_all();
}

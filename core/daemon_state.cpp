#include "core/daemon_state.h"

log_daemon_state g_daemon;

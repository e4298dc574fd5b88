/* Outbound connections to the log server. Log lines have the source "vex_log_manage". */
#ifndef CLIENT_LOG_CONNECT_H
#define CLIENT_LOG_CONNECT_H

#include "core/log_tls_session.h"

#include <memory>

/*
 * Connects to the first address of `host`, trying as often as the daemon's retry_count says, with 2 seconds after
 * each failure; with TLS on, opens a session on the connection, which is not tried again.
 *   host     address or name of the server, never null
 *   port     its port
 *   session  holds null; then the session, with TLS on
 *   stop_fd  readable once the connection is not wanted any more, which ends everything but the look-up of a name at
 *            once; -1 for the control link. The session keeps it.
 * The connected socket, close-on-exec and with keepalive on, which the caller closes (after the session); -1 on
 * failure, which is logged. May take retry_count * 2 seconds and more. For any thread.
 */
int log_connect_server(const char *host, int port, std::unique_ptr<log_tls_session> *session, int stop_fd = -1);

#endif

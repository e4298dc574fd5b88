/* Outbound connections to the log server. Log lines bear the source "vex_log_manage". */
#ifndef CLIENT_LOG_CONNECT_H
#define CLIENT_LOG_CONNECT_H

#include "core/log_streams.h"

/*
 * Connects to the first address of `host`, trying as often as the daemon's retry_count says, with 2 seconds after
 * each failure; with TLS on, opens a session on the connection, which is not tried again.
 *   host      address or name of the server, never null
 *   port      its port
 *   session   holds null; then the session, with TLS on
 *   link      the data link that it is for, which is tried for only as long as it is wanted; null for the control link
 * The connected socket, close-on-exec and with keepalive on, which the caller closes (after the session); -1 on
 * failure, which is logged. May take retry_count * 2 seconds and more. For any thread.
 */
int log_connect_server(const char *host, int port, SSL **session, const log_link *link = nullptr);

#endif

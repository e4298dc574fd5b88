/*
 * Server mode's front door: two threads, one for IPv4 and one for IPv6, that listen on TCP port 48888 and
 * hand each log tool to a receive thread of its own. There is one command connection: the newest tool has it.
 *
 *     listener (IPv4) --+                        take the old connection away,
 *                       +--> accept, then, as      whose receive thread ends
 *     listener (IPv6) --+    one step under      record the new one
 *                            g_takeover_lock:    start its receive thread, detached: log_recv_tcp_msg()
 *
 * Log lines at level 6 as "vex_log_manage".
 */
#ifndef TRANSPORT_LOG_SERVER_H
#define TRANSPORT_LOG_SERVER_H

/* Start the listener of one address family, for the life of the process. 0 started, -1 not (logged). A family
 * whose port cannot be had stays without a listener; without both, the process ends with status 1 (logged). */
int vex_log_server_thread();
int vex_log_server_thread_ipv6();

#endif

/*
 * The data links of client mode: one connection for each live stream, to where the server wants it. The stream's
 * bytes go out on it; what comes in is handled like what comes from the control link, and is in practice the
 * confirmation that has the stream's log program started. When a link ends, the device goes back to its local
 * logging.
 */
#ifndef CLIENT_LOG_DATA_LINK_H
#define CLIENT_LOG_DATA_LINK_H

/* Start the thread of a stream's data link, which connects to the target that log_stream_start() has recorded,
 * announces itself and reads until the link ends. `start` is the number that log_stream_start() gave. 0 started, -1
 * not (logged). For any thread. */
int vex_log_client_syslog_thread(unsigned start);
int vex_log_client_qxdm_thread(unsigned start);

#endif

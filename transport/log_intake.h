/*
 * The intakes of client mode over TLS: local sockets at which the device's log programs write their live output, which
 * goes on, as it comes, to the stream's data link. An intake serves one program and ends with it; it waits for one only
 * as long as its stream wants one.
 *
 * Log lines at level 6, failures at level 0, as "vex_log_manage".
 */
#ifndef TRANSPORT_LOG_INTAKE_H
#define TRANSPORT_LOG_INTAKE_H

#include "platform/unique_fd.h"

struct log_stream;

/* Where the log programs' ends are connected. */
constexpr char kSyslogIntake[] = "/tmp/MSG_ID_SYSLOG";
constexpr char kQxdmIntake[] = "/tmp/MSG_ID_QXDM";

/* Stores a socket that listens at the path. 0; -1 on failure (logged), and nothing is stored. For any thread. */
int vex_create_unix_server_socket(const char *path, unique_fd *listener);

/* Serves one program at the listening socket, then closes it: hands what the program writes to its stream until it has
 * closed its end. `log_type` is for the log; once `stop_fd` is readable no program is waited for any more. */
void log_server_handle_realtimelog(unique_fd listener, int log_type, int stop_fd, log_stream &stream);

/* A piece of what the program wrote. The intake hands it over and leaves it to the stream what becomes of it: this one
 * is defined where a stream is (client/log_stream.cpp). */
void log_stream_send(log_stream &stream, const unsigned char *piece, int len);

#endif

/*
 * The intakes of client mode over TLS: local sockets at which the device's log programs write their live output,
 * which goes on, as it comes, to the stream's data link. An intake serves one program and ends with it; it waits for
 * one only as long as its stream wants one (core/log_streams.h).
 *
 * Log lines at level 6, failures at level 0, as "vex_log_manage".
 */
#ifndef TRANSPORT_LOG_INTAKE_H
#define TRANSPORT_LOG_INTAKE_H

/* Where the log programs' ends are connected. */
constexpr char kSyslogIntake[] = "/tmp/MSG_ID_SYSLOG";
constexpr char kQxdmIntake[] = "/tmp/MSG_ID_QXDM";

/* Start an intake's thread and return when it listens, or cannot. 0 started, -1 not (logged). For any thread. */
int vex_log_recv_syslog_thread();
int vex_log_recv_qxdm_thread();

#endif

/*
 * TLS towards the log server: the context that all links share, one session for each link, and the check of the
 * server's certificate. Log lines have the source "vex_log_manage".
 */
#ifndef CLIENT_LOG_TLS_H
#define CLIENT_LOG_TLS_H

#include "core/log_tls_session.h"

/* How start-up goes on. */
enum class log_tls_result {
    ready,
    no_context, /* the process ends with status -1 */
    bad_files,  /* the process ends with status 1 */
};

/* Builds the context from the device's certificates, and has all sends and reads go over TLS from now on. What is wrong
 * is logged. Start-up calls it before any other thread exists. */
log_tls_result log_tls_start();

/* Opens a session on a connected socket, which it makes non-blocking, and checks the server: within 30 seconds, and
 * before `stop_fd` is readable (see log_tls_session::open), or it has failed. 1, and the session in `*session`, or TLS
 * is off; 0 failed (logged, with the reason when it is the server's certificate), and null in `*session`. For any
 * thread. */
int vex_open_ssl(int fd, std::unique_ptr<log_tls_session> *session, int stop_fd);

/* 1 when the server's certificate is accepted, and says whose it is; 0 when not (logged). */
int log_cert_check(const log_tls_session &session);

/* Ends a session, which may be null: what is on its way is sent and a good-bye said, until `end` at the most; and with
 * `free_context` the shared context: no session can be opened then. Does nothing when TLS is off. By the thread that
 * reads the session; its memory stays its owner's. */
void vex_close_ssl(log_tls_session *session, int free_context, log_clock::time_point end);

#endif

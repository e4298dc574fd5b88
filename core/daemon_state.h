/*
 * The daemon's process-wide state: everything that is true of the daemon as a whole and of no single
 * connection. Start-up writes it before it starts the first thread; afterwards only what is atomic, or has a lock,
 * changes. Connections are in core/log_registry.h.
 */
#ifndef CORE_DAEMON_STATE_H
#define CORE_DAEMON_STATE_H

#include "core/log_lock.h"

#include <atomic>
#include <cstdint>
#include <openssl/ossl_typ.h>

struct log_daemon_state {
    int run_mode = 0;     /* 0 server mode, any other value client mode */
    int retry_count = 10; /* largest number of connect tries in client mode */
    int use_ssl = 0;      /* 1 when client mode runs over TLS: every read and write chooses by it */

    std::atomic<int> syslog_realtime_on{0}; /* 1 while the system log is streamed instead of kept on the device */

    log_mutex exit_lock;
    int exit_flag LOG_GUARDED_BY(exit_lock) = 0; /* set to 1 to end the process: log_end_process() */
    int exit_status LOG_GUARDED_BY(exit_lock) = 0;
    std::condition_variable exit_change;

    /* Bytes of the configuration package that have arrived since the last one was complete or the count was reset. It
     * outlives the connection: a tool that was cut off can go on where it stopped. 64 bits: more may arrive than was
     * announced. */
    std::atomic<std::int64_t> conf_recv_len{0};

    /* The context that all TLS sessions share; null without TLS, and once the control link has ended. */
    log_mutex ssl_ctx_lock;
    SSL_CTX *ssl_ctx LOG_GUARDED_BY(ssl_ctx_lock) = nullptr;
};

extern log_daemon_state g_daemon;

/* Has the process end with that status, from any thread. It may end before the call returns. */
void log_end_process(int status);

#endif

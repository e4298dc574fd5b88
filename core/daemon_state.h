/*
 * The daemon's process-wide state: everything that is true of the daemon as a whole and of no single
 * connection. Start-up writes it before it starts the first thread; afterwards only what is atomic changes.
 * Connections are in core/log_registry.h.
 */
#ifndef CORE_DAEMON_STATE_H
#define CORE_DAEMON_STATE_H

#include <atomic>
#include <openssl/ossl_typ.h>

struct log_daemon_state {
    int run_mode = 0;     /* 0 server mode, any other value client mode */
    int retry_count = 10; /* largest number of connect tries in client mode */
    int use_ssl = 0;      /* 1 when client mode runs over TLS: every read and write chooses by it */
    /* What TLS does for those below the client's room. Set with use_ssl by whoever brings TLS along: server mode has no
     * use for a TLS library and the memory it takes, so the daemon is not linked with one. Reads and writes wait. */
    int (*ssl_read)(SSL *ssl, void *bytes, int len) = nullptr;
    int (*ssl_write)(SSL *ssl, const void *bytes, int len) = nullptr;
    void (*ssl_hold)(SSL *ssl, bool on) = nullptr; /* for a burst of writes: they may reach the network together */
    void (*close_ssl)(SSL *ssl, int free_context) = nullptr;
    std::atomic<int> syslog_realtime_on{0}; /* 1 while the system log is streamed instead of kept on the device */
    std::atomic<int> exit_flag{0};          /* set to 1 to end the process; start-up looks at it every 5 seconds */
};

extern log_daemon_state g_daemon;

#endif

/*
 * The connection registry: which sockets and TLS sessions the daemon talks on, and who may use them.
 *
 * The locks of the daemon, in the order in which one may be taken while another is held:
 *
 *   g_takeover_lock      one accepted connection at a time takes over the command connection
 *   a link's `sending`   one frame at a time on a link (core/log_link.h): held while it is sent
 *   a log's `run_lock`   one start of a log program at a time, and the wait of a few seconds for what is in its way
 *                        (core/log_programs.h)
 *   ssl_ctx_lock         the TLS context (core/daemon_state.h)
 *   g_intake_lock        one intake at a time is put at its path (client/log_stream.cpp)
 *   g_registry_lock      the fields of the registry, and the live streams (client/log_stream.cpp). Held for a few
 *                        instructions: no waiting for a peer, sending, logging or starting of threads and programs
 *   a session's `lock_`  one library call on it (core/log_tls_session.h)
 *   exit_lock            whether the process is to end (core/daemon_state.h)
 *   g_print_lock         lines on standard output (core/log_stdout.cpp); no waiting
 *   bsp_record_lock      one change of the record of kernel-module levels at a time (handlers/bsp_module_level.cpp)
 */
#ifndef CORE_LOG_REGISTRY_H
#define CORE_LOG_REGISTRY_H

#include "core/log_link.h"

#include <memory>
#include <pthread.h>

extern log_mutex g_registry_lock;
extern log_mutex g_takeover_lock LOG_ACQUIRED_BEFORE(g_registry_lock);

struct log_sock_fd {
    int cmd_fd = -1;                    /* the command connection: a log tool, or the control link; -1: none, here and
                                           below */
    log_tls_session *cmd_ssl = nullptr; /* its session; null without TLS, here and below */
    int qxdm_fd = -1;                   /* the modem-log data link */
    log_tls_session *qxdm_ssl = nullptr;
    int syslog_fd = -1; /* the system-log data link */
    log_tls_session *syslog_ssl = nullptr;
};

extern log_sock_fd g_sock_fd LOG_GUARDED_BY(g_registry_lock);

/* Address of the connected log tool, as text. */
extern char client_ip[kClientIpSize] LOG_GUARDED_BY(g_registry_lock);

/* The thread that reads the command connection in server mode; 0: none yet, or no more. */
extern pthread_t recv_thread_id LOG_GUARDED_BY(g_registry_lock);

/* Where the server wants a stream to go. */
struct log_target {
    char ip[64] = {};
    int port = 0;
};

extern log_target syslog_target LOG_GUARDED_BY(g_registry_lock);
extern log_target qxdm_target LOG_GUARDED_BY(g_registry_lock);

/* Our ends of the connections to the intakes, which the log programs have copies of; -1: none. */
extern int syslog_local_fd LOG_GUARDED_BY(g_registry_lock);
extern int qxdm_local_fd LOG_GUARDED_BY(g_registry_lock);

/* Takes a link away from its owner: its reading ends, no command of it is run any more, and what its owner still has to
 * say in server mode reaches nobody. A link over TLS also needs to be stopped (log_tls_session::open). */
void log_link_take_away(log_link &link);

/* ---- The command connection ---- */

/* The command connection's descriptor, for the log only; -1 when there is none. */
int log_cmd_fd();

/* A command connection that was taken away, for the log only. */
struct log_cmd_taken {
    int fd;           /* -1: there was none */
    pthread_t reader; /* the thread that reads it; 0: none */
};

/* Takes the command connection away from its owner, if it has one. */
log_cmd_taken log_cmd_take_away() LOG_REQUIRES(g_takeover_lock);

/* Records a link as the command connection. */
void log_cmd_record(const std::shared_ptr<log_link> &link);

/* The command connection for a reply of the calling thread; null when there is none, or a log tool that this thread
 * serves has been replaced by another. */
std::shared_ptr<log_link> log_cmd_link();

/* The owner's last step: forgets the command connection, unless another has taken it over. */
void log_cmd_forget(const log_link &link);

/* ---- For the thread that reads a link ---- */

/* While this lives, the calling thread serves the link, whose owner it is. */
class log_serving
{
public:
    explicit log_serving(log_link &link);
    ~log_serving();
    log_serving(const log_serving &) = delete;
    log_serving &operator=(const log_serving &) = delete;
};

/* The link that the calling thread serves; null: none. */
log_link *log_served();

/* Whether that link is given up: see log_link::is_given_up(). */
bool log_served_given_up();

/*
 * A turn to run a command that does not run beside others. One thread has it at a time: a tool that took over from
 * another waits here until the other's command has ended. A thread whose link is taken away or given up meanwhile waits
 * no longer; it gets no turn, nor does one whose link was taken away before.
 */
class log_cmd_turn
{
public:
    explicit log_cmd_turn(bool alone); /* false: the command may run beside others */
    ~log_cmd_turn();
    log_cmd_turn(const log_cmd_turn &) = delete;
    log_cmd_turn &operator=(const log_cmd_turn &) = delete;
    bool granted() const { return granted_; }

private:
    void take(std::chrono::milliseconds time);

    const bool alone_;
    bool granted_ = false;
};

#endif

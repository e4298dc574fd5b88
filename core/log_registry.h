/*
 * The connection registry: which sockets and TLS sessions the daemon talks on, who may use them, and who closes them.
 *
 * A connection has one owner, the thread that reads it. The owner alone closes it, at its own end. Others may
 *   - take it away: reset its fields here and shut its socket down, which wakes its reader and a sender that blocks
 *     on it. The number stays taken until the owner is done, so it can never mean another connection meanwhile.
 *   - send on it: through log_cmd_use, which holds the link for one frame, so that frames of several threads never
 *     mix and the owner waits with its close until the frame is out or has failed.
 *
 * The locks of the daemon, in the order in which one may be taken while another is held:
 *
 *   g_takeover_lock  one accepted connection at a time takes the place of another
 *   producer_lock    of a stream: one thread at a time deals with its log program (core/log_streams.h), and
 *   send_lock        of a stream: one send at a time on its data link
 *   g_cmd_send_lock  one frame at a time on the command connection: held while it is sent (log_cmd_use)
 *   g_registry_lock  the fields of the registry. Held for a few instructions: no waiting for a peer, sending, logging
 *                    or starting of threads and programs
 *   g_block_lock     the blocks that wait for their next use (core/log_block.h); as short
 *   g_restart_lock   the latest restart of the local system log (core/log_local_syslog.cpp); as short
 *   g_context_lock   the TLS context (client/log_tls.cpp), and
 *   a session's own  one library call on it (client/tls_session.cpp): both are taken last
 */
#ifndef CORE_LOG_REGISTRY_H
#define CORE_LOG_REGISTRY_H

#include "core/log_lock.h"

#include <cstddef>
#include <openssl/ossl_typ.h>
#include <pthread.h>

extern log_mutex g_takeover_lock;
extern log_mutex g_cmd_send_lock;
extern log_mutex g_registry_lock;
extern log_mutex g_block_lock;

struct log_sock_fd {
    int cmd_fd = -1;        /* the command connection: a log tool, or the control link; -1: none, here and below */
    SSL *cmd_ssl = nullptr; /* its session; null without TLS, here and below */
    int qxdm_fd = -1;       /* the modem-log data link */
    SSL *qxdm_ssl = nullptr;
    int syslog_fd = -1; /* the system-log data link */
    SSL *syslog_ssl = nullptr;
};

extern log_sock_fd g_sock_fd LOG_GUARDED_BY(g_registry_lock);

/* Address of the connected log tool, as text. */
constexpr std::size_t kClientIpSize = 64;
extern char client_ip[kClientIpSize] LOG_GUARDED_BY(g_registry_lock);

/* The thread that reads the command connection in server mode; 0: none yet, or no more. It stands here only while the
 * thread lives, so that cancelling it is safe under the lock. */
extern pthread_t recv_thread_id LOG_GUARDED_BY(g_registry_lock);

/* The command connection's descriptor, for the log only; -1 when there is none. */
int log_cmd_fd();

/* A command connection that was taken away, for the log only. */
struct log_cmd_taken {
    int fd;           /* -1: there was none */
    pthread_t reader; /* the thread that was cancelled; 0: none */
};

/* Takes the command connection away from its owner, whose reading it cancels, or closes it where it has none. */
log_cmd_taken log_cmd_take_away() LOG_REQUIRES(g_takeover_lock);

/* Records a log tool's connection as the command connection, owned by the thread that is about to be started for it, or
 * by nobody after log_cmd_disown(). */
void log_cmd_record(int fd, const char *ip) LOG_REQUIRES(g_takeover_lock);
void log_cmd_disown() LOG_REQUIRES(g_takeover_lock);

/* Records the control link of client mode: its session, then its socket, owned by the calling thread. */
void log_cmd_record_session(SSL *session);
void log_cmd_record_link(int fd);

/* The command connection's session; null without TLS. For its owner. */
SSL *log_cmd_session();

/* The address of the log tool whose command connection the calling thread owns, also when another tool has taken its
 * place; empty for a thread that owns none. */
const char *log_cmd_client_ip();

/* Declares the calling thread to be the owner of the command connection `fd`. From now on its commands run,
 * and its replies go out, only while `fd` is still the command connection. A thread that never says so, like
 * one that reads a data link, answers on whatever command connection there is. */
void log_cmd_serve(int fd);

/* Whether the calling thread's command connection is still the daemon's; true for a thread that owns none. */
bool log_cmd_stands();

/*
 * The owner's last step: forgets the command connection `fd` unless another has taken its place, waits for a
 * frame that is just being sent on it, and closes it, after its session and the context of all sessions.
 */
void log_cmd_close(int fd);

/*
 * A turn to run a command. One thread has it at a time: a tool that took another's place waits here until the other's
 * command has ended, and a data link for the control link. A thread whose connection is taken away meanwhile waits no
 * longer; it gets no turn. A command that may run beside others gets its turn at once.
 */
class log_cmd_turn
{
public:
    explicit log_cmd_turn(bool beside_others);
    ~log_cmd_turn();
    log_cmd_turn(const log_cmd_turn &) = delete;
    log_cmd_turn &operator=(const log_cmd_turn &) = delete;
    bool granted() const { return granted_; }

private:
    bool granted_ = false;
    bool taken_ = false; /* and to be given back */
};

/* The command connection, held for one frame. fd() is -1 when there is none or this thread has lost its own. */
class log_cmd_use
{
public:
    log_cmd_use();
    ~log_cmd_use();
    log_cmd_use(const log_cmd_use &) = delete;
    log_cmd_use &operator=(const log_cmd_use &) = delete;
    int fd() const { return fd_; }
    SSL *ssl() const { return ssl_; }

private:
    log_lock sending_;
    int fd_ = -1;
    SSL *ssl_ = nullptr;
};

#endif

/*
 * The two live streams of client mode. Each has, at most,
 *   - a data link to the server, owned by the thread that reads it: it alone closes session and socket, at its own
 *     end;
 *   - over TLS, an intake: a local socket at which the stream's log program is waited for, or connected;
 *   - a producer: the log program, which writes to the data link itself or, over TLS, to the intake.
 *
 * Others may take the link away (a stop, or a newer link that takes its place): its fields are reset here and its
 * owner woken up. Whoever sends on it holds it meanwhile (log_link_use), and the owner waits with its close until
 * that is over. All procedures are for any thread.
 */
#ifndef CORE_LOG_STREAMS_H
#define CORE_LOG_STREAMS_H

#include "core/log_registry.h"

enum class log_stream {
    syslog, /* the system log */
    qxdm,   /* the modem's log */
};

/* Where the server wants a stream to go. */
struct log_target {
    char ip[64] = {};
    int port = 0;
};

extern log_target syslog_target LOG_GUARDED_BY(g_registry_lock);
extern log_target qxdm_target LOG_GUARDED_BY(g_registry_lock);

/* Our ends of the connections to the intakes, which the producers have copies of; -1: none. */
extern int syslog_local_fd LOG_GUARDED_BY(g_registry_lock);
extern int qxdm_local_fd LOG_GUARDED_BY(g_registry_lock);

/*
 * One thread at a time starts or stops a stream's producer, and hands a descriptor to it, while it has this.
 * Programs run meanwhile. The link's owner has it when it closes the link, so that no descriptor is closed while it
 * is being handed.
 */
class log_producer_turn
{
public:
    explicit log_producer_turn(log_stream stream);
    ~log_producer_turn();
    log_producer_turn(const log_producer_turn &) = delete;
    log_producer_turn &operator=(const log_producer_turn &) = delete;

private:
    log_lock hold_;
};

/* ---- Start and stop ---- */

/* Records the target of a stream that is being started; the number of the start, by which its link and its intake are
 * known. They are wanted until the stream is stopped or started anew. */
unsigned log_stream_start(log_stream stream, const char *ip, int port);

/* Takes the data link away from its owner, closes our end of the intake's connection, and sends an intake home that
 * still waits. */
void log_stream_stop(log_stream stream);

/* A producer was started that has to do with no link: no ended link's thread may stop it. */
void log_stream_taken_elsewhere(log_stream stream);

/* Shuts both data links down, as the process is about to end: programs may hold copies of them. */
void log_streams_shut_down();

/* ---- The data link, for the thread that owns it ---- */

struct log_link {
    log_stream stream;
    unsigned start; /* the number of its start */
    log_target target{};
    int fd = -1;
    SSL *ssl = nullptr;
};

/* Reads what the thread has to do; false when its start is not wanted any more. */
bool log_link_begin(log_link &link);

/* Whether the start is still wanted, for a link that is not connected yet. */
bool log_link_wanted(const log_link &link);

/* Records the link's session, in place of a link that stood there; then, once the link can be used, its socket.
 * False when the start is not wanted any more: the link is not to be used. */
bool log_link_record_session(const log_link &link);
bool log_link_record(const log_link &link);

/* Whether the link still stands, as far as the calling thread serves one. */
void log_link_serve(const log_link &link);
bool log_link_stands();

/* Takes the link back if it still stands, waits until nobody sends on it, and closes it. */
void log_link_close(const log_link &link);

/* Whether no producer has been started for a newer link yet: then what is run at this link's end hits none. */
bool log_link_is_latest(const log_link &link);

/* The thread's last step, or the last when there is no thread: an intake that waits for the start's producer waits no
 * longer. */
void log_link_end(const log_link &link);

/* ---- The data link, for others ---- */

/* The socket of the stream's data link, which is from now on the link that the producer belongs to; -1 when there is
 * none. For the holder of the producer's turn. */
int log_link_for_producer(log_stream stream);

/* Records our end of a connection to the intake, -1: none, and closes the one before. */
void log_local_record(log_stream stream, int fd);

/* The data link, held for one send. fd() is -1 when there is none. */
class log_link_use
{
public:
    explicit log_link_use(log_stream stream);
    ~log_link_use();
    log_link_use(const log_link_use &) = delete;
    log_link_use &operator=(const log_link_use &) = delete;
    int fd() const { return fd_; }
    SSL *ssl() const { return ssl_; }

private:
    const log_stream stream_;
    log_lock sending_;
    int fd_ = -1;
    SSL *ssl_ = nullptr;
};

/* ---- The intake ---- */

/* An intake's thread is about to be started; waits until it has said what came of it. */
void log_intake_starting(log_stream stream);
void log_intake_await(log_stream stream);

/* The intake of the latest start listens on `fd`, in place of one that still waited there; -1: it could not be
 * brought up. False when it is not wanted any more. */
bool log_intake_listens(log_stream stream, int fd);

/* The intake no longer waits on `fd`: true; false when it was sent home meanwhile. */
bool log_intake_done_waiting(log_stream stream, int fd);

#endif

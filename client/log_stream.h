/*
 * The live streams of client mode. A start of a stream is an object, from the server's request to the end of its last
 * thread: its target, its data link, over TLS its intake, and our end of its program's connection.
 *
 *     control link           data link's thread              intake's thread (over TLS)
 *     log_stream_start() --> connects, announces the link    listens by then, waits for the program
 *                            reads; the confirmation:
 *                            log_stream_confirm()        --> the program writes, pieces go out on the link
 *     log_stream_end()   --> drains, says good-bye, closes   ends with its program
 *
 * Each log has a current start. A newer one takes over when its link has been announced; until then the older one goes
 * on. A thread ends nothing but its own start. All procedures are for any thread.
 */
#ifndef CLIENT_LOG_STREAM_H
#define CLIENT_LOG_STREAM_H

#include "core/log_programs.h"

/* Starts a stream to the address: its threads run when this returns. What fails is logged. */
void log_stream_start(log_kind kind, const char *ip, int port);

/* Has the stream's log program started, which the server asks for on the data link: writing to the link itself or, over
 * TLS, to the intake. Not when the link that brought the confirmation has been stopped, nor over TLS a second time, as an
 * intake serves one program (both logged). */
void log_stream_confirm(log_kind kind);

/* Ends the stream and its program, and has the device log locally again. The link is closed by its own thread. */
void log_stream_end(log_kind kind);

/* Whether the log's program, if one runs, is for the links that there are: when it is not, their ends leave it alone. It
 * is again from the next confirmation on. */
void log_stream_own_program(log_kind kind, bool owns);

/* Ends the data links whose server has vanished, or has taken nothing for 60 seconds (logged): whatever logs on the device
 * would wait for it. Called every few seconds, by one thread. */
void log_streams_look_after();

/* Ends both streams, as the process is about to, and waits for that: 3.5 seconds for all of it, then 2.5 for the links
 * whose programs hang. */
void log_streams_end_all();

#endif

/* The receive loop of the command connection. */
#ifndef PROTOCOL_LOG_RECV_H
#define PROTOCOL_LOG_RECV_H

/* Makes a descriptor the argument of log_recv_tcp_msg() as a thread body. */
void *log_recv_argument(int fd);

/*
 * Owns the command connection whose descriptor is the argument: reads it and has its commands carried out
 * until the peer closes, a read fails, or the thread is cancelled because another connection took its place;
 * then closes it and takes it out of the registry. Returns null.
 *
 * Cancellation works by unwinding the stack, which ends the process where it meets a destructor or a noexcept
 * procedure. So the thread can be cancelled in its blocking read and nowhere else.
 */
void *log_recv_tcp_msg(void *connection);

#endif

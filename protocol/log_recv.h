/* The receive loops: how the bytes of a link become commands. */
#ifndef PROTOCOL_LOG_RECV_H
#define PROTOCOL_LOG_RECV_H

#include "core/log_link.h"
#include "protocol/log_reassembly.h"

#include <span>

/* Has the frames in a piece carried out, and logs it. False, after a log line, when the link must not be read on. */
using log_take_piece = bool (*)(log_link &link, log_reassembly &state, std::span<const unsigned char> piece);

/* Reads the link, which the calling thread owns and serves, and hands over its pieces until it ends or was taken away:
 * then 0, or the errno of the read that failed; -1 when `take` does not want more. */
int log_recv_link(log_link &link, log_take_piece take);

/*
 * Owns the command connection: reads it and has its commands carried out until the peer closes, a read fails, or
 * another connection takes it over, or, in server mode, its first bytes are a web browser's request; then takes it out
 * of the registry and has `close` end it, which is given no owner any more. Logs at level 6 as "vex_log_manage".
 */
void log_recv_tcp_msg(log_link &link, void (*close)(log_link &link));

#endif

/* How the daemon's handlers and client threads send a frame. */
#ifndef PROTOCOL_LOG_PKG_SEND_H
#define PROTOCOL_LOG_PKG_SEND_H

#include "core/log_link.h"
#include "protocol/log_pkg_codec.h"

/*
 * Sends one frame whole. The caller keeps other senders off the connection meanwhile.
 *   fd       the connection's socket; negative where there is none
 *   ssl      its TLS session, null without TLS
 *   control  the control text, ended by NUL, up to kPkgControlMax bytes
 *   data     the data part, never null, also where there is none
 *   dataLen  its length in bytes, up to kPkgDataMax
 * 0 sent; -1 refused or failed, logged but where an argument is missing. A failed send is not tried again and
 * the connection is left as it is. For any thread.
 */
int log_send_pkg_msg(int fd, log_tls_session *ssl, const char *control, const void *data, int dataLen);

/* The same on the link of the calling thread's replies (log_cmd_link), one frame at a time. */
int log_cmd_send_msg(const char *control);

/* The same for `dataLen` bytes of data that are already in `piece->data()`, and stay there: a piece of a file is sent
 * without being copied. */
int log_cmd_send_piece(const char *control, log_outgoing *piece, int dataLen);

#endif

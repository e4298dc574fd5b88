/* How the daemon's handlers and client threads send a frame. */
#ifndef PROTOCOL_LOG_PKG_SEND_H
#define PROTOCOL_LOG_PKG_SEND_H

#include "protocol/log_pkg_codec.h"

#include <cstddef>
#include <openssl/ossl_typ.h>

/*
 * Sends one frame whole. The caller holds the link (log_cmd_use), so that frames never mix.
 *   fd       the connection's socket; negative where there is none
 *   ssl      its TLS session, null without TLS
 *   control  the control text, ended by NUL, up to kPkgControlMax bytes
 *   data     the data part, never null, also where there is none
 *   dataLen  its length in bytes, up to kPkgDataMax
 * 0 sent; -1 refused or failed, logged but where an argument is missing. A failed send is not tried again and
 * the connection is left as it is.
 */
int log_send_pkg_msg(int fd, SSL *ssl, const char *control, const void *data, int dataLen);

/* A frame on its way out, in a block (core/log_block.h); it is encoded where it lies. */
struct log_outgoing {
    unsigned char front[52]; /* so that the data is aligned, which makes copying it cheaper */
    log_msg msg;
    unsigned char rest[kPkgSendBuf]; /* so that from anywhere in the record there are kPkgSendBuf bytes to write to */
};
static_assert((offsetof(log_outgoing, msg) + offsetof(log_msg, data)) % 64 == 0);

/* The same for `dataLen` bytes of data that are already in `piece->msg.data`, and stay there: a piece of a file is
 * sent without being copied. */
int log_send_pkg_piece(int fd, SSL *ssl, const char *control, log_outgoing *piece, int dataLen);

#endif

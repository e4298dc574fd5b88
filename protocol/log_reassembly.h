/*
 * The reassembler: turns the bytes of one connection back into frames and has each frame's command carried
 * out.
 *
 * Held bytes always begin with what should be a frame. Bytes that cannot be one stop everything, as the
 * stream has no other mark to find a frame by, until LOG_RECV_PKG_LEN bytes would be held: then all of them
 * are dropped and the newest piece is examined afresh.
 */
#ifndef PROTOCOL_LOG_REASSEMBLY_H
#define PROTOCOL_LOG_REASSEMBLY_H

#include "core/log_record.h"
#include "protocol/log_pkg_codec.h"
#include "protocol/log_request_line.h"

#include <cstddef>
#include <span>

constexpr std::size_t LOG_RECV_PKG_LEN = 61440; /* bytes; held bytes are always fewer */

/* A peer that sends byte by byte must not fill the log: each piece that completes no frame costs hundreds of bytes of it. So
 * of small pieces in a row, only the first ones are told. */
constexpr std::size_t kLogSmallPiece = 16;  /* bytes; smaller ones are small */
constexpr unsigned kLogSmallPiecesTold = 16;

/* What a frame on its way in takes up. Nothing behind the held bytes is ever read. */
struct log_incoming {
    log_msg msg; /* the frame that is being handled */
    unsigned char recv_pkg_buf[LOG_RECV_PKG_LEN];
};

/* One connection's bytes that are not yet a frame. Lives and ends with the connection; one thread feeds it. */
struct log_reassembly {
    log_record_ptr<log_incoming> incoming; /* allocated by the first piece */
    std::size_t recv_pkg_len = 0;          /* bytes held, from offset 0 */
    unsigned small_pieces = 0;             /* in a row, that completed no frame */
    log_request_line opening;              /* for the receive loop, which keeps browsers away */

    bool is_silent() const { return small_pieces > kLogSmallPiecesTold; }
};

/*
 * Appends a piece and handles every whole frame, in order, on the calling thread; a rest is kept for the next piece. A
 * frame that cannot be decoded is dropped by itself. 0; -1 only when the buffer cannot be allocated: the piece is lost.
 * Logs at level 6 as "vex_log_manage"; of small pieces in a row only the first ones, and how many were left out once a
 * frame is whole or a larger piece comes.
 */
int log_proc_tcp_pkg(log_reassembly &state, std::span<const unsigned char> piece);

#endif

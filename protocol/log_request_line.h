/*
 * Tells web browsers from log tools: what they send begins with a request line, "METHOD TARGET HTTP/...". A page can make
 * a browser send such a request to the command port, with a body that holds frames.
 */
#ifndef PROTOCOL_LOG_REQUEST_LINE_H
#define PROTOCOL_LOG_REQUEST_LINE_H

#include <cstdint>
#include <span>

/* What the bytes of a connection have shown so far. Lives with the connection; for one thread. */
struct log_request_line {
    enum class part : std::uint8_t { method, target, version, none };

    part at = part::method;    /* none: it is no request line */
    std::uint32_t matched = 0; /* bytes of that part that have come; of a target only whether there is one */
};

/* Looks at the next bytes of a connection, from its first one on and in pieces of any size. True as soon as they are
 * known to be a request line, whatever its method and however long its target; then it must not be called again. What
 * begins with the first byte of the head tag never is one. */
bool log_take_request_line(log_request_line &line, std::span<const unsigned char> piece);

#endif

/*
 * A connection to a device's log daemon, as the log tool uses it: every wait has a limit, and every failure
 * is a sentence that says what failed, at which address, why, and what to try.
 *
 * Procedures that can fail return false or nothing and store that sentence in `why`; one thread uses a link.
 */
#ifndef TOOLS_TOOL_LINK_H
#define TOOLS_TOOL_LINK_H

#include "platform/unique_fd.h"
#include "protocol/log_pkg_codec.h"
#include "tools/tool_tls.h"

#include <chrono>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <sys/socket.h>
#include <vector>

struct tool_limits {
    std::chrono::milliseconds connect{5000}; /* until one of its addresses has accepted; not the look-up */
    std::chrono::milliseconds reply{60000};  /* until the first byte of an answer */
    std::chrono::milliseconds stall{15000};  /* from one byte to the next, both ways */
};

struct tool_link {
    unique_fd fd;
    tls_session session = nullptr; /* over TLS; ends before its socket */
    std::string where;             /* the device's address and port, for messages */
    bool server = false;           /* the log server is at the other end, and the device behind it */
    bool with_device = false;      /* which it has given us */
    tool_limits limits;
    std::vector<unsigned char> held;                            /* received bytes behind the frames that were taken */
    std::unique_ptr<log_msg> msg = std::make_unique<log_msg>(); /* the frame being sent, or taken last */
};

struct tool_frame {
    std::string control;
    std::span<const unsigned char> data; /* the link's, until it is used again */
};

/* Connects to the first address of `host` that accepts. `advice` ends the sentence when none does. */
std::optional<tool_link> tool_connect(const std::string &host, const std::string &port, const tool_limits &limits,
                                      const char *advice, std::string &why);

/* Has a device that is gone without a word found out after 90 seconds of silence. */
void tool_set_keepalive(int fd);

/* The address of an end of a connection, getsockname or getpeername; of an IPv4 one as such, whatever the socket. */
std::string tool_address(int fd, decltype(getsockname) *end);

/* Sends one frame. */
bool tool_send(tool_link &link, const std::string &control, std::span<const unsigned char> data, std::string &why);

/* Waits for the next frame, `first` for its first byte: link.limits.reply for an answer, link.limits.stall inside a
 * transfer. */
std::optional<tool_frame> tool_receive(tool_link &link, std::chrono::milliseconds first, std::string &why);

/* The next frame if it is there; else none, and `wanted` says what to wait for, or `why` why there will be none. */
std::optional<tool_frame> tool_receive_now(tool_link &link, short &wanted, std::string &why);

/* As recv(), without waiting: takes bytes that a frame was read ahead of, or what there is. With EAGAIN, `wanted`
 * says what to wait for. */
ssize_t tool_read_some(tool_link &link, std::span<unsigned char> bytes, short &wanted);

/* Whether the device still keeps the connection, when its socket is readable: a device says nothing unasked, but its
 * TLS may. */
bool tool_still_there(tool_link &link);

#endif

/*
 * Where a live log's bytes come from. To a log tool the device's log programs send them themselves: the system log as
 * datagrams, a line each; the modem's over a connection to the device. A log server passes both on in frames.
 */
#ifndef TOOLS_TOOL_STREAM_SOURCE_H
#define TOOLS_TOOL_STREAM_SOURCE_H

#include "tools/tool_device.h"

struct tool_stream_source {
    unique_fd datagrams;
    std::optional<tool_link> link; /* if not datagrams: to the device, or to the log server */

    bool opened() const { return datagrams || link; }
    int fd() const { return datagrams ? datagrams.get() : link->fd.get(); }
};

/* What was asked of the device, and what is still to come of it. */
struct tool_stream_start {
    bool asked = false; /* then it is to be asked to stop, whatever happens */
    bool answered = false;
    int status = kNoAnswer;
    std::string why; /* when there is no stream */
};

/* Has the device start the log "syslog" or "qxdm", the modem's, and opens its source. With device.json, its answer is
 * printed to `replies`. */
tool_stream_start tool_stream_begin(tool_device &device, const std::string &log, FILE *replies,
                                    tool_stream_source &source);

/* Has the device stop, or tells the log server that we have enough; what is wrong with that, if anything. A start's answer
 * may still be due. */
std::string tool_stream_end(tool_device &device, tool_stream_source &source, const std::string &log, bool answer_due);

/* The command that has the device stop. */
std::string tool_stream_end_command(const std::string &log);

/* Takes bytes that are there: 0 when there are none, `wanted` says what to wait for; -1 at the stream's end, and why if it
 * is not the one that we wanted. Datagrams of others than the device, with which we have `control`, are passed over. */
ssize_t tool_stream_take(tool_stream_source &source, const tool_link *control, std::string &bytes, short &wanted,
                         std::string &why);

#endif

/*
 * Command dispatch: from a control text to the handler of its message id. The table is declared here and
 * defined with the handlers, so that nothing below them knows one.
 *
 * Dispatch keeps no state and runs handlers on the thread that calls it. In server mode one runs at a time: when its
 * turn has come, and only while its tool has not been replaced. In client mode links dispatch at the same time. It sends
 * nothing itself.
 */
#ifndef PROTOCOL_LOG_JSON_CODEC_H
#define PROTOCOL_LOG_JSON_CODEC_H

#include "protocol/json_tree.h"

#include <cstdint>
#include <span>

/*
 * What every handler is given, all of it borrowed for the call: the control text, ended by NUL and at most
 * kPkgControlMax characters long; the data part, never null; its length in bytes. The result, 0 or -1 by the
 * handler's own rules, is for nobody.
 */
using log_msg_handler = int (*)(const char *control, const unsigned char *data, std::int32_t dataLen);

struct log_msg_handler_entry {
    log_msg_handler handler; /* null: the id is known and nothing is done */
    std::int32_t msgid;
    bool alone = false; /* in client mode, too, it never runs beside another such (log_cmd_turn) */
};

extern const std::span<const log_msg_handler_entry> log_msg_handler_table;

/* The number in the control text's member "msgid", which must be a string; -1 when it cannot be read. */
int log_json_get_msgid(const char *control);

/* Parses a control text; null when it is not JSON, or has an escaped NUL in it: a text would end there for whoever reads
 * it, and what comes behind it would escape every check. */
json_tree log_json_parse(const char *control);

/* Runs the handler of the control text's message id. 0 when it ran or the id has none; -1 when the id is
 * missing, unreadable or unknown, or the link was taken over or ended: then only the log tells. */
int log_dl_msg_handle_cmd(const char *control, const unsigned char *data, std::int32_t dataLen);

#endif

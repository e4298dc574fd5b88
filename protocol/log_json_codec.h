/*
 * Command dispatch: from a control text to the handler of its message id. The table is declared here and
 * defined with the handlers, so that nothing below them knows one.
 *
 * Dispatch keeps no state and runs handlers on the thread that calls it, when its turn has come. Once the thread's
 * command connection has been taken over by another tool, none is run any more. It sends nothing itself.
 */
#ifndef PROTOCOL_LOG_JSON_CODEC_H
#define PROTOCOL_LOG_JSON_CODEC_H

#include "protocol/json_tree.h"

#include <array>
#include <cstdint>

/*
 * What every handler is given, all of it borrowed for the call: the control text, ended by NUL and at most
 * kPkgControlMax characters long; the data part, never null; its length in bytes. The result, 0 or -1 by the
 * handler's own rules, is for nobody.
 */
using log_msg_handler = int (*)(const char *control, const unsigned char *data, std::int32_t dataLen);

struct log_msg_handler_entry {
    std::int32_t msgid;
    log_msg_handler handler;    /* null: the id is known and nothing is done */
    bool beside_others = false; /* else it runs when no other thread's command does (log_cmd_turn) */
};

extern const std::array<log_msg_handler_entry, 11> log_msg_handler_table;

/* The number in the control text's member "msgid", which must be a string; -1 when it cannot be read. A text
 * that is JSON leaves its tree in `tree`. */
int log_json_get_msgid(const char *control, json_tree &tree);

/* Parses a control text for its handler; null when it is not JSON, or has an escaped NUL in it. A handler that dispatch
 * runs is given the tree that dispatch has made already, by its first call for its own control text. */
json_tree log_json_parse(const char *control);

/* Runs the handler of the control text's message id. 0 when it ran or the id has none; -1 when the id is
 * missing, unreadable or unknown, or another tool has taken over: then only the log tells. */
int log_dl_msg_handle_cmd(const char *control, const unsigned char *data, std::int32_t dataLen);

#endif

/* The steps that all handlers share. Log lines of handlers bear the source "log_json_codec". */
#ifndef HANDLERS_LOG_HANDLER_H
#define HANDLERS_LOG_HANDLER_H

#include "platform/vex_platform.h"
#include "protocol/json_tree.h"

constexpr char kLogSource[] = "log_json_codec";

constexpr char kSuccess[] = "Success";
constexpr char kInternalError[] = "Fail:Device internal error";

/* Entry check of the handler `name`: false, after a log line, when there is no control text or data to look
 * at. */
bool log_handler_entered(const char *name, const char *control, const unsigned char *data);

/* Logs the request to the handler `name` and parses it; null, after a log line, when it is not JSON. */
json_tree log_handler_parse(const char *name, const char *control);

/* The text of a string member, letter case of its name ignored; null when it is missing or of another type.
 * The text lives as long as the tree. */
const char *log_member_text(const cJSON *object, const char *name);

/* Sends a control text on the command connection; what becomes of it is nobody's concern. */
void log_reply_text(const char *control);

/* Fills a reply template, cut at 1023 characters, and sends it. */
void log_reply(const char *format, ...) VEX_PRINTF_CHECKED(1, 2);

#endif

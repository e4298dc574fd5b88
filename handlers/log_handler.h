/* The steps that all handlers share. Log lines of handlers have the source "log_json_codec". */
#ifndef HANDLERS_LOG_HANDLER_H
#define HANDLERS_LOG_HANDLER_H

#include "platform/vex_platform.h"
#include "protocol/json_tree.h"

#include <cstddef>
#include <cstdio>
#include <cstring>

constexpr char kLogSource[] = "log_json_codec";

constexpr char kSuccess[] = "Success";
constexpr char kInternalError[] = "Fail:Device internal error";
constexpr char kParameterError[] = "Fail:parameter error";

/* Entry check of the handler `name`: false, after a log line, when there is no control text or data to look
 * at. */
bool log_handler_entered(const char *name, const char *control, const unsigned char *data);

/* Logs what the handler `name` was sent. */
void log_handler_received(const char *name, const char *control);

/* Parses the request; null, after a log line, when it is not JSON. */
json_tree log_handler_parse(const char *control);

/* These three in a row, as most handlers begin. Null when the request is to be dropped. */
json_tree log_handler_take(const char *name, const char *control, const unsigned char *data);

/* Members of a request, letter case of their names ignored. Null, after the log line "cannot find WHAT item", when one
 * is missing or of another type. They live as long as the tree. */
const char *log_member_text(const cJSON *object, const char *name, const char *what);
const cJSON *log_member_object(const cJSON *object, const char *name, const char *what);

/* A text as above, which is logged as `found`, a format, says. */
const char *log_member_told(const cJSON *object, const char *name, const char *what, const char *found);

/* Copies as much of a text as the field holds with its NUL. */
template <std::size_t size> void log_keep_text(char (&field)[size], const char *text)
{
    const std::size_t len = strnlen(text, size - 1);
    std::memcpy(field, text, len);
    field[len] = '\0';
}

/* Fills a reply template, cut at 1023 characters, and sends it on the command connection; what becomes of it is nobody's
 * concern. */
void log_reply(const char *format, ...) VEX_PRINTF_CHECKED(1, 2);

#endif

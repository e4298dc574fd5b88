/* What is said to a device, and what its reply says. */
#ifndef TOOLS_TOOL_ANSWER_H
#define TOOLS_TOOL_ANSWER_H

#include "protocol/json_tree.h"

#include <string>
#include <utility>
#include <vector>

enum class tool_verdict {
    success, /* the device said "Success" */
    failed,  /* it said "Fail:" and why */
    refused, /* an empty reply: it does not carry out such a request */
    garbled, /* not a reply of the protocol */
};

struct tool_answer {
    tool_verdict verdict;
    std::string reason;  /* a sentence for a person; empty after success */
    json_tree root;      /* the reply, where it is JSON */
    std::string control; /* the reply as it came */
};

/* The text as a terminal may show it: control bytes, which could command the terminal, as \xNN. */
std::string tool_printable(const std::string &text);

/* The same for a text of several lines, whose ends are kept. */
std::string tool_printable_lines(const std::string &text);

/* Members of a JSON object that are texts, and such an object on one line. */
using tool_members = std::vector<std::pair<const char *, std::string>>;
std::string tool_json(const tool_members &members);

/* The control text of a command: `members` inside the object `group`, or beside "msgid" where that is null. */
std::string tool_command(const char *msgid, const char *group, const tool_members &members);

/* The message id of a command or a reply; empty when it has none. */
std::string tool_msgid(const std::string &control);

/* Judges the control text of a reply to the command of that message id. */
tool_answer tool_read_answer(const std::string &control, const std::string &msgid);

/* The printable text of the reply's member `name` inside its member `group`, or of its own where that is null; empty
 * when there is none. */
std::string tool_answer_text(const tool_answer &answer, const char *group, const char *name);

#endif

/* The log server that stands between the tool and the devices that have called it. */
#ifndef TOOLS_TOOL_SERVER_H
#define TOOLS_TOOL_SERVER_H

#include "tools/tool_answer.h"
#include "tools/tool_link.h"

#include <functional>
#include <map>
#include <string>
#include <vector>

/* Where it is, and how it knows us when it is not on this machine. */
struct tool_server {
    std::string address;       /* a unix socket's path, or ADDRESS:PORT; empty: devices are connected to directly */
    std::string cert, key, ca; /* PEM files: an operator's certificate, its key, and what the server's is signed by */
    std::chrono::seconds wait{0}; /* for a device that is not there */
    bool store = false;           /* keep archives there, too */
};

/* Connects and asks for something, with `request` as the control text's members. The link on which it comes, and the
 * server's answer; none, and why, when it is not to be had. What is waited for meanwhile is said on standard error. */
std::optional<tool_link> tool_ask_server(const tool_server &server, const tool_limits &limits,
                                         const tool_members &request, tool_frame &answer, std::string &why);

/* What a server tells of a device: its texts, by their names. */
using tool_entry = std::map<std::string, std::string>;

/* The devices that are there; none, and why, when that can't be had. */
std::optional<std::vector<tool_entry>> tool_list_devices(const tool_server &server, const tool_limits &limits,
                                                         std::string &why);

/* Shows the devices that are there and, with `watch`, who calls and leaves until the user ends it. The exit status. */
int tool_devices(const tool_server &server, const tool_limits &limits, bool json, bool watch);

#endif

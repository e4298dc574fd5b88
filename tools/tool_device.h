/*
 * The device that the tool's commands are for, and what all commands share. Each command is one procedure that returns
 * the tool's exit status and has said by then what came of it: a good result on standard output, anything else on
 * standard error.
 */
#ifndef TOOLS_TOOL_DEVICE_H
#define TOOLS_TOOL_DEVICE_H

#include "tools/tool_answer.h"
#include "tools/tool_link.h"
#include "tools/tool_server.h"

/* Exit statuses beside those of the command line parser, which are above 100. */
constexpr int kDone = 0;
constexpr int kDeviceSaidNo = 1;
constexpr int kNoAnswer = 2; /* or something on this side failed */

struct tool_device {
    std::string host = "192.168.0.1";
    std::string port = "48888";
    tool_limits limits;
    bool json = false;             /* print replies as they came instead of words */
    tool_server server;            /* that the device has called, if it has */
    std::string imei;              /* by which that knows it */
    bool one_of_many = false;      /* the same is asked of others, too */
    std::optional<tool_link> link; /* once it was reached, until it fails */
};

/* Says what failed; the status. */
int tool_fail(int status, const std::string &why);

/* Whether the device is behind a log server. */
inline bool tool_has_server(const tool_device &device)
{
    return !device.server.address.empty();
}

/* Connects unless there is a connection already. Whatever can be wrong on this side is looked at before: to connect is
 * to take the device from another tool. */
bool tool_reach(tool_device &device, std::string &why);

/* Where the device is and what its answer says, as a sentence. */
std::string tool_said(const tool_device &device, const tool_answer &answer);

/* Sends a command and waits for its answer. Nothing, and `why`, when there was none; then the link is given up,
 * unless it was the user who did not want to wait. */
std::optional<tool_answer> tool_exchange(tool_device &device, const std::string &command,
                                         std::span<const unsigned char> data, std::string &why);

/* The same for a command that is all there is to do: prints the reply with --json, says what is wrong with it. The
 * answer where it is a good one that is still to be put in words; else nothing, and `status` to end with. */
std::optional<tool_answer> tool_ask(tool_device &device, const std::string &command, int &status);

#endif

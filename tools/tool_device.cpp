#include "tools/tool_device.h"

#include "tools/tool_wait.h"

#include <cstdio>

int tool_fail(int status, const std::string &why)
{
    std::fflush(stdout); /* first the reply, then what is wrong with it */
    std::fprintf(stderr, "vex_log_tool: %s\n", why.c_str());
    return status;
}

namespace
{

/* A link to the server, which has given us the device. */
std::optional<tool_link> reach_through_server(const tool_device &device, std::string &why)
{
    tool_frame answer;
    std::optional<tool_link> link = tool_ask_server(device.server, device.limits,
                                                    {{"msgid", "device"},
                                                     {"imei", device.imei},
                                                     {"wait", std::to_string(device.server.wait.count())},
                                                     {"store", device.server.store ? "1" : "0"}},
                                                    answer, why);
    if (!link)
        return std::nullopt;
    link->with_device = true;
    link->where = device.imei;
    return link;
}

} // namespace

bool tool_reach(tool_device &device, std::string &why)
{
    if (!device.link && tool_has_server(device))
        device.link = reach_through_server(device, why);
    else if (!device.link)
        device.link =
            tool_connect(device.host, device.port, device.limits,
                         ". Check the address, and that the device is on and its log daemon runs in server mode", why);
    return device.link.has_value();
}

std::optional<tool_answer> tool_exchange(tool_device &device, const std::string &command,
                                         std::span<const unsigned char> data, std::string &why)
{
    if (command.size() > kPkgControlMax) {
        why = "the command has " + std::to_string(command.size()) + " characters; " + std::to_string(kPkgControlMax) +
              " is the most";
        return std::nullopt;
    }
    if (tool_interrupted()) { /* else the command would still go out, as a send need not wait */
        why = "interrupted";
        return std::nullopt;
    }
    if (!tool_reach(device, why))
        return std::nullopt;
    std::optional<tool_frame> frame;
    if (tool_send(*device.link, command, data, why))
        frame = tool_receive(*device.link, device.limits.reply, why);
    if (frame)
        return tool_read_answer(frame->control, tool_msgid(command));
    if (!tool_interrupted())
        device.link.reset();
    return std::nullopt;
}

std::string tool_said(const tool_device &device, const tool_answer &answer)
{
    return (device.link               ? device.link->where
            : tool_has_server(device) ? device.imei
                                      : device.host + " port " + device.port) +
           ' ' + answer.reason;
}

std::optional<tool_answer> tool_ask(tool_device &device, const std::string &command, int &status)
{
    std::string why;
    std::optional<tool_answer> answer = tool_exchange(device, command, {}, why);
    if (!answer) {
        status = tool_fail(kNoAnswer, why);
        return std::nullopt;
    }
    if (device.json && answer->root)
        std::printf("%s\n", answer->control.c_str());
    status = kDone;
    if (answer->verdict != tool_verdict::success)
        status = tool_fail(kDeviceSaidNo, tool_said(device, *answer));
    if (status != kDone || device.json)
        answer.reset();
    return answer;
}

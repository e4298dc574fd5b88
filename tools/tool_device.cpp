#include "tools/tool_device.h"

#include "tools/tool_wait.h"

#include <cstdio>

int tool_fail(int status, const std::string &why)
{
    std::fflush(stdout); /* first the reply, then what is wrong with it */
    std::fprintf(stderr, "vex_log_tool: %s\n", why.c_str());
    return status;
}

bool tool_reach(tool_device &device, std::string &why)
{
    if (!device.link && device.called_at != nullptr)
        why = "the device has hung up";
    else if (!device.link)
        device.link =
            tool_connect(device.host, device.port, device.limits,
                         ". Check the address, and that the device is on and its log daemon runs in server mode", why);
    return device.link.has_value();
}

std::string tool_command(const char *msgid, const char *group,
                         std::initializer_list<std::pair<const char *, std::string>> members)
{
    const json_tree root{cJSON_CreateObject()};
    cJSON_AddStringToObject(root.get(), "msgid", msgid);
    cJSON *const object = group != nullptr ? cJSON_AddObjectToObject(root.get(), group) : root.get();
    for (const auto &[name, value] : members)
        cJSON_AddStringToObject(object, name, value.c_str());
    char *const printed = cJSON_PrintUnformatted(root.get());
    std::string text = printed != nullptr ? printed : "";
    cJSON_free(printed);
    return text;
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
    return (device.link ? device.link->where : device.host + " port " + device.port) + ' ' + answer.reason;
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

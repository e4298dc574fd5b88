#include "tools/tool_answer.h"

#include <algorithm>
#include <utility>

namespace
{

/* What to do about an answer that is no success. */
const char *advice(const std::string &result)
{
    constexpr std::pair<const char *, const char *> kAdvice[] = {
        {"Fail:Modem file is not exisit", ": push a configuration package with a Diag.cfg first (config)"},
        {"Fail:Compressed logfs error",
         ": most likely a log changed while the logs were packed. Try again, or stop captures "
         "and streams first"},
        {"Fail:Open log file error", ": it has lost its archive. Try again"},
        {"Fail:parameter error", ": it does not take such a value"},
        {"Fail:Device internal error",
         ": it could not do it, or misses something in the command. Its own log tells more"},
    };
    for (const auto &[failure, text] : kAdvice)
        if (result == failure)
            return text;
    return ". Its own log may tell more";
}

/* The text of a member; empty when there is none. */
std::string member(const cJSON *root, const char *name)
{
    const char *text = cJSON_GetStringValue(cJSON_GetObjectItem(root, name));
    return text != nullptr ? text : "";
}

void add_members(cJSON *object, const tool_members &members)
{
    for (const auto &[name, value] : members)
        cJSON_AddStringToObject(object, name, value.c_str());
}

std::string print(const cJSON *root)
{
    char *const printed = cJSON_PrintUnformatted(root);
    std::string text = printed != nullptr ? printed : "";
    cJSON_free(printed);
    return text;
}

} // namespace

std::string tool_printable(const std::string &text)
{
    constexpr char kHex[] = "0123456789abcdef";
    std::string out;
    unsigned char last = 0;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        const bool second_control = last == 0xc2 && byte >= 0x80 && byte < 0xa0; /* U+0080 to U+009F in UTF-8 */
        if (byte < 0x20 || byte == 0x7f || second_control)
            out.append("\\x").append(1, kHex[byte >> 4]).append(1, kHex[byte & 15]);
        else
            out += c;
        last = byte;
    }
    return out;
}

std::string tool_printable_lines(const std::string &text)
{
    std::string out;
    for (std::size_t at = 0; at < text.size();) {
        const std::size_t end = std::min(text.find('\n', at), text.size());
        out += tool_printable(text.substr(at, end - at));
        if (end < text.size())
            out += '\n';
        at = end + 1;
    }
    return out;
}

std::string tool_json(const tool_members &members)
{
    const json_tree root{cJSON_CreateObject()};
    add_members(root.get(), members);
    return print(root.get());
}

std::string tool_command(const char *msgid, const char *group, const tool_members &members)
{
    const json_tree root{cJSON_CreateObject()};
    cJSON_AddStringToObject(root.get(), "msgid", msgid);
    add_members(group != nullptr ? cJSON_AddObjectToObject(root.get(), group) : root.get(), members);
    return print(root.get());
}

std::string tool_msgid(const std::string &control)
{
    const json_tree root{cJSON_ParseWithLength(control.data(), control.size())};
    return member(root.get(), "msgid");
}

tool_answer tool_read_answer(const std::string &control, const std::string &msgid)
{
    if (control.empty())
        return {tool_verdict::refused, "refused the request: it does not know such a command or value", nullptr, ""};
    json_tree root{cJSON_ParseWithLength(control.data(), control.size())};
    const std::string result = member(root.get(), "Result");
    if (result.empty())
        return {tool_verdict::garbled, "sent a reply without a result: " + tool_printable(control), nullptr, control};
    if (member(root.get(), "msgid") != msgid)
        return {tool_verdict::garbled, "sent the reply to another command: " + tool_printable(control), nullptr,
                control};
    if (result == "Success")
        return {tool_verdict::success, "", std::move(root), control};
    const std::string reason = "answered \"" + tool_printable(result) + '"' + advice(result);
    return {tool_verdict::failed, reason, std::move(root), control};
}

std::string tool_answer_text(const tool_answer &answer, const char *group, const char *name)
{
    const cJSON *object = group != nullptr ? cJSON_GetObjectItem(answer.root.get(), group) : answer.root.get();
    const char *text = cJSON_GetStringValue(cJSON_GetObjectItem(object, name));
    return text != nullptr ? tool_printable(text) : "";
}

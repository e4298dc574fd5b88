#include "tools/tool_answer.h"

std::string tool_printable(const std::string &text)
{
    constexpr char kHex[] = "0123456789abcdef";
    std::string out;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (byte >= 0x20 && byte != 0x7f)
            out += c;
        else
            out.append("\\x").append(1, kHex[byte >> 4]).append(1, kHex[byte & 15]);
    }
    return out;
}

tool_answer tool_read_answer(const std::string &control)
{
    if (control.empty())
        return {tool_verdict::refused, "the device refused the request: it does not know such a command", nullptr,
                control};
    json_tree root{cJSON_ParseWithLength(control.data(), control.size())};
    const char *result = cJSON_GetStringValue(cJSON_GetObjectItem(root.get(), "Result"));
    if (result == nullptr)
        return {tool_verdict::garbled, "the device's reply has no result: " + tool_printable(control), std::move(root),
                control};
    const std::string said = result;
    if (said == "Success")
        return {tool_verdict::success, "", std::move(root), control};
    return {tool_verdict::failed, "the device answered \"" + tool_printable(said) + '"', std::move(root), control};
}

std::string tool_answer_text(const tool_answer &answer, const char *group, const char *name)
{
    const cJSON *object = group != nullptr ? cJSON_GetObjectItem(answer.root.get(), group) : answer.root.get();
    const char *text = cJSON_GetStringValue(cJSON_GetObjectItem(object, name));
    return text != nullptr ? tool_printable(text) : "";
}

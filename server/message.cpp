#include "server/message.h"

std::string json_line(std::initializer_list<std::pair<const char *, std::string>> members)
{
    const json_tree root{cJSON_CreateObject()};
    for (const auto &[name, value] : members)
        cJSON_AddStringToObject(root.get(), name, value.c_str());
    char *const printed = cJSON_PrintUnformatted(root.get());
    std::string text = printed != nullptr ? printed : "";
    cJSON_free(printed);
    return text;
}

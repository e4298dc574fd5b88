/* The control texts that the server reads and writes. */
#ifndef SERVER_MESSAGE_H
#define SERVER_MESSAGE_H

#include "protocol/json_tree.h"
#include "tools/tool_answer.h"

#include <string>
#include <string_view>

/* A control text that was received. */
class message
{
public:
    explicit message(std::string_view control) : root_(cJSON_ParseWithLength(control.data(), control.size())) {}

    /* The text of a member, or of one inside the object `group`; empty when there is none. */
    std::string text(const char *name) const { return text_of(root_.get(), name); }
    std::string text(const char *group, const char *name) const
    {
        return text_of(cJSON_GetObjectItem(root_.get(), group), name);
    }
    std::string msgid() const { return text("msgid"); }

private:
    static std::string text_of(const cJSON *object, const char *name)
    {
        const char *const text = cJSON_GetStringValue(cJSON_GetObjectItem(object, name));
        return text != nullptr ? text : "";
    }

    json_tree root_;
};

#endif

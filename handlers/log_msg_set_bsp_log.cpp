#include "core/log_line.h"
#include "handlers/bsp_module_level.h"
#include "handlers/handlers.h"
#include "handlers/log_handler.h"

namespace
{

constexpr std::size_t kQueriedNameMax = 900; /* characters; with the rest, the reply stays below 1023 */

struct bsp_request {
    const char *name;
    const char *level; /* empty: which one is set? */
};

void reply(const char *name, const char *level, const char *result)
{
    log_reply("{\"msgid\":\"8\",\"bsp\":{\"module_name\":\"%s\",\"level\":\"%s\"},\"Result\":\"%s\"}", name, level,
              result);
}

/* Reads the request, whose texts live as long as its tree; false, after a log line, when it is not complete. */
bool read_request(const cJSON *tree, bsp_request *request)
{
    const cJSON *bsp = log_member_object(tree, "bsp", "K_bspLogSet");
    if (bsp == nullptr)
        return false;
    request->name = log_member_told(bsp, "module_name", "K_bspModuleName", "bsp module_name = %s\n");
    request->level = log_member_told(bsp, "level", "K_bspModuleLevel", "bsp_reqmodulelevel = %s\n");
    return request->name != nullptr && request->level != nullptr;
}

/* Whether a name can be part of a reply: as it is, and with room for the rest. */
bool can_be_replied(const char *name)
{
    std::size_t len = 0;
    for (; name[len] != '\0'; ++len)
        if (static_cast<unsigned char>(name[len]) < ' ' || std::strchr("\"\\", name[len]) != nullptr)
            return false;
    return len <= kQueriedNameMax;
}

bool is_allowed(const bsp_request &request)
{
    if (*request.level == '\0')
        return can_be_replied(request.name);
    return log_bsp_text_allowed(request.name) && log_bsp_text_allowed(request.level);
}

void serve(const bsp_request &request)
{
    const bool query = *request.level == '\0';
    if (*request.name == '\0') {
        reply("", "", "Fail:unkonw bsp module name");
    } else if (!is_allowed(request)) {
        reply("", "", kParameterError);
    } else if (query) {
        char level[kBspFieldSize];
        log_get_bsp_module_level(request.name, level);
        reply(request.name, level, kSuccess);
    } else if (log_set_bsp_module_level(request.name, request.level) != 0) {
        reply("", "", kParameterError);
    } else {
        log_apply_bsp_module_level(request.name, request.level);
        reply(request.name, request.level, kSuccess);
    }
}

} // namespace

int log_msg_set_bsp_log(const char *control, const unsigned char *data, std::int32_t /*dataLen*/)
{
    const json_tree tree = log_handler_take(__func__, control, data);
    if (!tree)
        return -1;
    bsp_request request{};
    if (read_request(tree.get(), &request))
        serve(request);
    else
        reply("", "", kInternalError);
    return 0;
}

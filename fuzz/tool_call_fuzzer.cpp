/*
 * The frame by which a device that calls the log tool says who it is: taken or refused for a reason, and shown so that
 * it cannot command a terminal.
 */
#include "fuzz/fuzz.h"
#include "tools/tool_answer.h"
#include "tools/tool_listener.h"

#include <cstring>
#include <sys/un.h>

namespace
{

/* Where the device calls. */
struct place {
    place()
    {
        address.sun_family = AF_UNIX;
        std::snprintf(address.sun_path + 1, sizeof address.sun_path - 1, "tool_call_fuzzer.%d", getpid());
        listener.fd.reset(socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0));
        promise(bind(listener.fd.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0 &&
                    listen(listener.fd.get(), 1) == 0,
                "a place to be called at");
    }
    sockaddr_un address{};
    tool_listener listener;
};

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    static const place here;
    unique_fd device{socket(AF_UNIX, SOCK_STREAM, 0)};
    if (size > 100000 ||
        connect(device.get(), reinterpret_cast<const sockaddr *>(&here.address), sizeof here.address) != 0)
        return 0;
    promise(send(device.get(), data, size, MSG_NOSIGNAL) == static_cast<ssize_t>(size) || size == 0, "it is sent");
    device.reset();
    std::string why;
    const auto call = tool_take_call(here.listener, {}, tool_clock::now() + std::chrono::seconds(5), why);
    promise(call.has_value() == why.empty(), "a caller is refused for a reason");
    if (!call)
        return 0;
    const std::string_view sent = text_of(data, size);
    promise(sent.starts_with(PKG_HEAD), "only a frame is an announcement");
    promise(call->msgid.empty() || call->announcement, "an announcement that has a number is JSON");
    for (const char *const group : {"ControlLink", "DataLink"})
        for (const char *const name : {"projectName", "VersionInfo", "imei", "modem_msn", "ConnectType"}) {
            const std::string text = tool_announced(*call, group, name);
            promise(!commands_terminal(text), "a caller's words cannot command a terminal");
            const cJSON *const member = cJSON_GetObjectItem(cJSON_GetObjectItem(call->announcement.get(), group), name);
            promise(text.empty() == (!cJSON_IsString(member) || *member->valuestring == '\0'), "they are shown");
        }
    return 0;
}

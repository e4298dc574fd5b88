#include "device/log_server.h"

#include "tools/tool_answer.h"

#include <algorithm>
#include <arpa/inet.h>
#include <cerrno>
#include <cstring>
#include <netinet/in.h>
#include <sys/socket.h>

namespace
{

/* A socket that listens at the address; none, and errno, on failure. */
unique_fd listen_at(const sockaddr *address, socklen_t len)
{
    unique_fd sock{socket(address->sa_family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)};
    if (!sock)
        return sock;
    const int on = 1;
    const int off = 0;
    setsockopt(sock.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    tool_set_keepalive(sock.get()); /* what it accepts inherits it */
    if (address->sa_family == AF_INET6)
        setsockopt(sock.get(), IPPROTO_IPV6, IPV6_V6ONLY, &off, sizeof off);
    if (bind(sock.get(), address, len) != 0 || listen(sock.get(), 8) != 0)
        return {};
    return sock;
}

} // namespace

tool_link tool_called_link(unique_fd fd, const tool_limits &limits)
{
    std::string where = tool_address(fd.get(), getpeername);
    return {.fd = std::move(fd), .where = std::move(where), .limits = limits, .held = {}};
}

bool tool_listen(tool_listener &listener, std::string &why)
{
    const auto port = htons(static_cast<std::uint16_t>(std::stoi(listener.port)));
    sockaddr_in6 any{};
    any.sin6_family = AF_INET6;
    any.sin6_port = port;
    listener.fd = listen_at(reinterpret_cast<const sockaddr *>(&any), sizeof any);
    if (!listener.fd && errno == EAFNOSUPPORT) { /* a machine without IPv6 */
        sockaddr_in any4{};
        any4.sin_family = AF_INET;
        any4.sin_port = port;
        listener.fd = listen_at(reinterpret_cast<const sockaddr *>(&any4), sizeof any4);
    }
    if (!listener.fd)
        why = "cannot listen on port " + listener.port + ": " + std::strerror(errno);
    return static_cast<bool>(listener.fd);
}

std::optional<tool_call> tool_take_call(const tool_listener &listener, const tool_limits &limits,
                                        tool_clock::time_point end, std::string &why)
{
    const auto left = [end](std::chrono::milliseconds limit) {
        const auto all = std::chrono::ceil<std::chrono::milliseconds>(end - tool_clock::now());
        return std::clamp(all, std::chrono::milliseconds(0), limit);
    };
    unique_fd fd{accept4(listener.fd.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK)};
    if (!fd) {
        why = std::string("cannot accept a call: ") + std::strerror(errno);
        return std::nullopt;
    }
    tool_call call{.link = tool_called_link(std::move(fd), limits), .announcement = nullptr, .msgid = {}};
    if (listener.context && !(call.link.session = tool_tls_accept(listener.context.get(), call.link.fd.get(),
                                                                  tool_clock::now() + left(limits.connect), why))) {
        why = call.link.where + " called, but " + why;
        return std::nullopt;
    }
    const std::optional<tool_frame> frame = tool_receive(call.link, left(limits.stall), why);
    if (!frame) {
        why = call.link.where + " called, but did not say who it is: " + why;
        return std::nullopt;
    }
    call.announcement.reset(cJSON_ParseWithLength(frame->control.data(), frame->control.size()));
    call.msgid = tool_msgid(frame->control);
    return call;
}

std::string tool_announced(const tool_call &call, const char *group, const char *name)
{
    const cJSON *const object = cJSON_GetObjectItem(call.announcement.get(), group);
    const char *const value = cJSON_GetStringValue(cJSON_GetObjectItem(object, name));
    return tool_printable(value != nullptr ? value : "");
}

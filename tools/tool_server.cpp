#include "tools/tool_server.h"

#include "tools/tool_answer.h"
#include "tools/tool_device.h"
#include "tools/tool_wait.h"

#include <cstdio>
#include <cstring>
#include <sys/un.h>

namespace
{

constexpr auto kForEver = std::chrono::hours(24 * 365);
constexpr int kSentMost = 3; /* times that a server sends us to another */

/* Connects to a unix socket. */
std::optional<tool_link> connect_local(const std::string &path, const tool_limits &limits, std::string &why)
{
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    unique_fd sock{socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)};
    if (path.size() >= sizeof address.sun_path)
        errno = ENAMETOOLONG;
    else if (std::memcpy(address.sun_path, path.data(), path.size());
             sock && connect(sock.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0)
        return tool_link{
            .fd = std::move(sock), .where = "the log server", .server = true, .limits = limits, .held = {}};
    why = "cannot connect to the log server at " + path + ": " + std::strerror(errno) +
          ". Does vex_log_server run here? Another one is named with --server";
    return std::nullopt;
}

/* Connects over TLS. */
std::optional<tool_link> connect_remote(const tool_server &server, const tool_limits &limits, std::string &why)
{
    const std::size_t colon = server.address.rfind(':');
    std::string host = server.address.substr(0, colon);
    if (host.starts_with('[') && host.ends_with(']'))
        host = host.substr(1, host.size() - 2);
    if (colon == server.address.npos || server.cert.empty() || server.key.empty() || server.ca.empty()) {
        why = "a server elsewhere is --server ADDRESS:PORT and needs --cert, --key and --ca";
        return std::nullopt;
    }
    const tls_context context = tool_tls_client(server.cert, server.key, server.ca, why);
    std::optional<tool_link> link;
    if (!context ||
        !(link = tool_connect(host, server.address.substr(colon + 1), limits, ". Is it the log server?", why)))
        return std::nullopt;
    link->server = true;
    link->session = tool_tls_connect(context.get(), link->fd.get(), host, tool_clock::now() + limits.connect, why);
    if (link->session)
        return link;
    why = "no TLS with " + link->where + ": " + why;
    return std::nullopt;
}

std::string text_of(const cJSON *root, const char *name)
{
    const char *const text = cJSON_GetStringValue(cJSON_GetObjectItem(root, name));
    return text != nullptr ? text : "";
}

/* The lines of a frame's data, as what they tell. */
std::vector<tool_entry> entries(const tool_frame &frame)
{
    std::vector<tool_entry> found;
    const std::string lines(frame.data.begin(), frame.data.end());
    for (std::size_t at = 0; at < lines.size();) {
        const std::size_t end = std::min(lines.find('\n', at), lines.size());
        const json_tree root{cJSON_ParseWithLength(lines.data() + at, end - at)};
        tool_entry entry;
        const cJSON *member = nullptr;
        cJSON_ArrayForEach(member, root.get()) if (cJSON_IsString(member)) entry[member->string] =
            tool_printable(member->valuestring);
        found.push_back(std::move(entry));
        at = end + 1;
    }
    return found;
}

void show(tool_entry &entry, bool json)
{
    if (json) {
        tool_members members;
        for (const auto &[name, value] : entry)
            members.emplace_back(name.c_str(), value);
        std::printf("%s\n", tool_json(members).c_str());
        return;
    }
    if (entry["event"] != "there")
        std::printf("%s ", entry["event"].c_str());
    std::printf("%-16s %-12s %-20s %-16s %-16s %-21s %-12s %s\n", entry["imei"].c_str(), entry["model"].c_str(),
                entry["software"].c_str(), entry["serial"].c_str(), entry["address"].c_str(), entry["since"].c_str(),
                entry["streams"].empty() ? "-" : entry["streams"].c_str(), entry["last"].c_str());
}

bool is_local(const std::string &address)
{
    return address.find('/') != std::string::npos;
}

/* Why a server has not done what it was asked. */
std::string refusal(const std::string &result)
{
    return "the log server says: " + tool_printable(result.starts_with("Fail:") ? result.substr(5) : result);
}

/* What a frame of a list of devices says is missing; empty: nothing. */
std::string missing_of(const tool_frame &frame)
{
    const json_tree root{cJSON_ParseWithLength(frame.control.data(), frame.control.size())};
    const std::string result = text_of(root.get(), "Result");
    return result.starts_with("Fail:") ? refusal(result) : "";
}

/* Asks one server; `elsewhere`: the one that it knows to have the device. */
std::optional<tool_link> ask_one(const tool_server &server, const tool_limits &limits, const tool_members &request,
                                 tool_frame &answer, std::string &elsewhere, std::string &why)
{
    std::optional<tool_link> link =
        is_local(server.address) ? connect_local(server.address, limits, why) : connect_remote(server, limits, why);
    if (!link || !tool_send(*link, tool_json(request), {}, why))
        return std::nullopt;
    for (;;) {
        const std::optional<tool_frame> frame = tool_receive(*link, limits.reply + server.wait, why);
        if (!frame)
            return std::nullopt;
        const json_tree root{cJSON_ParseWithLength(frame->control.data(), frame->control.size())};
        const std::string result = text_of(root.get(), "Result");
        if (result == "Success") {
            answer = *frame;
            return link;
        }
        if (result == "Elsewhere") {
            elsewhere = text_of(root.get(), "server");
            why = "the log server does not say where the device is";
            return std::nullopt;
        }
        if (result != "Waiting") {
            why = refusal(result);
            return std::nullopt;
        }
        std::fprintf(stderr, "Waiting: %s.\n", tool_printable(text_of(root.get(), "reason")).c_str());
    }
}

} // namespace

std::optional<tool_link> tool_ask_server(const tool_server &server, const tool_limits &limits,
                                         const tool_members &request, tool_frame &answer, std::string &why)
{
    tool_server asked = server;
    for (int sent = 0; sent <= kSentMost; ++sent) {
        std::string elsewhere;
        std::optional<tool_link> link = ask_one(asked, limits, request, answer, elsewhere, why);
        if (link || elsewhere.empty())
            return link;
        if (is_local(elsewhere) && !is_local(asked.address))
            break;
        asked.address = elsewhere;
    }
    why = "the log server sends us from place to place, last to " + tool_printable(asked.address);
    return std::nullopt;
}

std::optional<std::vector<tool_entry>> tool_list_devices(const tool_server &server, const tool_limits &limits,
                                                         std::string &why)
{
    std::vector<tool_entry> all;
    tool_frame frame;
    std::optional<tool_link> link = tool_ask_server(server, limits, {{"msgid", "devices"}}, frame, why);
    while (link) {
        if (frame.data.empty()) {
            why = missing_of(frame);
            return why.empty() ? std::optional(std::move(all)) : std::nullopt;
        }
        for (tool_entry &entry : entries(frame))
            all.push_back(std::move(entry));
        const std::optional<tool_frame> next = tool_receive(*link, limits.stall, why);
        if (!next)
            break;
        frame = *next;
    }
    return std::nullopt;
}

int tool_devices(const tool_server &server, const tool_limits &limits, bool json, bool watch)
{
    std::string why;
    tool_frame frame;
    std::optional<tool_link> link =
        tool_ask_server(server, limits, {{"msgid", "devices"}, {"watch", watch ? "1" : "0"}}, frame, why);
    if (!link)
        return tool_fail(kNoAnswer, why);
    if (!json)
        std::printf("%-16s %-12s %-20s %-16s %-16s %-21s %-12s %s\n", "IMEI", "MODEL", "SOFTWARE", "SERIAL NUMBER",
                    "ADDRESS", "SINCE", "STREAMS", "LAST COMMAND");
    if (watch)
        tool_catch_interrupts();
    for (;;) {
        for (tool_entry &entry : entries(frame))
            show(entry, json);
        std::fflush(stdout);
        const std::string missing = missing_of(frame);
        if (frame.data.empty() && !watch)
            return missing.empty() ? kDone : tool_fail(kNoAnswer, missing);
        if (!missing.empty())
            std::fprintf(stderr, "%s\n", missing.c_str());
        const std::optional<tool_frame> next = tool_receive(*link, watch ? kForEver : limits.stall, why);
        if (!next)
            return tool_interrupted() ? kDone : tool_fail(kNoAnswer, why);
        frame = *next;
    }
}

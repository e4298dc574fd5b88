#include "tools/tool_stream_source.h"

#include <cerrno>
#include <cstring>
#include <netinet/in.h>
#include <sys/socket.h>

namespace
{

constexpr std::uint16_t kSyslogPort = 1514;
constexpr std::size_t kPieceMax = 65536;

/* An end of the connection to the device, with another port. */
sockaddr_storage end_of(const tool_link &link, decltype(getsockname) *which, std::uint16_t port)
{
    sockaddr_storage address{};
    socklen_t len = sizeof address;
    which(link.fd.get(), reinterpret_cast<sockaddr *>(&address), &len);
    /* The port is at the same place for both families. */
    reinterpret_cast<sockaddr_in *>(&address)->sin_port = htons(port);
    return address;
}

/* The socket that the device's system log will arrive at: on the address that the device knows this side by. */
unique_fd open_datagrams(const tool_link &link, std::string &why)
{
    const sockaddr_storage own = end_of(link, getsockname, kSyslogPort);
    unique_fd sock{socket(own.ss_family, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)};
    if (sock && bind(sock.get(), reinterpret_cast<const sockaddr *>(&own), sizeof own) == 0)
        return sock;
    why = "cannot receive on UDP port " + std::to_string(kSyslogPort) + ": " + std::strerror(errno) +
          ". Is another program listening there?";
    return {};
}

/* The connection that the modem's log comes by, to where the device's answer says. */
std::optional<tool_link> connect_to_modem_log(const tool_device &device, const tool_answer &answer, std::string &why)
{
    const std::string ip = tool_answer_text(answer, "realtimeLog", "ip");
    const std::string port = tool_answer_text(answer, "realtimeLog", "port");
    std::optional<tool_link> link = tool_connect(
        ip, port, device.limits, ". The device streams on its LAN address only: is this PC on its LAN?", why);
    if (!link)
        why = "the device says that it streams from " + ip + " port " + port + ", but " + why;
    return link;
}

/* Has the log server pass the log on. */
tool_stream_start begin_at_server(tool_device &device, const std::string &log, FILE *replies,
                                  tool_stream_source &source)
{
    tool_stream_start state;
    tool_frame answer;
    source.link = tool_ask_server(device.server, device.limits,
                                  {{"msgid", "stream"},
                                   {"imei", device.imei},
                                   {"LogType", log},
                                   {"wait", std::to_string(device.server.wait.count())}},
                                  answer, state.why);
    state.asked = state.answered = source.link.has_value();
    if (source.link && device.json)
        std::fprintf(replies, "%.*s\n", static_cast<int>(answer.data.size()),
                     reinterpret_cast<const char *>(answer.data.data()));
    return state;
}

/* Whether a datagram comes from the device that was asked. */
bool from_device(const tool_link &link, const sockaddr_storage &source)
{
    const sockaddr_storage device = end_of(link, getpeername, 0);
    if (source.ss_family == AF_INET6)
        return std::memcmp(&reinterpret_cast<const sockaddr_in6 &>(source).sin6_addr,
                           &reinterpret_cast<const sockaddr_in6 &>(device).sin6_addr, sizeof(in6_addr)) == 0;
    return reinterpret_cast<const sockaddr_in &>(source).sin_addr.s_addr ==
           reinterpret_cast<const sockaddr_in &>(device).sin_addr.s_addr;
}

/* Takes a datagram as a line. */
ssize_t take_line(int fd, const tool_link &control, std::string &bytes)
{
    char piece[kPieceMax];
    sockaddr_storage source{};
    socklen_t len = sizeof source;
    const ssize_t n = recvfrom(fd, piece, sizeof piece, 0, reinterpret_cast<sockaddr *>(&source), &len);
    if (n < 0 || !from_device(control, source))
        return 0;
    bytes.assign(piece, static_cast<std::size_t>(n));
    bytes.erase(bytes.find_last_not_of('\n') + 1);
    bytes += '\n';
    return static_cast<ssize_t>(bytes.size());
}

/* Takes what the log server passes on. */
ssize_t take_passed_on(tool_link &link, std::string &bytes, short &wanted, std::string &why)
{
    bytes.clear();
    while (const std::optional<tool_frame> frame = tool_receive_now(link, wanted, why)) {
        const json_tree root{cJSON_ParseWithLength(frame->control.data(), frame->control.size())};
        const char *const missed = cJSON_GetStringValue(cJSON_GetObjectItem(root.get(), "missed"));
        const char *const result = cJSON_GetStringValue(cJSON_GetObjectItem(root.get(), "Result"));
        if (missed != nullptr)
            std::fprintf(stderr, "%s bytes were left out here: they were not taken in time\n",
                         tool_printable(missed).c_str());
        if (result != nullptr) {
            why = std::string_view(result) == "Success" ? "" : tool_printable(std::string(result).substr(5));
            return -1;
        }
        bytes.assign(frame->data.begin(), frame->data.end());
        if (!bytes.empty())
            return static_cast<ssize_t>(bytes.size());
    }
    return why.empty() ? 0 : -1;
}

} // namespace

tool_stream_start tool_stream_begin(tool_device &device, const std::string &log, FILE *replies,
                                    tool_stream_source &source)
{
    if (tool_has_server(device))
        return begin_at_server(device, log, replies, source);
    tool_stream_start state;
    const bool datagrams = log == "syslog";
    if (datagrams && !(source.datagrams = open_datagrams(*device.link, state.why)))
        return state;
    state.asked = true;
    const std::optional<tool_answer> answer = tool_exchange(
        device, tool_command("6", "realtimeLog", {{"LogType", log}, {"Action", "start"}}), {}, state.why);
    state.answered = answer.has_value();
    if (!answer)
        return state;
    if (device.json && answer->root)
        std::fprintf(replies, "%s\n", answer->control.c_str());
    if (answer->verdict != tool_verdict::success) {
        state.asked = false;
        state.status = kDeviceSaidNo;
        state.why = tool_said(device, *answer);
    } else if (!datagrams) {
        source.link = connect_to_modem_log(device, *answer, state.why);
    }
    return state;
}

std::string tool_stream_end_command(const std::string &log)
{
    return tool_command("6", "realtimeLog", {{"LogType", log}, {"Action", "end"}, {"ip", ""}, {"port", "0"}});
}

std::string tool_stream_end(tool_device &device, tool_stream_source &source, const std::string &log, bool answer_due)
{
    constexpr char kMayStream[] = "the device may still be streaming: ";
    std::string why;
    if (tool_has_server(device)) {
        tool_send(*source.link, R"({"msgid":"stream","Action":"end"})", {}, why);
        return why;
    }
    if (answer_due && !tool_receive(*device.link, device.limits.reply, why))
        return kMayStream + why;
    const std::optional<tool_answer> answer = tool_exchange(device, tool_stream_end_command(log), {}, why);
    if (answer && answer->verdict != tool_verdict::success)
        why = tool_said(device, *answer);
    return why.empty() ? "" : kMayStream + why;
}

ssize_t tool_stream_take(tool_stream_source &source, const tool_link *control, std::string &bytes, short &wanted,
                         std::string &why)
{
    wanted = POLLIN;
    if (source.datagrams)
        return take_line(source.datagrams.get(), *control, bytes);
    if (source.link->server)
        return take_passed_on(*source.link, bytes, wanted, why);
    bytes.resize(kPieceMax);
    const ssize_t n =
        tool_read_some(*source.link, {reinterpret_cast<unsigned char *>(bytes.data()), bytes.size()}, wanted);
    bytes.resize(static_cast<std::size_t>(std::max<ssize_t>(n, 0)));
    if (n < 0 && (errno == EAGAIN || errno == EINTR))
        return 0;
    if (n > 0)
        return n;
    why = n == 0 ? "the device has ended the stream" : std::string("the stream broke: ") + std::strerror(errno);
    return -1;
}

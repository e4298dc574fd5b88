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

/* Confirms a data link to the device, which has the stream's log program started. */
bool confirm(tool_call &call, const char *connect_type, std::string &why)
{
    const std::string imei = tool_announced(call, "DataLink", "imei");
    return tool_send(call.link, tool_command("10", "DataLink", {{"imei", imei}, {"ConnectType", connect_type}}), {},
                     why);
}

/* Whether a call is the stream's data link, and can still be; else it is told of. */
bool is_for(const std::optional<tool_call> &call, const tool_device &device, const char *connect_type,
            const std::string &wrong)
{
    if (!call)
        std::fprintf(stderr, "%s\n", wrong.c_str());
    else if (tool_announced(*call, "DataLink", "ConnectType") != connect_type ||
             tool_announced(*call, "DataLink", "imei") != device.imei)
        std::fprintf(stderr, "%s called, but not for this stream\n", call->link.where.c_str());
    else
        return true;
    return false;
}

/* Why no data link has come. */
std::string not_called(const tool_device &device, tool_wait event)
{
    if (event == tool_wait::interrupted)
        return "interrupted";
    if (event == tool_wait::ready)
        return "the device has hung up";
    return "the device said that it streams, but did not call for it within " + tool_seconds(device.limits.reply) +
           ". Can it reach " + tool_address(device.link->fd.get(), getsockname) + " port " + device.called_at->port +
           "?";
}

/* Waits for the data link that the device makes for the stream, and confirms it. */
std::optional<tool_link> await_data_link(tool_device &device, const std::string &log, std::string &why)
{
    const char *const connect_type = log == "syslog" ? "syslog_connect" : "modemlog_connect";
    const auto end = tool_clock::now() + device.limits.reply;
    for (;;) {
        pollfd sockets[] = {{device.called_at->fd.get(), POLLIN, 0}, {device.link->fd.get(), POLLIN, 0}};
        const tool_wait event = tool_wait_for(sockets, end);
        if (event != tool_wait::ready || (sockets[1].revents != 0 && !tool_still_there(*device.link))) {
            why = not_called(device, event);
            return std::nullopt;
        }
        if (sockets[0].revents == 0)
            continue;
        std::string wrong;
        std::optional<tool_call> call = tool_take_call(*device.called_at, device.limits, end, wrong);
        if (!is_for(call, device, connect_type, wrong))
            continue;
        if (confirm(*call, connect_type, wrong))
            return std::move(call->link);
        std::fprintf(stderr, "%s\n", wrong.c_str()); /* of an earlier stream, perhaps: another link may come */
    }
}

/* Hangs up on those that wait: data links of streams that were broken off, which would be taken for the next one's. */
void clear_calls(const tool_listener &listener)
{
    while (unique_fd{accept4(listener.fd.get(), nullptr, nullptr, SOCK_CLOEXEC)})
        continue;
}

std::string start_command(const tool_device &device, const std::string &log)
{
    if (device.called_at == nullptr)
        return tool_command("6", "realtimeLog", {{"LogType", log}, {"Action", "start"}});
    return tool_command("6", "realtimeLog",
                        {{"LogType", log},
                         {"Action", "start"},
                         {"ip", tool_address(device.link->fd.get(), getsockname)},
                         {"port", device.called_at->port}});
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

} // namespace

tool_stream_start tool_stream_begin(tool_device &device, const std::string &log, FILE *replies,
                                    tool_stream_source &source)
{
    tool_stream_start state;
    const bool datagrams = log == "syslog" && device.called_at == nullptr;
    if (datagrams && !(source.datagrams = open_datagrams(*device.link, state.why)))
        return state;
    if (device.called_at != nullptr)
        clear_calls(*device.called_at);
    state.asked = true;
    const std::optional<tool_answer> answer = tool_exchange(device, start_command(device, log), {}, state.why);
    state.answered = answer.has_value();
    if (!answer)
        return state;
    if (device.json && answer->root)
        std::fprintf(replies, "%s\n", answer->control.c_str());
    if (answer->verdict != tool_verdict::success) {
        state.asked = false;
        state.status = kDeviceSaidNo;
        state.why = tool_said(device, *answer);
    } else if (device.called_at != nullptr) {
        source.link = await_data_link(device, log, state.why);
    } else if (!datagrams) {
        source.link = connect_to_modem_log(device, *answer, state.why);
    }
    return state;
}

std::string tool_stream_end_command(const std::string &log)
{
    return tool_command("6", "realtimeLog", {{"LogType", log}, {"Action", "end"}, {"ip", ""}, {"port", "0"}});
}

std::string tool_stream_end(tool_device &device, const std::string &log, bool answer_due)
{
    constexpr char kMayStream[] = "the device may still be streaming: ";
    std::string why;
    if (answer_due && !tool_receive(*device.link, device.limits.reply, why))
        return kMayStream + why;
    const std::optional<tool_answer> answer = tool_exchange(device, tool_stream_end_command(log), {}, why);
    if (answer && answer->verdict != tool_verdict::success)
        why = tool_said(device, *answer);
    return why.empty() ? "" : kMayStream + why;
}

ssize_t tool_stream_take(tool_stream_source &source, const tool_link &control, std::string &bytes, short &wanted,
                         std::string &why)
{
    wanted = POLLIN;
    if (source.datagrams)
        return take_line(source.datagrams.get(), control, bytes);
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

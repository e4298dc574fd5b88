#include "tools/tool_stream.h"

#include "tools/tool_process.h"
#include "tools/tool_progress.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <netinet/in.h>
#include <string_view>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr std::uint16_t kSyslogPort = 1514;
constexpr auto kFirstBytes = std::chrono::seconds(10); /* then the user is told that nothing has come yet */
constexpr auto kForEver = std::chrono::hours(24 * 365);

/* Where a stream's bytes come from and go to. */
struct stream_ends {
    unique_fd in;
    unique_fd out_file;
    bool datagrams = false; /* each is a line without its end */
    int out() const { return out_file ? out_file.get() : STDOUT_FILENO; }
};

/* What was asked of the device, and what is still to come of it. */
struct stream_start {
    bool asked = false; /* then it is to be asked to stop, whatever happens */
    bool answered = false;
    int status = kNoAnswer;
    std::string why; /* when there is no stream */
};

std::string stream_command(const std::string &log, const char *action)
{
    return tool_command("6", "realtimeLog", {{"LogType", log}, {"Action", action}});
}

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
unique_fd open_syslog(const tool_link &link, std::string &why)
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
unique_fd open_modem_log(const tool_device &device, const tool_answer &answer, std::string &why)
{
    const std::string ip = tool_answer_text(answer, "realtimeLog", "ip");
    const std::string port = tool_answer_text(answer, "realtimeLog", "port");
    std::optional<tool_link> link = tool_connect(
        ip, port, device.limits, ". The device streams on its LAN address only: is this PC on its LAN?", why);
    if (link)
        return std::move(link->fd);
    why = "the device says that it streams from " + ip + " port " + port + ", but " + why;
    return {};
}

/* Has the device start, and opens the way that its answer names. */
stream_start start(tool_device &device, const std::string &log, stream_ends &ends)
{
    stream_start state;
    ends.datagrams = log == "syslog";
    if (ends.datagrams && !(ends.in = open_syslog(*device.link, state.why)))
        return state;
    state.asked = true;
    const std::optional<tool_answer> answer = tool_exchange(device, stream_command(log, "start"), {}, state.why);
    state.answered = answer.has_value();
    if (!answer)
        return state;
    if (device.json && answer->root) /* standard output may be where the log goes */
        std::fprintf(ends.out_file ? stdout : stderr, "%s\n", answer->control.c_str());
    if (answer->verdict != tool_verdict::success) {
        state.asked = false;
        state.status = kDeviceSaidNo;
        state.why = tool_said(device, *answer);
    } else if (!ends.datagrams) {
        ends.in = open_modem_log(device, *answer, state.why);
    }
    return state;
}

/* Writes bytes as fast as they are taken; false, and why, when they are not, or the user wants to end. */
bool write_patiently(int fd, std::string_view bytes, std::string &why)
{
    while (!bytes.empty()) {
        pollfd entry{fd, POLLOUT, 0};
        if (tool_wait_for({&entry, 1}, tool_clock::now() + kForEver) == tool_wait::interrupted)
            return false;
        const std::string_view piece = bytes.substr(0, PIPE_BUF); /* what a pipe that is ready takes at once */
        if (!tool_write_whole(fd, piece.data(), piece.size())) {
            why = std::string("cannot write the log: ") + std::strerror(errno);
            return false;
        }
        bytes.remove_prefix(piece.size());
    }
    return true;
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

/* A line of the system log as it is to be written; on a terminal, without what could command it. */
std::string line_of(std::string_view datagram, int out)
{
    std::string line(datagram.substr(0, datagram.find_last_not_of('\n') + 1));
    if (isatty(out) == 1)
        line = tool_printable(line);
    return line + '\n';
}

/* Passes on what there is. Bytes received; 0 when there was nothing, -1 at the end of the stream, and why unless it was
 * the user's. */
ssize_t pass_on(const tool_link &link, const stream_ends &ends, std::string &why)
{
    char piece[65536];
    sockaddr_storage source{};
    socklen_t len = sizeof source;
    const ssize_t n = recvfrom(ends.in.get(), piece, sizeof piece, 0, reinterpret_cast<sockaddr *>(&source), &len);
    if (n < 0 && (errno == EAGAIN || errno == EINTR || ends.datagrams))
        return 0;
    if (n <= 0 && !ends.datagrams) {
        why = n == 0 ? "the device has ended the stream" : std::string("the stream broke: ") + std::strerror(errno);
        return -1;
    }
    const std::string_view bytes(piece, static_cast<std::size_t>(n));
    if (ends.datagrams && !from_device(link, source))
        return 0;
    return write_patiently(ends.out(), ends.datagrams ? line_of(bytes, ends.out()) : bytes, why) ? n : -1;
}

/* Whether the device has closed the connection, which it does only to a tool that it no longer serves. */
bool lost(const tool_link &link)
{
    char byte = 0;
    const ssize_t n = recv(link.fd.get(), &byte, 1, MSG_DONTWAIT);
    return n == 0 || (n < 0 && errno != EAGAIN && errno != EINTR);
}

/* How a stream ended. */
struct stream_result {
    std::uint64_t bytes = 0;
    bool device_lost = false; /* another tool has it, or it is gone */
    std::string why;          /* when it was not the user who ended it */
};

/* Until the user, the time, the device or the stream's own end ends it. */
stream_result relay(const tool_link &link, const stream_ends &ends, tool_clock::time_point end)
{
    stream_result result;
    auto told = std::min<tool_clock::time_point>(end, tool_clock::now() + kFirstBytes);
    for (;;) {
        pollfd sockets[] = {{link.fd.get(), POLLIN, 0}, {ends.in.get(), POLLIN, 0}};
        const tool_wait event = tool_wait_for(sockets, result.bytes == 0 ? told : end);
        if (event == tool_wait::interrupted || tool_clock::now() >= end)
            return result;
        if (event == tool_wait::timeout) {
            std::fprintf(stderr, "nothing has come yet; still waiting\n");
            told = end;
        } else if (sockets[0].revents != 0 && lost(link)) {
            result.device_lost = true;
            result.why =
                "the connection to " + link.where +
                " ended. Another log tool may have taken it over; until one has it stop (stream LOG --stop), the "
                "device goes on streaming to this PC";
            return result;
        } else if (sockets[1].revents != 0) {
            const ssize_t n = pass_on(link, ends, result.why);
            if (n < 0)
                return result;
            result.bytes += static_cast<std::uint64_t>(n);
        }
    }
}

/* Has the device stop the stream; what is wrong with that, if anything. */
std::string stop(tool_device &device, const std::string &log, bool answer_due)
{
    std::string why;
    if (answer_due && !tool_receive(*device.link, device.limits.reply, why))
        return "the device may still be streaming: " + why;
    const std::optional<tool_answer> answer = tool_exchange(device, stream_command(log, "end"), {}, why);
    if (answer && answer->verdict != tool_verdict::success)
        why = tool_said(device, *answer);
    return why.empty() ? "" : "the device may still be streaming: " + why;
}

/* The file that the log goes to; none where that is standard output. False, and why, when it cannot go there. */
bool open_output(const tool_stream_options &options, unique_fd &file, std::string &why)
{
    if (options.output.empty()) {
        if (options.log == "syslog" || isatty(STDOUT_FILENO) == 0)
            return true;
        why = "the modem's log is binary and not for a terminal: store it with --output";
        return false;
    }
    file.reset(open(options.output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666));
    if (!file)
        why = "cannot write " + options.output + ": " + std::strerror(errno);
    return static_cast<bool>(file);
}

int stop_only(tool_device &device, const std::string &log)
{
    int status = kDone;
    if (tool_ask(device, stream_command(log, "end"), status))
        std::printf("The device was told to stop the stream.\n");
    return status;
}

} // namespace

int tool_stream(tool_device &device, const tool_stream_options &options)
{
    if (device.called_at != nullptr)
        return tool_fail(kNoAnswer, "a device that has called streams over links of its own, which are not taken yet");
    if (options.stop)
        return stop_only(device, options.log);
    stream_ends ends;
    std::string why;
    if (!open_output(options, ends.out_file, why) || !tool_reach(device, why))
        return tool_fail(kNoAnswer, why);
    tool_catch_interrupts();
    const stream_start started = start(device, options.log, ends);
    stream_result result;
    result.why = started.why;
    if (started.answered && ends.in && started.why.empty()) {
        std::fflush(stdout);
        std::fprintf(stderr, "The device says that it streams; Ctrl-C ends it.\n");
        const auto length = options.length.count() > 0 ? options.length : std::chrono::milliseconds(kForEver);
        result = relay(*device.link, ends, tool_clock::now() + length);
    }
    tool_forget_interrupts();
    if (started.asked && !result.device_lost && device.link) {
        const std::string wrong = stop(device, options.log, !started.answered);
        result.why += (result.why.empty() || wrong.empty() ? "" : "; ") + wrong;
    }
    if (!result.why.empty())
        return tool_fail(started.status, result.why);
    std::fprintf(stderr, "%s of the log received.%s\n", tool_bytes(result.bytes).c_str(),
                 result.bytes == 0 ? " That the device streams is not proved: is there a firewall in between?" : "");
    return kDone;
}

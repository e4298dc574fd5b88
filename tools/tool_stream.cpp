#include "tools/tool_stream.h"

#include "tools/tool_progress.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <netinet/in.h>
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
    bool asked = false;     /* whether the device was asked to start: then it is to stop, whatever happens */
    int out() const { return out_file ? out_file.get() : STDOUT_FILENO; }
};

std::string stream_command(const std::string &log, const char *action)
{
    return tool_command("6", "realtimeLog", {{"LogType", log}, {"Action", action}});
}

/* The socket that the device's system log will arrive at: on the address that the device knows this side by. */
unique_fd open_syslog(const tool_link &link, std::string &why)
{
    sockaddr_storage own{};
    socklen_t len = sizeof own;
    getsockname(link.fd.get(), reinterpret_cast<sockaddr *>(&own), &len);
    if (own.ss_family == AF_INET6)
        reinterpret_cast<sockaddr_in6 *>(&own)->sin6_port = htons(kSyslogPort);
    else
        reinterpret_cast<sockaddr_in *>(&own)->sin_port = htons(kSyslogPort);
    unique_fd sock{socket(own.ss_family, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)};
    if (sock && bind(sock.get(), reinterpret_cast<const sockaddr *>(&own), len) == 0)
        return sock;
    why = "cannot receive on UDP port " + std::to_string(kSyslogPort) + ": " + std::strerror(errno) +
          ". Is another program listening there?";
    return {};
}

/* Has the device start, and opens the way that its answer names. */
bool start(tool_device &device, const std::string &log, stream_ends &ends, int &status, std::string &why)
{
    status = kNoAnswer;
    ends.datagrams = log == "syslog";
    if (!tool_reach(device, why))
        return false;
    if (ends.datagrams && !(ends.in = open_syslog(*device.link, why)))
        return false;
    ends.asked = true;
    const std::optional<tool_answer> answer = tool_exchange(device, stream_command(log, "start"), {}, why);
    if (!answer)
        return false;
    if (device.json)
        std::printf("%s\n", answer->control.c_str());
    if (answer->verdict != tool_verdict::success) {
        ends.asked = false;
        status = kDeviceSaidNo;
        why = answer->reason;
        return false;
    }
    if (!ends.datagrams) {
        std::optional<tool_link> link =
            tool_connect(tool_answer_text(*answer, "realtimeLog", "ip"),
                         tool_answer_text(*answer, "realtimeLog", "port"), device.limits, why);
        if (!link) {
            why = "the device says that it streams, but " + why;
            return false;
        }
        ends.in = std::move(link->fd);
    }
    return true;
}

bool write_whole(int fd, const char *bytes, std::size_t len)
{
    while (len > 0) {
        const ssize_t n = write(fd, bytes, len);
        if (n < 0 && errno != EINTR)
            return false;
        bytes += std::max<ssize_t>(n, 0);
        len -= static_cast<std::size_t>(std::max<ssize_t>(n, 0));
    }
    return true;
}

/* Passes on what there is. Bytes passed on; 0 when there was nothing, -1 and why at the end of the stream. */
ssize_t pass_on(const stream_ends &ends, std::string &why)
{
    char piece[65536];
    ssize_t n = recv(ends.in.get(), piece, sizeof piece - 1, 0);
    if (n < 0 && (errno == EAGAIN || errno == EINTR))
        return 0;
    if (n <= 0 && !ends.datagrams) {
        why = n == 0 ? "the device has ended the stream" : std::string("the stream broke: ") + std::strerror(errno);
        return -1;
    }
    n = std::max<ssize_t>(n, 0);
    if (ends.datagrams && n > 0 && piece[n - 1] != '\n')
        piece[n++] = '\n';
    if (write_whole(ends.out(), piece, static_cast<std::size_t>(n)))
        return n;
    why = std::string("cannot write the log: ") + std::strerror(errno);
    return -1;
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
        pollfd sockets[] = {{ends.in.get(), POLLIN, 0}, {link.fd.get(), POLLIN | POLLRDHUP, 0}};
        const tool_wait event = tool_wait_for(sockets, result.bytes == 0 ? told : end);
        if (event == tool_wait::interrupted || tool_clock::now() >= end)
            return result;
        if (event == tool_wait::timeout) {
            std::fprintf(stderr, "nothing has come yet; still waiting\n");
            told = end;
        } else if (sockets[0].revents != 0) {
            const ssize_t n = pass_on(ends, result.why);
            if (n < 0)
                return result;
            result.bytes += static_cast<std::uint64_t>(n);
        } else {
            result.device_lost = true;
            result.why = "the connection to " + link.where + " ended. Another log tool may have taken it over";
            return result;
        }
    }
}

/* Has the device stop the stream; what is wrong with that, if anything. */
std::string stop(tool_device &device, const std::string &log)
{
    std::string why;
    const std::optional<tool_answer> answer = tool_exchange(device, stream_command(log, "end"), {}, why);
    if (answer && answer->verdict != tool_verdict::success)
        why = answer->reason;
    return why.empty() ? "" : "the device may still be streaming: " + why;
}

} // namespace

int tool_stream(tool_device &device, const tool_stream_options &options)
{
    stream_ends ends;
    if (!options.output.empty()) {
        ends.out_file.reset(open(options.output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666));
        if (!ends.out_file)
            return tool_fail(kNoAnswer, "cannot write " + options.output + ": " + std::strerror(errno));
    }
    tool_catch_interrupts();
    int status = kDone;
    stream_result result;
    if (start(device, options.log, ends, status, result.why)) {
        std::fflush(stdout);
        std::fprintf(stderr, "The device says that it streams; Ctrl-C ends it.\n");
        const auto end =
            tool_clock::now() + (options.length.count() > 0 ? options.length : std::chrono::milliseconds(kForEver));
        result = relay(*device.link, ends, end);
    } else if (!ends.asked) {
        return tool_fail(status, result.why);
    }
    tool_release_interrupts();
    if (!result.device_lost) {
        const std::string wrong = stop(device, options.log);
        result.why += (result.why.empty() || wrong.empty() ? "" : "; ") + wrong;
    }
    if (!result.why.empty())
        return tool_fail(kNoAnswer, result.why);
    std::fprintf(stderr, "%s of the log received.%s\n", tool_bytes(result.bytes).c_str(),
                 result.bytes == 0 ? " That the device streams is not proved: is there a firewall in between?" : "");
    return kDone;
}

#include "tools/tool_stream.h"

#include "tools/tool_process.h"
#include "tools/tool_progress.h"
#include "tools/tool_stream_source.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <string_view>
#include <unistd.h>

namespace
{

constexpr auto kFirstBytes = std::chrono::seconds(10); /* then the user is told that nothing has come yet */
constexpr auto kForEver = std::chrono::hours(24 * 365);

/* Where a stream's bytes go to. */
struct stream_output {
    unique_fd file; /* none: standard output */
    bool text = false;

    int fd() const { return file ? file.get() : STDOUT_FILENO; }
    /* On a terminal, the system log without what could command it. */
    std::string shown(const std::string &bytes) const
    {
        return text && isatty(fd()) == 1 ? tool_printable_lines(bytes) : bytes;
    }
};

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

/* How a stream ended. */
struct stream_result {
    std::uint64_t bytes = 0;
    bool over = false;        /* at its own end, or told to end */
    bool device_lost = false; /* another tool has it, or it is gone */
    std::string why;          /* when it was not the user who ended it */
};

/* Why the device is lost. */
std::string lost(const tool_link &link)
{
    return "the connection to " + link.where +
           " ended. Another log tool may have taken it over; until one has it stop (stream LOG --stop), the device goes on "
           "streaming to this PC";
}

/* Passes on what comes until the user, the time, the device or the stream's own end ends it. Without a control link, the
 * stream is the log server's. */
void relay(tool_link *control, tool_stream_source &source, const stream_output &out, tool_clock::time_point end,
           stream_result &result)
{
    auto told = result.over ? end : std::min<tool_clock::time_point>(end, tool_clock::now() + kFirstBytes);
    for (;;) {
        std::string bytes;
        short wanted = 0;
        const ssize_t n = tool_stream_take(source, control, bytes, wanted, result.why);
        result.over = n < 0;
        if (n < 0 || !write_patiently(out.fd(), out.shown(bytes), result.why))
            return;
        result.bytes += static_cast<std::uint64_t>(n);
        pollfd sockets[] = {{control != nullptr ? control->fd.get() : -1, POLLIN, 0}, {source.fd(), wanted, 0}};
        const auto until = n > 0 ? tool_clock::now() : result.bytes == 0 ? told : end;
        const tool_wait event = tool_wait_for(sockets, until);
        if (event == tool_wait::interrupted || tool_clock::now() >= end)
            return;
        if (event == tool_wait::timeout && n == 0) {
            std::fprintf(stderr, "nothing has come yet; still waiting\n");
            told = end;
        } else if (sockets[0].revents != 0 && !tool_still_there(*control)) {
            result.device_lost = true;
            result.why = lost(*control);
            return;
        }
    }
}

/* Passes on what was under way when the log server was told to stop; it says when that is all. */
void drain(tool_stream_source &source, const stream_output &out, stream_result &result)
{
    stream_result rest;
    rest.over = true;
    relay(nullptr, source, out, tool_clock::now() + source.link->limits.stall, rest);
    result.bytes += rest.bytes;
    result.why = rest.why;
}

/* Opens what the log goes to; false, and why, when it cannot go there. */
bool open_output(const tool_stream_options &options, stream_output &out, std::string &why)
{
    out.text = options.log == "syslog";
    if (options.output.empty()) {
        if (out.text || isatty(STDOUT_FILENO) == 0)
            return true;
        why = "the modem's log is binary and not for a terminal: store it with --output";
        return false;
    }
    out.file.reset(open(options.output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666));
    if (!out.file)
        why = "cannot write " + options.output + ": " + std::strerror(errno);
    return static_cast<bool>(out.file);
}

int stop_only(tool_device &device, const std::string &log)
{
    int status = kDone;
    if (tool_ask(device, tool_stream_end_command(log), status))
        std::printf("The device was told to stop the stream.\n");
    return status;
}

} // namespace

int tool_stream(tool_device &device, const tool_stream_options &options)
{
    if (options.stop)
        return stop_only(device, options.log);
    stream_output out;
    stream_result result;
    if (!open_output(options, out, result.why) || (!tool_has_server(device) && !tool_reach(device, result.why)))
        return tool_fail(kNoAnswer, result.why);
    tool_catch_interrupts();
    tool_stream_source source;
    const tool_stream_start started = tool_stream_begin(device, options.log, out.file ? stdout : stderr, source);
    result.why = started.why;
    if (source.opened() && started.answered && started.why.empty()) {
        std::fflush(stdout);
        std::fprintf(stderr, "The device says that it streams; Ctrl-C ends it.\n");
        const auto length = options.length.count() > 0 ? options.length : std::chrono::milliseconds(kForEver);
        relay(device.link ? &*device.link : nullptr, source, out, tool_clock::now() + length, result);
    }
    tool_forget_interrupts();
    if (started.asked && !result.device_lost && (device.link || source.link) &&
        !(result.over && tool_has_server(device))) {
        const std::string wrong = tool_stream_end(device, source, options.log, !started.answered);
        result.why += (result.why.empty() || wrong.empty() ? "" : "; ") + wrong;
        if (tool_has_server(device) && wrong.empty())
            drain(source, out, result);
    }
    if (result.device_lost)
        device.link.reset();
    if (!result.why.empty())
        return tool_fail(started.status, result.why);
    std::fprintf(stderr, "%s of the log received.%s\n", tool_bytes(result.bytes).c_str(),
                 result.bytes == 0 ? " That the device streams is not proved: is there a firewall in between?" : "");
    return kDone;
}

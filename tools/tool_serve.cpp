#include "tools/tool_serve.h"

#include "tools/tool_listener.h"

#include <cerrno>
#include <cstdio>
#include <unistd.h>

namespace
{

constexpr auto kForEver = std::chrono::hours(24 * 365);

/* Lines of standard input, as they come. */
struct input_lines {
    std::string held;
    bool ended = false;

    /* Takes what there is. */
    void read_some()
    {
        char piece[4096];
        const ssize_t n = read(STDIN_FILENO, piece, sizeof piece);
        if (n > 0)
            held.append(piece, static_cast<std::size_t>(n));
        else if (n == 0 || errno != EINTR)
            ended = true;
    }
    /* The next line that is not blank. */
    std::optional<std::string> next()
    {
        for (;;) {
            const auto newline = held.find('\n');
            if (newline == std::string::npos && (!ended || held.empty()))
                return std::nullopt;
            std::string line = held.substr(0, newline);
            held.erase(0, newline == std::string::npos ? newline : newline + 1);
            if (line.find_first_not_of(" \t\r") != std::string::npos)
                return line;
        }
    }
};

/* Whatever comes first: a line, or something to read on the socket; false when the user wants to end. */
bool wait_for_line_or(int fd, input_lines &input, bool &readable)
{
    pollfd sources[] = {{fd, POLLIN, 0}, {input.ended ? -1 : STDIN_FILENO, POLLIN, 0}};
    if (tool_wait_for(sources, tool_clock::now() + kForEver) != tool_wait::ready)
        return false;
    readable = sources[0].revents != 0;
    if (sources[1].revents != 0)
        input.read_some();
    return true;
}

/* Waits until a device has called and said who it is; false when there is nobody left to wait for. */
bool await_device(tool_device &device, const tool_listener &listener, input_lines &input)
{
    while (!input.ended || !input.held.empty()) {
        bool called = false;
        if (!wait_for_line_or(listener.fd.get(), input, called))
            return false;
        if (!called)
            continue;
        std::string why;
        std::optional<tool_call> call = tool_take_call(listener, device.limits, tool_clock::now() + kForEver, why);
        if (call && call->msgid != "9")
            why = call->link.where + " called, but not to be served: it announced a link of another kind";
        if (!why.empty()) {
            std::fprintf(stderr, "%s\n", why.c_str());
            continue;
        }
        const auto text = [&call](const char *name) { return tool_announced(*call, "ControlLink", name); };
        std::printf("%s calls%s: model %s, software %s, IMEI %s, serial number %s\n", call->link.where.c_str(),
                    call->link.session ? " over TLS" : "", text("projectName").c_str(), text("VersionInfo").c_str(),
                    text("imei").c_str(), text("modem_msn").c_str());
        std::fflush(stdout);
        device.imei = text("imei");
        device.link = std::move(call->link);
        return true;
    }
    return false;
}

/* Runs lines for the device until there are no more of them or the user wants to end: then false; or the link to the
 * device is lost: then true. */
bool run_lines(tool_device &device, input_lines &input, const tool_run_line &run_line, int &status)
{
    for (;;) {
        std::optional<std::string> line;
        while (device.link && !tool_interrupted() && (line = input.next())) {
            status = run_line(device, *line);
            tool_catch_interrupts(); /* a stream that the user ended is no reason to end */
            std::fflush(stdout);
        }
        if (!device.link)
            return true;
        bool readable = false;
        if (input.ended || !wait_for_line_or(device.link->fd.get(), input, readable))
            return false;
        if (readable && !tool_still_there(*device.link)) {
            std::fprintf(stderr, "%s has hung up.\n", device.link->where.c_str());
            device.link.reset();
        }
    }
}

/* A device is gone. What was meant for it is not for the next one. */
void drop_lines(input_lines &input, int &status)
{
    while (const std::optional<std::string> line = input.next())
        status = tool_fail(kNoAnswer, "not carried out: " + *line);
    if (!input.ended)
        std::fprintf(stderr, "Waiting for the next call.\n");
}

} // namespace

int tool_serve(tool_device &device, const tool_serve_options &options, const tool_run_line &run_line)
{
    std::string why;
    tool_listener listener;
    listener.port = options.port;
    if (!options.plain && (options.cert.empty() || options.key.empty() || options.ca.empty()))
        return tool_fail(kNoAnswer, "a server over TLS needs --cert, --key and --ca; without TLS, --plain");
    if (!options.plain && !(listener.context = tool_tls_server(options.cert, options.key, options.ca, why)))
        return tool_fail(kNoAnswer, why);
    if (!tool_listen(listener, why))
        return tool_fail(kNoAnswer, why);
    std::fprintf(stderr, "Waiting for a device to call port %s; then one command a line.\n", options.port.c_str());
    tool_catch_interrupts();
    device.called_at = &listener;
    input_lines input;
    int status = kDone;
    while (await_device(device, listener, input) && run_lines(device, input, run_line, status))
        drop_lines(input, status);
    device.link.reset();
    device.called_at = nullptr;
    return status;
}

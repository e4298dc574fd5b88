#include "tools/tool_serve.h"

#include <arpa/inet.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{

constexpr auto kForEver = std::chrono::hours(24 * 365);
constexpr auto kAnnouncement = std::chrono::seconds(30); /* a device that calls says at once who it is */

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
    std::optional<std::string> next()
    {
        const auto newline = held.find('\n');
        if (newline == std::string::npos && (!ended || held.empty()))
            return std::nullopt;
        std::string line = held.substr(0, newline);
        held.erase(0, newline == std::string::npos ? newline : newline + 1);
        return line;
    }
};

/* A socket that listens on every address of both families. */
unique_fd listen_on(const std::string &port, std::string &why)
{
    unique_fd sock{socket(AF_INET6, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    const int on = 1;
    const int off = 0;
    setsockopt(sock.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    setsockopt(sock.get(), IPPROTO_IPV6, IPV6_V6ONLY, &off, sizeof off);
    sockaddr_in6 any{};
    any.sin6_family = AF_INET6;
    any.sin6_port = htons(static_cast<std::uint16_t>(std::stoi(port)));
    if (sock && bind(sock.get(), reinterpret_cast<const sockaddr *>(&any), sizeof any) == 0 &&
        listen(sock.get(), 8) == 0)
        return sock;
    why = "cannot listen on port " + port + ": " + std::strerror(errno);
    return {};
}

/* The text of an address, and an IPv4 one as such. */
std::string address_text(const sockaddr_in6 &address)
{
    char host[NI_MAXHOST] = {};
    getnameinfo(reinterpret_cast<const sockaddr *>(&address), sizeof address, host, sizeof host, nullptr, 0,
                NI_NUMERICHOST);
    const std::string text = host;
    return text.starts_with("::ffff:") ? text.substr(7) : text;
}

/* The next caller's connection; none when it is none that can be talked to: then why, or when the user wants to end. */
std::optional<tool_link> accept_device(const tool_device &device, int listener, SSL_CTX *context, std::string &why)
{
    pollfd entry{listener, POLLIN, 0};
    if (tool_wait_for({&entry, 1}, tool_clock::now() + kForEver) != tool_wait::ready)
        return std::nullopt;
    sockaddr_in6 peer{};
    socklen_t len = sizeof peer;
    tool_link link{
        .fd = unique_fd{accept4(listener, reinterpret_cast<sockaddr *>(&peer), &len, SOCK_CLOEXEC | SOCK_NONBLOCK)},
        .where = address_text(peer),
        .limits = device.limits,
        .held = {}};
    if (!link.fd) {
        why = std::string("cannot accept a call: ") + std::strerror(errno);
        return std::nullopt;
    }
    const int on = 1;
    setsockopt(link.fd.get(), SOL_SOCKET, SO_KEEPALIVE, &on, sizeof on);
    if (context == nullptr)
        return link;
    link.session = tool_tls_accept(context, link.fd.get(), tool_clock::now() + device.limits.connect, why);
    if (link.session)
        return link;
    why = link.where + " called, but: " + why;
    return std::nullopt;
}

/* Says who has called; false, and why, when the caller did not tell. */
bool greet(tool_device &device, std::string &why)
{
    const std::optional<tool_frame> frame = tool_receive(*device.link, kAnnouncement, why);
    if (!frame)
        return false;
    const json_tree root{cJSON_ParseWithLength(frame->control.data(), frame->control.size())};
    const cJSON *who = cJSON_GetObjectItem(root.get(), "ControlLink");
    if (tool_msgid(frame->control) != "9" || who == nullptr) {
        why = device.link->where + " called, but did not say who it is";
        return false;
    }
    const auto text = [who](const char *name) {
        const char *value = cJSON_GetStringValue(cJSON_GetObjectItem(who, name));
        return tool_printable(value != nullptr ? value : "");
    };
    std::printf("%s calls%s: model %s, software %s, IMEI %s, serial number %s\n", device.link->where.c_str(),
                device.link->session ? " over TLS" : "", text("projectName").c_str(), text("VersionInfo").c_str(),
                text("imei").c_str(), text("modem_msn").c_str());
    std::fflush(stdout);
    return true;
}

/* Runs lines for the device until there are no more of them, the device hangs up or the user wants to end: then false. */
bool run_lines(tool_device &device, input_lines &input, const tool_run_line &run_line, int &status)
{
    for (;;) {
        while (const std::optional<std::string> line = input.next()) {
            if (line->find_first_not_of(" \t\r") == std::string::npos)
                continue;
            status = run_line(device, *line);
            std::fflush(stdout);
            if (!device.link)
                return true;
        }
        if (input.ended)
            return false;
        pollfd sources[] = {{STDIN_FILENO, POLLIN, 0}, {device.link->fd.get(), POLLIN, 0}};
        if (tool_wait_for(sources, tool_clock::now() + kForEver) != tool_wait::ready)
            return false;
        if (sources[0].revents != 0) {
            input.read_some();
        } else { /* a device says nothing unasked */
            std::fprintf(stderr, "%s has hung up; waiting for the next call\n", device.link->where.c_str());
            return true;
        }
    }
}

} // namespace

int tool_serve(tool_device &device, const tool_serve_options &options, const tool_run_line &run_line)
{
    std::string why;
    tls_context context;
    if (!options.plain && (options.cert.empty() || options.key.empty() || options.ca.empty()))
        return tool_fail(kNoAnswer, "a server over TLS needs --cert, --key and --ca; without TLS, --plain");
    if (!options.plain && !(context = tool_tls_server(options.cert, options.key, options.ca, why)))
        return tool_fail(kNoAnswer, why);
    const unique_fd listener = listen_on(options.port, why);
    if (!listener)
        return tool_fail(kNoAnswer, why);
    std::fprintf(stderr, "Waiting for a device to call port %s; then one command a line.\n", options.port.c_str());
    tool_catch_interrupts();
    device.called = true;
    input_lines input;
    int status = kDone;
    for (bool on = true; on && !tool_interrupted();) {
        why.clear();
        device.link = accept_device(device, listener.get(), context.get(), why);
        if (device.link && greet(device, why))
            on = run_lines(device, input, run_line, status);
        else if (!why.empty())
            std::fprintf(stderr, "%s\n", why.c_str());
        device.link.reset();
    }
    return status;
}

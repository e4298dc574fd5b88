#include "server/server.h"

#include "server/bus.h"
#include "server/fleet.h"
#include "server/store.h"

#include <poll.h>
#include <unistd.h>

int server_log_fd = STDERR_FILENO;

namespace
{

/* Writes what is taken at once: a reader that stalls must not stop the server. */
void write_line(std::string line)
{
    static std::uint64_t lost = 0;
    pollfd entry{server_log_fd, POLLOUT, 0};
    if (poll(&entry, 1, 0) != 1 || (entry.revents & POLLOUT) == 0) {
        ++lost;
        return;
    }
    if (lost > 0)
        line = std::to_string(std::exchange(lost, 0)) + " lines were lost\n" + line;
    static_cast<void>(!write(server_log_fd, line.data(), line.size()));
}

} // namespace

server::server(asio::io_context &context, const server_options &chosen)
    : io(context), options(chosen), devices(std::make_unique<fleet>(*this))
{
}

server::~server() = default;

void server_log(const char *what, const tool_members &members)
{
    std::string line = what;
    for (const auto &[name, value] : members)
        line += std::string(" ") + name + "=\"" + tool_printable(value) + '"';
    write_line(line + '\n');
}

void server_event(server &server, const char *what, const tool_members &members)
{
    server_log(what, members);
    if (!server.store && !server.bus)
        return;
    tool_members all{{"time", utc_text("%Y-%m-%dT%H:%M:%SZ")}, {"event", what}, {"server", server.name}};
    all.insert(all.end(), members.begin(), members.end());
    const std::string event = tool_json(all);
    if (server.store)
        server.store->event(event);
    if (server.bus)
        server.bus->tell(members.front().second, event);
}

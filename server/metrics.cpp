#include "server/metrics.h"

#include "server/bus.h"
#include "server/fleet.h"
#include "server/store.h"

#include <asio/read_until.hpp>
#include <asio/write.hpp>
#include <cstdio>

namespace
{

using namespace std::chrono_literals;

constexpr auto kRequestMax = 10s;

/* A label's value, which may hold anything that a peer has said. */
std::string label(const std::string &value)
{
    std::string out;
    for (const char c : value)
        out += c == '"' || c == '\\' || c == '\n' ? '_' : c;
    return out;
}

std::string text_of(const server &server)
{
    const server_metrics &counts = server.metrics;
    std::string out;
    const auto tell = [&out](const char *name, const char *type, const char *help) {
        out += std::string("# HELP vex_") + name + ' ' + help + "\n# TYPE vex_" + name + ' ' + type + '\n';
    };
    const auto one = [&](const char *name, const char *type, const char *help, double value) {
        tell(name, type, help);
        char number[32];
        std::snprintf(number, sizeof number, "%.15g", value);
        out += std::string("vex_") + name + ' ' + number + '\n';
    };
    one("devices", "gauge", "Devices that are connected.", static_cast<double>(server.devices->all().size()));
    one("handshakes_total", "counter", "TLS handshakes with devices.", static_cast<double>(counts.handshakes));
    tell("refused_total", "counter", "Calls of devices that were refused.");
    for (const auto &[why, count] : counts.refused)
        out += "vex_refused_total{why=\"" + label(why) + "\"} " + std::to_string(count) + '\n';
    tell("commands_total", "counter", "Commands given to devices.");
    for (const auto &[msgid, count] : counts.commands)
        out += "vex_commands_total{msgid=\"" + label(msgid) + "\"} " + std::to_string(count) + '\n';
    one("command_seconds_total", "counter", "Time that they took.", counts.command_seconds);
    one("commands_failed_total", "counter", "Commands without success.", static_cast<double>(counts.commands_failed));
    one("log_bytes_total", "counter", "Bytes of live logs.", static_cast<double>(counts.log_bytes));
    one("log_lines_total", "counter", "Lines of live system logs.", static_cast<double>(counts.log_lines));
    one("log_gaps_total", "counter", "Gaps in kept logs.", static_cast<double>(counts.log_gaps));
    one("store_lost_bytes_total", "counter", "Bytes that found no room.", static_cast<double>(counts.store_bytes_lost));
    if (server.store)
        one("store_bytes", "gauge", "Bytes that are kept.", static_cast<double>(server.store->total()));
    if (server.bus) {
        one("bus_connected", "gauge", "Whether the bus is there.", server.bus->connected() ? 1 : 0);
        one("bus_records_total", "counter", "Records that the bus has taken.", static_cast<double>(counts.bus_records));
        one("bus_failures_total", "counter", "Records to send once more.", static_cast<double>(counts.bus_failures));
        one("spool_bytes", "gauge", "Bytes that the bus has not got.", static_cast<double>(server.bus->spooled()));
    }
    return out;
}

/* Whatever is asked for, it is the counts. */
task<void> answer(server &server, asio::ip::tcp::socket accepted)
{
    const auto shared = std::make_shared<asio::ip::tcp::socket>(std::move(accepted));
    asio::ip::tcp::socket &socket = *shared;
    asio::error_code error;
    std::string request;
    asio::steady_timer limit(server.io, kRequestMax);
    limit.async_wait([socket = std::weak_ptr(shared)](asio::error_code cancelled) {
        const auto late = socket.lock();
        asio::error_code ignored;
        if (late && !cancelled)
            late->cancel(ignored);
    });
    co_await asio::async_read_until(socket, asio::dynamic_buffer(request, 8192), "\r\n\r\n", await_into(error));
    const std::string body = text_of(server);
    const std::string reply =
        "HTTP/1.1 200 OK\r\nContent-Type: text/plain; version=0.0.4\r\nContent-Length: " + std::to_string(body.size()) +
        "\r\nConnection: close\r\n\r\n" + body;
    if (!error)
        co_await asio::async_write(socket, asio::buffer(reply), await_into(error));
}

} // namespace

task<void> serve_metrics(server &server, asio::ip::tcp::acceptor listener)
{
    for (asio::error_code error; error != asio::error::operation_aborted;) {
        asio::ip::tcp::socket socket = co_await listener.async_accept(await_into(error));
        if (!error)
            run_beside(server.io, answer(server, std::move(socket)));
    }
}

/*
 * Many devices in one process, as a log server sees them: each calls it, answers commands and brings its live logs. Says on
 * standard output when all are connected.
 */
#include "server/frame_link.h"
#include "server/message.h"
#include "tools/tls_context.h"

#include <CLI/CLI.hpp>
#include <asio/ip/tcp.hpp>
#include <csignal>
#include <cstdio>
#include <random>
#include <sys/resource.h>

namespace
{

using namespace std::chrono_literals;
using asio::ip::tcp;

struct fleet_options {
    std::string host = "127.0.0.1";
    std::uint16_t port = 5000;
    std::uint16_t other_port = 0; /* of another server, for when that one is away; 0: there is none */
    unsigned count = 100;
    std::uint64_t first = 100'000'000'000'000; /* IMEI of the first */
    std::string cert, key;                     /* PEM files; empty: no TLS */
    unsigned at_once = 64;                     /* that are about to connect */
    unsigned rate = 10;                        /* lines a second of a live log; 0: as fast as can be */
    unsigned restless = 0;                     /* seconds that a device stays, at most; 0: for ever */
    unsigned handshakes = 0;                   /* only shake hands, so often, and hang up */
    bool raw = false;                          /* send syslog lines and nothing else */
};

/* What all devices have in common. */
struct many_devices {
    explicit many_devices(const fleet_options &given) : options(given)
    {
        if (options.cert.empty())
            return;
        tls.reset(SSL_CTX_new(TLS_client_method()));
        if (SSL_CTX_use_certificate_chain_file(tls.get(), options.cert.c_str()) != 1 ||
            SSL_CTX_use_PrivateKey_file(tls.get(), options.key.c_str(), SSL_FILETYPE_PEM) != 1) {
            std::fprintf(stderr, "many_devices: cannot use %s\n", options.cert.c_str());
            std::exit(1);
        }
        SSL_CTX_set_mode(tls.get(), SSL_MODE_RELEASE_BUFFERS);
    }

    unsigned below(unsigned n) { return static_cast<unsigned>(chance() % n); }

    asio::io_context io{1};
    const fleet_options &options;
    tls_context tls;
    std::mt19937 chance{1};
    unsigned next = 0;
    unsigned connected = 0;
};

task<void> pause(many_devices &all, server_clock::duration time)
{
    asio::steady_timer timer(all.io, time);
    asio::error_code cancelled;
    co_await timer.async_wait(await_into(cancelled));
}

/* A connection to the server; none when there is no getting it. */
task<std::shared_ptr<frame_link>> call(many_devices &all, std::string host, std::uint16_t port)
{
    tcp::socket socket(all.io);
    asio::error_code error;
    const tcp::endpoint to(asio::ip::make_address(host, error), port);
    if (!error)
        co_await socket.async_connect(to, await_into(error));
    if (error)
        co_return nullptr;
    ssl_session session{all.tls ? SSL_new(all.tls.get()) : nullptr};
    if (session)
        SSL_set_connect_state(session.get());
    const auto link = std::make_shared<frame_link>(std::move(socket), std::move(session));
    const bool ready = co_await link->shake_hands();
    co_return ready ? link : nullptr;
}

/* One of them. */
struct one_device : std::enable_shared_from_this<one_device> {
    one_device(many_devices &others, std::string name) : all(others), imei(std::move(name)) {}

    std::string announcement(const char *msgid, const char *member, const char *connect_type) const
    {
        return make_frame(tool_command(msgid, member,
                                       {{"VersionInfo", "V1"},
                                        {"projectName", "VX-1"},
                                        {"imei", imei.c_str()},
                                        {"modem_msn", "M1"},
                                        {"ConnectType", connect_type}}));
    }
    task<void> live();
    task<void> serve();
    task<void> answer(message command);
    task<void> send_archive();
    task<void> stream(std::string host, std::uint16_t port, std::string log);

    many_devices &all;
    const std::string imei;
    std::shared_ptr<frame_link> control;
    std::shared_ptr<frame_link> data;
    std::uint64_t lines = 0; /* that it has sent, over all links */
};

/* Brings a live log until the server has enough of it. */
task<void> one_device::stream(std::string host, std::uint16_t port, std::string log)
{
    const auto alive = shared_from_this();
    const auto link = co_await call(all, host, port);
    if (!link)
        co_return;
    data = link;
    const std::string hello = announcement("10", "DataLink", log == "syslog" ? "syslog_connect" : "modemlog_connect");
    co_await link->send(hello);
    const auto confirmed = co_await link->receive();
    const std::string line = "Nov 24 12:00:00 vex-device user.notice demo: " + imei + std::string(40, '.');
    std::string many;
    for (unsigned i = 0; i < 160; ++i)
        many += line + '\n';
    while (confirmed && !link->ended()) {
        const std::string bytes = all.options.rate == 0 ? many : line + ' ' + std::to_string(++lines) + '\n';
        co_await link->send(bytes);
        if (all.options.rate != 0)
            co_await pause(all, 1s / static_cast<double>(all.options.rate) < 1ms ? 1ms : 1000ms / all.options.rate);
    }
}

task<void> one_device::send_archive()
{
    const std::string piece =
        make_frame(R"({"msgid":"2","GetLocalLog":{"totalLength":"24000"},"Result":"Success"})", std::string(8000, 'x'));
    for (int i = 0; i < 3; ++i)
        co_await control->send(piece);
}

task<void> one_device::answer(message command)
{
    const std::string msgid = command.msgid();
    std::string reply = R"({"msgid":")" + msgid + R"(","Result":"Success"})";
    if (msgid == "2") {
        co_await send_archive();
        co_return;
    }
    if (msgid == "3")
        reply = R"({"msgid":"3","getVersionInfo":{"VersionInfo":"V1","projectName":"VX-1","imei":")" + imei +
                R"("},"Result":"Success"})";
    if (msgid == "11")
        reply = R"({"msgid":"11","mode_lpm_online":"online","Result":"Success"})";
    const std::string frame = make_frame(reply);
    co_await control->send(frame);
    if (msgid != "6")
        co_return;
    if (data)
        data->end("told to");
    if (command.text("realtimeLog", "Action") == "start")
        run_beside(all.io, stream(command.text("realtimeLog", "ip"),
                                  static_cast<std::uint16_t>(std::atoi(command.text("realtimeLog", "port").c_str())),
                                  command.text("realtimeLog", "LogType")));
}

/* Serves the server until one of the two has enough. */
task<void> one_device::serve()
{
    const std::string hello = announcement("9", "ControlLink", "");
    bool more = co_await control->send(hello);
    if (all.options.restless > 0)
        control->limit(1ms * (1 + all.below(all.options.restless * 1000)));
    if (++all.connected == all.options.count) {
        std::printf("all are connected\n");
        std::fflush(stdout);
    }
    while (more) {
        const auto frame = co_await control->receive();
        more = frame.has_value();
        if (more)
            co_await answer(message(frame->control));
    }
    --all.connected;
    if (data)
        data->end("the control link has ended");
}

task<void> one_device::live()
{
    const auto alive = shared_from_this();
    for (;;) {
        control = co_await call(all, all.options.host, all.options.port);
        if (!control && all.options.other_port != 0)
            control = co_await call(all, all.options.host, all.options.other_port);
        if (control)
            co_await serve();
        control.reset();
        co_await pause(all, 1ms * (100 + all.below(900)));
    }
}

/* Shakes hands with the server until that has been done often enough. */
task<void> shake_hands(many_devices &all)
{
    while (all.next < all.options.handshakes) {
        ++all.next;
        const auto link = co_await call(all, all.options.host, all.options.port);
        if (!link)
            --all.next; /* refused: again */
    }
    if (--all.connected == 0)
        all.io.stop();
}

/* Sends lines as a device's own syslogd would, to a syslog server. */
task<void> send_lines(many_devices &all, unsigned number)
{
    const auto link = co_await call(all, all.options.host, all.options.port);
    std::string lines;
    for (int i = 0; i < 160; ++i)
        lines += "<13>Nov 24 12:00:00 vex-device d" + std::to_string(number) + ": " + std::string(55, '.') + '\n';
    for (bool more = link != nullptr; more;)
        more = co_await link->send(lines);
}

/* Lets devices come to life one after the other, each when another has connected. */
task<void> begin(many_devices &all)
{
    while (all.next < all.options.count) {
        while (all.next < all.options.count && all.next < all.connected + all.options.at_once) {
            const auto device = std::make_shared<one_device>(all, std::to_string(all.options.first + all.next++));
            run_beside(all.io, device->live());
        }
        co_await pause(all, 1ms);
    }
}

} // namespace

int main(int argc, char **argv)
{
    fleet_options options;
    CLI::App app{"Many devices that call a log server."};
    app.add_option("--host", options.host)->capture_default_str();
    app.add_option("--port", options.port)->capture_default_str();
    app.add_option("--other-port", options.other_port, "of another server, for when that one is away");
    app.add_option("--count", options.count)->capture_default_str();
    app.add_option("--first", options.first, "IMEI of the first")->capture_default_str();
    app.add_option("--cert", options.cert, "their certificate; without it, no TLS");
    app.add_option("--key", options.key);
    app.add_option("--at-once", options.at_once, "how many connect at a time")->capture_default_str();
    app.add_option("--rate", options.rate, "lines a second of a live log; 0: all it can")->capture_default_str();
    app.add_option("--restless", options.restless, "seconds that one stays, at most; 0: for ever");
    app.add_option("--handshakes", options.handshakes, "only shake hands, so often");
    app.add_flag("--raw", options.raw, "send syslog lines and nothing else");
    CLI11_PARSE(app, argc, argv);
    std::signal(SIGPIPE, SIG_IGN);
    rlimit limit{};
    getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = limit.rlim_max;
    setrlimit(RLIMIT_NOFILE, &limit);
    many_devices all(options);
    if (options.handshakes > 0)
        for (all.connected = 0; all.connected < options.at_once; ++all.connected)
            run_beside(all.io, shake_hands(all));
    else if (options.raw)
        for (unsigned i = 0; i < options.count; ++i)
            run_beside(all.io, send_lines(all, i));
    else
        run_beside(all.io, begin(all));
    all.io.run();
}

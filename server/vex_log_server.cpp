/* The log server of a fleet: its command line, its start and its end. */
#include "server/bus.h"
#include "server/fleet.h"
#include "server/server.h"
#include "server/store.h"
#include "server/tool_session.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <asio/ip/v6_only.hpp>
#include <asio/signal_set.hpp>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <sys/resource.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace
{

using namespace std::chrono_literals;
using asio::ip::tcp;

constexpr auto kEndMax = 3s;           /* for links to end with the server */
constexpr auto kCertificateLook = 24h; /* how often the end of the certificate is looked at */
constexpr int kCertificateWarn = 30;   /* days before it */

void add_device_options(CLI::App &app, server_options &options)
{
    app.add_option("--listen", options.listen, "ADDRESS:PORT that devices call")->capture_default_str();
    app.add_option("--advertise", options.advertise, "address that devices bring live logs to, if not where they call");
    app.add_flag("--plain", options.plain, "devices call without TLS");
    for (const auto &[name, file, help] : {std::tuple{"--cert", &options.cert, "our certificate, a PEM file"},
                                           {"--key", &options.key, "its key"},
                                           {"--ca", &options.ca, "certificate that the devices' are signed by"}})
        app.add_option(name, *file, help)->check(CLI::ExistingFile);
    app.add_flag("--require-imei-in-certificate", options.imei_in_certificate,
                 "a device's certificate must be for its IMEI");
    app.add_option_function<unsigned>(
           "--announce-timeout", [&options](unsigned s) { options.announce_limit = std::chrono::seconds(s); },
           "longest that a caller takes to say who it is")
        ->check(CLI::Range(1, 3600))
        ->type_name("SECONDS")
        ->default_str(std::to_string(options.announce_limit.count()));
    app.add_option("--per-address", options.per_address, "most connections of devices from one address")
        ->capture_default_str();
}

void add_tool_options(CLI::App &app, server_options &options)
{
    app.add_option("--tools", options.tools, "unix socket that tools connect to")->capture_default_str();
    app.add_option("--tools-listen", options.tools_listen, "ADDRESS:PORT for tools elsewhere, over TLS");
    app.add_option("--tools-ca", options.tools_ca, "certificate that the operators' are signed by")
        ->check(CLI::ExistingFile);
    app.add_option("--metrics", options.metrics, "ADDRESS:PORT to tell Prometheus the counts at");
}

void add_store_options(CLI::App &app, server_options &options)
{
    const CLI::AsSizeValue bytes(false);
    app.add_option("--store", options.store, "folder to keep live logs and events in");
    app.add_option("--stream", options.streams, "logs to keep of every device: syslog, qxdm")
        ->delimiter(',')
        ->check(CLI::IsMember({"syslog", "qxdm"}));
    app.add_option("--store-limit", options.store_limit, "most that is kept, such as 10GB; the oldest goes first")
        ->transform(bytes)
        ->capture_default_str();
    app.add_option("--store-days", options.store_days, "days that a file is kept");
    app.add_flag("--compress", options.compress, "compress the files that are followed by others, with zstd");
    app.add_option("--rotate", options.rotate_size, "size at which a file is followed by the next")
        ->transform(bytes)
        ->capture_default_str();
}

/* What parts of a subject, and keys of a bucket, are made of. */
const CLI::Validator kBusName(
    [](const std::string &text) {
        const auto is_fit = [](unsigned char c) { return std::isalnum(c) != 0 || c == '-' || c == '_'; };
        return !text.empty() && std::ranges::all_of(text, is_fit) ? "" : "a name is of letters, digits, - and _";
    },
    "");

void add_bus_options(CLI::App &app, server_options &options)
{
    CLI::Option *const nats =
        app.add_option("--nats", options.nats, "URLs of the NATS servers by which several log servers are one")
            ->delimiter(',')
            ->type_name("URL");
    app.add_option("--nats-name", options.name, "this server's name there, if not HOST-PORT")
        ->check(kBusName)
        ->needs(nats);
    app.add_option("--nats-creds", options.nats_credentials, "credentials for NATS")
        ->check(CLI::ExistingFile)
        ->needs(nats);
    app.add_option("--nats-ca", options.nats_ca, "certificate that NATS' are signed by: TLS")
        ->check(CLI::ExistingFile)
        ->needs(nats);
    app.add_option("--advertise-tools", options.advertise_tools,
                   "address that tools are told to go to, if not --tools-listen or --tools")
        ->needs(nats);
    app.add_option("--spool", options.spool, "folder for what JetStream has not got yet of the logs of --stream")
        ->needs(nats);
    app.add_option("--spool-limit", options.spool_limit, "most that is there; more is lost, and told")
        ->transform(CLI::AsSizeValue(false))
        ->capture_default_str();
}

/* The address of a text such as "[::]:5000"; none, and why, when it is none. */
std::optional<tcp::endpoint> endpoint(const std::string &text, std::string &why)
{
    const std::size_t colon = text.rfind(':');
    asio::error_code error;
    std::string host = text.substr(0, colon == text.npos ? 0 : colon);
    if (host.starts_with('[') && host.ends_with(']'))
        host = host.substr(1, host.size() - 2);
    const auto address = asio::ip::make_address(host, error);
    const unsigned long port = colon == text.npos ? 0 : std::strtoul(text.c_str() + colon + 1, nullptr, 10);
    if (!error && port > 0 && port < 65536)
        return tcp::endpoint(address, static_cast<std::uint16_t>(port));
    why = text + " is no ADDRESS:PORT, such as 10.0.0.1:5000 or [::]:5000";
    return std::nullopt;
}

/* Listens at the address; none, and why, when that can't be. */
std::optional<tcp::acceptor> listen_at(asio::io_context &io, const std::string &text, std::string &why)
{
    const auto at = endpoint(text, why);
    if (!at)
        return std::nullopt;
    tcp::acceptor listener(io);
    asio::error_code error;
    listener.open(at->protocol(), error);
    if (!error)
        listener.set_option(tcp::acceptor::reuse_address(true), error);
    if (!error && at->protocol() == tcp::v6())
        listener.set_option(asio::ip::v6_only(false), error);
    if (!error)
        listener.bind(*at, error);
    if (!error)
        listener.listen(4096, error);
    if (!error)
        return listener;
    why = "cannot listen at " + text + ": " + error.message();
    return std::nullopt;
}

/* The same for a unix socket, which its group may use. One that an earlier server has left behind is removed. */
std::optional<asio::local::stream_protocol::acceptor> listen_local(asio::io_context &io, const std::string &path,
                                                                   std::string &why)
{
    asio::local::stream_protocol::socket probe(io);
    asio::error_code error;
    probe.connect(path, error);
    if (!error) {
        why = "another server serves " + path;
        return std::nullopt;
    }
    std::error_code ignored;
    if (std::filesystem::is_socket(path, ignored))
        std::filesystem::remove(path, ignored);
    asio::local::stream_protocol::acceptor listener(io);
    listener.open({}, error);
    const mode_t mask = umask(0117);
    listener.bind(path, error);
    umask(mask);
    if (!error)
        listener.listen(128, error);
    if (!error)
        return listener;
    why = "cannot listen at " + path + ": " + error.message();
    return std::nullopt;
}

bool load_certificates(server &server, std::string &why)
{
    const server_options &options = server.options;
    return (options.plain || server.device_tls.load(options.cert, options.key, options.ca, why)) &&
           (options.tools_listen.empty() || server.tool_tls.load(options.cert, options.key, options.tools_ca, why));
}

void look_at_certificate(const server &server)
{
    for (const tls_endpoint *const tls : {&server.device_tls, &server.tool_tls})
        if (tls->loaded() && tls->days_left() <= kCertificateWarn) {
            server_log("certificate", {{"ends in days", std::to_string(tls->days_left())}});
            break;
        }
}

task<void> watch_certificate(server &server)
{
    asio::steady_timer timer(server.io);
    for (asio::error_code cancelled; !cancelled;) {
        look_at_certificate(server);
        timer.expires_after(kCertificateLook);
        co_await timer.async_wait(await_into(cancelled));
    }
}

/* Takes the certificates again whenever that is asked for. */
task<void> reload(server &server)
{
    asio::signal_set hang_up(server.io, SIGHUP);
    for (asio::error_code cancelled; !cancelled;) {
        co_await hang_up.async_wait(await_into(cancelled));
        std::string why;
        if (!cancelled && load_certificates(server, why)) {
            server_log("certificates were loaded again", {});
            look_at_certificate(server);
        } else if (!cancelled) {
            server_log("certificates stay as they were", {{"why", why}});
        }
    }
}

/* What a server is called that was given no name: by host and port. */
std::string default_name(const std::string &port)
{
    char host[65] = "";
    gethostname(host, sizeof host - 1);
    std::string name = std::string(host) + '-' + port;
    std::ranges::replace(name, '.', '_');
    return name;
}

/* Begins to serve; false, and why, when that can't be. */
bool start(server &server, std::string &why)
{
    const server_options &options = server.options;
    if (!load_certificates(server, why))
        return false;
    if (!options.store.empty() && !(server.store = log_store::open(server, why)))
        return false;
    auto devices = listen_at(server.io, options.listen, why);
    auto tools = listen_local(server.io, options.tools, why);
    if (!devices || !tools)
        return false;
    server.port = std::to_string(devices->local_endpoint().port());
    server.name = options.name.empty() ? default_name(server.port) : options.name;
    server.tools_address = !options.advertise_tools.empty() ? options.advertise_tools
                           : !options.tools_listen.empty()  ? options.tools_listen
                                                            : options.tools;
    if (!options.nats.empty() && !(server.bus = bus::open(server, why)))
        return false;
    run_beside(server.io, server.devices->listen(std::move(*devices)));
    run_beside(server.io, serve_local_tools(server, std::move(*tools)));
    using serve = task<void> (*)(struct server &, tcp::acceptor);
    for (const auto &[at, procedure] : {std::pair<const std::string &, serve>{options.tools_listen, serve_remote_tools},
                                        {options.metrics, serve_metrics}}) {
        if (at.empty())
            continue;
        auto listener = listen_at(server.io, at, why);
        if (!listener)
            return false;
        run_beside(server.io, procedure(server, std::move(*listener)));
    }
    run_beside(server.io, watch_certificate(server));
    run_beside(server.io, reload(server));
    return true;
}

/* As many descriptors as the system allows: a device takes one, its streams one each. */
void raise_descriptors()
{
    rlimit limit{};
    getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = limit.rlim_max;
    setrlimit(RLIMIT_NOFILE, &limit);
}

int serve(const server_options &options)
{
    std::signal(SIGPIPE, SIG_IGN);
    raise_descriptors();
    asio::io_context io(1);
    server server(io, options);
    std::string why;
    if (!start(server, why)) {
        std::fprintf(stderr, "vex_log_server: %s\n", why.c_str());
        return 1;
    }
    asio::signal_set end(io, SIGTERM, SIGINT);
    end.async_wait([&](asio::error_code, int) { io.stop(); });
    server_log("ready", {{"devices", options.listen}, {"tools", options.tools}});
    sd_notify(0, "READY=1");
    io.run();
    sd_notify(0, "STOPPING=1");
    server_log("ends", {{"devices", std::to_string(server.devices->all().size())}});
    server.devices->end_all();
    io.restart();
    bool bus_ended = server.bus == nullptr;
    if (server.bus)
        asio::co_spawn(io, server.bus->end(), [&bus_ended](const std::exception_ptr &) { bus_ended = true; });
    for (const auto until = server_clock::now() + kEndMax;
         !(server.devices->all().empty() && bus_ended) && server_clock::now() < until;)
        io.run_one_for(100ms);
    if (server.bus)
        server.bus->flush();
    std::filesystem::remove(options.tools);
    server.store.reset();
    std::fflush(nullptr);
    _exit(0); /* what still waits for something refers to the server */
}

} // namespace

int main(int argc, char **argv)
{
    server_options options;
    CLI::App app{"The log server of a fleet: devices in client mode call it, log tools connect to it."};
    app.set_version_flag("--version", "vex_log_server " VEX_VERSION);
    add_device_options(app, options);
    add_tool_options(app, options);
    add_store_options(app, options);
    add_bus_options(app, options);
    CLI11_PARSE(app, argc, argv);
    if (!options.plain && (options.cert.empty() || options.key.empty() || options.ca.empty())) {
        std::fprintf(stderr, "vex_log_server: over TLS it needs --cert, --key and --ca; without TLS, --plain\n");
        return 2;
    }
    if (!options.tools_listen.empty() && (options.cert.empty() || options.key.empty() || options.tools_ca.empty())) {
        std::fprintf(stderr, "vex_log_server: --tools-listen needs --cert, --key and --tools-ca\n");
        return 2;
    }
    if (!options.streams.empty() && options.store.empty() && options.spool.empty()) {
        std::fprintf(stderr, "vex_log_server: --stream needs --store, or --nats and --spool\n");
        return 2;
    }
    return serve(options);
}

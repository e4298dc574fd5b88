/* The PC side's command line: which device, and the one thing that is asked of it. */
#include "tools/tool_archive.h"
#include "tools/tool_commands.h"
#include "tools/tool_config.h"
#include "tools/tool_log.h"
#include "tools/tool_many.h"
#include "tools/tool_process.h"
#include "tools/tool_server.h"
#include "tools/tool_stream.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstdlib>
#include <functional>

namespace
{

constexpr char kServerSocket[] = "/run/vex_log_server.sock";

/* What is asked of the device; the exit status. */
using tool_job = std::function<int(tool_device &)>;

const CLI::Validator kDigits(
    [](const std::string &text) {
        return !text.empty() && text.find_first_not_of("0123456789") == std::string::npos ? "" : "a number is wanted";
    },
    "");

/* An option that takes a limit in seconds. */
void add_limit(CLI::App &app, const char *name, std::chrono::milliseconds &limit, const char *help)
{
    constexpr double kMost = 86400;
    app.add_option_function<double>(
           name, [&limit](double s) { limit = std::chrono::milliseconds(static_cast<long>(s * 1000)); }, help)
        ->check([](const std::string &text) {
            const double s = std::strtod(text.c_str(), nullptr);
            return s >= 0.001 && s <= kMost ? "" : "a time is 0.001 to 86400 seconds"; /* and never "nan" */
        })
        ->type_name("SECONDS")
        ->default_str(limit.count() > 0 ? std::to_string(limit.count() / 1000) : "");
}

void add_common_options(CLI::App &app, tool_device &device)
{
    app.add_option("--host", device.host, "address or name of the device")->capture_default_str();
    app.add_option("--port", device.port, "port of its log daemon")->check(CLI::Range(1, 65535))->capture_default_str();
    app.add_flag("--json", device.json, "print the device's reply as it came");
    app.add_flag_callback("--debug", tool_log_show, "show on standard error what goes over the wire");
    add_limit(app, "--connect-timeout", device.limits.connect, "longest wait for a connection");
    add_limit(app, "--reply-timeout", device.limits.reply, "longest wait for an answer");
    add_limit(app, "--stall-timeout", device.limits.stall, "longest pause inside a transfer");
}

/* What the command line says beside the command. */
struct tool_words {
    std::string first;
    std::string second;
    int tries = 3;
    tool_stream_options stream;
};

void add_capture(CLI::App &app, tool_words &words, tool_job &job)
{
    CLI::App *capture = app.add_subcommand("capture", "capture packets into the device's logs");
    capture->require_subcommand(1);
    CLI::App *start = capture->add_subcommand("start", "start again, on up to four interfaces");
    start->add_option("INTERFACES", words.first, "such as eth0,wan,lan; wan and lan are the device's own")
        ->required()
        ->check([](const std::string &list) {
            return std::count(list.begin(), list.end(), ',') < 4 ? "" : "a device captures on four interfaces at most";
        });
    start->add_option("--len", words.second, "bytes to keep of each packet")->check(kDigits);
    start->callback(
        [&] { job = [&](tool_device &device) { return tool_capture_start(device, words.first, words.second); }; });
    capture->add_subcommand("stop", "stop all captures")->callback([&] { job = tool_capture_stop; });
}

void add_transfers(CLI::App &app, tool_words &words, tool_job &job)
{
    CLI::App *archive = app.add_subcommand("archive", "fetch all the device's logs as a gzip tar");
    archive->add_option("FILE", words.first, "where to store it; with several devices, a folder")->required();
    archive->add_option("--tries", words.tries, "how often the device may fail to pack them")
        ->check(CLI::PositiveNumber)
        ->capture_default_str();
    archive->callback(
        [&] { job = [&](tool_device &device) { return tool_archive(device, words.first, words.tries); }; });

    CLI::App *config = app.add_subcommand("config", "push a configuration package and have it set up");
    config->add_option("FILE", words.first, "the package, a tar file")->required();
    config->callback([&] { job = [&](tool_device &device) { return tool_config(device, words.first); }; });

    CLI::App *stream = app.add_subcommand("stream", "show a live log until Ctrl-C");
    stream->add_option("LOG", words.stream.log, "syslog, or qxdm: the modem's log, which is binary")
        ->required()
        ->check(CLI::IsMember({"syslog", "qxdm"}));
    stream->add_option("--output", words.stream.output, "append it to a file");
    stream->add_flag("--stop", words.stream.stop, "only have the device stop, whoever started it");
    add_limit(*stream, "--for", words.stream.length, "end by itself after that time");
    stream->callback([&] { job = [&](tool_device &device) { return tool_stream(device, words.stream); }; });
}

void add_short_commands(CLI::App &app, tool_words &words, tool_job &job)
{
    app.add_subcommand("version", "who the device is")->callback([&] { job = tool_version; });
    app.add_subcommand("clean", "delete all the device's logs")->callback([&] { job = tool_clean; });

    CLI::App *syslog = app.add_subcommand("syslog", "show or set level and size of the device's system log");
    CLI::Option *level = syslog->add_option("LEVEL", words.first, "1 to 8: lines of a level below it are kept");
    level->needs(syslog->add_option("SIZE", words.second, "in KB")->needs(level)->check(kDigits))->check(kDigits);
    syslog->callback(
        [&] { job = [&](tool_device &device) { return tool_syslog(device, words.first, words.second); }; });

    CLI::App *bsp = app.add_subcommand("bsp", "show or set the log level of a kernel module");
    bsp->add_option("MODULE", words.first, "its name")->required();
    bsp->add_option("LEVEL", words.second, "such as debug");
    bsp->callback([&] { job = [&](tool_device &device) { return tool_bsp(device, words.first, words.second); }; });

    CLI::App *modem = app.add_subcommand("modem", "show or switch the modem's mode");
    modem->add_option("MODE", words.first, "lpm or online")->check(CLI::IsMember({"lpm", "online"}));
    modem->callback([&] { job = [&](tool_device &device) { return tool_modem(device, words.first); }; });

    CLI::App *raw = app.add_subcommand("raw", "send a command as it is and print the reply");
    raw->add_option("JSON", words.first, "the command, such as {\"msgid\":\"3\"}")->required();
    raw->callback([&] { job = [&](tool_device &device) { return tool_raw(device, words.first); }; });
}

void add_commands(CLI::App &app, tool_words &words, tool_job &job)
{
    app.require_subcommand(1);
    add_short_commands(app, words, job);
    add_capture(app, words, job);
    add_transfers(app, words, job);
}

/* Which devices behind a log server it is for. */
struct tool_choice {
    std::vector<std::string> imeis;
    bool all = false;
    unsigned parallel = 8;
    bool list = false; /* it is for none: they are to be listed */
    bool watch = false;
};

void add_server_options(CLI::App &app, tool_device &device, tool_choice &choice)
{
    tool_server &server = device.server;
    CLI::Option *const host = app.get_option("--host");
    app.add_option("--server", server.address,
                   "the log server that the device has called: a unix socket's path, or ADDRESS:PORT")
        ->envname("VEX_LOG_SERVER")
        ->type_name("ADDRESS");
    CLI::Option *const all =
        app.add_flag("--all", choice.all, "all devices that are connected to the server")->excludes(host);
    app.add_option("--device", choice.imeis, "IMEI of the device; may be given several times")
        ->excludes(host)
        ->excludes(all);
    app.add_option("--parallel", choice.parallel, "how many devices at a time")
        ->check(CLI::Range(1, 256))
        ->capture_default_str();
    app.add_option_function<long>(
           "--wait", [&server](long s) { server.wait = std::chrono::seconds(s); },
           "how long to wait for a device that is not connected")
        ->check(CLI::Range(0, 86400))
        ->type_name("SECONDS");
    for (const auto &[name, file, help] : {std::tuple{"--cert", &server.cert, "an operator's certificate, a PEM file"},
                                           {"--key", &server.key, "its key"},
                                           {"--ca", &server.ca, "certificate that the server's is signed by"}})
        app.add_option(name, *file, help)->check(CLI::ExistingFile);
    app.get_subcommand("archive")->add_flag("--store", server.store, "keep it on the log server, too");
    CLI::App *const devices = app.add_subcommand("devices", "list the devices that are connected to the log server");
    devices->add_flag("--watch", choice.watch, "and go on with who calls and who leaves");
    devices->callback([&choice] { choice.list = true; });
}

/* Has the job done for the devices that are meant. */
int run(tool_device &device, const tool_choice &choice, const tool_job &job)
{
    if (device.server.address.empty() && (choice.all || choice.list || !choice.imeis.empty()))
        device.server.address = kServerSocket;
    if (choice.list)
        return tool_devices(device.server, device.limits, device.json, choice.watch);
    if (choice.all)
        return tool_for_all(device, choice.parallel, job);
    if (choice.imeis.size() > 1)
        return tool_for_many(device, choice.imeis, choice.parallel, job);
    if (choice.imeis.empty() && tool_has_server(device))
        return tool_fail(kNoAnswer, "which device behind the log server? Name it with --device, or take --all");
    if (!choice.imeis.empty())
        device.imei = choice.imeis.front();
    return job(device);
}

} // namespace

int main(int argc, char **argv)
{
    tool_prepare_process();
    tool_device device;
    tool_words words;
    tool_job job;
    tool_choice choice;
    CLI::App app{"Controls and collects the diagnostic logs of a device."};
    app.set_version_flag("--version", "vex_log_tool " VEX_VERSION);
    app.fallthrough(); /* common options may follow the command, too */
    add_common_options(app, device);
    add_commands(app, words, job);
    add_server_options(app, device, choice);

    CLI11_PARSE(app, argc, argv);
    if (app.count("--host") > 0)
        device.server.address.clear(); /* which the environment may name */
    return tool_exit_status(run(device, choice, job));
}

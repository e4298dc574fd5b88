/* The PC side's command line: which device, and the one thing that is asked of it. */
#include "tools/tool_archive.h"
#include "tools/tool_commands.h"
#include "tools/tool_config.h"
#include "tools/tool_log.h"
#include "tools/tool_process.h"
#include "tools/tool_serve.h"
#include "tools/tool_stream.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstdlib>
#include <functional>

namespace
{

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

/* The options of every command, whoever made the connection. */
void add_output_options(CLI::App &app, tool_device &device)
{
    app.add_flag("--json", device.json, "print the device's reply as it came");
    app.add_flag_callback("--debug", tool_log_show, "show on standard error what goes over the wire");
    add_limit(app, "--connect-timeout", device.limits.connect, "longest wait for a connection");
    add_limit(app, "--reply-timeout", device.limits.reply, "longest wait for an answer");
    add_limit(app, "--stall-timeout", device.limits.stall, "longest pause inside a transfer");
}

void add_common_options(CLI::App &app, tool_device &device)
{
    app.add_option("--host", device.host, "address or name of the device")->capture_default_str();
    app.add_option("--port", device.port, "port of its log daemon")->check(CLI::Range(1, 65535))->capture_default_str();
    add_output_options(app, device);
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
    archive->add_option("FILE", words.first, "where to store it")->required();
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

/* Runs a command line for a device that has called. What it says of output and limits holds for itself only. */
int run_line(tool_device &device, const std::string &line)
{
    if (line.starts_with("raw {")) /* JSON as it is: quotes and blanks are its own */
        return tool_raw(device, line.substr(4));
    const bool json = device.json;
    const tool_limits limits = device.limits;
    tool_words words;
    tool_job job;
    CLI::App app{"Commands for the device that has called."};
    app.fallthrough();
    add_output_options(app, device);
    add_commands(app, words, job);
    int status = 0;
    try {
        app.parse(line);
        device.link->limits = device.limits;
        status = job(device);
    } catch (const CLI::ParseError &error) {
        if (error.get_exit_code() != 0)
            std::fprintf(stderr, "%s:\n", line.c_str());
        status = app.exit(error);
    }
    device.json = json;
    device.limits = limits;
    return status;
}

void add_serve(CLI::App &app, tool_serve_options &options, tool_job &job)
{
    CLI::App *serve = app.add_subcommand("serve", "be the log server that a device calls, and take commands for it");
    serve->add_option("--listen", options.port, "port to be called at")
        ->check(CLI::Range(1, 65535))
        ->capture_default_str();
    CLI::Option *plain = serve->add_flag("--plain", options.plain, "without TLS");
    const auto add_file = [&](const char *name, std::string &file, const char *help) {
        serve->add_option(name, file, help)->check(CLI::ExistingFile)->excludes(plain);
    };
    add_file("--cert", options.cert, "our certificate, a PEM file");
    add_file("--key", options.key, "its key");
    add_file("--ca", options.ca, "certificate that the devices' are signed by");
    serve->callback([&] {
        if (app.count("--host") + app.count("--port") > 0)
            throw CLI::ValidationError(
                "serve is called by devices, at the port of --listen; it has no --host or --port");
        job = [&](tool_device &device) { return tool_serve(device, options, run_line); };
    });
}

} // namespace

int main(int argc, char **argv)
{
    tool_prepare_process();
    tool_device device;
    tool_words words;
    tool_job job;
    tool_serve_options serve;
    CLI::App app{"Controls and collects the diagnostic logs of a device."};
    app.set_version_flag("--version", "vex_log_tool " VEX_VERSION);
    app.fallthrough(); /* common options may follow the command, too */
    add_common_options(app, device);
    add_commands(app, words, job);
    add_serve(app, serve, job);

    CLI11_PARSE(app, argc, argv);
    return tool_exit_status(job(device));
}

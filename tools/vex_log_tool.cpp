/* The PC side: asks a device's log daemon for one thing and says in words, or as JSON, what came of it. */
#include "tools/tool_answer.h"
#include "tools/tool_link.h"
#include "tools/tool_log.h"

#include <CLI/CLI.hpp>
#include <cstdio>
#include <functional>

namespace
{

/* Exit statuses beside those of the command line parser, which are above 100. */
constexpr int kDone = 0;
constexpr int kDeviceSaidNo = 1;
constexpr int kNoAnswer = 2;

struct tool_options {
    std::string host = "192.168.0.1";
    std::string port = "48888";
    tool_limits limits;
    bool json = false;
};

int fail(int status, const std::string &why)
{
    std::fflush(stdout); /* first the reply, then what is wrong with it */
    std::fprintf(stderr, "vex_log_tool: %s\n", why.c_str());
    return status;
}

/* Sends one command and waits for its reply; `show` prints a good one for a person. */
int ask(const tool_options &options, const std::string &command,
        const std::function<void(const tool_link &, const tool_answer &)> &show)
{
    std::string why;
    std::optional<tool_link> link = tool_connect(options.host, options.port, options.limits, why);
    if (!link || !tool_send(*link, command, why))
        return fail(kNoAnswer, why);
    const std::optional<tool_frame> frame = tool_receive(*link, why);
    if (!frame)
        return fail(kNoAnswer, why);
    const tool_answer answer = tool_read_answer(frame->control);
    if (options.json && !frame->control.empty())
        std::printf("%s\n", frame->control.c_str());
    if (answer.verdict != tool_verdict::success)
        return fail(kDeviceSaidNo, answer.reason);
    if (!options.json)
        show(*link, answer);
    return kDone;
}

void show_version(const tool_link &link, const tool_answer &answer)
{
    const auto row = [&answer](const char *title, const char *member, const char *unit) {
        const std::string value = tool_answer_text(answer, "VersionInfo", member);
        std::printf("  %-18s%s%s\n", title, value.empty() ? "(not set)" : value.c_str(), value.empty() ? "" : unit);
    };
    std::printf("Device at %s\n", link.where.c_str());
    row("model", "projectName", "");
    row("software", "VersionNum", "");
    row("IMEI", "imei", "");
    row("kernel built", "CompileTime", "");
    row("system log, most", "syslogsizeMax", " KB");
}

int run_version(const tool_options &options)
{
    return ask(options, R"({"msgid":"3","VersionInfo":""})", show_version);
}

int run_raw(const tool_options &options, const std::string &command)
{
    return ask(options, command, [](const tool_link &, const tool_answer &answer) {
        char *printed = cJSON_Print(answer.root.get());
        std::printf("%s\n", printed != nullptr ? printed : "");
        cJSON_free(printed);
    });
}

/* An option that takes a limit in seconds. */
void add_limit(CLI::App &app, const char *name, std::chrono::milliseconds &limit, const char *help)
{
    constexpr double kMost = 86400;
    app.add_option_function<double>(
           name, [&limit](double s) { limit = std::chrono::milliseconds(static_cast<long>(s * 1000)); }, help)
        ->check(CLI::Range(0.001, kMost))
        ->type_name("SECONDS")
        ->default_str(std::to_string(limit.count() / 1000));
}

void add_common_options(CLI::App &app, tool_options &options)
{
    app.add_option("--host", options.host, "address or name of the device")->capture_default_str();
    app.add_option("--port", options.port, "port of its log daemon")->capture_default_str();
    app.add_flag("--json", options.json, "print the device's reply as it came");
    app.add_flag_callback("--debug", tool_log_show, "show on standard error what goes over the wire");
    add_limit(app, "--connect-timeout", options.limits.connect, "longest wait for a connection");
    add_limit(app, "--reply-timeout", options.limits.reply, "longest wait for an answer");
    add_limit(app, "--stall-timeout", options.limits.stall, "longest pause inside a transfer");
}

} // namespace

int main(int argc, char **argv)
{
    tool_options options;
    std::string raw;
    int status = kDone;
    CLI::App app{"Controls and collects the diagnostic logs of a device."};
    app.require_subcommand(1);
    app.fallthrough(); /* common options may stand behind the command too */
    add_common_options(app, options);

    CLI::App *version = app.add_subcommand("version", "who the device is");
    version->callback([&] { status = run_version(options); });
    CLI::App *raw_command = app.add_subcommand("raw", "send a command as it is and print the reply");
    raw_command->add_option("JSON", raw, "the command, such as {\"msgid\":\"3\"}")->required();
    raw_command->callback([&] { status = run_raw(options, raw); });

    CLI11_PARSE(app, argc, argv);
    return status;
}

#include "tools/tool_commands.h"

#include <cstdio>

int tool_version(tool_device &device)
{
    int status = kDone;
    const auto answer = tool_ask(device, tool_command("3", nullptr, {{"VersionInfo", ""}}), status);
    if (!answer)
        return status;
    const auto row = [&answer](const char *title, const char *member, const char *unit) {
        const std::string value = tool_answer_text(*answer, "VersionInfo", member);
        std::printf("  %-18s%s%s\n", title, value.empty() ? "(not set)" : value.c_str(), value.empty() ? "" : unit);
    };
    std::printf("Device at %s\n", device.link->where.c_str());
    row("model", "projectName", "");
    row("software", "VersionNum", "");
    row("IMEI", "imei", "");
    row("kernel built", "CompileTime", "");
    row("system log, most", "syslogsizeMax", " KB");
    return kDone;
}

int tool_raw(tool_device &device, const std::string &command)
{
    int status = kDone;
    if (const auto answer = tool_ask(device, command, status)) {
        char *const printed = cJSON_Print(answer->root.get());
        std::printf("%s\n", printed != nullptr ? printed : "");
        cJSON_free(printed);
    }
    return status;
}

int tool_syslog(tool_device &device, const std::string &level, const std::string &size)
{
    int status = kDone;
    const std::string command = tool_command("4", "syslogParaSet", {{"sysloglevel", level}, {"syslogsize", size}});
    const auto answer = tool_ask(device, command, status);
    if (!answer)
        return status;
    const auto value = [&answer](const char *name) { return tool_answer_text(*answer, "syslogParaSet", name); };
    std::printf("System log: level %s, size %s KB", value("sysloglevel").c_str(), value("syslogsize").c_str());
    if (level.empty())
        std::printf(", at most %s KB\n", value("syslogsizeMax").c_str());
    else
        std::printf(": the device was told so\n");
    return kDone;
}

int tool_capture_start(tool_device &device, const std::string &interfaces, const std::string &length)
{
    int status = kDone;
    const std::string command =
        length.empty() ? tool_command("5", "tcpdump", {{"InterfaceName", interfaces}, {"Action", "start"}})
                       : tool_command("5", "tcpdump",
                                      {{"InterfaceName", interfaces}, {"Action", "start"}, {"TcpdumpLen", length}});
    if (tool_ask(device, command, status))
        std::printf("The device was told to capture on %s. It does not say whether a capture has really started: the\n"
                    "log archive shows it, with a .pcap file for each interface.\n",
                    interfaces.c_str());
    return status;
}

int tool_capture_stop(tool_device &device)
{
    int status = kDone;
    const std::string command = tool_command("5", "tcpdump", {{"InterfaceName", ""}, {"Action", "end"}});
    if (tool_ask(device, command, status))
        std::printf("The device was told to stop all captures; their files are in the log archive.\n");
    return status;
}

int tool_clean(tool_device &device)
{
    int status = kDone;
    if (tool_ask(device, tool_command("7", nullptr, {{"CleanLocalLog", ""}}), status))
        std::printf("The device was told to delete all its logs, captures and configuration files.\n");
    return status;
}

int tool_bsp(tool_device &device, const std::string &module, const std::string &level)
{
    int status = kDone;
    if (const auto answer =
            tool_ask(device, tool_command("8", "bsp", {{"module_name", module}, {"level", level}}), status))
        std::printf("Kernel module %s: log level %s%s\n", tool_answer_text(*answer, "bsp", "module_name").c_str(),
                    tool_answer_text(*answer, "bsp", "level").c_str(), level.empty() ? "" : ": the device was told so");
    return status;
}

int tool_modem(tool_device &device, const std::string &mode)
{
    int status = kDone;
    if (const auto answer = tool_ask(device, tool_command("11", nullptr, {{"mode_lpm_online", mode}}), status))
        std::printf(mode.empty() ? "The modem is set to: %s\n" : "The modem was asked to go to: %s\n",
                    tool_answer_text(*answer, nullptr, "mode_lpm_online").c_str());
    return status;
}

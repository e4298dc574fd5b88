#include "soak/commands.h"

#include "tests/frame.h"

namespace
{

std::string random_level(dice &chance)
{
    return chance.one_of({"0", "3", "7", "", "8", "-1", "fifteen letters", "longer than what fits in"});
}

std::string random_text(dice &chance)
{
    return chance.one_in(2) ? "\"" + random_level(chance) + "\""
                            : chance.one_of({"7", "null", "{}", "[\"7\"]", "\"\\u0000\""});
}

std::string live_log(dice &chance, const std::string &server_port)
{
    std::string text = R"({"msgid":"6","realtimeLog":{"LogType":")";
    text += chance.one_of({"syslog", "syslog", "qxdm", "qxdm", "kernel"});
    text += R"(","Action":")";
    text += chance.one_of({"start", "start", "end"});
    if (!server_port.empty())
        text += R"(","ip":"127.0.0.1","port":")" + (chance.one_in(8) ? "9" : server_port);
    return text + "\"}}";
}

std::string capture(dice &chance)
{
    std::string text = R"({"msgid":"5","tcpdump":{"InterfaceName":")";
    text += chance.one_of({"lan", "wan,lan", "lan,lo,usb0,nobody,more", "", ",,,"});
    text += R"(","Action":")";
    text += chance.one_of({"start", "end", "end", "pause"});
    return text + R"(","TcpdumpLen":)" + random_text(chance) + "}}";
}

std::string module_level(dice &chance)
{
    std::string text = R"({"msgid":"8","bsp":{"module_name":")";
    text += chance.one_of({"wlan", "usb", "switch", "a-rather-long-name-of-a-module.1", ""});
    text += std::to_string(chance.below(12));
    text += R"(","level":")";
    text += chance.one_of({"debug", "err", "info", "", "", "a;b,c"});
    return text + "\"}}";
}

} // namespace

soak_command random_command(dice &chance, const std::string &server_port)
{
    if (!server_port.empty() && chance.one_in(3))
        return {"6", live_log(chance, server_port), ""};
    const auto text = [&] { return random_text(chance); };
    switch (chance.below(20)) {
    case 0:
        return {"2", R"({"msgid":"2","GetLocalLog":""})", ""};
    case 1:
        return {"3", R"({"msgid":"3","VersionInfo":""})", ""};
    case 2:
    case 3:
        return {"4", R"({"msgid":"4","syslogParaSet":{"sysloglevel":)" + text() + R"(,"syslogsize":)" + text() + "}}",
                ""};
    case 4:
    case 5:
        return {"5", capture(chance), ""};
    case 6:
        return {"7", R"({"msgid":"7","CleanLocalLog":""})", ""};
    case 7:
    case 8:
        return {"1", R"({"msgid":"1","conf_file":{"totalLength":)" + text() + "}}", chance.bytes(chance.below(3000))};
    case 9:
    case 10:
    case 11:
        return {"8", module_level(chance), ""};
    case 12:
    case 13:
    case 14:
        return {"6", live_log(chance, server_port), ""};
    case 15:
        return {"11", R"({"msgid":"11","mode_lpm_online":)" + text() + "}", ""};
    default:
        return {"11",
                R"({"msgid":"11","mode_lpm_online":")" + std::string(chance.one_of({"", "lpm", "online"})) + "\"}", ""};
    }
}

std::string random_nonsense(dice &chance)
{
    const soak_command near = random_command(chance, "9");
    std::string bytes = frame(near.control, near.data);
    const auto at = [&] { return static_cast<std::size_t>(chance.below(static_cast<int>(bytes.size()))); };
    switch (chance.below(9)) {
    case 0:
        return chance.bytes(1 + chance.below(5000));
    case 1:
        for (int i = chance.below(4); i >= 0; --i)
            bytes[at()] = static_cast<char>(chance.below(256));
        return bytes;
    case 2:
        return bytes.substr(0, at());
    case 3:
        return bytes.insert(at(), chance.bytes(1 + chance.below(20)));
    case 4:
        return bytes.erase(at(), 1 + static_cast<std::size_t>(chance.below(20)));
    case 5: /* a length that never ends */
        return "#~" + std::string(4, '\xff') + bytes;
    case 6:
        return frame(std::string(static_cast<std::size_t>(2046 + chance.below(4)), chance.one_of({'[', ' ', '\0'})));
    case 7:
        return frame("{\"msgid\":" + random_text(chance) + ",\"conf_file\":" + random_text(chance) + "}",
                     chance.bytes(chance.below(70000)));
    default:
        return frame(chance.one_of({R"({"msgid":"9"})", R"({"msgid":"10","DataLink":{"imei":"356938035643809"}})",
                                    R"({"msgid":"12"})", R"({"msgid":"-1"})", "null", ""}));
    }
}

std::string random_package(dice &chance)
{
    const std::size_t size = static_cast<std::size_t>(chance.below(20000));
    if (chance.one_in(3))
        return chance.bytes(static_cast<int>(size));
    /* One file in a folder, as tar writes it. */
    std::string head(512, '\0');
    const auto put = [&head](std::size_t at, const std::string &text) { head.replace(at, text.size(), text); };
    char octal[12];
    put(0, chance.one_of({"conf/Diag.cfg", "conf/vex_config_sys.sh", "conf/a b/$(c)", "../logfs/up"}));
    put(100, "0000644");
    put(108, "0000000");
    put(116, "0000000");
    std::snprintf(octal, sizeof octal, "%011zo", size);
    put(124, octal);
    put(136, "00000000000");
    put(148, "        0");
    put(257, std::string("ustar\0"
                         "00",
                         8));
    unsigned sum = 0;
    for (const char c : head)
        sum += static_cast<unsigned char>(c);
    std::snprintf(octal, sizeof octal, "%06o", sum);
    put(148, std::string(octal, 7));
    return head + chance.bytes(static_cast<int>(size)) + std::string(2048 - size % 512, '\0');
}

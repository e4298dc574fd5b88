/*
 * Every handler's control text, on a device whose commands are written down instead of run. Every request is
 * answered once, by a frame that has its number and has a control text of at most its bound; what is uploaded and
 * what is fetched arrives, and is not changed on its way.
 *
 * The first byte of an input says how the device is (see device_traits). The rest is up to four control texts, one a
 * line; a NUL, then NV items, NAME=VALUE, one a line; a NUL, then what programs print.
 */
#include "core/daemon_state.h"
#include "core/log_registry.h"
#include "core/log_tls_session.h"
#include "core/log_tools.h"
#include "fuzz/fuzz.h"
#include "fuzz/recorded_device.h"
#include "handlers/handlers.h"
#include "platform/unique_fd.h"
#include "protocol/log_json_codec.h"
#include "protocol/log_pkg_codec.h"
#include "tests/frame.h"
#include "tests/memory_platform.h"
#include "transport/log_intake.h"

#include <cstring>
#include <fstream>
#include <memory>
#include <sys/socket.h>
#include <sys/un.h>
#include <utility>
#include <vector>

namespace
{

constexpr std::size_t kReplyMax = 1023;
constexpr std::size_t kVersionReplyMax = 2047;
constexpr int kRequestsMax = 4;
constexpr char kPackage[] = "/logfs/logconf.tar";

int g_link = -1; /* the device's end of the command connection */

std::string content_of(const char *path)
{
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

/* A place at which a log program can be connected. */
unique_fd intake(const char *path)
{
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, path);
    unlink(path);
    unique_fd sock{socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0)};
    promise(bind(sock.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0 &&
                listen(sock.get(), 8) == 0,
            "an intake");
    return sock;
}

/* Our end of the command connection, and an archive to be fetched over it. */
struct tool_end {
    tool_end()
    {
        int ends[2] = {-1, -1};
        promise(socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, ends) == 0, "a socket pair");
        fd.reset(ends[1]);
        g_link = ends[0];
        for (int i = 0; i < 60000; ++i)
            g_archive += static_cast<char>(i % 251);
    }
    unique_fd fd;
    const unique_fd intakes[2] = {intake(kSyslogIntake), intake(kQxdmIntake)};
};

struct reply {
    std::string control;
    std::string data;
};

/* Takes the next reply off the bytes that came. */
reply take_reply(std::string_view &bytes)
{
    static const auto msg = std::make_unique<log_msg>();
    const auto parts = parts_of(bytes);
    promise(parts && parts->control.size() <= kPkgControlMax, "a reply is a frame, and bounded");
    log_msg_clear(msg.get());
    promise(log_decode_msg(reinterpret_cast<const unsigned char *>(bytes.data()), parts->size, msg.get()) == 0,
            "a reply is a whole frame");
    bytes.remove_prefix(parts->size);
    return {std::string(parts->control), std::string(parts->data)};
}

bool succeeded(const std::string &control)
{
    return control.ends_with("\"Result\":\"Success\"}");
}

/* Takes the replies to a request of that number off the connection; the control text of the last one. */
std::string check_replies(const tool_end &tool, int msgid)
{
    static unsigned char received[1 << 18];
    std::size_t held = 0;
    for (ssize_t n = 0; (n = recv(tool.fd.get(), received + held, sizeof received - held, 0)) > 0;)
        held += static_cast<std::size_t>(n);
    const std::string number = "{\"msgid\":\"" + std::to_string(msgid) + "\",";
    int count = 0;
    reply last;
    std::string data;
    for (std::string_view bytes = text_of(received, held); !bytes.empty(); ++count) {
        last = take_reply(bytes);
        promise(last.control.empty() || last.control.starts_with(number), "a reply has its request's number");
        promise(last.control.size() <= (msgid == 3 ? kVersionReplyMax : kReplyMax), "a reply is not too long");
        data += last.data;
    }
    const bool answers = msgid >= 1 && msgid <= 11 && msgid != 9 && msgid != 10;
    promise(count == (answers ? 1 : 0) || (msgid == 2 && count > 1), "a request is answered once");
    const bool packed = msgid == 2 && succeeded(last.control);
    promise(data == (packed ? g_archive : ""), "the archive arrives as it is, and only when it is asked for");
    return last.control;
}

/* Over TLS, replies are written to a session; here one that writes them as they are. */
std::unique_ptr<log_tls_session> session()
{
    return g_device.tls ? log_tls_session::open(nullptr, g_link, -1) : nullptr;
}

void set_up(std::string_view items)
{
    g_platform = {};
    g_platform.takes_line = [](const char *, const char *, va_list) {};
    g_platform.items["imei"] = "356938035643809";
    while (!items.empty()) {
        std::string_view value = take_field(items, '\n');
        const std::string name(take_field(value, '='));
        g_platform.items[name] = value;
    }
    g_platform.fails = g_device.platform_fails;
    g_daemon.run_mode = g_device.client_mode ? 1 : 0;
    g_daemon.use_ssl = g_device.tls ? 1 : 0;
    g_daemon.syslog_realtime_on = 0;
}

/* Runs the requests; what they have uploaded. */
std::string run_requests(const tool_end &tool, std::string_view requests, std::string_view data)
{
    std::string uploaded;
    for (int i = 0; i < kRequestsMax && !requests.empty(); ++i) {
        const std::string control(take_field(requests, '\n').substr(0, kPkgControlMax));
        const int msgid = log_json_get_msgid(control.c_str());
        log_dl_msg_handle_cmd(control.c_str(), reinterpret_cast<const unsigned char *>(data.data()),
                              static_cast<std::int32_t>(data.size()));
        const bool done = succeeded(check_replies(tool, msgid));
        if (msgid == 1 && done)
            uploaded += data;
    }
    return uploaded;
}

/* What is left of one input is not for the next one. */
void clean_up(const tool_end &tool)
{
    for (const unique_fd &sock : tool.intakes)
        while (unique_fd{accept(sock.get(), nullptr, nullptr)})
            continue;
    log_msg_set_config_file(R"({"conf_file":{"totalLength":"0"}})", reinterpret_cast<const unsigned char *>(""), 0);
    check_replies(tool, 1);
    unlink(kPackage);
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    if (size < 1)
        return 0;
    static const tool_end tool;
    std::string_view input = text_of(data + 1, size - 1);
    const std::string_view brought = input;
    g_device = device_traits(data[0]);
    const std::string_view requests = take_field(input, '\0');
    set_up(take_field(input, '\0'));
    g_output = input;
    const auto link =
        std::make_shared<log_link>(unique_fd{dup(g_link)}, session(), g_platform.items["client_ip"].c_str());
    const log_serving serving{*link};
    log_cmd_record(link);
    const std::string uploaded = run_requests(tool, requests, g_device.brings_data ? brought : "");
    if (!uploaded.empty())
        promise(content_of(kPackage) == uploaded, "what was uploaded is in the package");
    clean_up(tool);
    log_cmd_forget(*link);
    return 0;
}

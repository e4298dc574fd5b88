#include "server/tool_session.h"

#include "server/bus.h"
#include "server/fleet.h"

#include <asio/experimental/awaitable_operators.hpp>
#include <charconv>
#include <pwd.h>
#include <sys/socket.h>

using namespace asio::experimental::awaitable_operators;

namespace
{

using namespace std::chrono_literals;

constexpr auto kHandshakeMax = 20s;
constexpr auto kIdleMax = 60s;               /* for a tool to give its next command while it has a device */
constexpr std::size_t kAheadMax = 128 << 10; /* bytes that a tool may send before it is its turn */
constexpr unsigned kWaitMost = 86400;        /* s that a tool may want to wait */
constexpr auto kLookElsewhere = 2s;          /* whether a device that is waited for has called another server */

/* One tool. */
struct tool_session {
    server &home;
    std::shared_ptr<frame_link> link;
    std::string who;
};

task<bool> say(tool_session &tool, std::string frame)
{
    co_return co_await tool.link->send(frame);
}

task<bool> fail(tool_session &tool, std::string msgid, std::string why)
{
    return say(tool, make_frame(tool_json({{"msgid", msgid}, {"Result", "Fail:" + why}})));
}

/* Tells a tool that waits what it waits for. */
task<bool> let_wait(tool_session &tool, std::string msgid, std::string reason)
{
    return say(tool, make_frame(tool_json({{"msgid", msgid}, {"Result", "Waiting"}, {"reason", reason}})));
}

/* Tells a tool that it has the device now. */
task<bool> hand_over(tool_session &tool, const device &device)
{
    return say(
        tool,
        make_frame(tool_json(
            {{"msgid", "device"}, {"Result", "Success"}, {"imei", device.about.imei}, {"address", device.address}})));
}

/* Tells a tool that its live log begins, with the device's reply. */
task<bool> begin_log(tool_session &tool, const std::string &reply)
{
    return say(tool, make_frame(R"({"msgid":"stream","Result":"Success"})", reply));
}

constexpr char kDevicesHead[] = R"({"msgid":"devices","Result":"Success"})";

/* The devices of this server and of all others, a line each, in the data parts of as many frames as it takes, and one
 * without data behind them, which says what is missing. */
task<std::vector<std::string>> device_frames(server &home)
{
    std::string lines;
    for (const auto &[imei, device] : home.devices->all())
        lines += device->describe("there") + '\n';
    std::string missing;
    if (home.bus)
        lines += co_await home.bus->list(missing);
    std::vector<std::string> frames;
    for (std::size_t at = 0, end = 0; at < lines.size(); at = end) {
        end = lines.size() - at <= kPkgDataMax ? lines.size() : lines.rfind('\n', at + kPkgDataMax - 1) + 1;
        frames.push_back(make_frame(kDevicesHead, std::string_view(lines).substr(at, end - at)));
    }
    const std::string result =
        missing.empty() ? "Success" : "Fail:these are not all: it does not know those " + missing;
    frames.push_back(make_frame(tool_json({{"msgid", "devices"}, {"Result", result}})));
    co_return frames;
}

/* Tells all devices; then, if that is wanted, who calls and who leaves until the tool has enough. */
task<void> list_devices(tool_session &tool, bool watch)
{
    std::deque<std::string> changes;
    wake_up changed(tool.home.io);
    const auto note = [&](const std::string &line) {
        changes.push_back(line + '\n');
        changed.set();
    };
    const auto watching = tool.home.devices->watch(
        [&](const device &device, bool there) { note(device.describe(there ? "called" : "left")); });
    const auto watching_others = watch && tool.home.bus ? tool.home.bus->watch(note) : nullptr;
    const std::vector<std::string> frames = co_await device_frames(tool.home);
    for (const std::string &frame : frames) {
        const bool said = co_await say(tool, frame);
        if (!said)
            co_return;
    }
    const auto follow = [&]() -> task<void> {
        while (!tool.link->ended()) {
            co_await changed.wait();
            changed.reset();
            while (!changes.empty()) {
                const std::string frame = make_frame(kDevicesHead, changes.front());
                changes.pop_front();
                co_await say(tool, frame);
            }
        }
    };
    const auto leave = [&]() -> task<void> {
        co_await tool.link->fill();
        tool.link->end("it has left");
        changed.set();
    };
    if (watch)
        co_await (follow() && leave());
}

server_clock::time_point wait_end(const message &request)
{
    const std::string text = request.text("wait");
    unsigned seconds = 0;
    std::from_chars(text.data(), text.data() + text.size(), seconds);
    return server_clock::now() + std::chrono::seconds(std::min(seconds, kWaitMost));
}

/* Waits for something on behalf of a tool, by `waiting`; no longer than the tool does. */
template <class T> task<T> wait_for(tool_session &tool, std::shared_ptr<wake_up> waiting, task<T> something)
{
    T result{};
    bool over = false;
    const auto wait = [&]() -> task<void> {
        result = co_await std::move(something);
        over = true;
        tool.link->stop_waiting();
    };
    const auto watch = [&]() -> task<void> {
        for (bool more = true; more && !over && tool.link->held() <= kAheadMax;)
            more = co_await tool.link->fill();
        if (tool.link->ended())
            waiting->wait_no_longer_than(server_clock::now());
    };
    co_await (wait() && watch());
    co_return result;
}

/* Sends the tool to the other server that has a device, if there is one. */
task<bool> send_elsewhere(tool_session &tool, std::string msgid, std::string imei)
{
    if (!tool.home.bus)
        co_return false;
    const std::string address = co_await tool.home.bus->find(imei);
    if (address.empty())
        co_return false;
    const tool_members answer{{"msgid", msgid}, {"Result", "Elsewhere"}, {"server", address}};
    co_await say(tool, make_frame(tool_json(answer)));
    co_return true;
}

/* The device that a tool names, when it is there, or comes in the time that the tool has. None, and the tool knows why. */
task<std::shared_ptr<device>> find_device(tool_session &tool, const message &request)
{
    const std::string imei = request.text("imei");
    const auto end = wait_end(request);
    std::shared_ptr<device> found = tool.home.devices->find(imei);
    for (bool told = false; !found && !tool.link->ended(); told = true) {
        const bool sent = co_await send_elsewhere(tool, request.msgid(), imei);
        if (sent)
            co_return nullptr;
        if (server_clock::now() >= end)
            break;
        if (!told)
            co_await let_wait(tool, request.msgid(), "the device is not connected");
        const auto called = std::make_shared<wake_up>(tool.home.io);
        const auto look = tool.home.bus ? std::min(end, server_clock::now() + kLookElsewhere) : end;
        found = co_await wait_for(tool, called, tool.home.devices->await(imei, look, called));
    }
    if (!found)
        co_await fail(tool, request.msgid(), "no device " + tool_printable(imei.substr(0, 64)) + " is connected");
    co_return found;
}

/* Has the tool's commands carried out until it leaves; its archives are kept, if it wants that. */
task<void> run_commands(tool_session &tool, device &device, bool keep)
{
    for (;;) {
        tool.link->limit(kIdleMax);
        const auto frame = co_await tool.link->receive();
        if (!frame)
            co_return;
        tool.link->unlimited();
        const auto command = std::make_shared<device_command>(tool.home.io, message(frame->control).msgid(), tool.link);
        if (keep && command->msgid == "2")
            command->kept = std::make_unique<stored_archive>(*tool.home.store, device.about.imei);
        const bool answered = co_await device.run(command, frame->bytes);
        if (!answered) {
            if (device.link->ended())
                co_await fail(tool, "device", "the device has hung up: " + device.link->why());
            co_return;
        }
    }
}

/* Gives a tool the device that it names, for as long as it stays. */
task<void> give_device(tool_session &tool, const message &request)
{
    const bool keep = request.text("store") == "1";
    if (keep && !tool.home.store) {
        co_await fail(tool, "device", "it keeps nothing: it was started without --store");
        co_return;
    }
    const std::shared_ptr<device> device = co_await find_device(tool, request);
    if (!device)
        co_return;
    if (device->is_busy())
        co_await let_wait(tool, "device", "the device is at work for " + device->at_work());
    const auto turn = std::make_shared<wake_up>(tool.home.io);
    const bool mine = co_await wait_for(tool, turn, device->take_turn(tool.who, turn));
    if (!mine) {
        co_await fail(tool, "device", "the device has hung up");
        co_return;
    }
    const bool told = co_await hand_over(tool, *device);
    if (told)
        co_await run_commands(tool, *device, keep);
    device->give_turn();
}

/* Passes a live log on to the tool until that has enough of it. */
task<void> give_log(tool_session &tool, const message &request)
{
    const auto kind = log_kind_of(request.text("LogType"));
    if (!kind) {
        co_await fail(tool, "stream", "there is no such log");
        co_return;
    }
    const std::shared_ptr<device> device = co_await find_device(tool, request);
    if (!device)
        co_return;
    const auto follower = std::make_shared<log_follower>(tool.home.io, tool.link);
    device->log(*kind).join(follower);
    bool over = false;
    const auto follow = [&]() -> task<void> {
        co_await follower->started.wait();
        if (!follower->reply.empty())
            co_await begin_log(tool, follower->reply);
        co_await follower->pass_on();
        over = true;
        tool.link->stop_waiting();
    };
    const auto leave = [&]() -> task<void> {
        if (!over)
            co_await tool.link->fill(); /* whatever it says, it has enough */
        device->log(*kind).leave(follower);
    };
    co_await (follow() && leave());
}

/* The user at the other end of a unix socket. */
std::string local_user(int fd)
{
    ucred peer{};
    socklen_t len = sizeof peer;
    getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &len);
    const passwd *const user = getpwuid(peer.uid);
    return user != nullptr ? user->pw_name : "uid " + std::to_string(peer.uid);
}

task<void> take_local(server &server, asio::local::stream_protocol::socket socket)
{
    std::string who = local_user(socket.native_handle());
    auto link = std::make_shared<frame_link>(std::move(socket), nullptr);
    co_await serve_tool(server, std::move(link), std::move(who));
}

task<void> take_remote(server &server, asio::ip::tcp::socket socket)
{
    const auto link = std::make_shared<frame_link>(std::move(socket), server.tool_tls.session());
    link->limit(kHandshakeMax);
    const bool ready = co_await link->shake_hands();
    if (!ready) {
        server_log("refused tool", {{"address", link->address()}, {"why", link->why()}});
        co_return;
    }
    std::string who = peer_name(link->session());
    co_await serve_tool(server, link, std::move(who));
}

template <class Acceptor, class Take> task<void> accept_all(server &server, Acceptor listener, Take take)
{
    for (;;) {
        asio::error_code error;
        auto socket = co_await listener.async_accept(await_into(error));
        if (error == asio::error::operation_aborted)
            co_return;
        if (!error) {
            run_beside(server.io, take(server, std::move(socket)));
            continue;
        }
        asio::steady_timer pause(server.io, 100ms);
        co_await pause.async_wait(await_into(error));
    }
}

} // namespace

task<void> serve_tool(server &server, std::shared_ptr<frame_link> link, std::string who)
{
    tool_session tool{server, std::move(link), std::move(who)};
    const auto frame = co_await tool.link->receive();
    if (!frame)
        co_return;
    tool.link->unlimited();
    const message request(frame->control);
    if (request.msgid() == "devices")
        co_await list_devices(tool, request.text("watch") == "1");
    else if (request.msgid() == "device")
        co_await give_device(tool, request);
    else if (request.msgid() == "stream")
        co_await give_log(tool, request);
    else
        co_await fail(tool, request.msgid(), "unknown request");
}

task<void> serve_local_tools(server &server, asio::local::stream_protocol::acceptor listener)
{
    return accept_all(server, std::move(listener), take_local);
}

task<void> serve_remote_tools(server &server, asio::ip::tcp::acceptor listener)
{
    return accept_all(server, std::move(listener), take_remote);
}

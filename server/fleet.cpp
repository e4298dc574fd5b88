#include "server/fleet.h"

#include "server/bus.h"

#include <algorithm>
#include <cctype>
#include <netinet/tcp.h>

namespace
{

using namespace std::chrono_literals;

constexpr auto kProbeMax = 12s; /* for a device that is there no more to be found out */

constexpr unsigned kRefusalsTold = 20; /* in a second */

/* How soon a peer is found out that is gone without a word: `idle` seconds of silence, then some probes. */
void set_keepalive(int fd, int idle, int interval, int count)
{
    const std::pair<int, int> settings[] = {
        {TCP_KEEPIDLE, idle}, {TCP_KEEPINTVL, interval}, {TCP_KEEPCNT, count}, {TCP_NODELAY, 1}};
    const int on = 1;
    const int unanswered = 120 * 1000; /* ms until bytes under way are given up */
    setsockopt(fd, SOL_SOCKET, SO_KEEPALIVE, &on, sizeof on);
    setsockopt(fd, IPPROTO_TCP, TCP_USER_TIMEOUT, &unanswered, sizeof unanswered);
    for (const auto &[name, value] : settings)
        setsockopt(fd, IPPROTO_TCP, name, &value, sizeof value);
}

device_about about(const message &announcement)
{
    const auto text = [&announcement](const char *name) {
        return tool_printable(announcement.text("ControlLink", name).substr(0, 64));
    };
    return {announcement.text("ControlLink", "imei"), text("projectName"), text("VersionInfo"), text("modem_msn")};
}

/* Takes a caller off the count of its address. */
struct caller_count {
    std::map<std::string, unsigned> &callers;
    const std::string &address;

    ~caller_count()
    {
        if (--callers[address] == 0)
            callers.erase(address);
    }
};

} // namespace

bool is_imei(const std::string &text)
{
    return !text.empty() && text.size() <= 32 &&
           std::ranges::all_of(text, [](unsigned char c) { return std::isalnum(c) != 0 || c == '-' || c == '_'; });
}

task<void> fleet::listen(asio::ip::tcp::acceptor listener)
{
    for (;;) {
        asio::error_code error;
        asio::ip::tcp::socket socket = co_await listener.async_accept(await_into(error));
        if (error == asio::error::operation_aborted)
            co_return;
        if (!error) {
            run_beside(server_.io, take_call(std::move(socket)));
            continue;
        }
        server_log("accept", {{"error", error.message()}}); /* no descriptor left, say: callers wait */
        asio::steady_timer pause(server_.io, 100ms);
        co_await pause.async_wait(await_into(error));
    }
}

task<void> fleet::take_call(frame_link::socket socket)
{
    set_keepalive(socket.native_handle(), 60, 10, 3);
    ssl_session session = server_.options.plain ? nullptr : server_.device_tls.session();
    const auto link = std::make_shared<frame_link>(std::move(socket), std::move(session));
    const std::string address = link->address();
    const caller_count counted{callers_, address};
    std::string why = "too many connections from its address";
    if (++callers_[address] <= server_.options.per_address)
        why = co_await serve_call(link, address);
    if (why.empty())
        co_return;
    link->end(why);
    refuse(address, why);
}

/* Tells of a caller that was refused; of some a second at most, as anybody can call. */
void fleet::refuse(const std::string &address, const std::string &why)
{
    ++server_.metrics.refused[why.substr(0, why.find(": "))]; /* what comes behind is the caller's */
    if (server_clock::now() - refusals_since_ > 1s) {
        if (refusals_ > kRefusalsTold)
            server_log("refused", {{"more", std::to_string(refusals_ - kRefusalsTold)}});
        refusals_since_ = server_clock::now();
        refusals_ = 0;
    }
    if (++refusals_ <= kRefusalsTold)
        server_log("refused", {{"address", address}, {"why", why}});
}

/* Serves a caller until its link ends; why it was not served, if so. */
task<std::string> fleet::serve_call(std::shared_ptr<frame_link> link, std::string address)
{
    link->limit(server_.options.announce_limit);
    const bool ready = co_await link->shake_hands();
    if (!ready)
        co_return link->why();
    server_.metrics.handshakes += link->session() != nullptr ? 1 : 0;
    const auto frame = co_await link->receive();
    if (!frame)
        co_return "it did not say who it is: " + link->why();
    link->unlimited();
    const message announcement(frame->control);
    if (announcement.msgid() == "10")
        co_return hand_over(link, announcement, address);
    if (announcement.msgid() != "9")
        co_return "it did not say who it is";
    co_return co_await serve_device(link, announcement, address);
}

/* Hands a data link over to the log that waits for it. A link is for the device that proves to be the same. */
std::string fleet::hand_over(const std::shared_ptr<frame_link> &link, const message &announcement,
                             const std::string &address)
{
    const auto device = find(announcement.text("DataLink", "imei"));
    const auto kind = log_kind_of_link(announcement.text("DataLink", "ConnectType"));
    const std::string identity = link->session() != nullptr ? peer_fingerprint(link->session()) : address;
    if (!device || !kind || device->identity != identity)
        return "it brings a stream of a device that it is not";
    return device->log(*kind).take(link) ? "" : "it brings a stream that nobody waits for";
}

task<std::string> fleet::serve_device(std::shared_ptr<frame_link> link, const message &announcement,
                                      std::string address)
{
    const device_about who = about(announcement);
    if (!is_imei(who.imei))
        co_return "its IMEI is none: " + tool_printable(who.imei.substr(0, 64));
    if (server_.options.imei_in_certificate && link->session() != nullptr && !peer_is_named(link->session(), who.imei))
        co_return "its certificate is for another: " + tool_printable(peer_name(link->session())) + ", not " + who.imei;
    const std::string identity = link->session() != nullptr ? peer_fingerprint(link->session()) : address;
    bool may_enter = true;
    if (server_.bus)
        may_enter = co_await server_.bus->may_take(who.imei, identity);
    const std::shared_ptr<device> older = find(who.imei);
    if (may_enter)
        may_enter = co_await may_replace(older, identity);
    if (!may_enter)
        co_return "another device is connected as this one: " + who.imei;
    const auto caller = device::make(server_, link, who, identity, address);
    enter(caller);
    co_await caller->serve();
    leave(caller);
    co_return "";
}

/* Whether a caller may take over from a device of the same IMEI, if there is one: when it proves to be the same one, or
 * when the older one turns out to be gone. */
task<bool> fleet::may_replace(std::shared_ptr<device> older, const std::string &identity)
{
    if (older == nullptr || older->identity == identity)
        co_return true;
    set_keepalive(older->link->fd(), 1, 2, 4);
    asio::steady_timer pause(server_.io);
    for (const auto end = server_clock::now() + kProbeMax; !older->link->ended() && server_clock::now() < end;) {
        asio::error_code cancelled;
        pause.expires_after(200ms);
        co_await pause.async_wait(await_into(cancelled));
    }
    if (!older->link->ended())
        set_keepalive(older->link->fd(), 60, 10, 3);
    co_return older->link->ended();
}

task<bool> fleet::give_up(std::string imei, std::string identity)
{
    const std::shared_ptr<device> held = find(imei);
    const bool may_go = co_await may_replace(held, identity);
    if (may_go && held)
        held->link->end("it has called another server");
    co_return may_go;
}

void fleet::enter(const std::shared_ptr<device> &device)
{
    const device_about &who = device->about;
    if (const auto older = find(who.imei))
        older->link->end("it has called again");
    devices_[who.imei] = device;
    if (server_.bus)
        server_.bus->called(*device);
    server_event(server_, "called",
                 {{"imei", who.imei},
                  {"address", device->address},
                  {"model", who.model},
                  {"software", who.software},
                  {"serial", who.serial}});
    for (const auto &watching : std::vector(watchers_))
        if (const auto told = watching.lock())
            (*told)(*device, true);
    for (const std::string &name : server_.options.streams)
        device->log(*log_kind_of(name)).keep();
}

void fleet::leave(const std::shared_ptr<device> &device)
{
    const auto entry = devices_.find(device->about.imei);
    if (entry != devices_.end() && entry->second == device) {
        devices_.erase(entry);
        if (server_.bus)
            server_.bus->left(*device);
    }
    server_event(server_, "left",
                 {{"imei", device->about.imei}, {"address", device->address}, {"why", device->link->why()}});
    for (const auto &watching : std::vector(watchers_))
        if (const auto told = watching.lock())
            (*told)(*device, false);
}

std::shared_ptr<device> fleet::find(const std::string &imei) const
{
    const auto entry = devices_.find(imei);
    return entry != devices_.end() && !entry->second->link->ended() ? entry->second : nullptr;
}

task<std::shared_ptr<device>> fleet::await(std::string imei, server_clock::time_point end,
                                           std::shared_ptr<wake_up> called)
{
    const auto watching = watch([called, &imei](const device &device, bool there) {
        if (there && device.about.imei == imei)
            called->set();
    });
    for (bool in_time = true; in_time && find(imei) == nullptr;) {
        called->reset();
        in_time = co_await called->wait(end);
    }
    co_return find(imei);
}

std::shared_ptr<fleet::watcher> fleet::watch(watcher who)
{
    std::erase_if(watchers_, [](const auto &watching) { return watching.expired(); });
    auto watching = std::make_shared<watcher>(std::move(who));
    watchers_.push_back(watching);
    return watching;
}

void fleet::end_all()
{
    for (const auto &[imei, device] : devices_)
        device->link->end("the server ends");
}

#include "server/bus.h"

#include "server/fleet.h"

#include <algorithm>

namespace
{

using namespace std::chrono_literals;

constexpr auto kGiveUpMax = 15s;        /* for another server to find out whether a device is still there */
constexpr auto kWhereMax = 2s;          /* for a server to say that it has a device */
constexpr auto kListMax = 2s;           /* for another server to tell of its devices */
constexpr auto kTurnMax = 60s;          /* for a command to begin */
constexpr unsigned kUnderWayMost = 100; /* commands for a device */
constexpr std::size_t kListAtOnce = 256 << 10;

/* The commands whose whole answer is one control text. */
bool is_short(const std::string &msgid)
{
    static const char *const kShort[] = {"3", "4", "5", "7", "8", "11"};
    return std::ranges::find(kShort, msgid) != std::end(kShort);
}

std::string failure(const std::string &msgid, const std::string &why)
{
    return tool_json({{"msgid", msgid}, {"Result", "Fail:" + why}});
}

} // namespace

std::unique_ptr<bus> bus::open(server &server, std::string &why)
{
    const server_options &options = server.options;
    const auto made = std::make_shared<bus *>(nullptr);
    nats_link::listener listener{
        [made](bool connected, const std::string &reason) { (*made)->changed(connected, reason); },
        [made](const std::string &subject, const std::string &id, const std::string &reason) {
            (*made)->spool_.kept(subject, id, reason);
        }};
    auto link = nats_link::open(server.io, {options.nats, server.name, options.nats_credentials, options.nats_ca},
                                std::move(listener), why);
    if (!link)
        return nullptr;
    std::unique_ptr<bus> opened(new bus(server, std::move(link)));
    *made = opened.get();
    if (!options.spool.empty() && !opened->spool_.open(why))
        return nullptr;
    opened->directory_.start();
    return opened;
}

bus::bus(server &server, std::unique_ptr<nats_link> link)
    : home_(server), link_(std::move(link)), directory_(server, *link_), spool_(server, *link_)
{
    questions_ = link_->subscribe("vex.server." + home_.name, "",
                                  [this](const nats_message &request) { run_beside(home_.io, answer(request)); });
}

void bus::changed(bool connected, const std::string &why)
{
    if (connected)
        server_log("the bus is there", {});
    else
        server_log("the bus is away", {{"why", why}});
    directory_.set_connected(connected);
    if (!home_.options.spool.empty())
        spool_.set_connected(connected);
}

/* Asks whoever takes the device's commands. That knows better than a bucket, which a node answers for that may be behind;
 * and where no server has the device, NATS says so at once. */
task<bus::place> bus::place_of(std::string imei)
{
    if (commands_.contains(imei) || !is_imei(imei))
        co_return place();
    const auto reply = co_await link_->request("vex.command." + imei, R"({"msgid":"where"})", kWhereMax);
    const message answer(reply.value_or(""));
    co_return place{answer.text("server"), answer.text("tools")};
}

task<bool> bus::may_take(std::string imei, std::string identity)
{
    const place other = co_await place_of(imei);
    if (other.server.empty())
        co_return true;
    const std::string question = tool_json({{"ask", "give up"}, {"imei", imei}, {"identity", identity}});
    const auto reply = co_await link_->request("vex.server." + other.server, question, kGiveUpMax);
    co_return !reply || message(*reply).text("Result") == "Success";
}

void bus::called(const device &device)
{
    const std::string &imei = device.about.imei;
    directory_.enter(imei, device.since);
    std::shared_ptr<nats_subscription> &commands = commands_[imei];
    if (!commands)
        commands = link_->subscribe("vex.command." + imei, "vex", [this, imei](const nats_message &request) {
            run_beside(home_.io, carry_out(request, imei));
        });
}

void bus::left(const device &device)
{
    directory_.leave(device.about.imei);
    commands_.erase(device.about.imei);
}

task<std::string> bus::find(std::string imei)
{
    const place other = co_await place_of(imei);
    co_return other.tools;
}

/* The devices of one other server; false when it does not answer. */
task<bool> bus::list_server(std::string name, std::string &lines)
{
    for (std::string after;;) {
        const std::string question = tool_json({{"ask", "devices"}, {"after", after}});
        const auto part = co_await link_->request("vex.server." + name, question, kListMax);
        if (!part || part->empty())
            co_return part.has_value();
        lines += *part;
        const std::size_t last = part->size() > 1 ? part->rfind('\n', part->size() - 2) + 1 : 0;
        const std::string next = message(std::string_view(*part).substr(last)).text("imei");
        if (next <= after)
            co_return false;
        after = next;
    }
}

task<std::string> bus::list(std::string &missing)
{
    std::string lines;
    const auto others = co_await directory_.others();
    if (!others)
        missing = "of other servers, as the bus does not answer";
    for (const std::string &name : others.value_or(std::vector<std::string>())) {
        const bool answers = co_await list_server(name, lines);
        if (!answers)
            missing = "of server " + name + ", which does not answer";
    }
    co_return lines;
}

/* The next of the devices that are here. */
std::string bus::list_after(const std::string &imei) const
{
    std::string lines;
    const auto &all = home_.devices->all();
    for (auto device = all.upper_bound(imei); device != all.end() && lines.size() < kListAtOnce; ++device)
        lines += device->second->describe("there") + '\n';
    return lines;
}

/* Answers another server. */
task<void> bus::answer(nats_message request)
{
    const message question(request.data);
    std::string reply = R"({"Result":"Fail:unknown question"})";
    if (question.text("ask") == "devices") {
        reply = list_after(question.text("after"));
    } else if (question.text("ask") == "give up") {
        const bool given_up = co_await home_.devices->give_up(question.text("imei"), question.text("identity"));
        reply = given_up ? R"({"Result":"Success"})" : R"({"Result":"Fail:it is here"})";
    }
    link_->publish(request.reply, reply);
}

void bus::tell(const std::string &imei, const std::string &event)
{
    link_->publish("vex.event." + imei, event);
}

std::shared_ptr<nats_subscription> bus::watch(std::function<void(const std::string &event)> told)
{
    return link_->subscribe("vex.event.*", "", [told = std::move(told), own = home_.name](const nats_message &event) {
        const message what(event.data);
        const bool comes_or_goes = what.text("event") == "called" || what.text("event") == "left";
        if (comes_or_goes && what.text("server") != own)
            told(event.data);
    });
}

/* Has a command carried out that has come over the bus, and answers it. */
task<void> bus::carry_out(nats_message request, std::string imei)
{
    const std::string msgid = message(request.data).msgid();
    if (msgid == "where") {
        link_->publish(request.reply,
                       tool_json({{"msgid", msgid}, {"server", home_.name}, {"tools", home_.tools_address}}));
        co_return;
    }
    if (under_way_[imei] >= kUnderWayMost) {
        link_->publish(request.reply, failure(msgid, "too many commands wait for the device"));
        co_return;
    }
    ++under_way_[imei];
    const std::string reply = co_await command(imei, request.data);
    link_->publish(request.reply, reply);
    if (--under_way_[imei] == 0)
        under_way_.erase(imei);
}

/* What comes of a command. */
task<std::string> bus::command(std::string imei, std::string control)
{
    const std::string msgid = message(control).msgid();
    if (!is_short(msgid) || control.size() > kPkgControlMax)
        co_return failure(msgid, "this is no short command");
    const std::shared_ptr<device> device = home_.devices->find(imei);
    if (!device)
        co_return failure(msgid, "the device has hung up");
    const auto turn = std::make_shared<wake_up>(home_.io);
    const bool mine = co_await device->take_turn("the bus", turn, server_clock::now() + kTurnMax);
    if (!mine)
        co_return failure(msgid, device->link->ended() ? "the device has hung up" : "the device is at work for others");
    const std::optional<std::string> reply = co_await device->ask(control);
    device->give_turn();
    co_return reply ? *reply : failure(msgid, "the device has hung up");
}

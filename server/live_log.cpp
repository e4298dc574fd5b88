#include "server/live_log.h"

#include "server/bus.h"
#include "server/device.h"
#include "server/store.h"

#include <algorithm>

namespace
{

using namespace std::chrono_literals;

constexpr auto kCallMax = 60s; /* for the data link to come */
constexpr auto kEndMax = 10s;  /* for a log to end that was told to */
constexpr auto kRetryMin = 1s; /* before a log that the store follows is begun again */
constexpr auto kRetryMax = 60s;
constexpr std::size_t kQueueMax = 4 << 20; /* bytes that wait for a tool */

struct kind_names {
    const char *name;
    const char *connect_type;
};
constexpr kind_names kNames[kLogKinds] = {{"syslog", "syslog_connect"}, {"qxdm", "modemlog_connect"}};

std::uint64_t lines_in(std::string_view bytes)
{
    std::uint64_t lines = 0;
    for (std::size_t at = 0; (at = bytes.find('\n', at)) != bytes.npos; ++at)
        ++lines;
    return lines;
}

/* Tells a tool that its log has ended, as it wanted or else why. */
std::string last_frame(const std::string &why)
{
    return make_frame(tool_json({{"msgid", "stream"}, {"Result", why.empty() ? "Success" : "Fail:" + why}}));
}

/* The request by which a log begins or ends, and the confirmation of its data link. */
std::string request(log_kind kind, const char *action, const std::string &address, const std::string &port)
{
    return tool_command("6", "realtimeLog",
                        {{"LogType", log_name(kind)}, {"Action", action}, {"ip", address}, {"port", port}});
}

std::string confirmation(log_kind kind, const std::string &imei)
{
    return make_frame(tool_command("10", "DataLink", {{"imei", imei}, {"ConnectType", log_connect_type(kind)}}));
}

template <class Member> std::optional<log_kind> find_kind(Member member, std::string_view text)
{
    for (std::size_t kind = 0; kind < kLogKinds; ++kind)
        if (text == kNames[kind].*member)
            return static_cast<log_kind>(kind);
    return std::nullopt;
}

} // namespace

const char *log_name(log_kind kind)
{
    return kNames[static_cast<std::size_t>(kind)].name;
}

const char *log_connect_type(log_kind kind)
{
    return kNames[static_cast<std::size_t>(kind)].connect_type;
}

std::optional<log_kind> log_kind_of(std::string_view name)
{
    return find_kind(&kind_names::name, name);
}

std::optional<log_kind> log_kind_of_link(std::string_view connect_type)
{
    return find_kind(&kind_names::connect_type, connect_type);
}

void log_follower::push(std::string_view bytes)
{
    if (ended_)
        return;
    if (queued_ + bytes.size() > kQueueMax) {
        missed_ += bytes.size();
        return;
    }
    if (missed_ > 0) {
        queue_.push_back(make_frame(tool_json({{"msgid", "stream"}, {"missed", std::to_string(missed_)}})));
        missed_ = 0;
    }
    while (!bytes.empty()) {
        const std::string_view piece = bytes.substr(0, kPkgDataMax);
        queue_.push_back(make_frame(R"({"msgid":"stream"})", piece));
        bytes.remove_prefix(piece.size());
        queued_ += queue_.back().size();
    }
    more_.set();
}

void log_follower::end(const std::string &reason)
{
    if (ended_)
        return;
    ended_ = true;
    why = reason;
    started.set();
    more_.set();
}

task<void> log_follower::pass_on()
{
    while (!tool_->ended()) {
        while (!queue_.empty()) {
            const std::string frame = std::move(queue_.front());
            queue_.pop_front();
            queued_ -= std::min(queued_, frame.size());
            const bool sent = co_await tool_->send(frame);
            if (!sent)
                co_return;
        }
        if (ended_) {
            const std::string last = last_frame(why);
            co_await tool_->send(last);
            co_return;
        }
        more_.reset();
        co_await more_.wait();
    }
}

live_log::live_log(device &device, log_kind kind)
    : device_(device.weak_from_this()), io_(device.home.io), kind_(kind), called_(io_), left_(io_)
{
}

live_log::~live_log() = default;

bool live_log::wanted() const
{
    const auto device = device_.lock();
    return device && !device->link->ended() &&
           (!stored_.empty() || std::ranges::any_of(followers_, [](const auto &follower) { return follower->wanted; }));
}

void live_log::join(const std::shared_ptr<log_follower> &follower)
{
    followers_.push_back(follower);
    if (!reply_.empty() && !stopping_) {
        follower->reply = reply_;
        follower->started.set();
    }
    if (!running_)
        run_beside(io_, run());
}

void live_log::leave(const std::shared_ptr<log_follower> &follower)
{
    follower->wanted = false;
    if (wanted() || !running_) {
        std::erase(followers_, follower);
        follower->end("");
    } else if (link_) {
        run_beside(io_, stop());
    }
}

void live_log::keep()
{
    const auto device = device_.lock();
    const std::string &imei = device->about.imei;
    if (device->home.store)
        stored_.push_back(device->home.store->follow(imei, kind_));
    if (!device->home.options.spool.empty())
        stored_.push_back(device->home.bus->follow(imei, kind_));
    if (!running_)
        run_beside(io_, run());
}

bool live_log::take(const std::shared_ptr<frame_link> &link)
{
    if (!expecting_)
        return false;
    expecting_ = false;
    link_ = link;
    called_.set();
    return true;
}

void live_log::device_left()
{
    if (link_)
        link_->end("the device has hung up");
    called_.set();
    left_.set();
}

void live_log::tell_started(const std::string &reply)
{
    reply_ = reply;
    for (const auto &follower : followers_) {
        follower->reply = reply;
        follower->started.set();
    }
    for (const auto &stored : stored_)
        stored->resumed(this);
}

/* Ends those who follow; or only those who followed a log that had begun, as the others wait for the next one. */
void live_log::tell_ended(const std::string &why, bool to_all)
{
    const auto staying = std::partition(followers_.begin(), followers_.end(), [to_all](const auto &follower) {
        return to_all || follower->started.is_set() || !follower->wanted;
    });
    for (auto follower = followers_.begin(); follower != staying; ++follower)
        (*follower)->end((*follower)->wanted ? why : "");
    followers_.erase(followers_.begin(), staying);
    for (const auto &stored : stored_)
        stored->interrupted(this, why);
}

/* Runs the log for as long as somebody wants it. */
task<void> live_log::run()
{
    const auto alive = shared_from_this();
    running_ = true;
    for (server_clock::duration pause = kRetryMin; wanted();
         pause = std::min<server_clock::duration>(2 * pause, kRetryMax)) {
        std::string why = co_await begin();
        const bool begun = why.empty();
        if (begun) {
            pause = kRetryMin;
            co_await relay();
            why = link_->why().empty() ? "the device has ended the stream" : link_->why();
        }
        link_.reset();
        reply_.clear();
        stopping_ = false;
        tell_ended(why, !begun);
        if (wanted()) {
            co_await left_.wait(server_clock::now() + pause);
        }
    }
    running_ = false;
    tell_ended("the device has hung up", true);
}

/* Has the device start the log and takes its data link; why it does not, or nothing. */
task<std::string> live_log::begin()
{
    const auto device = device_.lock();
    const server &home = device->home;
    const std::string start = request(kind_, "start", device->called_address(), home.port);
    const bool mine = co_await device->take_turn("stream", std::make_shared<wake_up>(io_));
    if (!mine)
        co_return "the device has hung up";
    called_.reset();
    expecting_ = true;
    const std::optional<std::string> reply = co_await device->ask(start);
    device->give_turn();
    if (!reply)
        co_return "the device did not answer";
    if (const tool_answer answer = tool_read_answer(*reply, "6"); answer.verdict != tool_verdict::success)
        co_return "the device " + answer.reason;
    co_await called_.wait(server_clock::now() + kCallMax);
    if (!link_) {
        expecting_ = false;
        co_return device->link->ended() ? "the device has hung up"
                                        : "the device did not call for its stream. Can it reach " +
                                              device->called_address() + " port " + home.port + "?";
    }
    const std::string confirmed = confirmation(kind_, device->about.imei);
    co_await link_->send(confirmed);
    tell_started(*reply);
    co_return "";
}

task<void> live_log::relay()
{
    const auto device = device_.lock();
    if (!wanted())
        run_beside(io_, stop());
    for (;;) {
        const std::string_view bytes = co_await link_->read();
        if (bytes.empty())
            co_return;
        device->home.metrics.log_bytes += bytes.size();
        if (kind_ == log_kind::syslog)
            device->home.metrics.log_lines += lines_in(bytes);
        for (const auto &follower : followers_)
            follower->push(bytes);
        for (const auto &stored : stored_)
            stored->append(bytes);
    }
}

/* Has the device end the log, which ends the link, unless it is wanted again by then. */
task<void> live_log::stop()
{
    const auto alive = shared_from_this();
    const auto device = device_.lock();
    const auto link = link_;
    if (!device || !link)
        co_return;
    const bool mine = co_await device->take_turn("stream", std::make_shared<wake_up>(io_));
    if (!mine)
        co_return;
    if (!wanted() && link == link_ && !link->ended()) {
        stopping_ = true;
        link->limit(kEndMax);
        const std::string end = request(kind_, "end", "", "0");
        co_await device->ask(end);
    }
    device->give_turn();
}

#include "server/device.h"

#include "server/fleet.h"
#include "server/stored_log.h"

#include <algorithm>
#include <asio/experimental/awaitable_operators.hpp>
#include <charconv>

using namespace asio::experimental::awaitable_operators;

namespace
{

using namespace std::chrono_literals;

constexpr auto kFrameMax = 60s;              /* from one part of a frame to the next */
constexpr auto kAbandonedMax = 600s;         /* for the answer to a command whose tool is gone: others wait behind it */
constexpr std::size_t kAheadMax = 128 << 10; /* bytes that a tool may send before its command is answered */

/* What a device answers at all. */
bool is_answered(const std::string &msgid)
{
    static const char *const kAnswered[] = {"1", "2", "3", "4", "5", "6", "7", "8", "11"};
    return std::ranges::find(kAnswered, msgid) != std::end(kAnswered);
}

/* Whether a frame ends the answer to a command: an archive's are many. */
bool is_last(device_command &command, const frame_view &frame)
{
    if (command.msgid != "2" || frame.control.empty())
        return true;
    const message reply(frame.control);
    const std::string total = reply.text("GetLocalLog", "totalLength");
    std::uint64_t wanted = 0;
    std::from_chars(total.data(), total.data() + total.size(), wanted);
    command.archived += frame.data.size();
    return reply.text("Result") != "Success" || command.archived >= wanted;
}

/* Reads ahead while a command is under way, to learn that its tool has gone. */
task<void> watch(std::shared_ptr<frame_link> tool, std::shared_ptr<device_command> command)
{
    for (bool more = true; more && !command->done.is_set() && tool->held() <= kAheadMax;)
        more = co_await tool->fill();
    if (!tool->ended() || command->done.is_set())
        co_return;
    command->tool.reset();
    if (is_answered(command->msgid))
        command->done.wait_no_longer_than(server_clock::now() + kAbandonedMax);
    else
        command->done.set();
}

task<void> await_answer(std::shared_ptr<frame_link> tool, std::shared_ptr<device_command> command)
{
    co_await command->done.wait();
    tool->stop_waiting();
}

} // namespace

device::device(server &server, std::shared_ptr<frame_link> control, device_about who, std::string mark,
               std::string from)
    : home(server), link(std::move(control)), about(std::move(who)), identity(std::move(mark)),
      address(std::move(from)), since(std::time(nullptr))
{
}

std::shared_ptr<device> device::make(server &server, std::shared_ptr<frame_link> link, device_about about,
                                     std::string identity, std::string address)
{
    std::shared_ptr<device> made(
        new device(server, std::move(link), std::move(about), std::move(identity), std::move(address)));
    for (std::size_t kind = 0; kind < kLogKinds; ++kind)
        made->logs_[kind] = std::make_shared<live_log>(*made, static_cast<log_kind>(kind));
    return made;
}

task<void> device::serve()
{
    const auto alive = shared_from_this();
    for (;;) {
        const std::optional<frame_view> frame = link->take();
        if (frame) {
            co_await take_reply(*frame);
            continue;
        }
        if (link->held() > 0)
            link->limit(kFrameMax);
        else
            link->unlimited();
        const bool more = co_await link->fill();
        if (!more)
            break;
    }
    if (current_)
        current_->done.set();
    for (const auto &waiting : queue_)
        waiting->set();
    for (const auto &log : logs_)
        log->device_left();
}

/* Passes a frame on to whoever waits for it. */
task<void> device::take_reply(const frame_view &frame)
{
    const auto command = current_;
    if (!command || command->done.is_set() ||
        (!frame.control.empty() && message(frame.control).msgid() != command->msgid)) {
        if (!has_spoken_unasked_)
            server_log("unasked", {{"imei", about.imei}, {"text", std::string(frame.control.substr(0, 200))}});
        has_spoken_unasked_ = true;
        co_return;
    }
    command->reply = frame.control;
    const bool last = is_last(*command, frame);
    if (command->kept)
        command->kept->append(frame.data);
    if (command->kept && last && message(command->reply).text("Result") == "Success")
        command->kept->finish();
    const auto tool = command->tool;
    if (tool != nullptr) {
        const bool sent = co_await tool->send(frame.bytes);
        if (!sent)
            command->tool.reset();
    }
    if (last)
        command->done.set();
    else if (!command->tool)
        command->done.wait_no_longer_than(server_clock::now() + kAbandonedMax);
}

std::string device::at_work() const
{
    return holder_ + (current_ ? " with command " + current_->msgid : "");
}

task<bool> device::take_turn(std::string who, std::shared_ptr<wake_up> turn, server_clock::time_point end)
{
    const auto alive = shared_from_this();
    bool mine = !busy_;
    if (busy_) {
        queue_.push_back(turn);
        mine = co_await turn->wait(end);
        queue_.remove(turn);
    }
    if (!mine || link->ended())
        co_return false;
    busy_ = true;
    holder_ = who;
    co_return true;
}

void device::give_turn()
{
    holder_.clear();
    busy_ = !queue_.empty();
    if (busy_) {
        queue_.front()->set();
        queue_.pop_front();
    }
}

task<bool> device::run(const std::shared_ptr<device_command> &command, std::span<const unsigned char> frame)
{
    const auto alive = shared_from_this();
    const auto begun = server_clock::now();
    current_ = command;
    const bool sent = co_await link->send(frame);
    const auto tool = command->tool;
    if (sent && tool != nullptr) {
        co_await (await_answer(tool, command) && watch(tool, command));
    } else if (sent) {
        co_await command->done.wait(begun + kAbandonedMax);
    }
    if (!command->done.is_set())
        link->end("it does not answer"); /* what it would say later must not be taken for another answer */
    current_.reset();
    note_end(*command, begun);
    co_return !link->ended();
}

void device::note_end(const device_command &command, server_clock::time_point begun)
{
    const std::chrono::duration<double> took = server_clock::now() - begun;
    const message reply(command.reply);
    const std::string result = reply.text("Result");
    ++home.metrics.commands[command.msgid.size() < 3 ? command.msgid : "?"];
    home.metrics.command_seconds += took.count();
    if (result != "Success")
        ++home.metrics.commands_failed;
    last_command = command.msgid + ' ' + (result.empty() ? "no answer" : result);
    server_event(home, "command",
                 {{"imei", about.imei},
                  {"msgid", command.msgid},
                  {"who", holder_},
                  {"result", result},
                  {"seconds", std::to_string(took.count())}});
}

task<std::optional<std::string>> device::ask(std::string control)
{
    const auto command = std::make_shared<device_command>(home.io, message(control).msgid(), nullptr);
    const std::string frame = make_frame(control);
    const bool answered =
        co_await run(command, std::span(reinterpret_cast<const unsigned char *>(frame.data()), frame.size()));
    co_return answered ? std::optional{command->reply} : std::nullopt;
}

std::string device::describe(const char *event) const
{
    std::string streams;
    for (std::size_t kind = 0; kind < kLogKinds; ++kind)
        if (logs_[kind]->running())
            streams += (streams.empty() ? "" : ",") + std::string(log_name(static_cast<log_kind>(kind)));
    return tool_json({{"event", event},
                      {"imei", about.imei},
                      {"model", about.model},
                      {"software", about.software},
                      {"serial", about.serial},
                      {"address", address},
                      {"since", utc_text("%Y-%m-%dT%H:%M:%SZ", since)},
                      {"streams", streams},
                      {"last", last_command},
                      {"server", home.name}});
}

std::string device::called_address() const
{
    return home.options.advertise.empty() ? link->own_address() : home.options.advertise;
}

#include "soak/servers.h"

#include "tests/daemon.h"

#include <poll.h>

namespace
{

constexpr std::size_t kLinksMax = 4;

soak_command end_of(const char *log_type)
{
    return {"6",
            R"({"msgid":"6","realtimeLog":{"LogType":")" + std::string(log_type) +
                R"(","Action":"end","ip":"","port":""}})",
            ""};
}

} // namespace

random_server::random_server(const tool_listener &listener, dice chance, soak_tally &tally)
    : listener_(listener), chance_(chance), tally_(tally)
{
}

bool random_server::is_called(tool_clock::time_point end)
{
    while (!control_ && tool_clock::now() < end)
        take_call();
    return control_.has_value();
}

void random_server::serve(tool_clock::time_point end)
{
    while (tool_clock::now() < end && !testing::Test::HasFailure()) {
        take_call();
        if (!links_.empty() && chance_.one_in(2))
            use_link();
        if (!command())
            break;
    }
}

daemon_says random_server::calm(int milliseconds)
{
    links_.clear();
    const bool said = control_->say(end_of("syslog")) && control_->say(end_of("qxdm"));
    return said ? control_->answer(milliseconds) : daemon_says::goodbye;
}

/* Takes a call that is there, or treats it badly. */
void random_server::take_call()
{
    pollfd entry{listener_.fd.get(), POLLIN, 0};
    if (poll(&entry, 1, chance_.below(20)) != 1)
        return;
    if (control_ && chance_.one_in(6)) { /* not what the caller expects */
        const unique_fd fd{accept4(listener_.fd.get(), nullptr, nullptr, SOCK_CLOEXEC)};
        const std::string words = chance_.bytes(chance_.below(300));
        ::send(fd.get(), words.data(), words.size(), MSG_NOSIGNAL);
        ++tally_.broken;
        return;
    }
    std::string why;
    std::optional<tool_call> call = tool_take_call(listener_, {}, tool_clock::now() + std::chrono::seconds(3), why);
    if (!call)
        return;
    soak_peer peer{std::move(call->link), tally_};
    if (!control_) {
        EXPECT_EQ("9", call->msgid);
        control_.emplace(std::move(peer));
        return;
    }
    EXPECT_EQ("10", call->msgid);
    const std::string type = tool_announced(*call, "DataLink", "ConnectType");
    if (!chance_.one_in(4))
        peer.say(
            {nullptr, R"({"msgid":"10","DataLink":{"imei":"356938035643809","ConnectType":")" + type + "\"}}", ""});
    links_.push_back(std::move(peer));
}

/* Does something with one of the data links, which bring bytes and take nothing but a confirmation. */
void random_server::use_link()
{
    const int which = chance_.below(static_cast<int>(links_.size()));
    soak_peer &link = links_[static_cast<std::size_t>(which)];
    bool there = true;
    switch (chance_.below(8)) {
    case 0:
        link.reset();
        there = false;
        break;
    case 1:
        control_->expect_anything(); /* a command that comes this way is answered that way */
        there = link.say(random_nonsense(chance_));
        break;
    default:
        for (int i = chance_.below(30); i > 0 && there; --i)
            there = link.take_bytes(10);
    }
    if (!there || links_.size() > kLinksMax)
        links_.erase(links_.begin() + which);
}

/* Says something on the control link; false when that has come to its end. */
bool random_server::command()
{
    if (chance_.one_in(60))
        return control_->say(random_nonsense(chance_)) && control_->listen(20);
    return control_->say(random_command(chance_, listener_.port)) && control_->listen(chance_.below(150));
}

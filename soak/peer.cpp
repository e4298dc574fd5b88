#include "soak/peer.h"

#include "tests/frame.h"

#include <gtest/gtest.h>
#include <openssl/err.h>
#include <poll.h>

namespace
{

constexpr std::size_t kControlMax = 2048;
constexpr std::size_t kDataMax = 61440;
constexpr int kSendPatience = 50; /* milliseconds; a daemon at work takes nothing for longer */

std::size_t number(const std::string &bytes, std::size_t at)
{
    std::size_t n = 0;
    for (std::size_t i = at; i < at + 4; ++i)
        n = n << 8 | static_cast<unsigned char>(bytes[i]);
    return n;
}

} // namespace

soak_peer::soak_peer(tool_link to, soak_tally &tally) : link(std::move(to)), tally_(&tally)
{
    ++tally_->connections;
}

bool soak_peer::say(const soak_command &command)
{
    ++tally_->commands;
    if (command.msgid != nullptr)
        asked_.push_back(command.msgid);
    return write(frame(command.control, command.data));
}

bool soak_peer::say(const std::string &bytes)
{
    ++tally_->broken;
    orderly_ = in_step_ = false;
    return write(bytes);
}

bool soak_peer::listen(int milliseconds)
{
    const auto end = tool_clock::now() + std::chrono::milliseconds(milliseconds);
    while (orderly_ ? !asked_.empty() || last_ == "2" : true) {
        if (take_frame())
            continue;
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - tool_clock::now()).count();
        if (left <= 0)
            break;
        if (!read(static_cast<int>(left), held_))
            return false;
    }
    return true;
}

daemon_says soak_peer::answer(int milliseconds)
{
    constexpr char kName[] = "nobody-else-asks-for-me";
    const auto end = tool_clock::now() + std::chrono::milliseconds(milliseconds);
    if (!in_step_ || !say({"8", std::string(R"({"msgid":"8","bsp":{"level":"","module_name":")") + kName + "\"}}", ""}))
        return daemon_says::goodbye;
    while (said_.find(kName) == std::string::npos) {
        if (take_frame())
            continue;
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - tool_clock::now()).count();
        if (left <= 0)
            return daemon_says::nothing;
        if (!read(static_cast<int>(left), held_))
            return daemon_says::goodbye;
    }
    return daemon_says::a_reply;
}

bool soak_peer::take_bytes(int milliseconds)
{
    std::string taken;
    const bool there = read(milliseconds, taken);
    EXPECT_EQ(std::string::npos, taken.find("{\"msgid\":\""))
        << "a reply came on a data link: " << taken.substr(0, 300);
    return there;
}

void soak_peer::reset()
{
    const linger hard{1, 0};
    setsockopt(link.fd.get(), SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
    link.fd.reset();
    ++tally_->broken;
}

bool soak_peer::write(const std::string &bytes)
{
    for (std::size_t sent = 0; sent < bytes.size();) {
        short wanted = POLLOUT;
        ssize_t n = 0;
        if (link.session) {
            ERR_clear_error();
            n = tool_tls_result(
                link.session.get(),
                SSL_write(link.session.get(), bytes.data() + sent, static_cast<int>(bytes.size() - sent)), wanted);
        } else {
            n = ::send(link.fd.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL | MSG_DONTWAIT);
        }
        pollfd entry{link.fd.get(), wanted, 0};
        if (n > 0)
            sent += static_cast<std::size_t>(n);
        else if (n == 0 || errno != EAGAIN || poll(&entry, 1, kSendPatience) != 1)
            return in_step_ = false;
    }
    return true;
}

bool soak_peer::read(int milliseconds, std::string &into)
{
    unsigned char piece[65536];
    short wanted = POLLIN;
    ssize_t n = tool_read_some(link, piece, wanted);
    pollfd entry{link.fd.get(), wanted, 0};
    if (n < 0 && errno == EAGAIN && poll(&entry, 1, milliseconds) == 1)
        n = tool_read_some(link, piece, wanted);
    if (n > 0)
        into.append(reinterpret_cast<const char *>(piece), static_cast<std::size_t>(n));
    return n > 0 || (n < 0 && errno == EAGAIN);
}

bool soak_peer::take_frame()
{
    EXPECT_EQ(std::string("#~").substr(0, held_.size()), held_.substr(0, 2));
    if (held_.size() < 10)
        return false;
    const std::size_t control_len = number(held_, 2);
    EXPECT_LE(control_len, kControlMax);
    if (held_.size() < control_len + 10)
        return false;
    const std::size_t data_len = number(held_, control_len + 6);
    EXPECT_LT(data_len, kDataMax);
    const std::size_t len = control_len + data_len + 12;
    if (held_.size() < len)
        return false;
    EXPECT_EQ("~#", held_.substr(len - 2, 2));
    judge(held_.substr(6, control_len), data_len);
    held_.erase(0, len);
    return true;
}

void soak_peer::judge(const std::string &control, std::size_t data_len)
{
    constexpr char kBegin[] = "{\"msgid\":\"";
    constexpr char kEnd[] = "\"}";
    ++tally_->replies;
    said_ = control;
    std::string msgid = "6"; /* only a live log without sense gets an empty text */
    if (!control.empty()) {
        EXPECT_TRUE(control.starts_with(kBegin) && control.ends_with(kEnd)) << control;
        EXPECT_NE(std::string::npos, control.rfind("\"Result\":\"")) << control;
        msgid = control.substr(sizeof kBegin - 1, control.find('"', sizeof kBegin - 1) - (sizeof kBegin - 1));
    }
    EXPECT_TRUE(data_len == 0 || msgid == "2") << "only an archive has data: " << control;
    if (!orderly_ || (msgid == "2" && last_ == "2"))
        return;
    while (!asked_.empty() && asked_.front() != msgid)
        asked_.pop_front();
    EXPECT_FALSE(asked_.empty()) << "nobody asked here for " << control;
    if (!asked_.empty())
        asked_.pop_front();
    last_ = msgid;
}

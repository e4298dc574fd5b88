#include "platform/unique_fd.h"
#include "protocol/log_pkg_codec.h"
#include "protocol/log_pkg_send.h"
#include "tests/frame.h"
#include "tests/memory_platform.h"

#include <gtest/gtest.h>
#include <memory>
#include <sys/socket.h>
#include <tuple>
#include <vector>

namespace
{

class Codec : public testing::Test
{
protected:
    int decode(const std::string &frame)
    {
        g_platform = {};
        log_msg_clear(msg_.get());
        return log_decode_msg(bytes(frame), frame.size(), msg_.get());
    }
    /* What sending comes to, and whether no more than the given frame was sent. */
    int send(const std::string &control, const std::string &data, const std::string &frame = "")
    {
        g_platform = {};
        int ends[2];
        EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
        const unique_fd sender{ends[0]}, receiver{ends[1]};
        const int result =
            log_send_pkg_msg(ends[0], nullptr, control.c_str(), data.data(), static_cast<int>(data.size()));
        std::string got(70000, '?');
        const ssize_t n = recv(ends[1], got.data(), got.size(), MSG_DONTWAIT);
        EXPECT_TRUE(frame == got.substr(0, n > 0 ? static_cast<std::size_t>(n) : 0));
        return result;
    }

    std::unique_ptr<log_msg> msg_ = std::make_unique<log_msg>();
};

TEST_F(Codec, RefusesWhatIsNoFrame)
{
    const std::string good("#~\0\0\0\2{}\0\0\0\4data~#", 18);
    EXPECT_EQ(good, frame("{}", "data"));
    const auto patched = [&good](std::size_t at, const std::string &with) {
        return std::string(good).replace(at, with.size(), with);
    };
    for (const auto &[bytes_of_frame, result, line] : {
             std::tuple{good, 0, "log_msg->tailTag=~#$"},
             {frame(std::string(2048, 'c'), std::string(61439, 'd')), 0, "log_msg->tailTag=~#$"},
             {std::string(), 1, "log_decode_msg enter$"},
             {good.substr(0, 11), 1, "log_decode_fill_msg error:wrong para$"},
             {frame(std::string(2049, 'c')), 1, "log_decode_fill_msg error control len = 2049$"},
             {patched(2, "\xff\xff\xff\xff"), 1, "log_decode_fill_msg error control len = -1$"},
             {patched(2, big_endian(9)), 1, "log_decode_fill_msg error controlLen =9$"},
             {patched(8, big_endian(5)), 1, "log_decode_fill_msg error dataLen =5$"},
             {patched(8, "\xff\xff\xff\xff"), 1, "log_decode_fill_msg error dataLen =-1$"},
             {frame("", std::string(61440, 'd')), 1, "log_decode_fill_msg error dataLen =61440$"},
             {good + "x", 1, "log_decode_fill_msg:error index 18 != len 19$"},
             {patched(0, "~#"), 2, "log_decode_fill_msg:log_msg->tailTag=~#$"},
             {patched(16, "#~"), 3, "log_decode_fill_msg:log_msg->tailTag=#~$"},
         }) {
        EXPECT_EQ(result, decode(bytes_of_frame)) << line;
        EXPECT_TRUE(g_platform.log.ends_with(line + std::string("|"))) << line;
    }
}

TEST_F(Codec, SendsOneWholeFrameOrNothing)
{
    const std::string control(2048, 'c'), data(61440, 'd');
    EXPECT_EQ(0, send("{}", "", frame("{}")));
    EXPECT_EQ("6 log_pkg_codec log_encode_pkg_buf enter$|6 log_pkg_codec log_send_pkg_msg: send pkg success$|",
              g_platform.log);
    EXPECT_EQ(0, send(control, data, frame(control, data)));
    EXPECT_EQ(-1, send(control + 'c', data));
    EXPECT_EQ("6 log_pkg_codec log_encode_fill_msg: controlLen=2049 error$|6 log_pkg_codec log_send_pkg_msg: encode "
              "log msg fail$|",
              g_platform.log);
    EXPECT_EQ(-1, send("", data + 'd'));
    EXPECT_TRUE(g_platform.logged("6 log_pkg_codec log_encode_fill_msg: dataLen=61441 error$|"));
    EXPECT_EQ(-1, log_send_pkg_msg(-1, nullptr, "{}", "", 0));
    EXPECT_EQ(-1, log_send_pkg_msg(0, nullptr, "{}", nullptr, 0));
    std::vector<unsigned char> out(63504);
    std::int32_t len = 63503;
    log_msg_clear(msg_.get());
    EXPECT_EQ(1, log_encode_pkg_buf(out.data(), &len, msg_.get()));
    EXPECT_TRUE(g_platform.logged("log_encode_pkg_buf: sendLen=63503 fail$"));
    EXPECT_EQ(0, log_encode_pkg_buf(out.data(), &++len, msg_.get()));
}

} // namespace

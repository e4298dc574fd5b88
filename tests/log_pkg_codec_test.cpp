#include "protocol/log_pkg_codec.h"
#include "protocol/log_pkg_send.h"
#include "tests/frame.h"
#include "tests/memory_platform.h"

#include <csignal>
#include <cstring>
#include <gtest/gtest.h>
#include <sys/socket.h>

namespace
{

class Codec : public testing::Test
{
protected:
    void SetUp() override
    {
        g_platform = {};
        std::memset(msg_.get(), 0x55, sizeof *msg_);
    }

    int decode(const std::string &frame)
    {
        log_msg_clear(msg_.get());
        return log_decode_msg(bytes(frame), frame.size(), msg_.get());
    }

    /* Encodes through the record; empty when it is refused. */
    std::string encode(const std::string &control, const std::string &data)
    {
        std::string out(kPkgSendBuf, '\x55');
        auto len = static_cast<std::int32_t>(out.size());
        log_msg_clear(msg_.get());
        if (log_encode_fill_msg(control.c_str(), data.data(), static_cast<int>(data.size()), msg_.get()) != 0 ||
            log_encode_pkg_buf(reinterpret_cast<unsigned char *>(out.data()), &len, msg_.get()) != 0)
            return "";
        return out.substr(0, static_cast<std::size_t>(len));
    }

    std::unique_ptr<log_msg> msg_ = std::make_unique<log_msg>();
};

TEST_F(Codec, FramesAreTheseBytes)
{
    const char clean[] = "\x23\x7e\x00\x00\x00\x33\x7b\x22\x6d\x73\x67\x69\x64\x22\x3a\x22"
                         "\x37\x22\x2c\x22\x43\x6c\x65\x61\x6e\x4c\x6f\x63\x61\x6c\x4c\x6f"
                         "\x67\x22\x3a\x22\x22\x2c\x22\x52\x65\x73\x75\x6c\x74\x22\x3a\x22"
                         "\x53\x75\x63\x63\x65\x73\x73\x22\x7d\x00\x00\x00\x00\x7e\x23";
    EXPECT_EQ(std::string(clean, 63), encode(R"({"msgid":"7","CleanLocalLog":"","Result":"Success"})", ""));
    const std::string control = R"({"msgid":"2","GetLocalLog":{"totalLength":"99999"},"Result":"Success"})";
    const std::string data(51200, '\xd7');
    EXPECT_EQ(std::string("#~\0\0\0\x46", 6) + control + std::string("\0\0\xc8\0", 4) + data + "~#",
              encode(control, data));
}

TEST_F(Codec, EveryLengthComesBackAsItWas)
{
    for (const std::size_t control_len : {0u, 1u, 2047u, 2048u}) {
        for (const std::size_t data_len : {0u, 1u, 61439u}) {
            const std::string control(control_len, 'c'), data(data_len, '\0');
            ASSERT_EQ(0, decode(frame(control, data))) << control_len << ' ' << data_len;
            EXPECT_EQ(control, std::string(msg_->control, strnlen(msg_->control, sizeof msg_->control)));
            EXPECT_EQ(data, std::string(reinterpret_cast<char *>(msg_->data), static_cast<std::size_t>(msg_->dataLen)));
            EXPECT_EQ(frame(control, data), encode(control, data));
        }
    }
    EXPECT_EQ(63500u, encode(std::string(2048, 'c'), std::string(61440, 'd')).size());
}

TEST_F(Codec, RefusesWhatIsNoFrame)
{
    const std::string good = frame("{}", "data");
    const auto patched = [&good](std::size_t at, const std::string &with) {
        return std::string(good).replace(at, with.size(), with);
    };
    const struct {
        std::string frame;
        int result;
        const char *line;
    } cases[] = {
        {good, 0, "log_msg->tailTag=~#$"},
        {"", 1, "log_decode_msg enter$"},
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
    };
    for (const auto &c : cases) {
        EXPECT_EQ(c.result, decode(c.frame)) << c.line;
        EXPECT_TRUE(g_platform.take_log().ends_with(c.line + std::string("|"))) << c.line;
    }
    EXPECT_EQ("", encode(std::string(2049, 'c'), ""));
    EXPECT_EQ("6 log_pkg_codec log_encode_fill_msg: controlLen=2049 error$|", g_platform.take_log());
    EXPECT_EQ("", encode("", std::string(61441, 'd')));
    EXPECT_EQ("6 log_pkg_codec log_encode_fill_msg: dataLen=61441 error$|", g_platform.take_log());
    EXPECT_EQ(1, log_encode_fill_msg("{}", nullptr, 0, msg_.get()));
    std::vector<unsigned char> out(63504);
    std::int32_t len = 63503;
    EXPECT_EQ(1, log_encode_pkg_buf(out.data(), &len, msg_.get()));
    EXPECT_TRUE(g_platform.logged("log_encode_pkg_buf: sendLen=63503 fail$"));
    ASSERT_EQ(0, log_encode_fill_msg("{}", "", 0, msg_.get()));
    EXPECT_EQ(0, log_encode_pkg_buf(out.data(), &(len = 63504), msg_.get()));
    EXPECT_EQ(14, len);
}

TEST_F(Codec, FindsATagOnlyWhereItStandsWhole)
{
    const std::string tags = "#~#";
    const unsigned char *at = bytes(tags);
    EXPECT_EQ(at, log_FindHead_pkg(at, at + 2));
    EXPECT_EQ(nullptr, log_FindHead_pkg(at, at + 1));
    EXPECT_EQ(nullptr, log_FindHead_pkg(at, at));
    EXPECT_EQ(at + 1, log_FindTail_pkg(at + 1, at + 3));
    EXPECT_EQ(nullptr, log_FindTail_pkg(at, at + 3));
    EXPECT_EQ(nullptr, log_FindTail_pkg(nullptr, at));
    EXPECT_EQ("6 log_pkg_codec log_FindHead_pkg,find PKG_HEAD|6 log_pkg_codec log_FindHead_pkg,cannot find "
              "PKG_HEAD|"
              "6 log_pkg_codec log_FindTail_pkg,find PKG_TAIL|6 log_pkg_codec log_FindTail_pkg,cannot find "
              "PKG_TAIL|",
              g_platform.log);
}

TEST_F(Codec, SendsOneWholeFrameOrNothing)
{
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
    EXPECT_EQ(0, log_send_pkg_msg(ends[0], nullptr, "{}", "", 0));
    EXPECT_EQ(-1, log_send_pkg_msg(ends[0], nullptr, std::string(2049, 'c').c_str(), "", 0));
    EXPECT_EQ(-1, log_send_pkg_msg(-1, nullptr, "{}", "", 0));
    EXPECT_EQ(-1, log_send_pkg_msg(ends[0], nullptr, "{}", nullptr, 0));
    shutdown(ends[0], SHUT_WR);
    std::signal(SIGPIPE, SIG_IGN);
    EXPECT_EQ(-1, log_send_pkg_msg(ends[0], nullptr, "{}", "", 0));
    EXPECT_EQ("6 log_pkg_codec log_encode_pkg_buf enter$|6 log_pkg_codec log_send_pkg_msg: send pkg success$|"
              "6 log_pkg_codec log_encode_fill_msg: controlLen=2049 error$|6 log_pkg_codec log_send_pkg_msg: "
              "encode log msg fail$|"
              "6 log_pkg_codec log_encode_pkg_buf enter$|6 log_pkg_codec log_send_pkg_msg: send pkg fail$|",
              g_platform.log);
    char got[128];
    const ssize_t n = recv(ends[1], got, sizeof got, MSG_WAITALL);
    EXPECT_EQ(frame("{}"), std::string(got, static_cast<std::size_t>(n)));
}

} // namespace

#include "protocol/log_reassembly.h"
#include "tests/frame.h"
#include "tests/memory_platform.h"
#include "tests/recording_handlers.h"

#include <gtest/gtest.h>

namespace
{

const std::string kThree = frame(R"({"msgid":"3"})");
const std::string kFour = frame(R"({"msgid":"4"})");

class Reassembly : public testing::Test
{
protected:
    void SetUp() override { g_platform = {}; }

    /* Feeds the bytes in reads as the receive loop makes them; returns the commands that this set off. */
    std::string feed(const std::string &stream)
    {
        g_commands.clear();
        for (std::size_t at = 0; at < stream.size(); at += 2000) {
            const std::string piece = stream.substr(at, 2000);
            EXPECT_EQ(0, log_proc_tcp_pkg(state_, {bytes(piece), piece.size()}));
        }
        return g_commands;
    }

    log_reassembly state_;
};

TEST_F(Reassembly, DropsABadFrameAndHandlesTheGoodOneBehindIt)
{
    EXPECT_EQ(R"(3:{"msgid":"3"}:;4:{"msgid":"4"}:;)",
              feed(frame(std::string(2049, ' ')) + kThree + frame("") + kFour));
    EXPECT_TRUE(g_platform.logged("6 vex_log_manage log_proc_tcp_pkg: decode log msg error,drop this piece data$|"));
    EXPECT_TRUE(g_platform.logged("6 log_json_codec log_json_get_msgid para len error$|"));
    /* The longest control text, which fills its field, has its NUL too. */
    const std::string control = R"({"msgid":"8"})" + std::string(2035, ' ');
    EXPECT_EQ("8:" + control + ":dd;", feed(frame(control, "dd")));
}

TEST_F(Reassembly, StartsAfreshWithThePieceThatWouldFillTheBuffer)
{
    std::string wrong_tail = kThree;
    wrong_tail.back() = '!';
    for (const auto &[stuck, why] : {std::pair<std::string, const char *>{"?", "FindHead_pkg,cannot find PKG_HEAD|"},
                                     {"#~" + big_endian(0xffffffff), "continue recv data, Received =61439|"},
                                     {wrong_tail, "FindTail_pkg,cannot find PKG_TAIL|"}}) {
        g_platform = {};
        EXPECT_EQ("", feed(stuck + std::string(61439 - stuck.size(), 'x')));
        EXPECT_TRUE(g_platform.log.ends_with(why)) << g_platform.log.substr(g_platform.log.size() - 200);
        EXPECT_FALSE(g_platform.logged("tmpbuf small"));
        EXPECT_EQ(R"(4:{"msgid":"4"}:;)", feed(kFour));
        EXPECT_TRUE(g_platform.logged("|6 vex_log_manage log_proc_tcp_pkg: tmpbuf small,drop old content.$|"));
    }
    /* A frame of 61440 bytes is never whole; one of a byte less is. */
    EXPECT_EQ("", feed(frame(R"({"msgid":"1"})", std::string(61440 - kThree.size(), 'd'))));
    state_ = {};
    EXPECT_NE("", feed(frame(R"({"msgid":"1"})", std::string(61439 - kThree.size(), 'd'))));
}

TEST_F(Reassembly, TellsOfSmallPiecesInARowOnlyTheFirst)
{
    const auto byte_by_byte = [this](const std::string &stream) {
        std::string commands;
        for (const char byte : stream)
            commands += feed({byte});
        return commands;
    };
    for (const std::string &stuck :
         {std::string("?"), "#~" + big_endian(0x7fffffff), kThree.substr(0, kThree.size() - 1) + "!"}) {
        state_ = {};
        byte_by_byte(stuck + std::string(20, 'x'));
        g_platform = {};
        byte_by_byte(std::string(30000, 'x'));
        EXPECT_EQ("", g_platform.log);
    }
    state_ = {};
    EXPECT_EQ(R"(3:{"msgid":"3"}:;)", byte_by_byte(kThree));
    EXPECT_TRUE(g_platform.logged("6 vex_log_manage log_proc_tcp_pkg: [8] small pieces were not logged$|"));
    EXPECT_TRUE(g_platform.logged("enter log_proc_tcp_pkg len = [1]$|")) << "each frame is told from its start";
    g_platform = {};
    EXPECT_EQ("", byte_by_byte(kFour.substr(0, 15)));
    EXPECT_EQ(R"(4:{"msgid":"4"}:;)", feed(kFour.substr(15)));
    EXPECT_FALSE(g_platform.logged("small pieces"));
}

TEST(RequestLine, IsKnownHoweverItArrives)
{
    const auto is_request = [](const std::string &opening, std::size_t cut) {
        log_request_line line;
        return log_take_request_line(line, {bytes(opening), cut}) ||
               log_take_request_line(line, {bytes(opening) + cut, opening.size() - cut});
    };
    for (const std::string &opening :
         {std::string("POST / HTTP/1.1\r\n"), std::string("GET http://device:48888/?a=b HTTP/1.0"),
          std::string("PRI * HTTP/2.0"), std::string("M-SEARCH * HTTP/"), std::string("patch /\xc3\xa4 HTTP/1.1"),
          "GET /" + std::string(70000, 'a') + " HTTP/1.1"})
        for (std::size_t cut = 0; cut < 12; ++cut)
            EXPECT_TRUE(is_request(opening, cut)) << opening.substr(0, 20) << cut;
    for (const std::string &opening :
         {kThree, std::string("#~ / HTTP/1.1"), std::string(" / HTTP/1.1"), std::string("GET  HTTP/1.1"),
          std::string("GET / HTCPCP/1.0"), std::string("GET /\n HTTP/1.1"), std::string("G\0T / HTTP/1.1", 14)})
        for (std::size_t cut = 0; cut < 8; ++cut)
            EXPECT_FALSE(is_request(opening, cut)) << opening << cut;
}

} // namespace

#include "core/daemon_state.h"
#include "core/log_options.h"
#include "core/log_stdout.h"
#include "core/log_tools.h"
#include "tests/memory_platform.h"

#include <csignal>
#include <getopt.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <tuple>
#include <unistd.h>

namespace
{

class Tools : public testing::Test
{
protected:
    void SetUp() override { g_platform = {}; }
};

TEST_F(Tools, NvItemsAreReadAndCommitted)
{
    g_platform.items["imei"] = "0123456789abcdefgh";
    char value[16] = {};
    EXPECT_EQ(0, vex_get_nv_item("imei", value, sizeof value));
    EXPECT_STREQ("0123456789abcde", value);
    EXPECT_EQ("6 log_tools vex_get_nv_item:nvItem = imei,buf = 0123456789abcde, bufLength=15|", g_platform.take_log());
    EXPECT_EQ(-1, vex_get_nv_item("missing", value, sizeof value));
    EXPECT_EQ(0, log_get_nv_int("missing"));
    EXPECT_EQ("", g_platform.take_log());
    EXPECT_EQ(-1, vex_get_nv_item("imei", value, 1));
    EXPECT_EQ("6 log_tools vex_get_nv_item Para Error$|", g_platform.take_log());
    EXPECT_EQ(0, log_set_nv_int("count", -42));
    EXPECT_EQ(1, g_platform.saves);
    EXPECT_EQ(-42, log_get_nv_int("count"));
    EXPECT_EQ(-1, vex_set_nv_item("x", nullptr, 1));
    EXPECT_TRUE(g_platform.logged("6 log_tools vex_set_nv_item Para Error$|"));
}

TEST_F(Tools, CommandsReportHowTheyEnded)
{
    for (const auto &[cmd, result, words] : {std::tuple{"true", 0, "6 log_tools [true] System ok$|"},
                                             {"false", -1, "0 log_tools [false] System error3$|"},
                                             {"kill -9 $$", -1, "0 log_tools [kill -9 $$] System error2$|"},
                                             {"false &", 0, "6 log_tools [false &] System ok$|"}}) {
        EXPECT_EQ(result, log_exec_cmd(cmd));
        EXPECT_EQ("6 log_tools cmdStr[" + std::string(cmd) + "]$|" + words, g_platform.take_log());
    }
    for (const auto &[cmd, result, words] :
         {std::tuple{"echo 42; echo 7", 1, "42"}, {"echo 0123456789", 1, "0123456"}, {"true", 0, ""}}) {
        char line[8] = "asitwas";
        EXPECT_EQ(result, vex_popen(cmd, line, sizeof line));
        EXPECT_STREQ(words, line);
    }
}

TEST_F(Tools, PacketsAreSentWholeOrRefused)
{
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
    testing::internal::CaptureStdout();
    EXPECT_EQ(4, log_send_packet(ends[0], nullptr, "data", 4));
    shutdown(ends[0], SHUT_WR);
    std::signal(SIGPIPE, SIG_IGN);
    EXPECT_EQ(-1, log_send_packet(ends[0], nullptr, "x", 1));
    for (const auto &[fd, len] : {std::pair{-1, 1}, {ends[0], 0}})
        EXPECT_EQ(-1, log_send_packet(fd, nullptr, "x", len));
    EXPECT_EQ(0, log_send_packet(ends[0], nullptr, "x", -1));
    g_daemon.use_ssl = 1; /* without a session */
    EXPECT_EQ(-1, log_send_packet(ends[0], nullptr, "x", 1));
    g_daemon.use_ssl = 0;
    log_print_flush();
    EXPECT_EQ("log_send_packet complete, the write data size is 4\n"
              "log_send_packet data fail  errno= 32 (Broken pipe)\n",
              testing::internal::GetCapturedStdout());
}

TEST_F(Tools, TextsAreTakenApart)
{
    for (const auto &[address, kind] : {std::pair{"any/0", 1}, {"10.0.0.1", 1}, {"::1", 2}, {"localhost", 0}})
        EXPECT_EQ(kind, log_isValidIpOrUrl(address)) << address;
    EXPECT_EQ("6 log_tools log_isValidIpOrUrl(): localhost is not a valid IP address.$|", g_platform.take_log());
    for (const auto &[n, text, size, result, field] : {std::tuple{0, "a,b,c", 8, 0, "a"},
                                                       {2, "a,b,c", 8, 0, "c"},
                                                       {3, "a,b,c", 8, -1, "asitwas"},
                                                       {1, "a,,c", 8, 0, ""},
                                                       {1, "a,bcdef", 4, 0, "bcd"},
                                                       {0, "a", 0, -1, "asitwas"}}) {
        char out[8] = "asitwas";
        EXPECT_EQ(result, getNthValueSafe(n, text, ',', out, size));
        EXPECT_STREQ(field, out);
    }
    EXPECT_EQ("0 log_tools getNthValueSafe: null in$|", g_platform.take_log());
    g_platform.log = "";
    log_print_hex_buf((std::string(250, '\x11') + '\xaf').data(), 251, "tag");
    log_print_hex_buf(nullptr, 0, "tag");
    const std::string name = "6 log_tools log_print_hex_buf";
    EXPECT_EQ(name + " enter$|" + name + ":tag print_count=2$|" + name + ":tag pieceBuf[0]:" + std::string(500, '1') +
                  ".$|" + name + ":tag pieceBuf[1]:AF.$|" + name + " enter$|" + name + ": param null$|",
              g_platform.log);
    EXPECT_EQ(-1, log_hex_encode(nullptr, nullptr, 0));
}

TEST_F(Tools, MessagesFitTheirRecord)
{
    EXPECT_EQ(1, log_send_msg(23, 0x2F00, "abc", 3));
    EXPECT_EQ(std::string("\x03\0\0\0abc\0", 8), g_platform.messages[0].substr(8, 8));
    EXPECT_EQ(0, log_send_msg(23, 305, std::string(1025, 'p').data(), 1025));
    EXPECT_EQ(0, log_send_msg(23, 0x2F01, nullptr, 0));
    EXPECT_TRUE(g_platform.log.ends_with("|0 log_tools log_send_msg: Msg cmd is >= MSG_CMD_SERVICE_REG, return!|"));
    EXPECT_EQ(-1, log_thread_create(nullptr, nullptr));
    EXPECT_TRUE(g_platform.log.ends_with("|6 log_tools input paramnet is error$|"));
}

log_options_result parse(std::vector<const char *> arguments)
{
    arguments.insert(arguments.begin(), "vex_log_manage");
    arguments.push_back(nullptr);
    g_platform = {};
    optind = 0; /* starts getopt again */
    return log_parse_options(static_cast<int>(arguments.size()) - 1, const_cast<char **>(arguments.data()));
}

TEST_F(Tools, OptionsChangeTheDaemonForGood)
{
    using items = std::map<std::string, std::string>;
    testing::internal::CaptureStdout();
    EXPECT_EQ(log_options_result::run, parse({"-a", "10.0.0.9", "--nonsense", "--retry", "3"}));
    EXPECT_EQ((items{{"log_manage_mode", "1"}, {"log_server_addr", "10.0.0.9"}}), g_platform.items);
    EXPECT_TRUE(g_platform.log.ends_with("|6 vex_log_manage set vex_log_manage client mode$|"));
    EXPECT_EQ(3, g_daemon.retry_count);
    const std::string longest(63, 'a'), too_long = longest + 'a';
    testing::internal::CaptureStderr();
    parse({"-a", longest.c_str(), "-p", "0123456789abcdef", "-a", too_long.c_str()});
    EXPECT_EQ("--port: the argument is longer than 15 characters, ignored\n--address: the argument is longer than 63 "
              "characters, ignored\n",
              testing::internal::GetCapturedStderr());
    EXPECT_EQ((items{{"log_manage_mode", "1"}, {"log_server_addr", longest}}), g_platform.items);
    EXPECT_EQ(log_options_result::help, parse({"-p", "1", "-h", "-a", "10.0.0.9"}));
    EXPECT_EQ((items{{"log_server_port", "1"}}), g_platform.items);
    EXPECT_EQ("\n Usage for vex_log_manage:\n\n-a, --address:\t Server IP address\n\n-p, --port:\t Server Port "
              "number\n\n-r, --retry:\t Number of retries for connect\n\n-h, --help:\t usage help\n"
              "\ne.g. vex_log_manage -a <ip address> -p <port number> -r <num retries>\n",
              testing::internal::GetCapturedStdout());
}

} // namespace

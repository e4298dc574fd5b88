#include "core/daemon_state.h"
#include "core/log_options.h"
#include "core/log_tools.h"
#include "tests/memory_platform.h"

#include <csignal>
#include <cstring>
#include <future>
#include <getopt.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
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
    EXPECT_EQ("", g_platform.take_log());
    EXPECT_EQ(-1, vex_get_nv_item("imei", value, 1));
    EXPECT_EQ("6 log_tools vex_get_nv_item Para Error$|", g_platform.take_log());

    EXPECT_EQ(0, log_set_nv_int("count", -42));
    EXPECT_EQ("6 log_tools count value=-42|6 log_tools vex_set_nv_item: nvItem = count,nvItemValue = -42$|",
              g_platform.take_log());
    EXPECT_EQ(1, g_platform.saves);
    EXPECT_EQ(-42, log_get_nv_int("count"));
    EXPECT_EQ(0, log_get_nv_int("missing"));
    g_platform.take_log();
    g_platform.fails = true;
    EXPECT_EQ(-1, vex_set_nv_item("x", "y", 1));
    EXPECT_EQ(-1, vex_set_nv_item("x", nullptr, 1));
    EXPECT_EQ("6 log_tools vex_set_nv_item set Error$|6 log_tools vex_set_nv_item Para Error$|", g_platform.log);
}

TEST_F(Tools, CommandsReportHowTheyEnded)
{
    const struct {
        const char *cmd;
        int result;
        const char *line;
    } cases[] = {{"true", 0, "6 log_tools [true] System ok$|"},
                 {"false", -1, "0 log_tools [false] System error3$|"},
                 {"kill -9 $$", -1, "0 log_tools [kill -9 $$] System error2$|"},
                 {"false &", 0, "6 log_tools [false &] System ok$|"}};
    for (const auto &c : cases) {
        EXPECT_EQ(c.result, log_exec_cmd(c.cmd));
        EXPECT_EQ("6 log_tools cmdStr[" + std::string(c.cmd) + "]$|" + c.line, g_platform.take_log());
    }
    char line[8];
    EXPECT_EQ(1, vex_popen("echo 42; echo 7", line, sizeof line));
    EXPECT_EQ(std::string("42\0\0\0\0\0\0", 8), std::string(line, 8));
    EXPECT_EQ(1, vex_popen("echo 0123456789", line, sizeof line));
    EXPECT_STREQ("0123456", line);
    EXPECT_EQ(0, vex_popen("true", line, sizeof line));
    EXPECT_EQ(std::string(8, '\0'), std::string(line, 8));
}

TEST_F(Tools, PacketsAreSentWholeOrRefused)
{
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
    const std::string big(4 << 20, 'b'); /* more than the socket holds: sent in several writes */
    std::string got(big.size(), '\0');
    auto reader = std::async(std::launch::async, [&] { return recv(ends[1], got.data(), got.size(), MSG_WAITALL); });
    testing::internal::CaptureStdout();
    EXPECT_EQ(4 << 20, log_send_packet(ends[0], nullptr, big.data(), 4 << 20));
    EXPECT_EQ(4 << 20, reader.get());
    EXPECT_EQ(big, got);
    shutdown(ends[0], SHUT_WR);
    std::signal(SIGPIPE, SIG_IGN);
    EXPECT_EQ(-1, log_send_packet(ends[0], nullptr, "x", 1));
    EXPECT_EQ(-1, log_send_packet(-1, nullptr, "x", 1));
    EXPECT_EQ(-1, log_send_packet(ends[0], nullptr, "x", 0));
    EXPECT_EQ(0, log_send_packet(ends[0], nullptr, "x", -1));
    /* Over TLS, the session is written to as SSL_write() does. */
    static std::string written;
    g_daemon.use_ssl = 1;
    g_daemon.ssl_write = [](SSL *, const void *at, int len) {
        written.append(static_cast<const char *>(at), 2);
        return len < 3 ? 0 : 2;
    };
    EXPECT_EQ(-1, log_send_packet(ends[0], nullptr, "x", 1));
    errno = 0;
    EXPECT_EQ(-1, log_send_packet(ends[0], reinterpret_cast<SSL *>(ends), "abcdef", 6));
    EXPECT_EQ("abcdef", written);
    g_daemon.use_ssl = 0;
    EXPECT_EQ("log_send_packet complete, the write data size is 4194304\n"
              "log_send_packet data fail  errno= 32 (Broken pipe)\n"
              "log_send_packet data fail  errno= 0 (Success)\n",
              testing::internal::GetCapturedStdout());
}

TEST_F(Tools, HexDumpsComeInPieces)
{
    char text[7];
    EXPECT_EQ(6, log_hex_encode("\x00\xaf\x12", text, 3));
    EXPECT_STREQ("00AF12", text);
    log_print_hex_buf(std::string(251, '\x11').data(), 251, "tag");
    log_print_hex_buf(text, 0, "tag");
    const std::string name = "6 log_tools log_print_hex_buf";
    EXPECT_EQ(name + " enter$|" + name + ":tag print_count=2$|" + name + ":tag pieceBuf[0]:" + std::string(500, '1') +
                  ".$|" + name + ":tag pieceBuf[1]:11.$|" + name + " enter$|" + name + ": param null$|",
              g_platform.log);
}

TEST_F(Tools, TextsAreTakenApart)
{
    for (const char *v4 : {"any", "any/0", "10.0.0.1"})
        EXPECT_EQ(1, log_isValidIpOrUrl(v4)) << v4;
    EXPECT_EQ(2, log_isValidIpOrUrl("fe80:0:0:0:0:0:0:1"));
    EXPECT_EQ(0, log_isValidIpOrUrl("localhost"));
    EXPECT_EQ("6 log_tools log_isValidIpOrUrl(): localhost is not a valid IP address.$|", g_platform.take_log());
    const struct {
        int n;
        const char *text;
        int size;
        const char *field; /* null: there is none */
    } cases[] = {{0, "a,b,c", 8, "a"}, {2, "a,b,c", 8, "c"},     {3, "a,b,c", 8, nullptr}, {1, "a,,c", 8, ""},
                 {0, "", 8, ""},       {1, "a,bcdef", 4, "bcd"}, {0, "a", 0, nullptr}};
    for (const auto &c : cases) {
        char out[8] = "asitwas";
        EXPECT_EQ(c.field != nullptr ? 0 : -1, getNthValueSafe(c.n, c.text, ',', out, c.size));
        EXPECT_STREQ(c.field != nullptr ? c.field : "asitwas", out);
    }
    EXPECT_EQ("0 log_tools getNthValueSafe: null in$|", g_platform.log);
}

TEST_F(Tools, MessagesAreOneFixedRecord)
{
    EXPECT_EQ(1, log_send_msg(23, 0x2F00, "abc", 3));
    std::string expected("\x00\x2f\0\0\x17\0\x08\0\x03\0\0\0abc", 15);
    expected.resize(1036);
    EXPECT_EQ(std::vector{expected}, g_platform.messages);
    EXPECT_EQ(1, log_send_msg(23, 305, std::string(1024, 'p').data(), 1024));
    EXPECT_EQ(0, log_send_msg(23, 305, std::string(1025, 'p').data(), 1025));
    EXPECT_EQ(0, log_send_msg(23, 0x2F01, nullptr, 0));
    g_platform.fails = true;
    EXPECT_EQ(0, log_send_msg(23, 305, nullptr, 0));
    EXPECT_TRUE(g_platform.logged("|0 log_tools log_send_msg: Msg cmd is >= MSG_CMD_SERVICE_REG, return!|0 "
                                  "log_tools log_send_msg: vex_msg_send err!|"));
    EXPECT_EQ(3u, g_platform.messages.size());
}

TEST_F(Tools, ThreadsAndLocalSocketsAreMade)
{
    static std::promise<const void *> argument;
    log_thread_task task{[](void *given) -> void * { return argument.set_value(given), nullptr; }, 0};
    EXPECT_EQ(0, log_thread_create(&task, &task));
    EXPECT_EQ(&task, argument.get_future().get());
    EXPECT_EQ(-1, log_thread_create(nullptr, nullptr));
    EXPECT_EQ(-1, log_connect_unix_socket("/tmp/nobody/here"));
    EXPECT_EQ("6 log_tools input paramnet is error$|0 log_tools can not connect to:/tmp/nobody/here, errno: "
              "2, pid=" +
                  std::to_string(getpid()) + "|",
              g_platform.log);
}

log_options_result parse(std::vector<const char *> arguments)
{
    arguments.insert(arguments.begin(), "vex_log_manage");
    arguments.push_back(nullptr);
    g_platform = {};
    optind = 0; /* starts getopt afresh */
    return log_parse_options(static_cast<int>(arguments.size()) - 1, const_cast<char **>(arguments.data()));
}

TEST_F(Tools, OptionsChangeTheDaemonForGood)
{
    using items = std::map<std::string, std::string>;
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    EXPECT_EQ(log_options_result::run, parse({"-a", "10.0.0.9", "--nonsense", "--retry", "3"}));
    EXPECT_EQ((items{{"log_manage_mode", "1"}, {"log_server_addr", "10.0.0.9"}}), g_platform.items);
    EXPECT_TRUE(g_platform.log.ends_with("|6 vex_log_manage set vex_log_manage client mode$|"));
    EXPECT_EQ(3, g_daemon.retry_count);
    EXPECT_EQ(log_options_result::help, parse({"-p", "1", "-h", "-a", "10.0.0.9"}));
    EXPECT_EQ((items{{"log_server_port", "1"}}), g_platform.items);
    const std::string too_long(64, 'a');
    parse({"-a", too_long.c_str(), "-p", too_long.c_str(), "-r", "7"});
    EXPECT_TRUE(g_platform.items.empty());
    EXPECT_EQ(7, g_daemon.retry_count);
    parse({"-a", too_long.c_str() + 1});
    EXPECT_EQ(too_long.substr(1), g_platform.items["log_server_addr"]);
    const std::string said = testing::internal::GetCapturedStderr();
    EXPECT_NE(std::string::npos, said.find("--port: the argument is longer than 63 characters, ignored\n"));
    EXPECT_EQ("\n Usage for vex_log_manage:\n\n-a, --address:\t Server IP address\n\n-p, --port:\t Server "
              "Port number\n"
              "\n-r, --retry:\t Number of retries for connect\n\n-h, --help:\t usage help\n"
              "\ne.g. vex_log_manage -a <ip address> -p <port number> -r <num retries>\n",
              testing::internal::GetCapturedStdout());
}

} // namespace

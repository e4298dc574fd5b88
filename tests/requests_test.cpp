/* Requests to the handlers themselves that are refused or meet a platform that fails. */
#include "core/daemon_state.h"
#include "core/log_registry.h"
#include "handlers/bsp_module_level.h"
#include "platform/unique_fd.h"
#include "protocol/log_json_codec.h"
#include "tests/frame.h"
#include "tests/memory_platform.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <tuple>

namespace
{

class Requests : public testing::Test
{
protected:
    void SetUp() override
    {
        int ends[2];
        ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
        peer_.reset(ends[1]);
        log_cmd_record(std::make_shared<log_link>(unique_fd{ends[0]}, nullptr));
        g_platform = {};
    }
    static int hand(int msgid, const char *control)
    {
        g_platform.take_log();
        return log_msg_handler_table[static_cast<std::size_t>(msgid) - 1].handler(control, bytes(""), 0);
    }
    /* The control text of the reply; empty when there is none. */
    std::string reply() const
    {
        char frame[2048];
        const ssize_t n = recv(peer_.get(), frame, sizeof frame, MSG_DONTWAIT);
        return n > 12 ? std::string(frame + 6, static_cast<std::size_t>(n) - 12) : "";
    }
    std::string ask(int msgid, const std::string &members) const
    {
        hand(msgid, (R"({"msgid":")" + std::to_string(msgid) + "\"," + members + "}").c_str());
        return reply();
    }

    unique_fd peer_;
};

TEST_F(Requests, WithoutATextAreDropped)
{
    for (const log_msg_handler_entry &entry : log_msg_handler_table) {
        if (entry.handler == nullptr)
            continue;
        EXPECT_EQ(-1, entry.handler("{}", nullptr, 0));
        EXPECT_TRUE(g_platform.take_log().ends_with(" para null error$|"));
        EXPECT_EQ(-1, hand(entry.msgid, nullptr));
        EXPECT_TRUE(g_platform.log.ends_with(" para null error$|"));
        EXPECT_EQ(-1, hand(entry.msgid, ""));
        EXPECT_TRUE(g_platform.log.ends_with(" para len error$|"));
        const bool takes_any = entry.msgid == 2 || entry.msgid == 3;
        EXPECT_EQ(-1, takes_any ? -1 : hand(entry.msgid, "{"));
        EXPECT_TRUE(takes_any || g_platform.logged("6 log_json_codec cJSON_Parse error$|"));
        EXPECT_EQ("", reply());
    }
}

TEST_F(Requests, AreToldWhenAMemberIsMissing)
{
    const std::string syslog = R"("syslogParaSet":{"sysloglevel":"","syslogsize":""})";
    const std::string capture = R"("tcpdump":{"interfaceName":"","Action":""})";
    const std::string stream = R"("realtimeLog":{"LogType":"","Action":"","protocol":"","port":"0","ip":""})";
    const std::string bsp = R"("bsp":{"module_name":"","level":""})";
    const std::string package = R"("conf_file":{"totalLength":""})";
    const std::string clean = R"("CleanLocalLog":"")", mode = R"("mode_lpm_online":"")";
    for (const auto &[msgid, members, missing, answer] : {
             std::tuple{1, R"("conf_file":"10")", "conf_file", package},
             {1, R"("conf_file":{"totalLength":10})", "totalLength", package},
             {4, R"("x":0)", "K_syslogParaSet", syslog},
             {4, R"("syslogParaSet":{"syslogsize":"64"})", "K_sysloglevel", syslog},
             {4, R"("SyslogParaSet":{"sysloglevel":"5","syslogsize":64})", "K_syslogsize", syslog},
             {5, R"("x":0)", "K_tcpdump", capture},
             {5, R"("tcpdump":{"Action":"end","TcpdumpLen":"1"})", "K_InterfaceName", capture},
             {5, R"("tcpdump":{"InterfaceName":"lo"})", "K_Action", capture},
             {6, R"("x":0)", "K_realtimeLog", stream},
             {6, R"("realtimeLog":{"Action":"end"})", "K_LogType", stream},
             {6, R"("realtimeLog":{"LogType":"syslog"})", "K_Action", stream},
             {6, R"("realtimeLog":{"LogType":"syslog","Action":"end","port":"1"})", "K_ip", stream},
             {6, R"("realtimeLog":{"LogType":"syslog","Action":"end","ip":"1.1.1.1"})", "K_port", stream},
             {7, R"("CleanLocalLog":1)", "CleanLocalLog", clean},
             {8, R"("x":0)", "K_bspLogSet", bsp},
             {8, R"("bsp":{"level":"1"})", "K_bspModuleName", bsp},
             {8, R"("bsp":{"module_name":"usb"})", "K_bspModuleLevel", bsp},
             {11, R"("mode":"lpm")", "mode_lpm_online", mode},
             {11, R"("mode_lpm_online":1)", "mode_lpm_online", mode},
         }) {
        g_daemon.run_mode = missing == std::string("K_ip") || missing == std::string("K_port") ? 1 : 0;
        EXPECT_EQ(R"({"msgid":")" + std::to_string(msgid) + "\"," + answer +
                      R"(,"Result":"Fail:Device internal error"})",
                  ask(msgid, members));
        EXPECT_TRUE(g_platform.logged("|6 log_json_codec cannot find " + std::string(missing) + " item$|"));
        EXPECT_FALSE(g_platform.logged("cmdStr["));
    }
    g_daemon.run_mode = 1;
    EXPECT_EQ("", ask(6, R"("realtimeLog":{"LogType":"syslog","Action":"stop","ip":"1.1.1.1","port":"1"})"));
}

TEST_F(Requests, ToStreamToAnAddressThatCannotBeOneAreToldSo)
{
    g_daemon.run_mode = 1;
    for (const std::string &ip : {std::string(R"(1\"1)"), std::string("1'1"), std::string(R"(1\\1)"),
                                  std::string(R"(1\n1)"), std::string(R"(1\u007f)"), std::string(64, '1')}) {
        const auto request = [&](const char *action) {
            return R"("realtimeLog":{"LogType":"qxdm","Action":")" + std::string(action) + R"(","ip":")" + ip +
                   R"(","port":"1"})";
        };
        EXPECT_EQ(R"({"msgid":"6","realtimeLog":{"LogType":"","Action":"","protocol":"","port":"0","ip":""},)"
                  R"("Result":"Fail:Device internal error"})",
                  ask(6, request("start")));
        EXPECT_FALSE(g_platform.logged("cmdStr["));
        EXPECT_NE(std::string::npos, ask(6, request("end")).find("Success"));
    }
}

TEST_F(Requests, ToConfirmALinkAreTheDevicesOwnServersOnly)
{
    g_platform.items["imei"] = "356938035643809";
    for (const auto &[members, words] : {
             std::pair{R"("x":{)", "cannot find K_DataLink item"},
             {R"("datalink":{"imei":"356938035643808","ConnectType":"modemlog_connect")",
              "imei = [356938035643808] is incorrect"},
             {R"("datalink":{"ConnectType":"modemlog_connect")", "cannot find K_Imei item"},
             {R"("datalink":{"IMEI":"356938035643809")", "cannot find K_ConnectType item"},
             {R"("datalink":{"imei":"356938035643809","ConnectType":"MODEMLOG_CONNECT")",
              "unknow ConnectType = [MODEMLOG_CONNECT]"},
             {R"("datalink":{"IMEI":"356938035643809","connecttype":"modemlog_connect")",
              "cmdStr[killall -9 diag_mdlog]"},
         }) {
        EXPECT_EQ("", ask(10, std::string(members) + "}"));
        EXPECT_TRUE(g_platform.logged(words)) << g_platform.log;
        EXPECT_EQ(*words == 'c' && words[1] == 'm', g_platform.logged("cmdStr["));
    }
}

TEST_F(Requests, AreToldNothingOfAPlatformThatFails)
{
    const std::string set = R"("bsp":{"module_name":"usb","level":"err"})";
    const std::string query = R"("bsp":{"module_name":"usb","level":""})";
    const auto done = [](const char *msgid, const std::string &members) {
        return R"({"msgid":")" + std::string(msgid) + "\"," + members + R"(,"Result":"Success"})";
    };
    log_restore_bsp_module_level(); /* there is no record */
    EXPECT_EQ("", g_platform.log);
    EXPECT_EQ(done("8", R"("bsp":{"module_name":"usb","level":"info"})"), ask(8, query));
    g_platform.fails = true;
    EXPECT_EQ(done("8", set), ask(8, set));
    EXPECT_TRUE(g_platform.logged("vex_set_nv_item set Error$|6 log_tools cmdStr[sh /usr/vex/"));
    EXPECT_EQ(done("11", R"("mode_lpm_online":"lpm")"), ask(11, R"("mode_lpm_online":"lpm")"));
    EXPECT_TRUE(g_platform.logged("0 log_tools log_send_msg: vex_msg_send err!|"));
    g_daemon.syslog_realtime_on = 1;
    const std::string para = R"("syslogParaSet":{"sysloglevel":"5","syslogsize":"64"})";
    EXPECT_EQ(done("4", para), ask(4, para));
    EXPECT_TRUE(g_platform.logged("vex_set_nv_item set Error$|6 log_tools vex_set_nv_item set Error$|"));
    g_platform.fails = false;
    EXPECT_EQ(done("8", set), ask(8, set));
    EXPECT_EQ("usb,err;", g_platform.items["bsplog_module_level"]);
}

} // namespace

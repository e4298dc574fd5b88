/* The daemon on a device in trouble: system calls fail, and it says so and goes on. */
#include "tests/daemon.h"
#include "tests/frame.h"

#include <cerrno>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <netinet/in.h>
#include <sys/socket.h>
#include <tuple>

namespace
{

using std::chrono::steady_clock;

class Faults : public Daemon
{
protected:
    void SetUp() override { ASSERT_TRUE(prepare_faults()); }
    /* A tool's port, by which the daemon's calls on its connection are told from others. */
    static int port_of(const tool_connection &tool)
    {
        sockaddr_in6 name{};
        socklen_t len = sizeof name;
        EXPECT_EQ(0, getsockname(tool.fd.get(), reinterpret_cast<sockaddr *>(&name), &len));
        return ntohs(name.sin6_port);
    }
};

TEST_F(Faults, EndTheListenerThatTheyHitAndNoOther)
{
    for (const auto &[what, words] : {
             std::pair{fault{.call = kFaultSocket, .only = AF_INET}, "[error]can not create tcp server socket !"},
             {{.call = kFaultSocket, .only = AF_INET6}, "[error]can not create tcp server socket !"},
             {{.call = kFaultBind, .only = AF_INET}, "can not bind socket! errno=98,Address already in use"},
             {{.call = kFaultBind, .only = AF_INET6}, "can not bind socket ipv6! errno=98,Address already in use"},
             {{.call = kFaultListen, .only = AF_INET}, "log_server_handle_tcp_msg listen failed "},
             {{.call = kFaultListen, .only = AF_INET6}, "log_server_handle_tcp_msg_ipv6 listen failed "},
             {{.call = kFaultThread}, "vex_log_server_thread  FAIL"},
             {{.call = kFaultThread, .pass = 1}, "vex_log_server_thread_ipv6  FAIL"},
         }) {
        let_fail(what);
        const daemon_process daemon;
        EXPECT_TRUE(daemon.logs(words));
        const bool hit_ipv6 = what.only == AF_INET6 || what.pass == 1;
        EXPECT_TRUE(daemon.logs(hit_ipv6 ? "log_server_handle_tcp_msg enter" : "_ipv6 accept before"));
        EXPECT_EQ(kOnline, tool_connection(hit_ipv6 ? "127.0.0.1" : "::1").ask(kAskMode)) << words;
    }
}

TEST_F(Faults, OfBothListenersEndTheDaemon)
{
    for (const auto &what : {fault{.call = kFaultSocket, .times = 2}, fault{.call = kFaultThread, .times = 2}}) {
        let_fail(what);
        daemon_process daemon;
        EXPECT_EQ(1, daemon.wait_exit());
        EXPECT_EQ(1, daemon.logged("nobody can connect, on IPv4 or IPv6: vex_log_manage exit "));
    }
    let_fail({.call = kFaultSocket, .times = 0});
    set_nv("log_manage_switch", "50");
    start();
    daemon_process second; /* its port is taken */
    EXPECT_EQ(1, second.wait_exit());
    EXPECT_EQ(kOnline, tool_connection().ask(kAskMode));
    EXPECT_EQ("48", get_nv("log_manage_switch"));
    set_nv("log_manage_mode", "7"); /* which ends at once */
    run_command("for i in $(seq 8); do vex_log_manage & vex_log_manage; wait; done >/dev/null");
    EXPECT_EQ("32", get_nv("log_manage_switch")) << "each start takes its own";
}

TEST_F(Faults, LeaveAConnectionWithoutAReaderToTheNextTool)
{
    start();
    for (const int family : {AF_INET, AF_INET6}) {
        const auto begin = steady_clock::now();
        let_fail({.call = kFaultAccept, .only = family});
        const char *const address = family == AF_INET ? "127.0.0.1" : "::1";
        const tool_connection first(address); /* the accept that waits takes it */
        EXPECT_EQ(kOnline, first.ask(kAskMode));
        EXPECT_TRUE(daemon_->logs("accept error Too many open files(errno: 24) ", family == AF_INET ? 1 : 2));
        let_fail({.call = kFaultThread});
        const tool_connection unread(address);
        EXPECT_TRUE(daemon_->logs("[failed creat log_recv_tcp_msg ", family == AF_INET ? 1 : 2));
        EXPECT_LE(std::chrono::seconds(1), steady_clock::now() - begin) << "it pauses before it accepts again";
        EXPECT_EQ("(closed)", first.receive());
        unread.send(frame(kAskMode));
        EXPECT_EQ(kOnline, tool_connection(address).ask(kAskMode));
        EXPECT_EQ("(closed)", unread.receive());
    }
    EXPECT_TRUE(settles());
}

TEST_F(Faults, OfAReadEndTheConnectionUnlessItWasInterrupted)
{
    start();
    {
        const tool_connection tool;
        EXPECT_EQ(kOnline, tool.ask(kAskMode));
        const auto begin = steady_clock::now();
        let_fail({.call = kFaultRecv, .times = 3, .error = EINTR});
        EXPECT_EQ(kOnline, tool.ask(kAskMode)); /* by the read that was waiting already */
        EXPECT_EQ(kOnline, tool.ask(kAskMode));
        EXPECT_LE(std::chrono::milliseconds(60), steady_clock::now() - begin) << "it pauses after each";
        EXPECT_EQ(3, failed(kFaultRecv));
        let_fail({.call = kFaultRecv});
        tool.send(frame(kAskMode));
        const std::string reply = tool.receive(); /* there is none if the read had not begun yet */
        EXPECT_EQ("(closed)", reply == kOnline ? tool.receive() : reply);
        EXPECT_TRUE(daemon_->logs("log_recv_tcp_msg:recvfrom error,errno msg=Connection reset by peer"));
    }
    tool_connection{};
    EXPECT_TRUE(daemon_->logs("log_recv_tcp_msg:recvcount=0,client close"));
    EXPECT_TRUE(settles());
    EXPECT_EQ(0, daemon_->logged("close old fd[")) << "nobody was left to be replaced";
}

TEST_F(Faults, OfCommandsAndRepliesChangeNothingElse)
{
    let_fail({.call = kFaultSpawn});
    start();
    EXPECT_EQ(1, daemon_->logged("vex_syslog.sh -L -o /logfs -l 7 -s 512 ] System error1"));
    const tool_connection tool;
    for (const auto &[call, request, end, words] : {
             std::tuple{kFaultSpawn, R"({"msgid":"7","CleanLocalLog":""})", R"("CleanLocalLog":"","Result":"Success"})",
                        "[rm -rf /logfs/*] System error1"},
             {kFaultSpawn, R"({"msgid":"8","bsp":{"module_name":"usb","level":"err"}})",
              R"("module_name":"usb","level":"err"},"Result":"Success"})", "usb err] System error1"},
             {kFaultSpawn, R"({"msgid":"4","syslogParaSet":{"sysloglevel":"3","syslogsize":"9"}})",
              R"("sysloglevel":"3","syslogsize":"9"},"Result":"Success"})", "-l 3 -s 9 &] System error1"},
             {kFaultSpawn, R"({"msgid":"5","tcpdump":{"InterfaceName":"lo","Action":"start"}})",
              R"("Action":""},"Result":"Success"})", "-w /logfs/lo.pcap &] System error1"},
             {kFaultSpawn, R"({"msgid":"6","realtimeLog":{"LogType":"syslog","Action":"start"}})",
              R"("port":"1514","ip":"10.64.0.2"},"Result":"Success"})", ":1514 &] System error1"},
             {kFaultSpawn, R"({"msgid":"3"})", R"("CompileTime":"","syslogsizeMax":"0"},"Result":"Success"})",
              "syslogsizeMax = [0]"},
         }) {
        let_fail({.call = call, .times = 1000});
        const std::string reply = tool.ask(request);
        EXPECT_TRUE(reply.ends_with(end)) << reply;
        EXPECT_EQ(1, daemon_->logged(words)) << words;
        let_fail({.call = call, .times = 0});
    }
    let_fail({.call = kFaultSend, .times = 2, .only = port_of(tool)});
    tool.send(frame(R"({"msgid":"3"})") + frame(R"({"msgid":"11"})") + frame(kAskMode));
    EXPECT_EQ(kOnline, tool.receive());
    EXPECT_EQ(2, daemon_->logged("log_send_pkg_msg: send pkg fail"));
}

/* First of the new file, then of its folder. */
TEST_F(Faults, OfASyncLeaveTheItemToTheNextCommit)
{
    start();
    const tool_connection tool;
    for (const int pass : {0, 1}) {
        forget_nv();
        let_fail({.call = kFaultFsync, .pass = pass});
        tool.ask(R"({"msgid":"8","bsp":{"module_name":"usb","level":"err"}})");
        EXPECT_EQ(1, failed(kFaultFsync));
        EXPECT_EQ(pass == 0 ? "" : "usb,err;", get_nv("bsplog_module_level"));
        tool.ask(R"({"msgid":"8","bsp":{"module_name":"wlan","level":"err"}})");
        EXPECT_EQ("usb,err;wlan,err;", get_nv("bsplog_module_level"));
    }
}

TEST_F(Faults, LoseAnArchiveAndNothingElse)
{
    install_program("tar", "echo logs >$2; echo packs >/tmp/packs; read go </tmp/go");
    run_command("mkfifo /tmp/packs /tmp/go");
    start();
    const tool_connection tool;
    const std::string sent = R"({"msgid":"2","GetLocalLog":{"totalLength":"5"},"Result":"Success"})";
    const std::string not_opened =
        R"({"msgid":"2","GetLocalLog":{"totalLength":"0"},"Result":"Fail:Open log file error"})";
    for (const auto &[what, reply] : {
             std::pair{fault{.call = kFaultMemory}, not_opened}, /* the frames' record */
             {{.call = kFaultOpen}, not_opened},
             {{.call = kFaultSend, .times = 2, .only = port_of(tool)}, sent},
             {{.call = kFaultSend, .times = 3, .only = port_of(tool)}, kOnline}, /* nothing more is said of it */
             {{.call = kFaultSpawn}, sent},                                      /* it cannot be removed */
         }) {
        let_fail({.call = kFaultSpawn, .times = 2}); /* the look at the space that is left, and the script that tells
                                                        how the device is */
        tool.send(frame(R"({"msgid":"2"})") + frame(kAskMode));
        EXPECT_EQ("packs\n", read_file("/tmp/packs"));
        EXPECT_EQ(2, failed(kFaultSpawn));
        let_fail(what);
        std::ofstream("/tmp/go") << "go" << std::endl;
        std::string data;
        EXPECT_EQ(reply, tool.receive(&data)) << what.call;
        EXPECT_EQ(reply == sent ? "logs\n" : "", data);
        EXPECT_EQ(kOnline, reply == kOnline ? kOnline : tool.receive());
        EXPECT_EQ(what.times, failed(what.call));
        EXPECT_EQ(reply == not_opened || what.call == kFaultSpawn, std::filesystem::exists("/tmp/MBBlogfs.tar.gz"));
    }
    EXPECT_EQ(1, daemon_->logged("log_msg_get_log_file:send data fail"));
}

/* Every allocation that a command leads to fails once. */
TEST_F(Faults, OfMemoryLoseTheCommandThatTheyHit)
{
    start();
    const tool_connection tool;
    ASSERT_TRUE(daemon_->logs("enter log_recv_tcp_msg")); /* so that it is not the connection's that fail */
    long pieces = 0;
    std::string large = R"({"msgid":"3","x":[0)"; /* a large tree */
    for (int i = 0; i < 100; ++i)
        large += ",0";
    for (const std::string &request : {std::string(R"({"msgid":"11","mode_lpm_online":"?"})"), large + "]}"}) {
        int pass = 0;
        for (bool hit = true; hit; ++pass) {
            let_fail({.call = kFaultMemory, .pass = pass});
            tool.send(frame(request));
            ASSERT_TRUE(daemon_->logs("waiting recv data", ++pieces)) << pass << read_file("/tmp/daemon.out");
            hit = failed(kFaultMemory) != 0;
        }
        let_fail({.call = kFaultMemory, .times = 0});
        EXPECT_LT(2, pass);
    }
    for (const char *words : {"LOG_RECV_PKG_LEN malloc failed.", "sendbuf malloc failed .", "cJSON_Parse error",
                              "cjson create root fail", "cjson create pVersionInfo fail"})
        EXPECT_NE(0, daemon_->logged(words)) << words;
    tool.send(frame(kAskMode));
    std::string reply;
    while ((reply = tool.receive()) != kOnline)
        ASSERT_TRUE(reply.ends_with(R"("Result":"Success"})") || reply == mode_reply("", "Fail:parameter error"))
            << reply;
}

} // namespace

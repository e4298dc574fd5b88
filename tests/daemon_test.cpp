#include "tests/daemon.h"
#include "tests/frame.h"

#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <thread>

namespace
{

const std::string kAskVersion = R"({"msgid":"3","VersionInfo":""})";
TEST_F(Daemon, StartConsumesOneUnitOfItsCounter)
{
    set_nv("syslog_size", "");
    for (const auto &[before, after] : {std::pair{"3", "2"}, {"1", "0"}}) {
        set_nv("log_manage_switch", before);
        start();
        EXPECT_EQ(after, get_nv("log_manage_switch"));
        const std::string log = daemon_->log();
        EXPECT_LT(log.find("6 vex_log_manage"), log.find("start vex_log_manage..."));
        const auto script = log.find("sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o /logfs -l 7 -s  ] System ok");
        EXPECT_LT(script, log.find("enter log_server_thread_proc."));
    }
    for (const char *off : {"0", "-4", "abc", ""}) {
        set_nv("log_manage_switch", off);
        daemon_process daemon;
        EXPECT_EQ(0, daemon.wait_exit());
        EXPECT_EQ(1, daemon.logged(" log_manage_switch disable "));
        EXPECT_EQ(0, daemon.logged("log_server_thread_proc"));
        EXPECT_EQ(off, get_nv("log_manage_switch"));
    }
}

TEST_F(Daemon, TellsWhichDeviceItIs)
{
    set_nv("model_name", R"(VX "5\\20")"); /* one backslash, as the file writes it */
    start();
    const std::string kernel = run_command("cut -d '#' -f 2 /proc/version | tr -d '\\n'");
    const auto expected = [&kernel](const std::string &size) {
        return R"({"msgid":"3","VersionInfo":{"projectName":"VX \"5\\20\"","VersionNum":"VX520_V1.4.2_B07",)"
               R"("imei":"356938035643809","CompileTime":")" +
               kernel + R"(","syslogsizeMax":")" + size + R"("},"Result":"Success"})";
    };
    EXPECT_EQ(expected("20480"), tool_connection("127.0.0.1").ask(kAskVersion));
    const tool_connection tool("::1");
    EXPECT_EQ(expected("20480"), tool.ask(kAskVersion));
    install_program("df", "echo 'tmpfs 1.5G 0 1.5G 0% /logfs'");
    EXPECT_EQ(expected("1024"), tool.ask(R"({"MSGID":"3"})"));
    install_program("df", "exit 1");
    EXPECT_EQ(expected("0"), tool.ask(R"({"msgid":"3","x":[]})"));
}

TEST_F(Daemon, SwitchesTheModemAndTellsItsMode)
{
    start();
    const tool_connection tool;
    const unique_fd modem{socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)};
    const sockaddr_un address{AF_UNIX, "/run/vex/msg/23"};
    ASSERT_EQ(0, bind(modem.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address));
    const struct {
        const char *member;
        std::string reply;
        int command; /* 0: no message */
    } cases[] = {
        {R"("mode_lpm_online":"lpm")", mode_reply("lpm", "Success"), 305},
        {R"("Mode_LPM_online":"online")", mode_reply("online", "Success"), 306},
        {R"("mode_lpm_online":"Online")", mode_reply("", "Fail:parameter error"), 0},
        {R"("mode_lpm_online":1)", mode_reply("", "Fail:Device internal error"), 0},
        {R"("mode":"lpm")", mode_reply("", "Fail:Device internal error"), 0},
        {R"("mode_lpm_online":"")", kOnline, 0},
    };
    for (const auto &c : cases) {
        EXPECT_EQ(c.reply, tool.ask(R"({"msgid":"11",)" + std::string(c.member) + "}"));
        std::uint16_t record[518] = {};
        EXPECT_EQ(c.command != 0 ? 1036 : -1, recv(modem.get(), record, sizeof record, MSG_DONTWAIT)) << c.member;
        EXPECT_EQ(c.command, record[0]);
        EXPECT_EQ(c.command != 0 ? 23 : 0, record[2]);
    }
    set_nv("operate_mode", "online");
    EXPECT_EQ(mode_reply("lpm", "Success"), tool.ask(kAskMode));
}

TEST_F(Daemon, AnswersTheGoodFrameBehindEveryBadOne)
{
    start();
    const tool_connection tool;
    for (const std::string &control : {std::string(R"({"msgid":11})"), std::string(R"({"msgid":"9"})"),
                                       std::string(2048, '['), std::string(2049, 'c'), std::string("\0{}", 3)}) {
        tool.send(frame(control) + frame(kAskMode));
        EXPECT_EQ(kOnline, tool.receive()) << control.substr(0, 20);
    }
    for (int i = 0; i < 31; ++i) /* a stream out of step is given up at 61440 bytes */
        tool.send(std::string(2000, '?'));
    ASSERT_TRUE(daemon_->logs("tmpbuf small,drop old content."));
    const tool_connection next("::1");
    for (const char byte : frame(kAskMode))
        next.send(std::string(1, byte));
    EXPECT_EQ(kOnline, next.receive());
}

TEST_F(Daemon, HandsItselfToTheNewestTool)
{
    start();
    const tool_connection first;
    EXPECT_EQ(kOnline, first.ask(kAskMode));
    first.send("#~ half a frame"); /* stays behind with its connection */
    const tool_connection second("::1");
    EXPECT_EQ("(closed)", first.receive());
    EXPECT_EQ(kOnline, second.ask(kAskMode));
    const tool_connection third;
    EXPECT_EQ("(closed)", second.receive());
    EXPECT_EQ(kOnline, third.ask(kAskMode));
    const std::string log = daemon_->log();
    std::size_t at = 0;
    for (const char *line :
         {"_ipv6 accept after", "_ipv6:close fd[", "_ipv6: client ipv6[0:0:0:0:0:0:0:1],fd[",
          "vex_log_recv_thread:pthread_cancel threadID=[", "vex_log_recv_thread threadID=[", "tcp_msg:close old fd[",
          "tcp_msg: client ip[127.0.0.1],fd=[", "vex_log_recv_thread:pthread_cancel threadID=["})
        ASSERT_NE(std::string::npos, at = log.find(line, at)) << line << '\n' << log;
}

TEST_F(Daemon, KeepsNothingOfThreeHundredTools)
{
    start();
    std::string burst;
    for (int i = 0; i < 200; ++i)
        burst += frame(kAskMode);
    std::vector<tool_connection> tools;
    for (int round = 0; round < 300; ++round) {
        tools.emplace_back(round % 3 == 0 ? "::1" : "127.0.0.1");
        if (round % 3 == 1) /* replaced without a word, within its family: two listeners accept in any order */
            continue;
        ASSERT_EQ(kOnline, tools.back().ask(kAskMode));
        if (round % 10 == 9) { /* resets its connection while the daemon replies */
            const linger hard{1, 0};
            setsockopt(tools.back().fd.get(), SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
            tools.back().send(burst);
            tools.clear();
        }
    }
    tools.clear();
    EXPECT_EQ(kOnline, tool_connection().ask(kAskMode));
    EXPECT_TRUE(settles());
}

/* A tool asks for something slow and is replaced meanwhile. The new tool is accepted at once, its command
 * waits for the other to end, and not a word meant for the first tool reaches it. */
TEST_F(Daemon, KeepsReplacedToolsCommandsFromTheNewOne)
{
    install_program("df", "echo started >/tmp/started; read go </tmp/go");
    ASSERT_EQ(0, mkfifo("/tmp/started", 0600));
    ASSERT_EQ(0, mkfifo("/tmp/go", 0600));
    start();
    const tool_connection first;
    first.send(frame(kAskVersion) + frame(R"({"msgid":"11","mode_lpm_online":"lpm"})"));
    EXPECT_EQ("started\n", read_file("/tmp/started")); /* returns when df runs */
    {
        for (int i = 0; i < 20; ++i) { /* wait for their turn until they are replaced, and leave nothing behind */
            tool_connection("::1").send(frame(kAskMode));
            ASSERT_TRUE(daemon_->logs("log_recv_tcp_msg:===========recv data len =47", i + 1));
        }
        const tool_connection second("::1");
        second.send(frame(kAskMode));
        EXPECT_EQ("(closed)", first.receive());
        ASSERT_TRUE(daemon_->logs("log_recv_tcp_msg:===========recv data len =47", 21));
        EXPECT_TRUE(settles({3, 2})); /* two connections with their threads, and the pipe from df */
        EXPECT_EQ(0, daemon_->logged("log_msg_mode_lpm_online"));
        std::ofstream("/tmp/go") << "go" << std::endl;
        EXPECT_EQ(kOnline, second.receive());
        EXPECT_EQ(kOnline, second.ask(kAskMode));
    }
    EXPECT_TRUE(settles());
    EXPECT_EQ(21, daemon_->logged("another tool has taken over, command dropped"));
    EXPECT_EQ(0, daemon_->logged("modem mode = lpm"));
    EXPECT_EQ(2, daemon_->logged("send pkg success"));
}

/* A tool orders replies without reading one, until the daemon blocks in its send; the next tool is served. */
TEST_F(Daemon, IsNotHeldUpByAToolThatStopsReading)
{
    std::ofstream("/proc/sys/net/ipv4/tcp_wmem") << "4096 4096 4096"; /* little is sent ahead */
    start();
    const tool_connection deaf;
    std::string burst;
    for (int i = 0; i < 2000; ++i)
        burst += frame(kAskMode);
    for (std::size_t at = 0; !daemon_->waits_in(SYS_sendto);) {
        const ssize_t n = send(deaf.fd.get(), burst.data() + at, burst.size() - at, MSG_NOSIGNAL | MSG_DONTWAIT);
        at = (at + static_cast<std::size_t>(std::max<ssize_t>(n, 0))) % burst.size();
    }
    EXPECT_EQ(kOnline, tool_connection("::1").ask(kAskMode));
    EXPECT_TRUE(settles());
}

TEST_F(Daemon, LeavesNothingOpenInTheProgramsItStarts)
{
    install_program("df", "ls /proc/self/fd >/tmp/fds; sleep 1000 >/dev/null 2>&1 & echo $! >/tmp/sleeper");
    start();
    const tool_connection tool;
    EXPECT_NE("(closed)", tool.ask(kAskVersion));
    EXPECT_EQ("0\n1\n2\n3\n", read_file("/tmp/fds")); /* 3 is the folder that ls reads */
    /* So the sleeper holds neither the connection nor, behind the daemon's end, the port. */
    daemon_.reset();
    EXPECT_EQ("(closed)", tool.receive());
    start();
    EXPECT_EQ(kOnline, tool_connection().ask(kAskMode));
    EXPECT_EQ(0, kill(std::stoi(read_file("/tmp/sleeper")), SIGKILL));
}

TEST_F(Daemon, GivesNoSocketTheNumberOfAStandardStream)
{
    start(false);
    EXPECT_NE(std::string::npos, tool_connection().ask(kAskVersion).find("356938035643809"));
    for (const char *stream : {"fd/0", "fd/1", "fd/2"})
        EXPECT_EQ("/dev/null", std::filesystem::read_symlink(daemon_->proc(stream)));
}

TEST_F(Daemon, ServesOneFamilyWhenTheOthersPortIsTaken)
{
    const unique_fd squatter{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    sockaddr_in any{AF_INET, htons(48888), {}, {}};
    ASSERT_EQ(0, bind(squatter.get(), reinterpret_cast<const sockaddr *>(&any), sizeof any));
    const daemon_process daemon;
    EXPECT_TRUE(daemon.logs("[error]can not bind socket! errno=98,Address already in use"));
    EXPECT_TRUE(daemon.logs("ipv6 accept before"));
    EXPECT_EQ(kOnline, tool_connection("::1").ask(kAskMode));
}

TEST_F(Daemon, AcceptsAgainWhenDescriptorsAreToBeHad)
{
    start();
    rlimit limit{};
    ASSERT_EQ(0, prlimit(daemon_->pid, RLIMIT_NOFILE, nullptr, &limit));
    const rlimit none{3, limit.rlim_max}; /* 0 to 2 are open */
    ASSERT_EQ(0, prlimit(daemon_->pid, RLIMIT_NOFILE, &none, nullptr));
    const tool_connection first; /* the waiting accept has its descriptor already */
    EXPECT_TRUE(daemon_->logs("log_server_handle_tcp_msg accept error Too many open files(errno: 24) "));
    const tool_connection second;
    ASSERT_EQ(0, prlimit(daemon_->pid, RLIMIT_NOFILE, &limit, nullptr));
    EXPECT_EQ(kOnline, second.ask(kAskMode));
    /* Of its end of the connection, the keepalive timer (02) runs, in 1/100 s and from 60 s down. */
    EXPECT_NE("", run_command("grep -E ':BEF8 [0-9A-F:]+ 01 [0-9A-F:]+ 02:0000[01]' /proc/net/tcp"));
}

} // namespace

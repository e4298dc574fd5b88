#include "tests/daemon.h"
#include "tests/frame.h"

#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <tuple>

namespace
{

const std::string kAsked = "log_recv_tcp_msg:===========recv data len =47"; /* for the modem's mode, has arrived */
const std::string kConfirmModem =
    R"({"msgid":"10","DataLink":{"imei":"356938035643809","ConnectType":"modemlog_connect"}})";
const std::string kBothAsked = "log_recv_tcp_msg:===========recv data len =144"; /* that confirmation as well */
const std::string kAskVersion = R"({"msgid":"3","VersionInfo":""})";

TEST_F(Daemon, StartConsumesOneUnitOfItsCounter)
{
    const std::string script = "sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o ";
    for (const auto &[before, after, lines] : {std::tuple{"3", "2", script + "/logfs -l 7 -s 512 ] System ok"},
                                               {"1", "0", script + " -l  -s  ] System ok"}}) {
        set_nv("log_manage_switch", before);
        start(before[0] == '1'); /* once with its standard streams closed: no socket takes their numbers */
        EXPECT_EQ(after, get_nv("log_manage_switch"));
        EXPECT_LT(daemon_->log().find(lines), daemon_->log().find("enter log_server_thread_proc."));
        EXPECT_EQ(before[0] == '1' ? "/tmp/daemon.out" : "/dev/null",
                  std::filesystem::read_symlink(daemon_->proc("fd/1")));
        EXPECT_NE("(closed)", tool_connection().ask(kAskVersion));
        forget_nv();
    }
    for (const char *off : {"0", "-4", "abc", "", "(none)"}) {
        set_nv("log_manage_switch", off);
        if (*off == '(')
            run_command("rm /etc/vex/nvconfig");
        daemon_process daemon;
        EXPECT_EQ(0, daemon.wait_exit());
        EXPECT_EQ(1, daemon.logged(" log_manage_switch disable ") - daemon.logged("log_server_thread_proc"));
    }
    daemon_process daemon({"-h"});
    EXPECT_EQ(0, daemon.wait_exit());
    EXPECT_EQ(0, daemon.logged("log_manage_switch")) << "it has not come to look";
}

TEST_F(Daemon, TellsWhichDeviceItIs)
{
    set_nv("model_name", R"(VX "5\\20")"); /* one backslash, as the file writes it */
    start();
    const tool_connection tool;
    const auto expect = [&tool](const std::string &identity, const std::string &kernel, const std::string &size) {
        EXPECT_EQ(R"({"msgid":"3","VersionInfo":{)" + identity + R"(,"CompileTime":")" + kernel +
                      R"(","syslogsizeMax":")" + size + R"("},"Result":"Success"})",
                  tool.ask(R"({"MSGID":"3"})"));
    };
    const std::string kernel = run_command("cut -d '#' -f 2 /proc/version | tr -d '\\n'");
    const std::string identity =
        R"("projectName":"VX \"5\\20\"","VersionNum":"VX520_V1.4.2_B07","imei":"356938035643809")";
    expect(identity, kernel, "20480");
    install_program("df", "echo 'tmpfs 1.5G 0 1.5G 0% /logfs'");
    expect(identity, kernel, "1024");
    install_program("df", "exit 1");
    install_program("cat", "exit 1");
    forget_nv();
    expect(R"("projectName":"","VersionNum":"","imei":"")", "", "0");
}

TEST_F(Daemon, SwitchesTheModemAndTellsItsMode)
{
    start();
    const tool_connection tool;
    const unique_fd modem{socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)};
    const sockaddr_un address{AF_UNIX, "/run/vex/msg/23"};
    ASSERT_EQ(0, bind(modem.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address));
    for (const auto &[member, reply, command] :
         {std::tuple{R"("mode_lpm_online":"lpm")", mode_reply("lpm", "Success"), 305},
          {R"("Mode_LPM_online":"online")", kOnline, 306},
          {R"("mode_lpm_online":"Online")", mode_reply("", "Fail:parameter error"), 0},
          {R"("mode_lpm_online":"")", kOnline, 0}}) {
        EXPECT_EQ(reply, tool.ask(R"({"msgid":"11",)" + std::string(member) + "}"));
        std::uint16_t record[518] = {};
        EXPECT_EQ(command != 0 ? 1036 : -1, recv(modem.get(), record, sizeof record, MSG_DONTWAIT)) << member;
        EXPECT_EQ(std::tuple(command, command != 0 ? 23 : 0, command != 0 ? 8 : 0),
                  std::tuple(int{record[0]}, int{record[2]}, int{record[3]}));
    }
    for (int i = 0; i < 30; ++i) /* nobody waits for a modem that has more to do than its queue holds */
        EXPECT_EQ(kOnline, tool.ask(R"({"msgid":"11","mode_lpm_online":"online"})"));
    EXPECT_NE(0, daemon_->logged("log_send_msg: vex_msg_send err!"));
    set_nv("operate_mode", "online");
    EXPECT_EQ(mode_reply("lpm", "Success"), tool.ask(kAskMode));
}

TEST_F(Daemon, AnswersTheGoodFrameBehindEveryBadOne)
{
    start();
    const tool_connection tool;
    for (const std::string &control :
         {std::string(R"({"msgid":"9"})"), std::string(2048, '['), std::string(2049, 'c'), std::string("\0{}", 3)}) {
        tool.send(frame(control) + frame(kAskMode));
        EXPECT_EQ(kOnline, tool.receive()) << control.substr(0, 20);
    }
    tool.send(std::string(62000, '?')); /* a stream out of step is given up at 61440 bytes */
    ASSERT_TRUE(daemon_->logs("tmpbuf small,drop old content."));
    const tool_connection next("::1");
    for (const char byte : frame(kAskMode))
        next.send(std::string(1, byte));
    EXPECT_EQ(kOnline, next.receive());
    /* Of its end of the connection, the keepalive timer (02) runs, in 1/100 s and from 60 s down. */
    EXPECT_NE("", run_command("grep -E ':BEF8 [0-9A-F:]+ 01 [0-9A-F:]+ 02:0000[01]' /proc/net/tcp6"));
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
    std::size_t at = 0;
    for (const char *line : {"_ipv6:close fd[", "_ipv6: client ipv6[0:0:0:0:0:0:0:1],fd[", "pthread_cancel threadID=[",
                             "tcp_msg:close old fd[", "tcp_msg: client ip[127.0.0.1],fd=["})
        ASSERT_NE(std::string::npos, at = daemon_->log().find(line, at)) << line << '\n' << daemon_->log();
}

TEST_F(Daemon, LeavesNothingOpenInTheProgramsItStarts)
{
    install_program("df", "ls /proc/self/fd >/tmp/fds; sleep 1000 >/dev/null 2>&1 &");
    start();
    const tool_connection tool;
    EXPECT_NE("(closed)", tool.ask(kAskVersion));
    EXPECT_EQ("0\n1\n2\n3\n", read_file("/tmp/fds")); /* 3 is the folder that ls reads */
    /* So the sleeper holds neither the connection nor, behind the daemon's end, the port. */
    daemon_.reset();
    EXPECT_EQ("(closed)", tool.receive());
    start();
    EXPECT_EQ(kOnline, tool_connection().ask(kAskMode));
}

/* Whatever its starter made of signals and the locale, and without /proc, which tells what is open. */
TEST_F(Daemon, OwesNothingToItsStarter)
{
    const std::string hide_proc = kMemoryIsOurs ? "umount -l /proc; " : ""; /* sanitizers and emulators need it */
    install_program("vex_log_manage",
                    "trap '' TERM CHLD\nexport LC_ALL=de_DE.UTF-8\nexec 9>/tmp/left_open\nexec unshare -m sh -c '" +
                        hide_proc + "exec /usr/vex/bin/vex_log_manage'");
    install_program("df", "{ echo $LC_ALL; sh -c 'kill $$; echo survives'; } >/tmp/told 2>&1\necho leaks >&9");
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    sigprocmask(SIG_SETMASK, &all, &before);
    start();
    sigprocmask(SIG_SETMASK, &before, nullptr);
    EXPECT_NE("(closed)", tool_connection().ask(kAskVersion));
    EXPECT_EQ("C\nTerminated\n", read_file("/tmp/told"));
    EXPECT_EQ("", read_file("/tmp/left_open"));
    kill(daemon_->pid, SIGTERM);
    EXPECT_EQ(-1, daemon_->wait_exit()) << "by the signal";
}

/* What it writes to may take nothing, for as long as it likes. */
TEST_F(Daemon, WaitsForNoReaderOfItsWords)
{
    run_command("mkfifo /tmp/words /tmp/log; mkdir /tmp/full; mount -t tmpfs -o size=64k full /tmp/full");
    const unique_fd words{open("/tmp/words", O_RDWR | O_CLOEXEC)};
    const unique_fd lines{open("/tmp/log", O_RDWR | O_CLOEXEC | O_NONBLOCK)};
    const unique_fd system_log{socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)};
    install_program("syslogd", "exit 0"); /* which would listen there */
    const sockaddr_un at{AF_UNIX, "/dev/log"};
    ASSERT_EQ(0, bind(system_log.get(), reinterpret_cast<const sockaddr *>(&at), sizeof at));
    const auto taken_from = [](int fd) {
        std::string all(1 << 20, '\0');
        std::size_t len = 0;
        for (ssize_t n; (n = read(fd, all.data() + len, all.size() - len)) > 0;)
            len += static_cast<std::size_t>(n);
        return all.substr(0, len);
    };
    const auto taken = [&](const std::string &log) {
        return log == "/tmp/full/log" ? read_file(log) : taken_from(log.empty() ? system_log.get() : lines.get());
    };
    for (const std::string log : {"/tmp/log", "/tmp/full/log", ""}) {
        install_program("vex_log_manage", "VEX_LOG_FILE=" + log + " exec /usr/vex/bin/vex_log_manage >/tmp/words");
        const daemon_process daemon;
        const tool_connection tool;
        for (int i = 0; i < 3000; ++i)
            ASSERT_EQ(kOnline, tool.ask(kAskMode)) << log << i;
        const std::string first = taken(log);
        EXPECT_NE(std::string::npos, first.find("start vex_log_manage...")) << log;
        run_command(": >/tmp/full/log");
        EXPECT_EQ(kOnline, tool.ask(kAskMode));
        const std::string then = taken(log);
        EXPECT_NE(std::string::npos, then.find(" lines before this one were lost")) << log;
    }
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

/* A page in somebody's browser brings a frame to the port, behind what makes the daemon forget what it holds. */
TEST_F(Daemon, TakesNothingFromAWebBrowser)
{
    start();
    const std::string body = "\r\n\r\n" + std::string(61440, 'x') + frame(R"({"msgid":"11","mode_lpm_online":"lpm"})");
    long closed = 0;
    for (const char *line : {"POST / HTTP/1.1", "PRI * HTTP/2.0"}) {
        const tool_connection page(closed == 0 ? "127.0.0.1" : "::1");
        page.send(std::string(line, 3));
        ASSERT_TRUE(daemon_->logs("log_recv_tcp_msg:===========recv data len =3=", ++closed));
        const std::string rest = line + 3 + body;
        send(page.fd.get(), rest.data(), rest.size(), MSG_NOSIGNAL); /* is reset on the way */
        EXPECT_TRUE(daemon_->logs("sends an HTTP request, closed", closed)) << line;
        EXPECT_EQ("(closed)", page.receive());
    }
    EXPECT_EQ(kOnline, tool_connection().ask(kAskMode));
    EXPECT_EQ(0, daemon_->logged(R"("mode_lpm_online":"lpm")"));
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
            ASSERT_TRUE(daemon_->logs(kAsked, i + 1));
        }
        const tool_connection second("::1"); /* nor is its confirmation of a data link run beside the other's command */
        second.send(frame(kConfirmModem) + frame(kAskMode));
        EXPECT_EQ("(closed)", first.receive());
        ASSERT_TRUE(daemon_->logs(kBothAsked));
        EXPECT_TRUE(settles({3, 2})); /* two connections with their threads, and the pipe from df */
        EXPECT_EQ(0, daemon_->logged("log_msg_mode_lpm_online") + daemon_->logged("killall -9 diag_mdlog"));
        std::ofstream("/tmp/go") << "go" << std::endl;
        EXPECT_EQ(kOnline, second.receive());
        EXPECT_EQ(kOnline, second.ask(kAskMode));
    }
    EXPECT_TRUE(settles());
    EXPECT_EQ(21, daemon_->logged("another tool has taken over, command dropped"));
    EXPECT_EQ(0, daemon_->logged("modem mode = lpm"));
    EXPECT_EQ(2, daemon_->logged("send pkg success"));
}

/* A program hangs and does not even end when it is asked to, with others behind it. Whoever comes next is answered all
 * the same; what a tool has left running lives on. */
TEST_F(Daemon, IsNotHeldUpByAProgramThatHangs)
{
    install_program("df", "trap '' TERM; echo started >/tmp/started; while :; do sleep 1; done");
    ASSERT_EQ(0, mkfifo("/tmp/started", 0600));
    start();
    const tool_connection first;
    EXPECT_NE("(closed)", first.ask(R"({"msgid":"5","tcpdump":{"InterfaceName":"lo","Action":"start"}})"));
    first.send(frame(R"({"msgid":"2"})"));
    EXPECT_EQ("started\n", read_file("/tmp/started"));
    const auto replaced = std::chrono::steady_clock::now();
    const tool_connection second("::1");
    EXPECT_EQ("(closed)", first.receive());
    EXPECT_EQ(kOnline, second.ask(kAskMode));
    EXPECT_GT(std::chrono::seconds(15), std::chrono::steady_clock::now() - replaced);
    for (const char *line : {"nobody waits any more for what fd[", "the command before is still at work, fd[",
                             " is asked to end, nobody waits for it any more", " does not end and is killed",
                             "] is skipped, nobody waits for it any more"})
        EXPECT_NE(0, daemon_->logged(line)) << line;
    EXPECT_NE("", run_command("busybox pidof tcpdump"));
    second.send(frame(R"({"msgid":"2"})"));
    EXPECT_EQ("started\n", read_file("/tmp/started"));
    const long memory = daemon_->memory();
    for (int i = 1; i <= 200; ++i) { /* what they ask would run programs, too */
        tool_connection("::1").send(frame(kConfirmModem) + frame(kAskMode));
        ASSERT_TRUE(daemon_->logs(kBothAsked, i));
    }
    EXPECT_TRUE(settles({3, 2})); /* the thread that runs the program, the last that waits for it, and the pipe from df */
    EXPECT_TRUE(!kMemoryIsOurs || daemon_->memory() <= memory + 500) << daemon_->memory() - memory;
    EXPECT_EQ(kOnline, tool_connection("::1").ask(kAskMode));
    EXPECT_TRUE(settles());
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

} // namespace

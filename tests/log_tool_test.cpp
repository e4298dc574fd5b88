#include "tests/daemon.h"
#include "tests/frame.h"

#include <functional>
#include <netinet/in.h>
#include <sys/socket.h>
#include <thread>

namespace
{

/* A device that takes one connection, reads a command, sends what it is told to, and stays or closes. */
struct fake_device {
    fake_device(const std::string &says, bool stays)
    {
        sockaddr_in any{};
        any.sin_family = AF_INET;
        socklen_t len = sizeof any;
        EXPECT_EQ(0, bind(listener.get(), reinterpret_cast<const sockaddr *>(&any), sizeof any));
        EXPECT_EQ(0, listen(listener.get(), 1));
        getsockname(listener.get(), reinterpret_cast<sockaddr *>(&any), &len);
        port = std::to_string(ntohs(any.sin_port));
        thread = std::thread([this, says, stays] {
            const unique_fd fd{accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC)};
            char piece[4096];
            recv(fd.get(), piece, sizeof piece, 0);
            EXPECT_EQ(static_cast<ssize_t>(says.size()), send(fd.get(), says.data(), says.size(), MSG_NOSIGNAL));
            if (stays)
                recv(fd.get(), piece, sizeof piece, 0); /* until the tool gives up */
        });
    }
    ~fake_device() { thread.join(); }

    unique_fd listener{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    std::string port;
    std::thread thread;
};

TEST(LogTool, DoesEverythingOnARealDevice)
{
    daemon_process daemon;
    daemon.wait_listening();
    const auto says = [](const std::string &command, const std::string &words) {
        int status = -1;
        const std::string out = run_command("vex_log_tool " + command, &status);
        EXPECT_EQ(0, status) << command;
        EXPECT_NE(std::string::npos, out.find(words)) << command << '\n' << out;
    };
    says("--version", "vex_log_tool 1.0\n");
    says("version --host ::1", "Device at ::1 port 48888\n  model             VX-520\n");
    says("syslog", "System log: level 7, size 512 KB, at most 20480 KB\n");
    says("syslog 5 64", "System log: level 5, size 64 KB: the device was told so\n");
    says("bsp usb err", "Kernel module usb: log level err: the device was told so\n");
    says("capture start lan,lo --len 100", "told to capture on lan,lo.");
    says("--json capture start lan,lo",
         R"({"msgid":"5","tcpdump":{"interfaceName":"","Action":""},"Result":"Success"})");
    run_command("until [ -e /logfs/lo.pcap ] && [ -e /logfs/bridge0.pcap ]; do sleep 0.01; done");
    says("modem", "The modem is set to: online\n"); /* something to capture */
    run_command("until [ $(stat -c %s /logfs/lo.pcap) -gt 24 ]; do killall -USR2 tcpdump; sleep 0.01; done");
    says("capture stop", "told to stop");
    run_command("while pidof tcpdump; do sleep 0.01; done; head -c 1500000 /dev/urandom >/logfs/noise");
    says("archive /tmp/a.tgz", "\n  capture logfs/lo.pcap, ");
    EXPECT_EQ("", run_command("killall syslogd; mkdir /tmp/x && tar -xzf /tmp/a.tgz -C /tmp/x && rm /logfs/syslog "
                              "/tmp/x/logfs/syslog && diff -r /logfs /tmp/x/logfs"));
    EXPECT_NE("", run_command("tcpdump -r /logfs/lo.pcap port 48888 2>/dev/null"));
    run_command("mkdir -p /tmp/p/conf && touch /tmp/p/conf/Diag.cfg && tar -cf /tmp/p.tar -C /tmp/p conf");
    says("config /tmp/p.tar", "The device has taken the package of 10240 bytes.");
    EXPECT_EQ("Diag.cfg\n", run_command("ls /logfs/logconf"));
    says("stream qxdm --for 0.2 --output /tmp/q", "of the log received.");
    says("clean", "told to delete");
    EXPECT_EQ("", run_command("ls /logfs"));
}

TEST(LogTool, ShowsTheLiveLogUntilItIsStopped)
{
    daemon_process daemon;
    daemon.wait_listening();
    run_command("mkfifo /tmp/out /tmp/err");
    for (const char *host : {"192.168.0.1", "::1"}) {
        /* Lines are logged until the tool shows one; then it is stopped. */
        const std::string out = run_command("vex_log_tool stream syslog --host " + std::string(host) +
                                            " >/tmp/out 2>/tmp/err & tool=$!; exec 3</tmp/out 4</tmp/err; "
                                            "while :; do logger hello; sleep 0.02; done & "
                                            "read line <&3; kill $!; kill -INT $tool; wait $tool; "
                                            "echo $? $line; cat <&4");
        EXPECT_NE(std::string::npos, out.find("hello\n")) << out;
        EXPECT_EQ(0u, out.find("0 <")) << out;
        EXPECT_NE(std::string::npos, out.find(" bytes of the log received.")) << out;
        EXPECT_TRUE(daemon.commands().ends_with("vex_syslog.sh -L -o /logfs -l 7 -s 512 &\n"));
    }
    /* Another tool takes the device over. */
    const std::string out =
        run_command("vex_log_tool stream syslog >/tmp/out 2>/tmp/err & cat /tmp/out & "
                    "exec 4</tmp/err; read told <&4; vex_log_tool modem >/dev/null; wait $!; cat <&4");
    EXPECT_NE(std::string::npos, out.find("Another log tool may have taken it over")) << out;
    EXPECT_TRUE(daemon.commands().ends_with(":1514 &\n")); /* nobody fights: no stop */
}

std::string piece(const std::string &total, const std::string &data)
{
    return frame(R"({"msgid":"2","GetLocalLog":{"totalLength":")" + total + R"("},"Result":"Success"})", data);
}

struct tool_case {
    std::string says; /* the device */
    int status;
    const char *words;
};

/* What the tool says of each device, before `after` is run. */
void check(
    const std::vector<tool_case> &cases, const std::string &command,
    const std::function<void(const tool_case &)> &after = [](const tool_case &) {})
{
    for (const tool_case &c : cases) {
        const fake_device device(c.says, false);
        int status = -1;
        const std::string at = " --host 127.0.0.1 --port " + device.port;
        const std::string out = run_command("vex_log_tool " + command + at, &status);
        EXPECT_EQ(c.status, status) << c.words;
        EXPECT_NE(std::string::npos, out.find(c.words)) << c.words << '\n' << out;
        EXPECT_TRUE(c.status == 0 || out.find("127.0.0.1 port " + device.port) != std::string::npos) << out;
        after(c);
    }
}

TEST(LogTool, StoresNothingButWholeArchives)
{
    const std::string not_packed =
        frame(R"({"msgid":"2","GetLocalLog":{"totalLength":"0"},"Result":"Fail:Compressed logfs error"})");
    run_command("mkdir /tmp/d; echo hello >/tmp/hello; tar -czf /tmp/good.tgz -C /tmp hello");
    const std::string good = read_file("/tmp/good.tgz");
    const std::string size = std::to_string(good.size());
    check(
        {
            {piece(size, good.substr(0, 50)) + piece(size, good.substr(50)), 0, "/tmp/d/a: 1 file\n"},
            {not_packed + piece(size, good), 0, "most likely a log changed while the logs were packed"},
            {not_packed + not_packed, 1, "answered \"Fail:Compressed logfs error\": most likely a log"},
            {frame(R"({"msgid":"2","Result":"Fail:Open log file error"})"), 1, "lost its archive. Try again"},
            {piece("99999999999", "x"), 1, "do not fit together"},
            {piece(size, good.substr(0, good.size() - 8) + std::string(4, 'c') + good.substr(good.size() - 4)), 1,
             "no whole gzip tar: incorrect data check"},
            {piece(size, good.substr(0, 50)) + piece("9999", good.substr(50)), 1, "do not fit together"},
            {piece("0", ""), 1, "do not fit together"},
            {piece(size, good.substr(0, 50)), 2, "ended before the answer was there"},
            {piece("90", good.substr(0, 90)), 1, "is no whole gzip tar: unexpected end of file"},
        },
        "archive /tmp/d/a --tries 2",
        [](const tool_case &c) { EXPECT_EQ(c.status == 0 ? "a\n" : "", run_command("ls /tmp/d; rm -f /tmp/d/*")); });
    const fake_device slow(piece(size, good.substr(0, 50)), true);
    EXPECT_EQ("2 vex_log_tool: interrupted\n",
              run_command("vex_log_tool archive /tmp/d/a --host 127.0.0.1 --port " + slow.port +
                          " 2>/tmp/said & until [ -s /tmp/d/a.* ]; do sleep 0.01; done; kill -INT $!; wait $!; "
                          "echo -n $? ''; grep -v received /tmp/said; ls /tmp/d"));
}

TEST(LogTool, SaysWhatWentWrongAndWhere)
{
    const std::string whole = frame(R"({"msgid":"3","Result":"Success"})");
    check(
        {
            {frame(R"({"msgid":"3","Result":"Fail:x"})"), 1, " answered \"Fail:x\""},
            {frame(""), 1, " refused the request"},
            {frame(R"({"msgid":"4","Result":"Success"})"), 1, " sent the reply to another command"},
            {"220 ready", 2, " sent is not a frame"},
            {"", 2, " ended before the answer was there"},
            {whole.substr(0, whole.size() - 1) + "!", 2, "is not a frame"},
            {frame(R"({"msgid":"3","Result":"\u001b[2J\u009b"})"), 1, "answered \"\\x1b[2J\xc2\\x9b\""},
        },
        "version");
    const auto says = [](const std::string &options, const std::string &words) {
        const std::string out = run_command("vex_log_tool version " + options);
        EXPECT_NE(std::string::npos, out.find(words)) << out;
    };
    says("--host ::1 --port 9", "cannot connect to ::1 port 9: Connection refused");
    const fake_device mute("", true);
    says("--host 127.0.0.1 --reply-timeout 0.2 --port " + mute.port,
         "sent nothing for 0.200 s. Either it is still at work");
    const fake_device slow(whole.substr(0, 20), true);
    says("--host 127.0.0.1 --stall-timeout 0.1 --port " + slow.port,
         "sent nothing for 0.100 s in the middle of an answer");
}

} // namespace

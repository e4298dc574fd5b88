#include "tests/daemon.h"
#include "tests/frame.h"

#include <atomic>
#include <csignal>
#include <fcntl.h>
#include <fstream>
#include <future>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>

namespace
{

const std::string kTls = "--cert /tmp/c/server.crt --key /tmp/c/server.key --ca /tmp/c/ca.crt";
constexpr char kImei[] = "356938035643809"; /* the simulated device's */

/* What a device says when it calls, and when it brings a stream. */
std::string control_link(const std::string &imei, const std::string &model = "VX-1")
{
    return frame(R"({"msgid":"9","ControlLink":{"VersionInfo":"V1","projectName":")" + model + R"(","imei":")" + imei +
                 R"(","modem_msn":"M1"},"Result":""})");
}

std::string data_link(const std::string &imei)
{
    return (R"({"msgid":"10","DataLink":{"imei":")" + imei + R"(","ConnectType":"syslog_connect"},"Result":""})");
}

/* A device of the test's own, that has called. */
struct called_device : tool_connection {
    explicit called_device(std::string name, const char *address = "127.0.0.1")
        : tool_connection(address, "5000"), imei(std::move(name))
    {
        send(control_link(imei));
    }
    /* Answers the next command, which has to be a question for the modem's mode. */
    void answer_mode(const std::string &result = "Success") const
    {
        EXPECT_EQ(kAskMode, receive());
        send(frame(mode_reply("online", result)));
    }
    /* Takes the order to start or end its system log. */
    void answer_stream(const char *action) const
    {
        const std::string order = receive();
        EXPECT_NE(std::string::npos, order.find(std::string(R"("LogType":"syslog","Action":")") + action)) << order;
        send(frame(R"({"msgid":"6","Result":"Success"})"));
    }
    /* Brings the stream. */
    tool_connection bring_stream() const
    {
        tool_connection link("127.0.0.1", "5000");
        EXPECT_NE(std::string::npos, link.ask(data_link(imei)).find("syslog_connect"));
        return link;
    }
    const std::string imei;
};

/* A tool at work in the background: what it has said so far, and says in the end. */
class working_tool
{
public:
    explicit working_tool(const std::string &words) : said_("/tmp/tool." + std::to_string(++g_count))
    {
        result_ = std::async(std::launch::async, [line = "vex_log_tool " + words + " >>" + path() + " 2>&1"] {
            int status = 0;
            run_command(line, &status);
            return status;
        });
    }
    ~working_tool()
    {
        if (result_.valid()) /* a test that has failed */
            run_command("killall -INT vex_log_tool");
    }
    bool says(const std::string &words) const { return said_.awaits(words); }
    std::string ends()
    {
        const int status = result_.get();
        return said_.text() + "= " + std::to_string(status) + '\n';
    }

private:
    static std::string path() { return "/tmp/tool." + std::to_string(g_count); }
    static inline int g_count = 0;
    written_log said_;
    std::future<int> result_;
};

class LogServer : public testing::Test
{
protected:
    void SetUp() override
    {
        setenv("VEX_LOG_SERVER", "/tmp/server.sock", 1);
        unsetenv("NOTIFY_SOCKET");
    }
    void TearDown() override { end(); }

    void start(const std::string &options)
    {
        log_ = std::make_unique<written_log>("/tmp/server.log");
        pid_ = fork();
        if (pid_ == 0) {
            const std::string line =
                "exec vex_log_server --listen [::]:5000 --tools /tmp/server.sock " + options + " 2>>/tmp/server.log";
            execl("/bin/sh", "sh", "-c", line.c_str(), nullptr);
            _exit(127);
        }
        ASSERT_TRUE(logs("ready "));
    }

    /* Ends the server as systemd does. */
    void end()
    {
        if (pid_ == -1)
            return;
        int status = 0;
        kill(pid_, SIGTERM);
        waitpid(pid_, &status, 0);
        pid_ = -1;
        EXPECT_EQ(0, status) << log_->text();
        EXPECT_EQ(0, log_->count("Sanitizer")) << log_->text();
    }

    bool logs(const std::string &words, long count = 1) const
    {
        return log_->awaits(words, count) || (ADD_FAILURE() << words << '\n' << log_->text(), false);
    }

    /* What the tool says to a command, and its exit status. */
    static std::string tool(const std::string &words)
    {
        int status = 0;
        std::string said = run_command("vex_log_tool " + words + " 2>&1", &status);
        return said + "= " + std::to_string(status) + '\n';
    }

    std::unique_ptr<written_log> log_;
    pid_t pid_ = -1;
};

void expect_all(const std::string &text, const std::vector<std::string> &words)
{
    for (const std::string &word : words)
        EXPECT_NE(std::string::npos, text.find(word)) << word << '\n' << text;
}

TEST_F(LogServer, PassesEveryCommandOn)
{
    ASSERT_EQ("", run_command(SOURCE_DIR "/device/certificates /tmp/c"));
    run_command("head -c 3000000 /dev/urandom >/logfs/noise; mkdir -p /tmp/p/conf; touch /tmp/p/conf/Diag.cfg; "
                "tar -cf /tmp/p.tar -C /tmp/p conf");
    const std::string device = std::string("--device ") + kImei + ' ';
    for (const auto &[tls_off, options, address] :
         {std::tuple{"1", std::string("--plain"), "127.0.0.1"}, {"0", kTls, "::1"}, {"", kTls, "localhost"}}) {
        set_nv("log_use_ssl_disable", tls_off);
        start(options + " --store /tmp/st");
        daemon_process daemon({"-a", address, "-p", "5000x", "-r", "3"});
        for (const auto &[command, words] :
             {std::pair{"--wait 20 version", "IMEI              356938035643809\n"},
              {"bsp usb err", "usb: log level err: the device was"},
              {"archive --store /tmp/a.tgz", "Log archive stored as"},
              {"modem", "set to: online\n"},
              {"--json modem", R"({"msgid":"11","mode_lpm_online":"online","Result":"Success"})"},
              {"config /tmp/p.tar", "taken the package of 10240 bytes"},
              {"stream qxdm --for 0.5 --output /tmp/modem.log", " kB of the log received."}}) {
            const std::string said = tool(device + command);
            EXPECT_NE(std::string::npos, said.find(words)) << said;
            EXPECT_NE(std::string::npos, said.find("= 0\n")) << said;
        }
        EXPECT_EQ("", run_command("tar -xOzf /tmp/a.tgz logfs/noise | cmp - /logfs/noise"));
        EXPECT_EQ("", run_command("cmp /tmp/st/*/archive-*.tgz /tmp/a.tgz; rm -r /tmp/st"));
        EXPECT_EQ("DIAG", run_command("head -c 4 /tmp/modem.log; rm /tmp/modem.log"));
        expect_all(tool("devices"), {kImei, "VX-520", "VX52021A00417", " 6 Success\n= 0\n"});
        end();
        EXPECT_EQ(0, daemon.wait_exit());
        EXPECT_EQ(*tls_off == '1' ? 0 : 2, daemon.logged("very good ,log_server check ok "));
    }
}

TEST_F(LogServer, KeepsDevicesApart)
{
    start("--plain");
    const called_device one("1111");
    called_device two("2222");
    ASSERT_TRUE(logs("called ", 2));
    expect_all(tool("devices"), {"\n1111 ", "\n2222 ", "VX-1", "M1", "127.0.0.1", "= 0\n"});
    EXPECT_EQ("vex_log_tool: the log server says: no device 3333 is connected\n= 2\n", tool("--device 3333 modem"));
    EXPECT_NE(std::string::npos, tool("modem").find("Name it with --device")); /* which of the two? */

    working_tool waiting("--device 3333 --wait 60 modem");
    ASSERT_TRUE(waiting.says("Waiting: the device is not connected.\n"));
    const called_device three("3333");
    three.answer_mode();
    expect_all(waiting.ends(), {"online\n= 0\n"});

    working_tool first("--device 2222 modem");
    EXPECT_EQ(kAskMode, two.receive());
    working_tool second("--device 2222 modem");
    ASSERT_TRUE(second.says("Waiting: the device is at work for root with command 11.\n"));
    two.send(frame(kOnline));
    two.answer_mode("Fail");
    expect_all(first.ends(), {"online\n= 0\n"});
    expect_all(second.ends(), {"= 1\n"});

    working_tool all("--all modem");
    one.answer_mode();
    two.answer_mode("Fail");
    three.answer_mode();
    expect_all(all.ends(), {"1111             done ", "2222             failed ", "3333             done ", "= 1\n"});
    working_tool some("--device 1111 --device 3333 --parallel 1 --json modem");
    one.answer_mode();
    three.answer_mode();
    expect_all(some.ends(), {R"({"imei":"1111","status":0,"reply":{"msgid":"11",)", R"({"imei":"3333",)", "= 0\n"});
    expect_all(tool("devices"), {" 11 Success\n2222 ", " 11 Fail\n3333 "});
}

/* A command is over when its device has hung up or called again, and is given to nobody a second time. */
TEST_F(LogServer, EndsACommandWithItsDeviceOrItsTool)
{
    start("--plain");
    working_tool watching("devices --watch");
    ASSERT_TRUE(watching.says("IMEI "));
    auto device = std::make_unique<called_device>("1111");
    ASSERT_TRUE(watching.says("called 1111 "));
    working_tool cut("--device 1111 modem");
    EXPECT_EQ(kAskMode, device->receive());
    working_tool queued("--device 1111 modem");
    ASSERT_TRUE(queued.says("Waiting: "));
    auto again = std::make_unique<called_device>("1111");
    EXPECT_EQ("(closed)", device->receive());
    expect_all(cut.ends(), {"the device has hung up: it has called again\n= 2\n"});
    expect_all(queued.ends(), {"the device has hung up\n= 2\n"});
    ASSERT_TRUE(watching.says("left 1111 "));

    working_tool gone("--device 1111 --reply-timeout 0.05 modem");
    EXPECT_EQ(kAskMode, again->receive());
    expect_all(gone.ends(), {"= 2\n"});
    working_tool next("--device 1111 raw '{\"msgid\":\"3\"}'");
    ASSERT_TRUE(next.says("Waiting: "));
    again->send(frame(kOnline)); /* for the tool that is gone */
    EXPECT_EQ(R"({"msgid":"3"})", again->receive());
    again->send(frame(kOnline)); /* nobody has asked */
    ASSERT_TRUE(logs("unasked "));
    again->send(frame(R"({"msgid":"3","Result":"Success"})"));
    expect_all(next.ends(), {"\"Success\"", "= 0\n"});

    working_tool last("--device 1111 modem");
    EXPECT_EQ(kAskMode, again->receive());
    end();
    expect_all(last.ends(), {"= 2\n"});
    EXPECT_EQ("(closed)", again->receive());
    expect_all(watching.ends(), {"= 2\n"});
}

TEST_F(LogServer, IsNotTroubledByHostileCallers)
{
    start("--plain --announce-timeout 2 --per-address 40 --metrics 127.0.0.1:9100");
    const called_device other("1111", "::1"); /* the first to say so is */
    ASSERT_TRUE(logs("called imei=\"1111\""));
    const called_device taken("1111");
    const called_device good("2222", "::1");
    const tool_connection silent("127.0.0.1", "5000");
    const tool_connection slow("127.0.0.1", "5000");
    slow.send("#~");
    for (const auto &[bytes, why] :
         {std::pair{std::string("GET / HTTP/1.1\r\n\r\n"), "it did not say who it is: what it sends is no frame"},
          {std::string("#~\xff\xff\xff\xff"), "it did not say who it is: what it sends is no frame"},
          {frame("no JSON"), "why=\"it did not say who it is\""},
          {frame(kAskMode), "why=\"it did not say who it is\""},
          {control_link("../../etc"), "its IMEI is none: ../../etc"},
          {control_link(""), "its IMEI is none: \""},
          {frame(data_link("2222")), "it brings a stream of a device that it is not"},
          {frame(data_link("4444")), "it brings a stream of a device that it is not"}}) {
        const tool_connection caller("127.0.0.1", "5000");
        caller.send(bytes);
        EXPECT_EQ("(closed)", caller.receive()) << why;
        ASSERT_TRUE(logs(why));
    }
    const tool_connection own("::1", "5000");
    own.send(frame(data_link("2222")));
    EXPECT_EQ("(closed)", own.receive());
    ASSERT_TRUE(logs("it brings a stream that nobody waits for"));

    std::vector<std::unique_ptr<tool_connection>> crowd;
    for (int i = 0; i < 60; ++i)
        crowd.push_back(std::make_unique<tool_connection>("127.0.0.1", "5000"));
    ASSERT_TRUE(logs("too many connections from its address"));
    working_tool served("--device 2222 modem");
    good.answer_mode();
    expect_all(served.ends(), {"online\n= 0\n"});
    EXPECT_EQ("(closed)", silent.receive());
    EXPECT_EQ("(closed)", slow.receive());
    EXPECT_EQ("(closed)", taken.receive());
    ASSERT_TRUE(logs("another device is connected as this one: 1111"));
    crowd.clear();

    const called_device painter("5555");
    ASSERT_TRUE(logs("imei=\"5555\""));
    const tool_connection red("::1", "5000");
    red.send(control_link("6666", "\\u001b[31mred\\u009b"));
    ASSERT_TRUE(logs("imei=\"6666\""));
    EXPECT_EQ(std::string::npos, (tool("devices") + log_->text()).find_first_of("\x1b\x9b"));
    expect_all(run_command("printf 'GET /metrics HTTP/1.0\\r\\n\\r\\n' | busybox nc 127.0.0.1 9100"),
               {"HTTP/1.1 200 OK", "vex_devices 4", "vex_refused_total{why=\"its IMEI is none\"} 2\n"});
}

TEST_F(LogServer, OutlastsAnEndlessArchive)
{
    start("--plain");
    const called_device good("1111");
    const called_device endless("2222");
    ASSERT_TRUE(logs("called ", 2));
    working_tool fetching("--device 2222 archive /tmp/endless");
    EXPECT_TRUE(endless.receive().starts_with(R"({"msgid":"2")"));
    const std::string piece = frame(R"({"msgid":"2","GetLocalLog":{"totalLength":"1000000000000"},"Result":"Success"})",
                                    std::string(4000, 'x'));
    std::atomic<bool> over = false;
    std::thread sender([&] {
        while (!over && ::send(endless.fd.get(), piece.data(), piece.size(), MSG_NOSIGNAL) > 0) {
        }
    });
    for (int i = 0; i < 5; ++i) {
        working_tool served("--device 1111 modem");
        good.answer_mode();
        expect_all(served.ends(), {"online\n= 0\n"});
    }
    run_command("killall -INT vex_log_tool");
    expect_all(fetching.ends(), {"2222"});
    working_tool served("--device 1111 modem");
    good.answer_mode();
    expect_all(served.ends(), {"online\n= 0\n"});
    over = true;
    sender.join();
}

/* Only who shows a certificate of the right CA is served, as whom it says. */
TEST_F(LogServer, KnowsItsPeersByTheirCertificates)
{
    ASSERT_EQ("", run_command(SOURCE_DIR "/device/certificates /tmp/c"));
    ASSERT_EQ("",
              run_command(SOURCE_DIR "/device/certificates /tmp/o")); /* the operators' CA, the devices' of no use */
    run_command(
        "cd /tmp/c; cp device.crt /tmp/first.crt; cp device.key /tmp/first.key; openssl req -newkey ec -pkeyopt "
        "ec_paramgen_curve:prime256v1 -nodes -keyout imei.key -out imei.csr -subj /CN=1111 2>/dev/null; openssl "
        "x509 -req -in imei.csr -CA ca.crt -CAkey ca.key -CAcreateserial -out imei.crt -days 30 2>/dev/null");
    start(kTls + " --require-imei-in-certificate --tools-listen 127.0.0.1:5001 --tools-ca /tmp/o/ca.crt");
    const auto call = [](const std::string &name, const std::string &bytes, const char *what) {
        std::ofstream(std::string("/tmp/") + what) << bytes;
        run_command("(cat /tmp/" + std::string(what) +
                    "; until [ -e /tmp/enough ]; do sleep 0.01; done) | openssl "
                    "s_client -quiet -connect 127.0.0.1:5000 -cert " +
                    name + ".crt -key " + name + ".key >/tmp/" + what + ".out 2>&1 &");
    };
    call("/tmp/c/imei", control_link("2222"), "wrong");
    ASSERT_TRUE(logs("its certificate is for another: 1111, not 2222"));
    call("/tmp/o/device", control_link("1111"), "stranger");
    ASSERT_TRUE(logs("its certificate is not accepted: "));
    call("/tmp/c/imei", control_link("1111"), "right");
    ASSERT_TRUE(logs("called imei=\"1111\""));
    call("/tmp/first", frame(data_link("1111")), "thief");
    ASSERT_TRUE(logs("it brings a stream of a device that it is not"));

    const std::string remote = "--server 127.0.0.1:5001 --ca /tmp/c/ca.crt --connect-timeout 5 ";
    const std::string ours = "--cert /tmp/o/server.crt --key /tmp/o/server.key ";
    expect_all(tool(remote + ours + "devices"), {"\n1111 ", "= 0\n"});
    for (const char *const who : {"/tmp/c/device", "/tmp/c/imei"})
        expect_all(tool(remote + "--cert " + who + ".crt --key " + who + ".key devices"), {"= 2\n"});
    expect_all(tool("--server 127.0.0.1:5001 --ca /tmp/o/ca.crt " + ours + "devices"), {"no TLS with ", "= 2\n"});

    /* New certificates: the one is taken, one without its key is not; who is connected stays. */
    run_command("cd /tmp/o; cp server.crt /tmp/c/server.crt; cp server.key /tmp/c/server.key");
    kill(pid_, SIGHUP);
    ASSERT_TRUE(logs("certificates were loaded again"));
    expect_all(tool("--server 127.0.0.1:5001 --ca /tmp/o/ca.crt " + ours + "devices"), {"\n1111 ", "= 0\n"});
    run_command("rm /tmp/c/server.key");
    kill(pid_, SIGHUP);
    ASSERT_TRUE(logs("certificates stay as they were"));
    expect_all(tool("--server 127.0.0.1:5001 --ca /tmp/o/ca.crt " + ours + "devices"), {"\n1111 ", "= 0\n"});
    expect_all(log_->text(), {"ready ", "certificate ends in days=\""});
    run_command("touch /tmp/enough");
}

TEST_F(LogServer, KeepsLogsAndTellsOfGaps)
{
    start("--plain --store /tmp/st --stream syslog");
    const std::string kept =
        "cat /tmp/st/1111/syslog-*.log | sed -E 's/^[-0-9]{10}T[0-9:.]{12}Z /TIME /; s/for [0-9]+ s/for N s/'";
    auto device = std::make_unique<called_device>("1111");
    device->answer_stream("start");
    auto link = std::make_unique<tool_connection>(device->bring_stream());
    link->send("one\ntw");
    link->send("o\nthree");
    working_tool shown("--device 1111 stream syslog --for 3600");
    ASSERT_TRUE(shown.says("Ctrl-C"));
    link->send("!\nfour\nhalf");
    ASSERT_TRUE(shown.says("four\nhalf"));
    link.reset();
    expect_all(shown.ends(), {"four\nhalf", "it hung up", "= 2\n"});
    device->answer_stream("start"); /* again, after a moment */
    link = std::make_unique<tool_connection>(device->bring_stream());
    link->send("five\n");
    device.reset();
    EXPECT_EQ("(closed)", link->receive());
    device = std::make_unique<called_device>("1111");
    device->answer_stream("start");
    link = std::make_unique<tool_connection>(device->bring_stream());
    link->send("six\n");
    while (run_command(kept).find("six") == std::string::npos)
        std::this_thread::yield();
    end();
    EXPECT_EQ("TIME one\nTIME two\nTIME three!\nTIME four\nTIME half\n"
              "TIME # vex_log_server: nothing came for N s: it hung up\nTIME five\n"
              "TIME # vex_log_server: nothing came for N s: the device has hung up\nTIME six\n",
              run_command(kept));
    EXPECT_EQ(
        "called\ncommand\ngap\n",
        run_command("grep -o '\"event\":\"[a-z]*' /tmp/st/events-*.jsonl | cut -d'\"' -f4 | sort -u | grep -v left"));
}

TEST_F(LogServer, KeepsNoMoreThanThereIsRoomFor)
{
    run_command("mkdir /tmp/st; mount -t tmpfs -o size=400k none /tmp/st; mkdir /tmp/st/old; head -c 150000 /dev/zero "
                ">/tmp/st/old/syslog-2020-01-01.log; touch -d 2020-01-01 /tmp/st/old/*; echo >/tmp/st/old/new");
    const auto sends = [](const tool_connection &link, int count, const char *last) {
        std::string lines;
        for (int i = 0; i < count; ++i)
            lines += std::string(99, 'x') + '\n';
        link.send(lines + last + '\n');
    };
    const auto awaits = [](const std::string &condition) {
        run_command("for i in $(seq 1000); do " + condition + " && exit; sleep 0.01; done");
    };
    start("--plain --store /tmp/st --stream syslog --rotate 60KB --store-limit 200KB");
    called_device device("1111");
    device.answer_stream("start");
    const tool_connection first = device.bring_stream();
    sends(first, 700, "first");
    awaits("grep -q first /tmp/st/1111/*");
    EXPECT_EQ("new\n", run_command("ls /tmp/st/old"));
    sends(first, 700, "second");
    awaits("grep -q second /tmp/st/1111/*");
    sends(first, 700, "third");
    awaits("grep -q third /tmp/st/1111/*");
    EXPECT_GT(200001, std::stol(run_command("cat $(find /tmp/st -type f) | wc -c")));
    EXPECT_NE("1\n", run_command("ls /tmp/st/1111 | wc -l"));
    end();
    const std::string all = run_command("cat /tmp/st/1111/* | sort");
    start("--plain --store /tmp/st --rotate 60KB --compress");
    awaits("[ $(ls /tmp/st/1111/*.log | wc -l) = 1 ]"); /* to which more may come today */
    EXPECT_EQ(all, run_command("(zstd -dcq /tmp/st/1111/*.zst; cat /tmp/st/1111/*.log) | sort"));
    end();

    run_command("head -c 1000000 /dev/zero >/tmp/st/old/full 2>/dev/null"); /* no room, for somebody else's fault */
    start("--plain --store /tmp/st --stream syslog --store-limit 1GB --metrics 127.0.0.1:9100");
    const called_device again("1111");
    again.answer_stream("start");
    const tool_connection second = again.bring_stream();
    sends(second, 700, "fourth");
    awaits("! printf 'GET /metrics HTTP/1.0\\r\\n\\r\\n' | busybox nc 127.0.0.1 9100 | grep -q 'lost_bytes_total 0'");
    run_command("mount -o remount,size=2m /tmp/st");
    sends(second, 1, "fifth");
    awaits("grep -q fifth /tmp/st/1111/*");
    const std::string kept = run_command("cat /tmp/st/1111/syslog*");
    expect_all(kept, {" bytes are missing: No space left on device\n", "Z fifth\n"});
    EXPECT_LT(kept.find("are missing"), kept.find("Z fifth"));
}

} // namespace

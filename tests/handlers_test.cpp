#include "device/diag_record.h"
#include "tests/daemon.h"
#include "tests/frame.h"

#include <arpa/inet.h>
#include <filesystem>
#include <fstream>
#include <netinet/in.h>
#include <sys/socket.h>
#include <tuple>

namespace
{

using std::filesystem::exists;

const std::string kGetArchive = R"({"msgid":"2"})";
const std::string kNotPacked =
    R"({"msgid":"2","GetLocalLog":{"totalLength":"0"},"Result":"Fail:Compressed logfs error"})";

struct handler_case {
    std::string request;
    std::string reply;    /* of the good command behind it where the request has none */
    std::string commands; /* the shell lines that it runs */
};

class Handlers : public Daemon
{
protected:
    /* Starts the daemon and connects a tool to it. */
    void connect(const char *address = "192.168.0.1")
    {
        start();
        tool_ = std::make_unique<tool_connection>(address);
        daemon_->commands();
    }
    void check(const std::vector<handler_case> &cases)
    {
        for (const handler_case &c : cases) {
            tool_->send(frame(c.request));
            if (c.reply == kOnline)
                tool_->send(frame(kAskMode));
            EXPECT_EQ(c.reply, tool_->receive()) << c.request;
            EXPECT_EQ(c.commands, daemon_->commands()) << c.request;
        }
    }
    std::string push(const std::string &total, const std::string &data)
    {
        return tool_->ask(R"({"msgid":"1","conf_file":{"totalLength":")" + total + "\"}}", data);
    }

    std::unique_ptr<tool_connection> tool_;
};

std::string result(const std::string &head, const std::string &result)
{
    return head + R"(,"Result":")" + result + "\"}";
}

const std::string kInternal = "Fail:Device internal error";
const std::string kTar = result(R"({"msgid":"1","conf_file":{"totalLength":""})", "Success");
const std::string kTarFail = result(R"({"msgid":"1","conf_file":{"totalLength":""})", kInternal);

std::string stream_reply(const std::string &protocol, const std::string &port, const std::string &ip,
                         const std::string &said = "Success")
{
    return result(R"({"msgid":"6","realtimeLog":{"LogType":"","Action":"","protocol":")" + protocol + R"(","port":")" +
                      port + R"(","ip":")" + ip + "\"}",
                  said);
}

std::string stream_request(const std::string &log, const std::string &action)
{
    return R"({"msgid":"6","realtimeLog":{"LogType":")" + log + R"(","Action":")" + action + "\"}}";
}

TEST_F(Handlers, SetAndTellTheSystemLogsParameters)
{
    connect();
    const auto request = [](const std::string &level, const std::string &size) {
        return R"({"msgid":"4","SyslogParaSet":{"sysloglevel":")" + level + R"(","syslogsize":")" + size + "\"}}";
    };
    const auto reply = [](const std::string &values, const std::string &said = "Success") {
        return result(R"({"msgid":"4","syslogParaSet":{)" + values + "}", said);
    };
    const std::string stored = reply(R"("sysloglevel":"7","syslogsize":"512","syslogsizeMax":"20480")");
    const std::string script = "sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o /logfs -l ";
    check({{request("", ""), stored, ""},
           {request("5", ""), stored, ""},
           {request("5", "0123456789abcdef"), reply(R"("sysloglevel":"","syslogsize":"")", kInternal), ""},
           {request("5", "0123456789abcde"), reply(R"("sysloglevel":"5","syslogsize":"0123456789abcde")"),
            script + "5 -s 0123456789abcde &\n"}});
    const std::string refused = reply(R"("sysloglevel":"","syslogsize":"")", kInternal);
    for (const char *mark : {";", "&",    "|", "<", ">", "(", ")", "$",   "`",       "\\\"",
                             "'", "\\\\", "#", "*", "?", "[", "~", "\\n", "\\u0001", "\\u007f"})
        check({{request(std::string("7") + mark, "64"), refused, ""},
               {request("7", std::string(mark) + '6'), refused, ""}});
    EXPECT_EQ(20, daemon_->logged("syslogsize has a character that the shell would interpret, refused"));
    check({{request(" 5 -x", "{%]=!"), reply(R"("sysloglevel":" 5 -x","syslogsize":"{%]=!")"),
            script + " 5 -x -s {%]=! &\n"}});
    /* While the log is streamed, the values wait for the stream's end. */
    tool_->ask(stream_request("syslog", "start"));
    daemon_->commands();
    check({{request("3", "99"), reply(R"("sysloglevel":"3","syslogsize":"99")"), ""},
           {stream_request("syslog", "end"), stream_reply("udp", "0", ""),
            "killall -9 syslogd\n" + script + "3 -s 99 &\n"}});
    EXPECT_EQ("3 99", get_nv("syslog_level") + ' ' + get_nv("syslog_size"));
    set_nv("syslog_level", "7'"); /* kept by a daemon that refused nothing */
    set_nv("syslog_size", ";reboot #");
    check({{stream_request("syslog", "end"), stream_reply("udp", "0", ""),
            "killall -9 syslogd\n" + script + " -s  &\n"}});
    EXPECT_TRUE(daemon_->logs("syslog_size = [;reboot #] has a character that the shell would interpret, not used"));
}

TEST_F(Handlers, CapturePackets)
{
    connect();
    const auto request = [](const std::string &members) { return R"({"msgid":"5","tcpdump":{)" + members + "}}"; };
    const std::string done = result(R"({"msgid":"5","tcpdump":{"interfaceName":"","Action":""})", "Success");
    const std::string stop = "killall tcpdump\n";
    const std::string again = stop + "rm -rf /logfs/*.pcap\n";
    install_program("killall", "exit 1"); /* there is nothing to stop, */
    install_program("tcpdump", "exit 1"); /* and nothing to capture from */
    check(
        {{request(R"("interfacename":"wan,lan","Action":"start")"), done,
          again + "tcpdump -i wan0 -s 128 -w /logfs/wan0.pcap &\ntcpdump -i bridge0 -s 128 -w /logfs/bridge0.pcap &\n"},
         {request(R"("InterfaceName":"usb0,,0123456789abcdefgh,lo,fifth","Action":"start","TcpdumpLen":"64")"), done,
          again + "tcpdump -i usb0 -s 64 -w /logfs/usb0.pcap &\ntcpdump -i  -s 64 -w /logfs/.pcap &\n"
                  "tcpdump -i 0123456789abcde -s 64 -w /logfs/0123456789abcde.pcap &\n"
                  "tcpdump -i lo -s 64 -w /logfs/lo.pcap &\n"},
         {request(R"("InterfaceName":"","Action":"end")"), done, stop},
         {request(R"("InterfaceName":"lo","Action":"restart")"), done, ""}});
    forget_nv();
    check({{request(R"("InterfaceName":"wan,lo","Action":"start","TcpdumpLen":"all")"), done,
            stop + "rm -rf /*.pcap\ntcpdump -i  -s 0 -w /.pcap &\ntcpdump -i lo -s 0 -w /lo.pcap &\n"}});
}

TEST_F(Handlers, KeepModuleLevels)
{
    const std::string longest(31, 'n');
    const std::string script = "sh /usr/vex/vex_conf/scripts/klog_mod.sh ";
    set_nv("bsplog_module_level",
           "old,1;bad one,2;x,$(reboot);" + longest + ',' + longest + "n;info,info;nolevel;;usb,err,more;");
    start();
    EXPECT_EQ(0u,
              daemon_->commands().find(script + "old 1\n" + script + "usb err\nsh /usr/vex/vex_conf/scripts/vex_s"));
    EXPECT_EQ(4, daemon_->logged("] is skipped"));
    EXPECT_EQ(1, daemon_->logged("bsplog_module_level: [x,$(reboot)] is skipped"));
    tool_ = std::make_unique<tool_connection>();
    const auto request = [](const std::string &name, const std::string &level) {
        return R"({"msgid":"8","bsp":{"module_name":")" + name + R"(","level":")" + level + "\"}}";
    };
    const auto reply = [](const std::string &name, const std::string &level, const std::string &said) {
        return result(R"({"msgid":"8","bsp":{"module_name":")" + name + R"(","level":")" + level + "\"}", said);
    };
    const auto set = [&](const std::string &name, const std::string &level) {
        return handler_case{request(name, level), reply(name, level, "Success"), script + name + ' ' + level + '\n'};
    };
    const std::string refused = reply("", "", "Fail:parameter error");
    set_nv("bsplog_module_level", "wlan,debug;nolevel;;usb,err,more;");
    check({{request("usb", ""), reply("usb", "err", "Success"), ""},
           {request("nolevel", ""), reply("nolevel", "info", "Success"), ""},
           {request("", "debug"), reply("", "", "Fail:unkonw bsp module name"), ""},
           {request("a;reboot", ""), reply("a;reboot", "info", "Success"), ""},
           {request(std::string(900, 'a'), ""), reply(std::string(900, 'a'), "info", "Success"), ""},
           {request(std::string(901, 'a'), ""), refused, ""},
           {request("a\\\"b", ""), refused, ""},
           {request("a;reboot", "1"), refused, ""},
           {request("a\\u0000;b", "1"), kOnline, ""},
           {request("wlan", "$(id)"), refused, ""},
           {request(longest + "n", "1"), refused, ""},
           set("usb", "info"),
           set(longest, "2")});
    EXPECT_EQ("wlan,debug;usb,info;" + longest + ",2;", get_nv("bsplog_module_level"));
    EXPECT_EQ("2\n", read_file("/run/vex/klog/" + longest));
    /* 32 entries count, and 1023 characters. */
    std::string full;
    for (int i = 0; i < 33; ++i)
        full += 'm' + std::to_string(i) + ",1;";
    set_nv("bsplog_module_level", full);
    check({{request("m32", ""), reply("m32", "info", "Success"), ""}, set("new", "1")});
    EXPECT_EQ(full.substr(0, full.find("m32")) + "new,1;", get_nv("bsplog_module_level"));
    EXPECT_EQ(1, daemon_->logged("bsplog_module_level has no room for new: only its first 32 entries are looked at"));
    EXPECT_EQ(1, daemon_->logged("bsplog_module_level: [nolevel] has no level, dropped"));
    full.clear();
    for (int i = 0; i < 16; ++i)
        full.append(28, static_cast<char>('a' + i)).append(1, ',').append(30, '1').append(1, ';');
    set_nv("bsplog_module_level", full + "x," + std::string(1023 - full.size() - 3, '1') + ';');
    check({set("x", "2"), {request(longest, longest), refused, ""}});
}

TEST_F(Handlers, UnpackAPackageAndStartItsScript)
{
    connect();
    run_command("mkdir -p /tmp/p/conf/sub && cd /tmp/p/conf && head -c 90000 /dev/urandom >a && "
                "echo 'mkfifo /tmp/go; echo ran >/tmp/go' >vex_config_sys.sh && tar -C /tmp/p -cf /tmp/p.tar "
                "conf/sub conf/a conf/vex_config_sys.sh");
    const std::string package = read_file("/tmp/p.tar");
    const std::string total = std::to_string(package.size());
    /* Half of it from a tool that goes away; the reset keeps the count right but leaves the half in front. */
    EXPECT_EQ(kTar, push(total, package.substr(0, 50000)));
    tool_ = std::make_unique<tool_connection>("::1");
    EXPECT_EQ(kTar, push(total, ""));
    EXPECT_EQ(kTar, push("0", ""));
    EXPECT_EQ(kTar, push(total, package.substr(0, 60000)));
    EXPECT_FALSE(exists("/logfs/logconf"));
    EXPECT_EQ(110000u, std::filesystem::file_size("/logfs/logconf.tar"));
    EXPECT_EQ("", daemon_->commands());
    EXPECT_EQ(kTar, push(total, package.substr(60000))); /* cannot be unpacked: only the log says so */
    EXPECT_FALSE(exists("/logfs/logconf.tar"));
    EXPECT_LT(0, daemon_->logged("[cd /logfs/logconf/ && tar -xf /logfs/logconf.tar] System error3"));
    EXPECT_EQ(1, daemon_->logged("logconf file has " + std::to_string(50000 + package.size()) + " bytes, " + total +
                                 " were announced"));
    daemon_->commands();
    EXPECT_EQ(kTar, push(total, package.substr(0, 60000)));
    EXPECT_EQ(kTar, push(total, package.substr(60000)));
    EXPECT_EQ("rm -rf /logfs/logconf/\nmkdir /logfs/logconf/\ncd /logfs/logconf/ && tar -xf /logfs/logconf.tar\n"
              "cd /logfs/logconf/conf/ && cp * /logfs/logconf/\nrm -rf /logfs/logconf/conf/\n"
              "rm -rf /logfs/logconf.tar\nsh /logfs/logconf//vex_config_sys.sh &\n",
              daemon_->commands());
    EXPECT_EQ(read_file("/tmp/p/conf/a"), read_file("/logfs/logconf/a"));
    EXPECT_EQ("ran\n", run_command("until [ -p /tmp/go ]; do sleep 0.01; done; cat /tmp/go"));
    /* More than was announced never completes, nor does nothing at all. */
    EXPECT_EQ(kTar, push("10", "0123456789a"));
    EXPECT_EQ(kTar, push("0", "bcdef"));
    EXPECT_EQ("0123456789abcdef", read_file("/logfs/logconf.tar"));
    EXPECT_EQ("", daemon_->commands());
    /* No room, then no file to append to. */
    run_command("mount -t tmpfs -o size=64k small /logfs");
    EXPECT_EQ(kTar, push("0", ""));
    EXPECT_EQ(kTar, push("120000", std::string(50000, 'x')));
    EXPECT_EQ(kTarFail, push("120000", std::string(50000, 'x')));
    EXPECT_TRUE(daemon_->logs("write fail,wrCount=15536,dataLen=50000"));
    run_command("rm /logfs/logconf.tar; mkdir /logfs/logconf.tar");
    EXPECT_EQ(kTarFail, push("5", "12345"));
    EXPECT_EQ(kOnline, tool_->ask(kAskMode));
}

TEST_F(Handlers, SendTheLogArchive)
{
    connect();
    for (const std::size_t size : {51201u, 102400u}) {
        const std::string total = std::to_string(size);
        install_program("tar", "head -c " + total + " /dev/urandom >/tmp/packed; cp /tmp/packed $2");
        tool_->send(frame(kGetArchive));
        const std::string control = result(R"({"msgid":"2","GetLocalLog":{"totalLength":")" + total + "\"}", "Success");
        std::string first, second;
        EXPECT_EQ(control, tool_->receive(&first));
        EXPECT_EQ(control, tool_->receive(&second));
        EXPECT_EQ(51200u, first.size());
        EXPECT_TRUE(first + second == read_file("/tmp/packed"));
        EXPECT_EQ(kOnline, tool_->ask(kAskMode));
        EXPECT_EQ("sh /usr/vex/vex_conf/scripts/vex_debug.sh get_status\ntar -czvf /tmp/MBBlogfs.tar.gz /logfs/\n"
                  "rm -rf /tmp/MBBlogfs.tar.gz\n",
                  daemon_->commands());
    }
    for (const char *tar : {"cp /tmp/packed $2; exit 1", ": >$2", "rm -f $2"}) {
        install_program("tar", tar);
        EXPECT_EQ(kNotPacked, tool_->ask(kGetArchive)) << tar;
    }
    install_program("tar", "rm $2; mkdir $2"); /* something that cannot be read: no piece follows */
    tool_->send(frame(kGetArchive) + frame(kAskMode));
    EXPECT_EQ(kOnline, tool_->receive());
    EXPECT_EQ(1, daemon_->logged("log_msg_get_log_file:send data fail"));
    install_program("tar", "exit 1");
    for (const auto &[used, makes_room] : {std::pair{"95", false}, {"96", true}, {"x", false}}) {
        install_program("df", "echo fs 20M 1M 1M " + std::string(used) + "% /logfs");
        daemon_->commands();
        EXPECT_EQ(kNotPacked, tool_->ask(kGetArchive));
        EXPECT_EQ(makes_room, daemon_->commands().find("rm -rf /logfs/syslog*\nsh ") == 0) << used;
    }
    check({{R"({"msgid":"7","CleanLocalLog":"no"})", R"({"msgid":"7","CleanLocalLog":"","Result":"Success"})",
            "rm -rf /logfs/*\n"}});
}

/* Whatever another user has laid in its place. */
TEST_F(Handlers, MakeTheLogArchiveTheirOwn)
{
    install_program("tar", "stat -c '%a %h %F' $2 >/tmp/stat; echo logs >$2");
    connect();
    for (const char *laid : {"ln -s /tmp/file $archive", "ln file $archive; chmod 666 file", "mkdir -p $archive/folder",
                             "mkfifo $archive", "ln -s / $archive"}) {
        run_command("cd /tmp; echo old >file; archive=MBBlogfs.tar.gz; " + std::string(laid));
        tool_->send(frame(kGetArchive));
        std::string data;
        EXPECT_EQ(result(R"({"msgid":"2","GetLocalLog":{"totalLength":"5"})", "Success"), tool_->receive(&data))
            << laid;
        EXPECT_EQ("logs\n", data) << laid;
        EXPECT_EQ("600 1 regular empty file\n", read_file("/tmp/stat")) << laid;
        EXPECT_EQ("old\n", read_file("/tmp/file")) << laid;
        EXPECT_EQ(kOnline, tool_->ask(kAskMode));
    }
}

TEST_F(Handlers, StopAnArchiveWhoseToolIsReplaced)
{
    install_program("tar", "head -c 20000000 /dev/zero >$2");
    connect();
    tool_->send(frame(kGetArchive) + frame(kGetArchive));
    std::string piece;
    tool_->receive(&piece);
    EXPECT_EQ(51200u, piece.size());
    EXPECT_EQ(kOnline, tool_connection("::1").ask(kAskMode)) << "and nothing of the archive";
    EXPECT_EQ(1, daemon_->logged("send data fail"));
    EXPECT_EQ(0, daemon_->logged("read file all data, complete"));
    EXPECT_FALSE(exists("/tmp/MBBlogfs.tar.gz"));
}

TEST_F(Handlers, StreamTheSystemLogToTheTool)
{
    install_program("killall", "");
    install_program("syslogd", "");
    connect();
    for (const auto &[tool, target, device] : {std::tuple{"192.168.0.1", "192.168.0.1", "192.168.0.1"},
                                               {"127.0.0.1", "127.0.0.1", "10.64.0.2"},
                                               {"::1", "[0:0:0:0:0:0:0:1]", "fd00::2"}}) {
        tool_ = std::make_unique<tool_connection>(tool);
        check({{stream_request("syslog", "start"), stream_reply("udp", "1514", device),
                "killall -9 syslogd\nsyslogd -R " + std::string(target) + ":1514 &\n"}});
    }
    check({{stream_request("syslog", "stop"), "", ""}, {stream_request("Syslog", "start"), "", ""}});
    forget_nv();
    check({{stream_request("syslog", "start"), stream_reply("udp", "1514", ""),
            "killall -9 syslogd\nsyslogd -R [0:0:0:0:0:0:0:1]:1514 &\n"},
           {stream_request("syslog", "end"), stream_reply("udp", "0", ""),
            "killall -9 syslogd\nsh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o  -l  -s  &\n"}});
}

TEST_F(Handlers, StreamTheModemLogFromTheDevice)
{
    connect();
    const std::string kill = "killall -9 diag_mdlog\nkillall -9 diag_socket_log\n";
    check({{stream_request("qxdm", "start"), stream_reply("", "0", "", "Fail:Modem file is not exisit"), kill},
           {stream_request("qxdm", "end"), stream_reply("tcp", "0", ""), "killall -9 diag_mdlog\n"}});
    run_command("mkdir /logfs/logconf; touch /logfs/logconf/Diag.cfg");
    const std::string tidy = kill + "echo 3 > /proc/sys/vm/drop_caches &\nrm /tmp/diag_logs &\n";
    const std::string device = stream_reply("tcp", "25555", "192.168.0.1");
    check({{stream_request("qxdm", "start"), device,
            tidy + "diag_mdlog -f /logfs/logconf/Diag.cfg -o /tmp/diag_logs  -n 2 -s 10 -R 192.168.0.1 -P 25555 &\n"}});
    const unique_fd modem{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    sockaddr_in at{AF_INET, htons(25555), {inet_addr("192.168.0.1")}, {}};
    ASSERT_EQ(0, ::connect(modem.get(), reinterpret_cast<const sockaddr *>(&at), sizeof at));
    for (std::uint32_t number = 0; number < 20; ++number) {
        diag_record record;
        ASSERT_EQ(512, recv(modem.get(), record.data(), record.size(), MSG_WAITALL));
        ASSERT_EQ(make_diag_record(number), record);
    }
    install_program("diag_mdlog", "");
    run_command("touch /logfs/logconf/Diag.cfg2");
    check({{stream_request("qxdm", "start"), device,
            tidy + "diag_mdlog -f /logfs/logconf/Diag.cfg -m /logfs/logconf/Diag.cfg2 -o /tmp/diag_logs\\x09"
                   "-n 2 -s 10 -R 192.168.0.1 -P 25555 &\n"}});
    set_nv("product_type", "MODULE");
    run_command("mkdir -p /sys/class/net/usb0");
    check(
        {{stream_request("qxdm", "start"), stream_reply("tcp", "25555", "192.168.255.1"),
          kill + "diag_mdlog -o /tmp/diag_logs -f /logfs/logconf/Diag.cfg -n 2 -s 10 -R 192.168.255.1 -P 25555 &\n"}});
}

} // namespace

#include "tests/daemon.h"
#include "tests/frame.h"

#include <fstream>
#include <sys/syscall.h>
#include <thread>
#include <tuple>

namespace
{

constexpr char kCertDir[] = "/usr/vex/vex_conf/logcert/";

/* The checkout's own programs for a device. */
std::string device_program(const char *name)
{
    std::string path = SOURCE_DIR "/device/";
    return path += name;
}

class Client : public testing::Test
{
protected:
    void SetUp() override { ASSERT_EQ("", run_command(device_program("certificates") + " /tmp/c")); }
    /* A shell line in the background that runs until the device has been served. */
    static void start_server(const std::string &line)
    {
        run_command("rm -f /tmp/served /tmp/said; mkfifo /tmp/served; (" + line +
                    " >/tmp/said 2>&1; echo $? >/tmp/served) >/dev/null 2>&1 &");
        run_command("until grep -q ':1388 .* 0A ' /proc/net/tcp /proc/net/tcp6; do sleep 0.01; done");
    }
    static std::string server_status() { return run_command("cat /tmp/served"); }
    static std::string server_said() { return read_file("/tmp/said"); }
};

TEST_F(Client, TrustsNoServerWithoutItsCertificate)
{
    std::ofstream("/tmp/c/ca.cnf") << "[ca]\ndefault_ca=d\n[d]\ndatabase=db\nserial=serial\nnew_certs_dir=.\n"
                                      "default_md=sha256\npolicy=p\n[p]\ncommonName=supplied\n";
    const std::string sign =
        "cd /tmp/c; rm -f db*; touch db; echo 01 >serial; openssl ca -batch -config ca.cnf -cert ca.crt "
        "-keyfile ca.key -in server.csr -out bad.crt -notext ";
    for (const auto &[make, options, reason] :
         {std::tuple{sign + "-days 30", "-tls1_2", ""}, /* it asks for none of ours, too */
          {sign + "-days 30", "-tls1_3", ""},
          {"echo 'log_server_name=log server' >>/etc/vex/nvconfig", "-tls1_3", ""},
          {"sed -i 's/=log server/=log.example.net/' /etc/vex/nvconfig", "-tls1_2", "ostname mismatch"},
          {"sed -i 's/=log.example.net/=10.0.0.1/' /etc/vex/nvconfig", "-tls1_3", "IP address mismatch"},
          {"sed -i /log_server_name/d /etc/vex/nvconfig; " + sign +
               "-startdate 20200101000000Z -enddate 20210101000000Z",
           "-tls1_3", "certificate has expired"},
          {sign + "-startdate 20990101000000Z -enddate 20991231000000Z", "-tls1_2", "certificate is not yet valid"},
          {"cd /tmp/c; openssl x509 -req -in server.csr -signkey server.key -out bad.crt -days 30", "",
           "signed certificate"},
          {device_program("certificates") + " /tmp/o; cp /tmp/c/ca.crt " + kCertDir +
               "logca_cert.crt; cp /tmp/o/server.crt /tmp/c/bad.crt; cp /tmp/o/server.key /tmp/c",
           "", "unable to get local issuer certificate"}}) {
        const bool accepted = *reason == '\0';
        run_command(make + "; rm -f /tmp/daemon.log");
        start_server(
            "until grep -q ControlLink /tmp/said || grep -q 'connect error' /tmp/daemon.log; do sleep 0.01; done | "
            "openssl s_server -quiet -naccept 1 -accept 5000 -cert /tmp/c/bad.crt "
            "-key /tmp/c/server.key 2>/dev/null " +
            std::string(options));
        daemon_process daemon({"-a", "127.0.0.1", "-p", "5000", "-r", "3"});
        EXPECT_EQ(0, daemon.wait_exit());
        server_status();
        EXPECT_EQ(accepted, server_said().find("ControlLink") != std::string::npos) << make << server_said();
        EXPECT_EQ(accepted ? 0 : 1, daemon.logged("vex_open_ssl: SSL connect error ")) << make;
        EXPECT_EQ(accepted ? 0 : 1, daemon.logged("vex_open_ssl: the server's certificate is refused: ")) << make;
        EXPECT_TRUE(accepted || daemon.logged(reason) == 1) << daemon.log();
        EXPECT_EQ(accepted ? 0 : 1, daemon.logged("fail connect to address: 127.0.0.1, port number: 5000"));
        EXPECT_EQ(1, daemon.logged("Trying to connect")) << "a session is not tried again";
    }
}

TEST_F(Client, SpeaksNoOldTls)
{
    start_server(
        "until grep -q 'connect error' /tmp/daemon.log; do sleep 0.01; done | openssl s_server -quiet -naccept 1 "
        "-accept 5000 -cert /tmp/c/server.crt -key /tmp/c/server.key -tls1_2 "
        "-cipher ECDHE-ECDSA-AES128-SHA256 2>/dev/null");
    daemon_process daemon({"-a", "127.0.0.1", "-p", "5000"});
    EXPECT_EQ(0, daemon.wait_exit());
    EXPECT_EQ(1, daemon.logged("vex_open_ssl: SSL connect error "));
    server_status();
}

TEST_F(Client, SaysWhichOfItsOwnFilesIsNoGood)
{
    setenv("OPENSSL_CONF", "/tmp/none.cnf", 1); /* in the end, TLS without its algorithms */
    for (const auto &[spoil, words, status, why] :
         {std::tuple{"mv logca_cert.crt x", "Failed to load CA file /usr/vex/vex_conf/logcert/logca_cert.crt", 1,
                     false},
          {"mv x logca_cert.crt; echo >logclient_cert.crt",
           "Failed to load user certificate file /usr/vex/vex_conf/logcert/logclient_cert.crt", 1, true},
          {"cp /tmp/c/device.crt logclient_cert.crt; echo >logkey.pem", "[ERROR]use private key fail!", 1, true},
          {"cp /tmp/c/server.key logkey.pem", "[ERROR]use private key fail!", 1, true},
          {"echo openssl_conf=o '[o]' providers=p '[p]' null=n '[n]' activate=1 | tr ' ' '\\n' >/tmp/none.cnf",
           "**SOCKET: Create SSL_CTX error...", 255, true}}) {
        run_command(std::string("cd ") + kCertDir + "; " + spoil);
        daemon_process daemon({"-a", "127.0.0.1"});
        EXPECT_EQ(status, daemon.wait_exit()) << spoil;
        EXPECT_EQ(1, daemon.logged(" 0 vex_log_manage")) << spoil;
        EXPECT_EQ(1, daemon.logged(words)) << daemon.log();
        EXPECT_EQ(why, read_file("/tmp/daemon.out").find(":error:") != std::string::npos) << spoil;
        EXPECT_EQ(0, daemon.logged("log_client_ctl_thread_proc"));
    }
}

TEST_F(Client, AnswersWhatItIsAskedDuringATransfer)
{
    run_command("head -c 5000000 /dev/urandom >/logfs/noise");
    std::string commands = frame(R"({"msgid":"2"})");
    for (int i = 0; i < 200; ++i)
        commands += frame(kAskMode);
    std::ofstream("/tmp/commands") << commands;
    start_server("{ cat /tmp/commands; until [ $(grep -ao 'online\",\"Result' /tmp/said | wc -l) = 200 ]; do "
                 "sleep 0.01; done; } | openssl s_server -quiet -naccept 1 -accept 5000 -cert /tmp/c/server.crt "
                 "-key /tmp/c/server.key -Verify 1 -verify_return_error -CAfile /tmp/c/ca.crt 2>/dev/null");
    daemon_process daemon({"-a", "127.0.0.1", "-p", "5000"});
    server_status();
    EXPECT_EQ(0, daemon.wait_exit());
    EXPECT_LT(5000000U, server_said().size());
}

TEST_F(Client, EndsWithItsServerWheneverThatIs)
{
    const std::string refuses = "until grep -qE 'SSL connect error|recvfrom error' /tmp/daemon.log; do sleep 0.01; "
                                "done | openssl s_server -naccept 1 -accept 5000 -cert /tmp/c/server.crt -key "
                                "/tmp/c/server.key -Verify 1 -verify_return_error -CAfile /tmp/c/server.crt ";
    run_command("head -c 9000000 /dev/urandom >/logfs/noise");
    std::ofstream("/tmp/archive") << frame(R"({"msgid":"2"})");
    const std::string hangs_up = "{ cat /tmp/archive; until [ $(stat -c %s /tmp/said) -gt 300000 ]; do sleep 0.01; "
                                 "done; } | "; /* in the middle of an archive */
    const std::string serves = "openssl s_server -quiet -naccept 1 -accept 5000 -cert /tmp/c/server.crt -key "
                               "/tmp/c/server.key -Verify 1 -verify_return_error -CAfile /tmp/c/ca.crt 2>/dev/null";
    for (const auto &[server, tls_off, words] :
         {std::tuple{std::string("true | busybox nc -l -p 5000 -w 1"), "0", "vex_open_ssl: SSL connect error "},
          {std::string("echo 'no TLS' | busybox nc -l -p 5000"), "0", "vex_open_ssl: SSL connect error "},
          {refuses + "-tls1_2", "0", "vex_open_ssl: SSL connect error "},
          {refuses + "-tls1_3", "0", "recvfrom error,errno msg="},
          {"until grep -q ControlLink /tmp/said; do sleep 0.01; done | " + serves, "0", "recvcount=0,client close"},
          {hangs_up + serves, "0", "exit log_recv_tcp_msg"},
          {std::string("{ printf '#~\\0\\0\\0\\036{\"msgid'; until grep -q 'recv data len =13' /tmp/daemon.log; do "
                       "sleep 0.01; done; } | busybox nc -l -p 5000"),
           "1", "recv data len =13"},
          {hangs_up + "busybox nc -l -p 5000", "1", "exit log_recv_tcp_msg"}}) {
        set_nv("log_use_ssl_disable", tls_off);
        run_command("rm -f /tmp/daemon.log");
        start_server(server);
        daemon_process daemon({"-a", "127.0.0.1", "-p", "5000"});
        EXPECT_EQ(0, daemon.wait_exit()) << server;
        EXPECT_NE(0, daemon.logged(words)) << server << daemon.log();
        EXPECT_EQ(0, daemon.logged("certificate is refused")) << server;
        EXPECT_EQ(1, daemon.logged("vex_log_manage exit ")) << server;
        server_status();
    }
}

TEST_F(Client, EndsWithoutAServerToCall)
{
    const std::string failed_line = "fail connect to address: ";
    const std::string none_there = "Error is ECONNREFUSED - No one is listening on the remote ip address";
    run_command("sed -i /^log_server_port=/d /etc/vex/nvconfig");
    using strings = std::vector<std::string>;
    for (const auto &[address, tries, lines, failures] :
         {std::tuple{"127.0.0.1", "0", strings{"Trying to connect to address: 127.0.0.1, port: 0", failed_line}, 1},
          {"127.0.0.1", "-1", strings{failed_line + "127.0.0.1, port number: 0"}, 1},
          {"127.0.0.1", "1", strings{"Error calling connect: Connection refused, errno: 111", none_there}, 1},
          {"8.8.8.8", "1", strings{"Network is unreachable,errno: 101 Re-trying ...", failed_line + "8.8.8.8, port"},
           1},
          {"fe80::1", "9",
           strings{"Error calling connect: Invalid argument, errno: 22", "Invalid argument.  Exiting... "}, 0},
          {"", "9", strings{"getaddrinfo error: -2, ", "getaddrinfo did not return list of addrinfo structures."},
           0}}) {
        const daemon_process daemon({"-a", address, "-r", tries});
        EXPECT_TRUE(daemon.logs("vex_log_manage exit "));
        for (const std::string &words : lines)
            EXPECT_EQ(1, daemon.logged(words)) << words << daemon.log();
        EXPECT_EQ(failures, daemon.logged(failed_line)) << address;
    }
    set_nv("log_manage_mode", "7");
    daemon_process daemon({"-p", "5000"});
    EXPECT_EQ(0, daemon.wait_exit());
    EXPECT_EQ(1, daemon.logged("vex_log_manage exit "));
}

TEST_F(Client, GoesOnWithoutItsThreadOrItsAnnouncement)
{
    ASSERT_TRUE(prepare_faults());
    set_nv("log_use_ssl_disable", "1");
    {
        let_fail({.call = kFaultThread});
        const daemon_process daemon({"-a", "127.0.0.1", "-p", "5000"});
        EXPECT_TRUE(daemon.logs("vex_log_client_ctl_thread  FAIL"));
        while (!daemon.waits_in(SYS_futex)) /* and does not end */
            std::this_thread::yield();
    }
    std::ofstream("/tmp/ask") << frame(kAskMode);
    let_fail({.call = kFaultSend, .only = 5000});
    start_server("{ cat /tmp/ask; until grep -q online /tmp/said; do sleep 0.01; done; } | busybox nc -l -p 5000");
    daemon_process daemon({"-a", "127.0.0.1", "-p", "5000"});
    EXPECT_EQ(0, daemon.wait_exit());
    EXPECT_EQ(frame(kOnline), server_said());
}

} // namespace

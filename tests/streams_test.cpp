#include "tests/daemon.h"
#include "tests/frame.h"
#include "tools/tool_device.h"
#include "device/log_server.h"
#include "tools/tool_process.h"

#include <atomic>
#include <chrono>
#include <fstream>
#include <future>
#include <netinet/in.h>
#include <openssl/err.h>
#include <random>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>
#include <tuple>

namespace
{

constexpr int kFeedSize = 1 << 20;
const std::string kImei = "356938035643809";

struct stream {
    const char *log_type;
    const char *connect_type;
};
constexpr stream kSyslog{"syslog", "syslog_connect"};
constexpr stream kModem{"qxdm", "modemlog_connect"};

/* How a device ends a link. */
enum class link_end {
    good_bye, /* TLS: close_notify, then the end of the connection */
    bare,     /* the end of the connection by itself, which is all there is without TLS */
    alert,    /* TLS: a fatal alert */
    reset,
    none, /* within kPatience */
};

/* This test is the log server; the device's log programs write a file that it knows. */
class Streams : public testing::Test
{
protected:
    void SetUp() override
    {
        tool_prepare_process(); /* a device that hangs up is an error like any other */
        ASSERT_EQ("", run_command(SOURCE_DIR "/device/certificates /tmp/c"));
        run_command("head -c " + std::to_string(kFeedSize) +
                    " /dev/urandom >/tmp/feed; mkdir -p /logfs/logconf; "
                    "touch /logfs/logconf/Diag.cfg; for p in syslogd diag_mdlog; do cp --remove-destination " FEEDER
                    " /usr/vex/override/$p; done; echo 2000 >/tmp/feed.size");
        feed_ = read_file("/tmp/feed");
        listener_.port = "5000";
    }
    /* Has the device call. */
    void call(bool tls, int feed_times, const char *tries = "10")
    {
        std::string why;
        set_nv("log_use_ssl_disable", tls ? "0" : "1");
        run_command("echo " + std::to_string(feed_times) + " >/tmp/feed.times");
        if (tls)
            listener_.context = tool_tls_server("/tmp/c/server.crt", "/tmp/c/server.key", "/tmp/c/ca.crt", why);
        ASSERT_TRUE(tool_listen(listener_, why)) << why;
        daemon_.emplace(std::vector<std::string>{"-a", "127.0.0.1", "-p", "5000", "-r", tries});
        control_.emplace(std::move(accept("9", listener_)->link));
    }
    /* One more place to be called at, without TLS; a call there. */
    static tool_listener listen_at(const char *port)
    {
        tool_listener listener;
        listener.port = port;
        std::string why;
        EXPECT_TRUE(tool_listen(listener, why)) << why;
        return listener;
    }
    static void await(const tool_listener &listener)
    {
        pollfd entry{listener.fd.get(), POLLIN, 0};
        EXPECT_EQ(1, poll(&entry, 1, kPatience));
    }
    static unique_fd accept_bare(const tool_listener &listener)
    {
        await(listener);
        return unique_fd{accept4(listener.fd.get(), nullptr, nullptr, SOCK_CLOEXEC)};
    }
    static std::optional<tool_call> accept(const char *msgid, tool_listener &listener)
    {
        std::string why;
        await(listener);
        std::optional<tool_call> call =
            tool_take_call(listener, {}, tool_clock::now() + std::chrono::milliseconds(kPatience), why);
        EXPECT_TRUE(call && call->msgid == msgid) << why;
        return call;
    }
    std::string ask(const std::string &control)
    {
        std::string why;
        EXPECT_TRUE(tool_send(*control_, control, {}, why)) << why;
        const auto frame = tool_receive(*control_, std::chrono::milliseconds(kPatience), why);
        return frame ? frame->control : why;
    }
    std::string ask(const stream &which, const char *action, const char *port = "5000")
    {
        return ask(
            tool_command("6", "realtimeLog",
                         {{"LogType", which.log_type}, {"Action", action}, {"ip", "127.0.0.1"}, {"port", port}}));
    }
    void order(const stream &which, const char *port = "5000")
    {
        EXPECT_EQ(R"({"msgid":"6","realtimeLog":{"LogType":"","Action":"","protocol":"tcp","port":")" +
                      std::string(port) + R"(","ip":"127.0.0.1"},"Result":"Success"})",
                  ask(which, "start", port));
    }
    /* Starts a stream; its data link, which is not confirmed yet. */
    tool_link start(const stream &which)
    {
        order(which);
        return accept_link(which, listener_);
    }
    static tool_link accept_link(const stream &which, tool_listener &listener)
    {
        std::optional<tool_call> call = accept("10", listener);
        EXPECT_EQ(which.connect_type, tool_announced(*call, "DataLink", "ConnectType"));
        EXPECT_EQ(kImei, tool_announced(*call, "DataLink", "imei"));
        return std::move(call->link);
    }
    static void confirm(tool_link &link, const stream &which)
    {
        std::string why;
        EXPECT_TRUE(tool_send(
            link, tool_command("10", "DataLink", {{"imei", kImei}, {"ConnectType", which.connect_type}}), {}, why));
    }
    void end(const stream &which)
    {
        EXPECT_EQ(R"({"msgid":"6","realtimeLog":{"LogType":"","Action":"","protocol":"tcp","port":"0","ip":""},)"
                  R"("Result":"Success"})",
                  ask(which, "end"));
    }
    /* Over TLS, has both ends change their keys. */
    static void change_keys(const tool_link &link)
    {
        if (link.session == nullptr)
            return;
        EXPECT_EQ(1, SSL_key_update(link.session.get(), SSL_KEY_UPDATE_REQUESTED));
        SSL_do_handshake(link.session.get());
    }
    /* Takes bytes off a link until there were so many or it has ended; whether all were the log's, and how many. */
    std::pair<bool, std::size_t> take(tool_link &link, std::size_t count) const
    {
        std::size_t got = 0;
        bool equal = true;
        unsigned char piece[65536];
        while (got < count) {
            short wanted = POLLIN;
            const ssize_t n = tool_read_some(link, {piece, std::min(sizeof piece, count - got)}, wanted);
            for (ssize_t i = 0; i < n; ++i)
                equal = static_cast<char>(piece[i]) == feed_[got++ % feed_.size()] && equal;
            pollfd entry{link.fd.get(), wanted, 0};
            if (n == 0 || (n < 0 && errno != EAGAIN) || (n < 0 && poll(&entry, 1, kPatience) != 1))
                break;
        }
        return {equal, got};
    }
    /* Takes what comes until the device ends the link; how it does. `pause` after each 16 kB: a slow server. */
    static link_end end_of(tool_link &link, std::chrono::microseconds pause = {})
    {
        unsigned char piece[16384];
        for (;;) {
            short wanted = POLLIN;
            const ssize_t n = tool_read_some(link, piece, wanted);
            pollfd entry{link.fd.get(), wanted, 0};
            if (n > 0)
                std::this_thread::sleep_for(pause);
            else if (n == 0 || errno != EAGAIN)
                return kind_of_end(link, n);
            else if (poll(&entry, 1, kPatience) != 1)
                return link_end::none;
        }
    }
    static link_end kind_of_end(const tool_link &link, ssize_t n)
    {
        if (link.session == nullptr)
            return n == 0 ? link_end::bare : link_end::reset;
        const unsigned long error = ERR_peek_last_error();
        pollfd entry{link.fd.get(), POLLIN, 0};
        char byte = 0;
        if (n == 0) /* and the end of the connection itself */
            return poll(&entry, 1, kPatience) == 1 && recv(entry.fd, &byte, 1, 0) == 0 ? link_end::good_bye
                                                                                       : link_end::none;
        if (error == 0)
            return link_end::reset;
        return ERR_GET_REASON(error) == SSL_R_UNEXPECTED_EOF_WHILE_READING ? link_end::bare : link_end::alert;
    }
    /* What a stream's end is that both sides have agreed on. */
    static link_end clean(const tool_link &link)
    {
        return link.session != nullptr ? link_end::good_bye : link_end::bare;
    }
    static bool ends_clean(tool_link &link) { return end_of(link) == clean(link); }
    /* The device's daemon ends with its server. */
    void hang_up()
    {
        control_.reset();
        EXPECT_EQ(0, daemon_->wait_exit());
        daemon_.reset();
        listener_.fd.reset();
    }

    std::string feed_;
    tool_listener listener_;
    std::optional<daemon_process> daemon_;
    std::optional<tool_link> control_;
};

TEST_F(Streams, BringEveryByteWhileCommandsAreAnswered)
{
    for (const bool tls : {false, true}) {
        const char *const mb = getenv("VEX_STREAM_MB"); /* for longer streams, by hand */
        const int times = mb != nullptr ? std::atoi(mb) : 8;
        call(tls, times);
        tool_link links[] = {start(kSyslog), start(kModem)};
        std::atomic<int> running = 2;
        std::future<void> readers[2];
        daemon_->commands();
        for (std::size_t i = 0; i < 2; ++i) {
            confirm(links[i], i == 0 ? kSyslog : kModem);
            readers[i] = std::async(std::launch::async, [this, &running, &link = links[i], times] {
                for (int n = 0; n < times; ++n, change_keys(link))
                    EXPECT_EQ(std::pair(true, feed_.size()), take(link, feed_.size()));
                --running;
            });
        }
        while (running > 0) {
            EXPECT_EQ(kOnline, ask(kAskMode));
            change_keys(*control_);
        }
        const std::string commands = daemon_->commands();
        for (const char *line : {"killall -9 syslogd\n", "\nsyslogd -R tcp_fd=", "killall -9 diag_mdlog\n",
                                 "echo 3 > /proc/sys/vm/drop_caches\n", "rm /tmp/diag_logs\n",
                                 "diag_mdlog -f /logfs/logconf/Diag.cfg -o /tmp/diag_logs -n 2 -s 10 -R tcp_fd="})
            EXPECT_NE(std::string::npos, commands.find(line)) << line << commands;
        end(kSyslog);
        end(kModem);
        EXPECT_TRUE(ends_clean(links[0]) && ends_clean(links[1]));
        hang_up();
    }
}

TEST_F(Streams, BelongToTheLatestStart)
{
    install_program("killall", "[ $1 = -q ] && sleep 0.2\nexec /usr/vex/bin/killall \"$@\"");
    call(false, 100000);
    const resources rest = daemon_->used();
    ask(kSyslog, "start", "5001"); /* nobody is there, and when somebody comes, it is not tried any more */
    EXPECT_TRUE(daemon_->logs("Error is ECONNREFUSED"));
    tool_link first = start(kSyslog);
    confirm(first, kSyslog);
    EXPECT_TRUE(daemon_->logs("fail connect to address: 127.0.0.1, port number: 5001"));
    EXPECT_TRUE(take(first, 100000).first);
    end(kSyslog);
    tool_link second = start(kSyslog); /* not hit by the restart of the local log, which is still under way */
    confirm(second, kSyslog);
    const std::size_t for_a_while = std::size_t{250} << 20;
    EXPECT_EQ(std::pair(true, for_a_while), take(second, for_a_while));
    end(kSyslog);
    EXPECT_TRUE(daemon_->settles(rest));
    hang_up();
}

/* Streams that flow, or were never confirmed, are ended from either side, started or confirmed once more, or too late.
 * Nobody reads them, so that every stop meets a blocked sender sooner or later. */
TEST_F(Streams, EndAtAnyMoment)
{
    for (const bool tls : {false, true}) {
        call(tls, 1000);
        const resources rest = daemon_->used();
        const char *const given = getenv("VEX_STREAM_CYCLES"); /* for more of them, by hand */
        const int cycles = given != nullptr ? std::atoi(given) : 25;
        std::mt19937 random{2206};
        long memory = 0;
        for (int i = 0; i < cycles; ++i) {
            std::optional<tool_link> links[2];
            for (int j = 0; j < 5; ++j) {
                const std::size_t at = random() % 2;
                const stream &which = at == 0 ? kSyslog : kModem;
                switch (random() % 5) {
                case 0:
                    end(which);
                    break;
                case 1:
                    links[at].reset(); /* the server hangs up */
                    break;
                case 2:
                    if (links[at])
                        confirm(*links[at], which);
                    break;
                default:
                    links[at] = start(which);
                }
            }
            end(kSyslog);
            end(kModem);
            memory = i == 9 ? daemon_->memory() : memory;
            for (std::optional<tool_link> &link : links) {
                const link_end how = link ? end_of(*link) : link_end::bare;
                EXPECT_TRUE(how != link_end::alert && how != link_end::none) << static_cast<int>(how);
            }
        }
        EXPECT_TRUE(daemon_->settles(rest)) << run_command("ls -l " + daemon_->proc("fd"));
        EXPECT_TRUE(!kMemoryIsOurs || daemon_->memory() <= memory + 200) << daemon_->memory() - memory;
        for (const stream &which : {kSyslog, kModem}) {
            tool_link link = start(which);
            confirm(link, which);
            EXPECT_EQ(std::pair(true, std::size_t{3000000}), take(link, 3000000));
        }
        hang_up();
    }
}

/* A stream's own parts fail, and its server is told that it has been started all the same. */
TEST_F(Streams, MayFailToBegin)
{
    ASSERT_TRUE(prepare_faults());
    call(true, 1000, "1");
    const resources rest = daemon_->used();
    long refused = 0;
    for (const auto &[what, words, calls] : {
             std::tuple{fault{.call = kFaultThread}, "vex_log_recv_syslog_thread  FAIL", true},
             {{.call = kFaultThread, .pass = 1}, "vex_log_client_syslog_thread  FAIL", false},
             {{.call = kFaultSocket, .only = AF_UNIX}, "can not create socket. errno: 24", true},
             {{.call = kFaultBind, .times = 10, .only = AF_UNIX},
              "can not bind socket :/tmp/MSG_ID_SYSLOG, errno: 98",
              true},
             {{.call = kFaultListen, .only = AF_UNIX}, "can not listen socket :/tmp/MSG_ID_SYSLOG, errno: 98", true},
             {{.call = kFaultSocket, .only = AF_INET}, "Error calling socket: Too many open files, errno: 24", false},
         }) {
        daemon_->commands();
        let_fail(what);
        order(kSyslog);
        if (calls) {
            tool_link link = accept_link(kSyslog, listener_);
            EXPECT_TRUE(daemon_->settles({rest.first + 2, rest.second + 1})) << words; /* a socket and an event */
            confirm(link, kSyslog); /* its program would have nowhere to write to */
            EXPECT_TRUE(daemon_->logs("can not connect to:/tmp/MSG_ID_SYSLOG, errno: ", ++refused));
            EXPECT_EQ("", daemon_->commands());
        }
        EXPECT_TRUE(daemon_->logs(words)) << words;
        end(kSyslog);
        EXPECT_TRUE(daemon_->settles(rest)) << words;
    }
    {
        tool_link link = start(kSyslog);
        let_fail({.call = kFaultAccept, .only = AF_UNIX});
        confirm(link, kSyslog);
        EXPECT_TRUE(daemon_->logs("can not accept client, errno: 24"));
        end(kSyslog);
        EXPECT_TRUE(daemon_->settles(rest));
    }
    order(kSyslog, "5003");
    EXPECT_TRUE(daemon_->logs("fail connect to address: 127.0.0.1, port number: 5003"));
    const tool_listener no_tls = listen_at("5004");
    order(kSyslog, "5004");
    accept_bare(no_tls).reset();
    EXPECT_TRUE(daemon_->logs("vex_open_ssl: SSL connect error "));
    tool_listener other = listen_at("5002");
    std::string why;
    other.context = tool_tls_server("/tmp/c/server.crt", "/tmp/c/server.key", "/tmp/c/ca.crt", why);
    let_fail({.call = kFaultSend, .only = 5002, .pass = 2}); /* of the handshake */
    order(kSyslog, "5002");
    await(other);
    EXPECT_FALSE(tool_take_call(other, {}, tool_clock::now() + std::chrono::milliseconds(kPatience), why))
        << "what could not be sent is never sent, least of all twice";
    EXPECT_EQ(1, failed(kFaultSend));
    EXPECT_TRUE(daemon_->settles(rest));
    hang_up();
}

TEST_F(Streams, AreNotBegunWithoutWhatTheirProgramsNeed)
{
    ASSERT_TRUE(prepare_faults());
    call(true, 1000);
    daemon_->commands();
    confirm(*control_, kSyslog); /* there is no link */
    EXPECT_EQ(kOnline, ask(kAskMode));
    EXPECT_EQ("", daemon_->commands());
    run_command("mkdir -p /tmp/MSG_ID_SYSLOG/folder"); /* of somebody who means to be in the way */
    tool_link links[] = {start(kSyslog), start(kModem)};
    daemon_->commands();
    let_fail({.call = kFaultSocket, .only = AF_UNIX});
    confirm(links[0], kSyslog);
    EXPECT_TRUE(daemon_->logs("create socket error, errno: 24"));
    EXPECT_EQ("", daemon_->commands());
    const std::string prepared = "killall -9 diag_mdlog\necho 3 > /proc/sys/vm/drop_caches\nrm /tmp/diag_logs\n";
    let_fail({.call = kFaultSocket, .only = AF_UNIX});
    confirm(links[1], kModem);
    EXPECT_TRUE(daemon_->logs("create socket error, errno: 24", 2));
    EXPECT_EQ(prepared, daemon_->commands());
    run_command("rm /logfs/logconf/Diag.cfg");
    confirm(links[1], kModem);
    EXPECT_TRUE(daemon_->logs("qxdm Diag.cfg is not exisit"));
    EXPECT_EQ("killall -9 diag_mdlog\n", daemon_->commands());
    run_command("touch /logfs/logconf/Diag.cfg");
    let_fail({.call = kFaultSpawn, .pass = 3});
    confirm(links[1], kModem);
    EXPECT_TRUE(daemon_->logs("&] System error1")) << "the program could not be started";
    confirm(links[0], kSyslog); /* no syslogd is there to be killed */
    EXPECT_EQ(std::pair(true, feed_.size()), take(links[0], feed_.size()));
    EXPECT_EQ("600 socket\n", run_command("stat -c '%a %F' /tmp/MSG_ID_SYSLOG"));
    EXPECT_NE(0, daemon_->logged("[killall -9 syslogd] System error3"));
    hang_up();
}

/* This test is the log program, too. */
TEST_F(Streams, TakeWhatTheirProgramsWriteToTheEnd)
{
    ASSERT_TRUE(prepare_faults());
    call(true, 0);
    const resources rest = daemon_->used();
    const auto send_all = [this](const unique_fd &program, std::size_t len) {
        EXPECT_EQ(static_cast<ssize_t>(len), send(program.get(), feed_.data(), len, MSG_NOSIGNAL));
    };
    const auto connect_program = [] {
        unique_fd program{socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
        const sockaddr_un intake{AF_UNIX, "/tmp/MSG_ID_SYSLOG"};
        EXPECT_EQ(0, connect(program.get(), reinterpret_cast<const sockaddr *>(&intake), sizeof intake));
        return program;
    };
    {
        tool_link link = start(kSyslog);
        unique_fd program = connect_program();
        let_fail({.call = kFaultRecv, .times = 3, .error = EINTR});
        send_all(program, 5000);
        EXPECT_EQ(std::pair(true, std::size_t{5000}), take(link, 5000));
        EXPECT_EQ(3, failed(kFaultRecv));
        let_fail({.call = kFaultSend, .only = 5000});
        send_all(program, 10);
        while (failed(kFaultSend) == 0)
            std::this_thread::yield();
        /* The link ends before its program does. */
        {
            const tool_link gone = std::move(link);
        }
        EXPECT_TRUE(daemon_->logs("exit log_recv_server_msg"));
        send_all(program, feed_.size());
        program.reset();
        EXPECT_TRUE(daemon_->logs("log_server_handle_realtimelog:recvcount=0,client close log_type=[0]"));
        EXPECT_TRUE(daemon_->settles(rest));
    }
    tool_link link = start(kSyslog);
    const unique_fd program = connect_program();
    let_fail({.call = kFaultRecv});
    send_all(program, 10);
    EXPECT_TRUE(daemon_->logs("log_server_handle_realtimelog:recvfrom error,errno msg=Connection reset by peer"));
    hang_up();
    EXPECT_NE(std::string::npos, read_file("/tmp/daemon.out").find("log_send_packet data fail  errno= 104 (Conn"));
}

TEST_F(Streams, EndTheirLinksWithTheirErrors)
{
    ASSERT_TRUE(prepare_faults());
    call(false, 1000);
    const resources rest = daemon_->used();
    tool_listener other = listen_at("5002");
    let_fail({.call = kFaultSend, .times = 3, .only = 5002});
    order(kSyslog, "5002");
    EXPECT_TRUE(daemon_->logs(") syslog connect "));
    EXPECT_EQ(2, daemon_->logged("log_client_syslog_thread_proc :try send pkg msg "));
    EXPECT_TRUE(daemon_->settles(rest));
    accept_bare(other).reset(); /* nothing was heard of it */
    let_fail({.call = kFaultSend, .times = 2, .only = 5002});
    order(kModem, "5002");
    {
        tool_link link = accept_link(kModem, other);
        EXPECT_EQ(2, daemon_->logged("log_client_qxdm_thread_proc :try send pkg msg "));
        let_fail({.call = kFaultRecv, .times = 2, .only = 5002, .error = EINTR});
        for (int i = 0; i < 2; ++i) {
            confirm(link, kModem);
            EXPECT_TRUE(daemon_->logs("cmdStr[diag_mdlog -f", i + 1));
        }
        EXPECT_EQ(2, failed(kFaultRecv));
        daemon_->commands();
        let_fail({.call = kFaultRecv, .only = 5002});
        confirm(link, kSyslog);
        EXPECT_TRUE(daemon_->logs("log_recv_server_msg:recvfrom error,errno msg=Connection reset by peer"));
        EXPECT_TRUE(daemon_->logs("exit log_recv_server_msg: fd=["));
        EXPECT_TRUE(daemon_->commands().ends_with("diag_mdlog -k \n"));
    }
    {
        const tool_link link = start(kSyslog);
        let_fail({.call = kFaultSpawn});
    }
    EXPECT_TRUE(daemon_->logs("log_recv_server_msg:recvcount=0,client close fd["));
    EXPECT_TRUE(daemon_->logs("vex_syslog.sh -L -o /logfs -l 7 -s 512 &] System error1"));
    EXPECT_TRUE(daemon_->settles(rest));
    EXPECT_EQ(kOnline, ask(kAskMode));
    hang_up();
}

/* A stop, or a newer start, waits for what is on its way, then says good-bye: also to a server that reads slowly. */
TEST_F(Streams, AreEndedWithAGoodBye)
{
    for (const bool tls : {false, true}) {
        call(tls, 100000);
        for (const stream &which : {kSyslog, kModem}) {
            tool_link idle = start(which);
            end(which);
            EXPECT_TRUE(ends_clean(idle));
            tool_link busy = start(which);
            confirm(busy, which);
            EXPECT_TRUE(take(busy, 4000000).first);
            const bool slow = tls; /* without TLS the kernel sends what is left, however long that takes */
            auto busy_end = std::async(
                std::launch::async, [&busy, slow] { return end_of(busy, std::chrono::microseconds(slow ? 2000 : 0)); });
            end(which);
            EXPECT_EQ(clean(busy), busy_end.get());
            tool_link older = start(which);
            confirm(older, which);
            EXPECT_TRUE(take(older, 4000000).first);
            auto older_end = std::async(std::launch::async, [&older, slow] {
                return end_of(older, std::chrono::microseconds(slow ? 2000 : 0));
            });
            tool_link newer = start(which);
            EXPECT_EQ(clean(older), older_end.get());
            confirm(newer, which);
            EXPECT_TRUE(take(newer, 4000000).first);
            end(which);
            EXPECT_TRUE(ends_clean(newer));
        }
        hang_up();
    }
}

/* The device's daemon ends with its server: its links are closed like any other, and the device logs locally again. */
TEST_F(Streams, AreEndedWithTheDaemon)
{
    for (const bool tls : {false, true}) {
        call(tls, 100000);
        tool_link links[] = {start(kSyslog), start(kModem)};
        confirm(links[0], kSyslog);
        confirm(links[1], kModem);
        EXPECT_TRUE(take(links[0], 100000).first && take(links[1], 100000).first);
        daemon_->commands();
        std::future<bool> ends[2];
        for (std::size_t i = 0; i < 2; ++i)
            ends[i] = std::async(std::launch::async, [&link = links[i]] { return ends_clean(link); });
        control_.reset();
        EXPECT_EQ(0, daemon_->wait_exit());
        EXPECT_TRUE(ends[0].get());
        EXPECT_TRUE(ends[1].get());
        const std::string commands = daemon_->commands();
        for (const char *line : {"killall -9 syslogd\n", "diag_mdlog -k\n",
                                 "sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o /logfs -l 7 -s 512 &\n"})
            EXPECT_NE(std::string::npos, commands.find(line)) << line << commands;
        daemon_.reset();
        listener_.fd.reset();
    }
}

TEST_F(Streams, AreNotHeldUpByAProgramThatHangs)
{
    call(true, 1000);
    run_command("mkfifo /tmp/go /tmp/runs; mkdir /tmp/f; cp " FEEDER " /tmp/f/diag_mdlog");
    install_program("diag_mdlog", "[ $1 = -k ] && exec cat /tmp/go\nexec /tmp/f/diag_mdlog \"$@\"");
    start(kModem); /* the server closes the link, and the command for its end hangs */
    EXPECT_TRUE(daemon_->logs("cmdStr[diag_mdlog -k ]"));
    {
        tool_link link = start(kModem);
        confirm(link, kModem);
        EXPECT_EQ(std::pair(true, feed_.size()), take(link, feed_.size()));
        EXPECT_EQ(kOnline, ask(kAskMode));
        /* A command that hangs on a data link holds up neither the control link nor the end of the daemon. */
        install_program("df", "echo runs >/tmp/runs; read go </tmp/go");
        std::string why;
        EXPECT_TRUE(tool_send(link, R"({"msgid":"3"})", {}, why));
        EXPECT_EQ("runs\n", read_file("/tmp/runs"));
        EXPECT_EQ(kOnline, ask(kAskMode));
        end(kModem); /* its command hangs, too */
        EXPECT_EQ(kOnline, ask(kAskMode));
    }
    tool_link link = start(kModem);
    confirm(link, kModem);
    EXPECT_TRUE(take(link, 100000).first);
    auto link_end = std::async(std::launch::async, [&link] { return ends_clean(link); });
    std::string why; /* the control link's own command hangs, and so does that for the stream's end */
    EXPECT_TRUE(tool_send(*control_, R"({"msgid":"3"})", {}, why));
    EXPECT_EQ("runs\n", read_file("/tmp/runs"));
    const auto hung_up = std::chrono::steady_clock::now();
    hang_up();
    EXPECT_GT(std::chrono::seconds(20), std::chrono::steady_clock::now() - hung_up);
    EXPECT_TRUE(link_end.get());
}

/* A program of the script that restarts the local log is its own; and a restart is not overtaken by the one before. */
TEST_F(Streams, LeaveTheLatestLocalLogBehind)
{
    run_command("mkfifo /tmp/never; mkdir /tmp/f; cp " FEEDER " /tmp/f/syslogd");
    install_program("klogd", "read go </tmp/never");
    install_program("killall", "[ $1 = -q ] && { sleep 0.1; klogd & }\nexec /usr/vex/bin/killall \"$@\"");
    install_program("syslogd", "[ $1 = -O ] && read go </tmp/never\nexec /tmp/f/syslogd \"$@\"");
    call(false, 0);
    for (int i = 0; i < 8; ++i) {
        const std::string level = std::to_string(1 + i % 7);
        tool_link link = start(kSyslog);
        EXPECT_TRUE(daemon_->logs("enter log_recv_server_msg", i + 1));
        confirm(link, kSyslog);
        end(kSyslog);
        EXPECT_EQ(R"({"msgid":"4","syslogParaSet":{"sysloglevel":")" + level +
                      R"(","syslogsize":"64"},"Result":"Success"})",
                  ask(R"({"msgid":"4","syslogParaSet":{"sysloglevel":")" + level + R"(","syslogsize":"64"}})"));
        EXPECT_TRUE(ends_clean(link));
        EXPECT_TRUE(daemon_->logs("exit log_recv_server_msg", i + 1));
        const std::string log_program =
            "{syslogd} /bin/sh /usr/vex/override/syslogd -O /logfs/syslog -l " + level + " -s 64\n";
        const std::string list = "busybox ps -o args | grep '[o]verride/syslogd'";
        const auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(kPatience);
        while (run_command(list) != log_program && std::chrono::steady_clock::now() < until)
            std::this_thread::yield();
        run_command("while busybox ps -o args | grep -q '[v]ex_syslog.sh'; do sleep 0.01; done");
        EXPECT_EQ(log_program, run_command(list)) << "nothing comes later";
        EXPECT_EQ("", run_command("timeout 10 sh -c 'until [ $(busybox pidof klogd | wc -w) = " +
                                  std::to_string(2 * i + 2) + " ]; do sleep 0.01; done' || echo ended"))
            << "what a script has started lives on";
    }
    hang_up();
}

/* A link that is being connected, or is shaking hands, ends with its stop. */
TEST_F(Streams, AreStoppedBeforeTheyAreConnected)
{
    call(true, 100000);
    const resources rest = daemon_->used();
    const unique_fd full{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)}; /* its backlog is: nobody is answered */
    sockaddr_in at{};
    at.sin_family = AF_INET;
    at.sin_port = htons(5003);
    at.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(0, bind(full.get(), reinterpret_cast<sockaddr *>(&at), sizeof at));
    ASSERT_EQ(0, listen(full.get(), 0));
    const unique_fd first{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    ASSERT_EQ(0, connect(first.get(), reinterpret_cast<sockaddr *>(&at), sizeof at));
    const tool_listener silent = listen_at("5004");
    for (long i = 1; i <= 10; ++i) {
        order(kSyslog, "5003");
        order(kModem, "5004");
        EXPECT_TRUE(daemon_->logs("Trying to connect to address: 127.0.0.1, port: 5003", i));
        const unique_fd never_answered = accept_bare(silent);
        end(kSyslog);
        end(kModem);
        EXPECT_TRUE(daemon_->settles(rest)) << i;
    }
    tool_link older = start(kSyslog); /* is the one in use for as long as a newer one has no link */
    order(kSyslog, "5003");
    EXPECT_TRUE(daemon_->logs("Trying to connect to address: 127.0.0.1, port: 5003", 11));
    confirm(older, kSyslog);
    EXPECT_EQ(std::pair(true, feed_.size()), take(older, feed_.size()));
    end(kSyslog);
    EXPECT_TRUE(ends_clean(older));
    EXPECT_TRUE(daemon_->settles(rest));
    hang_up();
}

TEST_F(Streams, AreConfirmedOnce)
{
    call(true, 100000);
    tool_link link = start(kSyslog);
    confirm(link, kSyslog);
    confirm(link, kSyslog);
    EXPECT_TRUE(daemon_->logs("the data link has been confirmed before, refused"));
    const std::size_t more_than_waited = std::size_t{50} << 20;
    EXPECT_EQ(std::pair(true, more_than_waited), take(link, more_than_waited));
    end(kSyslog);
    tool_link modem = start(kModem);
    confirm(modem, kModem);
    EXPECT_TRUE(take(modem, 100000).first);
    run_command("rm /logfs/logconf/Diag.cfg");
    EXPECT_NE(std::string::npos, ask(kModem, "start").find("Fail:Modem file is not exisit"));
    daemon_->commands();
    {
        const tool_link gone = std::move(modem);
    }
    EXPECT_TRUE(daemon_->logs("exit log_recv_server_msg", 2));
    EXPECT_EQ("diag_mdlog -k \n", daemon_->commands()) << "the older link's program is still its own";
    hang_up();
}

/* A server that asks for new keys and reads none of the answers. */
TEST_F(Streams, KeepNoMoreAnswersThanTheyHaveRoomFor)
{
    call(true, 0);
    EXPECT_EQ(kOnline, ask(kAskMode));
    const long memory = daemon_->memory();
    bool taken = true;
    for (int i = 0; taken && i < 200000; ++i) /* 4 MB of answers */
        taken = SSL_key_update(control_->session.get(), SSL_KEY_UPDATE_REQUESTED) == 1 &&
                SSL_do_handshake(control_->session.get()) == 1;
    EXPECT_TRUE(!kMemoryIsOurs || daemon_->memory() <= memory + 512) << daemon_->memory() - memory;
    control_.reset();
    EXPECT_EQ(0, daemon_->wait_exit());
}

/* What has arrived is carried out although no reply can be sent. */
TEST_F(Streams, RunCommandsWhoseRepliesAreLost)
{
    ASSERT_TRUE(prepare_faults());
    for (const bool tls : {false, true}) {
        call(tls, 0);
        const int count = 50;
        std::string commands; /* in one piece: what arrives behind a lost reply is lost as well */
        for (int i = 0; i < count; ++i)
            commands += frame(R"({"msgid":"11","mode_lpm_online":"lpm"})");
        const int size = static_cast<int>(commands.size());
        let_fail({.call = kFaultSend, .only = 5000});
        EXPECT_EQ(size, tls ? SSL_write(control_->session.get(), commands.data(), size)
                            : send(control_->fd.get(), commands.data(), commands.size(), MSG_NOSIGNAL));
        EXPECT_TRUE(daemon_->logs("modem mode = lpm", count)) << tls;
        hang_up();
    }
}

class SlowStreams : public Streams
{
};

/* What logs on the device would wait for such a server. */
TEST_F(SlowStreams, EndWithAServerThatTakesNothing)
{
    for (const bool tls : {false, true}) {
        call(tls, 100);
        tool_link link = start(kSyslog);
        confirm(link, kSyslog);
        EXPECT_EQ(kOnline, ask(kAskMode));
        daemon_->commands();
        for (int i = 0; i < 3 && daemon_->logged("takes nothing any more, the stream ends") == 0; ++i)
            daemon_->logs("takes nothing any more, the stream ends"); /* which gives up after 30 seconds */
        EXPECT_TRUE(daemon_->logs("exit log_recv_server_msg")) << daemon_->log();
        EXPECT_NE(std::string::npos, daemon_->commands().find("vex_syslog.sh")) << "it logs locally again";
        EXPECT_EQ(kOnline, ask(kAskMode));
        hang_up();
    }
}

} // namespace

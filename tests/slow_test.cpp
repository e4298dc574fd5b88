/* Peers that vanish without a word, which takes minutes to notice: ctest -C Slow -L slow. */
#include "tests/daemon.h"
#include "tests/frame.h"

#include <chrono>
#include <fstream>
#include <thread>

namespace
{

constexpr auto kNoticedMax = std::chrono::seconds(120);

class Slow : public Daemon
{
protected:
    /* From now on the daemon's packets reach nobody, and nobody's reach it. */
    void lose_packets(const std::string &port)
    {
        const std::string rule = "; add rule inet lost arriving tcp ";
        EXPECT_EQ(
            "", run_command("nft 'add table inet lost; add chain inet lost arriving { type filter hook input priority "
                            "0; }" +
                            rule + "dport " + port + " drop" + rule + "sport " + port + " drop' 2>&1"));
        lost_ = std::chrono::steady_clock::now();
    }

    void expect_noticed(const std::string &words) const
    {
        while (daemon_->logged(words) == 0 && std::chrono::steady_clock::now() < lost_ + kNoticedMax)
            std::this_thread::sleep_for(std::chrono::seconds(1)); /* precise enough for minutes */
        EXPECT_EQ(1, daemon_->logged(words)) << daemon_->log();
        const auto took = std::chrono::steady_clock::now() - lost_;
        RecordProperty("seconds", static_cast<int>(std::chrono::duration_cast<std::chrono::seconds>(took).count()));
    }

    std::chrono::steady_clock::time_point lost_;
};

const std::string kNoticed = "has answered nothing for 100 seconds, its connection ends";
const std::string kEnded = "exit log_recv_tcp_msg: fd=[";

TEST_F(Slow, NoticesAPeerThatVanishesInAnArchive)
{
    install_program("tar", "head -c 100000000 /dev/zero >$2");
    start();
    const tool_connection tool;
    tool.send(frame(R"({"msgid":"2"})"));
    std::string piece;
    tool.receive(&piece);
    EXPECT_EQ(51200U, piece.size());
    lose_packets("48888");
    expect_noticed("log_msg_get_log_file:send data fail");
    EXPECT_EQ(1, daemon_->logged(kNoticed));
    EXPECT_EQ(1, daemon_->logged(kEnded));
}

TEST_F(Slow, NoticesAPeerThatVanishesAfterAReply)
{
    run_command("mkfifo /tmp/runs /tmp/go");
    install_program("df", "echo runs >/tmp/runs; read go </tmp/go");
    start();
    const tool_connection tool;
    tool.send(frame(R"({"msgid":"3"})"));
    EXPECT_EQ("runs\n", read_file("/tmp/runs"));
    lose_packets("48888");
    install_program("df", "exit 0");
    std::ofstream("/tmp/go") << "go" << std::endl;
    expect_noticed(kEnded);
    EXPECT_EQ(1, daemon_->logged(kNoticed));
}

TEST_F(Slow, NoticesAPeerThatVanishesIdle)
{
    start();
    const tool_connection tool;
    EXPECT_EQ(kOnline, tool.ask(kAskMode));
    lose_packets("48888");
    expect_noticed(kEnded);
}

/* The control link's server is gone before it acknowledges a reply. */
TEST_F(Slow, NoticesAServerThatVanishes)
{
    set_nv("log_use_ssl_disable", "1");
    run_command("mkfifo /tmp/runs /tmp/go");
    install_program("df", "echo runs >/tmp/runs; read go </tmp/go");
    std::ofstream("/tmp/ask") << frame(R"({"msgid":"3"})");
    std::thread server([] { run_command("{ cat /tmp/ask; exec sleep 130; } | busybox nc -l -p 5000"); });
    daemon_ = std::make_unique<daemon_process>(std::vector<std::string>{"-a", "127.0.0.1", "-p", "5000"});
    EXPECT_EQ("runs\n", read_file("/tmp/runs"));
    lose_packets("5000");
    install_program("df", "exit 0");
    std::ofstream("/tmp/go") << "go" << std::endl;
    expect_noticed("vex_log_manage exit ");
    EXPECT_EQ(1, daemon_->logged(kNoticed));
    run_command("killall sleep busybox");
    server.join();
}

/* It acknowledges that its window is full, for as long as it likes. */
TEST_F(Slow, KeepsAPeerThatDoesNotRead)
{
    install_program("tar", "head -c 100000000 /dev/zero >$2");
    start();
    const tool_connection tool;
    tool.send(frame(R"({"msgid":"2"})"));
    std::this_thread::sleep_for(std::chrono::minutes(5));
    EXPECT_EQ(0, daemon_->logged(kNoticed));
    std::size_t got = 0;
    for (std::string piece(1, ' '); got < 100000000 && !piece.empty(); got += piece.size())
        tool.receive(&piece);
    EXPECT_EQ(100000000U, got);
}

} // namespace

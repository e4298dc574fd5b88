/*
 * Hours of bad luck in minutes. VEX_SOAK_MINUTES says how many (1), VEX_SOAK_SEED what happens (1), VEX_SOAK_ROUND with
 * which round it begins (0). A round is what its seed and its number make it, but for what threads make of it.
 */
#include "soak/device.h"
#include "soak/servers.h"
#include "soak/tools.h"
#include "soak/trouble.h"
#include "tools/tool_process.h"

#include <algorithm>
#include <cstdlib>
#include <thread>

namespace
{

using std::chrono::milliseconds;

/* Who throws the dice in a round. */
enum { kWhoRound, kWhoTrouble, kWhoPeer };

long setting(const char *name, long otherwise)
{
    const char *const value = std::getenv(name);
    return value != nullptr ? std::atol(value) : otherwise;
}

class Soak : public testing::Test
{
protected:
    void SetUp() override
    {
        tool_prepare_process();
        ASSERT_TRUE(prepare_faults());
        ASSERT_EQ("", run_command(SOURCE_DIR "/device/certificates /tmp/c"));
    }
    dice throws(long round, int who) const
    {
        return {static_cast<std::uint64_t>(seed_), static_cast<std::uint64_t>(round), static_cast<std::uint64_t>(who)};
    }
    void server_mode_round(long round);
    void client_mode_round(long round);
    static void come_and_go(long i, long *take_overs);
    void report(long round) const;

    const long seed_ = setting("VEX_SOAK_SEED", 1);
    soak_tally tally_{};
    device_trouble trouble_{tally_};
    soak_device device_;
};

/* Tools on a device in trouble. The daemon lives through it, unless it is killed. */
void Soak::server_mode_round(long round)
{
    dice chance = throws(round, kWhoRound);
    if (!device_.started())
        device_.start_server_mode();
    const auto end = tool_clock::now() + milliseconds(500 + chance.below(2500));
    std::vector<std::thread> actors;
    actors.emplace_back([&] { trouble_.run(throws(round, kWhoTrouble), end); });
    for (int i = 1 + chance.below(3); i >= 0; --i)
        actors.emplace_back([&, i] { run_random_tools(throws(round, kWhoPeer + i), tally_, end); });
    if (chance.one_in(12)) {
        std::this_thread::sleep_for(milliseconds(chance.below(1000)));
        device_.kill();
        device_.check_log();
        ++tally_.kills;
    }
    for (std::thread &actor : actors)
        actor.join();
    if (!device_.started())
        device_.start_server_mode();
    ASSERT_TRUE(device_.lives());
    device_.check_answers(); /* whatever still hangs for a tool that is gone */
    device_.check_bounds();
    trouble_.clear_away();
}

/* Milliseconds for a reply that a program which hangs may hold up for as long as its server waits. */
constexpr int kHungPatience = 3000;

/* A log server on a device in trouble. When it hangs up, the daemon ends as it should. */
void Soak::client_mode_round(long round)
{
    dice chance = throws(round, kWhoRound);
    device_.kill();
    const bool tls = chance.one_in(2);
    std::string why;
    tool_listener listener;
    listener.port = "5000";
    if (tls)
        listener.context = tool_tls_server("/tmp/c/server.crt", "/tmp/c/server.key", "/tmp/c/ca.crt", why);
    ASSERT_TRUE(tool_listen(listener, why)) << why;
    set_nv("log_use_ssl_disable", tls ? "0" : "1");
    device_.start({"-a", "127.0.0.1", "-p", listener.port});
    const auto end = tool_clock::now() + milliseconds(2000 + chance.below(4000));
    {
        random_server server{listener, throws(round, kWhoPeer), tally_};
        ASSERT_TRUE(server.is_called(tool_clock::now() + milliseconds(kPatience)));
        device_.rests();
        std::thread trouble{[&] { trouble_.run(throws(round, kWhoTrouble), end); }};
        server.serve(end);
        trouble.join();
        const daemon_says last = server.calm(trouble_.hangs() ? kHungPatience : kPatience);
        listener.fd.reset(); /* whoever still calls is refused */
        if (last == daemon_says::a_reply)
            device_.check_bounds();
        ASSERT_TRUE(last != daemon_says::nothing || device_.has_dropped_bytes() || trouble_.hangs());
    }
    EXPECT_EQ(0, device_.wait_exit()); /* whatever still hangs */
    trouble_.clear_away();
}

void Soak::report(long round) const
{
    std::printf("seed %ld, round %ld: %ld rounds, %ld connections, %ld commands, %ld replies; injected: %ld programs, "
                "%ld full disks, %ld calls, %ld broken or reset, %ld kills; at most %ld kB\n",
                seed_, round, tally_.rounds.load(), tally_.connections.load(), tally_.commands.load(),
                tally_.replies.load(), tally_.programs.load(), tally_.disks.load(), tally_.calls.load(),
                tally_.broken.load(), tally_.kills.load(), device_.memory_most());
    std::fflush(stdout);
}

TEST_F(Soak, NothingThatIsThrownAtItBreaksIt)
{
    const auto end = tool_clock::now() + std::chrono::minutes(setting("VEX_SOAK_MINUTES", 1));
    long round = setting("VEX_SOAK_ROUND", 0);
    for (; tool_clock::now() < end && !HasFailure(); ++round) {
        run_command("mkdir -p /logfs/logconf; touch /logfs/logconf/Diag.cfg"); /* until a tool cleans it away */
        if (round % 16 >= 12) /* between them, a daemon in server mode gets old */
            client_mode_round(round);
        else
            server_mode_round(round);
        device_.check_nv();
        device_.check_log();
        ++tally_.rounds;
        report(round);
    }
    for (const std::atomic<long> *done : {&tally_.replies, &tally_.programs, &tally_.disks, &tally_.calls})
        EXPECT_TRUE(*done > 0 || tally_.rounds < 5) << "nothing has happened";
}

/* A tool that comes, asks and goes; one of ten is taken over from by the next one. */
void Soak::come_and_go(long i, long *take_overs)
{
    const auto address = [](long n) { return n % 3 == 0 ? "::1" : "127.0.0.1"; };
    const tool_connection tool(address(i));
    EXPECT_EQ(kOnline, tool.ask(kAskMode));
    if (i % 10 != 0)
        return;
    EXPECT_EQ(kOnline, tool_connection(address(i / 10)).ask(kAskMode));
    EXPECT_EQ("(closed)", tool.receive());
    ++*take_overs;
}

/* As many as VEX_SOAK_CONNECTIONS says (100000). */
TEST_F(Soak, ToolsThatComeAndGoLeaveNothingBehind)
{
    const long tools = setting("VEX_SOAK_CONNECTIONS", 100000);
    long take_overs = 0;
    long memory = 0;
    device_.start_server_mode();
    for (long i = 0; i < tools && !HasFailure(); ++i) {
        come_and_go(i, &take_overs);
        if ((i + 1) % std::max(tools / 10, 1L) != 0)
            continue;
        device_.check_bounds();
        device_.check_log();
        std::printf("%ld tools, %ld take-overs: %ld kB\n", i + 1, take_overs, device_.memory());
        if (memory == 0)
            memory = device_.memory();
    }
    EXPECT_TRUE(!kMemoryIsOurs || device_.memory() <= memory + 100) << device_.memory() - memory;
}

} // namespace

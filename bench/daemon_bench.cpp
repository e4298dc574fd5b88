/*
 * Measures the daemon on a simulated device, each figure beside a floor in the same run: rounds of both
 * alternate, and the medians are compared. Daemon, floor and this program share one processor, so that a
 * round trip costs what the work costs and not what waking another processor costs.
 */
#include "platform/unique_fd.h"

#include <algorithm>
#include <arpa/inet.h>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <functional>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sched.h>
#include <string>
#include <sys/socket.h>
#include <sys/wait.h>
#include <vector>

namespace
{

/* Many short rounds: what else the machine does comes in bursts, which a median passes over. */
constexpr int kRounds = 401;
constexpr int kStarts = 21;
constexpr int kRoundTrips = 500;
constexpr int kConnections = 25;
constexpr std::uint16_t kDaemonPort = 48888;
constexpr std::uint16_t kFloorPort = 7777;

struct command {
    const char *what;
    std::string frame;
    std::size_t reply_size;
};

command make_command(const char *what, const std::string &control, const std::string &reply)
{
    const std::string head("#~\0\0\0", 5);
    return {what, head + static_cast<char>(control.size()) + control + std::string("\0\0\0\0~#", 6), reply.size() + 12};
}

/* Neither runs a program; the first touches nothing but the daemon, the second reads an NV item, which is a
 * file. */
const command kRefused = make_command("a refused mode", R"({"msgid":"11","mode_lpm_online":"none"})",
                                      R"({"msgid":"11","mode_lpm_online":"","Result":"Fail:parameter error"})");
const command kQuery = make_command("the mode, from NV", R"({"msgid":"11","mode_lpm_online":""})",
                                    R"({"msgid":"11","mode_lpm_online":"online","Result":"Success"})");

double now()
{
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

[[noreturn]] void give_up(const char *what)
{
    std::perror(what);
    std::exit(1);
}

/* A program that runs as long as this lives, its output dropped. */
class program
{
public:
    explicit program(const std::vector<std::string> &words) : pid_(fork())
    {
        if (pid_ != 0)
            return;
        std::vector<char *> argv;
        for (const std::string &word : words)
            argv.push_back(const_cast<char *>(word.c_str()));
        argv.push_back(nullptr);
        const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
        dup2(null, STDOUT_FILENO);
        dup2(null, STDERR_FILENO);
        execvp(argv[0], argv.data());
        _exit(127);
    }
    ~program()
    {
        if (pid_ > 0)
            kill(pid_, SIGKILL);
        wait();
    }
    program(const program &) = delete;
    program &operator=(const program &) = delete;

    pid_t pid() const { return pid_; }
    void wait()
    {
        if (pid_ > 0)
            waitpid(std::exchange(pid_, -1), nullptr, 0);
    }

private:
    pid_t pid_;
};

/* A connection, tried again until somebody listens there. */
unique_fd connect_to(std::uint16_t port)
{
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(port);
    to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    unique_fd fd{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    const double end = now() + 10;
    while (connect(fd.get(), reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0) {
        if (errno != ECONNREFUSED || now() > end)
            give_up("connect");
        sched_yield();
    }
    const int on = 1;
    setsockopt(fd.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    return fd;
}

void round_trip(int fd, const std::string &frame, std::size_t reply_size)
{
    char reply[256];
    if (send(fd, frame.data(), frame.size(), 0) != static_cast<ssize_t>(frame.size()) ||
        recv(fd, reply, reply_size, MSG_WAITALL) != static_cast<ssize_t>(reply_size))
        give_up("round trip");
}

/* Microseconds that one of `count` repetitions takes. */
double timed(int count, const std::function<void()> &work)
{
    const double start = now();
    for (int i = 0; i < count; ++i)
        work();
    return (now() - start) * 1e6 / count;
}

double median(std::vector<double> values)
{
    const auto middle = values.begin() + static_cast<std::ptrdiff_t>(values.size() / 2);
    std::nth_element(values.begin(), middle, values.end());
    return *middle;
}

struct comparison {
    double daemon;
    double floor;
};

/* Medians of alternating rounds. */
comparison compare(int rounds, const std::function<double()> &daemon, const std::function<double()> &floor)
{
    std::vector<double> daemon_rounds, floor_rounds;
    for (int round = 0; round < rounds; ++round) {
        floor_rounds.push_back(floor());
        daemon_rounds.push_back(daemon());
    }
    return {median(daemon_rounds), median(floor_rounds)};
}

/* The floor sends the command's own bytes back. */
void measure_round_trips(const command &command)
{
    const unique_fd daemon = connect_to(kDaemonPort);
    const unique_fd floor = connect_to(kFloorPort);
    const auto round = [&command](int fd, std::size_t reply_size) {
        return timed(kRoundTrips, [&] { round_trip(fd, command.frame, reply_size); });
    };
    const comparison us = compare(
        kRounds, [&] { return round(daemon.get(), command.reply_size); },
        [&] { return round(floor.get(), command.frame.size()); });
    std::printf("round trip, %-18s %8.2f us   bare echo         %8.2f us   ratio %.3f\n", command.what, us.daemon,
                us.floor, us.daemon / us.floor);
}

void measure_connections(const command &command)
{
    const auto rate = [&command](std::uint16_t port, std::size_t reply_size) {
        return 1e6 / timed(kConnections, [&] { round_trip(connect_to(port).get(), command.frame, reply_size); });
    };
    const comparison per_s = compare(
        kRounds, [&] { return rate(kDaemonPort, command.reply_size); },
        [&] { return rate(kFloorPort, command.frame.size()); });
    std::printf("connect, %-18s    %8.0f /s   bare server       %8.0f /s   ratio %.3f\n", command.what, per_s.daemon,
                per_s.floor, per_s.daemon / per_s.floor);
}

/* Sum of the lines "Private_...: N kB" of the process. */
long private_kib(pid_t pid)
{
    std::ifstream smaps("/proc/" + std::to_string(pid) + "/smaps_rollup");
    long sum = 0;
    for (std::string line; std::getline(smaps, line);)
        if (line.rfind("Private_", 0) == 0)
            sum += std::stol(line.substr(line.find(':') + 1));
    return sum;
}

long threads_of(pid_t pid)
{
    const std::filesystem::directory_iterator tasks("/proc/" + std::to_string(pid) + "/task");
    return static_cast<long>(std::distance(begin(tasks), end(tasks)));
}

void measure_idle(pid_t pid)
{
    connect_to(kDaemonPort); /* it is up; then wait until the connection's thread has gone */
    while (threads_of(pid) > 3)
        sched_yield();
    std::printf("idle                           %8ld threads, %ld KiB private memory\n", threads_of(pid),
                private_kib(pid));
}

void measure_start(const std::string &floor_server)
{
    const std::string script = "sh /usr/vex/vex_conf/scripts/vex_syslog.sh -L -o /logfs -l 7 -s 512 ";
    const comparison us = compare(
        kStarts,
        [] {
            const double start = now();
            const program daemon({"vex_log_manage"});
            connect_to(kDaemonPort);
            return (now() - start) * 1e6;
        },
        [&] {
            const double start = now();
            program({floor_server, "system", script}).wait();
            return (now() - start) * 1e6;
        });
    std::printf("start until it listens         %8.2f ms   system log script %8.2f ms   beyond it %.2f ms\n",
                us.daemon / 1e3, us.floor / 1e3, (us.daemon - us.floor) / 1e3);
}

} // namespace

int main(int argc, char **argv)
{
    if (argc != 2)
        return 2;
    cpu_set_t one;
    CPU_ZERO(&one);
    CPU_SET(0, &one);
    sched_setaffinity(0, sizeof one, &one); /* children too */
    setenv("VEX_LOG_LEVEL", "0", 1);

    {
        const program floor({argv[1], "echo", std::to_string(kFloorPort)});
        const program daemon({"vex_log_manage"});
        measure_idle(daemon.pid());
        for (const command &command : {kRefused, kQuery}) {
            measure_round_trips(command);
            measure_connections(command);
        }
    }
    measure_start(argv[1]);
    return 0;
}

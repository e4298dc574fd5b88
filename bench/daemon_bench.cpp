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
constexpr std::uint16_t kArchiveFloorPort = 7778;
constexpr std::uint16_t kUploadFloorPort = 7779;
constexpr std::uint16_t kShellFloorPort = 7780;

constexpr int kTransferRounds = 15;
constexpr std::size_t kArchiveSize = 256 << 20;
constexpr int kUploadRounds = 201;
constexpr int kUploadFrames = 20;
constexpr std::size_t kUploadSize = 50000;
constexpr int kShellRounds = 101;

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

void shell(const char *command)
{
    if (std::system(command) != 0)
        give_up(command);
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

/* Reads frames until the file that they carry is complete; seconds from the first byte on. */
double read_archive(int fd)
{
    static char piece[1 << 18];
    const std::size_t frames = (kArchiveSize + 51199) / 51200;
    std::size_t left = 0;
    double start = 0;
    do {
        const ssize_t n = recv(fd, piece, sizeof piece, 0);
        if (n <= 0)
            give_up("archive");
        if (start == 0) { /* the first frame begins here, and all have its control text */
            start = now();
            left = kArchiveSize + frames * (12 + static_cast<unsigned char>(piece[5]));
        }
        left -= static_cast<std::size_t>(n);
    } while (left > 0);
    return now() - start;
}

/* Largest memory that the process ever had, in KiB. */
long peak_kib(pid_t pid)
{
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmHWM:", 0) == 0)
            return std::stol(line.substr(6));
    return -1;
}

/* A stand-in for tar "packs" a file that is already there, so that only the sending counts. */
void measure_archive(const std::string &floor_server, pid_t daemon_pid)
{
    shell("head -c 268435456 /dev/urandom >/tmp/big; printf '#!/bin/sh\\nln /tmp/big $2\\n' "
          ">/usr/vex/override/tar; chmod 755 /usr/vex/override/tar");
    const program floor_process({floor_server, "archive", std::to_string(kArchiveFloorPort), "/tmp/big"});
    const unique_fd daemon = connect_to(kDaemonPort);
    const unique_fd floor = connect_to(kArchiveFloorPort);
    const std::string ask = make_command("", R"({"msgid":"2"})", "").frame;
    const auto fetch = [&ask](int fd) {
        if (send(fd, ask.data(), ask.size(), 0) != static_cast<ssize_t>(ask.size()))
            give_up("send");
        return read_archive(fd);
    };
    const long before = peak_kib(daemon_pid);
    const comparison s = compare(
        kTransferRounds, [&] { return fetch(daemon.get()); }, [&] { return fetch(floor.get()); });
    std::printf("archive of 256 MB              %8.0f MB/s   plain program    %8.0f MB/s   ratio %.3f\n",
                kArchiveSize / s.daemon / 1e6, kArchiveSize / s.floor / 1e6, s.floor / s.daemon);
    std::printf("  the daemon's peak memory     %8ld KiB, %ld KiB before\n", peak_kib(daemon_pid), before);
    shell("rm /tmp/big /usr/vex/override/tar");
}

void measure_upload(const std::string &floor_server)
{
    const program floor_process({floor_server, "upload", std::to_string(kUploadFloorPort), "/logfs/floor.tar"});
    const unique_fd daemon = connect_to(kDaemonPort);
    const unique_fd floor = connect_to(kUploadFloorPort);
    const std::string control = R"({"msgid":"1","conf_file":{"totalLength":"2000000000"}})";
    std::string frame = make_command("", control, "").frame;
    frame.replace(6 + control.size(), 4, std::string("\0\0\xc3\x50", 4)).insert(10 + control.size(), kUploadSize, 'x');
    const auto round = [&frame](int fd, std::size_t reply_size, const char *file) {
        const double us = timed(kUploadFrames, [&] { round_trip(fd, frame, reply_size); });
        std::filesystem::remove(file);
        return us;
    };
    const std::size_t reply_size =
        make_command("", "", R"({"msgid":"1","conf_file":{"totalLength":""},"Result":"Success"})").reply_size;
    const comparison us = compare(
        kUploadRounds, [&] { return round(daemon.get(), reply_size, "/logfs/logconf.tar"); },
        [&] { return round(floor.get(), 12, "/logfs/floor.tar"); });
    std::printf("upload by frames of 50000      %8.0f MB/s   plain program    %8.0f MB/s   ratio %.3f\n",
                kUploadSize / us.daemon, kUploadSize / us.floor, us.floor / us.daemon);
}

void measure_first_reply(const std::string &floor_server)
{
    const program floor_process({floor_server, "shell", std::to_string(kShellFloorPort),
                                 "cat /proc/version | cut -d '#' -f 2",
                                 "df -h | grep /logfs |awk '{print $2}' | cut -d 'M' -f 1"});
    const unique_fd daemon = connect_to(kDaemonPort);
    const unique_fd floor = connect_to(kShellFloorPort);
    const std::string ask = make_command("", R"({"msgid":"3"})", "").frame;
    const auto first_byte = [&ask](int fd) {
        return timed(1, [&] {
            char reply[2048];
            if (send(fd, ask.data(), ask.size(), 0) < 0 || recv(fd, reply, sizeof reply, 0) <= 0)
                give_up("first reply");
        });
    };
    const comparison us = compare(
        kShellRounds, [&] { return first_byte(daemon.get()); }, [&] { return first_byte(floor.get()); });
    std::printf("first byte of the version      %8.2f ms   its shell lines  %8.2f ms   ratio %.3f\n", us.daemon / 1e3,
                us.floor / 1e3, us.daemon / us.floor);
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
        measure_first_reply(argv[1]);
        measure_upload(argv[1]);
        measure_archive(argv[1], daemon.pid());
    }
    measure_start(argv[1]);
    return 0;
}

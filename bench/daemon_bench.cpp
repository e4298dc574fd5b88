/* Measures the daemon in server mode, on a simulated device. */
#include "bench/measure.h"

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sched.h>
#include <sys/socket.h>

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
    return {what, make_frame(control), reply.size() + 12};
}

/* Neither runs a program; the first touches nothing but the daemon, the second reads an NV item, which is a
 * file. */
const command kRefused = make_command("a refused mode", R"({"msgid":"11","mode_lpm_online":"none"})",
                                      R"({"msgid":"11","mode_lpm_online":"","Result":"Fail:parameter error"})");
const command kQuery = make_command("the mode, from NV", R"({"msgid":"11","mode_lpm_online":""})",
                                    R"({"msgid":"11","mode_lpm_online":"online","Result":"Success"})");

void round_trip(int fd, const std::string &frame, std::size_t reply_size)
{
    char reply[256];
    if (send(fd, frame.data(), frame.size(), 0) != static_cast<ssize_t>(frame.size()) ||
        recv(fd, reply, reply_size, MSG_WAITALL) != static_cast<ssize_t>(reply_size))
        give_up("round trip");
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
                us.floor, us.ratio);
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
                per_s.floor, per_s.ratio);
}

void measure_archive(const std::string &floor_server, pid_t daemon_pid)
{
    stand_in_for_tar();
    const program floor_process({floor_server, "archive", std::to_string(kArchiveFloorPort), "/tmp/big"});
    const unique_fd daemon = connect_to(kDaemonPort);
    const unique_fd floor = connect_to(kArchiveFloorPort);
    const std::string ask = make_frame(R"({"msgid":"2"})");
    const auto fetch = [&ask](int fd) {
        if (send(fd, ask.data(), ask.size(), 0) != static_cast<ssize_t>(ask.size()))
            give_up("send");
        return read_archive([fd](void *bytes, std::size_t len) { return recv(fd, bytes, len, 0); });
    };
    const long before = peak_kib(daemon_pid);
    const comparison s = compare(
        kTransferRounds, [&] { return fetch(daemon.get()); }, [&] { return fetch(floor.get()); });
    std::printf("archive of 256 MB              %8.0f MB/s   plain program    %8.0f MB/s   ratio %.3f\n",
                kArchiveSize / s.daemon / 1e6, kArchiveSize / s.floor / 1e6, 1 / s.ratio);
    std::printf("  the daemon's peak memory     %8ld KiB, %ld KiB before\n", peak_kib(daemon_pid), before);
    restore_tar();
}

void measure_upload(const std::string &floor_server)
{
    const program floor_process({floor_server, "upload", std::to_string(kUploadFloorPort), "/logfs/floor.tar"});
    const unique_fd daemon = connect_to(kDaemonPort);
    const unique_fd floor = connect_to(kUploadFloorPort);
    const std::string control = R"({"msgid":"1","conf_file":{"totalLength":"2000000000"}})";
    std::string frame = make_frame(control);
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
                kUploadSize / us.daemon, kUploadSize / us.floor, 1 / us.ratio);
}

void measure_first_reply(const std::string &floor_server)
{
    const program floor_process({floor_server, "shell", std::to_string(kShellFloorPort),
                                 "cat /proc/version | cut -d '#' -f 2",
                                 "df -h | grep /logfs |awk '{print $2}' | cut -d 'M' -f 1"});
    const unique_fd daemon = connect_to(kDaemonPort);
    const unique_fd floor = connect_to(kShellFloorPort);
    const std::string ask = make_frame(R"({"msgid":"3"})");
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
                us.floor / 1e3, us.ratio);
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
            const double start = seconds_now();
            const program daemon({"vex_log_manage"});
            connect_to(kDaemonPort);
            return (seconds_now() - start) * 1e6;
        },
        [&] {
            const double start = seconds_now();
            program({floor_server, "system", script}).wait();
            return (seconds_now() - start) * 1e6;
        });
    std::printf("start until it listens         %8.2f ms   system log script %8.2f ms   beyond it %.2f ms\n",
                us.daemon / 1e3, us.floor / 1e3, (us.daemon - us.floor) / 1e3);
}

} // namespace

int main(int argc, char **argv)
{
    if (argc != 2)
        return 2;
    prepare_measuring();
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

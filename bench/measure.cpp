#include "bench/measure.h"

#include <algorithm>
#include <arpa/inet.h>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <fcntl.h>
#include <fstream>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sched.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <utility>

namespace
{

double median(std::vector<double> values)
{
    const auto middle = values.begin() + static_cast<std::ptrdiff_t>(values.size() / 2);
    std::nth_element(values.begin(), middle, values.end());
    return *middle;
}

} // namespace

void prepare_measuring()
{
    cpu_set_t one;
    CPU_ZERO(&one);
    CPU_SET(0, &one);
    sched_setaffinity(0, sizeof one, &one);
    setenv("VEX_LOG_LEVEL", "0", 1);
}

double seconds_now()
{
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

void give_up(const char *what)
{
    std::perror(what);
    std::exit(1);
}

void shell(const char *command)
{
    if (std::system(command) != 0)
        give_up(command);
}

program::program(const std::vector<std::string> &words) : pid_(fork())
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

program::~program()
{
    if (pid_ > 0)
        kill(pid_, SIGKILL);
    wait();
}

void program::wait()
{
    if (pid_ > 0)
        waitpid(std::exchange(pid_, -1), nullptr, 0);
}

unique_fd connect_to(std::uint16_t port)
{
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(port);
    to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    unique_fd fd{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    const double end = seconds_now() + 10;
    while (connect(fd.get(), reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0) {
        if (errno != ECONNREFUSED || seconds_now() > end)
            give_up("connect");
        sched_yield();
    }
    const int on = 1;
    setsockopt(fd.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    return fd;
}

double timed(int count, const std::function<void()> &work)
{
    const double start = seconds_now();
    for (int i = 0; i < count; ++i)
        work();
    return (seconds_now() - start) * 1e6 / count;
}

void paired_rounds::add(int rounds, const std::function<double()> &of_daemon, const std::function<double()> &of_floor)
{
    for (int round = 0; round < rounds; ++round) {
        floor.push_back(of_floor());
        daemon.push_back(of_daemon());
    }
}

comparison paired_rounds::medians() const
{
    std::vector<double> ratios;
    for (std::size_t i = 0; i < floor.size(); ++i)
        ratios.push_back(daemon[i] / floor[i]);
    return {median(daemon), median(floor), median(ratios)};
}

comparison compare(int rounds, const std::function<double()> &daemon, const std::function<double()> &floor)
{
    paired_rounds all;
    all.add(rounds, daemon, floor);
    return all.medians();
}

std::string make_frame(const std::string &control)
{
    std::string frame("#~\0\0\0", 5);
    frame += static_cast<char>(control.size());
    frame += control;
    return frame.append("\0\0\0\0~#", 6);
}

void stand_in_for_tar()
{
    shell("head -c 268435456 /dev/urandom >/tmp/big; printf '#!/bin/sh\\nln -f /tmp/big $2\\n' "
          ">/usr/vex/override/tar; chmod 755 /usr/vex/override/tar");
}

void restore_tar()
{
    shell("rm /tmp/big /usr/vex/override/tar");
}

double read_archive(const std::function<ssize_t(void *bytes, std::size_t len)> &read)
{
    static char piece[1 << 18];
    const std::size_t frames = (kArchiveSize + 51199) / 51200;
    std::size_t left = 0;
    double start = 0;
    do {
        const ssize_t n = read(piece, sizeof piece);
        if (n <= 0)
            give_up("archive");
        if (start == 0) { /* the first frame begins here, and all have its control text */
            start = seconds_now();
            left = kArchiveSize + frames * (12 + static_cast<unsigned char>(piece[5]));
        }
        left -= static_cast<std::size_t>(n);
    } while (left > 0);
    return seconds_now() - start;
}

double processor_time(pid_t pid)
{
    clockid_t clock{};
    timespec used{};
    if (clock_getcpuclockid(pid, &clock) != 0 || clock_gettime(clock, &used) != 0)
        give_up("processor time");
    return static_cast<double>(used.tv_sec) + static_cast<double>(used.tv_nsec) / 1e9;
}

long peak_kib(pid_t pid)
{
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmHWM:", 0) == 0)
            return std::stol(line.substr(6));
    return -1;
}

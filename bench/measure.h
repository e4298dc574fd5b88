/*
 * What the benchmarks measure with. Each figure comes beside a floor in the same run: rounds of both alternate, and
 * medians are compared. Everything runs on one processor, so that a round costs what the work costs and not what
 * waking another processor costs. What goes wrong ends the program.
 */
#ifndef BENCH_MEASURE_H
#define BENCH_MEASURE_H

#include "platform/unique_fd.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <sys/types.h>
#include <vector>

constexpr std::size_t kArchiveSize = 256 << 20;

/* Puts this program and all that it starts on one processor, and has the daemon log failures only. */
void prepare_measuring();

double seconds_now(); /* seconds */
[[noreturn]] void give_up(const char *what);
void shell(const char *command);

/* A program that runs as long as this lives, its output dropped. */
class program
{
public:
    explicit program(const std::vector<std::string> &words);
    ~program();
    program(const program &) = delete;
    program &operator=(const program &) = delete;

    pid_t pid() const { return pid_; }
    void wait();

private:
    pid_t pid_;
};

/* A connection to this machine, tried again until somebody listens there. */
unique_fd connect_to(std::uint16_t port);

/* Microseconds that one of `count` repetitions takes. */
double timed(int count, const std::function<void()> &work);

struct comparison {
    double daemon;
    double floor;
    double
        ratio; /* of the daemon's figure to the floor's, round by round: what the machine does meanwhile meets both */
};

/* Alternating rounds of daemon and floor. */
struct paired_rounds {
    std::vector<double> daemon;
    std::vector<double> floor;

    void add(int rounds, const std::function<double()> &of_daemon, const std::function<double()> &of_floor);
    comparison medians() const;
};

/* Medians of so many rounds. */
comparison compare(int rounds, const std::function<double()> &daemon, const std::function<double()> &floor);

/* A command's frame without data. */
std::string make_frame(const std::string &control);

/* Has tar "pack" a file that is already there, /tmp/big of kArchiveSize bytes, so that only the sending counts; and
 * takes that back. */
void stand_in_for_tar();
void restore_tar();

/* Reads frames until the file that they carry is complete; seconds from the first byte on. `read` is as recv(). */
double read_archive(const std::function<ssize_t(void *bytes, std::size_t len)> &read);

/* Seconds of processor time that the process has used. */
double processor_time(pid_t pid);

/* Largest memory that the process ever had, in KiB. */
long peak_kib(pid_t pid);

#endif

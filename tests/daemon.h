/*
 * The daemon as a peer and an operator meet it, on the simulated device that the test itself runs in. Waiting is for
 * events; what does not come within kPatience is a failure.
 */
#ifndef TESTS_DAEMON_H
#define TESTS_DAEMON_H

#include "device/fault_orders.h"
#include "device/operator.h"
#include "platform/unique_fd.h"

#include <cstdlib>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <sys/types.h>
#include <utility>
#include <vector>

constexpr int kPatience = 30000; /* milliseconds */

/* Whether a daemon's memory tells of leaks: sanitizers keep books of their own, and what was freed; an emulator keeps
 * what it has translated. */
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kMemoryIsOurs = false;
#else
inline const bool kMemoryIsOurs = std::getenv("VEX_EMULATED") == nullptr;
#endif

/* A peer's connection to 127.0.0.1 or ::1: a log tool's to the daemon, a device's to the log server. */
struct tool_connection {
    explicit tool_connection(const char *address = "127.0.0.1", const char *port = "48888");
    void send(const std::string &bytes) const;
    /* The control text, and the data, of the next frame; "(closed)" when there is none. */
    std::string receive(std::string *data = nullptr) const;
    std::string ask(const std::string &control, const std::string &data = "") const;
    unique_fd fd;
};

/* What a program writes into a file, which it appends to. */
class written_log
{
public:
    explicit written_log(std::string path); /* empties it */
    std::string text() const;
    /* How many times the words are there, and whether they come to be. */
    long count(const std::string &words) const;
    bool awaits(const std::string &words, long count = 1) const;

private:
    const std::string path_;
    unique_fd changes_;
};

/* Descriptors and threads of a daemon. */
using resources = std::pair<std::size_t, std::size_t>;

class daemon_process
{
public:
    /* Starts it, with standard streams or without; its NV items are those of /etc/vex/nvconfig. */
    explicit daemon_process(const std::vector<std::string> &arguments = {}, bool streams = true);
    ~daemon_process(); /* kills it; a sanitizer's report is a failure of the test */
    daemon_process(const daemon_process &) = delete;

    void wait_listening();
    int wait_exit(); /* its exit status */
    /* All log lines, and how many of them hold the text. */
    std::string log() const { return log_.text(); }
    long logged(const std::string &text) const { return log_.count(text); }
    /* The shell lines it has run since this was asked last, each with a newline. */
    std::string commands();
    /* Waits until so many do. */
    bool logs(const std::string &text, long count = 1) const { return log_.awaits(text, count); }
    std::string proc(const char *name) const { return "/proc/" + std::to_string(pid) + '/' + name; }
    /* Whether one of its threads waits in that system call. */
    bool waits_in(long syscall) const;
    resources used() const { return {entries(proc("fd")), entries(proc("task"))}; }
    /* Whether it comes to use just that. */
    bool settles(const resources &expected) const;
    long memory() const; /* in kB */

    pid_t pid = -1;

private:
    written_log log_;
    std::size_t commands_seen_ = 0;
};

/* A daemon on its device, and what it had when it was at rest. */
class Daemon : public testing::Test
{
protected:
    void start(bool streams = true);
    /* Whether it comes to use what it did then, and so much more. */
    bool settles(const resources &more = {0, 0}) const
    {
        return daemon_->settles({rest_.first + more.first, rest_.second + more.second});
    }

    std::unique_ptr<daemon_process> daemon_;
    resources rest_;
};

/* A command that runs no program, and its reply. */
extern const std::string kAskMode, kOnline;
std::string mode_reply(const std::string &mode, const std::string &result);

#endif

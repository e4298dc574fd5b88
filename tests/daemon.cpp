#include "tests/daemon.h"

#include "tests/frame.h"

#include <algorithm>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <netdb.h>
#include <poll.h>
#include <sstream>
#include <sys/inotify.h>
#include <sys/wait.h>
#include <thread>

namespace
{

constexpr char kLogFile[] = "/tmp/daemon.log";

bool readable(int fd, int milliseconds)
{
    pollfd entry{fd, POLLIN, 0};
    return poll(&entry, 1, std::max(milliseconds, 0)) == 1;
}

/* So many bytes; none when the peer has closed. */
std::string receive_all(int fd, std::size_t count)
{
    std::string out(count, '\0');
    out.resize(count == 0 || recv(fd, out.data(), count, MSG_WAITALL) == static_cast<ssize_t>(count) ? count : 0);
    return out;
}

} // namespace

const std::string kAskMode = R"({"msgid":"11","mode_lpm_online":""})";
const std::string kOnline = mode_reply("online", "Success");

std::string mode_reply(const std::string &mode, const std::string &result)
{
    return R"({"msgid":"11","mode_lpm_online":")" + mode + R"(","Result":")" + result + R"("})";
}

tool_connection::tool_connection(const char *address, const char *port)
{
    addrinfo *to = nullptr;
    EXPECT_EQ(0, getaddrinfo(address, port, nullptr, &to));
    fd.reset(socket(to->ai_family, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const timeval patience{kPatience / 1000, 0};
    setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(kPatience);
    int result = -1;
    /* The daemon's last word before it listens is a log line, a moment ahead of the call. */
    while ((result = connect(fd.get(), to->ai_addr, to->ai_addrlen)) != 0 && std::chrono::steady_clock::now() < end)
        std::this_thread::yield();
    EXPECT_EQ(0, result) << std::strerror(errno);
    freeaddrinfo(to);
}

void tool_connection::send(const std::string &bytes) const
{
    EXPECT_EQ(static_cast<ssize_t>(bytes.size()), ::send(fd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL));
}

std::string tool_connection::receive(std::string *data) const
{
    const std::string head = receive_all(fd.get(), 6);
    const std::string control = receive_all(fd.get(), head.empty() ? 0 : number_at(head, 2));
    const std::string length = receive_all(fd.get(), 4);
    const std::string rest = receive_all(fd.get(), number_at(length, 0) + 2);
    if (rest.empty())
        return "(closed)";
    if (data != nullptr)
        *data = rest.substr(0, rest.size() - 2);
    return head.starts_with("#~") && rest.ends_with("~#") ? control : "(no frame)";
}

std::string tool_connection::ask(const std::string &control, const std::string &data) const
{
    send(frame(control, data));
    return receive();
}

written_log::written_log(std::string path) : path_(std::move(path)), changes_(inotify_init1(IN_CLOEXEC | IN_NONBLOCK))
{
    std::ofstream{path_};
    inotify_add_watch(changes_.get(), path_.c_str(), IN_MODIFY);
}

std::string written_log::text() const
{
    return read_file(path_);
}

long written_log::count(const std::string &words) const
{
    long count = 0;
    const std::string all = text();
    for (std::size_t at = 0; (at = all.find(words, at)) != std::string::npos; ++at)
        ++count;
    return count;
}

bool written_log::awaits(const std::string &words, long wanted) const
{
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(kPatience);
    while (count(words) < wanted) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - std::chrono::steady_clock::now());
        char events[4096];
        if (!readable(changes_.get(), static_cast<int>(left.count())))
            return false;
        EXPECT_LT(0, read(changes_.get(), events, sizeof events));
    }
    return true;
}

daemon_process::daemon_process(const std::vector<std::string> &arguments, bool streams) : log_(kLogFile)
{
    std::filesystem::create_directories("/run/vex/msg");
    std::vector<char *> argv{const_cast<char *>("vex_log_manage")};
    for (const std::string &argument : arguments)
        argv.push_back(const_cast<char *>(argument.c_str()));
    argv.push_back(nullptr);
    setenv("VEX_LOG_FILE", kLogFile, 1);
    pid = fork();
    if (pid != 0)
        return;
    const unique_fd out{open("/tmp/daemon.out", O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600)};
    dup2(out.get(), 1);
    dup2(out.get(), 2);
    for (int i = 0; !streams && i <= 2; ++i)
        close(i);
    join_faults();
    execvp(argv[0], argv.data());
    _exit(127);
}

daemon_process::~daemon_process()
{
    if (pid != -1) {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }
    EXPECT_EQ("", run_command("grep -A30 -E 'Sanitizer|runtime error' /tmp/daemon.out"));
}

void daemon_process::wait_listening()
{
    EXPECT_TRUE(logs("log_server_handle_tcp_msg enter"));
    EXPECT_TRUE(logs("log_server_handle_tcp_msg_ipv6 accept before"));
}

int daemon_process::wait_exit()
{
    int status = 0;
    waitpid(pid, &status, 0);
    pid = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

std::string daemon_process::commands()
{
    constexpr char kMark[] = " cmdStr[";
    const std::string all = log();
    std::string found;
    for (std::size_t at = commands_seen_; (at = all.find(kMark, at)) != std::string::npos;) {
        at += std::strlen(kMark);
        const std::size_t end = all.find("]\n", at);
        found += all.substr(at, end - at) + '\n';
    }
    commands_seen_ = all.size();
    return found;
}

bool daemon_process::waits_in(long syscall) const
{
    for (const auto &task : std::filesystem::directory_iterator(proc("task"))) {
        std::istringstream state(read_file(task.path() / "syscall")); /* "running", or the call's number first */
        long number = -1;
        if (state >> number && number == syscall)
            return true;
    }
    return false;
}

bool daemon_process::settles(const resources &expected) const
{
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(kPatience);
    while (used() != expected && std::chrono::steady_clock::now() < end)
        std::this_thread::yield(); /* the kernel tells nobody when a thread has gone */
    return used() == expected;
}

long daemon_process::memory() const
{
    return std::stol(run_command("sed -n 's/VmRSS:[ \t]*//p' " + proc("status")));
}

void Daemon::start(bool streams)
{
    daemon_ = std::make_unique<daemon_process>(std::vector<std::string>{}, streams);
    daemon_->wait_listening();
    rest_ = daemon_->used();
}

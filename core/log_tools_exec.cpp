#include "core/log_tools.h"

#include "core/log_line.h"
#include "core/log_lock.h"
#include "platform/unique_fd.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

namespace
{

constexpr char kLogSource[] = "log_tools";

/* A child that is in the way has so long to end by itself, then to end when it is asked to, then when it is killed. */
constexpr auto kEndsMax = std::chrono::seconds(3);
constexpr auto kTerminatesMax = std::chrono::seconds(2);
constexpr auto kDiesMax = std::chrono::seconds(1);
constexpr useconds_t kLookAgain = 1000; /* microseconds */

/* Starts a shell for the line. `handed_fd`: a descriptor that its programs inherit under its number; `output`: where
 * its standard output goes; -1 for neither. -1 on failure. */
pid_t start_shell(const char *line, int handed_fd, int output)
{
    /* A copy is put in the number's place, which clears the mark that closes it, in the child only. */
    const unique_fd copy{handed_fd != -1 ? fcntl(handed_fd, F_DUPFD_CLOEXEC, 0) : -1};
    if (handed_fd != -1 && !copy)
        return -1;
    posix_spawn_file_actions_t actions;
    if (posix_spawn_file_actions_init(&actions) != 0)
        return -1;
    int error = 0;
    if (copy)
        error = posix_spawn_file_actions_adddup2(&actions, copy.get(), handed_fd);
    if (error == 0 && output != -1)
        error = posix_spawn_file_actions_adddup2(&actions, output, STDOUT_FILENO);
    const char *const words[] = {"sh", "-c", line, nullptr};
    pid_t shell = -1;
    if (error == 0)
        error = posix_spawn(&shell, "/bin/sh", &actions, nullptr, const_cast<char *const *>(words), environ);
    posix_spawn_file_actions_destroy(&actions);
    return error == 0 ? shell : -1;
}

/* Starts the program of a simple command line, in its shell's place. */
pid_t start_program(const char *cmdStr, std::size_t len)
{
    char line[512];
    std::snprintf(line, sizeof line, "exec %.*s", static_cast<int>(len), cmdStr);
    return start_shell(line, -1, -1);
}

/* Waits for the shell; its status as system() has it. */
int await_shell(pid_t shell)
{
    int status = -1;
    while (shell != -1 && waitpid(shell, &status, 0) == -1)
        if (errno != EINTR)
            return -1;
    return status;
}

/* Logs what became of a shell line, and flushes file systems to storage; 0 when it exited with status 0, else -1. */
int judge_cmd(const char *cmdStr, int status)
{
    int result = -1;
    if (status == -1) {
        LOG_FAULT("[%s] System error1\n", cmdStr);
    } else if ((status & 0x7f) != 0) {
        LOG_FAULT("[%s] System error2\n", cmdStr);
    } else if (((status >> 8) & 0xff) != 0) {
        LOG_FAULT("[%s] System error3\n", cmdStr);
    } else {
        LOG_NOTE("[%s] System ok\n", cmdStr);
        result = 0;
    }
    sync();
    return result;
}

/* Reads up to `size` bytes, to the end of the first line at least; their number. */
int read_line(int fd, char *buffer, int size)
{
    int held = 0;
    while (held < size && std::memchr(buffer, '\n', static_cast<std::size_t>(held)) == nullptr) {
        const ssize_t n = read(fd, buffer + held, static_cast<std::size_t>(size - held));
        if (n > 0)
            held += static_cast<int>(n);
        else if (n == 0 || errno != EINTR)
            break;
    }
    return held;
}

/* Whether the child ends in that time. Then it is forgotten, and its status stored. */
bool ends_within(pid_t child, std::chrono::seconds time, int *status = nullptr)
{
    const auto end = log_clock::now() + time;
    while (waitpid(child, status, WNOHANG) == 0) {
        if (log_clock::now() >= end)
            return false;
        usleep(kLookAgain);
    }
    return true;
}

} // namespace

int log_exec_cmd(const char *cmdStr)
{
    return cmdStr != nullptr ? log_exec_cmd_with(cmdStr, -1) : -1;
}

int log_exec_cmd_with(const char *cmdStr, int handed_fd)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    return judge_cmd(cmdStr, await_shell(start_shell(cmdStr, handed_fd, -1)));
}

pid_t log_exec_cmd_behind(const char *cmdStr)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    const pid_t child = start_program(cmdStr, std::strlen(cmdStr) - 1); /* without the "&" */
    judge_cmd(cmdStr, child != -1 ? 0 : -1);
    return child;
}

pid_t log_exec_cmd_within(const char *cmdStr, std::chrono::seconds time)
{
    LOG_NOTE("cmdStr[%s]\n", cmdStr);
    const pid_t child = start_program(cmdStr, std::strlen(cmdStr));
    int status = -1;
    if (child != -1 && !ends_within(child, time, &status)) {
        LOG_FAULT("[%s] does not end, it is left behind\n", cmdStr);
        return child;
    }
    judge_cmd(cmdStr, status);
    return -1;
}

bool log_child_ended(pid_t child)
{
    return waitpid(child, nullptr, WNOHANG) != 0;
}

void log_end_child(pid_t child)
{
    if (ends_within(child, kEndsMax))
        return;
    LOG_NOTE("process %d is in the way and is asked to end\n", static_cast<int>(child));
    kill(child, SIGTERM);
    if (ends_within(child, kTerminatesMax))
        return;
    LOG_NOTE("process %d does not end and is killed\n", static_cast<int>(child));
    kill(child, SIGKILL);
    ends_within(child, kDiesMax);
}

int vex_popen(const char *cmd, char *buffer, int size)
{
    if (cmd == nullptr || buffer == nullptr) {
        LOG_FAULT("vex_popen: cmd or buf ptr NULL\n");
        return 0;
    }
    std::memset(buffer, 0, static_cast<std::size_t>(std::max(size, 0)));
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0)
        return 0;
    unique_fd output{ends[0]};
    unique_fd input{ends[1]};
    const pid_t shell = start_shell(cmd, -1, input.get());
    input.reset(); /* the shell has its own: the line ends with the programs that write it */
    const int len = read_line(output.get(), buffer, size - 1);
    output.reset();
    await_shell(shell);
    buffer[std::strcspn(buffer, "\n")] = '\0';
    return len > 0 ? 1 : 0;
}
